// Linked like the daemon, its allocator routed into the checking one: every C and C++ entry point,
// from several threads and across a fork, must hold (exit 0).
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
#define EXPECT(ok) (failures += !(ok) && fprintf(stderr, "FAILED: %s\n", #ok) > 0)

static bool aligned(const void* p, size_t to) { return reinterpret_cast<uintptr_t>(p) % to == 0; }

int main() {
  // Routed: a 100-byte malloc is a 128-byte bucket block (or exact in debug mode).
  char* p = static_cast<char*>(malloc(100));
  EXPECT(p != nullptr && aligned(p, 16) && malloc_usable_size(p) == (ma_debug ? 104u : 128u));
  memset(p, 'p', 100);
  p = static_cast<char*>(realloc(p, 5000));
  EXPECT(p != nullptr && p[99] == 'p');
  char* z = static_cast<char*>(calloc(1000, 3));
  EXPECT(z != nullptr && std::string(z, 3000) == std::string(3000, '\0'));
  volatile size_t huge = SIZE_MAX / 2;  // keeps the compiler from refusing the call itself
  EXPECT(calloc(huge, 3) == nullptr);

  for (size_t align : {32, 64, 4096}) {
    void *a = aligned_alloc(align, 3 * align), *m = memalign(align, 10), *q = nullptr;
    EXPECT(posix_memalign(&q, align, 1) == 0 && a && m && q && aligned(a, align) &&
           aligned(m, align) && aligned(q, align) && malloc_usable_size(a) >= 3 * align);
    memset(a, 1, 3 * align);
    for (void* f : {realloc(a, 100000), m, q}) free(f);
  }
  void *v = valloc(10), *pv = pvalloc(10);
  EXPECT(aligned(v, 4096) && aligned(pv, 4096) && malloc_usable_size(pv) >= 4096);

  // Beyond the last bucket: served, by a mapping of its own.
  size_t big = size_t{300} << 20;
  char* b = static_cast<char*>(malloc(big));
  EXPECT(b != nullptr && aligned(b, 16) && malloc_usable_size(b) >= big && (b[0] = b[big - 1] = 1));
  b = static_cast<char*>(realloc(b, big * 2));
  EXPECT(b != nullptr && b[0] == 1);

  // The C library goes through the same entry points, and the C++ library in every thread.
  char* d = strdup("routed");
  EXPECT(d != nullptr && strcmp(d, "routed") == 0);
  for (void* f : std::initializer_list<void*>{p, z, v, pv, b, d, nullptr}) free(f);
  FILE* fp = tmpfile();
  EXPECT(fp != nullptr && fprintf(fp, "%s\n", "line") == 5 && fclose(fp) == 0);
  std::vector<std::thread> pool;
  for (int t = 0; t < 4; ++t)
    pool.emplace_back([c = static_cast<char>('a' + t)] {
      std::vector<std::string> held(50);
      for (int i = 0; i < 20000; ++i) held[i % 50] = std::string(i % 389 + 16, c);
      for (const std::string& w : held) w.find_first_not_of(c) == std::string::npos || (abort(), 0);
    });
  for (std::thread& t : pool) t.join();

  int st = 0, pid = fork();
  if (pid == 0) _exit(malloc(64) != nullptr ? 0 : 1);  // allocation in a forked child
  EXPECT(pid > 0 && waitpid(pid, &st, 0) == pid && WIFEXITED(st) && WEXITSTATUS(st) == 0);
  MA_allcheck(__LINE__, "tests/ma_route_probe");
  return failures == 0 && printf("routed allocator: all entry points held\n") > 0 ? 0 : 1;
}
