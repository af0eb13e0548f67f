// Lock directories: taking, waiting, breaking and releasing them.
//
// A lock is the directory "NAME.lock" holding one holder file named after
// the holder's host with "%d\n" and its pid.  mkdir is the test-and-set:
// atomic on every file system the farm shares, and the one that the other
// processes of the control directory use too.  The holder is written under a
// name of its own inside and renamed to the host's name, so it is never seen
// half-written.
//
// Who cleans up after a crash: the next waiter.  A holder of this host whose
// pid is not alive here was our own crash and is broken at once; a lock
// whose holder file is missing or empty is broken when 5 s old; any other
// lock when 181 s old, both judged by the directory's access time against
// the file server's clock (the hosts' own clocks disagree).  A break renames
// the lock away first, so of several waiters only one breaks it; a broken
// lock that cannot be removed (another user's, in the retry mode without
// search permission) stays under its "NAME.lock.broken.HOST.PID.N" name,
// out of everybody's way.
#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <string>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_fileio.h"
#include "Utility/rndctl/ctldir/rj_paths.h"

namespace {

constexpr int64_t kNsPerSecond = 1000000000;
// A lock this old (by its directory's access time) is taken to be left by a
// dead holder.
constexpr long kStaleSeconds = 181;
// A lock without a holder pid this old was abandoned by a writer that died
// between making it and writing its pid.
constexpr long kGraceSeconds = 5;
// The first pause of a waiter; each further one may be twice as long.
constexpr int64_t kFirstPauseNs = 2000000;
// Once past the first quick retries a waiter never pauses shorter than at
// this level (32-64 ms): about twenty attempts a second at most.
constexpr unsigned kSteadyLevel = 5;

void nanosleep_pause(int64_t ns) {
  struct timespec ts = {static_cast<time_t>(ns / kNsPerSecond),
                        static_cast<long>(ns % kNsPerSecond)};
  while (nanosleep(&ts, &ts) != 0 && errno == EINTR) {
  }
}

int64_t monotonic_now() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<int64_t>(ts.tv_sec) * kNsPerSecond + ts.tv_nsec;
}

// The file server's "now": the modification time of a file we just touched
// in the control directory.  Touched at most once a second; in between the
// last reading is carried forward on the monotonic clock.
time_t touched_server_clock() {
  static bool have = false;
  static time_t server = 0;
  static int64_t taken_at = 0;
  int64_t now = fileop_monotonic_ns();
  if (have && now - taken_at >= 0 && now - taken_at < kNsPerSecond) {
    return server + static_cast<time_t>((now - taken_at) / kNsPerSecond);
  }
  const std::string path = rj_clock_path(rndctl.host.or_else(""));
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0666);
  struct stat st;
  // Setting the times to "now" lets the server stamp them with its own clock.
  bool ok = fd >= 0 && futimens(fd, nullptr) == 0 && fstat(fd, &st) == 0;
  if (fd >= 0) close(fd);
  if (!ok) return rj_now();
  have = true;
  server = st.st_mtime;
  taken_at = now;
  return server;
}

struct HeldLock {
  bool held = false;
  int64_t since_ns = 0;
};
HeldLock held_locks[FILE_COUNT];
FileopHoldStats hold_stats[FILE_COUNT];
unsigned name_counter = 0;

bool valid_index(int index) { return index >= 0 && index < FILE_COUNT; }

struct DirCloser {
  void operator()(DIR* d) const { closedir(d); }
};
using ScopedDIR = std::unique_ptr<DIR, DirCloser>;

// A name beside the lock that nobody else makes: "%s.%s.%s.%d.%u".
void unique_name(char* out, size_t size, const char* lock_path, const char* what) {
  snprintf(out, size, "%s%s%s.%d.%u", lock_path, what, rndctl.host.or_else(""), rndctl.pid,
           name_counter++);
}

