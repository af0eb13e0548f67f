// Taking back held tasks: the put-back cut, the start-up and dead-host
// cycles on a real task file, the heartbeat judgement and the render registry.
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <string>

#include "tests/support/task_fixture.h"
#include "tests/support/task_text.h"

namespace {

class ReclaimTest : public TaskFixture {
 protected:
  void SetUp() override {
    TaskFixture::SetUp();
    far_ = host_dev("far1", 2, "farhost");
  }
  void TearDown() override {
    // Kills what the test registered, in its own registry: the default one lists other tests'.
    rj_render_kill_leftovers();
    TaskFixture::TearDown();
  }
  // Against `now` when given, so that a second passing in the test shifts nothing.
  void set_age(const std::string& name, time_t seconds, time_t now = 0) {
    if (now == 0) now = time(nullptr);
    struct timespec t[2] = {{now - seconds, 0}, {now - seconds, 0}};
    ASSERT_EQ(utimensat(AT_FDCWD, path(name).c_str(), t, 0), 0);
  }
  // Whether `pid` ends by a signal within 5 seconds; killed and reaped either way.
  static bool killed(pid_t pid) {
    int status = 0, tries = 0;
    while (waitpid(pid, &status, WNOHANG) != pid && ++tries < 500) usleep(10000);
    if (tries < 500) return WIFSIGNALED(status);
    kill(pid, SIGKILL);
    waitpid(pid, &status, 0);
    return false;
  }
  Dev* far_ = nullptr;
};

// Nothing done goes back pending, whole, for any host; midway keeps the done
// frames; at the last frame that frame stays pending.  Retries are kept.
TEST_F(ReclaimTest, StartUpPutsBackOnlyThisHostsHeldTasks) {
  std::string name = job_->name.c_str();
  write_file("Render_Tasks",
             group_line(name, 1, 5, 5) + rec_lines("0 1 2 1 1 0 STARTED, 1 3 6 5 1 1 RUNNING, "
                                                   "2 7 8 7 2 0 RUNNING, 3 9 10 9 0 0 PENDING, "
                                                   "4 11 12 12 1 0 RUNNING"));
  EXPECT_EQ(Task_reclaim_this_host(), 3);
  EXPECT_EQ(read_file("Render_Tasks"),
            group_line(name, 1, 7, 7) + rec_lines("0 1 2 1 0 0 PENDING, 1 3 4 4 1 1 FINISHED, "
                                                  "2 7 8 7 2 0 RUNNING, 3 9 10 9 0 0 PENDING, "
                                                  "4 11 11 11 1 0 FINISHED, 5 5 6 5 0 1 PENDING, "
                                                  "6 12 12 12 0 0 PENDING"));
  EXPECT_EQ(access(path("Render_Tasks.lock").c_str(), F_OK), -1);
}

TEST_F(ReclaimTest, AnotherHostsTaskIsPutBackOnlyWhenItsHeartbeatIsOldAndItsDaemonGone) {
  use_local_rsh();  // this process counts as farhost's daemon when the pid file names it
  mkdir(path("TSKSTAT").c_str(), 0775);
  const std::string name = job_->name.c_str(),
                    held = group_line(name, 1, 1, 1) + rec_line(0, 1, 4, 1, 2, 0, "STARTED");
  const time_t now = time(nullptr);
  // Heartbeat age (-1: no heartbeat file), whether the daemon lives, whether put back.
  const std::tuple<int, bool, bool> cases[] = {
      {30, false, false}, {-1, false, false}, {3600, true, false}, {3600, false, true}};
  for (auto [age, alive, put_back] : cases) {
    write_file("Render_Tasks", held);
    for (const char* file : {"TSKSTAT/farhost", "farhost.pid"}) unlink(path(file).c_str());
    if (age >= 0) write_file("TSKSTAT/farhost", "");
    if (age >= 0) set_age("TSKSTAT/farhost", age, now);
    if (alive) write_file("farhost.pid", pid_bytes(getpid()));
    EXPECT_EQ(Task_reclaim_dead_hosts(now), put_back ? 1 : 0) << age << alive;
    EXPECT_EQ(read_file("Render_Tasks").find("STARTED") == std::string::npos, put_back) << age;
  }
}

TEST_F(ReclaimTest, HeartbeatCreatesTheStatusFileAndKeepsItsLines) {
  time_t first = rj_heartbeat();
  EXPECT_GE(first, time(nullptr) - 5);
  EXPECT_EQ(read_file("TSKSTAT/testhost"), "");
  write_file("TSKSTAT/testhost", "job 1 2 -\n");
  set_age("TSKSTAT/testhost", 1000);
  EXPECT_GE(rj_heartbeat(), first);
  EXPECT_EQ(read_file("TSKSTAT/testhost"), "job 1 2 -\n");
}

TEST_F(ReclaimTest, RegistryKillsOnlyTheRendersItRecordedAndIgnoresAPlantedLink) {
  write_file("victim", "untouched");
  ASSERT_EQ(symlink(path("victim").c_str(), rj_render_registry_path()), 0);
  const pid_t render = sleeper(), other = sleeper();
  for (pid_t pid : {render, other}) rj_render_started(pid);
  const std::string both = read_text_file(rj_render_registry_path());
  rj_render_ended(other);
  EXPECT_EQ(read_file("victim"), "untouched");
  struct stat st;
  EXPECT_TRUE(lstat(rj_render_registry_path(), &st) == 0 && S_ISREG(st.st_mode));
  EXPECT_EQ(std::count(both.begin(), both.end(), '\n'), 2) << both;

  // A line that names a live process under another start time: its pid was
  // reused, the process is not ours.
  write_text_file(rj_render_registry_path(),
                  read_text_file(rj_render_registry_path()) + std::to_string(other) + " 1\n");
  EXPECT_EQ(rj_render_kill_leftovers(), 1);
  EXPECT_TRUE(killed(render));
  EXPECT_EQ(waitpid(other, nullptr, WNOHANG), 0) << "a reused pid was killed";
  EXPECT_EQ(read_text_file(rj_render_registry_path()), "");

  // A registry that others may write is not believed.
  write_text_file(rj_render_registry_path(), both);
  chmod(rj_render_registry_path(), 0666);
  EXPECT_EQ(rj_render_kill_leftovers(), 0);
  EXPECT_EQ(waitpid(other, nullptr, WNOHANG), 0);
  kill(other, SIGKILL);
  waitpid(other, nullptr, 0);
}

TEST(UpdateTimeSettled, AWholeSecondStampWaitsForTheServersNextSecond) {
  const int64_t stamp = 1700000000 * int64_t{1000000000};
  for (auto [ns, server, settled] : {std::tuple{stamp + 123, 1700000000, true},
                                     {stamp, 1700000000, false},
                                     {stamp, 1700000001, true},
                                     {int64_t{0}, 1700000000, true}})
    EXPECT_EQ(rj_update_time_settled(ns, server), settled) << ns << " " << server;
}

}  // namespace
