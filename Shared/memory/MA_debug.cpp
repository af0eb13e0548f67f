// Debug blocks: the guarded header and trailer, the list of blocks handed
// out, and the checks a release or a caller runs on them.
#include <cstring>

#include "Shared/memory/MA_internal.h"

namespace ma_detail {

namespace {

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

}  // namespace

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

namespace {

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

}  // namespace

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

}  // namespace ma_detail

using namespace ma_detail;

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
