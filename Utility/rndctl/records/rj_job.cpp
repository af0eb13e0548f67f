// Job records: making, finding, inserting and deleting jobs of the control
// block's job list, and decoding run-state words.
#include "Utility/rndctl/records/rj_job.h"

#include <cstdint>
#include <cstring>

#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_fileio.h"
#include "Utility/rndctl/records/rj_jobcheck.h"
#include "Utility/rndctl/records/rj_lst.h"
#include "Utility/rndctl/records/rj_recindex.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/records/rj_schedule.h"

namespace {

const char* const kUnit = "Utility/rndctl/rj_job";

// The allocator trace names every job by this tag, whatever line makes it.
constexpr int kJobTag = 100;

auto index_is(int index) {
  return [index](const Job* j) { return j->index == index; };
}

// The reader appends ten thousand jobs; walking to the tail for each would
// be quadratic.  The last appended job is remembered together with the head
// of its list, and only used while that list is the current one (a reload
// swaps lists).  Job_del forgets it before the job is freed.
Job* tail_hint = nullptr;  // non-owning
Job* tail_head = nullptr;  // non-owning; compared, never followed

// An editor's list entry is {next, prev, record, ...}; it points back at the
// record it shows, and that pointer must not outlive the record.
void clear_listitem_backlink(void* item, const void* record) {
  if (item == nullptr) return;
  void** words = static_cast<void**>(item);
  if (words[2] == record) words[2] = nullptr;
}

}  // namespace

namespace {

Job* job_make(Job* before, void* listitem, const char* path, int index, bool defaults) {
  Job* job = MA_new<Job>(kJobTag, kUnit);
  if (job == nullptr) return nullptr;

  job->pick_level = 0;
  job->listitem = listitem;
  // The job is named after the last component of its scene path.
  const char* slash = path != nullptr ? strrchr(path, '/') : nullptr;
  job->name.set(slash != nullptr ? slash + 1 : path);
  job->status.set("none");
  job->priority = 0;
  job->index = index != 0 ? index : RJCget_next_index(FILE_JOB_INDEX);
  job->use_sdl_paths = 1;
  if (defaults) {
    job->sdl.set(path);
    job->pix.set("./pix_file");
    job->matte.set("./matte_file");
  }

  if (before != nullptr) {
    job->next = before;
    job->prev = before->prev;
    if (before->prev != nullptr)
      before->prev->next = job;
    else
      rndctl.jobs = job;
    before->prev = job;
  } else if (rndctl.jobs == nullptr) {
    rndctl.jobs = job;
  } else {
    Job* last = rndctl.jobs;
    if (tail_hint != nullptr && tail_head == rndctl.jobs) last = tail_hint;
    while (last->next != nullptr) last = last->next;
    last->next = job;
    job->prev = last;
  }
  if (job->next == nullptr) {
    tail_hint = job;
    tail_head = rndctl.jobs;
  }
  recindex_add(rndctl.job_index, job->index, job);
  return job;
}

}  // namespace

Job* Job_new(Job* before, void* listitem, const char* path, int index) {
  return job_make(before, listitem, path, index, true);
}

Job* Add_a_job_as_read(const char* name, int index) {
  if (index != 0) {
    Job* found = Job_by_index(index);
    if (found != nullptr) return found;
  }
  return job_make(nullptr, nullptr, name, index, false);
}

Job* Add_a_job(void* listitem, const char* path, int index) {
  if (index != 0) {
    Job* found = Job_by_index(index);
    if (found != nullptr) return found;
  }
  return Job_new(nullptr, listitem, path, index);
}

Job* Insert_a_job(Job* before, void* listitem, const char* path, int index) {
  Job* found = Job_by_index(index);
  if (found != nullptr) return found;
  return Job_new(before, listitem, path, index);
}

Job* Job_by_listitem(void* item) {
  for (Job* job = rndctl.jobs; job != nullptr; job = job->next)
    if (job->listitem == item) return job;
  return nullptr;
}

Job* Job_by_name(const char* name) {
  if (name == nullptr) return nullptr;
  for (Job* job = rndctl.jobs; job != nullptr; job = job->next)
    if (job->name.is(name)) return job;
  return nullptr;
}

Job* Job_by_index(int index) {
  return recindex_find(rndctl.job_index, index, rndctl.jobs, index_is(index), false);
}

