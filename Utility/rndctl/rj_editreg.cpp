// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

void Editor_process_list(int /*mode*/) {}
int Editor_process_validate(int /*pid*/) { return {}; }
const char* Editor_process_getuser(int /*pid*/) { return {}; }
