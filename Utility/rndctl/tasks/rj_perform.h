#pragma once

#include <cstdio>

#include "Utility/rndctl/tasks/rj_taskrec.h"

// Running a task (rj_perform).
int Perform_a_Task(TASK* entry);
int rj_system(char* const argv[], const char* stream_path, const char* out_path, Job* job);
int rj_splitpath(const char* path, char** base, char** dir, const char* last);
void rj_set_paths(Job* job, char** path, char** root);
int get_task_frame_range(TASK* entry, int* first_extension);
int get_current_frame_extension(Job* job, Dev* dev, int* extension);
void Job_Log_out(Job* job);
FILE* Logfile_open(Job* job);
FILE* Logfile_open_nr(Job* job);
void daemon_kill_running_tasks(const char* host);
/// The one kill of a render: sends `sig` to the process group that the
/// render program `pid` leads on this host (so its own children go too).
/// For another host nothing is sent (RJ_signal traces it) and 0 is returned;
/// a pid below 2 is no render and returns 0.  Otherwise kill's result.
int rj_kill_render(const char* host, int pid, int sig);
