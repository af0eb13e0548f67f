#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <string>
#include <vector>

#include "Utility/rndctl/ctldir/rj_paths.h"
#include "Utility/rndctl/ctldir/rj_pidfile.h"
#include "tests/support/test_support.h"

namespace {

bool exists(const std::string& p) {
  struct stat st;
  return lstat(p.c_str(), &st) == 0;
}

// A fixed point in the past for planted lock directories; the fake clocks
// count from it, so no test depends on the wall clock or sleeps.
constexpr time_t kLockMade = 1000000000;
constexpr int64_t kSecond = 1000000000;

time_t fake_server = 0;
int64_t fake_mono = 0;
std::vector<int64_t> pauses;

time_t server_clock() { return fake_server; }
int64_t mono_clock() { return fake_mono; }
// Sleeps by moving both clocks.  Bounded: a waiter that never breaks the
// lock gets an absurd age and the test fails on it instead of hanging.
void fake_sleep(int64_t ns) {
  pauses.push_back(ns);
  fake_mono += ns;
  fake_server = kLockMade + static_cast<time_t>(fake_mono / kSecond);
  if (pauses.size() > 1000) fake_server = kLockMade + 100000;
}

class FileopTest : public ControlDirTest {
 protected:
  void SetUp() override {
    ControlDirTest::SetUp();
    fileop_poll_seconds = 5;
    fileop_sleep = fake_sleep;
    fileop_monotonic_ns = mono_clock;
    fileop_server_clock = server_clock;
    fake_server = kLockMade;
    fake_mono = 0;
    pauses.clear();
  }
  void TearDown() override {
    fileop_release_held_locks();
    fileop_poll_seconds = saved_poll_;
    fileop_sleep = saved_sleep_;
    fileop_monotonic_ns = saved_mono_;
    fileop_server_clock = saved_server_;
    debug_fileacc = 0;
    ControlDirTest::TearDown();
  }

  std::string lock_dir(int index) const {
    return path(std::string(control_names[index]) + ".lock");
  }

  // Plants a lock made at kLockMade, with a holder file when `holder` is set.
  void plant_lock(int index, const char* holder, const std::string& content) {
    std::string lock = lock_dir(index);
    ASSERT_EQ(mkdir(lock.c_str(), 0777), 0);
    if (holder != nullptr) {
      write_file(std::string(control_names[index]) + ".lock/" + holder, content);
    }
    // The age of a lock is its access time; the modification time is left alone.
    struct timespec times[2] = {{kLockMade, 0}, {0, UTIME_OMIT}};
    ASSERT_EQ(utimensat(AT_FDCWD, lock.c_str(), times, 0), 0) << lock;
  }

  // Every name in the control directory but the access log and the clock file.
  std::vector<std::string> entries() const {
    std::vector<std::string> names;
    DIR* d = opendir(dir_.c_str());
    while (struct dirent* e = d != nullptr ? readdir(d) : nullptr) {
      std::string n = e->d_name;
      if (n != "." && n != ".." && n != "Render_Access" && n != ".clock.testhost") {
        names.push_back(n);
      }
    }
    if (d != nullptr) closedir(d);
    return names;
  }

  static mode_t mode_of(const std::string& p) {
    struct stat st;
    return stat(p.c_str(), &st) == 0 ? st.st_mode & 07777 : 0;
  }

