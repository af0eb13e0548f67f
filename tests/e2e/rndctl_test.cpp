// The command-line tool against a real control directory and a real daemon.
#if defined(RNDCTL_TOOL)
#include <signal.h>

#include <algorithm>
#include <map>
#include <nlohmann/json.hpp>
#include <set>

#include "tests/e2e/farm_hosts.h"
#include "tests/e2e/render_farm.h"

namespace {

// Runs the tool with `args` on the farm.  Probes of another host's daemon go
// through the farm's remote-shell shim.  Its stderr follows its stdout in `out`.
Ran rndctl(Farm& farm, const std::vector<std::string>& args) {
  std::vector<std::string> argv = {"env", "ZARNO_RSH=" + farm.path("../rsh_here"), RNDCTL_PATH,
                                   "-l", farm.dir()};
  argv.insert(argv.end(), args.begin(), args.end());
  Ran r = run_program(argv, farm.path("../tool"));
  r.out += r.err;
  return r;
}

// The tool's JSON answer to `args` (discarded, and a failure noted, when it
// does not succeed).
nlohmann::json tool_json(Farm& farm, const std::vector<std::string>& args) {
  Ran r = rndctl(farm, args);
  EXPECT_EQ(r.code(), 0) << r.out;
  return nlohmann::json::parse(r.out, nullptr, false);
}

class RndctlTest : public ::testing::Test {
 protected:
  void SetUp() override {
    farm_.write("Render_Resource_Control", resource_file({{host_}}));
    farm_.write("Render_Job_Control", job_file({}, scene_));
  }
  std::vector<std::string> submit(const std::string& name, const std::string& frames) {
    return {"submit",       scene_,          "--name", name,          "--frames", frames,
            "--executable", "frame_painter", "--pix",  "pix/" + name, "--hosts",  host_};
  }
  Farm farm_;
  std::string host_ = this_host_name(), scene_ = make_project(farm_);
};

// Submit, pause, resume, list, abort, delete (a restart has a test of its own, on two hosts).
TEST_F(RndctlTest, ASubmittedJobPausesResumesListsAbortsAndGoes) {
  Daemon& d = farm_.start_on_farm({}, "", render_env());
  // Four tasks of three frames for two processors: what was taken before
  // the pause may finish, but not the whole job.
  Ran r = rndctl(farm_, submit("spin", "1-12"));
  ASSERT_EQ(r.code(), 0) << r.out;
  EXPECT_EQ(r.out.substr(r.out.find(' ')), " spin\n");
  ASSERT_EQ(rndctl(farm_, {"pause", "spin"}).code(), 0);
  EXPECT_NE(job_block(farm_, "spin").find("ctrl\t\t= PAUSED;"), std::string::npos);
  for (int i = 0; i < 5; i++) d.wake(), usleep(100000);
  EXPECT_NE(job_status(farm_, "spin"), "finished");
  ASSERT_EQ(rndctl(farm_, {"resume", "spin"}).code(), 0);
  ASSERT_TRUE(job_finishes(farm_, d)) << d.log();
  nlohmann::json jobs = tool_json(farm_, {"jobs", "--json"});
  ASSERT_EQ(jobs.size(), 1u) << jobs;
  EXPECT_EQ(std::tuple(jobs[0]["name"], jobs[0]["state"], jobs[0]["doneframes"], jobs[0]["hosts"]),
            std::tuple("spin", "finished", 12, nlohmann::json{host_}));
  ASSERT_EQ(rndctl(farm_, {"abort", "spin"}).code(), 0);
  EXPECT_EQ(job_status(farm_, "spin"), "aborted");
  ASSERT_EQ(rndctl(farm_, {"delete", "spin"}).code(), 0);
  EXPECT_EQ(job_block(farm_, "spin"), "");
}

// Input the reader would not take back is refused before anything is written.
TEST_F(RndctlTest, RefusedInputLeavesBothFilesByteIdentical) {
  ASSERT_EQ(rndctl(farm_, submit("spin", "1-4")).code(), 0);
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
      {"host", "add", "12"}};
  for (const auto& args : refused) {
    Ran r = rndctl(farm_, args);
    EXPECT_EQ(r.code(), 1) << args[0] << " " << args[1] << ": " << r.out;
    EXPECT_EQ(count_of(r.out, "\n"), 1) << r.out;
  }
  EXPECT_EQ(rndctl(farm_, {"submit", "--nonsense"}).code(), 2);
  EXPECT_EQ(farm_.read("Render_Job_Control"), jobs);
  EXPECT_EQ(farm_.read("Render_Resource_Control"), devs);
}

