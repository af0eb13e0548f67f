// One host's real daemon on a real control directory: a daemon that crashes, dies with its host
// or exits loses no task and leaves no render running; an abort ends a whole render; a render
// program gets only its three streams.  The daemon is killed and restarted on the same directory.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <tuple>

#include "tests/e2e/render_farm.h"
#include "tests/support/task_text.h"

namespace {

using testing::HasSubstr;

bool any_held(Farm& farm) { return std::ranges::any_of(task_records(farm), &FileRec::held); }

// Gone, or a zombie nobody has reaped yet.
bool process_gone(int pid) {
  std::string stat = read_text_file("/proc/" + std::to_string(pid) + "/stat");
  size_t close = stat.rfind(')');
  return close == std::string::npos || stat.compare(close + 1, 3, " Z ") == 0;
}

class RenderTest : public ::testing::Test {
 protected:
  // This host's resource and a job "spin" of frames 1 to `end` on it.
  void write_farm(const std::string& opts, int max_frames = 6, int processors = 1, float end = 6) {
    farm_.write(
        "Render_Resource_Control",
        resource_file({{.name = host_, .max_frames = max_frames, .num_processors = processors}}));
    farm_.write("Render_Job_Control",
                job_file({{.end = end, .opts = opts, .hosts = {host_}}}, scene_));
  }
  // Starts this host's daemon.  A `wrapper` script, when given, runs in place of the render
  // program with the daemon's arguments.
  Daemon& start(const std::string& wrapper = "") {
    std::vector<std::string> env = render_env();
    if (!wrapper.empty()) {
      mkdir(farm_.path("wrapped").c_str(), 0777);
      farm_.write("wrapped/frame_painter", "#!/bin/sh\n" + wrapper);
      chmod(farm_.path("wrapped/frame_painter").c_str(), 0755);
      env[0] = "PATH=" + farm_.path("wrapped") + ":" + env[0].substr(5);
    }
    return farm_.start_on_farm({}, "", env);
  }
  std::string image(int frame) { return farm_.path("project/pix/spin." + std::to_string(frame)); }
  bool rendered(int frame) { return access(image(frame).c_str(), F_OK) == 0; }
  // The one render program the daemon runs, once its task is RUNNING.
  int running_render(Daemon& d) {
    auto running = [&] { return farm_.read("Render_Tasks").find("RUNNING") != std::string::npos; };
    bool ran = wait_for([&] { return running() && !children_of(d.pid).empty(); }, 60, &d);
    std::vector<int> kids = children_of(d.pid);
    return ran && kids.size() == 1 ? kids[0] : -1;
  }

  // Inode and change time of the images before frame `end` (a frame painted again has others).
  std::vector<std::tuple<ino_t, time_t, long>> images_before(int end) {
    std::vector<std::tuple<ino_t, time_t, long>> out;
    for (int frame = 1; frame < end; ++frame) {
      struct stat st {};
      stat(image(frame).c_str(), &st);
      out.emplace_back(st.st_ino, st.st_mtim.tv_sec, st.st_mtim.tv_nsec);
    }
    return out;
  }

