/// The layout of the control directory: every path in it is built here.
///
/// The control directory (rndctl.location, read, never written here; "."
/// while it is unset or empty) holds:
///   NAME                the shared files, by index (FILE_JOBS ...), below
///   NAME.lock/HOST      a file's lock directory and its holder (rj_fileio.h)
///   HOST.pid            a daemon's pid file and its host's wake-up bell
///                       (rj_pidfile.h, rj_updatetime.h)
///   .HOST.pid.PID       a pid file being claimed by process PID
///   .clock.HOST         touched to read the file server's clock
///   JOBLOG/JOB          a job's log
///   TSKSTAT/HOST        a host's task status and heartbeat
///
/// Calling order: none; each call reads rndctl.location as it stands, so a
/// process that changes control directory gets the new paths at once (the
/// table behind fileop_path is rebuilt by fileop_reset, rj_fileio.h).
/// The std::string forms allocate; the buffer form does not (for callers
/// that must not, such as code reached from a signal handler).
/// Nothing here reports anything, and nothing touches the file system.
#pragma once

#include <cstddef>
#include <string>

// The shared files, by index into control_names.
enum {
  FILE_JOBS = 0,
  FILE_RESOURCES = 1,
  FILE_TASKS = 2,
  FILE_EDITPIDS = 3,
  FILE_DEV_INDEX = 4,
  FILE_JOB_INDEX = 5,
  FILE_ACCESS = 6,
  FILE_STATUS = 7,
  FILE_COUNT = 8
};

/// The names of the shared files, in index order.
extern const char* const control_names[FILE_COUNT];

/// The control directory as paths use it: rndctl.location, or "." when that
/// is unset or empty.  Never null.
const char* rj_ctldir();
/// "DIR/NAME": shared file `index`; "" for a bad index.
std::string rj_control_path(int index);
/// "DIR/NAME.lock": the lock directory of shared file `index`; "" for a bad index.
std::string rj_lock_path(int index);
/// "DIR/HOST.pid": the pid file of `host`.
std::string rj_pid_path(const char* host);
/// The same into `out` (at most `size` bytes, always terminated).  Returns
/// false when the path does not fit (then `out` holds a cut path: unusable).
[[nodiscard]] bool rj_pid_path(char* out, size_t size, const char* host);
/// "DIR/.HOST.pid.PID": where process `pid` writes the pid file it claims.
std::string rj_pid_claim_path(const char* host, int pid);
/// "DIR/.clock.HOST": the file touched to read the file server's clock.
std::string rj_clock_path(const char* host);
/// "DIR/JOBLOG" and "DIR/JOBLOG/JOB": the job logs.
std::string rj_joblog_dir();
std::string rj_joblog_path(const char* job);
/// "DIR/TSKSTAT" and "DIR/TSKSTAT/HOST": the status files and heartbeats.
std::string rj_tskstat_dir();
std::string rj_tskstat_path(const char* host);
