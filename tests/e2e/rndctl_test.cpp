// The command-line tool against a real control directory and a real daemon.
#if defined(RNDCTL_TOOL)
#include <signal.h>

#include <map>
#include <nlohmann/json.hpp>

#include "tests/e2e/farm_hosts.h"
#include "tests/e2e/render_farm.h"

namespace {

struct ToolRun {
  int status = -1;
  std::string out;  // stdout, then stderr
};

// Runs the tool with `args` on the farm.  Probes of another host's daemon go
// through the farm's remote-shell shim.
ToolRun rndctl(Farm& farm, const std::vector<std::string>& args) {
  std::vector<std::string> argv = {"env", "ZARNO_RSH=" + farm.path("../rsh_here"), RNDCTL_PATH,
                                   "-l", farm.dir()};
  argv.insert(argv.end(), args.begin(), args.end());
  Ran r = run_program(argv, farm.path("../tool"));
  return {r.code(), r.out + r.err};
}

class RndctlTest : public ::testing::Test {
 protected:
  void SetUp() override {
    host_ = this_host_name();
    scene_ = make_project(farm_);
    farm_.write("Render_Resource_Control", resource_file({{host_}}));
    farm_.write("Render_Job_Control", job_file({}, scene_));
  }
  std::vector<std::string> submit(const std::string& name, const std::string& frames) {
    return {"submit",       scene_,          "--name", name,          "--frames", frames,
            "--executable", "frame_painter", "--pix",  "pix/" + name, "--hosts",  host_};
  }
  Farm farm_;
  std::string host_, scene_;
};

TEST_F(RndctlTest, ASubmittedJobRendersToFinishedAndListsAsJson) {
  Daemon& d = farm_.start_on_farm({}, "", render_env());
  ToolRun r = rndctl(farm_, submit("spin", "1-4"));
  ASSERT_EQ(r.status, 0) << r.out;
  EXPECT_EQ(r.out.substr(r.out.find(' ')), " spin\n");
  ASSERT_TRUE(wait_for([&] { return job_status(farm_, "spin") == "finished"; }, 120, &d))
      << d.log();
  ToolRun j = rndctl(farm_, {"jobs", "--json"});
  ASSERT_EQ(j.status, 0) << j.out;
  nlohmann::json jobs = nlohmann::json::parse(j.out);
  ASSERT_EQ(jobs.size(), 1u);
  EXPECT_EQ(std::tuple(jobs[0]["name"], jobs[0]["state"], jobs[0]["doneframes"], jobs[0]["hosts"]),
            std::tuple("spin", "finished", 4, nlohmann::json{host_}));
  ToolRun h = rndctl(farm_, {"hosts", "--json"});
  EXPECT_EQ(nlohmann::json::parse(h.out)[0]["alive"], true) << h.out;
}

// Input the reader would not take back is refused before anything is written.
TEST_F(RndctlTest, RefusedInputLeavesBothFilesByteIdentical) {
  ASSERT_EQ(rndctl(farm_, submit("spin", "1-4")).status, 0);
  std::string jobs = farm_.read("Render_Job_Control"), devs = farm_.read("Render_Resource_Control");
  const std::vector<std::vector<std::string>> refused = {
      submit("two words", "1-4"),
      submit("spin2", "4-1"),
      {"submit", scene_, "--name", "x", "--hosts", "nohost"},
      {"submit", scene_, "--name", "x", "--pix", "a\"b"},
      {"submit", scene_, "--name", "x", "--schedule", "800-1700 Friday-Monday"},
      {"submit", farm_.path("missing.sdl"), "--name", "x"},
      submit("spin", "1-2"),  // a second job of one name
      {"pause", "nojob"},
      {"host", "lock", "nohost"},
      {"host", "schedule", host_, "815-900 Mon"},
      {"host", "add", "12"},
  };
  for (const auto& args : refused) {
    ToolRun r = rndctl(farm_, args);
    EXPECT_EQ(r.status, 1) << args[0] << " " << args[1] << ": " << r.out;
    EXPECT_EQ(count_of(r.out, "\n"), 1) << r.out;
  }
  EXPECT_EQ(rndctl(farm_, {"submit", "--nonsense"}).status, 2);
  EXPECT_EQ(farm_.read("Render_Job_Control"), jobs);
  EXPECT_EQ(farm_.read("Render_Resource_Control"), devs);
}

TEST_F(RndctlTest, PauseHoldsNewTasksAndResumeLetsThemRun) {
  Daemon& d = farm_.start_on_farm({}, "", render_env());
  // Four tasks of three frames for two processors: what was taken before
  // the pause may finish, but not the whole job.
  ASSERT_EQ(rndctl(farm_, submit("spin", "1-12")).status, 0);
  ASSERT_EQ(rndctl(farm_, {"pause", "spin"}).status, 0);
  EXPECT_NE(job_block(farm_, "spin").find("ctrl\t\t= PAUSED;"), std::string::npos);
  for (int i = 0; i < 5; i++) {
    d.wake();
    usleep(100000);
  }
  EXPECT_NE(job_status(farm_, "spin"), "finished");
  ASSERT_EQ(rndctl(farm_, {"resume", "spin"}).status, 0);
  ASSERT_TRUE(wait_for([&] { return job_status(farm_, "spin") == "finished"; }, 120, &d))
      << d.log();
}

TEST_F(RndctlTest, RestartRendersEveryFrameAgain) {
  Daemon& d = farm_.start_on_farm({}, "", render_env());
  ASSERT_EQ(rndctl(farm_, submit("spin", "1-3")).status, 0);
  ASSERT_TRUE(wait_for([&] { return job_status(farm_, "spin") == "finished"; }, 120, &d))
      << d.log();
  std::string image = farm_.path("project/pix/spin.1");
  ASSERT_EQ(unlink(image.c_str()), 0);
  ToolRun r = rndctl(farm_, {"restart", "spin", "--timeout", "60"});
  ASSERT_EQ(r.status, 0) << r.out;
  ASSERT_TRUE(wait_for([&] { return job_status(farm_, "spin") == "finished"; }, 120, &d))
      << d.log();
  EXPECT_EQ(access(image.c_str(), F_OK), 0);
  ASSERT_EQ(rndctl(farm_, {"delete", "spin"}).status, 0);
  EXPECT_EQ(job_block(farm_, "spin"), "");
}

TEST_F(RndctlTest, TheWatchViewDrawsAndQuitsCleanlyInTmux) {
  if (system("command -v tmux >/dev/null 2>&1") != 0) GTEST_SKIP() << "tmux is not installed";
  ASSERT_EQ(rndctl(farm_, submit("spin", "1-3")).status, 0);
  std::string session = "rndctl_watch_" + std::to_string(getpid());
  std::string cmd = "tmux new-session -d -s " + session + " -x 80 -y 24 \"" + RNDCTL_PATH +
                    " -l '" + farm_.dir() + "' watch --interval 100; echo WATCH_ENDED; sleep 30\"";
  ASSERT_EQ(system(cmd.c_str()), 0);
  auto pane = [&] {
    return run_program({"tmux", "capture-pane", "-p", "-t", session}, farm_.path("../pane")).out;
  };
  bool drawn = wait_for([&] { return pane().find("spin") != std::string::npos; }, 30);
  std::string seen = pane();
  ASSERT_EQ(system(("tmux send-keys -t " + session + " q").c_str()), 0);
  bool ended = wait_for([&] { return pane().find("WATCH_ENDED") != std::string::npos; }, 30);
  std::string after = pane();
  (void)system(("tmux kill-session -t " + session).c_str());
  ASSERT_TRUE(drawn) << seen;
  EXPECT_NE(seen.find("[...."), std::string::npos) << seen;
  ASSERT_TRUE(ended) << after;
  // The view's own screen is gone: only the shell's line is left.
  EXPECT_EQ(after.find("rndctl watch"), std::string::npos) << after;
}

// Several daemons under host names of their own, one processor each, and
// one job of `frames` one-frame tasks for all of them rendered by the
// stamping render program, `sleep` seconds a frame.
class RndctlFarmTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!can_name_hosts())
      GTEST_SKIP() << "needs root or user namespaces: daemons run under other host names";
    scene_ = make_project(farm_);
    stamps_ = farm_.path("../stamps");
  }
  void make_farm(const std::vector<std::string>& names, int frames, double sleep) {
    std::vector<ResourceSpec> resources;
    for (size_t i = 0; i < names.size(); ++i)
      resources.push_back({names[i], static_cast<int>(i) + 1, 1, 1});
    farm_.write("Render_Resource_Control", resource_file(resources));
    farm_.write("Render_Job_Control",
                job_file({{.end = static_cast<float>(frames),
                           .opts = "sleep=" + std::to_string(sleep) + " stamp=" + stamps_,
                           .hosts = names,
                           .executable = "stamp_render"}},
                         scene_));
    for (const auto& h : names) ASSERT_TRUE(hosts_.start(h)) << h;
  }
  std::vector<Stamp> stamps() const { return read_stamps(stamps_); }
  // Cuts `host`'s power at a moment its daemon holds no lock of the control
  // directory: a dead host's lock holds everyone else up for minutes.
  bool power_cut_between_locks(const std::string& host) {
    for (int tries = 0; tries < 500; ++tries) {
      Daemon* daemon = hosts_.daemon(host);
      if (daemon == nullptr) return false;
      kill(daemon->pid, SIGSTOP);
      bool holds = false;
      for (const std::string& n : dir_names(farm_.dir()))
        holds |= n.ends_with(".lock") && access(farm_.path(n + "/" + host).c_str(), F_OK) == 0;
      if (!holds) {
        hosts_.power_cut(host);
        return true;
      }
      kill(daemon->pid, SIGCONT);
      usleep(20000);
    }
    return false;
  }
  bool finished(double seconds) {
    return hosts_.wait_until([&] { return job_status(farm_, "spin") == "finished"; }, seconds);
  }
  // Task records of `host` still taken or running.
  int active_on(const std::string& host) {
    ToolRun r = rndctl(farm_, {"show", "spin", "--json"});
    if (r.status != 0) return -1;
    int n = 0;
    nlohmann::json job = nlohmann::json::parse(r.out);
    for (const auto& t : job["tasks"])
      if (t["host"] == host && (t["status"] == "RUNNING" || t["status"] == "STARTED")) n++;
    return n;
  }

  Farm farm_;
  FarmHosts hosts_{farm_, nullptr};
  std::string scene_, stamps_;
};

