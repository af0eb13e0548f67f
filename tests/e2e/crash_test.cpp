// A daemon that crashes, dies with its host or exits loses no task and
// leaves no render running: the real daemon, killed and restarted on the
// same control directory.
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>

#include "tests/e2e/render_farm.h"
#include "tests/support/task_text.h"

namespace {

bool any_held(Farm& farm) {
  for (const FileRec& r : task_records(farm))
    if (r.held()) return true;
  return false;
}

std::vector<std::string> lock_dirs(Farm& farm) {
  std::vector<std::string> locks = dir_names(farm.dir());
  std::erase_if(locks, [](const std::string& name) { return !name.ends_with(".lock"); });
  return locks;
}

// Gone, or a zombie nobody has reaped yet.
bool process_gone(int pid) {
  std::string stat = read_text_file("/proc/" + std::to_string(pid) + "/stat");
  size_t close = stat.rfind(')');
  return close == std::string::npos || stat.compare(close + 1, 3, " Z ") == 0;
}

class CrashTest : public ::testing::Test {
 protected:
  void SetUp() override {
    host_ = this_host_name();
    scene_ = make_project(farm_);
  }
  // This host's resource and a job of frames 1 to 6 on it.
  void write_farm(const std::string& opts) {
    farm_.write("Render_Resource_Control", resource_file({{host_, 1, 6, 1}}));
    farm_.write("Render_Job_Control", job_file({{.opts = opts, .hosts = {host_}}}, scene_));
  }
  std::string image(int frame) { return farm_.path("project/pix/spin." + std::to_string(frame)); }
  bool rendered(int frame) { return access(image(frame).c_str(), F_OK) == 0; }
  bool finished(Daemon& d) {
    return wait_for([&] { return job_status(farm_, "spin") == "finished" || d.ended(); }, 120,
                    &d) &&
           job_status(farm_, "spin") == "finished";
  }
  // The one render program the daemon runs, once its task is RUNNING.
  int running_render(Daemon& d) {
    bool running = wait_for(
        [&] {
          std::string t = farm_.read("Render_Tasks");
          return t.find("RUNNING") != std::string::npos && !children_of(d.pid).empty();
        },
        60, &d);
    std::vector<int> kids = children_of(d.pid);
    return running && kids.size() == 1 ? kids[0] : -1;
  }

