/// Taking back tasks whose render went away with its daemon.
///
/// A daemon that is killed, loses its host for good or exits leaves records
/// STARTED or RUNNING in Render_Tasks that nobody renders, and a STARTED
/// record of a host holds one of its slots.  Such a record is put back the
/// way a failed task is cut: the frames before `current` stay done, the rest
/// is pending again.  `retries` is not counted up: the daemon failed, not
/// the task.
///
/// The daemon's calling order: Task_reclaim_this_host once at start-up,
/// after the first load of the control files and before the first pass
/// (only then does no process of this host render anything); rj_heartbeat
/// at every pass and every wake-up; Task_reclaim_dead_hosts from the service
/// loop, about once a minute and never while holding another lock;
/// Task_release_own_renders before a clean exit.  rj_system and the SIGCHLD
/// handler keep the render registry (proc/rj_registry) up to date.
///
/// Control block: reads `host`, `pid`, `location` (the task file, the
/// heartbeat and pid files) and `tasks` (Task_release_own_renders); writes
/// none of its fields and frees no entry: the records put back are the task
/// file's, and each put-back cycle is one locked rewrite of it.  The other
/// hosts of each job touched are woken after the lock is released.
#pragma once

#include <cstdint>
#include <ctime>

#include "Utility/rndctl/tasks/rj_taskrec.h"

/// Puts a held record of `group` (a group read from the task file) back.
/// With progress (start < current <= end) `rec` becomes FINISHED
/// start..current-by and a new PENDING record current..end with the group's
/// next id and the same retries is appended; it is returned.  Without
/// progress (or when the remainder cannot be made) `rec` itself goes
/// PENDING with its range and null is returned; null without a group, a
/// record or the group's job, and nothing changes then.  A record put back
/// pending names no host, so no host is barred from it.
TaskRec* Task_put_back(TaskGroup** groups, TaskGroup* group, TaskRec* rec);

/// Start-up: ends every render of the registry that a dead predecessor left
/// running (rj_render_kill_leftovers), then puts back, in one locked cycle,
/// every STARTED or RUNNING record of this host and wakes the other hosts of
/// each job touched.  Returns the number of records put back (counted in
/// the cycle: a rewrite that then fails is reported and the file stands).
int Task_reclaim_this_host();

/// Puts back every record held by another host whose heartbeat is older than
/// rj_host_timeout() seconds by the file server's clock `server_now` (from
/// rj_heartbeat) and whose daemon the daemon-alive test finds gone; one
/// access-log line per record.  A host without a heartbeat file is not
/// judged.  Returns the number of records put back, counted as for
/// Task_reclaim_this_host.
int Task_reclaim_dead_hosts(time_t server_now);

/// Clean exit: kills the render process groups this daemon still runs and
/// puts their records back, unless the pid file already names another live
/// daemon (which took this host's records over when it started).  Returns
/// the number of renders killed.
int Task_release_own_renders();

/// The heartbeat: touches "%s/TSKSTAT/%s" (created empty when missing) to the
/// file server's time and returns its new modification time in seconds, or
/// 0 when it cannot be touched.
[[nodiscard]] time_t rj_heartbeat();

/// How long a host's heartbeat may age, in seconds: the environment variable
/// ZARNO_RNDCTL_HOST_TIMEOUT, else that preference, else 600.
long rj_host_timeout();

/// Whether an update time `seen_ns` read by a reload may count as seen when
/// the file server's clock reads `server_now`: false while a whole-second
/// stamp (no nanoseconds) and the clock are still in the same second, since
/// a second touch in that second would leave the same stamp.
bool rj_update_time_settled(int64_t seen_ns, time_t server_now);
