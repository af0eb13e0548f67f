// Update times of the hosts (their pid files) and the free-space check.
#include "Utility/rndctl/ctldir/rj_updatetime.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>

#include <cstdio>
#include <cstring>
#include <ctime>
#include <string>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/ctldir/rj_paths.h"

long min_disk_space = 5242880;

namespace {
int64_t to_ns(const struct timespec& ts) {
  return static_cast<int64_t>(ts.tv_sec) * 1000000000LL + ts.tv_nsec;
}
}  // namespace

int64_t daemon_updatetime_set(const char* host) {
  if (host == nullptr) return 0;
  const std::string path = rj_pid_path(host);
  // Full resolution: a change made within the second of the last reload must
  // still read as a change.  A missing file stays missing.
  struct timespec now;
  clock_gettime(CLOCK_REALTIME, &now);
  struct timespec times[2] = {now, now};
  (void)utimensat(AT_FDCWD, path.c_str(), times, 0);
  dbgpnt("daemon_updatetime_set( %s ) to %d \n", path.c_str(), static_cast<int>(now.tv_sec));
  return to_ns(now);
}

int64_t daemon_updatetime_get(const char* host) {
  if (host == nullptr) return 0;
  struct stat st;
  if (stat(rj_pid_path(host).c_str(), &st) != 0) return 0;
  return to_ns(st.st_mtim);
}

int64_t editor_updatetime_get() {
  struct stat st;
  if (stat(rj_control_path(FILE_JOBS).c_str(), &st) != 0) return 0;
  return to_ns(st.st_mtim);
}

long IS_enough_disk() {
  struct statvfs fs;
  if (statvfs(rndctl.location.or_else("."), &fs) != 0) {
    perror("Control File System:");
    memset(&fs, 0, sizeof fs);
  }
  long long available =
      static_cast<long long>(fs.f_bavail) * static_cast<long long>(fs.f_frsize) - min_disk_space;
  dbgpnt("available_disk = %d\n", static_cast<int>(available));
  return static_cast<long>(available);
}
