#pragma once

#include "Utility/rndctl/tasks/rj_taskrec.h"

// Task status, job state and progress (rj_status).
int SetTaskStatus(TASK* entry, int status);
int ISA_task_running(TASK* entry);
int ISA_task_active(TASK* entry);
int UpdateRunningTasks();
int VerifyRunningTasks();
int set_image_percentage_done(TASK* entry);
void Job_clear_tasks(Job* job);
void UpdateJobState(Job* job);
