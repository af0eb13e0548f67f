#pragma once

#include <cstdio>
#include <functional>

#include "Utility/rndctl/tasks/rj_taskrec.h"

// ---------------------------------------------------------------------------
// Task groups, records and the task file.
extern const char* const task_status_table[];
const char* GetTaskStatusStr(int code);
int ISA_task_status(const char* text, int* code);
TaskGroup* TaskGroup_alloc(Job* job, int next_task_id);
TaskRec* TaskRec_alloc(TaskGroup* group, float start, float end, float current, Dev* dev,
                       int status, const char* status_text, int id);
/// The records Task_read makes share larger blocks.  For the record at *link
/// (a link of a group's list) that is one of them, puts a copy in a heap
/// block of its own in its place (an entry that owns it owns the copy) and
/// returns the copy; any other record is returned as it is.  For a record
/// that an entry is to keep beyond the cycle that read it.
TaskRec* TaskRec_unpool(TaskRec** link);
void TaskRec_free(TaskRec* rec);
void TaskRec_freeOnly(TaskRec* rec);
void TaskGroup_free(TaskGroup** list, TaskGroup* group);
/// Frees every group of a list and every record still owned by a group.
void TaskGroup_free_all(TaskGroup** list);
int TaskGroup_find(TaskGroup* group, const char* host);
int Task_find(TaskGroup* groups, const char* host);
TaskGroup* TaskGroup_by_job(TaskGroup* groups, Job* job);
TaskGroup* Task_read(FILE* fp);
TaskGroup* TaskGroup_read(FILE* fp);
int Task_write(FILE* fp, TaskGroup* groups);
int TaskGroup_write(FILE* fp, TaskGroup* group);
int Task_write_dump(TaskGroup* groups);
int TaskGroup_write_dump(TaskGroup* group);
void Task_file_dump();
int Task_file_search(const char* host);
void Task_file_update(Job* job);
int Task_file_check(Job* job);
/// The one locked read-modify-write of the task file: takes its lock, reads
/// the groups, hands them to `change` (which may add, cut and free records
/// and groups), and when it returns true writes them back (aside, then
/// renamed in); releases the lock and frees the groups on every way out.
/// Returns 1 written, 0 left alone, -1 when the file could not be opened or
/// written (reported; the old file stands).
int Task_file_rewrite(const std::function<bool(TaskGroup** groups)>& change);
void Editor_load_Tasks();
void Task_update_status();
void Task_sfile_dump(Dev* dev);
char* Task_current_filenames(Job* job, Dev* dev);