TEST_F(RndctlFarmTest, AHostLockStopsNewWorkOnThatHostAtOnce) {
  make_farm({"lockA", "lockB"}, 30, 0.3);
  ASSERT_TRUE(hosts_.wait_until(
      [&] {
        std::map<std::string, int> by_host;
        for (const Stamp& s : stamps()) by_host[s.host]++;
        return by_host["lockA"] > 0 && by_host["lockB"] > 0;
      },
      60));
  ToolRun r = rndctl(farm_, {"host", "lock", "lockB"});
  ASSERT_EQ(r.status, 0) << r.out;
  long long locked_ns = wall_ns();
  ASSERT_TRUE(finished(120)) << farm_.read("Render_Tasks");
  // The render running at the lock may end, and a pass already past its
  // reload may take one more; nothing after that.
  int late = 0;
  for (const Stamp& s : stamps())
    if (s.host == "lockB" && s.start_ns > locked_ns) late++;
  EXPECT_LE(late, 1);
  ToolRun h = rndctl(farm_, {"hosts", "--json"});
  ASSERT_EQ(h.status, 0) << h.out;
  EXPECT_EQ(nlohmann::json::parse(h.out)[1]["lock"], "LOCKED");
  EXPECT_EQ(nlohmann::json::parse(h.out)[1]["locked_now"], true);
}

