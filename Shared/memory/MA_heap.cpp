// The heap: one address range reserved at start-up and made usable in steps,
// and what the machine says of its memory.
#include <errno.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/sysinfo.h>

#include <cstring>

#include "Shared/memory/MA_internal.h"

namespace ma_detail {

char* ma_base = nullptr;
char* ma_top = nullptr;
char* ma_committed = nullptr;
char* ma_limit = nullptr;
size_t ma_pagesize = 4096;
long ma_total_swap = -1;

namespace {

constexpr size_t MA_GULP = size_t{1} << 20;  // smallest step of the usable part

long kb(unsigned long n, unsigned int unit) {
  return static_cast<long>(static_cast<unsigned long long>(n) * unit / 1024);
}

// Takes `size` bytes (a multiple of 16) off the heap top, making more of the
// reserved range usable when needed; null when it cannot.
char* ma_getmem(size_t size) {
  if (ma_base == nullptr && !ma_reserve()) return nullptr;
  if (size > static_cast<size_t>(ma_limit - ma_top)) return nullptr;
  if (ma_top + size > ma_committed) {
    size_t want = round_up(static_cast<size_t>(ma_top + size - ma_committed), ma_pagesize);
    size_t step = want > MA_GULP ? want : MA_GULP;
    if (step > static_cast<size_t>(ma_limit - ma_committed)) step = want;
    if (mprotect(ma_committed, step, PROT_READ | PROT_WRITE) != 0) {
      int saved = errno;
      perr("brk() failed to return %d bytes (%dK) (>MA_GULP)\n", static_cast<int>(step),
           static_cast<int>(step / 1024));
      struct rlimit rl {};
      if (saved == ENOMEM && getrlimit(RLIMIT_AS, &rl) == 0 && rl.rlim_cur != RLIM_INFINITY)
        perr(
            "UNIX imposed memory use limit exceeded.\nSee your system administrator to increase "
            "these limits\n");
      return nullptr;
    }
    ma_committed += step;
  }
  char* p = ma_top;
  ma_top += size;
  return p;
}

}  // namespace

void ma_nomem(size_t size, int line, const char* unit, int where) {
  struct sysinfo si {};
  int rc = sysinfo(&si);
  long swap = rc == 0 ? kb(si.freeswap, si.mem_unit) : -1;
  long ram = rc == 0 ? kb(si.freeram, si.mem_unit) : -1;
  perr("alloc for %d bytes failed in %s line %d: %s.\n", static_cast<int>(size), safe(unit), line,
       "Insufficient virtual memory");
  perr("memory used so far = %dkB\n", static_cast<int>((ma_top - ma_base) / 1024));
  perr("%s ERROR: Insufficient virtual memory.\n", "MA_malloc");
  perr(" ________________Insufficient Virtual Memory____________ where = %d\n", where);
  perr(" Requested: %u  Wanted: %u   Swap reportedly available: %u\n", static_cast<unsigned>(size),
       static_cast<unsigned>(round_up(size, kAlign)), static_cast<unsigned>(swap));
  perr(" Total Memory+Swap reportedly available: %u  Memory alone: %u\n",
       static_cast<unsigned>(swap + ram), static_cast<unsigned>(ram));
  perr(" Return Codes...  swapctl: %d  sysmp(A): %d  sysmp(B): %d\n", rc, rc, rc);
}

// Reserves the address range the heap grows in.  Reserving (PROT_NONE) costs
// neither memory nor swap; a smaller range is tried when the address space
// is limited.
bool ma_reserve() {
  for (size_t size = size_t{64} << 30; size >= (size_t{64} << 20); size /= 2) {
    void* p = mmap(nullptr, size, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    if (p == MAP_FAILED) continue;
    ma_base = static_cast<char*>(p);
    ma_top = ma_committed = ma_base;
    ma_limit = ma_base + size;
    return true;
  }
  return false;
}

// A fresh block for bucket `b` in layout `debug`; MA_SCATTER spaces fresh
// debug blocks apart so that an overrun lands in untouched memory.
MaTag* ma_fresh(int b, int debug) {
  MaBucket& bk = ma_buckets[b];
  size_t step = bk.stride[debug];
  if (debug && ma_scatter > 1) step *= static_cast<size_t>(ma_scatter);
  char* p = ma_getmem(step);
  if (p == nullptr) return nullptr;
  bk.made++;
  return reinterpret_cast<MaTag*>(p);
}

}  // namespace ma_detail

using namespace ma_detail;

namespace {

// The machine's memory as sysinfo says it, or false after `complaint` and
// the reason on stderr.
bool machine_memory(const char* complaint, struct sysinfo* si) {
  if (sysinfo(si) == 0) return true;
  perr("%s: %s\n", complaint, strerror(errno));
  return false;
}

}  // namespace

long MA_get_total_swap() {
  struct sysinfo si {};
  if (!machine_memory("Swapctl could not get freeswap number", &si)) return -1;
  return kb(si.totalswap, si.mem_unit);
}

long MA_swap_available() {
  struct sysinfo si {};
  if (!machine_memory("Swapctl could not get freeswap number", &si)) return -1;
  return kb(si.freeswap, si.mem_unit);
}

long MA_get_real_memory_size() {
  struct sysinfo si {};
  if (!machine_memory("Sysmp failed to get size of SINFO", &si)) return -1;
  return kb(si.totalram, si.mem_unit);
}

long MA_get_total_free() {
  struct sysinfo si {};
  if (!machine_memory("Sysmp failed to get the amount of free memory", &si)) return -1;
  return kb(si.freeram, si.mem_unit) + kb(si.freeswap, si.mem_unit);
}

int MA_check_mem_required(size_t bytes) {
  long free_kb = MA_get_total_free();
  if (free_kb < 0 || static_cast<unsigned long long>(free_kb) * 1024 >= bytes) return 1;
  ma_nomem(bytes, 0, kUnit, 2);
  return 0;
}