// Lock directories released aside that could not be removed at once; each
// later release tries them again.  Bounded: a leftover nobody can remove is
// forgotten, out of everybody's way under its unique name.
constexpr size_t kMaxLeftovers = 16;
char leftovers[kMaxLeftovers][PATH_MAX];
size_t leftover_count = 0;

void remember_leftover(const char* path) {
  if (leftover_count < kMaxLeftovers) {
    snprintf(leftovers[leftover_count++], PATH_MAX, "%s", path);
  }
}

enum class Holder { kUnreadable, kMissing, kNoPid, kPid };

// Reads the holder file "%s/%s" (lock, host) by name: a lookup, unlike a
// listing, leaves the directory's access time alone.
Holder read_holder(const char* lock_path, const char* host, int* pid) {
  char path[PATH_MAX];
  snprintf(path, sizeof path, "%s/%s", lock_path, host);
  int fd = open(path, O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) return errno == ENOENT ? Holder::kMissing : Holder::kUnreadable;
  char text[32];
  ssize_t n;
  do {
    n = read(fd, text, sizeof text - 1);
  } while (n < 0 && errno == EINTR);
  close(fd);
  if (n < 0) return Holder::kUnreadable;
  text[n] = '\0';
  char* end = nullptr;
  long value = strtol(text, &end, 10);
  if (end == text || value <= 0 || value > INT_MAX || (*end != '\0' && *end != '\n')) {
    return Holder::kNoPid;
  }
  *pid = static_cast<int>(value);
  return Holder::kPid;
}

// Removes a directory that nobody else uses any more (an aside or a broken
// lock) with its files; `last` gets the name of the last file in it.
void remove_lock_tree(const char* dir, char* last, size_t last_size) {
  if (last_size > 0) last[0] = '\0';
  // A retry-mode directory lacks search permission; ours may be opened up.
  chmod(dir, 0777);
  {
    ScopedDIR d(opendir(dir));
    while (d) {
      struct dirent* e = readdir(d.get());
      if (e == nullptr) break;
      if (strcmp(e->d_name, ".") == 0 || strcmp(e->d_name, "..") == 0) continue;
      if (last_size > 0) snprintf(last, last_size, "%s", e->d_name);
      unlinkat(dirfd(d.get()), e->d_name, 0);
    }
  }
  rmdir(dir);
}

// Takes the lock at `lock_path` away from where waiters look, when it is
// still the directory `seen`.  1: taken away and removed (`entry` names its
// last file); 0: another waiter was first, or it was not `seen` any more.
int break_lock(const char* lock_path, const struct stat& seen, char* entry, size_t entry_size) {
  char away[PATH_MAX];
  unique_name(away, sizeof away, lock_path, ".broken.");
  if (rename(lock_path, away) != 0) return 0;
  struct stat now;
  if (lstat(away, &now) != 0 || now.st_ino != seen.st_ino || now.st_dev != seen.st_dev) {
    // Between our look and our rename the old lock went and a new holder
    // came: give the new lock back.  Only fails when a third process took
    // the free name in these microseconds.
    if (rename(away, lock_path) != 0) {
      dbgpnt("lock %s taken away from its holder: %s\n", lock_path, strerror(errno));
      wrt_logfile("lock \"%s\" taken away from its holder by mistake", lock_path);
    }
    return 0;
  }
  remove_lock_tree(away, entry, entry_size);
  return 1;
}

