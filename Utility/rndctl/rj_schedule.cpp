// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

const char* Schedule_get_day(const char* /*name*/) { return {}; }
void Schedule_job_runs(Job* /*job*/, int /*start*/, int /*end*/, const char* /*first_day*/, const char* /*last_day*/) {}
void Schedule_dev_lock(Dev* /*dev*/, int /*start*/, int /*end*/, const char* /*first_day*/, const char* /*last_day*/) {}
int Schedule_get_a_block(int* /*grid*/, int /*times*/[2], const char* /*days*/[2]) { return {}; }
int set_in_betweens(int* /*grid*/, const int /*a*/[2], const int /*b*/[2], int /*mode*/) { return {}; }
int get_abbreviated_day_index(const char* /*abbr*/) { return {}; }
int get_current_schedule_index() { return {}; }
int Job_schedule_check(Job* /*job*/) { return {}; }
int Dev_schedule_check(const char* /*host*/) { return {}; }
int get_next_available_time(const char* /*host*/, int /*index*/) { return {}; }
int job_get_next_available_time(Job* /*job*/, int /*index*/) { return {}; }
const char* const day_table[7] = {};
const char* const day_nametable[7][4] = {};
const char* const time_table[48] = {};
float last_float_time_index = 0.0f;
