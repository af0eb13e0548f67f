#include <fcntl.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include "Utility/rndctl/ctldir/rj_paths.h"
#include "Utility/rndctl/ctldir/rj_pidfile.h"
#include "gmock/gmock.h"
#include "tests/support/test_support.h"

namespace {

using Names = std::vector<std::string>;
using testing::HasSubstr;

mode_t mode_of(const std::string& p) {
  struct stat st;
  return stat(p.c_str(), &st) == 0 ? st.st_mode & 07777 : 0;
}

// Planted locks are made at kLockMade and the fake clocks count from it, so no test sleeps.
// A waiter that never breaks the lock gets an absurd age and fails on it instead of hanging.
constexpr time_t kLockMade = 1000000000;
constexpr int64_t kSecond = 1000000000;
time_t fake_server = 0;
int64_t fake_mono = 0;
std::vector<int64_t> pauses;
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
    fileop_monotonic_ns = [] { return fake_mono; };
    fileop_server_clock = [] { return fake_server; };
    std::tie(fake_server, fake_mono) = std::tuple(kLockMade, 0);
    pauses.clear();
  }
  void TearDown() override {
    fileop_release_held_locks();
    std::tie(fileop_poll_seconds, fileop_sleep, fileop_monotonic_ns, fileop_server_clock) = saved_;
    debug_fileacc = 0;
    ControlDirTest::TearDown();
  }
  std::string lock_dir(int i) const { return path(control_names[i] + std::string(".lock")); }
  /// What this host's holder file in the lock of `index` holds.
  std::string holder(int index) const { return read_text_file(lock_dir(index) + "/testhost"); }
  // A lock made at kLockMade (its age is its access time), with a holder file if `holder`.
  void plant_lock(int index, const char* holder, const std::string& content) {
    std::string lock = lock_dir(index);
    ASSERT_EQ(mkdir(lock.c_str(), 0777), 0);
    if (holder != nullptr) write_text_file(lock + "/" + holder, content);
    struct timespec times[2] = {{kLockMade, 0}, {0, UTIME_OMIT}};
    ASSERT_EQ(utimensat(AT_FDCWD, lock.c_str(), times, 0), 0) << lock;
  }
  // The control directory but for the access log and the clock file.
  Names entries() const {
    Names names = dir_names(dir_);
    std::erase_if(names, [](auto& n) { return n == "Render_Access" || n == ".clock.testhost"; });
    return names;
  }

  const std::string my_pid = std::to_string(getpid()) + "\n";  // a holder file of this process
  const std::tuple<unsigned, void (*)(int64_t), int64_t (*)(), time_t (*)()> saved_{
      fileop_poll_seconds, fileop_sleep, fileop_monotonic_ns, fileop_server_clock};
};

TEST_F(FileopTest, FreeLockHoldsHostFileWithPidAndReleaseRemovesBoth) {
  ASSERT_EQ(lock_fileop(FILE_TASKS, 1), 1);
  // The holder is renamed in: nothing else is left beside the lock.
  EXPECT_EQ(std::tuple(holder(FILE_TASKS), mode_of(lock_dir(FILE_TASKS)), entries(), pauses.size(),
                       std::string(fileop_path(FILE_TASKS))),
            std::tuple(my_pid, 0777u, Names{"Render_Tasks.lock"}, 0u, path("Render_Tasks")));
  EXPECT_EQ(read_file("Render_Access"), "\n\n *** Start of new process entries ***\n\n");
  // Reading a missing file makes it, empty.
  FILE* fp = read_fileop(FILE_TASKS);
  EXPECT_TRUE(fp != nullptr && fgetc(fp) == EOF && close_fileop(FILE_TASKS) == 0);

  const long before = fileop_hold_stats(FILE_TASKS).count;
  fake_mono += 3 * kSecond / 1000;
  ASSERT_EQ(lock_fileop(FILE_TASKS, 0), 1);
  EXPECT_EQ(entries(), Names{"Render_Tasks"});
  EXPECT_EQ(fileop_hold_stats(FILE_TASKS).count, before + 1);
  EXPECT_GE(fileop_hold_stats(FILE_TASKS).longest_ns, 3 * kSecond / 1000);
}

