// A program linked like the daemon, with the process allocator routed into the checking
// allocator: every C and C++ entry point, from several threads and across a fork; exits 0 when
// all held.  Run by ctest in normal and in debug mode.
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

static int failures = 0;

static void expect(bool ok, const char* what) {
  if (!ok) fprintf(stderr, "FAILED: %s\n", what);
  failures += !ok;
}

static bool aligned(const void* p, size_t to) { return reinterpret_cast<uintptr_t>(p) % to == 0; }

int main() {
  // Routed: a 100-byte malloc is a 128-byte bucket block (or exact in debug mode).
  char* p = static_cast<char*>(malloc(100));
  expect(p != nullptr && aligned(p, 16), "malloc");
  expect(malloc_usable_size(p) == (ma_debug ? 104u : 128u), "malloc is routed");
  memset(p, 'p', 100);
  p = static_cast<char*>(realloc(p, 5000));
  expect(p != nullptr && p[99] == 'p', "realloc keeps the bytes");
  free(p);
  char* z = static_cast<char*>(calloc(1000, 3));
  expect(z != nullptr && std::string(z, 3000) == std::string(3000, '\0'), "calloc zeroes");
  free(z);
  volatile size_t huge = SIZE_MAX / 2;  // keeps the compiler from refusing the call itself
  expect(calloc(huge, 3) == nullptr, "calloc overflow");

  for (size_t align : {32, 64, 4096}) {
    void *a = aligned_alloc(align, 3 * align), *m = memalign(align, 10), *q = nullptr;
    expect(posix_memalign(&q, align, 1) == 0, "posix_memalign");
    expect(a && m && q && aligned(a, align) && aligned(m, align) && aligned(q, align) &&
               malloc_usable_size(a) >= 3 * align,
           "aligned entry points");
    memset(a, 1, 3 * align);
    for (void* f : {realloc(a, 100000), m, q}) free(f);
  }
  void *v = valloc(10), *pv = pvalloc(10);
  expect(aligned(v, 4096) && aligned(pv, 4096) && malloc_usable_size(pv) >= 4096, "valloc");
  for (void* f : {v, pv, static_cast<void*>(nullptr)}) free(f);

  // Beyond the last bucket: served, by a mapping of its own.
  size_t big = size_t{300} << 20;
  char* b = static_cast<char*>(malloc(big));
  expect(b != nullptr && aligned(b, 16) && malloc_usable_size(b) >= big, "large malloc");
  if (b != nullptr) b[0] = b[big - 1] = 1;
  b = static_cast<char*>(realloc(b, big * 2));
  expect(b != nullptr && b[0] == 1, "large realloc");
  free(b);

  // The C++ and C libraries go through the same entry points.
  std::vector<std::string> words;
  for (int i = 0; i < 1000; ++i) words.push_back(std::string(i % 200, 'w'));
  char* d = strdup("routed");
  expect(d != nullptr && strcmp(d, "routed") == 0, "strdup");
  free(d);
  FILE* fp = tmpfile();
  expect(fp != nullptr && fprintf(fp, "%s\n", "line") == 5 && fclose(fp) == 0, "stdio");

  std::vector<std::thread> pool;
  for (int t = 0; t < 4; ++t)
    pool.emplace_back([t] {
      std::vector<std::vector<int>> held;
      for (int i = 0; i < 20000; ++i) {
        held.emplace_back(static_cast<size_t>(i % 97 + 1), t);
        if (held.size() > 50) held.erase(held.begin() + i % 50);
      }
      for (const auto& v : held)
        if (v != std::vector<int>(v.size(), t)) abort();
    });
  for (std::thread& t : pool) t.join();

  pid_t pid = fork();
  if (pid == 0) _exit(malloc(64) != nullptr ? 0 : 1);  // allocation in a forked child
  int st = 0;
  expect(pid > 0 && waitpid(pid, &st, 0) == pid && WIFEXITED(st) && WEXITSTATUS(st) == 0, "fork");
  MA_allcheck(__LINE__, "tests/ma_route_probe");
  if (failures == 0) printf("routed allocator: all entry points held\n");
  return failures == 0 ? 0 : 1;
}
