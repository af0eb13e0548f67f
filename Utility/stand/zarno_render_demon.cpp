// zarno_render_demon: the render daemon, one per render host.
//
// It claims its host's pid file (a second daemon on the same host refuses to
// start), sends its diagnostics to a per-host log in the temporary directory,
// loads the control files and then serves: reload what changed, judge the
// render programs that ended, start what this host may render, and wait in
// 20-second steps until something changes.  It exits (status 1) when its pid
// file no longer names it or when it has found no work for a long time.
#include <fcntl.h>
#include <getopt.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>

#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_fileio.h"
#include "Utility/rndctl/ctldir/rj_pidfile.h"
#include "Utility/rndctl/ctldir/rj_updatetime.h"
#include "Utility/rndctl/ctlfile/rj_reload.h"
#include "Utility/rndctl/proc/rj_signal.h"
#include "Utility/rndctl/records/rj_jobcheck.h"
#include "Utility/rndctl/records/rj_recindex.h"
#include "Utility/rndctl/records/rj_schedule.h"
#include "Utility/rndctl/tasks/rj_perform.h"
#include "Utility/rndctl/tasks/rj_reclaim.h"
#include "Utility/rndctl/tasks/rj_select.h"
#include "Utility/rndctl/tasks/rj_status.h"
#include "Utility/rndctl/tasks/rj_task.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"
#include "Utility/rndctl/tasks/rj_tskio.h"

