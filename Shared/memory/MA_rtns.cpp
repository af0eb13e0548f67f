#include "Shared/memory/MA_rtns.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/single_threaded.h>
#include <sys/sysinfo.h>
#include <unistd.h>

#include <atomic>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>

// Nothing in this file may call malloc, directly or through stdio: when the
// process allocator is routed here, that would come straight back into the
// lock we hold.  Messages go out with snprintf into a stack buffer and
// write(2); getenv, sysinfo, mmap and mprotect do not allocate.

int ma_debug = 0;
int ma_trace = 0;
int ma_scatter = 1;
int ma_chkalloc = 0;
int ma_chkfree = 0;
int ma_tstart = 0;
int ma_stomp = 0;
int ma_start = 0;
int ma_stop = 0;
int ma_line = 0;
const char* ma_file = nullptr;

namespace {

constexpr const char* kUnit = "Shared/memory/MA_rtns";

constexpr uint32_t kLiveMagic = 0xF0E1D2C3u;
constexpr uint32_t kFreeMagic = 0xB45A9678u;
constexpr uint32_t kHeaderMagic = 0x0E2C4A68u;
constexpr uint32_t kTrailerMagic = 0xF1D3B597u;
constexpr uint32_t kStompWord = 0xDEADBEEFu;
constexpr size_t kAlign = 8;  // requests are rounded to this

// Some sizes look odd (456, 560, 8200, 262200, 16777320, ...): they were
// fitted to the records the programs allocate most.  Keep them.
constexpr size_t kBucketSizes[MA_NBUCKETS] = {
    8,         16,        24,        32,        40,        56,        64,        72,
    128,       256,       456,       512,       560,       1024,      2048,      4096,
    8200,      12000,     20000,     30000,     50000,     110000,    150000,    200000,
    262200,    350000,    500000,    1400000,   2000000,   3000000,   5600000,   10000000,
    16777320,  22369624,  40000000,  67108864,  80000000,  100000000, 120000000, 140000000,
    160000000, 180000000, 200000000, 220000000, 240000000, 268435460};
constexpr int kSmallBuckets = 14;  // up to 1024 bytes: found by table

struct MaTrailer;

// Every block starts with a tag: bucket index, state magic, and the link of
// the bucket's free list while the block is free (kept out of the user data
// so that a stomped free block is 0xDEADBEEF from end to end).
struct MaTag {
  uint32_t bucket;
  uint32_t state;
  MaTag* next_free;
};

// Debug mode only, between the tag and the user data.  The magic sits right
// before `user`, so its word is 16 bytes before the user data: a release can
// tell a debug block from a normal one (whose tag is there) by that word.
struct MaDebugHeader {
  MaDebugHeader* prev;  // bucket's list of handed-out blocks
  MaDebugHeader* next;
  const char* unit;
  MaTrailer* trailer;  // non-zero for a block that was handed out
  intptr_t line;
  intptr_t seq;
  uint32_t magic;
  uint32_t zero;
  void* user;
};

struct MaTrailer {
  MaDebugHeader* header;
  uintptr_t magic;
};

static_assert(sizeof(MaTag) == 16 && sizeof(MaDebugHeader) == 64 && sizeof(MaTrailer) == 16);
constexpr size_t kDebugOffset = sizeof(MaTag) + sizeof(MaDebugHeader);

struct MaBucket {
  MaTag* free_head[2];  // [0] normal layout, [1] debug layout
  MaDebugHeader* out_head;
  size_t stride[2];
  uint32_t allocs, frees, out, max_out, made;
  uint64_t bytes;  // requested bytes handed out
  uint64_t waste;  // bucket bytes beyond the rounded requests
};

MaBucket ma_buckets[MA_NBUCKETS];
int8_t small_bucket[kBucketSizes[kSmallBuckets - 1] / kAlign + 1];

bool ma_initialized = false;
char* ma_base = nullptr;       // start of the reserved range
char* ma_top = nullptr;        // first byte never handed to a bucket
char* ma_committed = nullptr;  // end of the usable part
char* ma_limit = nullptr;      // end of the reserved range
size_t ma_pagesize = 4096;
long ma_total_swap = -1;
int ma_opcount = 0;
int ma_tagged = 0;
int ma_trace_fd = -1;
int ma_tstack[16];
int ma_tdepth = 0;

constexpr size_t MA_GULP = size_t{1} << 20;  // smallest step of the usable part

std::atomic_flag ma_lock_flag = ATOMIC_FLAG_INIT;

// The lock is skipped while the process has one thread: a thread is only
// created by a call that the same thread makes between two of ours.
struct MaLock {
  bool taken;
  MaLock() : taken(!__libc_single_threaded) {
    if (taken)
      while (ma_lock_flag.test_and_set(std::memory_order_acquire)) {
      }
  }
  ~MaLock() {
    if (taken) ma_lock_flag.clear(std::memory_order_release);
  }
  MaLock(const MaLock&) = delete;
  MaLock& operator=(const MaLock&) = delete;
};

constexpr size_t round_up(size_t n, size_t to) { return (n + to - 1) / to * to; }

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

#define perr(...) fdprint(2, __VA_ARGS__)

[[noreturn]] void ma_die() { abort(); }

const char* safe(const char* unit) { return unit != nullptr ? unit : "(null)"; }

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

long kb(unsigned long n, unsigned int unit) {
  return static_cast<long>(static_cast<unsigned long long>(n) * unit / 1024);
}

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

bool in_heap(const void* p, size_t n) {
  const char* c = static_cast<const char*>(p);
  return c >= ma_base && c < ma_top && n <= static_cast<size_t>(ma_top - c);
}

MaTag* tag_of(MaDebugHeader* h) { return reinterpret_cast<MaTag*>(h) - 1; }

// Reports the first word of a stomped free block that no longer holds the
// fill, with up to four words from there on.
void report_reuse(const uint32_t* base, const uint32_t* at, const uint32_t* end) {
  perr("base 0x%08x: offset=%d\n", static_cast<unsigned>(reinterpret_cast<uintptr_t>(base)),
       static_cast<int>((at - base) * 4));
  perr("Free block reused at\n");
  char line[128];
  int n = snprintf(line, sizeof line, "0x%08x: '",
                   static_cast<unsigned>(reinterpret_cast<uintptr_t>(at)));
  for (int i = 0; i < 4 && at + i < end && n > 0 && static_cast<size_t>(n) < sizeof line - 16; ++i)
    n += snprintf(line + n, sizeof line - static_cast<size_t>(n), "%s0x%08x", i ? " " : "", at[i]);
  perr("%s'\n", line);
}

// Checks one debug block: 1 when sound, 0 after saying what is wrong.
int ma_check_item(MaDebugHeader* h, bool expect_free) {
  char* user = reinterpret_cast<char*>(h + 1);
  if (h->magic != kHeaderMagic || h->user != user) perr("Header damage\n");
  MaTrailer* t = h->trailer;
  if (!in_heap(t, sizeof *t) || reinterpret_cast<uintptr_t>(t) % kAlign != 0 ||
      reinterpret_cast<char*>(t) < user || t->header != h || t->magic != kTrailerMagic) {
    perr("Trailer damage\n");
    return 0;
  }
  if (tag_of(h)->state != (expect_free ? kFreeMagic : kLiveMagic)) {
    perr("Bad magic number\n");
    return 0;
  }
  if (expect_free && ma_stomp) {
    const uint32_t* w = reinterpret_cast<const uint32_t*>(user);
    const uint32_t* end = reinterpret_cast<const uint32_t*>(t);
    for (const uint32_t* p = w; p < end; ++p)
      if (*p != kStompWord) {
        report_reuse(w, p, end);
        return 0;
      }
  }
  return 1;
}

[[noreturn]] void ma_check_failed(MaDebugHeader* h, int line, const char* unit) {
  perr("Memory allocated from %s line %d\n", safe(h->unit), static_cast<int>(h->line));
  perr("Memory check failed in '%s' line %d\n", safe(unit), line);
  ma_die();
}

bool ma_all_sound(int line, const char* unit) {
  for (int b = 0; b < MA_NBUCKETS; ++b) {
    for (MaDebugHeader* h = ma_buckets[b].out_head; h != nullptr; h = h->next)
      if (!ma_check_item(h, false)) ma_check_failed(h, line, unit);
    for (MaTag* t = ma_buckets[b].free_head[1]; t != nullptr; t = t->next_free) {
      MaDebugHeader* h = reinterpret_cast<MaDebugHeader*>(t + 1);
      if (!ma_check_item(h, true)) ma_check_failed(h, line, unit);
    }
  }
  return true;
}

int bucket_of(size_t size) {
  if (size > MA_MAXREQUEST) return -1;
  if (size <= kBucketSizes[kSmallBuckets - 1]) return small_bucket[(size + kAlign - 1) / kAlign];
  size_t r = round_up(size, kAlign);
  for (int b = kSmallBuckets; b < MA_NBUCKETS; ++b)
    if (kBucketSizes[b] >= r) return b;
  return MA_NBUCKETS - 1;  // the last size is not a multiple of 8
}

void ma_setup_tables() {
  int b = 0;
  for (size_t i = 0; i < sizeof small_bucket; ++i) {
    while (kBucketSizes[b] < i * kAlign) ++b;
    small_bucket[i] = static_cast<int8_t>(b);
  }
  for (int i = 0; i < MA_NBUCKETS; ++i) {
    size_t user = round_up(kBucketSizes[i], kAlign);
    ma_buckets[i].stride[0] = round_up(sizeof(MaTag) + user, 16);
    ma_buckets[i].stride[1] = round_up(kDebugOffset + user + sizeof(MaTrailer), 16);
  }
}

void* debug_malloc(int b, size_t size, int line, const char* unit) {
  MaBucket& bk = ma_buckets[b];
  bool reused = bk.free_head[1] != nullptr;
  MaTag* tag = reused ? bk.free_head[1] : ma_fresh(b, 1);
  if (tag == nullptr) {
    ma_nomem(size, line, unit, 1);
    return nullptr;
  }
  MaDebugHeader* h = reinterpret_cast<MaDebugHeader*>(tag + 1);
  if (reused && ma_chkalloc && !ma_check_item(h, true)) ma_check_failed(h, line, unit);
  if (reused) bk.free_head[1] = tag->next_free;
  tag->bucket = static_cast<uint32_t>(b);
  tag->state = kLiveMagic;
  tag->next_free = nullptr;
  char* user = reinterpret_cast<char*>(h + 1);
  size_t rounded = round_up(size, kAlign);
  h->magic = kHeaderMagic;
  h->zero = 0;
  h->user = user;
  h->unit = unit;
  h->line = line;
  h->seq = ++ma_opcount;
  h->trailer = reinterpret_cast<MaTrailer*>(user + rounded);
  h->trailer->header = h;
  h->trailer->magic = kTrailerMagic;
  h->prev = nullptr;
  h->next = bk.out_head;
  if (bk.out_head != nullptr) bk.out_head->prev = h;
  bk.out_head = h;
  if (ma_stomp) memset(user, 0x01, rounded);
  bk.allocs++;
  bk.out++;
  if (bk.out > bk.max_out) bk.max_out = bk.out;
  bk.bytes += size;
  bk.waste += kBucketSizes[b] - (rounded < kBucketSizes[b] ? rounded : kBucketSizes[b]);
  ma_traps(line, unit);
  ma_trace_line("alloc  ", user, size, line, unit);
  return user;
}

void debug_free(void* pointer, int line, const char* unit);

void normal_free(MaTag* tag, int line, const char* unit) {
  if (tag->state != kLiveMagic || tag->bucket >= MA_NBUCKETS) {
    if (tag->state == kFreeMagic)
      perr("Freeing memory twice in %s line %d\n", safe(unit), line);
    else
      perr("Magic number in freed memory is incorect. %s line %d\n", safe(unit), line);
    ma_die();
  }
  MaBucket& bk = ma_buckets[tag->bucket];
  tag->state = kFreeMagic;
  tag->next_free = bk.free_head[0];
  bk.free_head[0] = tag;
}

// A debug block's header magic sits where a normal block's tag would be.
bool is_debug_block(const void* pointer) {
  return *reinterpret_cast<const uint32_t*>(static_cast<const char*>(pointer) - 16) == kHeaderMagic;
}

void debug_free(void* pointer, int line, const char* unit) {
  char* p = static_cast<char*>(pointer);
  if (!in_heap(p - kDebugOffset, kDebugOffset)) {
    perr("Free of garbage pointer 0x%08lx in %s line %d\n",
         static_cast<unsigned long>(reinterpret_cast<uintptr_t>(p)), safe(unit), line);
    ma_die();
  }
  MaDebugHeader* h = reinterpret_cast<MaDebugHeader*>(p) - 1;
  if (h->magic != kHeaderMagic) {
    // A block made before debug mode was switched on.
    MaTag* t = reinterpret_cast<MaTag*>(p) - 1;
    if (t->bucket < MA_NBUCKETS && (t->state == kLiveMagic || t->state == kFreeMagic)) {
      normal_free(t, line, unit);
      return;
    }
    perr("Magic number in freed memory is incorect. %s line %d\n", safe(unit), line);
    ma_die();
  }
  MaTag* tag = tag_of(h);
  MaTrailer* t = h->trailer;
  if (h->user != p || tag->bucket >= MA_NBUCKETS || !in_heap(t, sizeof *t) ||
      reinterpret_cast<char*>(t) < p ||
      static_cast<size_t>(reinterpret_cast<char*>(t) - p) > kBucketSizes[tag->bucket] + kAlign) {
    perr("Freeing damaged memory in %s line %d\n", safe(unit), line);
    ma_die();
  }
  ++ma_opcount;
  ma_traps(line, unit);
  if (tag->state == kFreeMagic) {
    perr("Freeing memory twice in %s line %d\n", safe(unit), line);
    ma_die();
  }
  if (ma_chkfree) {
    if (!ma_check_item(h, false)) ma_check_failed(h, line, unit);
    if (ma_chkfree == 1) {
      if (h->prev != nullptr && !ma_check_item(h->prev, false))
        ma_check_failed(h->prev, line, unit);
      if (h->next != nullptr && !ma_check_item(h->next, false))
        ma_check_failed(h->next, line, unit);
    } else {
      ma_all_sound(line, unit);
    }
  }
  size_t size = static_cast<size_t>(reinterpret_cast<char*>(t) - p);
  if (ma_stomp && h->trailer != nullptr) {
    uint32_t* w = reinterpret_cast<uint32_t*>(p);
    for (size_t i = 0; i < size / 4; ++i) w[i] = kStompWord;
  }
  ma_trace_line("free   ", p, size, line, unit);
  MaBucket& bk = ma_buckets[tag->bucket];
  if (h->prev != nullptr) h->prev->next = h->next;
  if (h->next != nullptr) h->next->prev = h->prev;
  if (bk.out_head == h) bk.out_head = h->next;
  h->prev = h->next = nullptr;
  tag->next_free = bk.free_head[1];
  bk.free_head[1] = tag;
  tag->state = kFreeMagic;
  bk.frees++;
  bk.out--;
}

void ma_init_locked() {
  if (ma_initialized) return;
  long page = getpagesize();
  ma_pagesize = page > 0 ? static_cast<size_t>(page) : 4096;
  ma_setup_tables();
  MA_read_settings();
  ma_reserve();
  ma_initialized = true;
  // Prime the free lists of the small sizes every program asks for first.
  int layout = ma_debug ? 1 : 0;
  for (int b = 0; b < kSmallBuckets - 1; ++b)
    for (int i = 0; i < 3; ++i) {
      MaTag* t = ma_fresh(b, layout);
      if (t == nullptr) break;
      t->bucket = static_cast<uint32_t>(b);
      t->state = kFreeMagic;
      if (layout) {
        // A primed debug block must pass the free-block check like any other.
        MaDebugHeader* h = reinterpret_cast<MaDebugHeader*>(t + 1);
        char* user = reinterpret_cast<char*>(h + 1);
        h->magic = kHeaderMagic;
        h->user = user;
        h->unit = kUnit;
        h->line = __LINE__;
        h->trailer = reinterpret_cast<MaTrailer*>(user + kBucketSizes[b]);
        h->trailer->header = h;
        h->trailer->magic = kTrailerMagic;
        if (ma_stomp) {
          uint32_t* w = reinterpret_cast<uint32_t*>(user);
          for (size_t k = 0; k < kBucketSizes[b] / 4; ++k) w[k] = kStompWord;
        }
      }
      t->next_free = ma_buckets[b].free_head[layout];
      ma_buckets[b].free_head[layout] = t;
    }
  ma_total_swap = MA_get_total_swap();
}

int env_int(const char* name, int fallback) {
  const char* v = getenv(name);
  return v != nullptr ? atoi(v) : fallback;
}

}  // namespace

