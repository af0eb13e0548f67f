/// Selection (rj_select): the cycle in which this host takes its next
/// piece, and failed pieces put back.
///
/// Every daemon mirrors every record of Render_Tasks in its running-task
/// list (rndctl.tasks), so that it knows what the other hosts are doing.
/// Task_get runs one cycle inside one locked rewrite of the task file:
/// entries of another life of their group out, then pick and cut (see
/// rj_pick.h), then the mirror brought in line with the file, then the
/// file written back.  The STARTED mark written under the lock is what
/// keeps another host from taking the same piece.
///
/// Calling order in the daemon: GetaPendingTask (which calls Task_get) when
/// a process slot is free; Split_first_splittable_failed_tasks after exits
/// have been judged.
///
/// Control block: reads rndctl.host, rndctl.jobs, rndctl.devs; adds,
/// updates and frees entries of rndctl.tasks; GetaPendingTask advances
/// rndctl.stream_counter.
#pragma once

#include "Utility/rndctl/tasks/rj_pick.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"

/// Unless this host's schedule keeps it from rendering now (then an alarm
/// is set for when it may, and null returned), takes a piece (Task_get) and
/// opens its log stream.  Returns the entry to render, or null.
TASK* GetaPendingTask();
/// Task_get.
TASK* Get_a_task();
/// One selection cycle under the task file's lock.  Returns the entry of
/// the piece taken, marked STARTED in the file and taken here, or null when
/// there is none or the file could not be written (then nothing is taken).
TASK* Task_get();
/// The first entry of rndctl.tasks that mirrors `rec` (same job, id and
/// start frame), or null.
TASK* match_a_taskrec(TaskRec* rec);
/// Puts back the first failed piece this daemon rendered that may be tried
/// again (Task_split_and_insert); always returns null.
TaskRec* Split_first_splittable_failed_tasks();
/// Under the task file's lock, puts a failed piece back: the frames it
/// reached are FINISHED and the rest a new PENDING piece, or the whole piece
/// PENDING again; its retries go up by one and the hosts that may render it
/// are woken.  A piece no longer this host's is settled instead.  Always
/// returns null.
TaskRec* Task_split_and_insert(TaskRec* rec);
/// Debug aids: trace lines about rndctl.tasks, nothing else.
void Walk_rndctl_tasks(const char* label);
void Check_for_same_task(TASK* entry);
void Check_RndTasks(const char* label);