TEST_F(RndctlTest, TheWatchViewDrawsAndQuitsCleanlyInTmux) {
  if (system("command -v tmux >/dev/null 2>&1") != 0) GTEST_SKIP() << "tmux is not installed";
  ASSERT_EQ(rndctl(farm_, submit("spin", "1-3")).code(), 0);
  std::string session = "rndctl_watch_" + std::to_string(getpid());
  auto tmux = [&](const std::string& args) { return system(("tmux " + args).c_str()); };
  ASSERT_EQ(0, tmux("new-session -d -s " + session + " -x 80 -y 24 \"" + RNDCTL_PATH + " -l '" +
                    farm_.dir() + "' watch --interval 100; echo WATCH_ENDED; sleep 30\""));
  std::string seen;
  auto shows = [&](const char* what) {
    seen = run_program({"tmux", "capture-pane", "-p", "-t", session}, farm_.path("../pane")).out;
    return seen.find(what) != std::string::npos;
  };
  bool drawn = wait_for([&] { return shows("[...."); }, 30);
  ASSERT_EQ(tmux("send-keys -t " + session + " q"), 0);
  bool ended = drawn && wait_for([&] { return shows("WATCH_ENDED"); }, 30);
  (void)tmux("kill-session -t " + session);
  ASSERT_TRUE(drawn && ended) << seen;
  // The view's own screen is gone: only the shell's line is left.
  EXPECT_EQ(seen.find("rndctl watch"), std::string::npos) << seen;
}

// Several daemons under host names of their own, one processor each, and
// one job of `frames` one-frame tasks for all of them rendered by the
// stamping render program, `sleep` seconds a frame.
class RndctlFarmTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!can_name_hosts()) GTEST_SKIP() << kCannotNameHosts;
  }
  void make_farm(const std::vector<std::string>& names, int frames, double sleep) {
    std::vector<ResourceSpec> resources;
    for (const auto& h : names) resources.push_back({h, int(resources.size()) + 1, 1, 1});
    farm_.write("Render_Resource_Control", resource_file(resources));
    JobSpec job{.end = static_cast<float>(frames), .hosts = names, .executable = "stamp_render"};
    job.opts = "sleep=" + std::to_string(sleep) + " stamp=" + stamps_;
    farm_.write("Render_Job_Control", job_file({job}, scene_));
    for (const auto& h : names) ASSERT_TRUE(hosts_.start(h)) << h;
  }
  std::vector<Stamp> stamps() const { return read_stamps(stamps_); }
  // Frames rendered by each host, of renders begun after `after_ns`.
  std::map<std::string, int> by_host(long long after_ns = 0) const {
    std::map<std::string, int> n;
    for (const Stamp& s : stamps())
      if (s.start_ns > after_ns) n[s.host]++;
    return n;
  }
  bool finished(double seconds) {
    return hosts_.wait_until([&] { return job_status(farm_, "spin") == "finished"; }, seconds);
  }
  // Ids of the tasks of `host` (of any host when empty) still taken or running.
  std::vector<int> active_on(const std::string& host = "") {
    std::vector<int> ids;
    nlohmann::json job = tool_json(farm_, {"show", "spin", "--json"});
    for (const auto& t : job["tasks"])
      if ((host.empty() || t["host"] == host) &&
          (t["status"] == "RUNNING" || t["status"] == "STARTED"))
        ids.push_back(t["id"]);
    return ids;
  }

  Farm farm_;
  FarmHosts hosts_{farm_, nullptr};
  std::string scene_ = make_project(farm_), stamps_ = farm_.path("../stamps");
};

