// The control block, the diagnostics channels, host update times and the
// free-space check.
#include <fcntl.h>
#include <pwd.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "General/pst/pst.h"
#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/rndctl.h"

RndCtl rndctl;

int debug = 0;
int debug_fileacc = 0;
const char* PrgName = "zarno_render_demon";
char* ProgramName = nullptr;
char ApplModeName[64] = "";

long min_disk_space = 5242880;

namespace {

time_t system_clock() { return time(nullptr); }

// Shared formatting buffers of the trace and log channels.  Bounded: an
// over-long message is cut, never written past the buffer.
char trace_buffer[8192];
char log_buffer[4096];

// Writes under an exclusive flock on stderr's descriptor, so that lines of
// processes sharing one log file do not interleave.
void write_locked_stderr(const char* prefix_host, const char* text) {
  int fd = fileno(stderr);
  flock(fd, LOCK_EX);
  if (prefix_host != nullptr) {
    fprintf(stderr, "%s:\t%s", prefix_host, text);
  } else {
    fprintf(stderr, "%s\n", text);
  }
  fflush(stderr);
  flock(fd, LOCK_UN);
}

void append_access_log(const char* message) {
  FILE* log = fileop_access_stream();
  if (log == nullptr) return;
  time_t now = rj_now();
  fprintf(log, "* %s --  %s:%s(%d) %s", message, rndctl.host.or_else(""), PrgName, rndctl.pid,
          ctime(&now));
  fflush(log);
}

int64_t to_ns(const struct timespec& ts) {
  return static_cast<int64_t>(ts.tv_sec) * 1000000000LL + ts.tv_nsec;
}

}  // namespace

time_t (*rj_clock)() = system_clock;

time_t rj_now() { return rj_clock(); }

bool rj_dev_on_host(const Dev* dev, const char* host) {
  return dev != nullptr && host != nullptr && dev->host_name.is(host);
}

bool rj_dev_is_this_host(const Dev* dev) { return rj_dev_on_host(dev, rndctl.host.c_str()); }

void rj_write_all(int fd, const char* text, size_t length) {
  while (length > 0) {
    ssize_t n = write(fd, text, length);
    if (n < 0) {
      if (errno == EINTR) continue;
      return;
    }
    text += n;
    length -= static_cast<size_t>(n);
  }
}

void Job_wake_other_hosts(const Job* job) {
  if (job == nullptr) return;
  for (const RndDevList* e = job->resources; e != nullptr; e = e->next) {
    const Dev* dev = e->dev;
    if (dev == nullptr || dev->host_name.none() || rj_dev_is_this_host(dev)) continue;
    bool seen = false;  // several resources may stand for one host
    for (const RndDevList* f = job->resources; f != e && !seen; f = f->next) {
      seen = f->dev != nullptr && f->dev->host_name.is(dev->host_name.c_str());
    }
    if (!seen) daemon_updatetime_set(dev->host_name.c_str());
  }
}

const char* rj_tmpdir() {
  const char* dir = getenv("DRCTMPDIR");
  if (dir != nullptr && *dir != '\0') return dir;
  struct stat st;
  if (stat("/usr/tmp", &st) == 0 && S_ISDIR(st.st_mode)) return "/usr/tmp";
  return "/var/tmp";
}

void dbgpnt(const char* format, ...) {
  if (debug == 0) return;
  // Off while formatting, so nothing called from here can trace recursively;
  // any level becomes 1 afterwards: the level is a switch.
  debug = 0;
  va_list ap;
  va_start(ap, format);
  vsnprintf(trace_buffer, sizeof trace_buffer, format, ap);
  va_end(ap);
  write_locked_stderr(rndctl.host.or_else(""), trace_buffer);
  debug = 1;
}

void EDuprintf(const char* format, ...) {
  va_list ap;
  va_start(ap, format);
  vsnprintf(trace_buffer, sizeof trace_buffer, format, ap);
  va_end(ap);
  write_locked_stderr(nullptr, trace_buffer);
}

