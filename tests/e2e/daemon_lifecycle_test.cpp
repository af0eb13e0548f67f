// The daemon as a process: singleton per host, its pid file, its log, its
// service loop's wake-ups and its ways to exit.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>

#include "tests/e2e/render_farm.h"

namespace {

using testing::HasSubstr;

class DaemonLifecycle : public testing::Test {
 protected:
  // Waits until the daemon has claimed the pid file, opened its log and
  // entered its loop (from then on SIGALRM wakes it instead of ending it).
  bool started(Daemon& d) {
    return wait_for(
        [&] { return read_pid_file(farm.path(d.host + ".pid")) == d.pid && d.in_loop(); }, 20);
  }
  // The daemon's exit code once it has ended, or -2 when it does not.
  static int exit_code(Daemon& d) {
    return wait_for([&] { return d.ended(); }, 20) ? d.exit_code() : -2;
  }
  // Removes the daemon's pid file and wakes it; its exit code.
  int exit_without_pid_file(Daemon& d) {
    if (unlink(farm.path(d.host + ".pid").c_str()) != 0) return -2;
    d.wake();
    return exit_code(d);
  }
  // All a daemon logs when nothing traces it.
  static std::string untraced_log() {
    return geteuid() != 0 ? ""
                          : "zarno_render_demon: warning: running as root; every render program "
                            "runs as root too\n";
  }
  Farm farm;
};

// Wakes the daemon once and waits until its wait has taken the signal.  The
// daemon blocks SIGALRM outside its wait, so a signal no longer pending was
// taken by a wait, and the next one cannot merge with it.
bool woken(Daemon& d) {
  d.wake();
  return wait_for(
      [&] {
        std::string status = read_text_file("/proc/" + std::to_string(d.pid) + "/status");
        if (status.empty()) return d.ended();
        auto pending = signal_mask(status, "\nSigPnd:") | signal_mask(status, "\nShdPnd:");
        return (pending & 1ULL << (SIGALRM - 1)) == 0;
      },
      10);
}

// Without -d the environment's debug level holds: the first daemon traces into its log.
TEST_F(DaemonLifecycle, SecondDaemonIsRefusedAndARemovedPidFileEndsTheFirst) {
  Daemon& d = farm.start({"-l", farm.dir()}, "", {"RNDCTL_DEBUG=3"});
  ASSERT_TRUE(started(d));
  Daemon& second = farm.start_on_farm();
  EXPECT_EQ(exit_code(second), 1);
  EXPECT_TRUE(read_pid_file(farm.path(d.host + ".pid")) == d.pid && !d.ended());
  ASSERT_EQ(exit_without_pid_file(d), 1);
  EXPECT_THAT(farm.read("Render_Access"),
              testing::AllOf(HasSubstr("* Exiting due to self check failure --  " + d.host +
                                       ":zarno_render_demon(" + std::to_string(d.pid) + ") "),
                             HasSubstr("error openning \"")));
  EXPECT_GT(d.log().size(), untraced_log().size()) << d.log();
}

// -d wins over the environment: eleven wake-ups go by untraced.
TEST_F(DaemonLifecycle, ExitsOnTheEleventhWorklessWakeUp) {
  Daemon& d = farm.start({"-l", farm.dir(), "-d", "0"}, "", {"RNDCTL_DEBUG=1"});
  ASSERT_TRUE(started(d));
  for (int i = 1; i <= 10; ++i) ASSERT_TRUE(woken(d)) << "wake-up " << i;
  EXPECT_FALSE(d.ended());
  EXPECT_EQ((d.wake(), exit_code(d)), 1);
  EXPECT_EQ(d.log(), untraced_log());
}

TEST_F(DaemonLifecycle, RefusesAControlDirectoryThatIsNotThere) {
  Daemon& d = farm.start({"-l", farm.path("missing")});
  EXPECT_EQ(exit_code(d), 255);
  std::string early = read_text_file(d.tmpdir + "/early");
  EXPECT_TRUE(early.find("control directory " + farm.path("missing")) != std::string::npos &&
              count_of(early, "\n") == 1)
      << early;
}

TEST_F(DaemonLifecycle, APlantedLinkDoesNotRedirectTheLog) {
  std::string tmp = farm.path("plantedtmp"), victim = farm.path("victim");
  ASSERT_TRUE(mkdir(tmp.c_str(), 0777) == 0 && write_text_file(victim, "precious\n") &&
              symlink(victim.c_str(), (tmp + "/zarno_render_demon.LOG").c_str()) == 0);
  Daemon& d = farm.start_on_farm({}, "", {"DRCTMPDIR=" + tmp});
  d.tmpdir = tmp;
  ASSERT_TRUE(started(d));
  EXPECT_EQ(read_text_file(victim), "precious\n");
  struct stat st;
  EXPECT_TRUE(lstat((tmp + "/zarno_render_demon.LOG").c_str(), &st) == 0 && S_ISREG(st.st_mode));
}

TEST_F(DaemonLifecycle, WakeUpsWhileStartUpWaitsForALockAreSurvived) {
  // Held by a live process of another host: nothing breaks it early.
  std::string lock = farm.path("Render_Resource_Control.lock");
  ASSERT_TRUE(mkdir(lock.c_str(), 0777) == 0 && write_text_file(lock + "/otherhost", "1\n"));
  Daemon& d = farm.start_on_farm();
  // The log is opened just before the first load, which waits for the lock.
  ASSERT_TRUE(wait_for([&] { return access(d.log_path().c_str(), F_OK) == 0; }, 20));
  for (int i = 0; i < 5; ++i) kill(d.pid, SIGALRM), usleep(100000);
  EXPECT_FALSE(d.ended() || d.in_loop()) << "status " << d.status;
  ASSERT_TRUE(unlink((lock + "/otherhost").c_str()) == 0 && rmdir(lock.c_str()) == 0);
  EXPECT_TRUE(started(d));
}

// Between its signals the daemon waits 20 seconds; a touch is seen within a
// fraction of a second.  Work that starts well inside the 20 seconds after
// the touch was started by the touch.
TEST_F(DaemonLifecycle, ATouchOfThePidFileWakesAnIdleDaemonWithoutASignal) {
  std::string host = this_host_name(), scene = make_project(farm);
  farm.write("Render_Resource_Control", resource_file({{host, 1, 3, 1}}));
  farm.write("Render_Job_Control", job_file({}, scene));
  Daemon& d = farm.start_on_farm({"-u", "3600"}, "", render_env());
  ASSERT_TRUE(started(d));
  // Its first pass beats the heartbeat: from then on it waits.
  ASSERT_TRUE(
      wait_for([&] { return access(farm.path("TSKSTAT/" + host).c_str(), F_OK) == 0; }, 20));

  JobSpec spin{.start = 1, .end = 1, .hosts = {host}};
  const auto touched = std::chrono::steady_clock::now();
  ASSERT_TRUE(edit_job_file(farm, "End\n", job_file({spin}, scene).substr(21), host));
  // Its one frame may render and finish between two looks: the group then
  // has come and gone from the task file.
  auto taken = [&] { return farm.read("Render_Tasks").find("spin") != std::string::npos; };
  ASSERT_TRUE(wait_for([&] { return taken() || job_status(farm, "spin") == "finished"; }, 120))
      << d.log();
  EXPECT_LT(std::chrono::steady_clock::now() - touched, std::chrono::seconds(15)) << d.log();
  ASSERT_TRUE(job_finishes(farm, d)) << d.log();
}

}  // namespace
