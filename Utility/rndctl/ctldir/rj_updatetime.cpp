// Update times of the hosts (their pid files) and the free-space check.
#include "Utility/rndctl/ctldir/rj_updatetime.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>

#include <cstdio>
#include <cstring>
#include <ctime>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"

long min_disk_space = 5242880;

namespace {
int64_t to_ns(const struct timespec& ts) {
  return static_cast<int64_t>(ts.tv_sec) * 1000000000LL + ts.tv_nsec;
}

void pid_file_path(char* out, size_t size, const char* host) {
  snprintf(out, size, "%s/%s.pid", rndctl.location.or_else("."), host);
}
}  // namespace

int64_t daemon_updatetime_set(const char* host) {
  if (host == nullptr) return 0;
  char path[4096];
  pid_file_path(path, sizeof path, host);
  // Full resolution: a change made within the second of the last reload must
  // still read as a change.  A missing file stays missing.
  struct timespec now;
  clock_gettime(CLOCK_REALTIME, &now);
  struct timespec times[2] = {now, now};
  utimensat(AT_FDCWD, path, times, 0);
  dbgpnt("daemon_updatetime_set( %s ) to %d \n", path, static_cast<int>(now.tv_sec));
  return to_ns(now);
}

int64_t daemon_updatetime_get(const char* host) {
  if (host == nullptr) return 0;
  char path[4096];
  pid_file_path(path, sizeof path, host);
  struct stat st;
  if (stat(path, &st) != 0) return 0;
  return to_ns(st.st_mtim);
}

int64_t editor_updatetime_get() {
  char path[4096];
  snprintf(path, sizeof path, "%s/Render_Job_Control", rndctl.location.or_else("."));
  struct stat st;
  if (stat(path, &st) != 0) return 0;
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