void wrt_logfile(const char* format, ...) {
  va_list ap;
  va_start(ap, format);
  vsnprintf(log_buffer, sizeof log_buffer, format, ap);
  va_end(ap);
  append_access_log(log_buffer);
}

void dbg_logfile(const char* format, ...) {
  if (debug_fileacc == 0) return;
  va_list ap;
  va_start(ap, format);
  vsnprintf(log_buffer, sizeof log_buffer, format, ap);
  va_end(ap);
  append_access_log(log_buffer);
}

void RJC_init_rndctl(const char* location) {
  if (location == nullptr) location = get_zarno_variable("ZARNO_RNDCTL_LOCATION");
  if (location == nullptr) {
    fprintf(stderr, "Zarno variable ZARNO_RNDCTL_LOCATION must be set\n");
    exit(-1);
  }
  rndctl.location.set(location);

  char host[64];
  if (gethostname(host, sizeof host) != 0) host[0] = '\0';
  host[sizeof host - 1] = '\0';
  rndctl.host.set(host);

  rndctl.pid = getpid();

  // The login name of the effective user.
  struct passwd* pw = getpwuid(geteuid());
  rndctl.user.set(pw != nullptr ? pw->pw_name : nullptr);

  const char* install = getenv("ZARNO_LOCATION");
  rndctl.install.set(install != nullptr ? install : "/usr/qm/zarno");

  // The optional access-log lines (idle exits, timed-out locks): on when
  // ZARNO_RNDCTL_ACCESS_LOG, from the environment or else the preferences
  // file (only when there is one to read: its lookup complains otherwise),
  // is a non-zero number.
  const char* access_log = getenv("ZARNO_RNDCTL_ACCESS_LOG");
  const char* prefs = access_log == nullptr ? find_variable_file(0, nullptr, nullptr) : nullptr;
  if (prefs != nullptr && *prefs != '\0' && access(prefs, R_OK) == 0)
    access_log = get_zarno_variable("ZARNO_RNDCTL_ACCESS_LOG");
  if (access_log != nullptr && atoi(access_log) != 0) debug_fileacc = 1;

  dbgpnt("%s %d %s -------------------------------------------RJC_init_rndctl\n",
         rndctl.host.or_else(""), rndctl.pid, rndctl.user.or_else("(null)"));
}

namespace {
// The last value refused, so that a bad header read again at every reload
// is reported once, not every few seconds.
bool refused_any = false;
long refused_min = 0;
long refused_sec = 0;
}  // namespace

int RJC_set_check_interval(long minutes, long seconds, const char* from) {
  // The loop waits interval_min * 60 + interval_sec seconds, as an int: a
  // negative part, or a total past that, wraps round to a negative wait,
  // which the loop takes as "reload now", at full speed for ever.
  bool valid = minutes >= 0 && seconds >= 0 && seconds <= 59 && minutes <= (INT_MAX - seconds) / 60;
  if (valid) {
    rndctl.interval_min = static_cast<unsigned>(minutes);
    rndctl.interval_sec = static_cast<unsigned>(seconds);
    refused_any = false;
    return 1;
  }
  if (!refused_any || refused_min != minutes || refused_sec != seconds) {
    char line[256];
    snprintf(line, sizeof line,
             "ignoring check interval %ld:%02ld from %s: out of range, keeping %u:%02u", minutes,
             seconds, from != nullptr ? from : "(null)", rndctl.interval_min, rndctl.interval_sec);
    write_locked_stderr(nullptr, line);
    refused_any = true;
    refused_min = minutes;
    refused_sec = seconds;
  }
  return 0;
}

namespace {
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

int is_editor() { return 0; }
void sounder(int /*code*/) {}
void IR_repoint_editor_list() {}
void IR_rebuild_rndctl() {}
void Update_control_and_editors(void* /*what*/) {}
