// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

void Job_Error_Update(TASK* /*entry*/) {}
