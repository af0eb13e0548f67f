// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

Dev* Dev_new(Dev* /*before*/, void* /*listitem*/, const char* /*name*/, int /*index*/) { return {}; }
Dev* Add_a_dev(void* /*listitem*/, const char* /*name*/, int /*index*/) { return {}; }
Dev* Insert_a_dev(Dev* /*before*/, void* /*listitem*/, const char* /*name*/, int /*index*/) { return {}; }
Dev* Dev_by_name(const char* /*name*/) { return {}; }
Dev* Dev_by_index(int /*index*/) { return {}; }
Dev* dev_by_listitem(void* /*item*/) { return {}; }
Dev* Dev_del(Dev* /*dev*/) { return {}; }
int Dev_get_lockstate(const char* /*word*/) { return {}; }
void Dev_field_check() {}
void reset_autoadd_dev() {}
void setcurrent_dev(Dev* /*dev*/) {}
