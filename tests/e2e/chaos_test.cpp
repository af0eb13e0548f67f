// The farm under faults: four hosts render two jobs while daemons are killed,
// hosts lose power, a daemon is frozen for a while and a job is restarted by
// an editor.  Whatever happens, each job must end "finished" with every frame
// rendered since its last restart, a frame rendered twice only where a host
// that died had it in flight, no lock directory and no render left, and no
// wait on a lock that a host which came back had left behind.
//
// CI runs one fixed seed.  CHAOS_SEEDS="1,2,3,..." runs a sweep by hand.
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <map>
#include <random>
#include <sstream>
#include <thread>

#include "tests/e2e/farm_hosts.h"
#include "tests/e2e/render_farm.h"

namespace {

constexpr double kFrameSeconds = 0.2;
constexpr int kFrames = 40;
constexpr double kRunBound = 150;  // a wait on a 181-second lock shows up here

enum class Fault { kKillDaemon, kPowerCut, kFreeze, kRestartJob };
const char* fault_name(Fault f) {
  switch (f) {
    case Fault::kKillDaemon:
      return "kill -9";
    case Fault::kPowerCut:
      return "power cut";
    case Fault::kFreeze:
      return "SIGSTOP";
    case Fault::kRestartJob:
      return "restart job";
  }
  return "?";
}

struct Event {
  Fault fault;
  std::string target;  // host, or job for a restart
  double before;       // seconds of work before the fault
  double down;         // seconds the host stays down or frozen
  long long at_ns = 0;
};

std::vector<unsigned> seeds() {
  const char* env = getenv("CHAOS_SEEDS");
  std::vector<unsigned> out;
  std::istringstream in(env != nullptr ? env : "1");
  std::string item;
  while (std::getline(in, item, ',')) {
    if (!item.empty()) out.push_back(static_cast<unsigned>(strtoul(item.c_str(), nullptr, 10)));
  }
  if (out.empty()) out.push_back(1);
  return out;
}

// Every kind of fault at least once, then a few more, in a seeded order.
std::vector<Event> plan(unsigned seed, const std::vector<std::string>& hosts,
                        const std::vector<std::string>& jobs) {
  std::mt19937 rng(seed);
  auto pick = [&](const std::vector<std::string>& from) {
    return from[std::uniform_int_distribution<size_t>(0, from.size() - 1)(rng)];
  };
  auto uniform = [&](double lo, double hi) {
    return std::uniform_real_distribution<double>(lo, hi)(rng);
  };
  std::vector<Fault> faults = {Fault::kKillDaemon, Fault::kPowerCut,   Fault::kFreeze,
                               Fault::kRestartJob, Fault::kKillDaemon, Fault::kPowerCut};
  std::shuffle(faults.begin(), faults.end(), rng);
  std::vector<Event> events;
  for (Fault f : faults) {
    Event e{f, f == Fault::kRestartJob ? pick(jobs) : pick(hosts), uniform(0.3, 1.5),
            uniform(0.3, 2.5)};
    if (f == Fault::kFreeze) e.down = uniform(2, 4);
    events.push_back(e);
  }
  return events;
}

// A lock directory taken as an editor takes it; gives up at the deadline
// (a lock that nobody releases is a finding, not a reason to hang).
class EditorLock {
 public:
  EditorLock(const std::string& path, std::chrono::steady_clock::time_point deadline)
      : path_(path) {
    while (mkdir(path.c_str(), 0777) != 0) {
      if (std::chrono::steady_clock::now() > deadline) return;
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    held_ = true;
  }
  ~EditorLock() {
    if (held_) rmdir(path_.c_str());
  }
  EditorLock(const EditorLock&) = delete;
  EditorLock& operator=(const EditorLock&) = delete;
  bool held() const { return held_; }

 private:
  std::string path_;
  bool held_ = false;
};

// Lines of `text` in the block of `job` that start with `key` get `value`.
std::string set_job_fields(const std::string& text, const std::string& job,
                           const std::map<std::string, std::string>& fields) {
  std::istringstream in(text);
  std::string line, out;
  bool inside = false;
  while (std::getline(in, line)) {
    if (!line.empty() && line[0] != '\t' && line[0] != ' ' && line != "}") {
      inside = line.rfind(job + " ", 0) == 0;
    }
    if (inside) {
      size_t word = line.find_first_not_of(" \t");
      for (const auto& [key, value] : fields) {
        if (word != std::string::npos && line.compare(word, key.size(), key) == 0 &&
            (line.size() == word + key.size() || line[word + key.size()] == ' ' ||
             line[word + key.size()] == '\t'))
          line = "\t" + key + "\t= " + value + ";";
      }
    }
    out += line + "\n";
  }
  return out;
}

// The task file with the group of `job` left out; `active` tells whether a
// record of that group is STARTED or RUNNING.
std::string without_group(const std::string& tasks, const std::string& job, bool* active) {
  std::istringstream in(tasks);
  std::string line, out;
  bool inside = false;
  *active = false;
  while (std::getline(in, line)) {
    if (!line.empty() && line[0] != '\t') inside = line.rfind(job + "\t", 0) == 0;
    if (inside) {
      if (line.find("STARTED") != std::string::npos || line.find("RUNNING") != std::string::npos)
        *active = true;
      continue;
    }
    out += line + "\n";
  }
  return out;
}

class ChaosTest : public ::testing::TestWithParam<bool> {
 protected:
  // Runs one seeded schedule of faults; returns false when it could not run.
  void run(unsigned seed, const SshServer* ssh);
  // The editor's restart of a job; returns the time from which its frames
  // count again, or 0 when the restart could not be completed.
  long long restart_job(FarmHosts& hosts, Farm& farm, const std::string& job,
                        std::chrono::steady_clock::time_point deadline, std::string* trouble);
};

long long ChaosTest::restart_job(FarmHosts& hosts, Farm& farm, const std::string& job,
                                 std::chrono::steady_clock::time_point deadline,
                                 std::string* trouble) {
  {
    EditorLock jobs(farm.path("Render_Job_Control.lock"), deadline);
    if (!jobs.held()) {
      *trouble = "the job file's lock was never free";
      return 0;
    }
    farm.write("Render_Job_Control",
               set_job_fields(farm.read("Render_Job_Control"), job, {{"status", "\"restarted\""}}));
  }
  hosts.touch_pid_files();
  bool drained = hosts.wait_until(
      [&] {
        bool active = false;
        (void)without_group(farm.read("Render_Tasks"), job, &active);
        return !active;
      },
      30);
  if (!drained) {
    *trouble =
        "tasks still STARTED or RUNNING 30 s after the restart:\n" + farm.read("Render_Tasks");
    return 0;
  }
  EditorLock jobs(farm.path("Render_Job_Control.lock"), deadline);
  EditorLock tasks(farm.path("Render_Tasks.lock"), deadline);
  if (!jobs.held() || !tasks.held()) {
    *trouble = "the job or task file's lock was never free";
    return 0;
  }
  bool active = false;
  farm.write("Render_Tasks", without_group(farm.read("Render_Tasks"), job, &active));
  farm.write("Render_Job_Control",
             set_job_fields(farm.read("Render_Job_Control"), job,
                            {{"status", "\"pending\""}, {"doneframes", "0"}}));
  long long from = wall_ns();
  hosts.touch_pid_files();
  return from;
}

void ChaosTest::run(unsigned seed, const SshServer* ssh) {
  SCOPED_TRACE("seed " + std::to_string(seed));
  Farm farm;
  std::string scene = make_project(farm);
  FarmHosts hosts(farm, ssh);
  std::vector<std::string> names = {"chaos0", "chaos1", "chaos2", "chaos3"};
  std::map<std::string, int> max_frames;
  std::vector<ResourceSpec> resources;
  for (size_t i = 0; i < names.size(); ++i) {
    max_frames[names[i]] = 1 + static_cast<int>(i % 2);
    resources.push_back(
        {names[i], static_cast<int>(i) + 1, max_frames[names[i]], i == 0 ? 2 : 1, "AVAILABLE", ""});
  }
  std::vector<std::string> job_names = {"alpha", "beta"};
  std::vector<JobSpec> jobs;
  std::map<std::string, std::string> stamp_file;
  for (size_t i = 0; i < job_names.size(); ++i) {
    JobSpec j;
    j.name = job_names[i];
    j.index = static_cast<int>(i) + 1;
    j.start = 1;
    j.end = kFrames;
    stamp_file[j.name] = farm.path("../stamps." + j.name);
    j.opts = "sleep=" + std::to_string(kFrameSeconds) + " stamp=" + stamp_file[j.name];
    j.hosts = names;
    jobs.push_back(j);
  }
  std::string job_text = job_file(jobs, scene);
  for (size_t at; (at = job_text.find("= frame_painter;")) != std::string::npos;)
    job_text.replace(at, 16, "= stamp_render;");
  farm.write("Render_Resource_Control", resource_file(resources));
  farm.write("Render_Job_Control", job_text);

  auto begun = std::chrono::steady_clock::now();
  auto deadline = begun + std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                              std::chrono::duration<double>(kRunBound));
  long long begun_ns = wall_ns();
  for (const auto& h : names) {
    ASSERT_TRUE(hosts.start(h)) << h << " did not start:\n"
                                << read_text_file(hosts.daemon(h)->tmpdir + "/early")
                                << hosts.daemon(h)->log() << "\n--- first host:\n"
                                << hosts.daemon(names[0])->log();
  }

