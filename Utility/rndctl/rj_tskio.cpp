// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

const char* GetTaskStatusStr(int /*code*/) { return {}; }
int ISA_task_status(const char* /*text*/, int* /*code*/) { return {}; }
TaskGroup* TaskGroup_alloc(Job* /*job*/, int /*next_task_id*/) { return {}; }
TaskRec* TaskRec_alloc(TaskGroup* /*group*/, float /*start*/, float /*end*/, float /*current*/, Dev* /*dev*/, int /*status*/, const char* /*status_text*/, int /*id*/) { return {}; }
void TaskRec_free(TaskRec* /*rec*/) {}
void TaskRec_freeOnly(TaskRec* /*rec*/) {}
void TaskGroup_free(TaskGroup** /*list*/, TaskGroup* /*group*/) {}
void TaskGroup_free_all(TaskGroup** /*list*/) {}
int TaskGroup_find(TaskGroup* /*group*/, const char* /*host*/) { return {}; }
int Task_find(TaskGroup* /*groups*/, const char* /*host*/) { return {}; }
TaskGroup* TaskGroup_by_job(TaskGroup* /*groups*/, Job* /*job*/) { return {}; }
TaskGroup* Task_read(FILE* /*fp*/) { return {}; }
TaskGroup* TaskGroup_read(FILE* /*fp*/) { return {}; }
int Task_write(FILE* /*fp*/, TaskGroup* /*groups*/) { return {}; }
int TaskGroup_write(FILE* /*fp*/, TaskGroup* /*group*/) { return {}; }
int Task_write_dump(TaskGroup* /*groups*/) { return {}; }
int TaskGroup_write_dump(TaskGroup* /*group*/) { return {}; }
void Task_file_dump() {}
int Task_file_search(const char* /*host*/) { return {}; }
void Task_file_update(Job* /*job*/) {}
int Task_file_check(Job* /*job*/) { return {}; }
void Editor_load_Tasks() {}
void Task_update_status() {}
void Task_sfile_dump(Dev* /*dev*/) {}
char* Task_current_filenames(Job* /*job*/, Dev* /*dev*/) { return {}; }
const char* const task_status_table[] = {"PENDING", "CRASHED", "RUNNING", "FINISHED", "ABORTED", "FAILED", "STARTED", "STOPPED", nullptr};