// A busy lock as a waiter finds it, and when the waiter may break it.
struct BusyLock {
  const char* label;
  const char* holder;    // holder file name, or none
  std::string content;   // its content; "DEAD" = a pid that has exited
  long broken_at_age;    // server-clock age at which it is broken; 0 = at once
  const char* log_line;  // what the access log says of the break
};
class BusyLockTest : public FileopTest, public testing::WithParamInterface<BusyLock> {};

TEST_P(BusyLockTest, WaiterBreaksItOnlyWhenItsHolderIsGone) {
  const BusyLock& c = GetParam();
  plant_lock(FILE_RESOURCES, c.holder,
             c.content == "DEAD" ? std::to_string(exited_pid()) + "\n" : c.content);
  debug_fileacc = 1;
  ASSERT_EQ(init_fileop(), 1);
  testing::internal::CaptureStderr();
  ASSERT_EQ(lock_fileop(FILE_RESOURCES, 1), 1);
  const std::string err = testing::internal::GetCapturedStderr(), log = read_file("Render_Access");
  // Respected until then, taken within one (at most 5 s) pause after, and in the retry mode
  // other tools look for.
  const long age = static_cast<long>(fake_server - kLockMade), at = c.broken_at_age;
  EXPECT_TRUE(at == 0 ? pauses.empty() : age >= at && age <= at + 5) << age;
  EXPECT_TRUE(at == 0 || mode_of(lock_dir(FILE_RESOURCES)) == 0664u);
  EXPECT_EQ(std::pair(dir_names(lock_dir(FILE_RESOURCES)), holder(FILE_RESOURCES)),
            std::pair(Names{"testhost"}, my_pid));
  EXPECT_THAT(log, HasSubstr(c.log_line));
  if (at == 181) {
    const std::string message = std::to_string(age) + " second timed out on \"" + c.holder +
                                "\" in \"" + lock_dir(FILE_RESOURCES) + "\" removed";
    EXPECT_EQ(err, message + "\n");
    EXPECT_THAT(log, HasSubstr("* " + message + " --  testhost:"));  // names who broke it
  }
  ASSERT_EQ(lock_fileop(FILE_RESOURCES, 0), 1);
  EXPECT_EQ(entries(), Names{});
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
    by_label);

// Forked waiters at one stale lock: one breaks it, all get it in turn, and
// no two hold it at once.
TEST_F(FileopTest, WaitersRacingAtAStaleLockBreakItOnceAndTakeItInTurn) {
  plant_lock(FILE_TASKS, "otherhost", "1\n");
  fake_server = kLockMade + 200;
  // Real, short pauses: the children really wait.
  std::tie(std::ignore, fileop_sleep, fileop_monotonic_ns, std::ignore) = saved_;
  fileop_poll_seconds = debug_fileacc = 1;
  ASSERT_EQ(init_fileop(), 1);
  static std::string inside;
  inside = path("inside");
  auto waiter = [](int, void*) {
    if (freopen("/dev/null", "w", stderr) == nullptr) return 4;
    if (lock_fileop(FILE_TASKS, 1) != 1) return 5;
    int fd = open(inside.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0666);
    if (fd < 0) return 2;  // somebody else is inside
    close(fd);
    usleep(2000);
    unlink(inside.c_str());
    return lock_fileop(FILE_TASKS, 0) != 1 ? 6 : 0;
  };
  for (RaceChild c : race_children(4, waiter, nullptr)) EXPECT_EQ(c.status, 0);
  const std::string log = read_file("Render_Access");
  const size_t broken = log.find("second timed out");  // once
  EXPECT_TRUE(broken != std::string::npos && broken == log.rfind("second timed out")) << log;
  EXPECT_EQ(entries(), Names{});
}