TEST_F(RndctlFarmTest, CheckPutsADeadHostsTasksBackForTheOthers) {
  make_farm({"liveA", "deadB"}, 6, 2);
  ASSERT_TRUE(hosts_.wait_until([&] { return active_on("deadB") > 0; }, 60));
  ASSERT_TRUE(power_cut_between_locks("deadB"));
  ToolRun h = rndctl(farm_, {"hosts", "--json"});
  ASSERT_EQ(h.status, 0) << h.out;
  EXPECT_EQ(nlohmann::json::parse(h.out)[0]["alive"], true) << h.out;
  ToolRun r = rndctl(farm_, {"check", "--json"});
  ASSERT_EQ(r.status, 0) << r.out;
  EXPECT_EQ(nlohmann::json::parse(r.out)["jobs_put_back"], 1) << r.out;
  EXPECT_EQ(active_on("deadB"), 0) << farm_.read("Render_Tasks");
  ASSERT_TRUE(finished(120)) << farm_.read("Render_Tasks");
  std::map<int, int> rendered;
  for (const Stamp& s : stamps()) rendered[static_cast<int>(s.frame)]++;
  for (int f = 1; f <= 6; ++f) EXPECT_GE(rendered[f], 1) << "frame " << f;
}

TEST_F(RndctlFarmTest, AbortKillsTheRunningRender) {
  make_farm({"abortA"}, 3, 120);
  ASSERT_TRUE(hosts_.wait_until([&] { return !hosts_.renders_left().empty(); }, 60));
  // The render's output stream stays on its host: the tool says where.
  int id = -1;
  ToolRun show = rndctl(farm_, {"show", "spin", "--json"});
  ASSERT_EQ(show.status, 0) << show.out;
  nlohmann::json job = nlohmann::json::parse(show.out);
  for (const auto& t : job["tasks"])
    if (t["status"] == "RUNNING" || t["status"] == "STARTED") id = t["id"];
  ToolRun log = rndctl(farm_, {"log", "spin", "--task", std::to_string(id)});
  EXPECT_EQ(log.status, 0) << log.out;
  EXPECT_NE(log.out.find("runs on abortA: its output stream is there, in abortA:"),
            std::string::npos)
      << log.out;
  ToolRun r = rndctl(farm_, {"abort", "spin"});
  ASSERT_EQ(r.status, 0) << r.out;
  EXPECT_TRUE(hosts_.wait_until([&] { return hosts_.renders_left().empty(); }, 60))
      << hosts_.daemon("abortA")->log();
  EXPECT_EQ(job_status(farm_, "spin"), "aborted");
  EXPECT_TRUE(stamps().empty());
}

