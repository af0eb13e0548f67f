/// Locked file operations: mutual exclusion and atomic rewrites of the
/// shared files of the control directory (rj_fileio, rj_lockdir).  Every
/// shared file has a fixed index (FILE_JOBS ..., rj_paths.h) and a lock
/// directory "NAME.lock" beside it that holds one holder file, named after
/// the holder's host and containing "%d\n" with its pid.
///
/// Calling order.  A read:
///   { FileopLock lock(i);                waits until the lock is this process's
///     read_fileop(i) ... close_fileop(i) }   stream or null (reported); 0 or -1
/// A rewrite: fileop_rewrite(i, change), which locks, reads, writes and
/// releases in one call.  The pieces beneath, for writers that keep the
/// shape of a read followed by a write on one stream:
///   lock_fileop(i, 1)  update_fileop(i)  ... rewind_fileop(i) and write ...
///   close_and_truncate_fileop(i)  lock_fileop(i, 0)
/// A lock taken by hand is left held by any early return; FileopLock is not.
///
/// The control block: init_fileop (called by the first lock or open) sets
/// rndctl.location to "." when it is unset or empty and reads it for every
/// path; the locks read rndctl.host and rndctl.pid (the holder file).
/// Nothing else of rndctl is read or written.  init_fileop also records the
/// umask the process started with and hands the access log to rj_log.
///
/// A rewrite never shows half done: an update stream reads the file as it
/// was, keeps what is written to it in memory, and close_and_truncate_fileop
/// (or fileop_rewrite) puts the new contents in a temporary file beside the
/// old one ("NAME.new.XXXXXX"), forces it to disk and renames it over the old
/// one; a reader sees the old file or the new one.  When the new contents
/// equal the old, nothing is written and the file keeps its inode and times.
///
/// What a crash leaves behind: during a rewrite at most the temporary file,
/// which nobody reads (the old file stands); while holding a lock, the lock
/// directory: this host's next waiter breaks it at once (its holder pid is
/// dead), other hosts when it is 181 s old.  A crash between the mkdir of a
/// lock and the rename of its holder file into it leaves a lock without a
/// holder, which waiters break when it is 5 s old.  Breaks and releases
/// rename the lock aside first ("NAME.lock.broken.HOST.PID.N",
/// "NAME.lock.released.HOST.PID.N"); a crash then leaves that directory,
/// which nobody reads.
///
/// Nothing here is safe inside a signal handler.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <cstdio>
#include <ctime>

#include "Utility/rndctl/ctldir/rj_paths.h"