void MA_read_settings() {
  ma_debug = env_int("MA_DEBUG", 0);
  if (ma_debug == 0) return;
  ma_trace = env_int("MA_TRACE", 0);
  ma_scatter = env_int("MA_SCATTER", 1);
  if (ma_scatter < 1) ma_scatter = 1;
  ma_chkalloc = env_int("MA_ACHECK", 0);
  ma_chkfree = env_int("MA_FCHECK", 0);
  ma_tstart = getenv("MA_TSTART") != nullptr ? 1 : 0;
  ma_stomp = getenv("MA_STOMP") != nullptr ? 1 : 0;
  ma_start = env_int("MA_START", 0);
  if (ma_start < 0) ma_start = 0;
  ma_stop = env_int("MA_STOP", 0);
  ma_line = env_int("MA_LINE", 0);
  ma_file = getenv("MA_FILE");
  const char* home = getenv("HOME");
  if (ma_trace_fd < 0 && ma_trace > 0 && home != nullptr) {
    char path[4096];
    int n = snprintf(path, sizeof path, "%s/trace", home);
    if (n > 0 && static_cast<size_t>(n) < sizeof path) {
      ma_trace_fd = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
      if (ma_trace_fd >= 0) {
        // Kept from the first version of the trace, which proved the file
        // writable this way before anything was traced.
        write_all(ma_trace_fd, "Kludge", 6);
        lseek(ma_trace_fd, 0, SEEK_SET);
      }
    }
  }
}