// A restart in mid-render stops the running tasks first; afterwards each
// frame is rendered once more, by either host, and only once.
TEST_F(RndctlFarmTest, RestartRendersEveryFrameExactlyOnceOnTwoHosts) {
  constexpr int kFrames = 12;
  make_farm({"againA", "againB"}, kFrames, 0.5);
  ASSERT_TRUE(hosts_.wait_until([&] { return stamps().size() >= 2; }, 60));
  ToolRun r = rndctl(farm_, {"restart", "spin", "--timeout", "60"});
  ASSERT_EQ(r.status, 0) << r.out;
  long long restarted_ns = wall_ns();
  ASSERT_TRUE(finished(120)) << farm_.read("Render_Tasks");
  // The restart returns once no render of the old life runs: every frame
  // that ends afterwards is of the new life (one may have begun just before
  // the tool returned), and a killed render leaves no stamp.
  std::map<int, int> again;
  std::map<std::string, int> by_host;
  for (const Stamp& s : stamps()) {
    if (s.end_ns < restarted_ns) continue;
    again[static_cast<int>(s.frame)]++;
    by_host[s.host]++;
  }
  for (int f = 1; f <= kFrames; ++f) EXPECT_EQ(again[f], 1) << "frame " << f;
  EXPECT_EQ(again.size(), static_cast<size_t>(kFrames));
  EXPECT_TRUE(by_host["againA"] > 0 && by_host["againB"] > 0);
}

}  // namespace
#endif
