/// Diagnostics, the clock and small process-wide helpers every unit uses.
///
/// Three channels: dbgpnt, the trace, on stderr prefixed by the host, only
/// while `debug` is set; EDuprintf, the user's messages, on stderr; and the
/// access log (wrt_logfile always, dbg_logfile only while `debug_fileacc` is
/// set), a line each in the control directory's Render_Access once the
/// locked file operations have opened it (before that, lines are dropped).
/// Lines of several processes sharing one log file never interleave.
#pragma once

#include <sys/types.h>

#include <cstdio>
#include <ctime>

// Diagnostics and process identity (rj_rndctl).
extern int debug;          // gates dbgpnt; any non-zero level acts as 1
extern int debug_fileacc;  // gates dbg_logfile
extern const char* PrgName;
extern char* ProgramName;
extern char ApplModeName[64];

void dbgpnt(const char* format, ...) __attribute__((format(printf, 1, 2)));
void EDuprintf(const char* format, ...) __attribute__((format(printf, 1, 2)));
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

/// Compares two texts like strcmp, a null text ordering as an empty one.
int rj_strcmp(const char* a, const char* b);

// Editor stubs: the daemon shares code with the editors.
int is_editor();
void sounder(int code);
void IR_repoint_editor_list();
void IR_rebuild_rndctl();
void Update_control_and_editors(void* what);
