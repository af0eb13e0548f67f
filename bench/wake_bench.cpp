// What one wake-up of an idle daemon costs on a large queue: 10,000 jobs and
// 500 resources, none of them for the daemon's host.  An editor's touch of
// the host's pid file (and the SIGALRM it may send) wakes it; the daemon
// looks, finds nothing changed for it, and goes back to sleep.  Every host
// of a farm pays this for every change anywhere in the queue, so it must
// stay far below the work of a full reload.
//
// Reports the daemon's CPU time per wake (user + system, from /proc) and,
// from a second run with the trace on, how long it held the job and
// resource locks per wake.  Not a test: the figures depend on the machine.
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <random>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "Utility/rndctl/rndctl.h"

namespace {

constexpr int kJobs = 10000;
constexpr int kDevs = 500;

bool write_file(const std::string& path, void (*writer)(FILE*)) {
  FILE* fp = fopen(path.c_str(), "w");
  if (fp == nullptr) return false;
  writer(fp);
  return fclose(fp) == 0;
}

// The queue: every job on three of the 500 render hosts, none of them ours.
bool write_queue(const std::string& dir) {
  rndctl.location.set(dir.c_str());
  rndctl.host.set("benchhost");
  rndctl.interval_min = 0;
  std::mt19937 rng(42);
  auto pick = [&](int lo, int hi) { return std::uniform_int_distribution<int>(lo, hi)(rng); };
  std::vector<Dev*> devs;
  char text[256];
  for (int i = 0; i < kDevs; ++i) {
    snprintf(text, sizeof text, "render%03d", i);
    Dev* dev = Add_a_dev(nullptr, text, i + 1);
    dev->host_name.set(text);
    dev->num_processors = pick(1, 16);
    dev->max_frames = pick(1, 10);
    devs.push_back(dev);
  }
  for (int i = 0; i < kJobs; ++i) {
    snprintf(text, sizeof text, "/projects/show%02d/sdl/shot_%05d.sdl", i % 40, i);
    Job* job = Add_a_job(nullptr, text, i + 1);
    job->sdl.set(text);
    snprintf(text, sizeof text, "/projects/show%02d/pix/shot_%05d", i % 40, i);
    job->pix.set(text);
    job->user.set("artist");
    job->status.set(i % 3 == 0 ? "pending" : "37.00% ");
    job->priority = pick(0, 10);
    job->executable.set("zrender");
    job->animate = 1;
    job->frames[0] = 1.0f;
    job->frames[1] = static_cast<float>(pick(24, 500));
    job->frames[2] = 1.0f;
    job->totalframes = static_cast<int>(job->frames[1]);
    for (int n = 0; n < 3; ++n) RndDevList_add(job, devs[static_cast<size_t>(pick(0, kDevs - 1))]);
    RndPathList_add(job, "/projects/textures");
    Schedule_job_runs(job, 1800, 2400, "Monday", "Friday");
  }
  return write_file(dir + "/Render_Resource_Control", Resource_control_write_dev) &&
         write_file(dir + "/Render_Job_Control", Job_control_write_dev);
}

std::string host_name() {
  char name[256] = "";
  gethostname(name, sizeof name - 1);
  return name;
}

// User + system CPU of a process, in seconds, and its scheduler state.
bool cpu_of(pid_t pid, double* seconds, char* state) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
  std::string line;
  if (!std::getline(in, line)) return false;
  size_t close = line.rfind(')');
  if (close == std::string::npos) return false;
  std::istringstream rest(line.substr(close + 2));
  std::string field;
  std::vector<std::string> f;
  while (rest >> field) f.push_back(field);
  if (f.size() < 13) return false;
  *state = f[0][0];
  *seconds = (std::stod(f[11]) + std::stod(f[12])) / static_cast<double>(sysconf(_SC_CLK_TCK));
  return true;
}

