// The size buckets and their free lists: start-up, the allocation entry
// points and the normal (untagged by debug) layout.
#include <unistd.h>

#include <cstring>

#include "Shared/memory/MA_internal.h"

namespace ma_detail {

MaBucket ma_buckets[MA_NBUCKETS];
namespace {
int8_t small_bucket[kBucketSizes[kSmallBuckets - 1] / kAlign + 1];
}  // namespace

bool ma_initialized = false;
std::atomic_flag ma_lock_flag = ATOMIC_FLAG_INIT;

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

namespace {

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

}  // namespace

}  // namespace ma_detail

using namespace ma_detail;

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
    // Blocks freed in a burst (a reload drops ten thousand records) lie
    // scattered on the list, and following it is a cache miss a request.
    // The next request's block is fetched now, while the caller works.
    if (tag->next_free != nullptr) __builtin_prefetch(tag->next_free);
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

void MA_fork_prepare() {
  while (ma_lock_flag.test_and_set(std::memory_order_acquire)) {
  }
}
void MA_fork_parent() { ma_lock_flag.clear(std::memory_order_release); }
void MA_fork_child() { ma_lock_flag.clear(std::memory_order_release); }
