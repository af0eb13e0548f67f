/// Signals and child tracking: the one handler for SIGALRM and SIGCHLD, the
/// wrappers every signal operation goes through, the liveness probe, and the
/// signal descriptions used in job error texts.
///
/// Calling order in the daemon: block SIGALRM and SIGCHLD first thing, then
/// RJ_sigset(SIGALRM, sig_handler) and RJ_sigset(SIGCHLD, sig_handler); from
/// then on the signals stay blocked except inside RJ_pause / RJ_pause_for,
/// the service loop's one wait.  So the handler never interrupts work on the
/// record lists or a shared file.  After every wait the loop takes the
/// exits the handler recorded (RJ_take_exit, through Task_judge_exits).
///
/// Control block: the handler writes `rndctl.signal_seen` (1) and nothing
/// else of it; RJ_signal reads `rndctl.host`.  Nothing here knows of tasks.
#pragma once

/// The last signal the handler ran for.
extern volatile int last_signal;

/// The handler for SIGALRM and SIGCHLD.  For SIGCHLD it reaps, in one call,
/// every child that has ended and records each (pid, status) for
/// RJ_take_exit; it sets last_signal and rndctl.signal_seen.
void sig_handler(int sig);

/// Sends `sig` to process `pid` of `host`, or with `sig` 0 asks whether it
/// lives (by `ps`, through the remote shell for another host).
/// Returns 0 when the signal went out, or, for `sig` 0, when the process
/// is ALIVE; non-zero when it is dead or kill failed (kill's -1).  A pid
/// below 1, a signal for another host (signals never cross hosts) and a
/// probe that could not run return 0.
[[nodiscard]] int RJ_signal(const char* host, int pid, int sig);

/// The text a job's error comment gives for a render killed by `sig`
/// (spelling kept as other tools read it); "Unrecognized SIGNAL" outside 1..31.
const char* RGget_sig_desc(int sig);

/// Block, unblock or ignore one signal, or install `handler` for it (with
/// SIGALRM and SIGCHLD blocked while it runs; SIGCHLD without stop reports).
/// Each returns sigprocmask's or sigaction's result: 0, or -1 with errno.
int RJ_sighold(int sig);
int RJ_sigrelse(int sig);
int RJ_sigignore(int sig);
int RJ_sigset(int sig, void (*handler)(int));
/// alarm(2): the seconds left of the previous alarm.
unsigned RJ_alarm(unsigned seconds);

/// Waits, with SIGALRM and SIGCHLD let through, until a handler has run;
/// a signal that arrived while they were blocked ends it at once.  -1
/// (EINTR), as sigsuspend.
int RJ_pause();
/// Like RJ_pause, but gives up after `ms` milliseconds: 1 when a signal was
/// handled, 0 when the time ran out.
int RJ_pause_for(long ms);
/// wait(2).
int RJ_wait(int* status);

/// One exit the SIGCHLD handler reaped (every ended child is reaped by one
/// call of the handler) and nobody has taken yet, oldest first: sets `pid`
/// and `status` (as waitpid gives it) and returns 1; 0 when none is left.
/// Call with SIGCHLD blocked (the daemon keeps it blocked outside its wait).
/// At most 256 exits wait to be taken; a child beyond that is reaped unseen.
int RJ_take_exit(int* pid, int* status);