  std::vector<Event> events = plan(seed, names, job_names);
  std::map<std::string, long long> counts_from;
  for (const auto& j : job_names) counts_from[j] = begun_ns;
  std::vector<std::string> troubles;
  std::ostringstream story;
  for (Event& e : events) {
    hosts.idle(e.before);
    e.at_ns = wall_ns();
    story << "  " << (e.at_ns - begun_ns) / 1000000 << " ms: " << fault_name(e.fault) << " "
          << e.target << " (" << e.down << " s)\n";
    switch (e.fault) {
      case Fault::kKillDaemon:
      case Fault::kPowerCut:
        if (e.fault == Fault::kKillDaemon) {
          hosts.kill_daemon(e.target);
        } else {
          hosts.power_cut(e.target);
        }
        hosts.idle(e.down);
        if (!hosts.start(e.target)) troubles.push_back(e.target + " did not start again");
        break;
      case Fault::kFreeze:
        hosts.freeze(e.target);
        std::this_thread::sleep_for(std::chrono::duration<double>(e.down));
        hosts.thaw(e.target);
        break;
      case Fault::kRestartJob: {
        std::string trouble;
        long long from = restart_job(hosts, farm, e.target, deadline, &trouble);
        if (from == 0) troubles.push_back("restart of " + e.target + ": " + trouble);
        counts_from[e.target] = from != 0 ? from : wall_ns();
        break;
      }
    }
  }
  SCOPED_TRACE("faults:\n" + story.str());
  if (getenv("CHAOS_VERBOSE") != nullptr) printf("seed %u faults:\n%s", seed, story.str().c_str());
  for (const auto& t : troubles) ADD_FAILURE() << t;

