#pragma once

#include "Utility/rndctl/tasks/rj_taskrec.h"

// Task selection and splitting (rj_select).
TASK* GetaPendingTask();
TASK* Get_a_task();
TASK* Task_get();
void insert_unknown_pending_jobs(TaskGroup** groups);
TaskRec* insert_task(TaskGroup** groups, Job* job, float start, float end, int status);
TaskRec* extract_pending_task(TaskGroup** groups);
TaskGroup* get_highest_taskgroup(TaskGroup* groups, int mode);
TaskRec* check_for_pending_tasks(TaskGroup* group);
int isa_job_using_host(const char* host, Job* job);
TASK* match_a_taskrec(TaskRec* rec);
void split_a_task(TaskGroup* group, TaskRec* rec);
TaskRec* Split_first_splittable_failed_tasks();
TaskRec* Task_split_and_insert(TaskRec* rec);
void Walk_rndctl_tasks(const char* label);
void Check_for_same_task(TASK* entry);
void Check_RndTasks(const char* label);
int Dev_processes_available(Dev* dev);
