// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

TASK* Task_add(Job* /*job*/, TaskRec* /*rec*/) { return {}; }
void TASK_free(TASK* /*entry*/) {}
TASK* Task_by_pid(int /*pid*/) { return {}; }
