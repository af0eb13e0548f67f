// Signal handling: reaping render programs, the liveness probe, the texts.
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <string>

#include "tests/support/test_support.h"

namespace {

class SignalTest : public ControlDirTest {
 protected:
  void SetUp() override {
    ControlDirTest::SetUp();
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGCHLD);
    sigprocmask(SIG_BLOCK, &set, &saved_);
  }
  void TearDown() override {
    sigprocmask(SIG_SETMASK, &saved_, nullptr);
    rndctl.tasks = nullptr;  // the entries below live on the stack
    ControlDirTest::TearDown();
  }
  // A child that exits with `how` (negative: killed by signal -how), once it is a zombie.
  pid_t ended_child(int how) {
    pid_t pid = fork();
    if (pid == 0) _exit(how < 0 ? raise(-how) : how);
    siginfo_t info;
    waitid(P_PID, pid, &info, WEXITED | WNOWAIT);
    return pid;
  }
  sigset_t saved_;
};

TEST_F(SignalTest, OneHandlerCallJudgesEveryChildThatEnded) {
  TASK entries[3];
  TaskRec recs[3];
  const int hows[3] = {0, 3, -SIGKILL};
  for (int i = 0; i < 3; ++i) {
    std::tie(recs[i].id, entries[i].rec, entries[i].waitstatus) = std::tuple(i, &recs[i], 77);
    entries[i].pid = ended_child(hows[i]);
    entries[i].next = i < 2 ? &entries[i + 1] : nullptr;
    entries[i].prev = i > 0 ? &entries[i - 1] : nullptr;
  }
  rndctl.tasks = &entries[0];
  pid_t stranger = ended_child(5);  // not a task of ours: reaped all the same
  rndctl.running = 4;

  sig_handler(SIGCHLD);
  EXPECT_EQ(rndctl.running, 4);  // the handler only records the exits
  EXPECT_EQ(Task_judge_exits(), 4);

  EXPECT_EQ(std::tuple(rndctl.running, rndctl.signal_seen, last_signal), std::tuple(0, 1, SIGCHLD));
  for (int i = 0; i < 3; ++i)  // what the judge keeps of an exit: its code or signal
    EXPECT_EQ(std::pair(entries[i].pid, entries[i].waitstatus), std::pair(0, abs(hows[i]))) << i;
  EXPECT_EQ(waitpid(stranger, nullptr, WNOHANG), -1);  // no zombie left
}

TEST_F(SignalTest, AChildEndingTouchesTheHostUpdateTime) {
  write_file("testhost.pid", "abcd");
  struct timespec old_times[2] = {{1000, 0}, {1000, 0}};
  ASSERT_EQ(utimensat(AT_FDCWD, path("testhost.pid").c_str(), old_times, 0), 0);
  int64_t before = daemon_updatetime_get("testhost");
  ended_child(0);
  rndctl.running = 1;
  sig_handler(SIGCHLD);
  Task_judge_exits();
  EXPECT_GT(daemon_updatetime_get("testhost"), before);
}

TEST_F(SignalTest, SignalsGoToLocalProcessesOnlyAndProbesTellLiveFromDead) {
  const pid_t sleeping = sleeper();
  // A signal for another host is never sent, yet reported as sent.
  EXPECT_EQ(RJ_signal("otherhost", sleeping, SIGKILL), 0);
  EXPECT_EQ(waitpid(sleeping, nullptr, WNOHANG), 0);

  EXPECT_EQ(std::pair(RJ_signal(nullptr, 0, 0), RJ_signal("testhost", sleeping, 0)),
            std::pair(0, 0));
  EXPECT_NE(RJ_signal("testhost", exited_pid(), 0), 0);

  EXPECT_EQ(RJ_signal("testhost", sleeping, SIGKILL), 0);
  int status = 0;
  ASSERT_EQ(waitpid(sleeping, &status, 0), sleeping);
  EXPECT_TRUE(WIFSIGNALED(status));
}

TEST_F(SignalTest, RemoteProbeRunsTheRemoteShellWithoutALocalShell) {
  use_local_rsh();
  EXPECT_EQ(RJ_signal("farhost", getpid(), 0), 0);
  // A host name is one argument, never shell text: only the call's side effect counts.
  (void)RJ_signal(("x;touch " + path("owned")).c_str(), getpid(), 0);
  EXPECT_NE(access(path("owned").c_str(), F_OK), 0);
}

TEST_F(SignalTest, TimedPauseEndsAtItsLimitOrOnASignalThatCameWhileBlocked) {
  RJ_sighold(SIGALRM);
  RJ_sigset(SIGALRM, sig_handler);
  last_signal = 0;
  EXPECT_EQ(RJ_pause_for(20), 0);
  raise(SIGALRM);  // held: waits for the pause
  EXPECT_EQ(last_signal, 0);
  EXPECT_EQ(RJ_pause_for(10000), 1);  // ends on the signal, long before its limit
  EXPECT_EQ(last_signal, SIGALRM);
  signal(SIGALRM, SIG_DFL);
}
}  // namespace
