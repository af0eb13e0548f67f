// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

void Job_control_write_dev(FILE* /*fp*/) {}
void Resource_control_write_dev(FILE* /*fp*/) {}
