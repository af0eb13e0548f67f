// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

int SetTaskStatus(TASK* /*entry*/, int /*status*/) { return {}; }
int ISA_task_running(TASK* /*entry*/) { return {}; }
int ISA_task_active(TASK* /*entry*/) { return {}; }
int UpdateRunningTasks() { return {}; }
int VerifyRunningTasks() { return {}; }
int set_image_percentage_done(TASK* /*entry*/) { return {}; }
void Job_clear_tasks(Job* /*job*/) {}
void UpdateJobState(Job* /*job*/) {}
