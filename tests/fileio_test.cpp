#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <string>

#include "tests/support/test_support.h"

namespace {

bool exists(const std::string& p) {
  struct stat st;
  return lstat(p.c_str(), &st) == 0;
}

// A fixed point in the past for planted lock directories; the fake clocks
// below count from it, so no test depends on the wall clock.
constexpr time_t kLockMade = 1000000000;
time_t fake_now = 0;
time_t fixed_clock() { return fake_now; }

// Advances one second per look, so a waiter walks through the ages one by one.
int ticks = 0;
time_t ticking_clock() {
  // Bounded: a waiter that never breaks the lock gets an absurd age and the
  // test fails on the reported age instead of hanging.
  if (++ticks > 50) return kLockMade + 100000;
  return kLockMade + 178 + ticks;
}

class FileopTest : public ControlDirTest {
 protected:
  void SetUp() override {
    ControlDirTest::SetUp();
    fileop_poll_seconds = 0;
  }
  void TearDown() override {
    rj_clock = saved_clock_;
    debug_fileacc = 0;
    ControlDirTest::TearDown();
  }

  std::string lock_dir(int index) const {
    return path(std::string(control_names[index]) + ".lock");
  }

  // Plants a lock left by a dead process, optionally with its holder file.
  void plant_lock(int index, bool with_holder) {
    std::string lock = lock_dir(index);
    ASSERT_EQ(mkdir(lock.c_str(), 0777), 0);
    if (with_holder) write_file(std::string(control_names[index]) + ".lock/otherhost", "4242\n");
    // The age of a lock is its access time; the modification time is left alone.
    struct timespec times[2] = {{kLockMade, 0}, {0, UTIME_OMIT}};
    ASSERT_EQ(utimensat(AT_FDCWD, lock.c_str(), times, 0), 0) << lock;
  }

  time_t (*saved_clock_)() = rj_clock;
};

TEST_F(FileopTest, FreeLockHoldsHostFileWithPidAndReleaseRemovesBoth) {
  ASSERT_EQ(lock_fileop(FILE_TASKS, 1), 1);
  std::string holder = lock_dir(FILE_TASKS) + "/testhost";
  EXPECT_EQ(read_text_file(holder), std::to_string(getpid()) + "\n");

  // The lock path is built on first use and the access log is opened with it.
  EXPECT_EQ(std::string(fileop_path(FILE_TASKS)), path("Render_Tasks"));
  EXPECT_EQ(read_file("Render_Access"), "\n\n *** Start of new process entries ***\n\n");

  ASSERT_EQ(lock_fileop(FILE_TASKS, 0), 1);
  EXPECT_FALSE(exists(holder));
  EXPECT_FALSE(exists(lock_dir(FILE_TASKS)));
}

TEST_F(FileopTest, WaiterRespectsLockUntil181SecondsThenTakesIt) {
  plant_lock(FILE_RESOURCES, true);
  ticks = 0;
  rj_clock = ticking_clock;
  testing::internal::CaptureStderr();
  ASSERT_EQ(lock_fileop(FILE_RESOURCES, 1), 1);
  std::string err = testing::internal::GetCapturedStderr();

  // Ages 179 and 180 were seen and left alone; 181 broke it.
  EXPECT_EQ(ticks, 3);
  const std::string message =
      "181 second timed out on \"otherhost\" in \"" + lock_dir(FILE_RESOURCES) + "\" removed";
  EXPECT_EQ(err, message + "\n");
  EXPECT_FALSE(exists(lock_dir(FILE_RESOURCES) + "/otherhost"));
  struct stat st;
  ASSERT_EQ(stat(lock_dir(FILE_RESOURCES).c_str(), &st), 0);
  EXPECT_TRUE(S_ISDIR(st.st_mode));
  lock_fileop(FILE_RESOURCES, 0);
  EXPECT_FALSE(exists(lock_dir(FILE_RESOURCES)));
}

TEST_F(FileopTest, StaleLockWithoutItsHolderFileIsBrokenAllTheSame) {
  plant_lock(FILE_TASKS, false);
  fake_now = kLockMade + 181;
  rj_clock = fixed_clock;
  debug_fileacc = 1;
  ASSERT_EQ(init_fileop(), 1);
  const std::string lock = lock_dir(FILE_TASKS);
  const std::string message = "181 second timed out on \"\" in \"" + lock + "\" removed";
  testing::internal::CaptureStderr();
  EXPECT_EQ(fileop_break_stale_lock(lock.c_str()), 1);
  EXPECT_EQ(testing::internal::GetCapturedStderr(), message + "\n");
  EXPECT_FALSE(exists(lock));
  // The access log records it too, with the host that broke it.
  EXPECT_NE(read_file("Render_Access").find("* " + message + " --  testhost:"), std::string::npos);
}

TEST_F(FileopTest, ReadingAMissingFileCreatesItEmptyAndFeedsTheParser) {
  ASSERT_EQ(lock_fileop(FILE_JOBS, 1), 1);
  FILE* fp = read_fileop(FILE_JOBS);
  ASSERT_NE(fp, nullptr);
  EXPECT_EQ(fgetc(fp), EOF);
  EXPECT_EQ(RJCin, fp);
  EXPECT_STREQ(RJCreadfile, path("Render_Job_Control").c_str());
  close_fileop(FILE_JOBS);
  lock_fileop(FILE_JOBS, 0);
  struct stat st;
  ASSERT_EQ(stat(path("Render_Job_Control").c_str(), &st), 0);
  EXPECT_EQ(st.st_size, 0);
}

TEST_F(FileopTest, ShorterRewriteInPlaceLeavesNoTail) {
  write_file("Render_Job_next_index", "123456789\nold tail that must go\n");
  ASSERT_EQ(lock_fileop(FILE_JOB_INDEX, 1), 1);
  FILE* fp = update_fileop(FILE_JOB_INDEX);
  ASSERT_NE(fp, nullptr);
  int value = 0;
  ASSERT_EQ(fscanf(fp, "%d", &value), 1);
  EXPECT_EQ(value, 123456789);
  rewind_fileop(FILE_JOB_INDEX);
  fprintf(fp, "%d\n", 7);
  close_and_truncate_fileop(FILE_JOB_INDEX);
  lock_fileop(FILE_JOB_INDEX, 0);
  EXPECT_EQ(read_file("Render_Job_next_index"), "7\n");
}

TEST_F(FileopTest, OriginalUmaskSurvivesReinitialisation) {
  umask(022);
  ASSERT_EQ(init_fileop(), 1);
  fileop_reset();
  ASSERT_EQ(init_fileop(), 1);
  EXPECT_EQ(get_original_umask(), static_cast<mode_t>(022));
  EXPECT_EQ(umask(0), static_cast<mode_t>(1));
}

}  // namespace
