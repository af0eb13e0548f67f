// The diagnostics channels, the clock and small helpers every unit uses.
#include "Utility/rndctl/base/rj_log.h"

#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "Utility/rndctl/base/rj_control.h"

int debug = 0;
int debug_fileacc = 0;
const char* PrgName = "zarno_render_demon";
char* ProgramName = nullptr;
char ApplModeName[64] = "";

namespace {

time_t system_clock() { return time(nullptr); }

// Shared formatting buffers of the trace and log channels.  Bounded: an
// over-long message is cut, never written past the buffer.
char trace_buffer[8192];
char log_buffer[4096];

FILE* access_stream = nullptr;  // owned by the locked file operations

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
  FILE* log = access_stream;
  if (log == nullptr) return;
  time_t now = rj_now();
  fprintf(log, "* %s --  %s:%s(%d) %s", message, rndctl.host.or_else(""), PrgName, rndctl.pid,
          ctime(&now));
  fflush(log);
}

}  // namespace

namespace {
mode_t saved_umask = 0;
bool umask_saved = false;
}  // namespace

void rj_note_original_umask(mode_t mask) {
  if (umask_saved) return;
  saved_umask = mask;
  umask_saved = true;
}

mode_t get_original_umask() { return saved_umask; }

void rj_set_access_stream(FILE* stream) { access_stream = stream; }

time_t (*rj_clock)() = system_clock;

time_t rj_now() { return rj_clock(); }

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

int rj_strcmp(const char* a, const char* b) {
  if (a == nullptr && b == nullptr) return 0;
  if (b == nullptr) return 1;
  if (a == nullptr) return -1;
  return strcmp(a, b);
}

int is_editor() { return 0; }
void sounder(int /*code*/) {}
void IR_repoint_editor_list() {}
void IR_rebuild_rndctl() {}
void Update_control_and_editors(void* /*what*/) {}
