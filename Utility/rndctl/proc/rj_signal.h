#pragma once

// Signals and child tracking (rj_signal).
extern volatile int last_signal;
void sig_handler(int sig);
int RJ_signal(const char* host, int pid, int sig);
const char* RGget_sig_desc(int sig);
int RJ_sighold(int sig);
int RJ_sigrelse(int sig);
int RJ_sigignore(int sig);
int RJ_sigset(int sig, void (*handler)(int));
unsigned RJ_alarm(unsigned seconds);
int RJ_pause();
/// Like RJ_pause, but gives up after `ms` milliseconds: 1 when a signal was
/// handled, 0 when the time ran out.
int RJ_pause_for(long ms);
int RJ_wait(int* status);
/// One exit the SIGCHLD handler reaped (every ended child is reaped by one
/// call of the handler) and nobody has taken yet, oldest first: sets `pid`
/// and `status` (as waitpid gives it) and returns 1; 0 when none is left.
/// Call with SIGCHLD blocked (the daemon keeps it blocked outside its wait).
/// At most 256 exits wait to be taken; a child beyond that is reaped unseen.
int RJ_take_exit(int* pid, int* status);