void MA_init() {
  if (ma_initialized) return;
  MaLock lock;
  ma_init_locked();
}

int MA_bucket_of(size_t size) {
  if (!ma_initialized) MA_init();
  return bucket_of(size);
}

size_t MA_bucket_size(int bucket) {
  return bucket >= 0 && bucket < MA_NBUCKETS ? kBucketSizes[bucket] : 0;
}

void* MA_malloc(size_t size, int line, const char* unit, int /*flag: always 1, no effect*/) {
  if (__builtin_expect(!ma_initialized, 0)) MA_init();
  if (size > MA_MAXREQUEST) {
    perr("Bucket request of %d too large! in %s line %d\n", static_cast<int>(size), safe(unit),
         line);
    return nullptr;
  }
  int b = bucket_of(size);
  MaLock lock;
  if (ma_debug) return debug_malloc(b, size, line, unit);
  MaBucket& bk = ma_buckets[b];
  MaTag* tag = bk.free_head[0];
  if (__builtin_expect(tag != nullptr, 1)) {
    bk.free_head[0] = tag->next_free;
  } else {
    tag = ma_fresh(b, 0);
    if (tag == nullptr) {
      ma_nomem(size, line, unit, 0);
      return nullptr;
    }
  }
  tag->bucket = static_cast<uint32_t>(b);
  tag->state = kLiveMagic;
  return tag + 1;
}

