// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

int Dev_processes_available(Dev* /*dev*/) { return {}; }
TASK* GetaPendingTask() { return {}; }
TASK* Get_a_task() { return {}; }
TASK* Task_get() { return {}; }
void insert_unknown_pending_jobs(TaskGroup** /*groups*/) {}
TaskRec* insert_task(TaskGroup** /*groups*/, Job* /*job*/, float /*start*/, float /*end*/, int /*status*/) { return {}; }
TaskRec* extract_pending_task(TaskGroup** /*groups*/) { return {}; }
TaskGroup* get_highest_taskgroup(TaskGroup* /*groups*/, int /*mode*/) { return {}; }
TaskRec* check_for_pending_tasks(TaskGroup* /*group*/) { return {}; }
int isa_job_using_host(const char* /*host*/, Job* /*job*/) { return {}; }
TASK* match_a_taskrec(TaskRec* /*rec*/) { return {}; }
void split_a_task(TaskGroup* /*group*/, TaskRec* /*rec*/) {}
TaskRec* Split_first_splittable_failed_tasks() { return {}; }
TaskRec* Task_split_and_insert(TaskRec* /*rec*/) { return {}; }
void Walk_rndctl_tasks(const char* /*label*/) {}
void Check_for_same_task(TASK* /*entry*/) {}
void Check_RndTasks(const char* /*label*/) {}
