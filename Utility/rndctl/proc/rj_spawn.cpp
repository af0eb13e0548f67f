#include "Utility/rndctl/proc/rj_spawn.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/proc/rj_signal.h"

extern char** environ;

namespace {

// --- The child side --------------------------------------------------------
// Between fork and exec only async-signal-safe calls: the parent's heap and
// stdio locks may be in any state in the copy.

size_t put_text(char* buf, size_t size, size_t at, const char* text) {
  if (text == nullptr) text = "(null)";
  while (*text != '\0' && at + 1 < size) buf[at++] = *text++;
  buf[at] = '\0';
  return at;
}

// Everything the child uses, made in the parent.
struct ChildPlan {
  const RjSpawn* spawn;     // non-owning
  const char* exec_path;    // non-owning; null: the program was not found
  int find_error;           // why not, as an exec would have said it
  char* const* shell_argv;  // non-owning; the program run by /bin/sh
};

void child_trace(const RjSpawn& spawn, const char* text) {
  if (spawn.trace_prefix == nullptr) return;
  char line[1024];
  size_t at = put_text(line, sizeof line, 0, spawn.trace_prefix);
  at = put_text(line, sizeof line, at, ":\t");
  at = put_text(line, sizeof line, at, text);
  rj_write_all(STDERR_FILENO, line, at);
}

// Puts a fresh file on `target`.  A stream may live in a world-writable
// temporary directory, so a planted symbolic link must not redirect it.
bool child_reopen(const char* path, int target) {
  if (path == nullptr) return false;
  int fd;
  do {
    fd = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0666);
  } while (fd < 0 && errno == EINTR);
  if (fd < 0) return false;
  // dup2 leaves close-on-exec off on the target.
  int ok = dup2(fd, target);
  close(fd);
  return ok >= 0;
}

void child_reset_signals() {
  // Handlers are dropped by exec anyway, but ignored dispositions and the
  // signal mask are inherited.
  struct sigaction dfl {};
  dfl.sa_handler = SIG_DFL;
  sigemptyset(&dfl.sa_mask);
  for (int sig = 1; sig < NSIG; ++sig) {
    if (sig == SIGKILL || sig == SIGSTOP) continue;
    sigaction(sig, &dfl, nullptr);
  }
  sigset_t none;
  sigemptyset(&none);
  sigprocmask(SIG_SETMASK, &none, nullptr);
}

void child_streams(const RjSpawn& spawn) {
  char line[1024];
  if (!child_reopen(spawn.stderr_path, STDERR_FILENO)) {
    size_t at = put_text(line, sizeof line, 0, "eeeeeeeeeeeeeeeeeeeeeeee failed to reopen \"");
    at = put_text(line, sizeof line, at, spawn.stderr_path);
    put_text(line, sizeof line, at, "\" as stderr\n");
    child_trace(spawn, line);
  }
  if (!child_reopen(spawn.stdout_path, STDOUT_FILENO)) {
    size_t at = put_text(line, sizeof line, 0, "oooooooooooooooooooooooo failed to reopen \"");
    at = put_text(line, sizeof line, at, spawn.stdout_path);
    put_text(line, sizeof line, at, "\" as stdout\n");
    child_trace(spawn, line);
  }
}

[[noreturn]] void child_exec(const ChildPlan& plan) {
  const RjSpawn& spawn = *plan.spawn;
  child_reset_signals();
  setpgid(0, 0);
  // A relative output path is meant from the working directory: change first.
  // A directory that cannot be entered leaves the child where the parent is.
  if (spawn.workdir != nullptr && chdir(spawn.workdir) != 0) {
  }
  child_streams(spawn);

  int error = plan.find_error;
  if (plan.exec_path != nullptr) {
    execve(plan.exec_path, spawn.argv, spawn.envp);
    error = errno;
    // A file without a "#!" line is a shell script, as execvp has it.
    if (error == ENOEXEC) execve("/bin/sh", plan.shell_argv, spawn.envp);
  }

  // strerrordesc_np only indexes a constant table: safe here, unlike
  // strerror, which may translate and allocate.
  const char* reason = strerrordesc_np(error);
  if (reason == nullptr) reason = "Unknown error";
  char line[1024];
  size_t at = put_text(line, sizeof line, 0, "system(\"");
  at = put_text(line, sizeof line, at, spawn.argv[0]);
  at = put_text(line, sizeof line, at, "\") failed at exec <");
  at = put_text(line, sizeof line, at, reason);
  at = put_text(line, sizeof line, at, ">\n");
  child_trace(spawn, line);
  rj_write_all(STDERR_FILENO, line, at);
  rj_write_all(STDOUT_FILENO, line, at);
  _exit(-1);
}

