// The farm under faults: four hosts render two jobs while daemons are killed,
// hosts lose power, a daemon is frozen for a while and a job is restarted by
// an editor.  Whatever happens, each job must end "finished" with every frame
// rendered since its last restart, a frame rendered twice only where a host
// that died had it in flight, no lock directory and no render left, and no
// wait on a lock that a host which came back had left behind.
//
// CI runs one fixed seed.  CHAOS_SEEDS="1,2,3,..." runs a sweep by hand.
#include <signal.h>

#include <algorithm>
#include <chrono>
#include <map>
#include <random>
#include <regex>
#include <sstream>
#include <thread>

#include "tests/e2e/farm_hosts.h"
#include "tests/e2e/render_farm.h"

namespace {

constexpr double kFrameSeconds = 0.2;
constexpr int kFrames = 40;
constexpr double kRunBound = 150;  // a wait on a 181-second lock shows up here

enum class Fault { kKillDaemon, kPowerCut, kFreeze, kRestartJob };
const char* const kFaultNames[] = {"kill -9", "power cut", "SIGSTOP", "restart job"};

struct Event {
  Fault fault;
  std::string target;   // host, or job for a restart
  double before, down;  // seconds of work before the fault; the host stays down or frozen
  long long at_ns = 0;
  long long back_ns() const { return at_ns + static_cast<long long>(down * 1e9); }
  bool kills() const { return fault == Fault::kKillDaemon || fault == Fault::kPowerCut; }
};

// Every kind of fault at least once, then a few more, in a seeded order.
std::vector<Event> plan(unsigned seed, const std::vector<std::string>& hosts,
                        const std::vector<std::string>& jobs) {
  std::mt19937 rng(seed);
  auto uniform = [&](double lo, double hi) { return std::uniform_real_distribution(lo, hi)(rng); };
  std::vector<Fault> faults = {Fault::kKillDaemon, Fault::kPowerCut,   Fault::kFreeze,
                               Fault::kRestartJob, Fault::kKillDaemon, Fault::kPowerCut};
  std::shuffle(faults.begin(), faults.end(), rng);
  std::vector<Event> events;
  for (Fault f : faults) {
    const auto& from = f == Fault::kRestartJob ? jobs : hosts;
    std::string target = from[std::uniform_int_distribution<size_t>(0, from.size() - 1)(rng)];
    double before = uniform(0.3, 1.5), down = uniform(0.3, 2.5);
    events.push_back({f, target, before, f == Fault::kFreeze ? uniform(2, 4) : down});
  }
  return events;
}

// The task file without the group of `job`; `active` tells whether a record
// of that group is STARTED or RUNNING.
std::string without_group(const std::string& tasks, const std::string& job, bool* active) {
  std::istringstream in(tasks);
  std::string line, out;
  bool inside = false;
  *active = false;
  while (std::getline(in, line)) {
    if (!line.empty() && line[0] != '\t') inside = line.rfind(job + "\t", 0) == 0;
    if (!inside) out += line + "\n";
    *active |= inside && (line.find("STARTED") != std::string::npos ||
                          line.find("RUNNING") != std::string::npos);
  }
  return out;
}

// An editor's restart of a job: "restarted" until no task of it is in
// flight, then its task group removed and the job pending from frame one.
// Returns the time from which its frames count again, or 0.
long long restart_job(FarmHosts& hosts, Farm& farm, const std::string& job, std::string* trouble) {
  bool active = true;
  auto fail = [&](const std::string& why) { return *trouble = why, 0LL; };
  if (!set_job_status(farm, job, "restarted", "chaos0"))
    return fail("the job file's lock was never free");
  hosts.touch_pid_files();
  if (!hosts.wait_until(
          [&] { return (void)without_group(farm.read("Render_Tasks"), job, &active), !active; },
          30))
    return fail("tasks still in flight 30 s after the restart:\n" + farm.read("Render_Tasks"));
  if (!take_lock(farm, "Render_Job_Control")) return fail("the job file's lock was never free");
  if (!take_lock(farm, "Render_Tasks"))
    return drop_lock(farm, "Render_Job_Control"), fail("the task file's lock was never free");
  farm.write("Render_Tasks", without_group(farm.read("Render_Tasks"), job, &active));
  std::string block = job_block(farm, job), text = farm.read("Render_Job_Control");
  std::string fresh =
      std::regex_replace(block, std::regex("(status\\s*= )\"[^\"]*\""), "$1\"pending\"");
  fresh = std::regex_replace(fresh, std::regex("(doneframes\\s*=)\\s*[0-9]+"), "$1 0");
  text.replace(text.find(block), block.size(), fresh);
  farm.write("Render_Job_Control", text);
  drop_lock(farm, "Render_Tasks");
  drop_lock(farm, "Render_Job_Control");
  long long from = wall_ns();
  hosts.touch_pid_files();
  return from;
}

// Whether a second rendering of a frame is excused: some host died while it
// had the frame's task in flight.  A render is in flight until its daemon has
// seen it end; a daemon stopped when the render ended sees that only once
// continued.
bool excused(const std::vector<Stamp>& stamps, const std::vector<Event>& events,
             std::map<std::string, int>& max_frames) {
  // A render forked just before the kill stamps its start a moment after.
  const long long spawn_slack = 100000000;
  for (const Stamp& s : stamps) {
    long long window = static_cast<long long>((max_frames[s.host] * kFrameSeconds + 1.0) * 1e9);
    long long seen_end = s.end_ns;
    for (const Event& e : events)
      if (e.fault == Fault::kFreeze && e.target == s.host && e.at_ns <= s.end_ns &&
          s.end_ns <= e.back_ns())
        seen_end = e.back_ns();
    for (const Event& e : events)
      if (e.kills() && e.target == s.host && s.start_ns <= e.at_ns + spawn_slack &&
          seen_end >= e.at_ns - window)
        return true;
  }
  return false;
}

void run(unsigned seed, const SshServer* ssh) {
  SCOPED_TRACE("seed " + std::to_string(seed));
  Farm farm;
  std::string scene = make_project(farm);
  FarmHosts hosts(farm, ssh);
  std::vector<std::string> names = {"chaos0", "chaos1", "chaos2", "chaos3"};
  std::vector<std::string> job_names = {"alpha", "beta"};
  std::map<std::string, int> max_frames;
  std::vector<ResourceSpec> resources;
  for (int i = 0; i < 4; ++i)
    resources.push_back({names[i], i + 1, max_frames[names[i]] = 1 + i % 2, i == 0 ? 2 : 1});
  std::vector<JobSpec> jobs;
  for (const std::string& j : job_names) {
    jobs.push_back({.name = j, .index = int(jobs.size()) + 1, .end = kFrames, .hosts = names});
    jobs.back().opts =
        "sleep=" + std::to_string(kFrameSeconds) + " stamp=" + farm.path("../stamps." + j);
    jobs.back().executable = "stamp_render";
  }
  farm.write("Render_Resource_Control", resource_file(resources));
  farm.write("Render_Job_Control", job_file(jobs, scene));

  auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(int(kRunBound));
  long long begun_ns = wall_ns();
  auto ms = [&](long long ns) { return std::to_string((ns - begun_ns) / 1000000) + " ms"; };
  for (const auto& h : names)
    ASSERT_TRUE(hosts.start(h)) << h << " did not start:\n"
                                << read_text_file(hosts.daemon(h)->tmpdir + "/early")
                                << hosts.daemon(h)->log();

  std::vector<Event> events = plan(seed, names, job_names);
  std::map<std::string, long long> counts_from = {{"alpha", begun_ns}, {"beta", begun_ns}};
  std::ostringstream story;
  for (Event& e : events) {
    hosts.wait_until([] { return false; }, e.before);
    e.at_ns = wall_ns();
    story << "  " << ms(e.at_ns) << ": " << kFaultNames[int(e.fault)] << " " << e.target << " ("
          << e.down << " s)\n";
    Daemon* d = e.fault == Fault::kRestartJob ? nullptr : hosts.daemon(e.target);
    if (e.fault == Fault::kKillDaemon) {
      // The daemon alone: its renders run on, orphaned.
      if (!d->ended()) kill(d->pid, SIGKILL);
      wait_for([&] { return d->ended(); }, 10);
    } else if (e.fault == Fault::kPowerCut) {
      hosts.power_cut(e.target);
    } else if (e.fault == Fault::kFreeze && !d->ended()) {
      kill(d->pid, SIGSTOP);
      std::this_thread::sleep_for(std::chrono::duration<double>(e.down));
      kill(d->pid, SIGCONT);
    } else if (e.fault == Fault::kRestartJob) {
      std::string trouble;
      long long from = restart_job(hosts, farm, e.target, &trouble);
      EXPECT_NE(from, 0) << "restart of " << e.target << ": " << trouble;
      counts_from[e.target] = from != 0 ? from : wall_ns();
    }
    if (e.kills()) {
      hosts.wait_until([] { return false; }, e.down);
      EXPECT_TRUE(hosts.start(e.target)) << e.target << " did not start again";
    }
  }
  SCOPED_TRACE("faults:\n" + story.str());

  double left = std::chrono::duration<double>(deadline - std::chrono::steady_clock::now()).count();
  auto finished = [&](const std::string& j) { return job_status(farm, j) == "finished"; };
  bool all_finished = hosts.wait_until([&] { return std::ranges::all_of(job_names, finished); },
                                       std::max(left, 0.0));
  std::string logs;
  for (const auto& h : names) {
    std::string log = hosts.daemon(h)->log();  // one read: the log still grows
    logs += "--- " + h + " log tail:\n" + log.substr(log.size() > 600 ? log.size() - 600 : 0);
  }
  EXPECT_TRUE(all_finished) << "not finished within " << kRunBound << " s: a host waited on a lock "
                            << "left by a dead one, or work was lost\n"
                            << farm.read("Render_Tasks") << logs;

  // Frames since each job's last restart; a second rendering is excused only
  // where a host died with the frame's task in flight.
  for (const auto& j : job_names) {
    std::map<int, std::vector<Stamp>> by_frame;
    for (const Stamp& s : read_stamps(farm.path("../stamps." + j)))
      if (s.start_ns >= counts_from[j]) by_frame[static_cast<int>(s.frame)].push_back(s);
    std::string missing;
    for (int f = 1; f <= kFrames; ++f)
      missing += by_frame[f].empty() ? " " + std::to_string(f) : "";
    EXPECT_TRUE(missing.empty()) << j << " frames never rendered since its last restart:" << missing
                                 << "\njob log:\n"
                                 << farm.read("JOBLOG/" + j) << logs;
    for (const auto& [frame, stamps] : by_frame) {
      std::string seen;
      for (const Stamp& s : stamps)
        seen += " " + s.host + "@" + ms(s.start_ns) + "-" + ms(s.end_ns);
      EXPECT_TRUE(stamps.size() < 2 || excused(stamps, events, max_frames))
          << j << " frame " << frame << " rendered " << stamps.size()
          << " times with no host dying in flight:" << seen;
    }
  }

  std::vector<std::string> stuck = hosts.shut_down(30);
  EXPECT_TRUE(stuck.empty()) << stuck.size() << " daemon(s) did not leave within 30 s of an "
                             << "operator's stop (waiting on a lock?), first " << stuck[0];
  EXPECT_EQ(lock_dirs(farm), std::vector<std::string>{}) << "lock directories left";
  EXPECT_TRUE(wait_for([&] { return hosts.renders_left().empty(); }, 10))
      << hosts.renders_left().size() << " render(s) left running";
}

class ChaosTest : public ::testing::TestWithParam<bool> {};

TEST_P(ChaosTest, JobsFinishWithEveryFrameThroughKillsPowerCutsFreezesAndRestarts) {
  if (!can_name_hosts()) GTEST_SKIP() << kCannotNameHosts;
  bool network = GetParam();
  // Over sshfs a run takes one to two and a half minutes and its time bound
  // is still too tight to hold every time on a busy machine: run by hand.
  if (network && getenv("CHAOS_NETWORK") == nullptr)
    GTEST_SKIP() << "network-mount variant: set CHAOS_NETWORK=1 to run it (root, sshfs, sshd)";
  SshServer ssh;
  std::string why;
  if (network && !ssh.start(&why)) GTEST_SKIP() << "no network mounts here: " << why;
  std::istringstream in(getenv("CHAOS_SEEDS") != nullptr ? getenv("CHAOS_SEEDS") : "1");
  for (std::string seed; std::getline(in, seed, ',');)
    run(static_cast<unsigned>(strtoul(seed.c_str(), nullptr, 10)), network ? &ssh : nullptr);
}

INSTANTIATE_TEST_SUITE_P(Mounts, ChaosTest, ::testing::Values(false, true), mount_name);

}  // namespace
