/// Diagnostics, the clock and small process-wide helpers every unit uses.
///
/// Three channels: dbgpnt, the trace, on stderr prefixed by the host, only
/// while `debug` is set; EDuprintf, the user's messages, on stderr; and the
/// access log (wrt_logfile always, dbg_logfile only while `debug_fileacc` is
/// set), a line each in the control directory's Render_Access once the
/// locked file operations have opened it (before that, lines are dropped).
/// Lines of several processes sharing one log file never interleave.
///
/// Calling order: none; every channel works from the first line of main.
/// The access log lines appear once the locked file operations (ctldir/)
/// opened the control directory and called rj_set_access_stream.
///
/// Control block: the trace and the access log read `rndctl.host` and
/// `rndctl.pid` for their prefixes; nothing here writes it.  Nothing here is
/// safe in a signal handler except rj_write_all.
#pragma once

#include <sys/types.h>

#include <cstdio>
#include <ctime>

extern int debug;            // gates dbgpnt; any non-zero level acts as 1
extern int debug_fileacc;    // gates dbg_logfile (ZARNO_RNDCTL_ACCESS_LOG)
extern const char* PrgName;  // the program's name in the access log
extern char* ProgramName;
extern char ApplModeName[64];

/// The trace: "HOST:\t" and the text on stderr while `debug` is set.  A
/// text longer than 8191 bytes is cut.
void dbgpnt(const char* format, ...) __attribute__((format(printf, 1, 2)));
/// A message for the user: the text and a newline on stderr.
void EDuprintf(const char* format, ...) __attribute__((format(printf, 1, 2)));
/// One access-log line: "* TEXT --  HOST:PROGRAM(PID) DATE" (the date as
/// ctime gives it).  dbg_logfile writes only while `debug_fileacc` is set.
void wrt_logfile(const char* format, ...) __attribute__((format(printf, 1, 2)));
void dbg_logfile(const char* format, ...) __attribute__((format(printf, 1, 2)));

/// The clock of the whole queue.  Tests replace `rj_clock`.
extern time_t (*rj_clock)();
time_t rj_now();

/// The temporary directory: DRCTMPDIR, else "/usr/tmp" when it exists, else "/var/tmp".
const char* rj_tmpdir();
/// Writes all of `text` to `fd`, retrying after signals; gives up silently on
/// an error (the callers have nowhere to report it).  Safe between fork and
/// exec and in a signal handler.
void rj_write_all(int fd, const char* text, size_t length);

/// The umask the process started with.  The locked file operations set the
/// process's own (1: shared files are made group- and world-writable) and
/// note the first one here; a render program gets the original back.
/// Only the first note counts.
void rj_note_original_umask(mode_t mask);
mode_t get_original_umask();

/// The access log stream, or null while none is open (lines are dropped).
/// The locked file operations set it when they open the control directory.
void rj_set_access_stream(FILE* stream);

/// Compares two texts like strcmp; null equals null and orders before any
/// text (-1 / 1), so that records with an unset field compare stably.
int rj_strcmp(const char* a, const char* b);

/// Hooks for the interactive editors, which share this library: in the
/// daemon and the tools they do nothing (is_editor returns 0).
int is_editor();
void sounder(int code);
void IR_repoint_editor_list();
void IR_rebuild_rndctl();
void Update_control_and_editors(void* what);
