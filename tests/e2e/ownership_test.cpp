// Who renders what: a restart while a host is stopped, and a job deleted while it renders.
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <sstream>

#include "tests/e2e/render_farm.h"

namespace {

bool group_gone(int pid) { return kill(-pid, 0) != 0 && errno == ESRCH; }

class Ownership : public testing::Test {
 protected:
  // Every render goes through this frame_painter: it logs "PID START END", then execs the real one.
  void SetUp() override {
    if (!can_name_hosts()) GTEST_SKIP() << kCannotNameHosts;
    farm_.write("Render_Resource_Control", resource_file({{"hostA", 1, 2, 1}, {"hostB", 2, 2, 1}}));
    farm_.write("frame_painter",
                "#!/bin/sh\ns=0 e=0\nfor a; do case $p in -s) s=$a;; -e) e=$a;; esac; p=$a; done\n"
                "echo $$ $s $e >> $0.log\nexec " FRAME_PAINTER_PATH " \"$@\"\n");
    chmod(farm_.path("frame_painter").c_str(), 0755);
    env_[0].insert(5, farm_.dir() + ":");  // after "PATH="
  }
  // Pids of the renders logged from byte `from` on; each marks its frames f at f - 1 of `frames`.
  std::vector<int> renders(size_t from = 0, std::string* frames = nullptr) {
    std::vector<int> pids;
    std::istringstream in(farm_.read("frame_painter.log").substr(from));
    float s, e;
    for (int pid; in >> pid >> s >> e; pids.push_back(pid))
      for (int f = int(s); frames != nullptr && f <= int(e); ++f) frames->at(f - 1) = '#';
    return pids;
  }
  int active_on(int dev) {
    int n = 0;
    for (const FileRec& r : task_records(farm_)) n += r.dev == dev && r.held();
    return n;
  }
  Farm farm_;
  std::vector<std::string> env_ = render_env();
};

TEST_F(Ownership, RestartWhileAHostIsStoppedRendersEveryFrameAgain) {
  farm_.write(
      "Render_Job_Control",
      job_file({{.end = 12, .opts = "slow=1", .hosts = {"hostA", "hostB"}}}, make_project(farm_)));
  Daemon& da = farm_.start_on_farm({}, "hostA", env_);
  Daemon& db = farm_.start_on_farm({}, "hostB", env_);
  ASSERT_TRUE(wait_for([&] { return active_on(1) > 0 && active_on(2) > 0; }, 120, &da))
      << da.log() << db.log();

  // hostA misses the whole restart window, stopped while it holds no lock: a stopped
  // holder would keep the editor (and hostB) waiting until the lock counts as stale.
  ASSERT_TRUE(stop_between_locks(farm_, da));
  const size_t restart_at = farm_.read("frame_painter.log").size();
  // A daemon writing back its own view of the job before it reads the edit undoes it: say it again.
  for (int attempt = 0;; ++attempt) {
    ASSERT_LT(attempt, 20) << db.log();
    ASSERT_TRUE(set_job_status(farm_, "spin", "restarted", "hostB"));
    if (wait_for([&] { return active_on(2) == 0; }, 10, &db)) break;
  }
  // The editor clears the group, then lets the job start again.
  ASSERT_TRUE(take_lock(farm_, "Render_Tasks", 200));
  farm_.write("Render_Tasks", "");
  drop_lock(farm_, "Render_Tasks");
  ASSERT_TRUE(set_job_status(farm_, "spin", "pending", "hostB"));
  ASSERT_EQ(kill(da.pid, SIGCONT), 0);
  utimensat(AT_FDCWD, farm_.path("hostA.pid").c_str(), nullptr, 0);

  ASSERT_TRUE(job_finishes(farm_, da, 240)) << da.log() << db.log();
  std::string rendered(12, '-');
  renders(restart_at, &rendered);
  EXPECT_EQ(rendered, std::string(12, '#'));  // every frame, since the restart
  for (int pid : renders()) EXPECT_TRUE(wait_for([&] { return group_gone(pid); }, 60)) << pid;
}

TEST_F(Ownership, JobDeletedWhileRenderingLeavesNothingRunningOrListed) {
  farm_.write("Render_Job_Control",
              job_file({{.opts = "slow=30", .hosts = {"hostA"}}}, make_project(farm_)));
  Daemon& da = farm_.start_on_farm({}, "hostA", env_);
  auto listed = [&] { return farm_.read("TSKSTAT/hostA").find("spin") != std::string::npos; };
  ASSERT_TRUE(wait_for([&] { return !renders().empty() && listed(); }, 120, &da)) << da.log();
  // The daemon rewrites the job's state as it renders: delete what is there.
  ASSERT_TRUE(wait_for(
      [&] { return edit_job_file(farm_, job_block(farm_, "spin") + "}\n", "", "hostA"); }, 60));
  EXPECT_TRUE(wait_for([&] { return group_gone(renders()[0]); }, 120, &da)) << da.log();
  EXPECT_TRUE(wait_for([&] { return !listed(); }, 120, &da))
      << farm_.read("TSKSTAT/hostA") << da.log();
  EXPECT_FALSE(da.ended());
}

}  // namespace
