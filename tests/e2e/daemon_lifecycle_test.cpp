// The daemon as a process: singleton per host, its pid file, its log, its
// service loop's wake-ups and its ways to exit.
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <thread>

#include "tests/e2e/render_farm.h"

namespace {

// Waits until the daemon has claimed the pid file, opened its log and
// entered its loop (from then on SIGALRM wakes it instead of ending it).
bool started(Farm& farm, Daemon& d) {
  return wait_for([&] { return read_pid_file(farm.path(d.host + ".pid")) == d.pid && d.in_loop(); },
                  20);
}

// Wakes the daemon once and waits until its wait has taken the signal.  The
// daemon blocks SIGALRM outside its wait, so a signal no longer pending was
// taken by a wait, and the next one cannot merge with it.
bool woken(Daemon& d) {
  d.wake();
  return wait_for(
      [&] {
        std::string status = read_text_file("/proc/" + std::to_string(d.pid) + "/status");
        size_t at = status.find("\nSigPnd:");
        size_t shared = status.find("\nShdPnd:");
        if (at == std::string::npos || shared == std::string::npos) return d.ended();
        const unsigned long long alarm_bit = 1ull << (SIGALRM - 1);
        return ((strtoull(status.c_str() + at + 8, nullptr, 16) |
                 strtoull(status.c_str() + shared + 8, nullptr, 16)) &
                alarm_bit) == 0;
      },
      10);
}

TEST(DaemonLifecycle, SecondDaemonOnTheSameHostRefusesToStart) {
  Farm farm;
  Daemon& first = farm.start_on_farm();
  ASSERT_TRUE(started(farm, first));

  Daemon& second = farm.start_on_farm();
  ASSERT_TRUE(wait_for([&] { return second.ended(); }, 20));
  EXPECT_EQ(second.exit_code(), 1);
  std::string early = read_text_file(second.tmpdir + "/early");
  EXPECT_NE(
      early.find("process is alive --> " + first.host + ":" + std::to_string(first.pid) + "\n"),
      std::string::npos)
      << early;
  EXPECT_EQ(read_pid_file(farm.path(first.host + ".pid")), first.pid);
  EXPECT_FALSE(first.ended());
}

TEST(DaemonLifecycle, RemovedPidFileEndsTheDaemonAtItsNextWakeUp) {
  Farm farm;
  Daemon& d = farm.start_on_farm();
  ASSERT_TRUE(started(farm, d));
  ASSERT_EQ(unlink(farm.path(d.host + ".pid").c_str()), 0);
  d.wake();
  ASSERT_TRUE(wait_for([&] { return d.ended(); }, 20));
  EXPECT_EQ(d.exit_code(), 1);
  std::string access = farm.read("Render_Access");
  EXPECT_NE(access.find("* Exiting due to self check failure --  " + d.host +
                        ":zarno_render_demon(" + std::to_string(d.pid) + ") "),
            std::string::npos)
      << access;
  EXPECT_NE(access.find("error openning \""), std::string::npos) << access;
}

TEST(DaemonLifecycle, ExitsOnTheEleventhWorklessWakeUp) {
  Farm farm;
  Daemon& d = farm.start_on_farm();
  ASSERT_TRUE(started(farm, d));
  for (int i = 1; i <= 10; ++i) ASSERT_TRUE(woken(d)) << "wake-up " << i;
  EXPECT_FALSE(d.ended());
  d.wake();
  ASSERT_TRUE(wait_for([&] { return d.ended(); }, 20));
  EXPECT_EQ(d.exit_code(), 1);
}

TEST(DaemonLifecycle, RefusesAControlDirectoryThatIsNotThere) {
  Farm farm;
  Daemon& d = farm.start({"-l", farm.path("missing")});
  ASSERT_TRUE(wait_for([&] { return d.ended(); }, 20));
  EXPECT_EQ(d.exit_code(), 255);
  std::string early = read_text_file(d.tmpdir + "/early");
  EXPECT_NE(early.find("control directory " + farm.path("missing")), std::string::npos) << early;
  EXPECT_EQ(count_of(early, "\n"), 1) << early;
}

TEST(DaemonLifecycle, APlantedLinkDoesNotRedirectTheLog) {
  Farm farm;
  std::string tmp = farm.path("plantedtmp");
  ASSERT_EQ(mkdir(tmp.c_str(), 0777), 0);
  std::string victim = farm.path("victim");
  write_text_file(victim, "precious\n");
  ASSERT_EQ(symlink(victim.c_str(), (tmp + "/zarno_render_demon.LOG").c_str()), 0);
  Daemon& d = farm.start_on_farm({}, "", {"DRCTMPDIR=" + tmp});
  d.tmpdir = tmp;
  ASSERT_TRUE(started(farm, d));
  EXPECT_EQ(read_text_file(victim), "precious\n");
  struct stat st;
  ASSERT_EQ(lstat((tmp + "/zarno_render_demon.LOG").c_str(), &st), 0);
  EXPECT_TRUE(S_ISREG(st.st_mode));
}

TEST(DaemonLifecycle, WakeUpsWhileStartUpWaitsForALockAreSurvived) {
  Farm farm;
  // Held by a live process of another host: nothing breaks it early.
  std::string lock = farm.path("Render_Resource_Control.lock");
  ASSERT_EQ(mkdir(lock.c_str(), 0777), 0);
  write_text_file(lock + "/otherhost", "1\n");
  Daemon& d = farm.start_on_farm();
  // The log is opened just before the first load, which waits for the lock.
  ASSERT_TRUE(wait_for([&] { return access(d.log_path().c_str(), F_OK) == 0; }, 20));
  for (int i = 0; i < 5; ++i) {
    kill(d.pid, SIGALRM);
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
  }
  EXPECT_FALSE(d.ended()) << "status " << d.status;
  EXPECT_FALSE(d.in_loop());
  ASSERT_EQ(unlink((lock + "/otherhost").c_str()), 0);
  ASSERT_EQ(rmdir(lock.c_str()), 0);
  EXPECT_TRUE(started(farm, d));
}

// Between its signals the daemon waits 20 seconds; a touch is seen within a
// fraction of a second.  Work that starts well inside the 20 seconds after
// the touch was started by the touch.
TEST(DaemonLifecycle, ATouchOfThePidFileWakesAnIdleDaemonWithoutASignal) {
  Farm farm;
  std::string host = this_host_name();
  std::string scene = make_project(farm);
  ResourceSpec here{host, 1, 3, 1, "AVAILABLE", ""};
  farm.write("Render_Resource_Control", resource_file({here}));
  farm.write("Render_Job_Control", job_file({}, scene));
  Daemon& d = farm.start_on_farm({"-u", "3600"}, "", render_env());
  ASSERT_TRUE(started(farm, d));
  // Its first pass beats the heartbeat: from then on it waits.
  ASSERT_TRUE(
      wait_for([&] { return access(farm.path("TSKSTAT/" + host).c_str(), F_OK) == 0; }, 20));

  JobSpec spin;
  spin.start = spin.end = 1;
  spin.hosts = {host};
  const auto touched = std::chrono::steady_clock::now();
  ASSERT_TRUE(edit_job_file(farm, "End\n", job_file({spin}, scene).substr(21), host));
  // Its one frame may render and finish between two looks: the group then
  // has come and gone from the task file.
  ASSERT_TRUE(wait_for(
      [&] {
        return farm.read("Render_Tasks").find("spin") != std::string::npos ||
               job_status(farm, "spin") == "finished";
      },
      120))
      << d.log();
  EXPECT_LT(std::chrono::steady_clock::now() - touched, std::chrono::seconds(15)) << d.log();
  ASSERT_TRUE(wait_for([&] { return job_status(farm, "spin") == "finished"; }, 120)) << d.log();
}

TEST(DaemonLifecycle, DebugOptionWinsOverTheEnvironment) {
  Farm farm;
  Daemon& traced = farm.start({"-l", farm.dir()}, "", {"RNDCTL_DEBUG=3"});
  ASSERT_TRUE(started(farm, traced));
  ASSERT_EQ(unlink(farm.path(traced.host + ".pid").c_str()), 0);
  traced.wake();
  ASSERT_TRUE(wait_for([&] { return traced.ended(); }, 20));

  Daemon& quiet = farm.start({"-l", farm.dir(), "-d", "0"}, "", {"RNDCTL_DEBUG=1"});
  ASSERT_TRUE(started(farm, quiet));
  ASSERT_EQ(unlink(farm.path(quiet.host + ".pid").c_str()), 0);
  // Its exit proves it went through a wake-up without tracing anything.
  quiet.wake();
  ASSERT_TRUE(wait_for([&] { return quiet.ended(); }, 20));
  EXPECT_EQ(quiet.exit_code(), 1);
  // Nothing but the warning every daemon started as root writes.
  std::string log = quiet.log();
  const std::string warning =
      "zarno_render_demon: warning: running as root; every render program runs as root too\n";
  if (log.compare(0, warning.size(), warning) == 0) log.erase(0, warning.size());
  EXPECT_EQ(log, "");
}

}  // namespace
