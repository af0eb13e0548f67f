// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

RndDevList* RndDevList_add(Job* /*job*/, Dev* /*dev*/) { return {}; }
Dev* RndDevList_del(Job* /*job*/, Dev* /*dev*/) { return {}; }
void RndDevList_pick(Job* /*job*/, Dev* /*dev*/) {}
Dev* RndDevList_picked(Job* /*job*/) { return {}; }
RndJobList* RndJobList_add(Dev* /*dev*/, Job* /*job*/, RndDevList* /*mirror*/) { return {}; }
Job* RndJobList_del(Dev* /*dev*/, Job* /*job*/) { return {}; }
void RndJobList_pick(Dev* /*dev*/, Job* /*job*/) {}
Job* RndJobList_picked(Dev* /*dev*/) { return {}; }
RndPathList* RndPathList_add(Job* /*job*/, const char* /*path*/) { return {}; }
void RndPathList_del(Job* /*job*/, const char* /*path*/) {}