void MA_free(void* pointer, int line, const char* unit) {
  if (pointer == nullptr) {
    // The queue code frees fields that may never have been set, as C's
    // free allows; only the strictest checking treats that as a fault.
    if (ma_debug && ma_chkfree >= 2) {
      perr("Free of NULL in %s line %d\n", safe(unit), line);
      ma_die();
    }
    return;
  }
  MaLock lock;
  if (ma_debug || is_debug_block(pointer)) {
    debug_free(pointer, line, unit);
    return;
  }
  normal_free(static_cast<MaTag*>(pointer) - 1, line, unit);
}

void* MA_calloc(size_t count, size_t size, int line, const char* unit) {
  size_t total = 0;
  if (__builtin_mul_overflow(count, size, &total)) total = MA_MAXREQUEST + 1;
  void* p = MA_malloc(total, line, unit, 1);
  if (p != nullptr) memset(p, 0, total);
  return p;
}

size_t MA_usable_size(const void* pointer) {
  if (pointer == nullptr) return 0;
  if (is_debug_block(pointer)) {
    const MaDebugHeader* h = static_cast<const MaDebugHeader*>(pointer) - 1;
    return static_cast<size_t>(reinterpret_cast<const char*>(h->trailer) -
                               static_cast<const char*>(pointer));
  }
  return kBucketSizes[(static_cast<const MaTag*>(pointer) - 1)->bucket];
}