  Farm farm_;
  std::string host_, scene_;
};

TEST_F(CrashTest, ARestartedDaemonEndsTheOldRenderAndRendersTheRestFromTheFrameReached) {
  write_farm("slow=1");
  Daemon& first = farm_.start_on_farm({}, "", render_env());
  int render = running_render(first);
  ASSERT_GT(render, 0) << first.log();

  // Let the daemon record the frame reached (a touch of its pid file makes
  // it look), then kill it between two of its passes.
  ASSERT_TRUE(wait_for([&] { return rendered(2); }, 60)) << first.log();
  utimensat(AT_FDCWD, farm_.path(host_ + ".pid").c_str(), nullptr, 0);
  float reached = 0;
  ASSERT_TRUE(wait_for(
      [&] {
        for (const FileRec& r : task_records(farm_))
          if (r.status == "RUNNING" && r.current > r.start) reached = r.current;
        return reached > 0 && lock_dirs(farm_).empty();
      },
      30))
      << farm_.read("Render_Tasks");
  kill(first.pid, SIGKILL);
  ASSERT_TRUE(wait_for([&] { return first.ended(); }, 10));
  EXPECT_FALSE(process_gone(render)) << "the render outlives its daemon";
  // Frames the task file counts as done must not be painted again.
  std::vector<struct stat> done;
  for (int frame = 1; frame < static_cast<int>(reached); ++frame) {
    struct stat st {};
    EXPECT_EQ(stat(image(frame).c_str(), &st), 0) << frame;
    done.push_back(st);
  }

  // The same host again, with the same temporary directory.
  Daemon& second = farm_.start_on_farm({}, "", {render_env()[0], "DRCTMPDIR=" + first.tmpdir});
  second.tmpdir = first.tmpdir;
  EXPECT_TRUE(wait_for([&] { return process_gone(render); }, 30));
  ASSERT_TRUE(finished(second)) << second.log() << farm_.read("Render_Tasks");

  for (int frame = 1; frame <= 6; ++frame) EXPECT_TRUE(rendered(frame)) << frame;
  for (size_t i = 0; i < done.size(); ++i) {
    struct stat st {};
    ASSERT_EQ(stat(image(static_cast<int>(i) + 1).c_str(), &st), 0);
    EXPECT_TRUE(st.st_ino == done[i].st_ino && st.st_mtim.tv_sec == done[i].st_mtim.tv_sec &&
                st.st_mtim.tv_nsec == done[i].st_mtim.tv_nsec)
        << "frame " << i + 1 << " was rendered again";
  }
  // The old task was cut where it had got to: done frames stay done.
  std::string log = farm_.read("JOBLOG/spin");
  EXPECT_EQ(log.find(" 1.000000 - 6.000000\t"), std::string::npos) << log;
  EXPECT_NE(log.find("\t0\t 1.000000 - "), std::string::npos) << log;
  EXPECT_FALSE(any_held(farm_)) << farm_.read("Render_Tasks");
  // Only the live daemon's own passes may still take a lock now and then.
  EXPECT_TRUE(wait_for([&] { return lock_dirs(farm_).empty(); }, 30));
  EXPECT_FALSE(second.ended());
}

TEST_F(CrashTest, ACleanExitEndsItsRenderAndPutsTheTaskBack) {
  write_farm("slow=2");
  Daemon& d = farm_.start_on_farm({}, "", render_env());
  int render = running_render(d);
  ASSERT_GT(render, 0) << d.log();

  ASSERT_EQ(unlink(farm_.path(host_ + ".pid").c_str()), 0);
  d.wake();
  ASSERT_TRUE(wait_for([&] { return d.ended(); }, 30));
  EXPECT_TRUE(wait_for([&] { return process_gone(render); }, 30));
  EXPECT_FALSE(any_held(farm_)) << farm_.read("Render_Tasks");
  EXPECT_NE(farm_.read("Render_Tasks").find("PENDING"), std::string::npos);
  EXPECT_TRUE(lock_dirs(farm_).empty()) << "the exit left a lock behind";
}

// A control file the grammar cannot read ends the daemon at once: whatever
// locks it held on the way must go with it, or every host waits them out.
TEST_F(CrashTest, AFatalExitOnABadControlFileLeavesNoLockBehind) {
  write_farm("");
  farm_.write("Render_Job_Control", "RenderJobControl 1 1\nspin 1 {\n\tpriority = 4\n}\n");
  Daemon& d = farm_.start_on_farm({}, "", render_env());
  ASSERT_TRUE(wait_for([&] { return d.ended(); }, 60)) << d.log();
  EXPECT_TRUE(WIFSIGNALED(d.status) || d.exit_code() != 0) << d.status;
  std::string said = read_text_file(d.tmpdir + "/early") + d.log();
  EXPECT_NE(said.find("Syntax error: line 4 of "), std::string::npos) << said;
  EXPECT_EQ(lock_dirs(farm_), std::vector<std::string>{});
}

TEST_F(CrashTest, TasksOfAHostWhoseHeartbeatStoppedAreCutAndRenderedHere) {
  farm_.write("Render_Resource_Control", resource_file({{host_, 1, 6, 1}, {"ghost", 2, 6, 1}}));
  farm_.write("Render_Job_Control",
              job_file({{.status = "started", .end = 4, .hosts = {host_, "ghost"}}}, scene_));
  // The ghost had rendered frames 1 and 2 when its host went dark an hour ago.
  farm_.write("Render_Tasks", group_line("spin", 1, 1, 1) + rec_line(0, 1, 4, 3, 2, 0, "RUNNING"));
  ASSERT_EQ(mkdir(farm_.path("TSKSTAT").c_str(), 0775), 0);
  farm_.write("TSKSTAT/ghost", "spin 1 2 -\n");
  struct timespec old[2] = {{time(nullptr) - 3600, 0}, {time(nullptr) - 3600, 0}};
  ASSERT_EQ(utimensat(AT_FDCWD, farm_.path("TSKSTAT/ghost").c_str(), old, 0), 0);

  Daemon& d = farm_.start_on_farm({}, "", {render_env()[0], "ZARNO_RNDCTL_HOST_TIMEOUT=60"});
  ASSERT_TRUE(finished(d)) << d.log() << farm_.read("Render_Tasks");
  EXPECT_TRUE(rendered(3) && rendered(4));
  EXPECT_FALSE(rendered(1)) << "frames the ghost had done are not rendered again";
  std::string access = farm_.read("Render_Access");
  EXPECT_NE(access.find("* put back task 0 of \"spin\" from host ghost: no heartbeat for 36"),
            std::string::npos)
      << access;
}

}  // namespace
