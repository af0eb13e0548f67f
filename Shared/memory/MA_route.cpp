// The process allocator entry points, served by the checking allocator, so
// that every allocation of a program linked with this object (its own, the
// C++ library's, the C library's) passes through MA_malloc and MA_free with
// line 0 and the entry point's name as the unit.  Linked into the daemon and
// the tools, never into sanitizer builds (they replace these themselves).
//
// Two kinds of block do not fit the buckets and carry their own tag, 16
// bytes before the pointer handed out, where a bucket block has its tag (or,
// in debug mode, its header magic):
//  - requests beyond the last bucket: MA_malloc refuses those with a message,
//    which is right for the queue code, whose records are small; but the C and
//    C++ libraries may legitimately ask for more (a large vector, a sort
//    buffer), and a refusal there ends in an exception or a crash far from any
//    line the message could name.  They get a mapping of their own, given
//    back at release.
//  - alignments above 16 bytes: a larger bucket block, and the pointer inside
//    it, with a tag that leads back to the block.
#include <errno.h>
#include <malloc.h>
#include <pthread.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "Shared/memory/MA_rtns.h"

namespace {

constexpr uint32_t kLiveMagic = 0xF0E1D2C3u;
// Bucket words no bucket block has (they are < 46, a debug header magic is
// 0x0E2C4A68).
constexpr uint32_t kMappedBlock = 0x7FFF0001u;
constexpr uint32_t kAlignedBlock = 0x7FFF0002u;

struct RouteTag {
  uint32_t bucket;
  uint32_t state;
  uintptr_t extra;  // mapped: the mapping's length; aligned: the bucket block
};
static_assert(sizeof(RouteTag) == 16);

RouteTag* tag_of(void* p) { return static_cast<RouteTag*>(p) - 1; }

bool is_special(void* p, uint32_t kind) {
  RouteTag* t = tag_of(p);
  return t->bucket == kind && t->state == kLiveMagic;
}

void* mapped_alloc(size_t size) {
  size_t page = static_cast<size_t>(getpagesize());
  if (size > SIZE_MAX - page - sizeof(RouteTag)) return nullptr;
  size_t length = (size + sizeof(RouteTag) + page - 1) / page * page;
  void* p = mmap(nullptr, length, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  if (p == MAP_FAILED) return nullptr;
  RouteTag* t = static_cast<RouteTag*>(p);
  t->bucket = kMappedBlock;
  t->state = kLiveMagic;
  t->extra = length;
  return t + 1;
}

void* route_alloc(size_t size, const char* unit) {
  void* p = size > MA_MAXREQUEST ? mapped_alloc(size) : MA_malloc(size, 0, unit, 1);
  if (p == nullptr) errno = ENOMEM;
  return p;
}

void route_free(void* p, const char* unit) {
  if (p == nullptr) return;
  if (is_special(p, kMappedBlock)) {
    RouteTag* t = tag_of(p);
    t->state = 0;
    munmap(t, t->extra);
    return;
  }
  if (is_special(p, kAlignedBlock)) {
    RouteTag* t = tag_of(p);
    t->state = 0;
    MA_free(reinterpret_cast<void*>(t->extra), 0, unit);
    return;
  }
  MA_free(p, 0, unit);
}

size_t route_usable(void* p) {
  if (p == nullptr) return 0;
  if (is_special(p, kMappedBlock)) return tag_of(p)->extra - sizeof(RouteTag);
  if (is_special(p, kAlignedBlock)) {
    char* block = reinterpret_cast<char*>(tag_of(p)->extra);
    return MA_usable_size(block) - static_cast<size_t>(static_cast<char*>(p) - block);
  }
  return MA_usable_size(p);
}

void* route_aligned(size_t alignment, size_t size, const char* unit) {
  if (alignment <= 16) return route_alloc(size, unit);
  if (size > SIZE_MAX - alignment - sizeof(RouteTag)) {
    errno = ENOMEM;
    return nullptr;
  }
  char* block = static_cast<char*>(route_alloc(size + alignment + sizeof(RouteTag), unit));
  if (block == nullptr) return nullptr;
  uintptr_t at = (reinterpret_cast<uintptr_t>(block) + sizeof(RouteTag) + alignment - 1) &
                 ~(uintptr_t{alignment} - 1);
  void* p = reinterpret_cast<void*>(at);
  RouteTag* t = tag_of(p);
  t->bucket = kAlignedBlock;
  t->state = kLiveMagic;
  t->extra = reinterpret_cast<uintptr_t>(block);
  return p;
}

bool power_of_two(size_t n) { return n != 0 && (n & (n - 1)) == 0; }

void* route_realloc(void* p, size_t size) {
  if (p == nullptr) return route_alloc(size, "realloc");
  if (size == 0) {
    route_free(p, "realloc");
    return nullptr;
  }
  if (size <= MA_MAXREQUEST && !is_special(p, kMappedBlock) && !is_special(p, kAlignedBlock)) {
    void* q = MA_realloc(p, size, 0, "realloc");
    if (q == nullptr) errno = ENOMEM;
    return q;
  }
  void* q = route_alloc(size, "realloc");
  if (q == nullptr) return nullptr;
  size_t old = route_usable(p);
  memcpy(q, p, old < size ? old : size);
  route_free(p, "realloc");
  return q;
}

// A thread that forks while another holds the allocator's lock would leave
// the child with the lock taken for ever.
__attribute__((constructor)) void route_atfork() {
  MA_init();
  pthread_atfork(MA_fork_prepare, MA_fork_parent, MA_fork_child);
}

}  // namespace

extern "C" {

void* malloc(size_t size) noexcept { return route_alloc(size, "malloc"); }

void free(void* pointer) noexcept { route_free(pointer, "free"); }

// Gone from the C library's headers, still called by old code.
void cfree(void* pointer) noexcept { route_free(pointer, "cfree"); }

void* calloc(size_t count, size_t size) noexcept {
  size_t total = 0;
  if (__builtin_mul_overflow(count, size, &total)) {
    errno = ENOMEM;
    return nullptr;
  }
  // A fresh mapping is zero already.
  if (total > MA_MAXREQUEST) return route_alloc(total, "calloc");
  void* p = MA_calloc(count, size, 0, "calloc");
  if (p == nullptr) errno = ENOMEM;
  return p;
}

void* realloc(void* pointer, size_t size) noexcept { return route_realloc(pointer, size); }

void* reallocarray(void* pointer, size_t count, size_t size) noexcept {
  size_t total = 0;
  if (__builtin_mul_overflow(count, size, &total)) {
    errno = ENOMEM;
    return nullptr;
  }
  return route_realloc(pointer, total);
}

void* memalign(size_t alignment, size_t size) noexcept {
  if (!power_of_two(alignment)) {
    errno = EINVAL;
    return nullptr;
  }
  return route_aligned(alignment, size, "memalign");
}

void* aligned_alloc(size_t alignment, size_t size) noexcept {
  if (!power_of_two(alignment)) {
    errno = EINVAL;
    return nullptr;
  }
  return route_aligned(alignment, size, "aligned_alloc");
}

int posix_memalign(void** result, size_t alignment, size_t size) noexcept {
  if (!power_of_two(alignment) || alignment % sizeof(void*) != 0) return EINVAL;
  int saved = errno;
  void* p = route_aligned(alignment, size, "posix_memalign");
  errno = saved;
  if (p == nullptr) return ENOMEM;
  *result = p;
  return 0;
}

void* valloc(size_t size) noexcept {
  return route_aligned(static_cast<size_t>(getpagesize()), size, "valloc");
}

void* pvalloc(size_t size) noexcept {
  size_t page = static_cast<size_t>(getpagesize());
  if (size > SIZE_MAX - page) {
    errno = ENOMEM;
    return nullptr;
  }
  return route_aligned(page, (size + page - 1) / page * page, "pvalloc");
}

size_t malloc_usable_size(void* pointer) noexcept { return route_usable(pointer); }

}  // extern "C"
