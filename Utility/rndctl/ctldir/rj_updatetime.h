/// Update times (rj_updatetime): a host's pid file ("HOST.pid") is its
/// wake-up bell.  An editor or another daemon that changes work for a host
/// touches the file; that host's daemon compares the file's time with the
/// one it last saw (rndctl.last_update, which Update_from_demon writes and
/// callers compare with).  Times are in nanoseconds so that two
/// changes within one second still differ.  No lock is taken: a touch or a
/// stat is one system call, and a lost touch costs one reload at most.
///
/// Reads rndctl.location (paths); writes no field of rndctl.  Callable in
/// any order; nothing here is safe inside a signal handler.
#pragma once

#include <cstdint>

/// Touches the pid file of `host` to now (a missing file stays missing:
/// there is no daemon to wake); returns the time set, 0 for a null host.
int64_t daemon_updatetime_set(const char* host);
/// The modification time of the pid file of `host`, 0 when it is missing.
int64_t daemon_updatetime_get(const char* host);
/// The modification time of the job file, 0 when it is missing.
int64_t editor_updatetime_get();
/// Free bytes of the control directory's file system beyond min_disk_space
/// (negative when short; a failed statvfs is reported and counts as none).
long IS_enough_disk();
/// The free space, in bytes, that must remain (5 MiB).
extern long min_disk_space;
