// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

int Perform_a_Task(TASK* /*entry*/) { return {}; }
int rj_system(char* const /*argv*/[], const char* /*stream_path*/, const char* /*out_path*/, Job* /*job*/) { return {}; }
int rj_splitpath(const char* /*path*/, char** /*base*/, char** /*dir*/, const char* /*last*/) { return {}; }
void rj_set_paths(Job* /*job*/, char** /*path*/, char** /*root*/) {}
int get_task_frame_range(TASK* /*entry*/, int* /*first_extension*/) { return {}; }
int get_current_frame_extension(Job* /*job*/, Dev* /*dev*/, int* /*extension*/) { return {}; }
void Job_Log_out(Job* /*job*/) {}
FILE* Logfile_open(Job* /*job*/) { return {}; }
FILE* Logfile_open_nr(Job* /*job*/) { return {}; }
void daemon_kill_running_tasks(const char* /*host*/) {}