// --- The parent side --------------------------------------------------------

// 0 when `candidate` (relative ones from `dir_fd`) is a regular file that
// may be executed; EACCES when it exists but may not; ENOENT when absent.
int check_program(int dir_fd, const std::string& candidate) {
  struct stat st;
  if (fstatat(dir_fd, candidate.c_str(), &st, 0) != 0) return ENOENT;
  if (!S_ISREG(st.st_mode) || faccessat(dir_fd, candidate.c_str(), X_OK, 0) != 0) return EACCES;
  return 0;
}

struct FdCloser {
  int fd;
  ~FdCloser() {
    if (fd >= 0) close(fd);
  }
};

int find_program_from(const char* name, const char* dir, std::string* path) {
  if (name == nullptr || *name == '\0') return ENOENT;
  if (strchr(name, '/') != nullptr) {
    path->assign(name);
    return 0;
  }
  // The child changes directory before it executes, so relative PATH
  // entries mean the directory it will be in.
  FdCloser dir_fd{dir != nullptr ? open(dir, O_RDONLY | O_DIRECTORY | O_CLOEXEC) : -1};
  const int base = dir_fd.fd >= 0 ? dir_fd.fd : AT_FDCWD;
  const char* env = getenv("PATH");
  const std::string dirs = env != nullptr ? env : "/bin:/usr/bin";
  int error = ENOENT;
  size_t at = 0;
  for (;;) {
    const size_t colon = dirs.find(':', at);
    const std::string entry = dirs.substr(at, colon == std::string::npos ? colon : colon - at);
    const std::string candidate = entry.empty() ? std::string(name) : entry + "/" + name;
    const int found = check_program(base, candidate);
    if (found == 0) {
      // An empty entry: named from the working directory, not searched again.
      *path = entry.empty() ? "./" + candidate : candidate;
      return 0;
    }
    if (found == EACCES) error = EACCES;
    if (colon == std::string::npos) break;
    at = colon + 1;
  }
  return error;
}

}  // namespace

int RJ_find_program(const char* name, std::string* path) {
  return find_program_from(name, nullptr, path);
}

std::vector<std::string> RJ_env_with(const char* name, const char* value) {
  std::vector<std::string> env;
  const std::string entry = std::string(name) + "=" + value;
  const size_t key = strlen(name) + 1;
  bool replaced = false;
  for (char** e = environ; e != nullptr && *e != nullptr; ++e) {
    if (strncmp(*e, entry.c_str(), key) == 0) {
      if (!replaced) env.push_back(entry);
      replaced = true;
    } else {
      env.emplace_back(*e);
    }
  }
  if (!replaced) env.push_back(entry);
  return env;
}

int RJ_spawn(const RjSpawn& spawn) {
  if (spawn.argv == nullptr || spawn.argv[0] == nullptr) return -1;

  std::string exec_path;
  const int find_error = find_program_from(spawn.argv[0], spawn.workdir, &exec_path);
  std::vector<char*> shell_argv{const_cast<char*>("/bin/sh"), exec_path.data()};
  for (char* const* a = spawn.argv + 1; *a != nullptr; ++a) shell_argv.push_back(*a);
  shell_argv.push_back(nullptr);
  const ChildPlan plan{&spawn, find_error == 0 ? exec_path.c_str() : nullptr, find_error,
                       shell_argv.data()};

  const pid_t pid = fork();
  if (pid == 0) child_exec(plan);
  if (pid < 0) return -1;
  // The child makes itself the leader of its own group too; doing it here as
  // well closes the window in which a kill of the group would find no group.
  setpgid(pid, pid);
  return pid;
}

int rj_kill_render(const char* host, int pid, int sig) {
  if (pid < 2) return 0;
  // Another host's render: RJ_signal says so in the trace and sends nothing.
  if (host != nullptr && !rndctl.host.is(host)) return RJ_signal(host, pid, sig);
  // The render program leads its own process group: whatever it started
  // (a renderer behind a wrapper script, helpers) must go with it.
  int result = kill(-pid, sig);
  if (result != 0 && errno == ESRCH) result = kill(pid, sig);
  dbgpnt("kill( %d, %d ) = %d(%d);\n", pid, sig, result, result != 0 ? errno : 0);
  return result;
}
