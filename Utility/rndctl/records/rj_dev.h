/// Resource records: the list of render hosts as the queue sees them
/// (`rndctl.devs`), one "dev" per entry of Render_Resource_Control.  Making,
/// finding, renaming and deleting them, the lock-state words of the file,
/// and the questions "is this resource on that host".
///
/// Calling order: the reader makes resources with Add_a_dev (or Dev_new)
/// in file order, before any job names them; lookups may follow at any
/// time; Dev_del is the only way a resource goes (it takes the resource out
/// of every job's pick list first).  Renames go through Dev_set_name.
///
/// Control block: writes `devs` (the list head), `dev_index` and
/// `dev_name_index` (kept in step with every add, rename and delete) and
/// `current_dev` (setcurrent_dev, and cleared by Dev_del when it named the
/// record); reads `host` (a new resource's host name, "this host"), `pid`
/// (the lock holder mark) and `location` (the index file, through
/// RJCget_next_index).  A resource's `lock_pid` is an editor's claim on it,
/// not a file lock.
#pragma once

#include <vector>

#include "Utility/rndctl/records/rj_records.h"

/// Makes a resource and links it in before `before` (null: at the end).
/// `index` 0 asks for a fresh one from the index file; the name
/// "new_resource" becomes "new_resource_INDEX" so that new entries of an
/// editor differ.  The resource starts on this host, SCHEDULE, 4 frames a
/// piece, remote location $DRCTMPDIR or "/usr/tmp".  `listitem` is the
/// editor's list entry (non-owning; null outside editors).  Returns the new
/// resource, owned by the list, or null when out of memory (nothing linked).
Dev* Dev_new(Dev* before, void* listitem, const char* name, int index);
/// Like Dev_new (at the end, resp. before `before`), but an existing
/// resource of the same index is returned as it is: a file that names an
/// index twice keeps the first.  Null only when out of memory.
Dev* Add_a_dev(void* listitem, const char* name, int index);
Dev* Insert_a_dev(Dev* before, void* listitem, const char* name, int index);
/// The first resource in list order with that name (resp. index, editor
/// list entry), or null.  Names are labels, not identities: a lookup by name
/// that should mean "this host" wants rj_dev_on_host instead.
Dev* Dev_by_name(const char* name);
Dev* Dev_by_index(int index);
Dev* dev_by_listitem(void* item);
/// Unlinks and frees `dev`: drops it from every job's pick list and from the
/// index tables, clears `current_dev` and the editor entry's pointer to it.
/// Returns its neighbour (the previous resource, else the next), so that a
/// list view can move its selection; null when the list is now empty or
/// `dev` was null.  Pointers to `dev` held elsewhere dangle afterwards.
Dev* Dev_del(Dev* dev);
/// LOCK_LOCKED, LOCK_AVAILABLE or LOCK_SCHEDULE for the file's words
/// "LOCKED", "AVAILABLE", "SCHEDULE" (exact case); LOCK_UNSET for anything
/// else, an empty word or null.
int Dev_get_lockstate(const char* word);
/// Clears each resource's `lock_pid` whose holder (another process) is no
/// longer a registered editor: an editor that died holds nothing.
void Dev_field_check();
/// Makes current, in turn, every resource an editor marked to be added by
/// default (`default_dev`), clearing the mark; the last one stays current.
void reset_autoadd_dev();
/// Makes `dev` the current resource (null: none) and marks it held by this
/// process; the previous one is released if this process held it.  A call
/// made from inside another (editor code run by the first) is ignored.
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
/// daemon there takes it without waiting for its check interval.  A failed
/// touch only costs that host its early wake-up; nothing is returned.
/// Resources in `full` (non-owning; null for none) are passed over: a host
/// is touched only for a resource of the job that may take work now.
void Job_wake_other_hosts(const Job* job, const std::vector<const Dev*>* full = nullptr);