void* MA_realloc(void* pointer, size_t size, int line, const char* unit) {
  if (pointer == nullptr) return MA_malloc(size, line, unit, 1);
  // A normal block that still fits its bucket stays where it is; a debug
  // block always moves, so the trace and the owner name the new caller.
  if (!ma_debug && !is_debug_block(pointer) &&
      (static_cast<MaTag*>(pointer) - 1)->bucket == static_cast<uint32_t>(bucket_of(size)))
    return pointer;
  void* fresh = MA_malloc(size, line, unit, 1);
  if (fresh == nullptr) return nullptr;
  size_t old = MA_usable_size(pointer);
  memcpy(fresh, pointer, old < size ? old : size);
  MA_free(pointer, line, unit);
  return fresh;
}

char* MA_strdup(const char* text, int line, const char* unit) {
  if (text == nullptr) return nullptr;
  size_t n = strlen(text) + 1;
  char* copy = static_cast<char*>(MA_malloc(n, line, unit, 1));
  if (copy != nullptr) memcpy(copy, text, n);
  return copy;
}

void MA_check(void* pointer, int line, const char* unit) {
  if (!ma_debug || pointer == nullptr || !is_debug_block(pointer)) return;
  MaLock lock;
  if (tracing()) fdprint(ma_trace_fd, "Doing MA_CHECK in line %d in '%s'\n", line, safe(unit));
  MaDebugHeader* h = static_cast<MaDebugHeader*>(pointer) - 1;
  if (!ma_check_item(h, false)) ma_check_failed(h, line, unit);
  if (tracing()) fdprint(ma_trace_fd, "MA_CHECK OK in '%s' line %d\n", safe(unit), line);
}

