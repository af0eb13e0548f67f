#include "General/pst/pst.h"

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <functional>
#include <optional>
#include <ostream>
#include <string>

#include "tests/support/test_support.h"

namespace {

std::string make_temp_dir() {
  const char* tmp = getenv("TMPDIR");
  std::string templ = std::string(tmp != nullptr ? tmp : "/tmp") + "/pst_test_XXXXXX";
  char* made = mkdtemp(templ.data());
  return made != nullptr ? made : "";
}

// Keeps an environment variable and puts it back at the end of the test.
class SavedEnv {
 public:
  explicit SavedEnv(const char* name) : name_(name) {
    if (const char* v = getenv(name)) value_ = v;
  }
  ~SavedEnv() {
    if (value_) {
      setenv(name_, value_->c_str(), 1);
    } else {
      unsetenv(name_);
    }
  }

 private:
  const char* name_;
  std::optional<std::string> value_;
};

std::string prefs_line(const std::string& name, const std::string& value) {
  return name + " \"" + value + "\"\n";
}

class PstTest : public ::testing::Test {
 protected:
  void SetUp() override {
    home_ = make_temp_dir();
    site_ = make_temp_dir();
    ASSERT_FALSE(home_.empty());
    ASSERT_FALSE(site_.empty());
    setenv("HOME", home_.c_str(), 1);
    setenv("ZARNO_LOCATION", site_.c_str(), 1);
    pst_reset_cache();
  }
  void TearDown() override {
    pst_reset_cache();
    remove_tree(home_);
    remove_tree(site_);
  }

  void write_user(const std::string& content) {
    ASSERT_TRUE(write_text_file(home_ + "/.ZarnoPrefs", content));
    ASSERT_EQ(chmod((home_ + "/.ZarnoPrefs").c_str(), 0644), 0);
  }
  void write_site(const std::string& content, mode_t mode = 0644) {
    std::string p = site_ + "/.ZarnoPrefs";
    ASSERT_TRUE(write_text_file(p, content));
    ASSERT_EQ(chmod(p.c_str(), mode), 0);
  }
  std::string lookup(const char* name) {
    const char* v = get_zarno_variable(name);
    return v != nullptr ? v : "(null)";
  }