  Farm farm_;
  std::string host_ = this_host_name(), scene_ = make_project(farm_);
};
using CrashTest = RenderTest;

TEST_F(CrashTest, ARestartedDaemonEndsTheOldRenderAndRendersTheRestFromTheFrameReached) {
  write_farm("slow=1");
  Daemon& first = start();
  int render = running_render(first);
  ASSERT_GT(render, 0) << first.log();

  // Let the daemon record the frame reached (a touch of its pid file makes
  // it look), then kill it between two of its passes.
  ASSERT_TRUE(wait_for([&] { return rendered(2); }, 60)) << first.log();
  utimensat(AT_FDCWD, farm_.path(host_ + ".pid").c_str(), nullptr, 0);
  float reached = 0;
  auto recorded = [&] {
    for (const FileRec& r : task_records(farm_))
      if (r.status == "RUNNING" && r.current > r.start) reached = r.current;
    return reached > 0 && lock_dirs(farm_).empty();
  };
  ASSERT_TRUE(wait_for(recorded, 30)) << farm_.read("Render_Tasks");
  ASSERT_TRUE(kill(first.pid, SIGKILL) == 0 && wait_for([&] { return first.ended(); }, 10));
  EXPECT_FALSE(process_gone(render)) << "the render outlives its daemon";
  // Frames the task file counts as done must not be painted again.
  auto done = images_before(static_cast<int>(reached));

  // The same host again, with the same temporary directory.
  Daemon& second = farm_.start_on_farm({}, "", {render_env()[0], "DRCTMPDIR=" + first.tmpdir});
  second.tmpdir = first.tmpdir;
  EXPECT_TRUE(wait_for([&] { return process_gone(render); }, 30));
  ASSERT_TRUE(job_finishes(farm_, second)) << second.log() << farm_.read("Render_Tasks");

  for (int frame = 1; frame <= 6; ++frame) EXPECT_TRUE(rendered(frame)) << frame;
  EXPECT_EQ(images_before(static_cast<int>(reached)), done) << "a done frame was rendered again";
  EXPECT_FALSE(any_held(farm_)) << farm_.read("Render_Tasks");
  // Only the live daemon's own passes may still take a lock now and then.
  EXPECT_TRUE(wait_for([&] { return lock_dirs(farm_).empty(); }, 30));
  EXPECT_FALSE(second.ended());
}

TEST_F(CrashTest, ACleanExitEndsItsRenderAndPutsTheTaskBack) {
  write_farm("slow=2");
  Daemon& d = start();
  int render = running_render(d);
  ASSERT_GT(render, 0) << d.log();

  ASSERT_EQ(unlink(farm_.path(host_ + ".pid").c_str()), 0);
  ASSERT_TRUE((d.wake(), wait_for([&] { return d.ended(); }, 30)));
  EXPECT_TRUE(wait_for([&] { return process_gone(render); }, 30));
  EXPECT_TRUE(!any_held(farm_) && farm_.read("Render_Tasks").find("PENDING") != std::string::npos)
      << farm_.read("Render_Tasks");
  EXPECT_TRUE(lock_dirs(farm_).empty()) << "the exit left a lock behind";
}

// A control file the grammar cannot read ends the daemon at once: whatever
// locks it held on the way must go with it, or every host waits them out.
TEST_F(CrashTest, AFatalExitOnABadControlFileLeavesNoLockBehind) {
  write_farm("");
  farm_.write("Render_Job_Control", "RenderJobControl 1 1\nspin 1 {\n\tpriority = 4\n}\n");
  Daemon& d = start();
  ASSERT_TRUE(wait_for([&] { return d.ended(); }, 60)) << d.log();
  EXPECT_TRUE(WIFSIGNALED(d.status) || d.exit_code() != 0) << d.status;
  EXPECT_THAT(read_text_file(d.tmpdir + "/early") + d.log(), HasSubstr("Syntax error: line 4 of "));
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
  ASSERT_TRUE(job_finishes(farm_, d)) << d.log() << farm_.read("Render_Tasks");
  EXPECT_TRUE(rendered(3) && rendered(4));
  EXPECT_FALSE(rendered(1)) << "frames the ghost had done are not rendered again";
  EXPECT_THAT(farm_.read("Render_Access"),
              HasSubstr("* put back task 0 of \"spin\" from host ghost: no heartbeat for 36"));
}

// The render program is a wrapper that runs the real renderer as its own
// child, as studio wrappers do: an abort must end both.
TEST_F(RenderTest, AnAbortedJobHasItsWholeRenderKilled) {
  write_farm("slow=20");
  Daemon& d = start(FRAME_PAINTER_PATH " \"$@\" &\necho $! > " + farm_.path("child") + "\nwait\n");
  ASSERT_TRUE(wait_for([&] { return !farm_.read("child").empty(); }, 30)) << d.log();
  const int wrapper = children_of(d.pid)[0], renderer = atoi(farm_.read("child").c_str());
  ASSERT_TRUE(set_job_status(farm_, "spin", "aborted", host_)) << farm_.read("Render_Job_Control");
  ASSERT_TRUE(wait_for([&] { return kill(-wrapper, 0) != 0 && errno == ESRCH; }, 30, &d))
      << d.log();
  EXPECT_TRUE(process_gone(renderer));
  EXPECT_FALSE(rendered(6));  // the last frame was never reached
  EXPECT_EQ(job_status(farm_, "spin"), "aborted");
}

// The daemon holds its log, the access log and locked control files open: a
// render program must get none of them.  The listing's own directory shows
// as one more descriptor, so a clean start lists exactly 0 to 3.
TEST_F(RenderTest, RenderProgramsInheritOnlyTheirThreeStreams) {
  write_farm("", 1, 2, 2);
  Daemon& d =
      start("ls /proc/self/fd >> " + farm_.path("fds") + "\nexec " FRAME_PAINTER_PATH " \"$@\"\n");
  ASSERT_TRUE(job_finishes(farm_, d)) << d.log();
  EXPECT_EQ(farm_.read("fds"), "0\n1\n2\n3\n0\n1\n2\n3\n");
}

}  // namespace
