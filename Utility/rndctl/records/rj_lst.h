#pragma once

#include "Utility/rndctl/records/rj_records.h"

// Pick lists (rj_lst).

RndDevList* RndDevList_add(Job* job, Dev* dev);
Dev* RndDevList_del(Job* job, Dev* dev);
void RndDevList_pick(Job* job, Dev* dev);
Dev* RndDevList_picked(Job* job);
RndJobList* RndJobList_add(Dev* dev, Job* job, RndDevList* mirror);
Job* RndJobList_del(Dev* dev, Job* job);
void RndJobList_pick(Dev* dev, Job* job);
Job* RndJobList_picked(Dev* dev);
RndPathList* RndPathList_add(Job* job, const char* path);
void RndPathList_del(Job* job, const char* path);
