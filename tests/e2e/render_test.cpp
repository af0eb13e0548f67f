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
  void SetUp() override {
    host_ = this_host_name();
    scene_ = make_project(farm_);
  }
  // Writes both control files and starts this host's daemon.
  Daemon& start(const std::vector<ResourceSpec>& resources, const std::vector<JobSpec>& jobs,
                const std::vector<std::string>& wrapper_env = {}) {
    farm_.write("Render_Resource_Control", resource_file(resources));
    farm_.write("Render_Job_Control", job_file(jobs, scene_));
    std::vector<std::string> env = render_env();
    for (const auto& e : wrapper_env) env.push_back(e);
    return farm_.start_on_farm({}, "", env);
  }
  ResourceSpec here(int max_frames, int processors) {
    ResourceSpec r;
    r.name = host_;
    r.max_frames = max_frames;
    r.num_processors = processors;
    return r;
  }
  JobSpec job(const std::string& name, int index, float start, float end) {
    JobSpec j;
    j.name = name;
    j.index = index;
    j.start = start;
    j.end = end;
    j.hosts = {host_};
    return j;
  }
  bool status_becomes(Daemon& d, const std::string& job, const std::string& status,
                      double seconds = 120) {
    return wait_for([&] { return job_status(farm_, job) == status || d.ended(); }, seconds, &d) &&
           job_status(farm_, job) == status;
  }
  // PATH entry for a shell script named as the render program, that runs
  // `body` with the daemon's arguments.
  std::string wrapped(const std::string& body) {
    std::string dir = farm_.path("wrapped");
    mkdir(dir.c_str(), 0777);
    farm_.write("wrapped/frame_painter", "#!/bin/sh\n" + body);
    chmod((dir + "/frame_painter").c_str(), 0755);
    return "PATH=" + dir + ":" + render_env()[0].substr(5);
  }
  std::string image(const std::string& job, int frame) {
    char name[64];
    snprintf(name, sizeof name, "/project/pix/%s.%d", job.c_str(), frame);
    return farm_.dir() + name;
  }

  Farm farm_;
  std::string host_;
  std::string scene_;
};

TEST_F(RenderTest, AJobIsRenderedToFinished) {
  JobSpec spin = job("spin", 1, 1, 7);
  Daemon& d = start({here(3, 2)}, {spin});
  ASSERT_TRUE(status_becomes(d, "spin", "finished")) << d.log();

  for (int frame = 1; frame <= 7; ++frame) EXPECT_TRUE(exists(image("spin", frame))) << frame;
  EXPECT_FALSE(exists(image("spin", 8)));

  // The finished job's group has left the task file.
  EXPECT_EQ(farm_.read("Render_Tasks").find("spin"), std::string::npos)
      << farm_.read("Render_Tasks");
}

TEST_F(RenderTest, RenderProgramsEndingTogetherAreAllJudged) {
  JobSpec spin = job("spin", 1, 1, 4);
  spin.opts = "slow=1";
  Daemon& d = start({here(1, 2)}, {spin});
  // Two render programs at work; stop the daemon so that both end while it
  // cannot react, and their two SIGCHLDs arrive as one.
  ASSERT_TRUE(wait_for([&] { return children_of(d.pid).size() == 2; }, 30)) << d.log();
  kill(d.pid, SIGSTOP);
  int zombies = 0;
  bool both_ended = wait_for(
      [&] {
        children_of(d.pid, &zombies);
        return zombies == 2;
      },
      30);
  kill(d.pid, SIGCONT);
  ASSERT_TRUE(both_ended);
  ASSERT_TRUE(status_becomes(d, "spin", "finished")) << d.log();
  EXPECT_TRUE(children_of(d.pid).empty());
  EXPECT_EQ(count_of(d.log(), "UNKNOWN"), 0) << d.log();
  for (int frame = 1; frame <= 4; ++frame) EXPECT_TRUE(exists(image("spin", frame))) << frame;
}

// The render program is a wrapper that runs the real renderer as its own
// child, as studio wrappers do: an abort must end both.
TEST_F(RenderTest, AnAbortedJobHasItsWholeRenderKilled) {
  JobSpec spin = job("spin", 1, 1, 6);
  spin.opts = "slow=20";
  Daemon& d = start({here(6, 1)}, {spin},
                    {wrapped(std::string(FRAME_PAINTER_PATH) + " \"$@\" &\necho $! > " +
                             farm_.path("child") + "\nwait\n")});
  ASSERT_TRUE(wait_for([&] { return !farm_.read("child").empty(); }, 30)) << d.log();
  int wrapper = children_of(d.pid)[0];
  int renderer = atoi(farm_.read("child").c_str());
  ASSERT_TRUE(set_job_status(farm_, "spin", "aborted", host_)) << farm_.read("Render_Job_Control");
  ASSERT_TRUE(wait_for([&] { return kill(-wrapper, 0) != 0 && errno == ESRCH; }, 30, &d))
      << d.log();
  EXPECT_FALSE(exists("/proc/" + std::to_string(renderer)));
  EXPECT_FALSE(exists(image("spin", 6)));
  EXPECT_EQ(job_status(farm_, "spin"), "aborted");
}

// The daemon holds its log, the access log and locked control files open: a
// render program must get none of them.  The listing's own directory shows
// as one more descriptor, so a clean start lists exactly 0 to 3.
TEST_F(RenderTest, RenderProgramsInheritOnlyTheirThreeStreams) {
  JobSpec spin = job("spin", 1, 1, 2);
  Daemon& d = start({here(1, 2)}, {spin},
                    {wrapped("ls /proc/self/fd >> " + farm_.path("fds") + "\nexec " +
                             FRAME_PAINTER_PATH + " \"$@\"\n")});
  ASSERT_TRUE(status_becomes(d, "spin", "finished")) << d.log();
  EXPECT_EQ(farm_.read("fds"), "0\n1\n2\n3\n0\n1\n2\n3\n");
}

}  // namespace
