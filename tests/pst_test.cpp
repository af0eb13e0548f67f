#include "General/pst/pst.h"

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <optional>
#include <string>

#include "tests/support/test_support.h"

namespace {

std::optional<std::string> get_env(const char* name) {
  const char* v = getenv(name);
  return v != nullptr ? std::optional<std::string>(v) : std::nullopt;
}

void restore_env(const char* name, const std::optional<std::string>& v) {
  if (v) {
    setenv(name, v->c_str(), 1);
  } else {
    unsetenv(name);
  }
}

std::string prefs_line(const std::string& name, const std::string& value) {
  return name + " \"" + value + "\"\n";
}

// A user's home and a site directory of its own; the environment points at
// them for the test and is put back afterwards.
class PstTest : public ::testing::Test {
 protected:
  void SetUp() override {
    for (std::string* dir : {&home_, &site_}) {
      *dir = testing::TempDir() + "pst_test_XXXXXX";
      ASSERT_NE(mkdtemp(dir->data()), nullptr);
    }
    setenv("HOME", home_.c_str(), 1);
    setenv("ZARNO_LOCATION", site_.c_str(), 1);
    pst_reset_cache();
  }
  void TearDown() override {
    pst_reset_cache();
    remove_tree(home_);
    remove_tree(site_);
    restore_env("HOME", saved_home_);
    restore_env("ZARNO_LOCATION", saved_location_);
  }

  static void write_prefs(const std::string& dir, const std::string& content, mode_t mode = 0644) {
    ASSERT_TRUE(write_text_file(dir + "/.ZarnoPrefs", content));
    ASSERT_EQ(chmod((dir + "/.ZarnoPrefs").c_str(), mode), 0);
  }
  static std::string lookup(const char* name) {
    const char* v = get_zarno_variable(name);
    return v != nullptr ? v : "(null)";
  }

  const std::optional<std::string> saved_home_ = get_env("HOME");
  const std::optional<std::string> saved_location_ = get_env("ZARNO_LOCATION");
  std::string home_, site_;
};

struct Files {
  const char* name;
  mode_t site_mode;
  bool user_file;
  const char* expected;
};

class PrefsFileTest : public PstTest, public ::testing::WithParamInterface<Files> {};

TEST_P(PrefsFileTest, WritableSiteFileElseTheUsersElseTheSiteFile) {
  const Files& f = GetParam();
  write_prefs(site_, prefs_line("ZARNO_RNDCTL_LOCATION", "/site/ctl"), f.site_mode);
  if (f.user_file) write_prefs(home_, prefs_line("ZARNO_RNDCTL_LOCATION", "/user/ctl"));
  ASSERT_EQ(chmod(home_.c_str(), 0755), 0);
  ASSERT_EQ(chmod(site_.c_str(), 0755), 0);
  // Looked up in a child that cannot override file permissions, so that a
  // read-only file is read-only for it; its exit code is the answer.
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    if (geteuid() == 0 && (setgid(65534) != 0 || setuid(65534) != 0)) _exit(2);
    const char* v = get_zarno_variable("ZARNO_RNDCTL_LOCATION");
    _exit(v != nullptr && strcmp(v, f.expected) == 0 ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  if (WEXITSTATUS(status) == 2) GTEST_SKIP() << "cannot drop privileges";
  EXPECT_EQ(WEXITSTATUS(status), 0);
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

class ExpansionTest : public PstTest, public ::testing::WithParamInterface<Expansion> {};

TEST_P(ExpansionTest, ExpandsFromTheEnvironment) {
  setenv("PST_A", "a", 1);
  setenv("PST_EMPTY", "", 1);
  setenv("PST_LONG", std::string(200, 'L').c_str(), 1);
  unsetenv("UNSET_VAR");
  write_prefs(site_, prefs_line("V", GetParam().value));
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
  write_prefs(site_, prefs_line("KNOWN", "yes"));
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

}  // namespace