  double left = std::chrono::duration<double>(deadline - std::chrono::steady_clock::now()).count();
  bool finished = hosts.wait_until(
      [&] {
        for (const auto& j : job_names) {
          if (job_status(farm, j) != "finished") return false;
        }
        return true;
      },
      left > 0 ? left : 0);
  double took = std::chrono::duration<double>(std::chrono::steady_clock::now() - begun).count();
  if (getenv("CHAOS_VERBOSE") != nullptr) printf("seed %u: jobs done after %.1f s\n", seed, took);
  std::string logs;
  for (const auto& h : names) {
    // One read: the log still grows while the daemons run.
    std::string log = hosts.daemon(h)->log();
    logs += "--- " + h + " log tail:\n" + log.substr(log.size() > 600 ? log.size() - 600 : 0);
  }
  for (const auto& j : job_names) {
    EXPECT_EQ(job_status(farm, j), "finished")
        << j << " after " << took << " s (bound " << kRunBound << " s)\n"
        << farm.read("Render_Tasks") << logs;
  }
  EXPECT_TRUE(finished) << "the run took longer than " << kRunBound
                        << " s: a host waited on a lock left by a dead one, or work was lost";

  // Frames since each job's last restart; a second rendering is excused only
  // where a host died with the frame's task in flight.
  for (const auto& j : job_names) {
    std::map<int, std::vector<Stamp>> by_frame;
    for (const Stamp& s : read_stamps(stamp_file[j])) {
      if (s.start_ns >= counts_from[j]) by_frame[static_cast<int>(s.frame)].push_back(s);
    }
    std::string missing;
    for (int f = 1; f <= kFrames; ++f) {
      if (by_frame[f].empty()) missing += " " + std::to_string(f);
    }
    EXPECT_TRUE(missing.empty()) << j << " frames never rendered since its last restart:" << missing
                                 << "\njob log:\n"
                                 << farm.read("JOBLOG/" + j) << logs;
    for (const auto& [frame, stamps] : by_frame) {
      if (stamps.size() < 2) continue;
      bool excused = false;
      std::string seen;
      for (const Stamp& s : stamps) {
        seen += " " + s.host + "@" + std::to_string((s.start_ns - begun_ns) / 1000000) + "-" +
                std::to_string((s.end_ns - begun_ns) / 1000000) + "ms";
        long long window = static_cast<long long>((max_frames[s.host] * kFrameSeconds + 1.0) * 1e9);
        // A render is in flight until its daemon has seen it end; a daemon
        // stopped when the render ended sees that only once continued.
        long long seen_end = s.end_ns;
        for (const Event& e : events) {
          long long thaw = e.at_ns + static_cast<long long>(e.down * 1e9);
          if (e.fault == Fault::kFreeze && e.target == s.host && e.at_ns <= s.end_ns &&
              s.end_ns <= thaw)
            seen_end = thaw;
        }
        for (const Event& e : events) {
          if ((e.fault == Fault::kKillDaemon || e.fault == Fault::kPowerCut) &&
              e.target == s.host && s.start_ns <= e.at_ns && seen_end >= e.at_ns - window)
            excused = true;
        }
      }
      EXPECT_TRUE(excused) << j << " frame " << frame << " rendered " << stamps.size()
                           << " times with no host dying in flight:" << seen;
    }
  }

