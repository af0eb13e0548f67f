// The render registry: which render programs this daemon runs, on disk, so
// that a daemon started after a crash can end what its predecessor left.
// Written on every start and exit of a render: fixed storage, plain system
// calls.
#include "Utility/rndctl/proc/rj_registry.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"

namespace {

struct RenderSlot {
  int pid;
  unsigned long long start;
};
constexpr int kMaxRenders = 256;
RenderSlot renders[kMaxRenders];
int render_count = 0;

// Field 22 of /proc/PID/stat: when the process started, in clock ticks since
// boot.  A pid that was reused names a process with another start time.
bool process_start_time(int pid, unsigned long long* start) {
  char path[64];
  snprintf(path, sizeof path, "/proc/%d/stat", pid);
  int fd = open(path, O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  char buf[1024];
  ssize_t n;
  do n = read(fd, buf, sizeof buf - 1);
  while (n < 0 && errno == EINTR);
  close(fd);
  if (n <= 0) return false;
  buf[n] = '\0';
  // The command name may hold blanks and parentheses: count from the last ')'.
  const char* p = strrchr(buf, ')');
  if (p == nullptr) return false;
  ++p;
  for (int field = 3; field <= 22; ++field) {
    while (*p == ' ') ++p;
    if (*p == '\0') return false;
    if (field == 22) {
      char* end = nullptr;
      *start = strtoull(p, &end, 10);
      return end != p;
    }
    while (*p != ' ' && *p != '\0') ++p;
  }
  return false;
}

// The temporary directory is writable by everyone: the registry is written
// under a fresh name that a planted link cannot stand in for, then renamed
// over whatever stands at its place (rename replaces a link, never follows it).
void write_registry() {
  const char* path = rj_render_registry_path();
  char temp[PATH_MAX + 16];
  snprintf(temp, sizeof temp, "%s.%d", path, static_cast<int>(getpid()));
  unlink(temp);
  int fd;
  do fd = open(temp, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
  while (fd < 0 && errno == EINTR);
  if (fd < 0) return;
  for (int i = 0; i < render_count; ++i) {
    char line[64];
    int n = snprintf(line, sizeof line, "%d %llu\n", renders[i].pid, renders[i].start);
    if (n > 0) rj_write_all(fd, line, static_cast<size_t>(n));
  }
  close(fd);
  if (rename(temp, path) != 0) unlink(temp);
}

}  // namespace

const char* rj_render_registry_path() {
  static char path[PATH_MAX];
  snprintf(path, sizeof path, "%s/zarno_render_demon.%s.renders", rj_tmpdir(),
           rndctl.host.or_else(""));
  return path;
}

void rj_render_started(int pid) {
  if (pid < 2 || render_count == kMaxRenders) return;
  unsigned long long start = 0;
  if (!process_start_time(pid, &start)) return;
  renders[render_count++] = RenderSlot{pid, start};
  write_registry();
}

void rj_render_ended(int pid) {
  for (int i = 0; i < render_count; ++i) {
    if (renders[i].pid != pid) continue;
    renders[i] = renders[--render_count];
    write_registry();
    return;
  }
}

int rj_render_kill_leftovers() {
  const char* path = rj_render_registry_path();
  int killed = 0;
  int fd;
  do fd = open(path, O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
  while (fd < 0 && errno == EINTR);
  if (fd >= 0) {
    // A list of pids to kill is believed only from ourselves.
    struct stat st;
    std::string text;
    if (fstat(fd, &st) == 0 && S_ISREG(st.st_mode) && st.st_uid == geteuid() &&
        (st.st_mode & 022) == 0) {
      char chunk[4096];
      for (;;) {
        ssize_t n = read(fd, chunk, sizeof chunk);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        text.append(chunk, static_cast<size_t>(n));
      }
    } else {
      dbgpnt("render registry %s not believed\n", path);
    }
    close(fd);
    const char* p = text.c_str();
    int pid = 0;
    unsigned long long start = 0;
    int used = 0;
    while (sscanf(p, "%d %llu%n", &pid, &start, &used) == 2) {
      p += used;
      unsigned long long now_start = 0;
      if (pid < 2 || pid == getpid() || !process_start_time(pid, &now_start) ||
          now_start != start) {
        continue;
      }
      // It leads its own group: whatever it started goes with it.
      int r = kill(-pid, SIGKILL);
      if (r != 0 && errno == ESRCH) r = kill(pid, SIGKILL);
      dbgpnt("render %d left by an earlier daemon: kill = %d\n", pid, r);
      if (r == 0) ++killed;
    }
  }
  render_count = 0;
  write_registry();
  return killed;
}

void rj_render_forget_all() {
  render_count = 0;
  write_registry();
}
