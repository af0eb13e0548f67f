// One selection cycle of a daemon on a busy farm: 2,000 jobs of 50 tasks
// each spread over 200 render hosts.  A cycle takes the task file's lock,
// reads the whole file, brings the running-task list in line with it,
// chooses and cuts a task, writes the file back and releases the lock; every
// daemon of the farm runs one per pass of its loop, under the one lock, so it
// has to stay within tens of milliseconds.
//
// TaskGet_Pick: a cycle that picks a task (the file grows by one record per
// cycle, as on a farm).  TaskGet_HostFull: a cycle in which every process
// slot of this host is taken, so nothing can be picked; the daemon ends every
// pass with one of these.
//
// Counters: ms per cycle (wall clock), file_MB.
#include <benchmark/benchmark.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "Utility/rndctl/rndctl.h"

namespace {

constexpr int kJobs = 2000;
constexpr int kTasks = 50;
constexpr int kDevs = 200;
constexpr int kHostsPerJob = 20;

std::string dir;
Dev* devs[kDevs];

void reset_queue() {
  while (rndctl.tasks != nullptr) TASK_free(rndctl.tasks);
  while (rndctl.jobs != nullptr) Job_del(rndctl.jobs);
  while (rndctl.devs != nullptr) Dev_del(rndctl.devs);
}

// Jobs, hosts and a task file as a farm in full swing has them: per job 48
// finished tasks, one running on another host and the pending remainder.
// This host (render000) may render every job.
void build_farm(int processors) {
  reset_queue();
  char* templ =
      strdup((std::string(getenv("TMPDIR") ? getenv("TMPDIR") : "/tmp") + "/task_get_bench_XXXXXX")
                 .c_str());
  if (mkdtemp(templ) == nullptr) abort();
  dir = templ;
  free(templ);
  fileop_reset();
  rndctl.location.set(dir.c_str());
  rndctl.host.set("render000");
  rndctl.pid = getpid();
  rndctl.running = 0;

  char text[256];
  for (int i = 0; i < kDevs; ++i) {
    snprintf(text, sizeof text, "render%03d", i);
    devs[i] = Add_a_dev(nullptr, text, i + 1);
    devs[i]->host_name.set(text);
    devs[i]->max_frames = 3;
    devs[i]->num_processors = 8;
  }
  devs[0]->num_processors = processors;

  std::string file;
  file.reserve(8 << 20);
  for (int j = 0; j < kJobs; ++j) {
    snprintf(text, sizeof text, "/projects/show/sdl/shot_%05d.sdl", j);
    Job* job = Add_a_job(nullptr, text, j + 1);
    job->status.set("50.00% ");
    job->priority = j % 7;
    job->animate = 1;
    job->frames[0] = 1;
    job->frames[1] = 1000;
    job->frames[2] = 1;
    RndDevList_add(job, devs[0]);
    for (int h = 1; h < kHostsPerJob; ++h) RndDevList_add(job, devs[1 + (j + h * 7) % (kDevs - 1)]);

    snprintf(text, sizeof text, "\n%s\t %d\t %d\t %d\n", job->name.c_str(), job->index, kTasks,
             kTasks);
    file += text;
    for (int t = 0; t < kTasks; ++t) {
      float start = static_cast<float>(1 + 3 * t);
      float end = t == kTasks - 1 ? 1000.0f : start + 2;
      const char* status = t < kTasks - 2 ? "FINISHED" : t == kTasks - 2 ? "RUNNING" : "PENDING";
      int dev = t == kTasks - 1 ? 0 : 2 + (j * kTasks + t) % (kDevs - 1);
      snprintf(text, sizeof text, "\t%d\t %f\t %f\t %f  %d\t %d\t%s\n", t, start, end,
               t < kTasks - 2 ? end : start, dev, 0, status);
      file += text;
    }
  }
  FILE* fp = fopen((dir + "/Render_Tasks").c_str(), "w");
  if (fp == nullptr) abort();
  fwrite(file.data(), 1, file.size(), fp);
  fclose(fp);
  // The first cycle makes an entry for every record; the cycles measured
  // find them there, as a running daemon does.
  TASK* first = Task_get();
  if (processors > 0 && first == nullptr) abort();
}

void remove_farm() {
  reset_queue();
  fileop_reset();
  std::string cmd = "rm -rf '" + dir + "'";
  if (system(cmd.c_str()) != 0) fprintf(stderr, "could not remove %s\n", dir.c_str());
}

double file_mb() {
  FILE* fp = fopen((dir + "/Render_Tasks").c_str(), "r");
  if (fp == nullptr) return 0;
  fseek(fp, 0, SEEK_END);
  double mb = static_cast<double>(ftell(fp)) / (1 << 20);
  fclose(fp);
  return mb;
}

void run_cycles(benchmark::State& state, bool expect_pick) {
  for (auto _ : state) {
    auto t0 = std::chrono::steady_clock::now();
    TASK* picked = Task_get();
    auto t1 = std::chrono::steady_clock::now();
    if ((picked != nullptr) != expect_pick) {
      state.SkipWithError("unexpected selection result");
      break;
    }
    state.SetIterationTime(std::chrono::duration<double>(t1 - t0).count());
  }
  state.counters["file_MB"] = file_mb();
}

void TaskGet_Pick(benchmark::State& state) {
  build_farm(1000000);
  run_cycles(state, true);
  remove_farm();
}

void TaskGet_HostFull(benchmark::State& state) {
  // One slot, taken by the task the first cycle picked.
  build_farm(1);
  run_cycles(state, false);
  remove_farm();
}

BENCHMARK(TaskGet_Pick)->UseManualTime()->Unit(benchmark::kMillisecond)->MinTime(2.0);
BENCHMARK(TaskGet_HostFull)->UseManualTime()->Unit(benchmark::kMillisecond)->MinTime(2.0);

}  // namespace

BENCHMARK_MAIN();