  // CHAOS_KEEP=DIR keeps the control directory and every daemon's log of a
  // failed run for a post-mortem.
  if (HasFailure() && getenv("CHAOS_KEEP") != nullptr) {
    std::string keep = getenv("CHAOS_KEEP");
    std::string cmd = "mkdir -p '" + keep + "' && cp -r '" + farm.dir() + "' '" + keep + "/ctl'";
    std::string tmp = hosts.daemon(names[0])->tmpdir;
    cmd += " && cp -r '" + tmp.substr(0, tmp.rfind('/')) + "' '" + keep + "/hosts'";
    if (system(cmd.c_str()) != 0) ADD_FAILURE() << "could not keep the run in " << keep;
  }
  std::vector<std::string> stuck = hosts.shut_down(30);
  EXPECT_TRUE(stuck.empty()) << stuck.size() << " daemon(s) did not leave within 30 s of an "
                             << "operator's stop (waiting on a lock?), first " << stuck[0];
  std::vector<std::string> locks;
  if (DIR* dir = opendir(farm.dir().c_str())) {
    while (struct dirent* e = readdir(dir)) {
      std::string name = e->d_name;
      if (name.size() > 5 && name.compare(name.size() - 5, 5, ".lock") == 0) locks.push_back(name);
    }
    closedir(dir);
  }
  EXPECT_TRUE(locks.empty()) << "lock directory left: " << locks[0];
  bool renders_gone = wait_for([&] { return hosts.renders_left().empty(); }, 10);
  EXPECT_TRUE(renders_gone) << hosts.renders_left().size() << " render(s) left running";
}

TEST_P(ChaosTest, JobsFinishWithEveryFrameThroughKillsPowerCutsFreezesAndRestarts) {
  if (!can_name_hosts())
    GTEST_SKIP() << "needs root or user namespaces: daemons run under other host names";
  bool network = GetParam();
  // Over sshfs a run takes one to two and a half minutes and its time bound
  // is still too tight to hold every time on a busy machine: run by hand.
  if (network && getenv("CHAOS_NETWORK") == nullptr) {
    GTEST_SKIP() << "network-mount variant: set CHAOS_NETWORK=1 to run it (root, sshfs, sshd)";
  }
  std::string why = network ? SshServer::why_unavailable() : "";
  if (!why.empty()) GTEST_SKIP() << "no network mounts here: " << why;
  TempDir keys;
  SshServer ssh;
  if (network && !ssh.start(keys.path(), &why)) GTEST_SKIP() << "no network mounts here: " << why;
  for (unsigned seed : seeds()) run(seed, network ? &ssh : nullptr);
}

INSTANTIATE_TEST_SUITE_P(Mounts, ChaosTest, ::testing::Values(false, true),
                         [](const ::testing::TestParamInfo<bool>& info) {
                           return info.param ? std::string("Sshfs") : std::string("Local");
                         });

}  // namespace
