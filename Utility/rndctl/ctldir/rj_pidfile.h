/// The pid file "HOST.pid" (rj_pidfile): one daemon per host.
///
/// The file holds exactly 4 bytes, the daemon's pid as a native 32-bit
/// integer (not text: every process of the farm reads it so).  Its
/// modification time is also the host's wake-up bell (rj_updatetime.h).
///
/// Calling order in the daemon: Pidfile_claim once at start-up (after
/// rndctl is filled); Pidfile_self_check at each wake-up.  Anyone may call
/// Pidfile_read and Pidfile_probe for any host at any time.
///
/// Reads rndctl.location (through rj_paths.h), rndctl.host and rndctl.pid;
/// writes no field of rndctl.  Nothing here is safe inside a signal handler.
///
/// What a crash leaves behind: at most ".HOST.pid.PID" (a claim being
/// written) or ".HOST.pid.PID.old" (a stale pid file being taken away);
/// nobody reads them, and the next claim by a process of that pid replaces
/// them.  The pid file itself is never seen half-written: it is made aside
/// and linked into place.
#pragma once

enum PidfileStatus {
  PIDFILE_MISSING = 0,  // the file could not be opened; `error` is errno
  PIDFILE_SHORT = 1,    // opened, but no 4 bytes to read; `error` is errno or 0 (short file)
  PIDFILE_OK = 2        // `pid` is what the file says (0 included)
};
struct PidfileRead {
  PidfileStatus status = PIDFILE_MISSING;
  int pid = 0;  // 0 unless PIDFILE_OK
  int error = 0;
};

/// Reads the pid file of `host`.  Reports nothing.
[[nodiscard]] PidfileRead Pidfile_read(const char* host);

/// The liveness probe: 1 when the pid file of `host` names a process that
/// RJ_signal finds alive (on that host), 0 when the file is missing, short,
/// names pid 0 or a dead process.  Traces "process is alive --> %s:%d" or
/// "process is DEAD --> %s:%d" for a pid it probed, and a short file's reason.
[[nodiscard]] int Pidfile_probe(const char* host);

/// Claims this host's pid file for this process (rndctl.host, rndctl.pid):
/// probes the pid recorded there, touches the file (it wakes whoever reads
/// its time) and, unless that process is alive, puts this process's pid in
/// its place.  Two processes claiming at once cannot both win: the new file
/// is linked into place, which fails when another claim came first, and a
/// stale file is renamed away, which only one claimer can do.
/// Returns 1 when another daemon is alive on this host (nothing written);
/// 0 otherwise: the file names this process, or it could not be written
/// (a failed write is reported to the user; a failed create is silent, and
/// the first self check then ends the daemon).
[[nodiscard]] int Pidfile_claim();

/// Whether the pid file still names this process.  A file that cannot be
/// opened is logged ("error openning \"%s\", <%s>") in the access log, a
/// short one traced and logged with its reason; both answer false.
[[nodiscard]] bool Pidfile_self_check();

/// Called by Pidfile_claim between judging the file and placing its claim;
/// does nothing.  Tests replace it to make claimers meet.
extern void (*pidfile_claim_pause)();