/// Builds the path table and opens the access log (see above); returns 1.
int init_fileop();
/// take non-zero: waits (backing off, see fileop_poll_seconds) until the lock
/// of file `index` is taken, breaking it when its holder is gone; returns 1.
/// take zero: releases it when this process holds it (its holder file names
/// this host and this pid) and leaves anyone else's alone; returns 1.
/// 0 only for a bad index or when the paths cannot be built.
[[nodiscard]] int lock_fileop(int index, int take);
/// Opens file `index` for reading, creating it empty when absent.  Returns
/// the stream (closed by close_fileop), or null for a bad index or a file
/// that cannot be opened or made (reported).
[[nodiscard]] FILE* read_fileop(int index);
/// Opens file `index` for a rewrite (creating it empty when absent): reads
/// give the file as it was; writes go to the new contents, from the start of
/// the file (right after the open or after rewind_fileop).  The stream has
/// no descriptor (fileno is -1).  Returns the stream (closed by
/// close_and_truncate_fileop), or null for a bad index or a file that cannot
/// be read or made (reported).
[[nodiscard]] FILE* update_fileop(int index);
/// Rewinds the open stream: an update stream then writes from the start.
/// Nothing when file `index` has no open stream.
void rewind_fileop(int index);
/// Closes the stream; an update stream that was written keeps the old bytes
/// past the written ones (nothing is cut).  0 ok (also when no stream is
/// open), -1 failed and reported.
[[nodiscard]] int close_fileop(int index);
/// Closes the stream; the new contents of an update stream end at the
/// stream's position and replace the file atomically (see above); a stream
/// that was neither rewound nor written is closed without a rewrite.  0 ok (also when
/// nothing changed), -1 when the rewrite failed: the old file stands, the
/// temporary is gone, and the path with the system's reason was reported to
/// the user and the trace.
[[nodiscard]] int close_and_truncate_fileop(int index);
/// The path of shared file `index` ("%s/%s"), building the table when needed;
/// null for a bad index or when the paths cannot be built.
const char* fileop_path(int index);
/// The path of the lock directory of file `index` ("%s/%s.lock"), likewise.
const char* fileop_lock_path(int index);
/// The access log stream opened by init_fileop, or null.
FILE* fileop_access_stream();
/// Closes the access log and forgets every path, so that the next lock or
/// open builds the table again (a process that changes control directory).
void fileop_reset();
/// The longest pause, in seconds, between two attempts at a busy lock (5).
/// A waiter retries after a few milliseconds, then after growing, jittered
/// pauses up to this.  0: no pauses at all (tests); editors never pause.
extern unsigned fileop_poll_seconds;
/// Pauses the waiter for `ns` nanoseconds (nanosleep); tests replace it.
extern void (*fileop_sleep)(int64_t ns);
/// A monotonic clock in nanoseconds for pauses and hold times; tests replace it.
extern int64_t (*fileop_monotonic_ns)();
/// The file server's clock, against which lock ages are judged: the
/// modification time of ".clock.HOST" in the control directory, touched at
/// most once a second and carried forward on the monotonic clock in
/// between (rj_now() when it cannot be touched).  Tests replace it.
extern time_t (*fileop_server_clock)();
/// One look at a busy lock directory: when its access time is 181 seconds
/// old or older by the server clock, takes it away (a rename, so only one
/// waiter wins), removes it with its holder file, reports the break on
/// stderr and in the access log, and returns 1; otherwise 0.
int fileop_break_stale_lock(const char* lock_path);
/// Releases every lock this process holds, and no other.  For fatal paths
/// (a syntax error ends the daemon): the other hosts go on at once.
void fileop_release_held_locks();
/// How long the lock of one file was held by this process, for benchmarks.
struct FileopHoldStats {
  long count = 0;  // releases of a held lock
  int64_t longest_ns = 0;
  int64_t total_ns = 0;
};
FileopHoldStats fileop_hold_stats(int index);

/// Holds the lock of one shared file for the life of the object: the
/// constructor waits for it (lock_fileop(index, 1)), the destructor releases
/// it on every way out of the scope.
class FileopLock {
 public:
  explicit FileopLock(int index) : index_(index), held_(lock_fileop(index, 1) == 1) {}
  ~FileopLock() {
    if (held_) (void)lock_fileop(index_, 0);  // only a bad index fails, and it was taken
  }
  FileopLock(const FileopLock&) = delete;
  FileopLock& operator=(const FileopLock&) = delete;
  [[nodiscard]] bool held() const { return held_; }

 private:
  int index_;
  bool held_;
};

/// Rewrites file `index` under its lock in one call: takes the lock, opens
/// the file (empty when absent) as `in`, lets `change(in, out)` write the
/// new contents to `out` (a memory stream), writes them aside and renames
/// them over the file, releases the lock.  `change` returns false when
/// there is nothing to change.  Returns 1 written, 0 nothing to change
/// (`change` said so, or wrote the same bytes: the file is not touched),
/// -1 failed (reported; the old file stands).
[[nodiscard]] int fileop_rewrite(int index, bool (*change)(FILE* in, FILE* out, void* context),
                                 void* context);
template <class Change>
[[nodiscard]] int fileop_rewrite(int index, Change change) {
  return fileop_rewrite(
      index,
      [](FILE* in, FILE* out, void* context) -> bool {
        return (*static_cast<Change*>(context))(in, out);
      },
      &change);
}