  unsigned saved_poll_ = fileop_poll_seconds;
  void (*saved_sleep_)(int64_t) = fileop_sleep;
  int64_t (*saved_mono_)() = fileop_monotonic_ns;
  time_t (*saved_server_)() = fileop_server_clock;
};

TEST_F(FileopTest, FreeLockHoldsHostFileWithPidAndReleaseRemovesBoth) {
  ASSERT_EQ(lock_fileop(FILE_TASKS, 1), 1);
  std::string holder = lock_dir(FILE_TASKS) + "/testhost";
  EXPECT_EQ(read_text_file(holder), std::to_string(getpid()) + "\n");
  EXPECT_EQ(mode_of(lock_dir(FILE_TASKS)), 0777u);
  // The holder is renamed in: nothing else is left beside the lock.
  EXPECT_EQ(entries(), std::vector<std::string>{"Render_Tasks.lock"});
  EXPECT_TRUE(pauses.empty());

  // The lock path is built on first use and the access log is opened with it.
  EXPECT_EQ(std::string(fileop_path(FILE_TASKS)), path("Render_Tasks"));
  EXPECT_EQ(read_file("Render_Access"), "\n\n *** Start of new process entries ***\n\n");
  // Reading a missing file makes it, empty.
  FILE* fp = read_fileop(FILE_TASKS);
  ASSERT_NE(fp, nullptr);
  EXPECT_EQ(fgetc(fp), EOF);
  EXPECT_EQ(close_fileop(FILE_TASKS), 0);
  EXPECT_EQ(read_file("Render_Tasks"), "");

  long before = fileop_hold_stats(FILE_TASKS).count;
  fake_mono += 3 * kSecond / 1000;
  ASSERT_EQ(lock_fileop(FILE_TASKS, 0), 1);
  EXPECT_FALSE(exists(lock_dir(FILE_TASKS)));
  FileopHoldStats stats = fileop_hold_stats(FILE_TASKS);
  EXPECT_EQ(stats.count, before + 1);
  EXPECT_GE(stats.longest_ns, 3 * kSecond / 1000);
}

// A busy lock as a waiter finds it, and when the waiter may break it.
struct BusyLock {
  const char* name;
  const char* holder;    // holder file name, or none
  std::string content;   // its content; "DEAD" = a pid that has exited
  long broken_at_age;    // server-clock age at which it is broken; 0 = at once
  const char* log_line;  // what the access log says of the break
};

class BusyLockTest : public FileopTest, public testing::WithParamInterface<BusyLock> {};

TEST_P(BusyLockTest, WaiterBreaksItOnlyWhenItsHolderIsGone) {
  const BusyLock& c = GetParam();
  std::string content = c.content;
  if (content == "DEAD") {
    pid_t child = fork();
    if (child == 0) _exit(0);
    ASSERT_EQ(waitpid(child, nullptr, 0), child);
    content = std::to_string(child) + "\n";
  }
  plant_lock(FILE_RESOURCES, c.holder, content);
  debug_fileacc = 1;
  ASSERT_EQ(init_fileop(), 1);
  testing::internal::CaptureStderr();
  ASSERT_EQ(lock_fileop(FILE_RESOURCES, 1), 1);
  std::string err = testing::internal::GetCapturedStderr();

  long age = static_cast<long>(fake_server - kLockMade);
  if (c.broken_at_age == 0) {
    EXPECT_TRUE(pauses.empty()) << age;
  } else {
    // Respected until then, and taken within one (at most 5 s) pause after.
    EXPECT_GE(age, c.broken_at_age);
    EXPECT_LE(age, c.broken_at_age + 5);
    // Taken by a retry: the retry mode, which other tools look for.
    EXPECT_EQ(mode_of(lock_dir(FILE_RESOURCES)), 0664u);
  }
  EXPECT_EQ(read_text_file(lock_dir(FILE_RESOURCES) + "/testhost"),
            std::to_string(getpid()) + "\n");
  if (c.holder != nullptr && std::string(c.holder) != "testhost") {
    EXPECT_FALSE(exists(lock_dir(FILE_RESOURCES) + "/" + c.holder));
  }
  EXPECT_NE(read_file("Render_Access").find(c.log_line), std::string::npos)
      << read_file("Render_Access");
  if (c.broken_at_age == 181) {
    EXPECT_EQ(err, std::to_string(age) + " second timed out on \"" + c.holder + "\" in \"" +
                       lock_dir(FILE_RESOURCES) + "\" removed\n");
  }
  ASSERT_EQ(lock_fileop(FILE_RESOURCES, 0), 1);
  EXPECT_EQ(entries(), std::vector<std::string>{});
}

INSTANTIATE_TEST_SUITE_P(
    Holders, BusyLockTest,
    testing::Values(
        BusyLock{"OwnHostDeadPid", "testhost", "DEAD", 0, "left by dead process"},
        BusyLock{"OwnHostLivePid", "testhost", "1\n", 181, "second timed out on \"testhost\""},
        BusyLock{"OtherHost", "otherhost", "1\n", 181, "second timed out on \"otherhost\""},
        BusyLock{"EmptyHolderFile", "otherhost", "", 5, "abandoned without a holder pid"},
        BusyLock{"OwnHostNoPid", "testhost", "garbage\n", 5, "abandoned without a holder pid"},
        // An editor between its mkdir and its holder: respected for a while.
        BusyLock{"NoHolderFile", nullptr, "", 5, "abandoned without a holder pid"}),
    [](const testing::TestParamInfo<BusyLock>& info) { return std::string(info.param.name); });

TEST_F(FileopTest, StaleLockWithoutItsHolderFileIsBrokenAllTheSame) {
  plant_lock(FILE_TASKS, nullptr, "");
  fake_server = kLockMade + 180;
  debug_fileacc = 1;
  ASSERT_EQ(init_fileop(), 1);
  const std::string lock = lock_dir(FILE_TASKS);
  EXPECT_EQ(fileop_break_stale_lock(lock.c_str()), 0);
  fake_server = kLockMade + 181;
  const std::string message = "181 second timed out on \"\" in \"" + lock + "\" removed";
  testing::internal::CaptureStderr();
  EXPECT_EQ(fileop_break_stale_lock(lock.c_str()), 1);
  EXPECT_EQ(testing::internal::GetCapturedStderr(), message + "\n");
  EXPECT_EQ(entries(), std::vector<std::string>{});
  // The access log records it too, with the host that broke it.
  EXPECT_NE(read_file("Render_Access").find("* " + message + " --  testhost:"), std::string::npos);
}

// Forked waiters at one stale lock: one breaks it, all get it in turn, and
// no two hold it at once.
TEST_F(FileopTest, WaitersRacingAtAStaleLockBreakItOnceAndTakeItInTurn) {
  plant_lock(FILE_TASKS, "otherhost", "1\n");
  fake_server = kLockMade + 200;
  fileop_sleep = saved_sleep_;  // real, short pauses: the children really wait
  fileop_monotonic_ns = saved_mono_;
  fileop_poll_seconds = 1;
  debug_fileacc = 1;
  ASSERT_EQ(init_fileop(), 1);
  int go[2];
  ASSERT_EQ(pipe(go), 0);
  const std::string inside = path("inside");
  std::vector<pid_t> children;
  for (int i = 0; i < 4; i++) {
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      rndctl.pid = getpid();
      close(go[1]);
      char byte;
      if (read(go[0], &byte, 1) != 0) _exit(3);
      if (freopen("/dev/null", "w", stderr) == nullptr) _exit(4);
      if (lock_fileop(FILE_TASKS, 1) != 1) _exit(5);
      int fd = open(inside.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0666);
      if (fd < 0) _exit(2);  // somebody else is inside
      close(fd);
      usleep(2000);
      unlink(inside.c_str());
      if (lock_fileop(FILE_TASKS, 0) != 1) _exit(6);
      fflush(nullptr);
      _exit(0);
    }
    children.push_back(child);
  }
  close(go[0]);
  close(go[1]);  // all start together
  for (pid_t child : children) {
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
  }
  std::string log = read_file("Render_Access");
  size_t breaks = 0;
  for (size_t at = log.find("second timed out"); at != std::string::npos;
       at = log.find("second timed out", at + 1)) {
    breaks++;
  }
  EXPECT_EQ(breaks, 1u) << log;
  EXPECT_EQ(entries(), std::vector<std::string>{});
}

