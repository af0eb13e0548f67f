// Who renders what: a restart while a host is stopped, and a job deleted
// while it renders.  Every render goes
// through a stand-in program that notes its pid and frame range before it
// becomes the real render program, so that renders can be counted.
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <map>
#include <sstream>

#include "tests/e2e/render_farm.h"

namespace {

struct Render {
  int pid;
  int start, end;
};

// A render program named frame_painter, first on the daemons' path, that
// appends "PID START END" to renders.log and execs the real one.
std::vector<std::string> counting_env(Farm& farm) {
  std::string dir = farm.path("counting");
  mkdir(dir.c_str(), 0777);
  std::string real = FRAME_PAINTER_PATH;
  farm.write("counting/frame_painter",
             "#!/bin/sh\n"
             "s=0; e=0; prev=\n"
             "for a in \"$@\"; do\n"
             "  case \"$prev\" in -s) s=$a;; -e) e=$a;; esac\n"
             "  prev=$a\n"
             "done\n"
             "echo \"$$ $s $e\" >> " +
                 farm.path("renders.log") + "\nexec " + real + " \"$@\"\n");
  chmod(dir.c_str(), 0777);
  chmod((dir + "/frame_painter").c_str(), 0755);
  std::vector<std::string> env = render_env();
  env[0] = "PATH=" + dir + ":" + env[0].substr(5);
  return env;
}

std::vector<Render> renders(Farm& farm, size_t from = 0) {
  std::vector<Render> out;
  std::istringstream in(farm.read("renders.log").substr(from));
  Render r;
  float s, e;
  while (in >> r.pid >> s >> e) {
    r.start = static_cast<int>(s);
    r.end = static_cast<int>(e);
    out.push_back(r);
  }
  return out;
}

// How many times each frame was rendered.
std::map<int, int> frame_counts(const std::vector<Render>& list) {
  std::map<int, int> counts;
  for (const Render& r : list) {
    for (int f = r.start; f <= r.end; ++f) ++counts[f];
  }
  return counts;
}

bool group_gone(int pid) { return kill(-pid, 0) != 0 && errno == ESRCH; }

// Render_Tasks records of resource `dev` that are STARTED or RUNNING.
int active_on(Farm& farm, int dev) {
  std::istringstream in(farm.read("Render_Tasks"));
  std::string line;
  int n = 0;
  while (std::getline(in, line)) {
    int id, d, retries;
    float s, e, c;
    char status[32];
    if (line.empty() || line[0] != '\t') continue;
    if (sscanf(line.c_str(), "%d %f %f %f %d %d %31s", &id, &s, &e, &c, &d, &retries, status) ==
            7 &&
        d == dev && (std::string(status) == "STARTED" || std::string(status) == "RUNNING")) {
      ++n;
    }
  }
  return n;
}

class Ownership : public testing::Test {
 protected:
  void SetUp() override {
    if (!can_name_hosts())
      GTEST_SKIP() << "needs root or user namespaces: daemons run under other host names";
    scene_ = make_project(farm_);
    env_ = counting_env(farm_);
  }
  Farm farm_;
  std::string scene_;
  std::vector<std::string> env_;
};

TEST_F(Ownership, RestartWhileAHostIsStoppedRendersEveryFrameAgain) {
  farm_.write("Render_Resource_Control",
              resource_file({ResourceSpec{"hostA", 1, 2, 1, "AVAILABLE", ""},
                             ResourceSpec{"hostB", 2, 2, 1, "AVAILABLE", ""}}));
  JobSpec spin;
  spin.end = 12;
  spin.opts = "slow=1";
  spin.hosts = {"hostA", "hostB"};
  farm_.write("Render_Job_Control", job_file({spin}, scene_));
  Daemon& da = farm_.start_on_farm({}, "hostA", env_);
  Daemon& db = farm_.start_on_farm({}, "hostB", env_);
  ASSERT_TRUE(
      wait_for([&] { return active_on(farm_, 1) > 0 && active_on(farm_, 2) > 0; }, 120, &da))
      << da.log() << db.log();

  // hostA misses the whole restart window.
  // Stopped while it holds no lock: a stopped holder would keep the editor
  // (and hostB) waiting until the lock counts as stale.
  auto any_lock = [&] {
    for (const char* f : {"Render_Tasks", "Render_Job_Control", "Render_Resource_Control"}) {
      if (access(farm_.path(std::string(f) + ".lock").c_str(), F_OK) == 0) return true;
    }
    return false;
  };
  ASSERT_TRUE(wait_for(
      [&] {
        kill(da.pid, SIGSTOP);
        if (!any_lock()) return true;
        kill(da.pid, SIGCONT);
        return false;
      },
      60));
  const size_t restart_at = farm_.read("renders.log").size();
  // A daemon that writes its own view of the job back before it has read
  // the edit undoes it; the editor says it again until hostB has stopped.
  bool stopped = false;
  for (int attempt = 0; attempt < 20 && !stopped; ++attempt) {
    ASSERT_TRUE(set_job_status(farm_, "spin", "restarted", "hostB"));
    stopped = wait_for([&] { return active_on(farm_, 2) == 0; }, 10, &db);
  }
  ASSERT_TRUE(stopped) << db.log();
  // The editor clears the group, then lets the job start again.
  std::string lock = farm_.path("Render_Tasks.lock");
  ASSERT_TRUE(wait_for([&] { return mkdir(lock.c_str(), 0777) == 0; }, 200));
  farm_.write("Render_Tasks", "");
  rmdir(lock.c_str());
  ASSERT_TRUE(set_job_status(farm_, "spin", "pending", "hostB"));
  ASSERT_EQ(kill(da.pid, SIGCONT), 0);
  utimensat(AT_FDCWD, farm_.path("hostA.pid").c_str(), nullptr, 0);

  ASSERT_TRUE(wait_for([&] { return job_status(farm_, "spin") == "finished"; }, 240, &da))
      << da.log() << db.log();
  std::map<int, int> counts = frame_counts(renders(farm_, restart_at));
  for (int f = 1; f <= 12; ++f) EXPECT_GE(counts[f], 1) << "frame " << f << " not rendered";
  for (const Render& r : renders(farm_)) {
    EXPECT_TRUE(wait_for([&] { return group_gone(r.pid); }, 60)) << "render " << r.pid;
  }
}

TEST_F(Ownership, JobDeletedWhileRenderingLeavesNothingRunningOrListed) {
  farm_.write("Render_Resource_Control",
              resource_file({ResourceSpec{"hostA", 1, 2, 1, "AVAILABLE", ""}}));
  JobSpec spin;
  spin.opts = "slow=30";
  spin.hosts = {"hostA"};
  farm_.write("Render_Job_Control", job_file({spin}, scene_));
  Daemon& da = farm_.start_on_farm({}, "hostA", env_);
  ASSERT_TRUE(wait_for(
      [&] { return !renders(farm_).empty() && farm_.read("TSKSTAT/hostA").find("spin") == 0; }, 120,
      &da))
      << da.log();
  const int pid = renders(farm_)[0].pid;

  // The daemon rewrites the job's state as it renders: delete what is there.
  bool deleted = false;
  for (int attempt = 0; attempt < 100 && !deleted; ++attempt) {
    deleted = edit_job_file(farm_, job_block(farm_, "spin") + "}\n", "", "hostA");
  }
  ASSERT_TRUE(deleted);
  EXPECT_TRUE(wait_for([&] { return group_gone(pid); }, 120, &da)) << da.log();
  EXPECT_TRUE(wait_for(
      [&] { return farm_.read("TSKSTAT/hostA").find("spin") == std::string::npos; }, 120, &da))
      << farm_.read("TSKSTAT/hostA") << da.log();
  EXPECT_FALSE(da.ended());
  if (HasFailure()) return;
  std::string log = da.log();
  EXPECT_NE(log.find("Crash Alert - task->job is NULL"), std::string::npos);
}

}  // namespace
