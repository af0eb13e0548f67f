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
  return getenv(name) != nullptr ? std::optional<std::string>(getenv(name)) : std::nullopt;
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
    for (const std::string& dir : {home_, site_}) remove_tree(dir);
    for (auto& [name, value] : saved_) value ? setenv(name, value->c_str(), 1) : unsetenv(name);
  }

  // A preferences file in `dir` setting `name` to `value`.
  static void write_prefs(const std::string& dir, const std::string& name, const std::string& value,
                          mode_t mode = 0644) {
    ASSERT_TRUE(write_text_file(dir + "/.ZarnoPrefs", name + " \"" + value + "\"\n"));
    ASSERT_EQ(chmod((dir + "/.ZarnoPrefs").c_str(), mode), 0);
  }
  static std::string lookup(const char* name) {
    const char* v = get_zarno_variable(name);
    return v != nullptr ? v : "(null)";
  }

  const std::pair<const char*, std::optional<std::string>> saved_[2] = {
      {"HOME", get_env("HOME")}, {"ZARNO_LOCATION", get_env("ZARNO_LOCATION")}};
  std::string home_, site_;
};

// A writable site file, else the user's, else the site file.
TEST_F(PstTest, PrefsFileChoice) {
  for (const std::string& dir : {home_, site_}) ASSERT_EQ(chmod(dir.c_str(), 0755), 0);
  for (auto [site_mode, user_file, expected] : {std::tuple{0666, true, "/site/ctl"},
                                                {0444, true, "/user/ctl"},
                                                {0444, false, "/site/ctl"}}) {
    unlink((home_ + "/.ZarnoPrefs").c_str());
    write_prefs(site_, "ZARNO_RNDCTL_LOCATION", "/site/ctl", site_mode);
    if (user_file) write_prefs(home_, "ZARNO_RNDCTL_LOCATION", "/user/ctl");
    // Looked up in a child that cannot override file permissions, so that a
    // read-only file is read-only for it; its exit code is the answer.
    auto child = [](int, void* want) {
      if (geteuid() == 0 && (setgid(65534) != 0 || setuid(65534) != 0)) return 2;
      const char* v = get_zarno_variable("ZARNO_RNDCTL_LOCATION");
      return v != nullptr && strcmp(v, static_cast<const char*>(want)) == 0 ? 0 : 1;
    };
    int status = race_children(1, child, const_cast<char*>(expected))[0].status;
    ASSERT_TRUE(WIFEXITED(status));
    if (WEXITSTATUS(status) == 2) GTEST_SKIP() << "cannot drop privileges";
    EXPECT_EQ(WEXITSTATUS(status), 0) << site_mode << user_file;
  }
}

TEST_F(PstTest, ExpandsFromTheEnvironment) {
  for (auto [name, value] : {std::pair{"PST_A", "a"}, {"PST_EMPTY", ""}}) setenv(name, value, 1);
  setenv("PST_LONG", std::string(200, 'L').c_str(), 1);
  unsetenv("UNSET_VAR");
  // As written in the file, and what a lookup gives ("(null)": no value).
  for (const auto& [value, expected] : std::vector<std::pair<std::string, std::string>>{
           {"${HOME}/ctl", home_ + "/ctl"},
           {"~/ctl", home_ + "/ctl"},
           {"$UNSET_VAR/ctl", "/ctl"},
           {"x${PST_EMPTY}y", "xy"},
           {"$PST_A-$PST_A.$PST_A", "a-a.a"},  // an unbraced name ends at any non-name
           {"${PST_A x", "ax"},                // a blank ends a braced name
           {"${}x$/y$", "x/y"},
           {"   ", "(null)"},
           {"$UNSET_VAR", "(null)"},
           {"$PST_LONG$PST_LONG", std::string(255, 'L')}}) {  // cut at the buffer
    write_prefs(site_, "V", value);
    pst_reset_cache();
    EXPECT_EQ(lookup("V"), expected) << value;
  }
}

// The default project comes from the browser's file, never the preferences.
TEST_F(PstTest, UnknownVariableAndUnreadableFileYieldNullAndTheDefaultProjectNeverAsks) {
  write_prefs(site_, "KNOWN", "yes");
  EXPECT_EQ(lookup("UNKNOWN"), "(null)");
  EXPECT_EQ(get_zarno_variable(nullptr), nullptr);
  pst_reset_cache();
  setenv("ZARNO_LOCATION", (site_ + "/missing").c_str(), 1);
  testing::internal::CaptureStderr();
  EXPECT_EQ(lookup("zarno_Default_Project"), "demo");
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
  testing::internal::CaptureStderr();
  EXPECT_EQ(lookup("KNOWN"), "(null)");
  EXPECT_EQ(testing::internal::GetCapturedStderr(),
            "Unable to read Zarno Preferences file (" + site_ + "/missing/.ZarnoPrefs).\n");
  ASSERT_TRUE(
      write_text_file(home_ + "/.ZarnoBrowserPrefs",
                      "CURRENT_PROJECT \"first\"\nOTHER_KEY \"other\"\n"
                      "CURRENT_PROJECT \"second\" \nCURRENT_PROJECT_X \"longer, no value\"\n"));
  EXPECT_EQ(lookup("ZARNO_DEFAULT_PROJECT"), "second");
}

}  // namespace