TEST_F(FileopTest, ReleaseRemovesOnlyLocksThisProcessHolds) {
  // Another holder's lock, by host or by pid, stays on release.
  plant_lock(FILE_JOBS, "otherhost", "1\n");
  plant_lock(FILE_RESOURCES, "testhost", "1\n");
  ASSERT_EQ(lock_fileop(FILE_JOBS, 0), 1);
  ASSERT_EQ(lock_fileop(FILE_RESOURCES, 0), 1);
  EXPECT_TRUE(exists(lock_dir(FILE_JOBS) + "/otherhost"));
  EXPECT_TRUE(exists(lock_dir(FILE_RESOURCES) + "/testhost"));

  ASSERT_EQ(lock_fileop(FILE_TASKS, 1), 1);
  ASSERT_EQ(lock_fileop(FILE_DEV_INDEX, 1), 1);
  ASSERT_EQ(lock_fileop(FILE_JOB_INDEX, 1), 1);
  ASSERT_EQ(lock_fileop(FILE_JOB_INDEX, 0), 1);
  // A syntax error ends the process; on its way out it lets go of its locks.
  void (*saved_exit)(int) = RJC_fatal_exit;
  RJC_fatal_exit = [](int) {};
  testing::internal::CaptureStdout();
  RJC_parse_string("RenderJobControl {{{", 20, "Render_Job_Control");
  testing::internal::GetCapturedStdout();
  RJC_fatal_exit = saved_exit;
  EXPECT_FALSE(exists(lock_dir(FILE_TASKS)));
  EXPECT_FALSE(exists(lock_dir(FILE_DEV_INDEX)));
  EXPECT_TRUE(exists(lock_dir(FILE_JOBS) + "/otherhost"));
  EXPECT_TRUE(exists(lock_dir(FILE_RESOURCES) + "/testhost"));
}

