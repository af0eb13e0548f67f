// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

Job* Job_new(Job* /*before*/, void* /*listitem*/, const char* /*path*/, int /*index*/) { return {}; }
Job* Add_a_job(void* /*listitem*/, const char* /*path*/, int /*index*/) { return {}; }
Job* Insert_a_job(Job* /*before*/, void* /*listitem*/, const char* /*path*/, int /*index*/) { return {}; }
Job* Job_by_listitem(void* /*item*/) { return {}; }
Job* Job_by_name(const char* /*name*/) { return {}; }
Job* Job_by_index(int /*index*/) { return {}; }
int ISA_resource_usedby(Job* /*job*/, Dev* /*dev*/) { return {}; }
int get_job_pick_level(Job* /*job*/) { return {}; }
void reorder_picklevels() {}
Job* Job_del(Job* /*job*/) { return {}; }
int Job_get_runstate(const char* /*word*/) { return {}; }
int Job_available(Job* /*job*/) { return {}; }
void setcurrent_job(Job* /*job*/) {}
Job* Job_clone(Job* /*job*/) { return {}; }
