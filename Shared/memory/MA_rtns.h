/// The checking allocator: every heap block of the queue code is taken and
/// given back here, with the caller's source line and unit, so that a leaked,
/// damaged or doubly freed block can be traced to the line that made it.
///
/// Normal mode is a size-bucket allocator: 46 fixed block sizes, a free list
/// per size, and a 16-byte tag in front of every block (bucket index, state
/// magic, free-list link).  With MA_DEBUG non-zero in the environment every
/// block also carries a guarded header (owner unit and line, operation number)
/// and a trailer right after the caller's bytes; releases are checked in a
/// fixed order and a failed check prints what it found and aborts.  The other
/// settings (read once, by MA_init):
///   MA_TRACE n    trace every operation to "$HOME/trace" (with MA_TSTART or
///                 after MA_trace(1)); MA_STOP n ends the trace after operation n
///   MA_ACHECK n   check a reused block when it is handed out again
///   MA_FCHECK n   check a block at release: 1 also its neighbours on the
///                 handed-out list, 2 or more every block, and a release of
///                 null is fatal
///   MA_STOMP      fill new blocks with 0x01 and released ones with 0xDEADBEEF
///   MA_SCATTER n  leave n-1 unused block slots between fresh blocks
///   MA_START n, MA_LINE n + MA_FILE unit
///                 call MA_trap (a debugger's stop point) at operation n, or
///                 when that line of that unit allocates or releases
///
/// Memory comes from one address range reserved with mmap at start-up and
/// made usable in steps ("the heap": ma_base up to the top); nothing is given
/// back to the system, and the program break is never moved, so anything else
/// that uses brk/sbrk is unaffected.  A request beyond the last bucket
/// (268435460 bytes) is refused with a message; the process allocator entry
/// points (MA_route.cpp) serve those from their own mappings instead.
///
/// Calling order: MA_init() once at start-up (later calls do nothing; the
/// first allocation calls it too), then any number of MA_malloc/MA_calloc/
/// MA_realloc/MA_free.  MA_malloc returns null when memory is exhausted or the
/// request is too large; MA_free(nullptr, ...) does nothing.  All calls are
/// thread-safe (one lock, skipped while the process has one thread).  None of
/// these is safe inside a signal handler.  User data is 16-byte aligned.
#pragma once

#include <cstddef>
#include <cstdint>
#include <new>
#include <utility>

void MA_init();
[[nodiscard]] void* MA_malloc(size_t size, int line, const char* unit, int flag);
[[nodiscard]] void* MA_calloc(size_t count, size_t size, int line, const char* unit);
[[nodiscard]] void* MA_realloc(void* pointer, size_t size, int line, const char* unit);
void MA_free(void* pointer, int line, const char* unit);

/// Heap copy of a NUL-terminated text through the allocator; null for null.
[[nodiscard]] char* MA_strdup(const char* text, int line, const char* unit);

/// Allocates and constructs one record; null when memory is exhausted.
template <class T, class... Args>
[[nodiscard]] T* MA_new(int line, const char* unit, Args&&... args) {
  void* p = MA_malloc(sizeof(T), line, unit, 1);
  if (p == nullptr) return nullptr;
  return new (p) T(std::forward<Args>(args)...);
}

/// Destroys and releases a record made by MA_new; null does nothing.
template <class T>
void MA_delete(T* record, int line, const char* unit) {
  if (record == nullptr) return;
  record->~T();
  MA_free(record, line, unit);
}

inline constexpr int MA_NBUCKETS = 46;
/// User bytes of the last bucket: the largest request MA_malloc serves.
inline constexpr size_t MA_MAXREQUEST = 268435460;

/// Bucket that serves a request of `size` bytes, -1 beyond the last one.
[[nodiscard]] int MA_bucket_of(size_t size);
/// User bytes of a bucket's blocks.
[[nodiscard]] size_t MA_bucket_size(int bucket);
/// Bytes the caller may use at `pointer` (a live block of this allocator).
[[nodiscard]] size_t MA_usable_size(const void* pointer);

/// Checks of live blocks (debug mode; in normal mode they pass).  MA_check
/// and MA_allcheck abort on a damaged block after saying what they found;
/// MA_checkit returns 1 for a sound block and 0 (with a message) otherwise.
void MA_check(void* pointer, int line, const char* unit);
[[nodiscard]] int MA_checkit(void* pointer);
void MA_allcheck(int line, const char* unit);

/// Trace control: MA_trace(1/0) starts or stops the trace (MA_TRACE must be
/// set), MA_tpush/MA_tpop save and restore the trace level around a stretch
/// of code (16 deep), MA_comment writes a "# text" line into the trace.
void MA_trace(int on);
void MA_tpush(int level);
void MA_tpop();
void MA_comment(const char* text);
/// The debugger's stop point: says "MA_trap called" and returns.
void MA_trap();

/// Reports, written to descriptor `fd` (debug mode keeps the figures):
/// per-bucket statistics, every handed-out block, the blocks handed out since
/// the last MA_tag_allocated ("Leak Report { ... }").  MA_exit writes the
/// statistics and the leak report to the trace (else stderr) in debug mode
/// and closes the trace; it does not end the process.
void MA_stats(int fd);
void MA_dump_alloc_list(int fd);
void MA_leak_report(int fd);
void MA_tag_allocated();
void MA_exit();

/// Memory figures of the machine in kB (from sysinfo); -1 when unknown.
[[nodiscard]] long MA_get_total_swap();
[[nodiscard]] long MA_swap_available();
[[nodiscard]] long MA_get_real_memory_size();
[[nodiscard]] long MA_get_total_free();
/// 1 when memory and swap can hold `bytes` more, else 0 after a report.
[[nodiscard]] int MA_check_mem_required(size_t bytes);

/// The settings MA_init reads from the environment.  MA_read_settings reads
/// them again (tests); blocks keep the layout they were made with, so the mode
/// may change while blocks are out.
extern int ma_debug, ma_trace, ma_scatter, ma_chkalloc, ma_chkfree, ma_tstart, ma_stomp;
extern int ma_start, ma_stop, ma_line;
extern const char* ma_file;
void MA_read_settings();

/// For the process allocator entry points only: hold the allocator's lock
/// across fork so that the child never inherits it taken.
void MA_fork_prepare();
void MA_fork_parent();
void MA_fork_child();
