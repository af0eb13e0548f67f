// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

int RJCget_next_index(int /*file_id*/) { return {}; }
char* get_strstr(const char* /*key*/, char* /*line*/) { return {}; }
int Job_check_sdlfields(Job* /*job*/) { return {}; }
int Job_set_frame_range(Job* /*job*/) { return {}; }
int Calc_frame_range(float /*start*/, float /*end*/, float /*step*/) { return {}; }
int Job_check_sdl(Job* /*job*/) { return {}; }
int rj_strcmp(const char* /*a*/, const char* /*b*/) { return {}; }
void Job_field_check() {}
int Job_file_search(const char* /*host*/) { return {}; }
int ISA_devdif(Dev* /*a*/, Dev* /*b*/) { return {}; }
int ISA_jobdif(Job* /*a*/, Job* /*b*/) { return {}; }
