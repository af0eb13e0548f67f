#pragma once

#include "Utility/rndctl/records/rj_records.h"

// Resource records (rj_dev) and pick lists (rj_lst).
Dev* Dev_new(Dev* before, void* listitem, const char* name, int index);
Dev* Add_a_dev(void* listitem, const char* name, int index);
Dev* Insert_a_dev(Dev* before, void* listitem, const char* name, int index);
Dev* Dev_by_name(const char* name);
Dev* Dev_by_index(int index);
Dev* dev_by_listitem(void* item);
Dev* Dev_del(Dev* dev);
int Dev_get_lockstate(const char* word);
void Dev_field_check();
void reset_autoadd_dev();
void setcurrent_dev(Dev* dev);
/// Renames a resource; renames must go through here so Dev_by_name stays right.
void Dev_set_name(Dev* dev, const char* name);
/// Whether a resource stands for `host`: its host_name names it.  A resource
/// name is only a label (one host may offer several resources, "fast1" on
/// host "hostA"); every "is this task / job / resource ours" question asks
/// this, never the resource name.  Null resource or host: false.
bool rj_dev_on_host(const Dev* dev, const char* host);
/// rj_dev_on_host(dev, this host's name).
bool rj_dev_is_this_host(const Dev* dev);
/// Work of `job` appeared (put back, cut off, created): touches the pid file
/// of every other host in the job's host list, once each, so that an idle
/// daemon there takes it without waiting for its check interval.
void Job_wake_other_hosts(const Job* job);
