/// Task groups and task records in memory (rj_taskgroup): the status names,
/// making and freeing groups and records, and lookups in a list of groups.
///
/// A group (TaskGroup) holds one job's records in creation order.  Records
/// made by TaskRec_alloc are heap blocks of their own; those the task-file
/// reader makes (TaskRec_pooled) share blocks of many, and a record that an
/// entry keeps beyond the cycle that read it is given a block of its own
/// (TaskRec_unpool).  Either kind is freed by TaskRec_free.
///
/// Control block: reads and writes none of it (the `task` back-pointer of a
/// record, an entry of rndctl.tasks, is cleared or moved when its record goes).
#pragma once

#include "Utility/rndctl/tasks/rj_taskrec.h"

/// The status names, indexed by status code, null-terminated.  Written to
/// the task file as they are.
extern const char* const task_status_table[];
/// The name of a status code; a code out of the table reads as "PENDING".
const char* GetTaskStatusStr(int code);
/// Sets *code to the code of a status name: 1 when the name is known, 0
/// (code untouched) when it is not or an argument is null.
int ISA_task_status(const char* text, int* code);

/// A new empty group of `job`; null when memory ran out.
TaskGroup* TaskGroup_alloc(Job* job, int next_task_id);
/// A new record appended to the group (when not null); a known
/// `status_text` overrides `status`.  Null when memory ran out.
TaskRec* TaskRec_alloc(TaskGroup* group, float start, float end, float current, Dev* dev,
                       int status, const char* status_text, int id);
/// A fresh default record from the shared blocks, linked nowhere; null when
/// memory ran out.  For the task-file reader.
TaskRec* TaskRec_pooled();
/// The records Task_read makes share larger blocks.  For the record at *link
/// (a link of a group's list) that is one of them, puts a copy in a heap
/// block of its own in its place (an entry that owns it owns the copy) and
/// returns the copy; any other record is returned as it is.  For a record
/// that an entry is to keep beyond the cycle that read it.
TaskRec* TaskRec_unpool(TaskRec** link);
/// Unlinks the record from its group, clears its entry's pointer to it (if
/// that entry owns it) and frees it.  Null: nothing.
void TaskRec_free(TaskRec* rec);
/// TaskRec_free, except that a record marked keep == 2 only loses the mark.
void TaskRec_freeOnly(TaskRec* rec);
/// Unlinks the group from *list (when list is not null) and frees it; its
/// records marked keep == 1 go with it, the others survive with their
/// entries, unlinked.
void TaskGroup_free(TaskGroup** list, TaskGroup* group);
/// Frees every group of a list and every record still owned by a group.
void TaskGroup_free_all(TaskGroup** list);

/// 1 when a record of the group names a resource on `host`, else 0.
int TaskGroup_find(TaskGroup* group, const char* host);
/// 1 when a record of any group names a resource on `host`, else 0.
int Task_find(TaskGroup* groups, const char* host);
/// The first group of `job` in the list, or null.
TaskGroup* TaskGroup_by_job(TaskGroup* groups, Job* job);
