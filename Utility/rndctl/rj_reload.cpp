// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

int RJC_reload(int /*flag*/) { return {}; }
int RRC_reload(int /*flag*/) { return {}; }
void Job_control_write(const char* /*dir*/) {}
void Resource_control_write(const char* /*dir*/) {}
int RJC_parse() { return {}; }
int get_fvalue(const char* /*text*/, float* /*value*/) { return {}; }
void Update_from_demon(int /*editor*/) {}
int RJC_in() { return {}; }
void RJC_out() {}
