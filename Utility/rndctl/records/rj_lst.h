/// Pick lists: the resources a job may use (RndDevList, hanging from the
/// job), their mirror, the jobs that name a resource (RndJobList, hanging
/// from the resource), and a job's image search paths (RndPathList).
///
/// A job's resource entry and the resource's job entry are made and removed
/// as a pair: RndDevList_add makes both, and deleting either side deletes
/// both, so a job and a resource never disagree about each other.  Each
/// list owns its entries; the entries' record pointers do not own.  Appends
/// take one step (each list keeps its tail), which the reader relies on for
/// jobs of many thousand search paths.
///
/// Control block: none of its fields is read or written; only the lists
/// hanging from the records given.
#pragma once

#include "Utility/rndctl/records/rj_records.h"

/// Adds `dev` to the job's pick list (and `job` to the resource's job list),
/// at the end.  A resource already there, by pointer or by index, is not
/// added twice: its entry is returned.  Returns the job's entry, or null
/// for a null job or resource or when out of memory (then nothing changed).
RndDevList* RndDevList_add(Job* job, Dev* dev);
/// Removes `dev` from the job's pick list together with its mirror entry.
/// Returns the resource of the entry after it (else before it) for a list
/// view's selection; null when the list is now empty, `dev` was not in it
/// or `job` is null.
Dev* RndDevList_del(Job* job, Dev* dev);
/// Marks `dev` the one picked entry of the job's list (null: none picked).
void RndDevList_pick(Job* job, Dev* dev);
/// The resource of the job's first picked entry, or null.
Dev* RndDevList_picked(Job* job);
/// Adds `job` to the resource's job list.  With `mirror` (the job's new
/// entry for this resource, from RndDevList_add) the two entries are tied
/// together; without, a job already there (by pointer or index) is not added
/// twice.  Returns the resource's entry, or null for a null resource or job
/// or when out of memory.  Outside rj_lst, call RndDevList_add instead: an
/// entry without a mirror is not on the job's side.
RndJobList* RndJobList_add(Dev* dev, Job* job, RndDevList* mirror);
/// Removes `job` from the resource's job list together with its mirror.
/// Returns the job of the entry after it (else before it); null when the
/// list is now empty, `job` was not in it or `dev` is null.
Job* RndJobList_del(Dev* dev, Job* job);
/// Marks `job` the one picked entry of the resource's list (null: none).
void RndJobList_pick(Dev* dev, Job* job);
/// The job of the resource's first picked entry, or null.
Job* RndJobList_picked(Dev* dev);
/// Appends `path` to the job's search paths (duplicates are kept: the order
/// is the search order).  Returns the entry, or null for a null job or out
/// of memory.
RndPathList* RndPathList_add(Job* job, const char* path);
/// Removes the first search path equal to `path`; nothing when none is.
void RndPathList_del(Job* job, const char* path);