// Waits until the daemon has been asleep with its CPU time standing still
// for a while: the pass that the wake started is over.
double settle(pid_t pid) {
  double last = -1;
  int quiet = 0;
  for (int i = 0; i < 2000 && quiet < 6; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    double now = 0;
    char state = '?';
    if (!cpu_of(pid, &now, &state)) return last;
    quiet = (now == last && state == 'S') ? quiet + 1 : 0;
    last = now;
  }
  return last;
}

struct Run {
  double cpu_per_wake = 0;
  std::vector<double> hold_ms;  // lock holds of the job and resource files
};

bool run_daemon(const std::string& daemon, const std::string& dir, int wakes, bool trace,
                Run* run) {
  std::string tmp = dir + "/tmp";
  mkdir(tmp.c_str(), 0777);
  pid_t pid = fork();
  if (pid < 0) return false;
  if (pid == 0) {
    setenv("DRCTMPDIR", tmp.c_str(), 1);
    int devnull = open("/dev/null", O_WRONLY);
    if (devnull >= 0) {
      dup2(devnull, 1);
      dup2(devnull, 2);
    }
    if (trace) {
      execl(daemon.c_str(), daemon.c_str(), "-l", dir.c_str(), "-d", "1",
            static_cast<char*>(nullptr));
    } else {
      execl(daemon.c_str(), daemon.c_str(), "-l", dir.c_str(), static_cast<char*>(nullptr));
    }
    _exit(127);
  }
  double before = settle(pid);
  std::string pid_file = dir + "/" + host_name() + ".pid";
  for (int i = 0; i < wakes; ++i) {
    // Something elsewhere in the queue changed: the editor touches the pid
    // files and wakes the daemons.
    utimensat(AT_FDCWD, pid_file.c_str(), nullptr, 0);
    kill(pid, SIGALRM);
    settle(pid);
  }
  double after = settle(pid);
  kill(pid, SIGKILL);
  waitpid(pid, nullptr, 0);
  run->cpu_per_wake = wakes > 0 ? (after - before) / wakes : 0;
  if (trace) {
    std::ifstream log(tmp + "/zarno_render_demon.LOG");
    std::string line;
    while (std::getline(log, line)) {
      // "lock <path> held <ms> ms", written when a lock is released.
      size_t at = line.find("Render_Job_Control.lock held ");
      if (at == std::string::npos) at = line.find("Render_Resource_Control.lock held ");
      if (at == std::string::npos) continue;
      size_t num = line.find(" held ", at) + 6;
      run->hold_ms.push_back(atof(line.c_str() + num));
    }
  }
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  bool quick = getenv("BENCH_QUICK") != nullptr && strcmp(getenv("BENCH_QUICK"), "1") == 0;
  for (int i = 1; i < argc; ++i) {
    if (strncmp(argv[i], "--benchmark_min_time", 20) == 0) quick = true;
  }
  char templ[] = "/tmp/rjc_wake_XXXXXX";
  if (mkdtemp(templ) == nullptr) return 1;
  std::string dir = templ;
  if (!write_queue(dir)) return 1;
  const int wakes = quick ? 2 : 5;
  Run plain, traced;
  // WAKE_BENCH_DAEMON measures another build of the daemon (before/after).
  const char* daemon =
      getenv("WAKE_BENCH_DAEMON") != nullptr ? getenv("WAKE_BENCH_DAEMON") : DAEMON_PATH;
  if (!run_daemon(daemon, dir, wakes, false, &plain)) return 1;
  if (!run_daemon(daemon, dir, wakes, true, &traced)) return 1;
  double longest = 0;
  for (double ms : traced.hold_ms) longest = std::max(longest, ms);
  printf("idle daemon, %d jobs + %d resources, none for it: %d wakes\n", kJobs, kDevs, wakes);
  printf("  CPU per wake      %8.1f ms   (target < 50 ms)\n", plain.cpu_per_wake * 1e3);
  printf("  job/resource locks held %zu times, longest %.1f ms   (target < 30 ms, trace on)\n",
         traced.hold_ms.size(), longest);
  std::string cmd = "rm -rf '" + dir + "'";
  return system(cmd.c_str()) == 0 ? 0 : 1;
}