// Whether the lock directory (still `seen`) holds no file with a pid in it.
// A listing refreshes the access time the lock's age is read from, so the
// old one is put back (where we may: owner or root).
bool holds_no_pid(const char* lock_path, const struct stat& seen) {
  int fd = open(lock_path, O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return false;
  struct stat st;
  if (fstat(fd, &st) != 0 || st.st_ino != seen.st_ino || st.st_dev != seen.st_dev) {
    close(fd);
    return false;
  }
  int list_fd = dup(fd);
  ScopedDIR d(list_fd >= 0 ? fdopendir(list_fd) : nullptr);
  if (!d) {
    if (list_fd >= 0) close(list_fd);
    close(fd);
    return false;
  }
  bool empty = true;
  while (struct dirent* e = readdir(d.get())) {
    // Dot files are no holders: a holder being written under its own name,
    // or a holder a file system client unlinked and keeps hidden.
    if (e->d_name[0] == '.') continue;
    struct stat f;
    if (fstatat(fd, e->d_name, &f, AT_SYMLINK_NOFOLLOW) != 0 || !S_ISREG(f.st_mode) ||
        f.st_size > 0) {
      empty = false;
    }
  }
  struct stat after;
  if (fstat(fd, &after) == 0 &&
      (after.st_atim.tv_sec != st.st_atim.tv_sec || after.st_atim.tv_nsec != st.st_atim.tv_nsec)) {
    struct timespec times[2] = {st.st_atim, {0, UTIME_OMIT}};
    futimens(fd, times);
  }
  close(fd);
  return empty;
}

// One attempt at the lock.  mkdir is the test-and-set that every process of
// the control directory agrees on, an older editor included, which makes the
// directory first and its holder after: a lock must never be taken from it
// in between.  (Renaming a ready-made directory into place would do just
// that: rename replaces an empty directory.)  The holder file is written
// under a name of its own and renamed to the host's name, so it is never
// seen empty.  A crash between the mkdir and that rename leaves a lock
// without a holder, which waiters break once it is a few seconds old.  The
// first attempt is made in mode 0777, retries in 0664: other tools tell a
// retaken lock by it; the mode changes only once the holder is written
// (without search permission it could not be).
bool take_lock_dir(const char* lock_path, bool retry) {
  if (mkdir(lock_path, 0777) != 0) return false;
  const char* host = rndctl.host.or_else("");
  char holder[PATH_MAX];
  char ready[PATH_MAX];
  snprintf(holder, sizeof holder, "%s/%s", lock_path, host);
  snprintf(ready, sizeof ready, "%s/.%s.%d", lock_path, host, rndctl.pid);
  // The directory is fresh, but never follow a planted link.
  int fd = open(ready, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0666);
  bool ok = fd >= 0;
  if (ok) {
    char text[32];
    int n = snprintf(text, sizeof text, "%d\n", rndctl.pid);
    ssize_t w;
    do {
      w = write(fd, text, static_cast<size_t>(n));
    } while (w < 0 && errno == EINTR);
    ok = w == n;
    if (close(fd) != 0) ok = false;
    ok = ok && rename(ready, holder) == 0;
    if (!ok) unlink(ready);
  }
  // Without a holder the lock is held all the same; waiters break it after
  // the grace of a lock without a pid.
  if (!ok) dbgpnt("lock %s taken without a holder file: %s\n", lock_path, strerror(errno));
  if (retry) chmod(lock_path, 0664);
  return true;
}

// The pause at back-off level `level`: exponential from 2 ms, at most
// fileop_poll_seconds, half of it fixed and half random, so waiters that met
// at one lock do not meet again at the next attempt.
int64_t backoff_pause(unsigned level, uint64_t* seed) {
  int64_t cap = static_cast<int64_t>(fileop_poll_seconds) * kNsPerSecond;
  if (cap <= 0) return 0;
  int64_t ceiling = level >= 40 ? cap : kFirstPauseNs << level;
  if (ceiling > cap || ceiling <= 0) ceiling = cap;
  // xorshift64: no global random state to disturb.
  *seed ^= *seed << 13;
  *seed ^= *seed >> 7;
  *seed ^= *seed << 17;
  int64_t half = ceiling / 2;
  return half + static_cast<int64_t>(*seed % static_cast<uint64_t>(ceiling - half + 1));
}

// What tells one lock directory from the next under the same name.  The
// inode alone does not: a file system client in user space may number files
// by their path.  A new lock also has a new modification time (made, its
// holder renamed in).
uint64_t lock_identity(const struct stat& st) {
  // Not its change time: putting back the access time a listing moved
  // changes that, and the lock is still the same one.
  uint64_t id = static_cast<uint64_t>(st.st_ino);
  id = id * 1099511628211ull ^ static_cast<uint64_t>(st.st_mtim.tv_sec);
  id = id * 1099511628211ull ^ static_cast<uint64_t>(st.st_mtim.tv_nsec);
  return id == 0 ? 1 : id;
}

// One look at a busy lock: breaks it when its holder is gone.  1 when it
// was broken (try again at once), 0 when it stands.  `listed` remembers the
// lock directory already listed in this wait; `seen` gets the one looked at.
int judge_busy_lock(const char* lock_path, uint64_t* listed, uint64_t* seen) {
  struct stat st;
  *seen = 0;
  if (stat(lock_path, &st) != 0) return errno == ENOENT ? 1 : 0;
  *seen = lock_identity(st);
  char entry[NAME_MAX + 1] = "";

  int pid = 0;
  const char* host = rndctl.host.or_else("");
  Holder own = read_holder(lock_path, host, &pid);
  if (own == Holder::kPid && pid != rndctl.pid && kill(pid, 0) != 0 && errno == ESRCH) {
    if (break_lock(lock_path, st, entry, sizeof entry) == 0) return 0;
    wrt_logfile("broke lock \"%s\" left by dead process %d of this host", lock_path, pid);
    return 1;
  }

  long age = static_cast<long>(fileop_server_clock() - st.st_atime);
  if (age >= kStaleSeconds) return fileop_break_stale_lock(lock_path);
  if (age >= kGraceSeconds && (own == Holder::kNoPid || *listed != *seen)) {
    *listed = *seen;
    if ((own == Holder::kNoPid || holds_no_pid(lock_path, st)) &&
        break_lock(lock_path, st, entry, sizeof entry) == 1) {
      wrt_logfile("broke lock \"%s\" abandoned without a holder pid", lock_path);
      return 1;
    }
  }
  return 0;
}

// Removes the lock at `lock_path` when its holder file names this host and
// this pid.  Someone else's (ours was broken and retaken) stays.
void remove_own_lock(const char* lock_path) {
  const char* host = rndctl.host.or_else("");
  int pid = 0;
  Holder holder = read_holder(lock_path, host, &pid);
  struct stat st;
  bool opened = false;
  if (holder == Holder::kUnreadable && stat(lock_path, &st) == 0 && st.st_uid == geteuid() &&
      chmod(lock_path, 0777) == 0) {
    // A retry-mode lock lacks search permission; its maker may open it up.
    opened = true;
    holder = read_holder(lock_path, host, &pid);
  }
  if (holder != Holder::kPid || pid != rndctl.pid) {
    if (opened) chmod(lock_path, st.st_mode & 07777);
    return;
  }
  // Renamed away first, the lock is free at once, whatever its directory
  // still holds: a network or user-space file system client that has not
  // yet seen the close of a holder file keeps it, unlinked, as a hidden
  // file in the directory for a while, and an rmdir in place would fail
  // and leave the lock standing.  What cannot be removed now is removed by
  // a later release.
  char away[PATH_MAX];
  unique_name(away, sizeof away, lock_path, ".released.");
  // ENOENT: broken in between by a waiter who judged it stale.
  if (rename(lock_path, away) != 0) return;
  remove_lock_tree(away, nullptr, 0);
  struct stat left;
  if (lstat(away, &left) == 0) remember_leftover(away);
}

void sweep_leftovers() {
  size_t kept = 0;
  for (size_t i = 0; i < leftover_count; ++i) {
    remove_lock_tree(leftovers[i], nullptr, 0);
    struct stat st;
    if (lstat(leftovers[i], &st) != 0) continue;  // gone
    if (kept != i) memcpy(leftovers[kept], leftovers[i], PATH_MAX);
    ++kept;
  }
  leftover_count = kept;
}

void release(int index, const char* lock_path) {
  HeldLock& h = held_locks[index];
  if (h.held) {
    h.held = false;
    int64_t held_ns = fileop_monotonic_ns() - h.since_ns;
    FileopHoldStats& s = hold_stats[index];
    s.count++;
    s.total_ns += held_ns;
    if (held_ns > s.longest_ns) s.longest_ns = held_ns;
    dbgpnt("lock %s held %.3f ms\n", lock_path, static_cast<double>(held_ns) / 1e6);
  }
  remove_own_lock(lock_path);
  if (leftover_count > 0) sweep_leftovers();
}

}  // namespace

