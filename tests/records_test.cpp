// Job and resource records: their names and state words.
#include <cstdlib>
#include <string>
#include <vector>

#include "tests/support/test_support.h"

namespace {

class RecordsTest : public ControlDirTest {};

}  // namespace

TEST_F(RecordsTest, NewRecordsTakeTheirNamesFromWhatTheyAreGiven) {
  // A job is named after its scene file; without a path it has neither.
  Job* job = Job_new(nullptr, nullptr, "/proj/sdl/ball.sdl", 12);
  EXPECT_STREQ(job->name.c_str(), "ball.sdl");
  EXPECT_STREQ(job->sdl.c_str(), "/proj/sdl/ball.sdl");
  EXPECT_STREQ(Job_new(nullptr, nullptr, "shot", 14)->name.c_str(), "shot");
  Job* bare = Job_new(nullptr, nullptr, nullptr, 13);
  EXPECT_TRUE(bare->name.none() && bare->sdl.none());

  // The editor's placeholder resource name gets the index; others are kept.
  // The remote directory follows the temporary-directory setting.
  setenv("DRCTMPDIR", "/scratch/tmp", 1);
  Dev* dev = Dev_new(nullptr, nullptr, "new_resource", 7);
  unsetenv("DRCTMPDIR");
  EXPECT_STREQ(dev->name.c_str(), "new_resource_7");
  EXPECT_EQ(Dev_by_name("new_resource_7"), dev);
  EXPECT_STREQ(dev->host_name.c_str(), "testhost");
  EXPECT_STREQ(dev->remote_location.c_str(), "/scratch/tmp");
  Dev* other = Dev_new(nullptr, nullptr, "new_resourceX", 8);
  EXPECT_STREQ(other->name.c_str(), "new_resourceX");
  EXPECT_STREQ(other->remote_location.c_str(), "/usr/tmp");
  EXPECT_TRUE(Dev_new(nullptr, nullptr, nullptr, 9)->name.none());
}

TEST(StateWords, DecodeCaseSensitively) {
  struct {
    const char* word;
    int run, lock;
  } const words[] = {{nullptr, 0, 0},     {"", 0, 0},         {"PAUSED", 1, 0}, {"paused", 0, 0},
                     {"AVAILABLE", 2, 2}, {"SCHEDULE", 3, 3}, {"NOW", 4, 0},    {"LOCKED", 0, 1},
                     {"Locked", 0, 0},    {"NOW ", 0, 0}};
  for (const auto& w : words) {
    SCOPED_TRACE(w.word != nullptr ? w.word : "(none)");
    EXPECT_EQ(Job_get_runstate(w.word), w.run);
    EXPECT_EQ(Dev_get_lockstate(w.word), w.lock);
  }
}
