/// Job records: the list of render jobs (`rndctl.jobs`), one per entry of
/// Render_Job_Control.  Making, finding, copying and deleting them, the
/// run-state words of the file, and the editor's current job.
///
/// Calling order: the reader makes jobs with Add_a_job (or Job_new) in file
/// order, after the resources they name; their pick lists are filled with
/// RndDevList_add (rj_lst).  Job_del is the only way a job goes; a job to be
/// dropped from the file is marked `deleted` instead and left to the writer.
///
/// Control block: writes `jobs` (the list head), `job_index` (kept in step
/// with every add and delete) and `current_job` (setcurrent_job, and cleared
/// by Job_del when it named the job); reads `pid` (the lock holder mark) and
/// `location` (the index file, through RJCget_next_index).  A job's
/// `lock_pid` is an editor's claim on it, not a file lock.
#pragma once

#include "Utility/rndctl/records/rj_records.h"

/// Makes a job for scene `path` and links it in before `before` (null: at
/// the end).  The job is named after the path's last component; `index` 0
/// asks for a fresh one from the index file.  It starts with status "none",
/// AVAILABLE, pix "./pix_file" and matte "./matte_file".  `listitem` is the
/// editor's list entry (non-owning; null outside editors).  Returns the new
/// job, owned by the list, or null when out of memory (nothing linked).
Job* Job_new(Job* before, void* listitem, const char* path, int index);
/// Like Job_new (at the end, resp. before `before`), but an existing job of
/// the same index is returned as it is: a file that names an index twice
/// keeps the first.  Add_a_job with index 0 always makes a new job.  Null
/// only when out of memory.
Job* Add_a_job(void* listitem, const char* path, int index);
/// For the reader: Add_a_job(nullptr, name, index), except that a job made
/// new has none of the default texts (scene, pix, matte): a record read from
/// a file holds only what the file says, and making texts only to drop them
/// costs a reload of a large queue dearly.
Job* Add_a_job_as_read(const char* name, int index);
Job* Insert_a_job(Job* before, void* listitem, const char* path, int index);
/// The first job in list order with that editor list entry (resp. name,
/// index), or null.  Names need not be unique: the index is the identity.
Job* Job_by_listitem(void* item);
Job* Job_by_name(const char* name);
Job* Job_by_index(int index);
/// 1 when `dev` is in the job's pick list, 0 when not or without a job.
int ISA_resource_usedby(Job* job, Dev* dev);
/// The job's pick level (0 without a job).
int get_job_pick_level(Job* job);
/// Makes current the first job whose editor entry is selected, at pick
/// level 1; without such a job nothing changes.
void reorder_picklevels();
/// Unlinks and frees `job` with its pick list and search paths, drops it
/// from the index table, clears `current_job` and the editor entry's pointer
/// to it.  Its index reads -1 until the memory is reused, so that a stale
/// pointer reads as a dead job.  Returns its neighbour (the previous job,
/// else the next) for a list view's selection; null when the list is now
/// empty or `job` was null.  Other pointers to it dangle: the writer tells
/// the running-task entries (RJC_records_hook) before it deletes the jobs
/// marked deleted; any other caller must know nobody holds the job.
Job* Job_del(Job* job);
/// RUN_PAUSED, RUN_AVAILABLE, RUN_SCHEDULE or RUN_NOW for the file's words
/// "PAUSED", "AVAILABLE", "SCHEDULE", "NOW" (exact case); RUN_UNSET for
/// anything else, an empty word or null.
int Job_get_runstate(const char* word);
/// Whether the job may be rendered now, by its run state and week grid
/// (Job_schedule_check): 2 yes (AVAILABLE, NOW, or SCHEDULE inside a run
/// slot), 1 paused, 0 not now (SCHEDULE outside its slots, an unset state,
/// a clock that cannot be read, or no job).  Only 2 lets work start.
int Job_available(Job* job);
/// Makes `job` the current job (null: none) and marks it held by this
/// process; the previous one is released if this process held it.  A call
/// made from inside another (editor code run by the first) is ignored.
void setcurrent_job(Job* job);
/// Appends a copy of `job` named "NAME.clone" with a fresh index, its own
/// pick list (the same resources) and search paths, not held, not picked.
/// Returns the copy, or null for a null job or out of memory.
Job* Job_clone(Job* job);
