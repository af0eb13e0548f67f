#pragma once

#include "Utility/rndctl/records/rj_records.h"

// Job records (rj_job).
Job* Job_new(Job* before, void* listitem, const char* path, int index);
Job* Add_a_job(void* listitem, const char* path, int index);
Job* Insert_a_job(Job* before, void* listitem, const char* path, int index);
Job* Job_by_listitem(void* item);
Job* Job_by_name(const char* name);
Job* Job_by_index(int index);
int ISA_resource_usedby(Job* job, Dev* dev);
int get_job_pick_level(Job* job);
void reorder_picklevels();
Job* Job_del(Job* job);
int Job_get_runstate(const char* word);
int Job_available(Job* job);
void setcurrent_job(Job* job);
Job* Job_clone(Job* job);
