/// The task file Render_Tasks (rj_taskfile): reading it into groups,
/// writing groups back, and the one locked read-modify-write every writer
/// of the file goes through (Task_file_rewrite).
///
/// Each line of a group is "NAME\t INDEX\t NUMRECS\t NEXT_ID", each record
/// "\tID\t START\t END\t CURRENT  DEV\t RETRIES\tSTATUS" ("%d" and "%f").
/// A read puts each group at the front of the list, so every
/// read-and-rewrite turns the order of the groups round; readers live with
/// that.  Groups of jobs no longer in rndctl.jobs are dropped on reading.
///
/// Calling order: Task_file_rewrite (or Task_read / Task_write on a stream
/// the caller locked and opened), then TaskGroup_free_all on what was read.
///
/// Control block: reads rndctl.jobs and rndctl.devs (by index), and
/// rndctl.location through the file operations; Editor_load_Tasks replaces
/// rndctl.tasks.  Writes nothing else.
#pragma once

#include <cstdio>
#include <functional>

#include "Utility/rndctl/tasks/rj_taskgroup.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"

/// Reads the whole stream; returns the groups (null for none or a null
/// stream).  Reading stops where the text stops making sense.
TaskGroup* Task_read(FILE* fp);
/// Reads one group from the stream, leaving the rest unread; null at the
/// end, on damage, or when the group's job is gone.
TaskGroup* TaskGroup_read(FILE* fp);
/// Writes every group that has records.  0 written, -1 on a write error or
/// a null stream (reported).
int Task_write(FILE* fp, TaskGroup* groups);
/// Writes one group: 1 written, 0 nothing to write (no records, no job or
/// null stream), -1 on a write error (reported).
int TaskGroup_write(FILE* fp, TaskGroup* group);
/// The groups on standard output, for people: 0, or -1 on an error.
int Task_write_dump(TaskGroup* groups);
/// One group on standard output: 1 written, 0 nothing to write, -1 error.
int TaskGroup_write_dump(TaskGroup* group);
/// Reads the task file under its lock and dumps it on standard output.
void Task_file_dump();
/// 1 when a record of the task file names a resource on `host`, else 0
/// (0 too when the file cannot be read).
int Task_file_search(const char* host);
/// Reads the task file without its lock (null when it cannot be read).
/// Writers replace the file whole (aside, then renamed in), so this is one
/// whole version, perhaps already an old one: good for telling whether a
/// locked cycle has anything to do, never for writing back.  The caller
/// frees the groups (TaskGroup_free_all).
TaskGroup* Task_file_peek();
/// The one locked read-modify-write of the task file: takes its lock, reads
/// the groups, hands them to `change` (which may add, cut and free records
/// and groups), and when it returns true writes them back (aside, then
/// renamed in); releases the lock and frees the groups on every way out.
/// Returns 1 written, 0 left alone, -1 when the file could not be opened or
/// written (reported; the old file stands).
int Task_file_rewrite(const std::function<bool(TaskGroup** groups)>& change);
/// For editors: replaces rndctl.tasks by one entry for each record of the
/// task file.  A file that cannot be read leaves the list empty.
void Editor_load_Tasks();