TEST_F(FileopTest, ReleaseRemovesOnlyLocksThisProcessHolds) {
  // Another holder's lock, by host or by pid, stays on release.
  plant_lock(FILE_JOBS, "otherhost", "1\n");
  plant_lock(FILE_RESOURCES, "testhost", "1\n");
  const std::pair<int, int> steps[] = {{FILE_JOBS, 0},      {FILE_RESOURCES, 0},
                                       {FILE_TASKS, 1},     {FILE_DEV_INDEX, 1},
                                       {FILE_JOB_INDEX, 1}, {FILE_JOB_INDEX, 0}};
  for (auto [index, take] : steps) ASSERT_EQ(lock_fileop(index, take), 1) << index << " " << take;
  fileop_release_held_locks();  // what a fatal exit does on its way out
  EXPECT_EQ(
      std::tuple(entries(), dir_names(lock_dir(FILE_JOBS)), dir_names(lock_dir(FILE_RESOURCES))),
      std::tuple(Names{"Render_Job_Control.lock", "Render_Resource_Control.lock"},
                 Names{"otherhost"}, Names{"testhost"}));
}

// One rewrite through each calling shape: the classic one (read, rewind,
// write to the same stream, close with truncation), the writer that writes
// straight after the open, and fileop_rewrite.
enum class Shape { kRewind, kWriteAtOnce, kRewriteHelper };

int rewrite(int index, Shape shape, const std::string& text) {
  if (shape == Shape::kRewriteHelper)
    return fileop_rewrite(index, [&](FILE* in, FILE* out) {
      while (fgetc(in) != EOF) continue;
      return fwrite(text.data(), 1, text.size(), out) == text.size();
    });
  FileopLock lock(index);
  FILE* fp = update_fileop(index);
  if (fp == nullptr) return -2;
  while (shape == Shape::kRewind && fgetc(fp) != EOF) continue;
  if (shape == Shape::kRewind) rewind_fileop(index);
  fwrite(text.data(), 1, text.size(), fp);
  return close_and_truncate_fileop(index);
}

class RewriteTest : public FileopTest, public testing::WithParamInterface<Shape> {};

TEST_P(RewriteTest, UnchangedContentsLeaveTheFileAloneChangedOnesReplaceItWhole) {
  const std::string file = path("Render_Job_next_index"), old_text = "123\nold tail\n";
  write_file("Render_Job_next_index", old_text);
  struct timespec times[2] = {{kLockMade, 0}, {kLockMade, 0}};
  ASSERT_EQ(utimensat(AT_FDCWD, file.c_str(), times, 0), 0);
  struct stat before, after;
  ASSERT_EQ(stat(file.c_str(), &before), 0);
  EXPECT_EQ(rewrite(FILE_JOB_INDEX, GetParam(), old_text), 0);
  ASSERT_EQ(stat(file.c_str(), &after), 0);
  EXPECT_EQ(std::pair(after.st_ino, after.st_mtime), std::pair(before.st_ino, kLockMade));

  // Shorter contents: nothing of the old tail stays, the mode is kept.
  ASSERT_EQ(chmod(file.c_str(), 0640), 0);
  EXPECT_EQ(rewrite(FILE_JOB_INDEX, GetParam(), "7\n"), GetParam() == Shape::kRewriteHelper);
  ASSERT_EQ(stat(file.c_str(), &after), 0);
  EXPECT_EQ(std::tuple(read_file("Render_Job_next_index"), after.st_ino != before.st_ino,
                       after.st_mode & 07777, entries()),
            std::tuple("7\n", true, 0640u, Names{"Render_Job_next_index"}));
}

