/// Reload and write-back: the cycle by which a process's record lists and
/// the two control files (Render_Resource_Control, Render_Job_Control)
/// agree.
///
/// Calling order: RJC_in once to load both files (resources first: jobs
/// name them); then, whenever the files may have changed or the lists were
/// changed here, Update_from_demon (the daemon with `editor` 0, an editor
/// with 1), which reads each changed file once, settles the job states the
/// file and this process disagree on, and writes back only a file whose
/// bytes would change.  RJC_out writes both files from the lists.  Each
/// file's lock is held only for its own read or write, never both at once,
/// never while parsing.
///
/// Control block: replaces `rndctl.jobs`, `rndctl.devs` and their index
/// tables as a whole (the old records are freed), clears `current_job` and
/// `current_dev`, sets `signal_seen` to 0 (RJC_in) and `last_update` (the
/// daemon's reload, to the pid file's time it answered); reads `location`
/// and `host`.  A syntax error in a file ends the process (RJC_fatal_exit)
/// after releasing every lock held.
#pragma once

/// Reads the job file (resp. the resource file) into the lists, replacing
/// them; `flag` is unused for jobs and, for resources, asks an editor to
/// rebuild its views.  1 when the file was parsed, 0 when it was empty or
/// could not be read (reported).
int RJC_reload(int flag);
int RRC_reload(int flag);
/// Writes the lists to the job file (resp. the resource file) under its
/// lock, dropping jobs marked deleted; `dir` is unused (the file lies in
/// `rndctl.location`).  A failed write is reported; the old file stands.
void Job_control_write(const char* dir);
void Resource_control_write(const char* dir);
/// Parses RJCin (set by the caller) into the lists: 0 for an empty stream
/// (nothing to read is no syntax error), else the grammar's result (0 ok).
int RJC_parse();
/// Reads a number at the start of `text` into `value` (when not null):
/// 1 when there is one, 0 otherwise.
int get_fvalue(const char* text, float* value);
/// One reconciling reload (see above).
void Update_from_demon(int editor);
/// Loads the resource file, then the job file; returns RJC_reload's result.
int RJC_in();
/// Writes the resource file, then the job file (nothing without a location).
void RJC_out();

/// What a reload tells whoever holds pointers into the record lists from
/// outside (the running-task entries), through RJC_records_hook:
/// RJC_RECORDS_DROPPING_DELETED before the writer frees the jobs marked
/// deleted; RJC_RECORDS_REPLACED once fresh lists were parsed, while the old
/// records still exist (Job_by_index and Dev_by_index answer from the fresh
/// lists), so that each pointer can move to the fresh record of its index or
/// become null.  Null: nobody holds such pointers.  The task units set it
/// when they make their first entry.
enum { RJC_RECORDS_DROPPING_DELETED = 1, RJC_RECORDS_REPLACED = 2 };
extern void (*RJC_records_hook)(int event);
