/// Task-file updates for one job and the per-host status files (rj_tskio).
/// Includes the units of the task file beneath it: rj_taskgroup (groups and
/// records in memory) and rj_taskfile (reading, writing, the locked rewrite).
///
/// A status file TSKSTAT/HOST holds one line "%s %d %d %s" (job label, job
/// index, status code, output name or "-") for each piece of that host.
///
/// Control block: reads rndctl.host, rndctl.location, rndctl.tasks and
/// rndctl.jobs; Task_file_update settles entries of rndctl.tasks with what
/// the file says (see Task_settle).
#pragma once

#include <cstdio>

#include "Utility/rndctl/tasks/rj_taskfile.h"
#include "Utility/rndctl/tasks/rj_taskgroup.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"

/// Under the task file's lock, settles the job's group with this host's
/// entries: a job that is over loses its group, one rebuilt behind this
/// host's back has its entries marked for Task_retire_marked, and the
/// others take the progress of this host's entries.  Null job: the file is
/// only rewritten.
void Task_file_update(Job* job);
/// Under the task file's lock, clears the retries of the job's records and
/// puts back to PENDING every STARTED or RUNNING record whose host's daemon
/// is not alive.  Returns 1 when one was put back (the other hosts are
/// woken), else 0.
int Task_file_check(Job* job);
/// Writes this host's status file from rndctl.tasks (reported on failure).
void Task_update_status();
/// Prints the status file of the resource's host on standard output.
void Task_sfile_dump(Dev* dev);
/// The output names, each followed by a blank, of the job's pieces in the
/// status file of the resource's host: a static buffer of at most 1024
/// characters, overwritten by the next call; null for a null argument.
char* Task_current_filenames(Job* job, Dev* dev);