TEST_P(RewriteTest, AFailedWriteLeavesTheOldFileAndNoTemporary) {
  write_file("Render_Tasks", "old contents\n");
  static Shape shape;
  shape = GetParam();
  int err[2];  // a pipe: a file would be cut by the size limit too
  ASSERT_EQ(pipe(err), 0);
  auto child = [](int, void* fd) {
    // A file-size limit makes the write fail part way (EFBIG).
    dup2(*static_cast<int*>(fd), 2);
    signal(SIGXFSZ, SIG_IGN);
    struct rlimit limit = {64, 64};
    setrlimit(RLIMIT_FSIZE, &limit);
    return rewrite(FILE_TASKS, shape, std::string(4096, 'x')) == -1 ? 0 : 1;
  };
  EXPECT_EQ(race_children(1, child, &err[1])[0].status, 0);
  close(err[1]);
  std::string reported(512, '\0');
  reported.resize(std::max<ssize_t>(read(err[0], &reported[0], reported.size()), 0));
  close(err[0]);
  EXPECT_EQ(std::pair(read_file("Render_Tasks"), entries()),
            std::pair(std::string("old contents\n"), Names{"Render_Tasks"}));
  EXPECT_THAT(reported,
              HasSubstr("ERROR: failed to write " + path("Render_Tasks") + ": File too large"));
}

INSTANTIATE_TEST_SUITE_P(Shapes, RewriteTest,
                         testing::Values(Shape::kRewind, Shape::kWriteAtOnce,
                                         Shape::kRewriteHelper));

TEST_F(FileopTest, OriginalUmaskSurvivesReinitialisation) {
  umask(022);
  ASSERT_EQ(init_fileop(), 1);
  fileop_reset();
  ASSERT_EQ(init_fileop(), 1);
  EXPECT_EQ(std::pair(get_original_umask(), umask(0)), std::pair(mode_t{022}, mode_t{1}));
}

// What start-up finds in the pid file (bytes of the pid of a process that
// has exited; -1: no file); every time, of claimers starting at once exactly
// one wins, the others see it alive, and no claim is left over.
class PidfileClaimTest : public FileopTest, public testing::WithParamInterface<int> {};

TEST_P(PidfileClaimTest, OfClaimersStartingAtOnceExactlyOneWins) {
  if (GetParam() >= 0) write_file("testhost.pid", pid_bytes(exited_pid(), GetParam()));
  // Claimers stay alive until all have claimed, so a loser sees the winner alive.
  static int* claimed;
  claimed = static_cast<int*>(
      mmap(nullptr, sizeof(int), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
  ASSERT_NE(claimed, MAP_FAILED);
  *claimed = 0;
  auto claimer = [](int, void*) {
    pidfile_claim_pause = [] { usleep(50000); };  // every claimer judges before any claims
    int result = Pidfile_claim();
    __atomic_add_fetch(claimed, 1, __ATOMIC_SEQ_CST);
    while (__atomic_load_n(claimed, __ATOMIC_SEQ_CST) < 4) usleep(1000);
    return result;
  };
  std::vector<RaceChild> raced = race_children(4, claimer, nullptr);
  munmap(claimed, sizeof(int));
  PidfileRead now = Pidfile_read("testhost");
  ASSERT_EQ(now.status, PIDFILE_OK);
  for (RaceChild c : raced)
    EXPECT_EQ(c.status, c.pid == now.pid ? 0 : 256) << c.pid << " won: " << now.pid;
  EXPECT_EQ(entries(), Names{"testhost.pid"});
}

INSTANTIATE_TEST_SUITE_P(Found, PidfileClaimTest, testing::Values(-1, 4, 2));

TEST_F(FileopTest, SelfCheckPassesOnlyWhileThePidFileNamesThisProcess) {
  ASSERT_EQ(init_fileop(), 1);
  for (auto [pid, bytes, ok] :
       {std::tuple{rndctl.pid, 4, true}, {rndctl.pid + 1, 4, false}, {rndctl.pid, 3, false}}) {
    write_file("testhost.pid", pid_bytes(pid, bytes));
    EXPECT_EQ(Pidfile_self_check(), ok) << pid << " " << bytes;
  }
  EXPECT_THAT(read_file("Render_Access"), HasSubstr("* short pid file --  testhost:"));
}

}  // namespace
