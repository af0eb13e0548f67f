/// Task status, render progress and job state: everything about a task's
/// end happens here, in the service loop, never in a signal handler.
///
/// Calling order: after each wait the service loop calls Task_judge_exits
/// (rj_task), which stores each reaped render's exit in its entry (pid 0,
/// waitstatus), then UpdateRunningTasks: it judges every entry, writes
/// changed states back to the task file and the host's status file, and
/// recomputes the state text of every job this host works for
/// (UpdateJobState, which clears a job's tasks once they all ended).
///
/// Control block: reads host and jobs; frees entries of `tasks` (a job that
/// left the file, a job cleared); writes each entry's status, current,
/// progress and output, and each job's status text, doneframes and deleted
/// mark.  UpdateRunningTasks ends with a reload and write-back cycle
/// (Update_from_demon), which may replace the record lists.
#pragma once

#include "Utility/rndctl/tasks/rj_taskrec.h"

/// Sets the record's status and rewrites the job's group in the task file
/// (also when the status is the same: progress may have moved).  An end
/// state (FINISHED, ABORTED, FAILED) of a task under way kills its render
/// and drops its stream and output name.  Returns 1 when the status
/// changed, 0 when it was already `status` or there is no record.
int SetTaskStatus(TASK* entry, int status);
/// 1 when the entry has a process (pid 2 or more) or its task runs on
/// another host; 0 when it runs here without a process yet, has no
/// resource, or there is no entry.
int ISA_task_running(TASK* entry);
/// 1 when the record is RUNNING or STARTED; 0 otherwise or without one.
int ISA_task_active(TASK* entry);
/// Brings every entry up to date (see above).  Returns 1 when some entry
/// is STARTED or RUNNING afterwards, else 0.
int UpdateRunningTasks();
/// UpdateRunningTasks, by its other name.
int VerifyRunningTasks();
/// Reads the new text of the entry's log stream; its last line, when a
/// progress line "IMAGE r LINE of LINES", sets the record's current frame,
/// the entry's progress and its output image name.  Returns 1 when current
/// or progress changed; 0 otherwise, and for an entry without an open
/// stream, job, record or resource.
int set_image_percentage_done(TASK* entry);
/// Writes the job log, frees every entry of the job, drops its group from
/// the task file when the job has ended and marks a job deleted when done.
void Job_clear_tasks(Job* job);
/// Recomputes the job's status text and doneframes from its entries.
void UpdateJobState(Job* job);

/// The number of frames of the entry's task; stores the extension number of
/// its first frame in `*first_extension` (may be null).  An entry without
/// job or record gives 0 (and 0 as the extension).
int get_task_frame_range(TASK* entry, int* first_extension);

/// Finds the first RUNNING entry of `job` on `dev`, refreshes its progress
/// and stores the extension number of its frame under way.  Returns 1, or 0
/// when there is no such entry (`*extension` untouched).
int get_current_frame_extension(Job* job, Dev* dev, int* extension);
