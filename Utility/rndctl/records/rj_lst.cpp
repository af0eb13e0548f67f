// Pick lists: the resources a job may use (hanging from the job), their
// mirror the jobs that name a resource (hanging from the resource), and a
// job's image search paths.  A resource entry and its mirror point at each
// other; removing either removes both.
#include "Utility/rndctl/records/rj_lst.h"

#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/records/rj_recindex.h"
#include "Utility/rndctl/records/rj_records.h"

namespace {

const char* const kUnit = "Utility/rndctl/rj_lst";

// The allocator trace names resource entries by this tag.
constexpr int kDevEntryTag = 122;

// Each list keeps its last entry in the owner, so that an append is one
// step: the reader appends every search path, resource and job of a file,
// and walking to the end for each made a job of 200,000 search paths take
// half a minute to read, under the lock.  append and unlink_entry are the only
// places that change a list's links, and they keep the tail right.
template <class E>
void append(E*& head, E*& tail, E* entry) {
  entry->next = nullptr;
  entry->prev = tail;
  if (tail != nullptr)
    tail->next = entry;
  else
    head = entry;
  tail = entry;
}

template <class E>
void unlink_entry(E*& head, E*& tail, E* entry) {
  if (entry->prev != nullptr)
    entry->prev->next = entry->next;
  else if (head == entry)
    head = entry->next;
  if (entry->next != nullptr)
    entry->next->prev = entry->prev;
  else if (tail == entry)
    tail = entry->prev;
  entry->next = entry->prev = nullptr;
}

// Takes one entry out of a resource's job list and frees it; the other half
// of the pair is left to the caller.
void drop_job_entry(Dev* dev, RndJobList* entry) {
  unlink_entry(dev->jobs, dev->jobs_tail, entry);
  if (entry->mirror != nullptr) entry->mirror->mirror = nullptr;
  entry->mirror = nullptr;
  entry->picked = -1;
  MA_delete(entry, __LINE__, kUnit);
}

void drop_dev_entry(Job* job, RndDevList* entry) {
  unlink_entry(job->resources, job->resources_tail, entry);
  if (entry->mirror != nullptr) entry->mirror->mirror = nullptr;
  entry->mirror = nullptr;
  entry->picked = -1;
  MA_delete(entry, __LINE__, kUnit);
}

}  // namespace

RndDevList* RndDevList_add(Job* job, Dev* dev) {
  if (job == nullptr || dev == nullptr) return nullptr;
  for (RndDevList* e = job->resources; e != nullptr; e = e->next)
    if (e->dev == dev || (e->dev != nullptr && e->dev->index == dev->index)) return e;

  RndDevList* entry = MA_new<RndDevList>(kDevEntryTag, kUnit);
  if (entry == nullptr) return nullptr;
  entry->dev = dev;
  entry->picked = 0;
  // Both halves exist before either is linked: out of memory links nothing.
  if (RndJobList_add(dev, job, entry) == nullptr) {
    MA_delete(entry, __LINE__, kUnit);
    return nullptr;
  }
  append(job->resources, job->resources_tail, entry);
  return entry;
}

Dev* RndDevList_del(Job* job, Dev* dev) {
  if (job == nullptr) return nullptr;
  RndDevList* entry = job->resources;
  while (entry != nullptr && entry->dev != dev) entry = entry->next;
  if (entry == nullptr) return nullptr;

  RndDevList* after = entry->next;
  RndDevList* before = entry->prev;
  RndJobList* mirror = entry->mirror;
  drop_dev_entry(job, entry);
  if (mirror != nullptr && dev != nullptr)
    drop_job_entry(dev, mirror);
  else
    RndJobList_del(dev, job);
  if (after != nullptr) return after->dev;
  if (before != nullptr) return before->dev;
  return nullptr;
}

void RndDevList_pick(Job* job, Dev* dev) {
  if (job == nullptr) return;
  for (RndDevList* e = job->resources; e != nullptr; e = e->next) e->picked = e->dev == dev ? 1 : 0;
}

Dev* RndDevList_picked(Job* job) {
  if (job == nullptr) return nullptr;
  for (RndDevList* e = job->resources; e != nullptr; e = e->next)
    if (e->picked != 0) return e->dev;
  return nullptr;
}

RndJobList* RndJobList_add(Dev* dev, Job* job, RndDevList* mirror) {
  if (dev == nullptr || job == nullptr) return nullptr;
  RndJobList* entry = nullptr;
  // Called for a job's new entry, the job cannot be in the list yet (the
  // job's own list was searched); only a lone add searches.
  if (mirror == nullptr) {
    entry = dev->jobs;
    while (entry != nullptr && entry->job != job &&
           (entry->job == nullptr || entry->job->index != job->index))
      entry = entry->next;
  }
  if (entry == nullptr) {
    entry = MA_new<RndJobList>(__LINE__, kUnit);
    if (entry == nullptr) return nullptr;
    entry->job = job;
    entry->picked = 0;
    append(dev->jobs, dev->jobs_tail, entry);
  }
  if (mirror != nullptr) {
    entry->mirror = mirror;
    mirror->mirror = entry;
  }
  return entry;
}

Job* RndJobList_del(Dev* dev, Job* job) {
  if (dev == nullptr) return nullptr;
  RndJobList* entry = dev->jobs;
  while (entry != nullptr && entry->job != job) entry = entry->next;
  if (entry == nullptr) return nullptr;

  RndJobList* after = entry->next;
  RndJobList* before = entry->prev;
  RndDevList* mirror = entry->mirror;
  drop_job_entry(dev, entry);
  if (mirror != nullptr && job != nullptr) drop_dev_entry(job, mirror);
  if (after != nullptr) return after->job;
  if (before != nullptr) return before->job;
  return nullptr;
}

void RndJobList_pick(Dev* dev, Job* job) {
  if (dev == nullptr) return;
  for (RndJobList* e = dev->jobs; e != nullptr; e = e->next) e->picked = e->job == job ? 1 : 0;
}

Job* RndJobList_picked(Dev* dev) {
  if (dev == nullptr) return nullptr;
  for (RndJobList* e = dev->jobs; e != nullptr; e = e->next)
    if (e->picked != 0) return e->job;
  return nullptr;
}

RndPathList* RndPathList_add(Job* job, const char* path) {
  if (job == nullptr) return nullptr;
  RndPathList* entry = MA_new<RndPathList>(__LINE__, kUnit);
  if (entry == nullptr) return nullptr;
  entry->path.set(path);
  append(job->searchpath, job->searchpath_tail, entry);
  return entry;
}

void RndPathList_del(Job* job, const char* path) {
  if (job == nullptr) return;
  for (RndPathList* e = job->searchpath; e != nullptr; e = e->next) {
    if (rj_strcmp(e->path.c_str(), path) == 0) {
      unlink_entry(job->searchpath, job->searchpath_tail, e);
      MA_delete(e, __LINE__, kUnit);
      return;
    }
  }
}