TEST_F(RndctlFarmTest, AHostLockStopsNewWorkOnThatHostAtOnce) {
  make_farm({"lockA", "lockB"}, 30, 0.3);
  ASSERT_TRUE(hosts_.wait_until([&] { return by_host().size() == 2; }, 60));
  ASSERT_EQ(rndctl(farm_, {"host", "lock", "lockB"}).code(), 0);
  long long locked_ns = wall_ns();
  ASSERT_TRUE(finished(120)) << farm_.read("Render_Tasks");
  // The render running at the lock may end, and a pass already past its
  // reload may take one more; nothing after that.
  EXPECT_LE(by_host(locked_ns)["lockB"], 1);
}

TEST_F(RndctlFarmTest, CheckPutsADeadHostsTasksBackForTheOthers) {
  make_farm({"liveA", "deadB"}, 6, 2);
  ASSERT_TRUE(hosts_.wait_until([&] { return !active_on("deadB").empty(); }, 60));
  // Its power cut while it holds no lock: a dead host's lock holds everyone up for minutes.
  ASSERT_TRUE(stop_between_locks(farm_, *hosts_.daemon("deadB")));
  hosts_.power_cut("deadB");
  // Its task is still listed as held there, and its output stream stays there: the tool says so.
  std::vector<int> held = active_on("deadB");
  ASSERT_FALSE(held.empty()) << farm_.read("Render_Tasks");
  Ran log = rndctl(farm_, {"log", "spin", "--task", std::to_string(held[0])});
  EXPECT_NE(log.out.find("runs on deadB: its output stream is there, in deadB:"), log.out.npos)
      << log.out;
  EXPECT_EQ(tool_json(farm_, {"hosts", "--json"})[0]["alive"], true);
  EXPECT_EQ(tool_json(farm_, {"check", "--json"})["jobs_put_back"], 1);
  EXPECT_EQ(active_on("deadB"), std::vector<int>{}) << farm_.read("Render_Tasks");
  ASSERT_TRUE(finished(120)) << farm_.read("Render_Tasks");
  std::set<int> rendered;
  for (const Stamp& s : stamps()) rendered.insert(static_cast<int>(s.frame));
  EXPECT_EQ(rendered, (std::set<int>{1, 2, 3, 4, 5, 6}));
}

// A restart in mid-render stops the running tasks first; afterwards each
// frame is rendered once more, by either host, and only once.
TEST_F(RndctlFarmTest, RestartRendersEveryFrameExactlyOnceOnTwoHosts) {
  constexpr int kFrames = 12;
  make_farm({"againA", "againB"}, kFrames, 0.5);
  ASSERT_TRUE(hosts_.wait_until([&] { return stamps().size() >= 2; }, 60));
  ASSERT_EQ(rndctl(farm_, {"restart", "spin", "--timeout", "60"}).code(), 0);
  long long restarted_ns = wall_ns();
  ASSERT_TRUE(finished(120)) << farm_.read("Render_Tasks");
  // The restart returns once no render of the old life runs: every frame
  // that ends afterwards is of the new life (one may have begun just before
  // the tool returned), and a killed render leaves no stamp.
  std::map<int, int> again, once;
  for (const Stamp& s : stamps()) again[static_cast<int>(s.frame)] += s.end_ns >= restarted_ns;
  for (int f = 1; f <= kFrames; ++f) once[f] = 1;
  EXPECT_EQ(again, once);
  EXPECT_EQ(by_host(restarted_ns).size(), 2u);
}

}  // namespace
#endif
