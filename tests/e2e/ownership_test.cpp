// Who renders what: a restart while a host is stopped, and a job deleted
// while it renders.  Every render goes through a stand-in program that notes
// its pid and frame range before it becomes the real render program.
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <map>
#include <sstream>

#include "tests/e2e/render_farm.h"

namespace {

struct Render {
  int pid, start, end;
};

// A render program named frame_painter, first on the daemons' path, that
// appends "PID START END" to renders.log and execs the real one.
std::vector<std::string> counting_env(Farm& farm) {
  std::string dir = farm.path("counting");
  mkdir(dir.c_str(), 0777);
  std::string real = FRAME_PAINTER_PATH;
  farm.write("counting/frame_painter",
             "#!/bin/sh\ns=0; e=0; prev=\nfor a in \"$@\"; do\n"
             "  case \"$prev\" in -s) s=$a;; -e) e=$a;; esac; prev=$a\ndone\n"
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
  int pid;
  float s, e;
  while (in >> pid >> s >> e) out.push_back({pid, static_cast<int>(s), static_cast<int>(e)});
  return out;
}

bool group_gone(int pid) { return kill(-pid, 0) != 0 && errno == ESRCH; }

int active_on(Farm& farm, int dev) {
  int n = 0;
  for (const FileRec& r : task_records(farm)) n += r.dev == dev && r.held();
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
  farm_.write("Render_Resource_Control", resource_file({{"hostA", 1, 2, 1}, {"hostB", 2, 2, 1}}));
  farm_.write("Render_Job_Control",
              job_file({{.end = 12, .opts = "slow=1", .hosts = {"hostA", "hostB"}}}, scene_));
  Daemon& da = farm_.start_on_farm({}, "hostA", env_);
  Daemon& db = farm_.start_on_farm({}, "hostB", env_);
  ASSERT_TRUE(
      wait_for([&] { return active_on(farm_, 1) > 0 && active_on(farm_, 2) > 0; }, 120, &da))
      << da.log() << db.log();

  // hostA misses the whole restart window, stopped while it holds no lock:
  // a stopped holder would keep the editor (and hostB) waiting until the lock
  // counts as stale.
  ASSERT_TRUE(wait_for(
      [&] {
        kill(da.pid, SIGSTOP);
        for (const std::string& name : dir_names(farm_.dir()))
          if (name.ends_with(".lock")) return kill(da.pid, SIGCONT), false;
        return true;
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
  ASSERT_TRUE(take_lock(farm_, "Render_Tasks", 200));
  farm_.write("Render_Tasks", "");
  drop_lock(farm_, "Render_Tasks");
  ASSERT_TRUE(set_job_status(farm_, "spin", "pending", "hostB"));
  ASSERT_EQ(kill(da.pid, SIGCONT), 0);
  utimensat(AT_FDCWD, farm_.path("hostA.pid").c_str(), nullptr, 0);

  ASSERT_TRUE(wait_for([&] { return job_status(farm_, "spin") == "finished"; }, 240, &da))
      << da.log() << db.log();
  std::map<int, int> counts;
  for (const Render& r : renders(farm_, restart_at))
    for (int f = r.start; f <= r.end; ++f) ++counts[f];
  for (int f = 1; f <= 12; ++f) EXPECT_GE(counts[f], 1) << "frame " << f << " not rendered";
  for (const Render& r : renders(farm_))
    EXPECT_TRUE(wait_for([&] { return group_gone(r.pid); }, 60)) << "render " << r.pid;
}

TEST_F(Ownership, JobDeletedWhileRenderingLeavesNothingRunningOrListed) {
  farm_.write("Render_Resource_Control", resource_file({{"hostA", 1, 2, 1}}));
  farm_.write("Render_Job_Control", job_file({{.opts = "slow=30", .hosts = {"hostA"}}}, scene_));
  Daemon& da = farm_.start_on_farm({}, "hostA", env_);
  ASSERT_TRUE(wait_for(
      [&] { return !renders(farm_).empty() && farm_.read("TSKSTAT/hostA").find("spin") == 0; }, 120,
      &da))
      << da.log();
  const int pid = renders(farm_)[0].pid;

  // The daemon rewrites the job's state as it renders: delete what is there.
  bool deleted = false;
  for (int attempt = 0; attempt < 100 && !deleted; ++attempt)
    deleted = edit_job_file(farm_, job_block(farm_, "spin") + "}\n", "", "hostA");
  ASSERT_TRUE(deleted);
  EXPECT_TRUE(wait_for([&] { return group_gone(pid); }, 120, &da)) << da.log();
  EXPECT_TRUE(wait_for(
      [&] { return farm_.read("TSKSTAT/hostA").find("spin") == std::string::npos; }, 120, &da))
      << farm_.read("TSKSTAT/hostA") << da.log();
  EXPECT_FALSE(da.ended());
  EXPECT_NE(da.log().find("Crash Alert - task->job is NULL"), std::string::npos);
}

}  // namespace
