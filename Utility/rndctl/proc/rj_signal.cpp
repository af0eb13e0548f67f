// Signals and child tracking: the one handler for SIGALRM and SIGCHLD, the
// wrappers every signal operation passes through, the liveness probe and the
// signal descriptions used in job error texts.
//
// The daemon keeps SIGALRM and SIGCHLD blocked all the time except inside
// RJ_pause (sigsuspend), so the handler only ever runs while the service loop
// waits and never interrupts its file or list work.  That is what makes the
// traces inside the handler safe.  The handler only reaps and records
// (pid, status) pairs; the service loop judges them (RJ_take_exit).
#include "Utility/rndctl/proc/rj_signal.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"

volatile int last_signal = 0;

namespace {

int mask_op(int how, int sig) {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, sig);
  return sigprocmask(how, &set, nullptr);
}

// Exits reaped by the handler and not yet taken by the service loop: a ring
// the handler fills and RJ_take_exit empties, with SIGCHLD blocked.
constexpr int kExitSlots = 256;
struct ExitSlot {
  int pid;
  int status;
};
ExitSlot exits[kExitSlots];
volatile int exits_head = 0;  // next to take
volatile int exits_count = 0;

// Runs argv with its stdout into `out_fd` and waits for it; true when it ran.
bool run_probe(char* const argv[], int out_fd) {
  pid_t child = fork();
  if (child < 0) return false;
  if (child == 0) {
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    signal(SIGALRM, SIG_DFL);
    signal(SIGCHLD, SIG_DFL);
    dup2(out_fd, 1);
    int devnull = open("/dev/null", O_WRONLY);
    if (devnull >= 0) dup2(devnull, 2);
    execvp(argv[0], argv);
    _exit(127);
  }
  int status = 0;
  while (waitpid(child, &status, 0) < 0) {
    if (errno != EINTR) return false;
  }
  return WIFEXITED(status) && WEXITSTATUS(status) != 127;
}

// Asks `ps` (through the remote shell for another host) whether pid runs.
// Returns 0 when it does, 1 when it does not or the probe could not run.
int probe_alive(const char* host, int pid) {
  bool remote = host != nullptr && !rndctl.host.is(host);
  if (!remote && access("/usr/bin/ps", X_OK) != 0) {
    // No ps here: ask the kernel.  EPERM still means the process exists.
    if (kill(pid, 0) == 0 || errno == EPERM) return 0;
    return 1;
  }

  char temp[4096];
  snprintf(temp, sizeof temp, "%s/rjprobeXXXXXX", rj_tmpdir());
  int fd = mkstemp(temp);
  if (fd < 0) {
    snprintf(temp, sizeof temp, "/tmp/rjprobeXXXXXX");
    fd = mkstemp(temp);
  }
  if (fd < 0) return -1;  // no temporary file: the caller counts it as alive

  char ps_command[64];
  snprintf(ps_command, sizeof ps_command, "/usr/bin/ps -p %d", pid);
  char pid_text[32];
  snprintf(pid_text, sizeof pid_text, "%d", pid);
  const char* rsh = getenv("ZARNO_RSH");
  if (rsh == nullptr || *rsh == '\0') rsh = "rsh";

  bool ran;
  if (remote) {
    dbgpnt("%s %s -n '/usr/bin/ps -p %d' > %s\n", rsh, host, pid, temp);
    char* argv[] = {const_cast<char*>(rsh), const_cast<char*>(host), const_cast<char*>("-n"),
                    ps_command, nullptr};
    ran = run_probe(argv, fd);
  } else {
    dbgpnt("/usr/bin/ps -p %d > %s\n", pid, temp);
    char* argv[] = {const_cast<char*>("/usr/bin/ps"), const_cast<char*>("-p"), pid_text, nullptr};
    ran = run_probe(argv, fd);
  }
  close(fd);

  int result = 1;
  if (ran) {
    FILE* in = fopen(temp, "r");
    if (in != nullptr) {
      char header[80];
      int found = 0;
      if (fgets(header, sizeof header, in) != nullptr && fscanf(in, "%d", &found) == 1 &&
          found == pid) {
        result = 0;
      }
      fclose(in);
    }
  }
  unlink(temp);
  return result;
}

}  // namespace

int RJ_sighold(int sig) { return mask_op(SIG_BLOCK, sig); }

int RJ_sigrelse(int sig) { return mask_op(SIG_UNBLOCK, sig); }

int RJ_sigignore(int sig) {
  struct sigaction action;
  memset(&action, 0, sizeof action);
  action.sa_handler = SIG_IGN;
  sigemptyset(&action.sa_mask);
  return sigaction(sig, &action, nullptr);
}

int RJ_sigset(int sig, void (*handler)(int)) {
  struct sigaction action;
  memset(&action, 0, sizeof action);
  action.sa_handler = handler;
  // The handler runs with both of its signals held.
  sigemptyset(&action.sa_mask);
  sigaddset(&action.sa_mask, SIGALRM);
  sigaddset(&action.sa_mask, SIGCHLD);
  action.sa_flags = (sig == SIGCHLD) ? SA_NOCLDSTOP : 0;
  return sigaction(sig, &action, nullptr);
}