// One rewrite through each calling shape: the classic one (read, rewind,
// write to the same stream, close with truncation), the writer that writes
// straight after the open, and fileop_rewrite.
enum class Shape { kRewind, kWriteAtOnce, kRewriteHelper };

int rewrite(int index, Shape shape, const std::string& text) {
  if (shape == Shape::kRewriteHelper) {
    return fileop_rewrite(index, [&](FILE* in, FILE* out) {
      while (fgetc(in) != EOF) {
      }
      return fwrite(text.data(), 1, text.size(), out) == text.size();
    });
  }
  FileopLock lock(index);
  FILE* fp = update_fileop(index);
  if (fp == nullptr) return -2;
  if (shape == Shape::kRewind) {
    while (fgetc(fp) != EOF) {
    }
    rewind_fileop(index);
  }
  fwrite(text.data(), 1, text.size(), fp);
  return close_and_truncate_fileop(index);
}

class RewriteTest : public FileopTest, public testing::WithParamInterface<Shape> {
 protected:
  struct stat look(const std::string& name) const {
    struct stat st = {};
    EXPECT_EQ(stat(path(name).c_str(), &st), 0);
    return st;
  }
};

TEST_P(RewriteTest, UnchangedContentsLeaveTheFileAloneChangedOnesReplaceItWhole) {
  const std::string old_text = "123456789\nold tail that must go\n";
  write_file("Render_Job_next_index", old_text);
  struct timespec times[2] = {{kLockMade, 0}, {kLockMade, 0}};
  ASSERT_EQ(utimensat(AT_FDCWD, path("Render_Job_next_index").c_str(), times, 0), 0);
  struct stat before = look("Render_Job_next_index");

  int same = rewrite(FILE_JOB_INDEX, GetParam(), old_text);
  EXPECT_EQ(same, 0);
  struct stat after = look("Render_Job_next_index");
  EXPECT_EQ(after.st_ino, before.st_ino);
  EXPECT_EQ(after.st_mtime, kLockMade);

  // Shorter contents: nothing of the old tail stays, the mode is kept.
  ASSERT_EQ(chmod(path("Render_Job_next_index").c_str(), 0640), 0);
  int changed = rewrite(FILE_JOB_INDEX, GetParam(), "7\n");
  EXPECT_EQ(changed, GetParam() == Shape::kRewriteHelper ? 1 : 0);
  EXPECT_EQ(read_file("Render_Job_next_index"), "7\n");
  EXPECT_NE(look("Render_Job_next_index").st_ino, before.st_ino);
  EXPECT_EQ(mode_of(path("Render_Job_next_index")), 0640u);
  EXPECT_EQ(entries(), std::vector<std::string>{"Render_Job_next_index"});
}

TEST_P(RewriteTest, AFailedWriteLeavesTheOldFileAndNoTemporary) {
  const std::string old_text = "old contents\n";
  write_file("Render_Tasks", old_text);
  int err[2];
  ASSERT_EQ(pipe(err), 0);
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    // A file-size limit makes the write fail part way (EFBIG).
    dup2(err[1], 2);
    signal(SIGXFSZ, SIG_IGN);
    struct rlimit limit = {64, 64};
    setrlimit(RLIMIT_FSIZE, &limit);
    int result = rewrite(FILE_TASKS, GetParam(), std::string(4096, 'x'));
    fflush(nullptr);
    _exit(result == -1 ? 0 : 1);
  }
  close(err[1]);
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  std::string reported(512, '\0');
  ssize_t n = read(err[0], &reported[0], reported.size());
  close(err[0]);
  reported.resize(n > 0 ? static_cast<size_t>(n) : 0);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
  EXPECT_EQ(read_file("Render_Tasks"), old_text);
  EXPECT_EQ(entries(), std::vector<std::string>{"Render_Tasks"});
  EXPECT_NE(reported.find("ERROR: failed to write " + path("Render_Tasks") + ": File too large"),
            std::string::npos)
      << reported;
}

