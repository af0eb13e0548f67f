// The checking allocator against the C library's malloc in the same run:
// small blocks (8 to 1024 bytes, random sizes) released in LIFO and in random
// order, and a daemon-like mix (many short texts, records of a few hundred
// bytes, now and then a file buffer, most of it living across a reload).
// Normal mode should be at least as fast as malloc; debug mode (guarded
// headers, lists, no checks) at most three times slower than normal mode.
// This binary is not routed: "glibc" is the C library's own allocator.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <random>
#include <string>
#include <vector>

#include "Shared/memory/MA_rtns.h"

namespace {

constexpr const char* kUnit = "bench/alloc_bench";
constexpr int kBlocks = 1000;

struct Glibc {
  static void* get(size_t n) { return malloc(n); }
  static void put(void* p) { free(p); }
  static void mode() {}
};
struct Normal {
  static void* get(size_t n) { return MA_malloc(n, __LINE__, kUnit, 1); }
  static void put(void* p) { MA_free(p, __LINE__, kUnit); }
  static void mode() { ma_debug = 0; }
};
struct Debug : Normal {
  static void mode() { ma_debug = 1; }
};

std::vector<size_t> random_sizes(int n, size_t lo, size_t hi, unsigned seed) {
  std::mt19937 rng(seed);
  std::uniform_int_distribution<size_t> d(lo, hi);
  std::vector<size_t> sizes(n);
  for (size_t& s : sizes) s = d(rng);
  return sizes;
}

// Sizes of one reload of a small queue: job and resource records, their
// texts, pick-list entries, and a line buffer now and then.
std::vector<size_t> daemon_sizes(int n) {
  std::mt19937 rng(7);
  std::vector<size_t> sizes(n);
  for (size_t& s : sizes) {
    unsigned r = rng() % 100;
    if (r < 55)
      s = 8 + rng() % 56;  // names, paths, option texts
    else if (r < 80)
      s = 24 + rng() % 24;  // list entries
    else if (r < 97)
      s = 200 + rng() % 400;  // records
    else
      s = 4096 + rng() % 4096;  // line and file buffers
  }
  return sizes;
}

template <class A>
void BM_Lifo(benchmark::State& state) {
  A::mode();
  auto sizes = random_sizes(kBlocks, 8, 1024, 1);
  std::vector<void*> held(kBlocks);
  for (auto _ : state) {
    for (int i = 0; i < kBlocks; ++i) held[i] = A::get(sizes[i]);
    for (int i = kBlocks - 1; i >= 0; --i) A::put(held[i]);
    benchmark::ClobberMemory();
  }
  state.SetItemsProcessed(state.iterations() * kBlocks);
  Normal::mode();
}

template <class A>
void BM_Random(benchmark::State& state) {
  A::mode();
  auto sizes = random_sizes(kBlocks, 8, 1024, 2);
  std::vector<int> order(kBlocks);
  for (int i = 0; i < kBlocks; ++i) order[i] = i;
  std::shuffle(order.begin(), order.end(), std::mt19937(3));
  std::vector<void*> held(kBlocks);
  for (auto _ : state) {
    for (int i = 0; i < kBlocks; ++i) held[i] = A::get(sizes[i]);
    for (int i : order) A::put(held[i]);
    benchmark::ClobberMemory();
  }
  state.SetItemsProcessed(state.iterations() * kBlocks);
  Normal::mode();
}

// Half of what a reload makes lives on to the next one; the rest is freed
// in a shuffled order, as records are dropped by index.
template <class A>
void BM_DaemonMix(benchmark::State& state) {
  A::mode();
  auto sizes = daemon_sizes(kBlocks);
  std::vector<int> order(kBlocks);
  for (int i = 0; i < kBlocks; ++i) order[i] = i;
  std::shuffle(order.begin(), order.end(), std::mt19937(4));
  std::vector<void*> held(kBlocks, nullptr);
  for (auto _ : state) {
    for (int i = 0; i < kBlocks; ++i) {
      if (held[i] != nullptr) A::put(held[i]);
      held[i] = A::get(sizes[i]);
    }
    for (int k = 0; k < kBlocks / 2; ++k) {
      A::put(held[order[k]]);
      held[order[k]] = nullptr;
    }
    benchmark::ClobberMemory();
  }
  for (void*& p : held)
    if (p != nullptr) A::put(p);
  state.SetItemsProcessed(state.iterations() * (kBlocks + kBlocks / 2));
  Normal::mode();
}

#define ALLOC_BENCH(fn)                                \
  BENCHMARK_TEMPLATE(fn, Glibc)->Name(#fn "/glibc");   \
  BENCHMARK_TEMPLATE(fn, Normal)->Name(#fn "/normal"); \
  BENCHMARK_TEMPLATE(fn, Debug)->Name(#fn "/debug")

ALLOC_BENCH(BM_Lifo);
ALLOC_BENCH(BM_Random);
ALLOC_BENCH(BM_DaemonMix);

// Prints the ratios the targets are stated in, after the usual table, from
// CPU times (the machine is shared; wall times carry the others' load).
class RatioReporter : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& r : runs)
      if (r.run_type == Run::RT_Iteration && r.iterations > 0)
        ns_[r.benchmark_name()] = r.GetAdjustedCPUTime();
    ConsoleReporter::ReportRuns(runs);
  }
  void Finalize() override {
    ConsoleReporter::Finalize();
    for (const char* fn : {"BM_Lifo", "BM_Random", "BM_DaemonMix"}) {
      std::string f = fn;
      double g = ns_[f + "/glibc"], n = ns_[f + "/normal"], d = ns_[f + "/debug"];
      if (g <= 0 || n <= 0 || d <= 0) continue;
      printf(
          "%-13s normal speed / glibc speed = %.2f (target >= 1.0); debug time / normal "
          "time = %.2f (target <= 3.0)\n",
          fn, g / n, d / n);
    }
  }

 private:
  std::map<std::string, double> ns_;
};

}  // namespace

int main(int argc, char** argv) {
  MA_init();
  benchmark::Initialize(&argc, argv);
  RatioReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  benchmark::Shutdown();
  return 0;
}