unsigned RJ_alarm(unsigned seconds) { return alarm(seconds); }

int RJ_pause() {
  // The one place where SIGALRM and SIGCHLD are let through.  A signal that
  // arrived while they were blocked is pending and ends the wait at once.
  sigset_t mask;
  sigprocmask(SIG_SETMASK, nullptr, &mask);
  sigdelset(&mask, SIGALRM);
  sigdelset(&mask, SIGCHLD);
  return sigsuspend(&mask);
}

int RJ_pause_for(long ms) {
  // As RJ_pause, with a time limit: ppoll sets the mask and waits in one
  // step, so a signal that is already pending ends the wait at once.
  sigset_t mask;
  sigprocmask(SIG_SETMASK, nullptr, &mask);
  sigdelset(&mask, SIGALRM);
  sigdelset(&mask, SIGCHLD);
  struct timespec limit;
  limit.tv_sec = ms / 1000;
  limit.tv_nsec = (ms % 1000) * 1000000L;
  return ppoll(nullptr, 0, &limit, &mask) < 0 && errno == EINTR ? 1 : 0;
}

int RJ_wait(int* status) { return wait(status); }

int RJ_take_exit(int* pid, int* status) {
  if (exits_count == 0) return 0;
  const ExitSlot& slot = exits[exits_head];
  *pid = slot.pid;
  *status = slot.status;
  exits_head = (exits_head + 1) % kExitSlots;
  exits_count = exits_count - 1;
  return 1;
}

void sig_handler(int sig) {
  int saved_errno = errno;
  RJ_sighold(SIGALRM);
  RJ_sighold(SIGCHLD);
  last_signal = sig;
  if (sig == SIGCHLD) {
    // Pending SIGCHLDs merge into one: reap every child that has ended.
    for (;;) {
      int status = 0;
      pid_t pid = waitpid(-1, &status, WNOHANG);
      if (pid <= 0) break;
      if (exits_count < kExitSlots) {
        exits[(exits_head + exits_count) % kExitSlots] = ExitSlot{pid, status};
        exits_count = exits_count + 1;
      }
    }
  }
  rndctl.signal_seen = 1;
  RJ_sigrelse(SIGALRM);
  RJ_sigrelse(SIGUSR1);
  RJ_sigset(SIGCHLD, sig_handler);
  errno = saved_errno;
}

int RJ_signal(const char* host, int pid, int sig) {
  int result = 1;
  if (pid < 1) return 0;
  umask(get_original_umask());
  if (sig != 0) {
    if (host != nullptr && !rndctl.host.is(host)) {
      // Signals never cross hosts; the caller is told it went out.
      dbgpnt("ERROR kill sent remote %s %d\n", host, pid);
      umask(1);
      return 0;
    }
    result = kill(pid, sig);
    dbgpnt("kill( %d, %d ) = %d(%d);\n", pid, sig, result, errno);
  } else {
    result = probe_alive(host, pid);
    if (result < 0) return 0;
  }
  umask(1);
  return result;
}

const char* RGget_sig_desc(int sig) {
  // Texts as other tools read them from job comments: keep the spelling.
  static const char* const table[32] = {
      "Unrecognized SIGNAL",
      "recieved SIGHUP (Hangup)",
      "recieved SIGINT (Interrupt)",
      "SIGQUIT",
      "SIGILL Programming Error Core Dumped",
      "Unrecognized SIGNAL",
      "SIGABRT Programming Error Core Dumped",
      "SIGEMT Programming Error Core Dumped",
      "SIGFPE Programming Error Core Dumped",
      "SIGKILL (Killed)",
      "SIGBUS Programming Error Core Dumped",
      "SIGSEGV Programming Error Core Dumped",
      "SIGSYS Programming Error Core Dumped",
      "SIGPIPE Broken Pipe",
      "SIGALRM",
      "SIGTERM Terminated by a user",
      "SIGUSR1 (out of vertual mem)",
      "SIGUSR2 Exit User Signal 2",
      "SIGCHLD Child Status Changed",
      "SIGPWR Power Fail/Restart",
      "Unrecognized SIGNAL",
      "Unrecognized SIGNAL",
      "Unrecognized SIGNAL",
      "SIGSTOP (Stopped)",
      "SIGTSTP Stopped (user)",
      "Unrecognized SIGNAL",
      "Unrecognized SIGNAL",
      "Unrecognized SIGNAL",
      "Unrecognized SIGNAL",
      "Unrecognized SIGNAL",
      "Unrecognized SIGNAL",
      "SIGXFSZ File size limit exceeded Core Dumped",
  };
  if (sig < 1 || sig > 31) return "Unrecognized SIGNAL";
  return table[sig];
}