int MA_checkit(void* pointer) {
  if (!ma_debug || pointer == nullptr || !is_debug_block(pointer)) return 1;
  MaLock lock;
  MaDebugHeader* h = static_cast<MaDebugHeader*>(pointer) - 1;
  if (ma_check_item(h, false)) return 1;
  perr("Checkit failed %ld %s\n", static_cast<long>(h->line), safe(h->unit));
  return 0;
}

void MA_allcheck(int line, const char* unit) {
  if (!ma_debug) return;
  MaLock lock;
  ma_all_sound(line, unit);
}

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

long MA_get_total_swap() {
  struct sysinfo si {};
  if (sysinfo(&si) != 0) {
    perr("Swapctl could not get freeswap number: %s\n", strerror(errno));
    return -1;
  }
  return kb(si.totalswap, si.mem_unit);
}

long MA_swap_available() {
  struct sysinfo si {};
  if (sysinfo(&si) != 0) {
    perr("Swapctl could not get freeswap number: %s\n", strerror(errno));
    return -1;
  }
  return kb(si.freeswap, si.mem_unit);
}

long MA_get_real_memory_size() {
  struct sysinfo si {};
  if (sysinfo(&si) != 0) {
    perr("Sysmp failed to get size of SINFO: %s\n", strerror(errno));
    return -1;
  }
  return kb(si.totalram, si.mem_unit);
}

long MA_get_total_free() {
  struct sysinfo si {};
  if (sysinfo(&si) != 0) {
    perr("Sysmp failed to get the amount of free memory: %s\n", strerror(errno));
    return -1;
  }
  return kb(si.freeram, si.mem_unit) + kb(si.freeswap, si.mem_unit);
}

int MA_check_mem_required(size_t bytes) {
  long free_kb = MA_get_total_free();
  if (free_kb < 0 || static_cast<unsigned long long>(free_kb) * 1024 >= bytes) return 1;
  ma_nomem(bytes, 0, kUnit, 2);
  return 0;
}

void MA_fork_prepare() {
  while (ma_lock_flag.test_and_set(std::memory_order_acquire)) {
  }
}
void MA_fork_parent() { ma_lock_flag.clear(std::memory_order_release); }
void MA_fork_child() { ma_lock_flag.clear(std::memory_order_release); }