unsigned fileop_poll_seconds = 5;
void (*fileop_sleep)(int64_t ns) = nanosleep_pause;
int64_t (*fileop_monotonic_ns)() = monotonic_now;
time_t (*fileop_server_clock)() = touched_server_clock;

int fileop_break_stale_lock(const char* lock_path) {
  // The access time is read before anything looks inside: a listing may
  // itself refresh it, and the age must be that of the lock, not of our look.
  struct stat st;
  if (lock_path == nullptr || stat(lock_path, &st) != 0) return 0;
  long age = static_cast<long>(fileop_server_clock() - st.st_atime);
  if (age < kStaleSeconds) return 0;
  char entry[NAME_MAX + 1] = "";
  if (break_lock(lock_path, st, entry, sizeof entry) == 0) return 0;
  EDuprintf("%d second timed out on \"%s\" in \"%s\" removed", static_cast<int>(age), entry,
            lock_path);
  dbg_logfile("%d second timed out on \"%s\" in \"%s\" removed", static_cast<int>(age), entry,
              lock_path);
  sounder(0);
  return 1;
}

int lock_fileop(int index, int take) {
  if (!valid_index(index)) return 0;
  const char* lock_path = fileop_lock_path(index);
  if (lock_path == nullptr) return 0;
  if (take == 0) {
    release(index, lock_path);
    return 1;
  }

  mode_t previous = umask(0);
  uint64_t seed = static_cast<uint64_t>(fileop_monotonic_ns()) ^
                  (static_cast<uint64_t>(rndctl.pid) << 32) ^ 0x9e3779b97f4a7c15ull;
  if (seed == 0) seed = 1;
  uint64_t listed = 0;
  uint64_t seen = 0;
  uint64_t seen_before = 0;
  unsigned level = 0;
  unsigned at_once = 0;
  for (bool retry = false;; retry = true) {
    if (take_lock_dir(lock_path, retry)) break;
    if (!retry) dbgpnt(":::::: WAITING on %s\n", lock_path);
    // After a break the lock is free: try again at once, but not for ever
    // when others keep winning it.  A missing control directory lands here
    // too (mkdir fails): the waiter keeps trying, pausing, until the
    // directory is back.
    if (judge_busy_lock(lock_path, &listed, &seen) == 1 && at_once++ < 8) continue;
    // Editors do not wait: the user sees no delay.
    if (is_editor()) continue;
    int64_t pause = backoff_pause(level, &seed);
    if (pause > 0) fileop_sleep(pause);
    // The same holder still there: it holds long, pause longer.  Another
    // one since: the lock changes hands quickly, and a waiter grown used to
    // long pauses would only leave it idle; pause shorter, down to the
    // steady level.  The pauses then follow the hold times.
    if (seen_before == 0 || seen == seen_before) {
      level++;
    } else if (level > kSteadyLevel) {
      level--;
    }
    seen_before = seen;
  }
  umask(previous);
  held_locks[index].held = true;
  held_locks[index].since_ns = fileop_monotonic_ns();
  return 1;
}

void fileop_release_held_locks() {
  for (int i = 0; i < FILE_COUNT; i++) {
    if (!held_locks[i].held) continue;
    const char* lock_path = fileop_lock_path(i);
    if (lock_path != nullptr) release(i, lock_path);
  }
}

FileopHoldStats fileop_hold_stats(int index) {
  return valid_index(index) ? hold_stats[index] : FileopHoldStats{};
}