  SavedEnv saved_home_{"HOME"};
  SavedEnv saved_location_{"ZARNO_LOCATION"};
  std::string home_;
  std::string site_;
};

// Runs `check` in a child that cannot override file permissions, so that a
// read-only file is read-only for it.  The child's exit code is the answer.
void expect_unprivileged(const std::function<bool()>& check, const std::string& dirs) {
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    if (geteuid() == 0) {
      if (setgid(65534) != 0 || setuid(65534) != 0) _exit(2);
    }
    _exit(check() ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  if (WEXITSTATUS(status) == 2) GTEST_SKIP() << "cannot drop privileges to test " << dirs;
  EXPECT_EQ(WEXITSTATUS(status), 0) << dirs;
}

struct Files {
  const char* name;
  mode_t site_mode;
  bool user_file;
  const char* expected;
};

void PrintTo(const Files& f, std::ostream* os) { *os << f.name; }

class PrefsFileTest : public PstTest, public ::testing::WithParamInterface<Files> {};

TEST_P(PrefsFileTest, WritableSiteFileElseTheUsersElseTheSiteFile) {
  const Files& f = GetParam();
  write_site(prefs_line("ZARNO_RNDCTL_LOCATION", "/site/ctl"), f.site_mode);
  if (f.user_file) write_user(prefs_line("ZARNO_RNDCTL_LOCATION", "/user/ctl"));
  ASSERT_EQ(chmod(home_.c_str(), 0755), 0);
  ASSERT_EQ(chmod(site_.c_str(), 0755), 0);
  const std::string expected = f.expected;
  expect_unprivileged(
      [&] {
        const char* v = get_zarno_variable("ZARNO_RNDCTL_LOCATION");
        return v != nullptr && expected == v;
      },
      home_ + " " + site_);
}

INSTANTIATE_TEST_SUITE_P(Choices, PrefsFileTest,
                         testing::Values(Files{"WritableSite", 0666, true, "/site/ctl"},
                                         Files{"ReadOnlySite", 0444, true, "/user/ctl"},
                                         Files{"OnlyReadOnlySite", 0444, false, "/site/ctl"}),
                         [](const auto& info) { return std::string(info.param.name); });

struct Expansion {
  const char* name;
  std::string value;     // as written in the file
  std::string expected;  // "(null)" for no value
};

void PrintTo(const Expansion& e, std::ostream* os) { *os << e.name; }

class ExpansionTest : public PstTest, public ::testing::WithParamInterface<Expansion> {};

TEST_P(ExpansionTest, ExpandsFromTheEnvironment) {
  setenv("PST_A", "a", 1);
  setenv("PST_EMPTY", "", 1);
  setenv("PST_LONG", std::string(200, 'L').c_str(), 1);
  unsetenv("UNSET_VAR");
  write_site(prefs_line("V", GetParam().value));
  std::string expected = GetParam().expected;
  for (size_t at; (at = expected.find("<HOME>")) != std::string::npos;) {
    expected.replace(at, 6, home_);
  }
  EXPECT_EQ(lookup("V"), expected);
}

INSTANTIATE_TEST_SUITE_P(
    Values, ExpansionTest,
    testing::Values(Expansion{"BracedHome", "${HOME}/ctl", "<HOME>/ctl"},
                    Expansion{"Tilde", "~/ctl", "<HOME>/ctl"},
                    Expansion{"UnsetVariableVanishes", "$UNSET_VAR/ctl", "/ctl"},
                    Expansion{"EmptyVariableVanishes", "x${PST_EMPTY}y", "xy"},
                    Expansion{"UnbracedEndKept", "$PST_A-$PST_A.$PST_A", "a-a.a"},
                    Expansion{"BlankEndingBracedNameDropped", "${PST_A x", "ax"},
                    Expansion{"EmptyNameVanishes", "${}x$/y$", "x/y"},
                    Expansion{"BlanksOnly", "   ", "(null)"},
                    Expansion{"NothingLeft", "$UNSET_VAR", "(null)"},
                    Expansion{"CutAtTheBuffer", "$PST_LONG$PST_LONG", std::string(255, 'L')}),
    [](const auto& info) { return std::string(info.param.name); });

TEST_F(PstTest, UnknownVariableAndUnreadableFileYieldNull) {
  write_site(prefs_line("KNOWN", "yes"));
  EXPECT_EQ(lookup("UNKNOWN"), "(null)");
  EXPECT_EQ(get_zarno_variable(nullptr), nullptr);

  pst_reset_cache();
  setenv("ZARNO_LOCATION", (site_ + "/missing").c_str(), 1);
  testing::internal::CaptureStderr();
  EXPECT_EQ(lookup("KNOWN"), "(null)");
  EXPECT_EQ(testing::internal::GetCapturedStderr(),
            "Unable to read Zarno Preferences file (" + site_ + "/missing/.ZarnoPrefs).\n");
}

TEST_F(PstTest, DefaultProjectComesFromTheBrowserFileNeverThePrefs) {
  // A preferences file that cannot be read would complain if it were asked.
  setenv("ZARNO_LOCATION", (site_ + "/missing").c_str(), 1);
  testing::internal::CaptureStderr();
  EXPECT_EQ(lookup("zarno_Default_Project"), "demo");
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");

  ASSERT_TRUE(write_text_file(home_ + "/.ZarnoBrowserPrefs",
                              "CURRENT_PROJECT \"first\"\n"
                              "OTHER_KEY \"other\"\n"
                              "CURRENT_PROJECT \"second\" \n"
                              "CURRENT_PROJECT_X \"longer key, no value\"\n"));
  EXPECT_EQ(lookup("ZARNO_DEFAULT_PROJECT"), "second");
}

TEST_F(PstTest, ProfileLinesAndComments) {
  std::string p = site_ + "/profile";
  ASSERT_TRUE(write_text_file(p,
                              "   # comment \"x\"\n"
                              "A \"one\"\n"
                              "B\t\"has \"inner\" quotes\"\n"
                              "A \"two\"\n"
                              "NOQUOTE value\n"
                              "C \"unterminated\n"
                              "LONG \"" +
                                  std::string(5000, 'x') +
                                  "\"\n"
                                  "D \"last line without newline\""));
  TpstTable* t = Tpst_read(p.c_str());
  ASSERT_NE(t, nullptr);
  EXPECT_STREQ(Tpst_get_value(t, "A", 0), "two");
  EXPECT_STREQ(Tpst_get_value(t, "B", 0), "has \"inner\" quotes");
  EXPECT_EQ(Tpst_get_value(t, "NOQUOTE", 0), nullptr);
  EXPECT_EQ(Tpst_get_value(t, "C", 0), nullptr);
  EXPECT_EQ(Tpst_get_value(t, "LONG", 0), nullptr);
  EXPECT_STREQ(Tpst_get_value(t, "D", 0), "last line without newline");
  Tpst_delete(t);
  EXPECT_EQ(Tpst_read((site_ + "/absent").c_str()), nullptr);
}

}  // namespace
