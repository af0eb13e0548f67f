// The checking allocator's own parts, shared by its source files and by no
// one else: the block layout, the buckets, the heap range and the settings
// it keeps between calls.  MA_rtns.h is the public manual.
//
// Nothing in the allocator may call malloc, directly or through stdio: when
// the process allocator is routed here, that would come straight back into
// the lock we hold.  Messages go out with snprintf into a stack buffer and
// write(2); getenv, sysinfo, mmap and mprotect do not allocate.
#pragma once

#include <sys/single_threaded.h>

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <cstdlib>

#include "Shared/memory/MA_rtns.h"

namespace ma_detail {

inline constexpr const char* kUnit = "Shared/memory/MA_rtns";

inline constexpr uint32_t kLiveMagic = 0xF0E1D2C3u;
inline constexpr uint32_t kFreeMagic = 0xB45A9678u;
inline constexpr uint32_t kHeaderMagic = 0x0E2C4A68u;
inline constexpr uint32_t kTrailerMagic = 0xF1D3B597u;
inline constexpr uint32_t kStompWord = 0xDEADBEEFu;
inline constexpr size_t kAlign = 8;  // requests are rounded to this

// Some sizes look odd (456, 560, 8200, 262200, 16777320, ...): they were
// fitted to the records the programs allocate most.  Keep them.
inline constexpr size_t kBucketSizes[MA_NBUCKETS] = {
    8,         16,        24,        32,        40,        56,        64,        72,
    128,       256,       456,       512,       560,       1024,      2048,      4096,
    8200,      12000,     20000,     30000,     50000,     110000,    150000,    200000,
    262200,    350000,    500000,    1400000,   2000000,   3000000,   5600000,   10000000,
    16777320,  22369624,  40000000,  67108864,  80000000,  100000000, 120000000, 140000000,
    160000000, 180000000, 200000000, 220000000, 240000000, 268435460};
inline constexpr int kSmallBuckets = 14;  // up to 1024 bytes: found by table

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

struct MaBucket {
  MaTag* free_head[2];  // [0] normal layout, [1] debug layout
  MaDebugHeader* out_head;
  size_t stride[2];
  uint32_t allocs, frees, out, max_out, made;
  uint64_t bytes;  // requested bytes handed out
  uint64_t waste;  // bucket bytes beyond the rounded requests
};

static_assert(sizeof(MaTag) == 16 && sizeof(MaDebugHeader) == 64 && sizeof(MaTrailer) == 16);
inline constexpr size_t kDebugOffset = sizeof(MaTag) + sizeof(MaDebugHeader);

// ---- State (MA_buckets.cpp, MA_heap.cpp, MA_trace.cpp) ----------------------

extern MaBucket ma_buckets[MA_NBUCKETS];
extern bool ma_initialized;
extern char* ma_base;       // start of the reserved range
extern char* ma_top;        // first byte never handed to a bucket
extern char* ma_committed;  // end of the usable part
extern char* ma_limit;      // end of the reserved range
extern size_t ma_pagesize;
extern long ma_total_swap;
extern int ma_opcount;  // allocations and releases of debug blocks so far
extern int ma_tagged;   // ma_opcount at the last MA_tag_allocated
extern int ma_trace_fd;
extern std::atomic_flag ma_lock_flag;

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

inline constexpr size_t round_up(size_t n, size_t to) { return (n + to - 1) / to * to; }

[[noreturn]] inline void ma_die() { abort(); }

inline const char* safe(const char* unit) { return unit != nullptr ? unit : "(null)"; }

inline bool in_heap(const void* p, size_t n) {
  const char* c = static_cast<const char*>(p);
  return c >= ma_base && c < ma_top && n <= static_cast<size_t>(ma_top - c);
}

inline MaTag* tag_of(MaDebugHeader* h) { return reinterpret_cast<MaTag*>(h) - 1; }

// A debug block's header magic sits where a normal block's tag would be.
inline bool is_debug_block(const void* pointer) {
  return *reinterpret_cast<const uint32_t*>(static_cast<const char*>(pointer) - 16) == kHeaderMagic;
}

// ---- Output, trace and traps (MA_trace.cpp) ---------------------------------

void write_all(int fd, const char* text, size_t n);
__attribute__((format(printf, 2, 3))) void fdprint(int fd, const char* format, ...);
#define perr(...) ::ma_detail::fdprint(2, __VA_ARGS__)
[[nodiscard]] bool tracing();
void ma_trace_line(const char* what, const void* user, size_t size, int line, const char* unit);
/// Calls MA_trap at the operation or the source line the settings name.
void ma_traps(int line, const char* unit);

// ---- The heap (MA_heap.cpp) -------------------------------------------------

/// Reserves the address range; false when no range could be had.
bool ma_reserve();
/// A fresh block for bucket `b` in layout `debug` (0 or 1); null when the
/// heap cannot grow.
[[nodiscard]] MaTag* ma_fresh(int b, int debug);
/// Says on stderr that `size` bytes could not be had.
void ma_nomem(size_t size, int line, const char* unit, int where);

// ---- Debug blocks (MA_debug.cpp) --------------------------------------------

/// Checks one debug block: 1 when sound, 0 after saying what is wrong.
[[nodiscard]] int ma_check_item(MaDebugHeader* h, bool expect_free);
[[noreturn]] void ma_check_failed(MaDebugHeader* h, int line, const char* unit);
[[nodiscard]] void* debug_malloc(int b, size_t size, int line, const char* unit);
void debug_free(void* pointer, int line, const char* unit);

// ---- Buckets (MA_buckets.cpp) -----------------------------------------------

/// Puts a normal block (or one made before debug mode) on its free list;
/// aborts on a block that is not live.
void normal_free(MaTag* tag, int line, const char* unit);

}  // namespace ma_detail
