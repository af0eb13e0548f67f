/// Picking and cutting (rj_pick): which piece of which job this host takes
/// next, and how much of it.
///
/// Calling order, inside one locked rewrite of the task file (see
/// Task_get in rj_select.h, the only caller in the daemon):
///   insert_unknown_pending_jobs  a group for every pending job that has none
///   extract_pending_task         the piece to take, its resource set
///   split_a_task                 the piece cut to the resource's max_frames
/// get_highest_taskgroup and check_for_pending_tasks are the steps of
/// extract_pending_task; Dev_processes_available and isa_job_using_host are
/// questions the rest of the daemon asks too.
///
/// Control block: reads rndctl.host, rndctl.running, rndctl.jobs,
/// rndctl.devs and rndctl.tasks (the running-task entries, which say what
/// this host already works on).  Writes nothing of it, except that a
/// resource with fewer than 1 processor or max_frames is raised to 1.
#pragma once

#include "Utility/rndctl/tasks/rj_taskrec.h"

/// Adds a group with one PENDING record (the job's whole frame range) for
/// every job of rndctl.jobs whose status is "pending", that names resources
/// and has no group in *groups.  Null groups: does nothing.
void insert_unknown_pending_jobs(TaskGroup** groups);

/// Appends a record [start, end] with the given status to the job's group,
/// making the group (at the front of *groups) when it has none, and gives
/// it the group's next id.  Returns the record, or null when groups is null
/// or memory ran out (nothing added then).
TaskRec* insert_task(TaskGroup** groups, Job* job, float start, float end, int status);

/// The PENDING record this host should take next, with its dev set to the
/// resource of this host that has a free process slot; null when no slot
/// is free or no job may be worked on here.  Priority first (mode 0), then
/// any job in file order (mode 1), then jobs this host already works on
/// (mode 2).  The record stays in its group; nothing is marked.
TaskRec* extract_pending_task(TaskGroup** groups);

/// From `groups` on, the group whose job this host may render now, with a
/// pending record: the best priority in mode 0; the first such group in
/// modes 1 and 2 (mode 2 counts jobs this host already works on too).  With
/// a render running here, only priority-0 jobs.  Null when there is none.
TaskGroup* get_highest_taskgroup(TaskGroup* groups, int mode);

/// The group's first PENDING record this host may take (a record that
/// failed here is left to another host the job names), or null.
TaskRec* check_for_pending_tasks(TaskGroup* group);

/// 1 when one of the job's resources is on `host`, else 0 (0 for null job).
int isa_job_using_host(const char* host, Job* job);

/// Cuts an animation record down to its resource's max_frames: the record
/// keeps the first frames, and the rest becomes a new PENDING record of the
/// group (the group's next id is used up; the caller sees that as a change
/// of next_task_id).  Does nothing when the record fits, has no resource,
/// or the job is a still.
void split_a_task(TaskGroup* group, TaskRec* rec);

/// Free process slots of a resource: its processors (at least 1) less the
/// records of rndctl.tasks STARTED or RUNNING on it, never below 0.  0 for a
/// null resource.
int Dev_processes_available(Dev* dev);
/// Whether one of this host's resources has a processor that this host's
/// running-task entries leave free (what a pick would find before it looks
/// at the task file).  False for a host without a resource.
[[nodiscard]] bool Task_host_has_free_slot();
