// Rendering from end to end: the real daemon, real control files and the demo
// render program.
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include "tests/e2e/render_farm.h"

namespace {

bool exists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }

class RenderTest : public ::testing::Test {
 protected:
  void SetUp() override { scene_ = make_project(farm_); }
  // Writes the control files of one job "spin", frames 1 to `end`, on this
  // host, and starts the host's daemon.  A `wrapper` script, when given, runs
  // in place of the render program with the daemon's arguments.
  Daemon& start(int max_frames, int processors, float end, const std::string& opts = "",
                const std::string& wrapper = "") {
    farm_.write(
        "Render_Resource_Control",
        resource_file({{.name = host_, .max_frames = max_frames, .num_processors = processors}}));
    farm_.write("Render_Job_Control",
                job_file({{.end = end, .opts = opts, .hosts = {host_}}}, scene_));
    std::vector<std::string> env = render_env();
    if (!wrapper.empty()) {
      mkdir(farm_.path("wrapped").c_str(), 0777);
      farm_.write("wrapped/frame_painter", "#!/bin/sh\n" + wrapper);
      chmod(farm_.path("wrapped/frame_painter").c_str(), 0755);
      env[0] = "PATH=" + farm_.path("wrapped") + ":" + env[0].substr(5);
    }
    return farm_.start_on_farm({}, "", env);
  }
  // '#' for each of frames 1 to `last` whose image is there, '-' for each missing.
  std::string images(int last) {
    std::string out;
    for (int f = 1; f <= last; ++f)
      out += exists(farm_.path("project/pix/spin." + std::to_string(f))) ? '#' : '-';
    return out;
  }

  Farm farm_;
  std::string host_ = this_host_name();
  std::string scene_;
};

// The render program is a wrapper that runs the real renderer as its own
// child, as studio wrappers do: an abort must end both.
TEST_F(RenderTest, AnAbortedJobHasItsWholeRenderKilled) {
  Daemon& d = start(6, 1, 6, "slow=20",
                    FRAME_PAINTER_PATH " \"$@\" &\necho $! > " + farm_.path("child") + "\nwait\n");
  ASSERT_TRUE(wait_for([&] { return !farm_.read("child").empty(); }, 30)) << d.log();
  const int wrapper = children_of(d.pid)[0], renderer = atoi(farm_.read("child").c_str());
  ASSERT_TRUE(set_job_status(farm_, "spin", "aborted", host_)) << farm_.read("Render_Job_Control");
  ASSERT_TRUE(wait_for([&] { return kill(-wrapper, 0) != 0 && errno == ESRCH; }, 30, &d))
      << d.log();
  EXPECT_FALSE(exists("/proc/" + std::to_string(renderer)));
  EXPECT_EQ(images(6).back(), '-');  // the last frame was never reached
  EXPECT_EQ(job_status(farm_, "spin"), "aborted");
}

// The daemon holds its log, the access log and locked control files open: a
// render program must get none of them.  The listing's own directory shows
// as one more descriptor, so a clean start lists exactly 0 to 3.
TEST_F(RenderTest, RenderProgramsInheritOnlyTheirThreeStreams) {
  Daemon& d =
      start(1, 2, 2, "",
            "ls /proc/self/fd >> " + farm_.path("fds") + "\nexec " FRAME_PAINTER_PATH " \"$@\"\n");
  ASSERT_TRUE(job_finishes(farm_, d)) << d.log();
  EXPECT_EQ(farm_.read("fds"), "0\n1\n2\n3\n0\n1\n2\n3\n");
}

}  // namespace
