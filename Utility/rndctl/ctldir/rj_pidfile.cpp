// The pid file: reading it, probing the process it names, claiming it.
#include "Utility/rndctl/ctldir/rj_pidfile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <string>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/ctldir/rj_paths.h"
#include "Utility/rndctl/ctldir/rj_updatetime.h"
#include "Utility/rndctl/proc/rj_signal.h"

namespace {

PidfileRead read_path(const char* path) {
  PidfileRead r;
  int fd;
  do fd = open(path, O_RDONLY | O_CLOEXEC);
  while (fd < 0 && errno == EINTR);
  if (fd < 0) {
    r.error = errno;
    return r;
  }
  int32_t value = 0;
  size_t done = 0;
  while (done < sizeof value) {
    ssize_t n = read(fd, reinterpret_cast<char*>(&value) + done, sizeof value - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      r.error = n < 0 ? errno : 0;
      break;
    }
    done += static_cast<size_t>(n);
  }
  close(fd);
  if (done < sizeof value) {
    r.status = PIDFILE_SHORT;
    return r;
  }
  r.status = PIDFILE_OK;
  r.pid = value;
  return r;
}

const char* short_reason(const PidfileRead& r) {
  return r.error != 0 ? strerror(r.error) : "short pid file";
}

int probe(const char* host, const PidfileRead& r) {
  if (r.status == PIDFILE_SHORT) dbgpnt("%s\n", short_reason(r));
  if (r.pid == 0) return 0;
  if (RJ_signal(host, r.pid, 0) != 0) {
    dbgpnt("process is DEAD --> %s:%d\n", host, r.pid);
    return 0;
  }
  dbgpnt("process is alive --> %s:%d\n", host, r.pid);
  return 1;
}

// Writes this process's pid to a file of its own beside the pid file.
// False when it cannot (a failed write is reported, a failed create not).
bool write_claim(const std::string& claim, int pid) {
  // A leftover of a crashed claim by a process of the same pid, or a planted
  // link: neither is followed.
  unlink(claim.c_str());
  int fd;
  do fd = open(claim.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0666);
  while (fd < 0 && errno == EINTR);
  if (fd < 0) return false;
  int32_t value = pid;
  ssize_t n;
  do n = write(fd, &value, sizeof value);
  while (n < 0 && errno == EINTR);
  int error = n == static_cast<ssize_t>(sizeof value) ? 0 : n < 0 ? errno : EIO;
  if (close(fd) != 0 && error == 0) error = errno;
  if (error != 0) {
    EDuprintf("%s", strerror(error));
    unlink(claim.c_str());
    return false;
  }
  return true;
}

enum class Take { kDone, kChanged };

// Renames the pid file `seen` (read as `seen_pid`) away so that it can be
// replaced.  Of several claimers only one can rename it; one that finds it
// replaced in between puts back what it took and looks again.
Take take_away_stale(const std::string& path, const struct stat& seen, int seen_pid) {
  const std::string aside = rj_pid_claim_path(rndctl.host.or_else(""), rndctl.pid) + ".old";
  if (rename(path.c_str(), aside.c_str()) != 0) return Take::kChanged;
  struct stat now;
  PidfileRead again = read_path(aside.c_str());
  bool same = lstat(aside.c_str(), &now) == 0 && now.st_ino == seen.st_ino &&
              now.st_dev == seen.st_dev && again.pid == seen_pid;
  // Not the stale file any more: a claim that just won.  Give it back,
  // unless a third claimer already filled the place.
  if (!same) (void)link(aside.c_str(), path.c_str());  // EEXIST: the newer claim stands
  unlink(aside.c_str());
  return same ? Take::kDone : Take::kChanged;
}

// Puts the written claim in place; false when another claim came first.
bool place_claim(const std::string& claim, const std::string& path) {
  if (link(claim.c_str(), path.c_str()) == 0) {
    unlink(claim.c_str());
    return true;
  }
  if (errno == EEXIST) {
    unlink(claim.c_str());
    return false;
  }
  // A file system without hard links: a rename is the best there is.  Two
  // claims at the very same moment may then both pass; the self check of
  // the one overwritten ends it at its first wake-up.
  if (rename(claim.c_str(), path.c_str()) == 0) return true;
  unlink(claim.c_str());
  return true;  // could not write: silent, as a failed create
}

}  // namespace

void (*pidfile_claim_pause)() = [] {};

PidfileRead Pidfile_read(const char* host) { return read_path(rj_pid_path(host).c_str()); }

int Pidfile_probe(const char* host) { return probe(host, Pidfile_read(host)); }

int Pidfile_claim() {
  const char* host = rndctl.host.or_else("");
  const std::string path = rj_pid_path(host);
  const std::string claim = rj_pid_claim_path(host, rndctl.pid);
  // A few rounds: each lost one means another claimer won or took a stale
  // file away, and the next round judges what it left.
  for (int round = 0; round < 8; ++round) {
    struct stat seen;
    bool exists = stat(path.c_str(), &seen) == 0;
    PidfileRead r = read_path(path.c_str());
    int alive = probe(host, r);
    if (round == 0) (void)daemon_updatetime_set(host);  // the time set is of no use here
    if (alive) return 1;
    pidfile_claim_pause();
    if (!write_claim(claim, rndctl.pid)) return 0;
    if (exists && take_away_stale(path, seen, r.pid) == Take::kChanged) {
      unlink(claim.c_str());
      continue;
    }
    if (place_claim(claim, path)) return 0;
  }
  return 0;
}

bool Pidfile_self_check() {
  const std::string path = rj_pid_path(rndctl.host.or_else(""));
  PidfileRead r = read_path(path.c_str());
  if (r.status == PIDFILE_MISSING) {
    wrt_logfile("error openning \"%s\", <%s>", path.c_str(), strerror(r.error));
    return false;
  }
  if (r.status == PIDFILE_SHORT) {
    dbgpnt("%s\n", short_reason(r));
    wrt_logfile("%s", short_reason(r));
  }
  return r.pid == rndctl.pid;
}
