// A program linked like the daemon, with the process allocator routed into
// the checking allocator.  It exercises every entry point the C and C++
// libraries may use, from several threads and across a fork, and exits 0
// when all held; run by ctest in normal and in debug mode.
#include <malloc.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdint>
#include <string>
#include <thread>
#include <vector>

#include "Shared/memory/MA_rtns.h"

namespace {

int failures = 0;

void expect(bool ok, const char* what) {
  if (ok) return;
  fprintf(stderr, "FAILED: %s\n", what);
  ++failures;
}

bool aligned(const void* p, size_t to) { return reinterpret_cast<uintptr_t>(p) % to == 0; }

void entry_points() {
  // Routed: a 100-byte malloc is a 128-byte bucket block (or exact in debug mode).
  char* p = static_cast<char*>(malloc(100));
  expect(p != nullptr && aligned(p, 16), "malloc");
  expect(malloc_usable_size(p) == (ma_debug ? 104u : 128u), "malloc is routed");
  memset(p, 'p', 100);
  p = static_cast<char*>(realloc(p, 5000));
  expect(p != nullptr && p[99] == 'p', "realloc keeps the bytes");
  free(p);

  auto* z = static_cast<unsigned char*>(calloc(1000, 3));
  bool zero = z != nullptr;
  for (int i = 0; zero && i < 3000; ++i) zero = z[i] == 0;
  expect(zero, "calloc zeroes");
  free(z);
  volatile size_t huge = SIZE_MAX / 2;  // keeps the compiler from refusing the call itself
  expect(calloc(huge, 3) == nullptr, "calloc overflow");

  for (size_t align : {32, 64, 4096}) {
    void* a = aligned_alloc(align, 3 * align);
    void* m = memalign(align, 10);
    void* q = nullptr;
    expect(posix_memalign(&q, align, 1) == 0, "posix_memalign");
    expect(a && m && q && aligned(a, align) && aligned(m, align) && aligned(q, align),
           "aligned entry points");
    expect(malloc_usable_size(a) >= 3 * align, "usable size of an aligned block");
    memset(a, 1, 3 * align);
    a = realloc(a, 100000);
    free(a);
    free(m);
    free(q);
  }
  void* v = valloc(10);
  void* pv = pvalloc(10);
  expect(aligned(v, 4096) && aligned(pv, 4096) && malloc_usable_size(pv) >= 4096, "valloc");
  free(v);
  free(pv);

  // Beyond the last bucket: served, by a mapping of its own.
  size_t big = size_t{300} << 20;
  char* b = static_cast<char*>(malloc(big));
  expect(b != nullptr && aligned(b, 16) && malloc_usable_size(b) >= big, "large malloc");
  if (b != nullptr) b[0] = b[big - 1] = 1;
  b = static_cast<char*>(realloc(b, big * 2));
  expect(b != nullptr && b[0] == 1, "large realloc");
  free(b);
  free(nullptr);

  // The C++ and C libraries go through the same entry points.
  std::vector<std::string> words;
  for (int i = 0; i < 1000; ++i) words.push_back(std::string(i % 200, 'w'));
  char* d = strdup("routed");
  expect(d != nullptr && strcmp(d, "routed") == 0, "strdup");
  free(d);
  FILE* fp = tmpfile();
  expect(fp != nullptr && fprintf(fp, "%s\n", "line") == 5, "stdio");
  if (fp != nullptr) fclose(fp);
}

void threads() {
  std::vector<std::thread> pool;
  for (int t = 0; t < 4; ++t)
    pool.emplace_back([t] {
      std::vector<std::vector<int>> held;
      for (int i = 0; i < 20000; ++i) {
        held.emplace_back(static_cast<size_t>(i % 97 + 1), t);
        if (held.size() > 50) held.erase(held.begin() + i % 50);
      }
      for (const auto& v : held)
        for (int x : v)
          if (x != t) abort();
    });
  for (std::thread& t : pool) t.join();
}

void fork_child() {
  pid_t pid = fork();
  if (pid == 0) {
    void* p = malloc(64);
    free(p);
    _exit(p != nullptr ? 0 : 1);
  }
  int status = 0;
  expect(
      pid > 0 && waitpid(pid, &status, 0) == pid && WIFEXITED(status) && WEXITSTATUS(status) == 0,
      "allocation in a forked child");
}

}  // namespace

int main() {
  entry_points();
  threads();
  fork_child();
  MA_allcheck(__LINE__, "tests/ma_route_probe");
  if (failures == 0) printf("routed allocator: all entry points held\n");
  return failures == 0 ? 0 : 1;
}
