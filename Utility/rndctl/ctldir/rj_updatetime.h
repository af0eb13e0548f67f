/// Update times: a host's pid file ("%s/%s.pid") is its wake-up bell.  An
/// editor or another daemon that changes work for a host touches the file;
/// the daemon compares the file's time with the one it last saw.  Times are
/// in nanoseconds so that two changes within one second still differ.
#pragma once

#include <cstdint>

/// Touches the pid file of `host` to now (a missing file stays missing);
/// returns the time set, 0 for a null host.
int64_t daemon_updatetime_set(const char* host);
/// The modification time of the pid file of `host`, 0 when it is missing.
int64_t daemon_updatetime_get(const char* host);
/// The modification time of the job file, 0 when it is missing.
int64_t editor_updatetime_get();
/// Free bytes of the control directory's file system beyond min_disk_space
/// (negative when short).
long IS_enough_disk();
extern long min_disk_space;
