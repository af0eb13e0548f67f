// Reading and writing a large control directory: 10,000 jobs (each with
// resources, search paths, a weekly schedule) and 500 resources.  A daemon
// rereads both files whenever anything in the queue changes, so a reload
// has to stay in the tens of milliseconds.
//
// One job with 200,000 image search paths, read alone: every path is an
// append to the job's list, so this shows at once if an append walks the
// list again (it took 27 s that way).  Target: well under 200 ms.
//
// BM_Write writes both files back to back; BM_WriteOnce the same with the
// disk idle before each write.  BM_WriteUserSpace writes into /dev/null, to
// tell the writers' own cost from the kernel's.  BM_WriteReplace writes as a daemon does after a
// change (one job and one resource changed each time): under each file's lock, the old file read
// and compared, the new one written beside it, forced to disk and renamed over it.
//
// The directory is made in $TMPDIR (default /tmp).
//
// Counters: ms per reload or write (wall clock), MB/s over both files,
// file_MB (both files together).
#include <benchmark/benchmark.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <random>
#include <string>

#include "Utility/rndctl/rndctl.h"

namespace {

constexpr int kJobs = 10000;
constexpr int kDevs = 500;

std::string dir;
std::string job_file;
std::string dev_file;
double file_bytes = 0;

void clear_lists() {
  while (rndctl.jobs != nullptr) Job_del(rndctl.jobs);
  while (rndctl.devs != nullptr) Dev_del(rndctl.devs);
}

void build_queue() {
  std::mt19937 rng(42);
  auto pick = [&](int lo, int hi) { return std::uniform_int_distribution<int>(lo, hi)(rng); };
  Dev* devs[kDevs];
  char text[256];
  for (int i = 0; i < kDevs; ++i) {
    snprintf(text, sizeof text, "render%03d", i);
    Dev* dev = Add_a_dev(nullptr, text, i + 1);
    dev->host_name.set(text);
    dev->num_processors = pick(1, 16);
    dev->max_frames = pick(1, 10);
    if (i % 4 == 0) {
      dev->comment.set("night shift only");
      Schedule_dev_lock(dev, 800, 1800, "monday", "friday");
    }
    devs[i] = dev;
  }
  for (int i = 0; i < kJobs; ++i) {
    snprintf(text, sizeof text, "/projects/show%02d/sdl/shot_%05d.sdl", i % 40, i);
    Job* job = Add_a_job(nullptr, text, i + 1);
    job->sdl.set(text);
    snprintf(text, sizeof text, "/projects/show%02d/pix/shot_%05d", i % 40, i);
    job->pix.set(text);
    job->user.set("artist");
    job->status.set(i % 3 == 0 ? "pending" : "37");
    job->priority = pick(0, 10);
    job->executable.set("zrender");
    job->animate = 1;
    job->frames[0] = 1.0f;
    job->frames[1] = static_cast<float>(pick(24, 500));
    job->frames[2] = 1.0f;
    job->extension = 291;
    job->ext_size = 4;
    job->ctrl = RUN_SCHEDULE;
    job->totalframes = static_cast<int>(job->frames[1]);
    job->doneframes = pick(0, job->totalframes);
    if (i % 10 == 0) job->comment.set("ERROR: render017 (render017) frame 12.0\nQuit\n \n");
    for (int n = 0; n < 3; ++n) RndDevList_add(job, devs[pick(0, kDevs - 1)]);
    RndPathList_add(job, "/projects/textures");
    RndPathList_add(job, "/library/maps");
    Schedule_job_runs(job, 1800, 2400, "Monday", "Friday");
    Schedule_job_runs(job, 0, 2400, "Saturday", "Sunday");
  }
}

bool write_file(const std::string& path, void (*writer)(FILE*)) {
  FILE* fp = fopen(path.c_str(), "w");
  if (fp == nullptr) return false;
  writer(fp);
  return fclose(fp) == 0;
}

// As a daemon reloads: the whole file read into memory, then parsed there.
bool parse_file(const std::string& path, const char* name) {
  static std::string bytes;
  FILE* fp = fopen(path.c_str(), "r");
  if (fp == nullptr) return false;
  bytes.clear();
  char buf[1 << 16];
  size_t n;
  while ((n = fread(buf, 1, sizeof buf, fp)) > 0) bytes.append(buf, n);
  fclose(fp);
  return RJC_parse_string(bytes.data(), bytes.size(), name) == 0;
}

off_t size_of(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 ? st.st_size : 0;
}

// Once per process: a control directory holding the two files.
bool ready() {
  static bool done = [] {
    const char* tmp = getenv("TMPDIR");
    std::string templ =
        std::string(tmp != nullptr && *tmp != '\0' ? tmp : "/tmp") + "/rjc_bench_XXXXXX";
    if (mkdtemp(templ.data()) == nullptr) return false;
    dir = templ;
    job_file = dir + "/Render_Job_Control";
    dev_file = dir + "/Render_Resource_Control";
    rndctl.location.set(dir.c_str());
    rndctl.host.set("benchhost");
    rndctl.pid = getpid();
    rndctl.interval_min = 10;
    build_queue();
    if (!write_file(dev_file, Resource_control_write_dev) ||
        !write_file(job_file, Job_control_write_dev))
      return false;
    file_bytes = static_cast<double>(size_of(job_file) + size_of(dev_file));
    return true;
  }();
  return done;
}

using Clock = std::chrono::steady_clock;

void report(benchmark::State& state, Clock::duration spent) {
  const double iterations = static_cast<double>(state.iterations());
  const double seconds = std::chrono::duration<double>(spent).count();
  if (iterations == 0 || seconds <= 0) return;
  state.counters["ms"] = seconds * 1e3 / iterations;
  state.counters["MB/s"] = file_bytes * iterations / 1e6 / seconds;
  state.counters["file_MB"] = file_bytes / 1e6;
}

void BM_Reload(benchmark::State& state) {
  if (!ready()) {
    state.SkipWithError("cannot set up the control directory");
    return;
  }
  Clock::duration spent{};
  for (auto _ : state) {
    state.PauseTiming();
    clear_lists();
    state.ResumeTiming();
    const auto start = Clock::now();
    bool ok = parse_file(dev_file, "Render_Resource_Control") &&
              parse_file(job_file, "Render_Job_Control");
    spent += Clock::now() - start;
    if (!ok) {
      state.SkipWithError("parse failed");
      break;
    }
  }
  report(state, spent);
}
BENCHMARK(BM_Reload)->Unit(benchmark::kMillisecond)->UseRealTime();

// The queue read once for the writers; false (the benchmark skipped) when
// the control directory cannot be made.
bool queue_loaded(benchmark::State& state) {
  if (!ready()) {
    state.SkipWithError("cannot set up the control directory");
    return false;
  }
  if (rndctl.jobs == nullptr) {
    parse_file(dev_file, "Render_Resource_Control");
    parse_file(job_file, "Render_Job_Control");
  }
  return rndctl.jobs != nullptr && rndctl.devs != nullptr;
}

// Times `write` (false: it failed) once an iteration; `settle`, untimed,
// before each.
template <class Write, class Settle = void (*)()>
void time_writes(
    benchmark::State& state, Write write, Settle settle = [] {}) {
  if (!queue_loaded(state)) return;
  Clock::duration spent{};
  for (auto _ : state) {
    state.PauseTiming();
    settle();
    state.ResumeTiming();
    const auto start = Clock::now();
    bool ok = write();
    spent += Clock::now() - start;
    if (!ok) {
      state.SkipWithError("write failed");
      break;
    }
  }
  report(state, spent);
}

void BM_Write(benchmark::State& state) {
  time_writes(state, [] {
    return write_file(dev_file, Resource_control_write_dev) &&
           write_file(job_file, Job_control_write_dev);
  });
}
BENCHMARK(BM_Write)->Unit(benchmark::kMillisecond)->UseRealTime();

// One write, as a daemon writes once per change: the disk has finished the
// write before.  Back to back (BM_Write), each write also waits for the disk
// to take the last one's megabytes.
void BM_WriteOnce(benchmark::State& state) {
  time_writes(
      state,
      [] {
        return write_file(dev_file, Resource_control_write_dev) &&
               write_file(job_file, Job_control_write_dev);
      },
      [] { sync(); });
}
BENCHMARK(BM_WriteOnce)->Unit(benchmark::kMillisecond)->UseRealTime();

// The same write into /dev/null: what the writers themselves cost, without
// the kernel's work of filling a fresh file.
void BM_WriteUserSpace(benchmark::State& state) {
  time_writes(state, [] {
    return write_file("/dev/null", Resource_control_write_dev) &&
           write_file("/dev/null", Job_control_write_dev);
  });
}
BENCHMARK(BM_WriteUserSpace)->Unit(benchmark::kMillisecond)->UseRealTime();

void BM_WriteReplace(benchmark::State& state) {
  time_writes(state, [] {
    // A file that would not change is not written at all.
    rndctl.jobs->doneframes ^= 1;
    rndctl.devs->max_frames ^= 1;
    Resource_control_write(nullptr);
    Job_control_write(nullptr);
    return true;  // a failed write is reported on stderr
  });
}
BENCHMARK(BM_WriteReplace)->Unit(benchmark::kMillisecond)->UseRealTime();

constexpr int kSearchPaths = 200000;

void BM_ReloadManySearchPaths(benchmark::State& state) {
  static const std::string text = [] {
    std::string t = "RenderJobControl 10 0\npaths.sdl 1 {\n\tpriority \t= 0;\n";
    char line[128];
    for (int i = 0; i < kSearchPaths; ++i) {
      snprintf(line, sizeof line, "\tsearchpath\t= \"/proj/textures/set%06d\";\n", i);
      t += line;
    }
    return t + "}\n\nEnd\n";
  }();
  Clock::duration spent{};
  for (auto _ : state) {
    state.PauseTiming();
    clear_lists();
    state.ResumeTiming();
    const auto start = Clock::now();
    bool ok = RJC_parse_string(text.data(), text.size(), "Render_Job_Control") == 0;
    spent += Clock::now() - start;
    if (!ok || rndctl.jobs == nullptr || rndctl.jobs->searchpath_tail == nullptr) {
      state.SkipWithError("parse failed");
      break;
    }
  }
  const double iterations = static_cast<double>(state.iterations());
  const double seconds = std::chrono::duration<double>(spent).count();
  if (iterations > 0 && seconds > 0) {
    state.counters["ms"] = seconds * 1e3 / iterations;
    state.counters["file_MB"] = static_cast<double>(text.size()) / 1e6;
  }
  clear_lists();
}
BENCHMARK(BM_ReloadManySearchPaths)->Unit(benchmark::kMillisecond)->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