INSTANTIATE_TEST_SUITE_P(Shapes, RewriteTest,
                         testing::Values(Shape::kRewind, Shape::kWriteAtOnce,
                                         Shape::kRewriteHelper));

TEST_F(FileopTest, OriginalUmaskSurvivesReinitialisation) {
  umask(022);
  ASSERT_EQ(init_fileop(), 1);
  fileop_reset();
  ASSERT_EQ(init_fileop(), 1);
  EXPECT_EQ(get_original_umask(), static_cast<mode_t>(022));
  EXPECT_EQ(umask(0), static_cast<mode_t>(1));
}

void write_pid(const std::string& file, int32_t pid, size_t bytes = sizeof(int32_t)) {
  ASSERT_TRUE(write_text_file(file, std::string(reinterpret_cast<const char*>(&pid), bytes)));
}

// What start-up finds in the pid file; every time, of claimers starting at
// once exactly one wins, the others see it alive, and no claim is left over.
struct Found {
  const char* name;
  int bytes;  // of the pid of a process that has exited; -1: no file
};
class PidfileClaimTest : public FileopTest, public testing::WithParamInterface<Found> {};

TEST_P(PidfileClaimTest, OfClaimersStartingAtOnceExactlyOneWins) {
  pid_t gone = fork();
  if (gone == 0) _exit(0);
  ASSERT_EQ(waitpid(gone, nullptr, 0), gone);
  if (GetParam().bytes >= 0) write_pid(path("testhost.pid"), gone, GetParam().bytes);
  int go[2], results[2];
  ASSERT_EQ(pipe(go), 0);
  ASSERT_EQ(pipe(results), 0);
  std::vector<pid_t> children;
  for (int i = 0; i < 4; i++) {
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      rndctl.pid = getpid();
      // Every claimer judges the file before any places its claim.
      pidfile_claim_pause = [] { usleep(50000); };
      close(go[1]);
      char byte;
      if (read(go[0], &byte, 1) != 0) _exit(3);
      byte = static_cast<char>('0' + Pidfile_claim());
      if (write(results[1], &byte, 1) != 1) _exit(4);
      pause();  // alive until every claimer has judged
      _exit(0);
    }
    children.push_back(child);
  }
  close(go[0]);
  close(go[1]);
  close(results[1]);
  std::string answers;
  char byte;
  while (answers.size() < children.size() && read(results[0], &byte, 1) == 1) answers += byte;
  PidfileRead now = Pidfile_read("testhost");
  for (pid_t child : children) kill(child, SIGKILL);
  for (pid_t child : children) ASSERT_EQ(waitpid(child, nullptr, 0), child);
  EXPECT_EQ(std::count(answers.begin(), answers.end(), '0'), 1) << answers;
  EXPECT_EQ(std::count(answers.begin(), answers.end(), '1'), 3) << answers;
  ASSERT_EQ(now.status, PIDFILE_OK);
  EXPECT_NE(std::find(children.begin(), children.end(), now.pid), children.end());
  EXPECT_EQ(entries(), std::vector<std::string>{"testhost.pid"});
}

INSTANTIATE_TEST_SUITE_P(Found, PidfileClaimTest,
                         testing::Values(Found{"NoFile", -1}, Found{"DeadPid", 4},
                                         Found{"ShortFile", 2}),
                         [](const testing::TestParamInfo<Found>& info) {
                           return std::string(info.param.name);
                         });

TEST_F(FileopTest, SelfCheckPassesOnlyWhileThePidFileNamesThisProcess) {
  ASSERT_EQ(init_fileop(), 1);
  write_pid(path("testhost.pid"), rndctl.pid);
  EXPECT_TRUE(Pidfile_self_check());
  write_pid(path("testhost.pid"), rndctl.pid + 1);
  EXPECT_FALSE(Pidfile_self_check());
  write_pid(path("testhost.pid"), rndctl.pid, 3);
  EXPECT_FALSE(Pidfile_self_check());
  EXPECT_NE(read_file("Render_Access").find("* short pid file --  testhost:"), std::string::npos);
}

}  // namespace
