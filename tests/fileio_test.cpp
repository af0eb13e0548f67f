#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <ostream>
#include <string>

#include "tests/support/test_support.h"

namespace {

bool exists(const std::string& p) {
  struct stat st;
  return lstat(p.c_str(), &st) == 0;
}

// Sets only the access time of `p`, leaving its modification time alone.
void set_atime(const std::string& p, time_t when) {
  struct timespec times[2] = {{when, 0}, {0, UTIME_OMIT}};
  ASSERT_EQ(utimensat(AT_FDCWD, p.c_str(), times, 0), 0) << p;
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
    set_atime(lock, kLockMade);
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

struct StaleCase {
  const char* name;
  int age;
  bool holder;
  bool broken;
  const char* entry;  // as named in the message
};

void PrintTo(const StaleCase& c, std::ostream* os) { *os << c.name; }

class StaleLockTest : public FileopTest, public ::testing::WithParamInterface<StaleCase> {};

TEST_P(StaleLockTest, BrokenOnlyFrom181SecondsWithItsHolderFile) {
  const StaleCase& c = GetParam();
  plant_lock(FILE_TASKS, c.holder);
  fake_now = kLockMade + c.age;
  rj_clock = fixed_clock;
  debug_fileacc = 1;
  ASSERT_EQ(init_fileop(), 1);

  std::string lock = lock_dir(FILE_TASKS);
  testing::internal::CaptureStderr();
  int broken = fileop_break_stale_lock(lock.c_str());
  std::string err = testing::internal::GetCapturedStderr();

  EXPECT_EQ(broken, c.broken ? 1 : 0);
  EXPECT_EQ(exists(lock), !c.broken);
  if (c.holder) {
    EXPECT_EQ(exists(lock + "/otherhost"), !c.broken);
  }
  std::string message = std::to_string(c.age) + " second timed out on \"" + c.entry + "\" in \"" +
                        lock + "\" removed";
  if (c.broken) {
    EXPECT_EQ(err, message + "\n");
    EXPECT_NE(read_file("Render_Access").find("* " + message + " --  testhost:"),
              std::string::npos);
  } else {
    EXPECT_EQ(err, "");
  }
}

INSTANTIATE_TEST_SUITE_P(Ages, StaleLockTest,
                         testing::Values(StaleCase{"Young", 180, true, false, ""},
                                         StaleCase{"Stale", 181, true, true, "otherhost"},
                                         StaleCase{"StaleWithoutHolder", 181, false, true, ""}),
                         [](const auto& info) { return std::string(info.param.name); });

TEST_F(FileopTest, WaiterRespectsLockUntil181SecondsThenTakesIt) {
  plant_lock(FILE_RESOURCES, true);
  ticks = 0;
  rj_clock = ticking_clock;

  testing::internal::CaptureStderr();
  ASSERT_EQ(lock_fileop(FILE_RESOURCES, 1), 1);
  std::string err = testing::internal::GetCapturedStderr();

  // Ages 179 and 180 were seen and left alone; 181 broke it.
  EXPECT_EQ(ticks, 3);
  EXPECT_EQ(err, "181 second timed out on \"otherhost\" in \"" + lock_dir(FILE_RESOURCES) +
                     "\" removed\n");
  EXPECT_FALSE(exists(lock_dir(FILE_RESOURCES) + "/otherhost"));
  struct stat st;
  ASSERT_EQ(stat(lock_dir(FILE_RESOURCES).c_str(), &st), 0);
  EXPECT_TRUE(S_ISDIR(st.st_mode));
  lock_fileop(FILE_RESOURCES, 0);
  EXPECT_FALSE(exists(lock_dir(FILE_RESOURCES)));
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
