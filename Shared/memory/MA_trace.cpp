// The trace of every operation, the debugger's stop points, and the reports
// on the buckets and the blocks handed out.
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstring>

#include "Shared/memory/MA_internal.h"

namespace ma_detail {

int ma_opcount = 0;
int ma_tagged = 0;
int ma_trace_fd = -1;

namespace {
int ma_tstack[16];
int ma_tdepth = 0;
}  // namespace

void write_all(int fd, const char* text, size_t n) {
  while (n > 0) {
    ssize_t w = write(fd, text, n);
    if (w < 0 && errno == EINTR) continue;
    if (w <= 0) return;
    text += w;
    n -= static_cast<size_t>(w);
  }
}

__attribute__((format(printf, 2, 3))) void fdprint(int fd, const char* format, ...) {
  if (fd < 0) return;
  char buffer[512];
  va_list ap;
  va_start(ap, format);
  int n = vsnprintf(buffer, sizeof buffer, format, ap);
  va_end(ap);
  if (n < 0) return;
  write_all(fd, buffer,
            static_cast<size_t>(n) < sizeof buffer ? static_cast<size_t>(n) : sizeof buffer - 1);
}

bool tracing() {
  return ma_trace > 0 && ma_tstart && ma_trace_fd >= 0 && (ma_stop <= 0 || ma_opcount <= ma_stop);
}

void ma_trace_line(const char* what, const void* user, size_t size, int line, const char* unit) {
  if (!tracing()) return;
  fdprint(ma_trace_fd, "%s 0x%08lx %-6d %-4d %s\n", what,
          static_cast<unsigned long>(reinterpret_cast<uintptr_t>(user)), static_cast<int>(size),
          line, safe(unit));
}

void ma_traps(int line, const char* unit) {
  if ((ma_start > 0 && ma_opcount == ma_start) || (ma_stop > 0 && ma_opcount == ma_stop)) MA_trap();
  if (ma_line != 0 && line == ma_line && ma_file != nullptr && unit != nullptr &&
      strcmp(unit, ma_file) == 0)
    MA_trap();
}

}  // namespace ma_detail

using namespace ma_detail;

void MA_trace(int on) { ma_tstart = on ? 1 : 0; }

void MA_tpush(int level) {
  if (ma_tdepth >= static_cast<int>(sizeof ma_tstack / sizeof ma_tstack[0])) {
    perr("trace stack overflow\n");
    return;
  }
  ma_tstack[ma_tdepth++] = ma_trace;
  ma_trace = level;
}

void MA_tpop() {
  if (ma_tdepth <= 0) {
    perr("trace stack underflow\n");
    return;
  }
  ma_trace = ma_tstack[--ma_tdepth];
}

void MA_comment(const char* text) {
  if (tracing()) fdprint(ma_trace_fd, "# %s\n", safe(text));
}

// Kept out of line and observable so that a debugger can stop here.
__attribute__((noinline)) void MA_trap() {
  perr("MA_trap called\n");
  asm volatile("" ::: "memory");
}

void MA_stats(int fd) {
  MaLock lock;
  fdprint(fd, "Bucket Allocs  Frees MaxAll MaxFree TotalAllocated Average    Size\n");
  unsigned long total_allocs = 0, total_frees = 0;
  unsigned long long handed = 0, requested = 0, wasted = 0;
  for (int b = 0; b < MA_NBUCKETS; ++b) {
    const MaBucket& bk = ma_buckets[b];
    if (bk.allocs == 0 && bk.made == 0) continue;
    uint32_t max_free = bk.made > bk.out ? bk.made - bk.out : 0;
    int average = bk.allocs ? static_cast<int>(bk.bytes / bk.allocs) : 0;
    fdprint(fd, "%4d%9d%7d", b, static_cast<int>(bk.allocs), static_cast<int>(bk.frees));
    fdprint(fd, "%7d%7d%13d", static_cast<int>(bk.max_out), static_cast<int>(max_free),
            static_cast<int>(bk.bytes));
    fdprint(fd, "%10d%9d\n", average, static_cast<int>(kBucketSizes[b]));
    total_allocs += bk.allocs;
    total_frees += bk.frees;
    requested += bk.bytes;
    wasted += bk.waste;
    handed += static_cast<unsigned long long>(bk.allocs) * kBucketSizes[b];
  }
  // The total row starts with a literal "%Tot".
  fdprint(fd, "%%Tot %9d%7d\n", static_cast<int>(total_allocs), static_cast<int>(total_frees));
  fdprint(fd, "Top of memory is 0x%08lx\n",
          static_cast<unsigned long>(reinterpret_cast<uintptr_t>(ma_top)));
  fdprint(fd, "Memory efficiency %lf\n",
          handed ? static_cast<double>(requested) / static_cast<double>(handed) : 1.0);
  fdprint(fd, "Total wasted due to size problems %ld\n", static_cast<long>(wasted));
  fdprint(fd, "Total memory operations %d\n", ma_opcount);
}

namespace {
void dump_blocks(int fd, int after) {
  for (int b = 0; b < MA_NBUCKETS; ++b)
    for (MaDebugHeader* h = ma_buckets[b].out_head; h != nullptr; h = h->next) {
      if (h->seq <= after) continue;
      fdprint(fd, "alloc   0x%08lx %-6d %-4d %s\n",
              static_cast<unsigned long>(reinterpret_cast<uintptr_t>(h->user)),
              static_cast<int>(reinterpret_cast<char*>(h->trailer) - static_cast<char*>(h->user)),
              static_cast<int>(h->line), safe(h->unit));
    }
}
}  // namespace

void MA_dump_alloc_list(int fd) {
  MaLock lock;
  dump_blocks(fd, 0);
}

void MA_tag_allocated() {
  MaLock lock;
  ma_tagged = ma_opcount;
}

void MA_leak_report(int fd) {
  MaLock lock;
  fdprint(fd, "Leak Report {\n");
  dump_blocks(fd, ma_tagged);
  fdprint(fd, "}\n");
}

void MA_exit() {
  if (!ma_debug) return;
  int fd = ma_trace_fd >= 0 ? ma_trace_fd : 2;
  MA_stats(fd);
  MA_leak_report(fd);
  if (ma_trace_fd >= 0) {
    close(ma_trace_fd);
    ma_trace_fd = -1;
  }
}