int ISA_resource_usedby(Job* job, Dev* dev) {
  if (job == nullptr) return 0;
  for (RndDevList* e = job->resources; e != nullptr; e = e->next)
    if (e->dev == dev) return 1;
  return 0;
}

int get_job_pick_level(Job* job) { return job != nullptr ? job->pick_level : 0; }

void reorder_picklevels() {
  for (Job* job = rndctl.jobs; job != nullptr; job = job->next) {
    if (job->listitem == nullptr) continue;
    // The editor keeps its selection mark in bit 0 of the entry's 22nd
    // 16-bit word.
    const uint16_t* words = static_cast<const uint16_t*>(job->listitem);
    if ((words[21] & 1) != 0) {
      job->pick_level = 1;
      setcurrent_job(job);
      return;
    }
  }
}

Job* Job_del(Job* job) {
  if (job == nullptr) return nullptr;
  Job* neighbour = job->prev != nullptr ? job->prev : job->next;

  if (job->prev != nullptr)
    job->prev->next = job->next;
  else if (rndctl.jobs == job)
    rndctl.jobs = job->next;
  if (job->next != nullptr) job->next->prev = job->prev;
  job->next = job->prev = nullptr;
  if (tail_hint == job) tail_hint = nullptr;
  recindex_remove(rndctl.job_index, job->index, job, rndctl.jobs, index_is(job->index));
  if (rndctl.current_job == job) rndctl.current_job = nullptr;

  // Each delete takes the head entry away; stop should one refuse, rather
  // than spin.
  while (job->resources != nullptr) {
    RndDevList* head = job->resources;
    RndDevList_del(job, head->dev);
    if (job->resources == head) break;
  }
  while (job->searchpath != nullptr) {
    RndPathList* head = job->searchpath;
    RndPathList_del(job, head->path.c_str());
    if (job->searchpath == head) break;
  }

  clear_listitem_backlink(job->listitem, job);
  // A stale pointer to a deleted job then reads as dead, not as a job.
  job->index = -1;
  MA_delete(job, __LINE__, kUnit);
  return neighbour;
}

int Job_get_runstate(const char* word) {
  if (word == nullptr || *word == '\0') return RUN_UNSET;
  if (strcmp(word, "PAUSED") == 0) return RUN_PAUSED;
  if (strcmp(word, "AVAILABLE") == 0) return RUN_AVAILABLE;
  if (strcmp(word, "SCHEDULE") == 0) return RUN_SCHEDULE;
  if (strcmp(word, "NOW") == 0) return RUN_NOW;
  return RUN_UNSET;
}

int Job_available(Job* job) { return Job_schedule_check(job); }

void setcurrent_job(Job* job) {
  // Making a job current can reach editor code that makes another current;
  // the inner call is refused rather than left to fight over the lock.
  static bool entered = false;
  if (entered) return;
  entered = true;
  Job* previous = rndctl.current_job;
  if (previous != nullptr && previous != job && previous->lock_pid == rndctl.pid)
    previous->lock_pid = 0;
  rndctl.current_job = job;
  if (job != nullptr) job->lock_pid = rndctl.pid;
  entered = false;
}

Job* Job_clone(Job* job) {
  if (job == nullptr) return nullptr;
  Job* copy = Job_new(nullptr, nullptr, nullptr, 0);
  if (copy == nullptr) return nullptr;

  // Everything but the list links, the identity and the owned lists is a
  // plain copy; the lists are rebuilt so both jobs own their entries.
  Job* next = copy->next;
  Job* prev = copy->prev;
  int index = copy->index;
  *copy = *job;
  copy->next = next;
  copy->prev = prev;
  copy->index = index;
  copy->listitem = nullptr;
  copy->pick_level = 0;
  copy->lock_pid = 0;
  copy->resources = copy->resources_tail = nullptr;
  copy->searchpath = nullptr;
  copy->searchpath_tail = nullptr;

  char name[256];
  snprintf(name, sizeof name, "%s.clone", job->name.or_else("noname"));
  copy->name.set(name);
  for (RndDevList* e = job->resources; e != nullptr; e = e->next) RndDevList_add(copy, e->dev);
  for (RndPathList* p = job->searchpath; p != nullptr; p = p->next)
    RndPathList_add(copy, p->path.c_str());
  return copy;
}
