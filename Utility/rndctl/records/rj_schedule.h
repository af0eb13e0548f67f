#pragma once

#include "Utility/rndctl/records/rj_records.h"

// Weekly schedules (rj_schedule).
extern const char* const day_table[7];
extern const char* const day_nametable[7][4];
extern const char* const time_table[48];
extern float last_float_time_index;
const char* Schedule_get_day(const char* name);
void Schedule_job_runs(Job* job, int start, int end, const char* first_day, const char* last_day);
void Schedule_dev_lock(Dev* dev, int start, int end, const char* first_day, const char* last_day);
int Schedule_get_a_block(int* grid, int times[2], const char* days[2]);
int set_in_betweens(int* grid, const int a[2], const int b[2], int mode);
int get_abbreviated_day_index(const char* abbr);
int get_current_schedule_index();
int Job_schedule_check(Job* job);
int Dev_schedule_check(const char* host);
int get_next_available_time(const char* host, int index);
int job_get_next_available_time(Job* job, int index);