namespace {

constexpr const char* kUsage =
    "usage: zarno_render_demon [-l DIRECTORY] [-u SECONDS] [-d LEVEL] [-s]\n"
    "       zarno_render_demon -h | --help\n"
    "\n"
    "The render daemon of this host: renders the work of the control directory's\n"
    "jobs that this host may take, one daemon per host.\n"
    "\n"
    "  -l DIRECTORY  the control directory (else the preference\n"
    "                ZARNO_RNDCTL_LOCATION)\n"
    "  -u SECONDS    longest wait between two passes when nothing changes\n"
    "                (0: only on changes)\n"
    "  -d LEVEL      debug trace on (any non-zero level)\n"
    "  -s            single-pass flag (stored only)\n"
    "  -h, --help    this text\n"
    "\n"
    "Environment:\n"
    "  RNDCTL_DEBUG               debug level when -d is not given\n"
    "  ZARNO_RNDCTL_LOCATION      the control directory when -l is not given\n"
    "                             (also read from the preferences file)\n"
    "  ZARNO_RNDCTL_ACCESS_LOG    1: also log idle exits and timed-out locks in\n"
    "                             Render_Access (also a preference)\n"
    "  ZARNO_RNDCTL_HOST_TIMEOUT  seconds without a heartbeat before a host's\n"
    "                             tasks are put back (default 600)\n"
    "  DRCTMPDIR                  directory of the log zarno_render_demon.LOG and\n"
    "                             of the task streams (default /usr/tmp, else\n"
    "                             /var/tmp)\n"
    "  ZARNO_LOCATION             install directory, where the site preferences\n"
    "                             file .ZarnoPrefs is (default /usr/qm/zarno)\n"
    "  HOME                       where the user's .ZarnoPrefs is\n"
    "  ZARNO_RSH                  remote shell for liveness probes of other\n"
    "                             hosts (default rsh)\n"
    "\n"
    "Exit status: 0 after -h, 2 on a usage error, -1 (255) without a usable\n"
    "control directory, 1 on every other end.\n";

[[noreturn]] void usage_error(const char* what, const char* option) {
  fprintf(stderr, "%s: %s %s\n%s", PrgName, what, option, kUsage);
  exit(2);
}

int work_check() {
  if (rndctl.running != 0) return rndctl.running;
  int found = Task_file_search(rndctl.host.c_str());
  if (found != 0) return found;
  return Job_file_search(rndctl.host.c_str());
}

// The per-host log.  It lives in a world-writable directory: remove whatever
// stands there and create the file anew, refusing to follow a planted link.
void open_log_file() {
  char path[4096];
  snprintf(path, sizeof path, "%s/zarno_render_demon.LOG", rj_tmpdir());
  unlink(path);
  int fd = open(path, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_APPEND, 0644);
  if (fd < 0) {
    dbgpnt("failed to reopen stderr as %s\n", path);
    return;
  }
  fflush(stderr);
  fflush(stdout);
  if (dup2(fd, 2) < 0) dbgpnt("failed to reopen stderr as %s\n", path);
  if (dup2(fd, 1) < 0) dbgpnt("failed to reopen %s as stdout\n", path);
  close(fd);
}

// Refuses a control directory that cannot work, instead of waiting for ever
// on the first lock.
void check_control_directory() {
  const char* dir = rndctl.location.c_str();
  struct stat st;
  const char* why = nullptr;
  if (stat(dir, &st) != 0) {
    why = strerror(errno);
  } else if (!S_ISDIR(st.st_mode)) {
    why = "not a directory";
  } else if (access(dir, W_OK | X_OK) != 0) {
    why = "not writable";
  }
  if (why != nullptr) {
    fprintf(stderr, "%s: control directory %s: %s\n", PrgName, dir, why);
    exit(-1);
  }
}

int interval_seconds() { return static_cast<int>(rndctl.interval_min * 60 + rndctl.interval_sec); }

// How a wait ended.
enum class Wake { kSignal, kTouched };

// Whether the update time last seen can still hide a touch: a file server
// that keeps whole seconds gives a touch within the second of the last
// reload the same stamp.  Asked of the server's clock about once a second
// (by this host's monotonic clock, however often signals end a wait).
struct Settle {
  bool settled;
  int64_t next_ask_ns = 0;
};

// True when the server's second has moved on past a whole-second stamp that
// was not yet settled: the reload must then be the reconciling one, which
// takes the files as they stand, as for any other touch.
bool unsettled_second_passed(Settle* settle) {
  const int64_t now = fileop_monotonic_ns();
  if (settle->settled || now < settle->next_ask_ns) return false;
  settle->next_ask_ns = now + 1000000000;
  if (!rj_update_time_settled(rndctl.last_update, rj_heartbeat())) return false;
  settle->settled = true;
  rndctl.last_update = -1;  // forget the stamp
  return true;
}

// One wait of the service loop: until the 20-second alarm or another signal,
// or until the pid file's update time moves (a touch by an editor or another
// daemon, looked at every 200 ms), or an unsettled whole-second stamp is
// settled.  A render that ended is news of its own: its record is to be
// written and its processor is free, whatever the pid file's stamp says.
Wake wait_for_wake(const char* host, Settle* settle) {
  RJ_alarm(20);
  for (;;) {
    if (RJ_pause_for(200) != 0) {
      if (Task_judge_exits() != 0) return Wake::kTouched;
      return Wake::kSignal;
    }
    if (daemon_updatetime_get(host) != rndctl.last_update) return Wake::kTouched;
    if (unsettled_second_passed(settle)) return Wake::kTouched;
  }
}

// About once a minute, by the monotonic clock: a host's death is judged over
// minutes, and each look rewrites the task file.
bool dead_host_check_due() {
  static struct timespec last = {0, 0};
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  if (last.tv_sec != 0 && now.tv_sec - last.tv_sec < 60) return false;
  last = now;
  return true;
}

// Leaving: nothing this daemon started may go on rendering unowned.
void leave() { Task_release_own_renders(); }

// The loop's state from one pass to the next.
struct Loop {
  const char* host;
  // Whether the schedule locks this host (any non-zero value counts).
  int locked;
  int interval;  // seconds; 0: no timed reloads, negative: reload at once
  int idle;      // workless wake-ups left before the daemon leaves
};

Loop prepare_loop() {
  Loop loop;
  loop.host = rndctl.host.c_str();
  VerifyRunningTasks();
  // Deliberately the unconverted index: a free host (-1) starts as "locked"
  // and a host locked in slot 0 as "free", so that the first wake-up in
  // either case performs a transition.
  loop.locked = Dev_schedule_check(loop.host);

  // SIGALRM and SIGCHLD are blocked since main's first line and stay so;
  // the waits let them through only while they wait.
  RJ_sighold(SIGALRM);
  RJ_sighold(SIGCHLD);
  RJ_sigset(SIGALRM, sig_handler);
  RJ_sigset(SIGCHLD, sig_handler);
  loop.interval = interval_seconds();
  umask(2);
  loop.idle = 10;
  return loop;
}

// One pass: take in what changed, put back the work of dead hosts, start
// what this host may render.
void run_pass(const Loop& loop) {
  time_t server_now = rj_heartbeat();
  if (daemon_updatetime_get(loop.host) != rndctl.last_update) Update_from_demon(0);
  if (server_now != 0 && dead_host_check_due()) Task_reclaim_dead_hosts(server_now);
  UpdateRunningTasks();
  for (TASK* task = GetaPendingTask(); task != nullptr; task = GetaPendingTask()) {
    if (Perform_a_Task(task) == 0) SetTaskStatus(task, TASK_FAILED);
  }
  UpdateRunningTasks();
}

// Follows the host's schedule: locking it kills its renders.  Either change
// touches the pid file, so that a reload and a full pass follow at once.
void follow_schedule(Loop* loop) {
  int r = Dev_schedule_check(loop->host);
  if (r >= 0 && !loop->locked) {
    dbgpnt("locked = %d\n", 1);
    (void)daemon_updatetime_set(loop->host);  // the time set is of no use here
    daemon_kill_running_tasks(loop->host);
    loop->locked = 1;
  } else if (r < 0 && loop->locked) {
    dbgpnt("locked = %d\n", 0);
    loop->locked = 0;
    (void)daemon_updatetime_set(loop->host);
  }
}

// Counts a wake-up against the idle allowance; false when it is used up.
bool still_wanted(Loop* loop) {
  if (work_check() != 0) {
    loop->idle = 180;
    return true;
  }
  loop->idle = loop->idle - 1;
  return loop->idle >= 0;
}

enum class After { kReload, kExit };

// Waits between passes until a reload is due, or until the daemon is to
// exit (then the access log says why).
After wait_for_reload(Loop* loop) {
  Settle settle{rj_update_time_settled(rndctl.last_update, rj_heartbeat())};
  time_t start = time(nullptr);
  if (daemon_updatetime_get(loop->host) != rndctl.last_update || loop->interval < 0) {
    return After::kReload;
  }
  for (;;) {
    Wake wake = wait_for_wake(loop->host, &settle);
    if (!Pidfile_self_check()) {
      wrt_logfile("Exiting due to self check failure");
      return After::kExit;
    }
    // A failed touch leaves an older heartbeat; the next wake-up tries again.
    (void)rj_heartbeat();
    // A touch is work announced: straight to the reload.  Only the alarm
    // and the other signals count as the idle wake-ups they always were.
    if (wake == Wake::kTouched) return After::kReload;
    if (!still_wanted(loop)) {
      dbg_logfile("Exiting due to no work found");
      return After::kExit;
    }
    loop->interval = interval_seconds();
    int elapsed = static_cast<int>(time(nullptr) - start);
    dbgpnt("pause %d:%02d\t\tsec since last check = %d\n", rndctl.interval_min, rndctl.interval_sec,
           elapsed);
    follow_schedule(loop);
    if (daemon_updatetime_get(loop->host) != rndctl.last_update) return After::kReload;
    if (loop->interval != 0 && elapsed >= loop->interval) return After::kReload;
  }
}

void reload() {
  RJ_sighold(SIGALRM);
  RJ_sighold(SIGCHLD);
  dbgpnt("good morning\n");
  dbgpnt("somthings changed\n");  // read by log watchers: keep the spelling
  RJC_in();
}

// The service loop: a pass, a wait, a reload, until the daemon is to exit.
void zrd() {
  Loop loop = prepare_loop();
  for (;;) {
    run_pass(loop);
    if (wait_for_reload(&loop) == After::kExit) {
      leave();
      return;
    }
    reload();
  }
}

struct Options {
  long interval = 0;
  const char* location = nullptr;
};

Options parse_command_line(int argc, char* argv[]) {
  Options o;
  bool debug_given = false;
  opterr = 0;  // our own messages below
  static const struct option kLong[] = {{"help", no_argument, nullptr, 'h'},
                                        {nullptr, 0, nullptr, 0}};
  int c;
  while ((c = getopt_long(argc, argv, ":hu:l:d:s", kLong, nullptr)) != -1) {
    char bad[3] = {'-', static_cast<char>(optopt), '\0'};
    switch (c) {
      case 'h':
        fputs(kUsage, stdout);
        exit(0);
      case 'u':
        // Read wide, so that a huge value is refused rather than wrapped.
        o.interval = strtol(optarg, nullptr, 10);
        break;
      case 'l':
        o.location = optarg;
        break;
      case 'd':
        debug = atoi(optarg);
        debug_given = true;
        break;
      case 's':
        rndctl.single_pass = 1;
        break;
      case ':':
        usage_error("option needs a value:", bad);
      default:
        // A bad long option leaves optopt 0; its text is the word just read.
        usage_error("unknown option", optopt != 0 ? bad : argv[optind - 1]);
    }
  }
  if (!debug_given) {
    const char* level = getenv("RNDCTL_DEBUG");
    if (level != nullptr) debug = atoi(level);
  }
  return o;
}

void name_program(const char* argv0) {
  const char* slash = strrchr(argv0, '/');
  PrgName = slash != nullptr ? slash + 1 : argv0;
  MA_init();
  ProgramName = MA_strdup(PrgName, __LINE__, "Utility/stand/zarno_render_demon");
  snprintf(ApplModeName, sizeof ApplModeName, "%s", PrgName);
}

}  // namespace

int main(int argc, char* argv[]) {
  // The wake-up signal of editors and tools may come before the handlers
  // exist (while start-up waits for a lock): held, it ends the first wait
  // instead of the process.
  RJ_sighold(SIGALRM);
  RJ_sighold(SIGCHLD);
  umask(2);
  name_program(argv[0]);
  debug = 0;
  rndctl.single_pass = 0;
  Options options = parse_command_line(argc, argv);

  RJC_init_rndctl(options.location);
  check_control_directory();
  if (options.interval != 0) {
    (void)RJC_set_check_interval(options.interval / 60, options.interval % 60, "-u");
  }
  // One daemon per host: a live one keeps its place.
  if (Pidfile_claim() != 0) exit(1);
  open_log_file();
  // Whoever can write the control directory chooses the programs this
  // daemon runs: as root, that is every program on the host.
  if (geteuid() == 0)
    EDuprintf("%s: warning: running as root; every render program runs as root too", PrgName);
  RJC_in();
  // Nothing of this host renders now: what the file says it does was left
  // by a daemon that died.
  Task_reclaim_this_host();
  zrd();
  exit(1);
}
