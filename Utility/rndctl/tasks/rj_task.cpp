// The running-task list: one entry per task record of Render_Tasks that this
// process knows about, linking the record to the render process (if any)
// that works on it here.
#include "Utility/rndctl/tasks/rj_task.h"

#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <unordered_map>
#include <vector>

#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_fileio.h"
#include "Utility/rndctl/ctldir/rj_updatetime.h"
#include "Utility/rndctl/ctlfile/rj_reload.h"
#include "Utility/rndctl/proc/rj_registry.h"
#include "Utility/rndctl/proc/rj_signal.h"
#include "Utility/rndctl/proc/rj_spawn.h"
#include "Utility/rndctl/records/rj_dev.h"
#include "Utility/rndctl/records/rj_job.h"
#include "Utility/rndctl/records/rj_recindex.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/tasks/rj_perform.h"
#include "Utility/rndctl/tasks/rj_reclaim.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"
#include "Utility/rndctl/tasks/rj_tskio.h"

namespace {

constexpr const char* kUnit = "Utility/rndctl/rj_task";

unsigned px(const void* p) { return static_cast<unsigned>(reinterpret_cast<uintptr_t>(p)); }

bool in_task_list(const TASK* entry) {
  return entry->prev != nullptr ? entry->prev->next == entry : rndctl.tasks == entry;
}

// The last entry appended, so that mirroring a file of many thousand
// records does not walk the whole list for every entry.  Only a hint, good
// while the list head is the one it was taken under: whoever sets the list
// aside or replaces it changes the head, and the next append walks again.
// TASK_free moves it off an entry that goes away.
TASK* tail_hint = nullptr;
TASK* tail_hint_head = nullptr;

bool tail_hint_valid() { return tail_hint != nullptr && tail_hint_head == rndctl.tasks; }

TASK* list_tail() {
  if (rndctl.tasks == nullptr) return nullptr;
  TASK* t = tail_hint_valid() ? tail_hint : rndctl.tasks;
  while (t->next != nullptr) t = t->next;
  return t;
}

bool owned_status(int status) {
  return status == TASK_STARTED || status == TASK_RUNNING || status == TASK_FAILED;
}

void kill_here(int pid) { rj_kill_render(rndctl.host.c_str(), pid, 9); }

}  // namespace

bool Task_owns(const TASK* entry, const TaskRec* file_rec) {
  return entry != nullptr && entry->taken && !entry->killed && file_rec != nullptr &&
         rj_dev_is_this_host(file_rec->dev) && owned_status(file_rec->status);
}

bool Task_same_rec(const TaskRec* own, const TaskRec* file_rec) {
  if (own == nullptr || file_rec == nullptr || own->id != file_rec->id) return false;
  // Frames go through the file with six decimals: a start computed here
  // comes back within rounding of that print.
  double a = own->start, b = file_rec->start;
  return std::fabs(a - b) <= 2e-6 + 1e-7 * std::fabs(a);
}

void TaskAfterLock::kill_later(int pid) {
  if (pid >= 2) kills.push_back(pid);
}

void TaskAfterLock::wake(Job* job) {
  if (job != nullptr && std::find(wakes.begin(), wakes.end(), job) == wakes.end()) {
    wakes.push_back(job);
  }
}

void TaskAfterLock::note_full(const TaskGroup* groups) {
  if (!wakes.empty()) full = Task_full_devs(groups, wakes);
}

void TaskAfterLock::run() {
  for (int pid : kills) kill_here(pid);
  kills.clear();
  for (Job* job : wakes) Job_wake_other_hosts(job, &full);
  wakes.clear();
  full.clear();
}

std::vector<const Dev*> Task_full_devs(const TaskGroup* groups, const std::vector<Job*>& jobs) {
  // Only the resources of the jobs to be woken are counted, and only in
  // those jobs' groups: a walk of the whole of a large file would cost the
  // selection cycle several per cent.  A host busy with another job's
  // renders counts as free; waking it costs it one look.
  std::vector<const Dev*> devs;
  for (const Job* job : jobs) {
    for (const RndDevList* e = job != nullptr ? job->resources : nullptr; e != nullptr;
         e = e->next) {
      if (e->dev != nullptr && std::find(devs.begin(), devs.end(), e->dev) == devs.end()) {
        devs.push_back(e->dev);
      }
    }
  }
  std::vector<int> busy(devs.size(), 0);
  for (const TaskGroup* g = groups; g != nullptr && !devs.empty(); g = g->next) {
    if (std::find(jobs.begin(), jobs.end(), g->job) == jobs.end()) continue;
    for (const TaskRec* rec = g->tasks; rec != nullptr; rec = rec->next) {
      if (rec->status != TASK_STARTED && rec->status != TASK_RUNNING) continue;
      auto at = std::find(devs.begin(), devs.end(), rec->dev);
      if (at != devs.end()) ++busy[static_cast<size_t>(at - devs.begin())];
    }
  }
  std::vector<const Dev*> full;
  for (size_t i = 0; i < devs.size(); ++i) {
    if (busy[i] >= std::max(1, devs[i]->num_processors)) full.push_back(devs[i]);
  }
  return full;
}

void Task_drop_stream(TASK* entry) {
  if (entry->stream != nullptr) {
    fclose(entry->stream);
    entry->stream = nullptr;
  }
  if (entry->stream_path) {
    unlink(entry->stream_path.c_str());
    entry->stream_path.reset();
  }
}

void Task_let_go(TASK* entry, TaskAfterLock* after) {
  if (entry == nullptr) return;
  if (entry->pid >= 2) {
    if (after != nullptr) {
      after->kill_later(entry->pid);
    } else {
      kill_here(entry->pid);
    }
  }
  entry->pid = 0;
  entry->taken = 0;
  Task_drop_stream(entry);
  if (entry->out_path) {
    if (entry->job == nullptr || entry->job->save_out == 0) unlink(entry->out_path.c_str());
    entry->out_path.reset();
  }
  entry->output.reset();
}

int Task_settle(TASK* entry, TaskRec* file_rec, TaskAfterLock* after) {
  if (entry == nullptr || entry->rec == nullptr || file_rec == nullptr) return 0;
  TaskRec* own = entry->rec;
  if (Task_owns(entry, file_rec)) {
    file_rec->status = own->status;
    return 1;
  }
  if (own == file_rec || !entry->taken || !owned_status(own->status)) return 0;
  // The piece was put back or taken by another host while this one was
  // slow: its render here stops, and whatever it did is not reported.
  Task_let_go(entry, after);
  own->status = file_rec->status;
  own->start = file_rec->start;
  own->end = file_rec->end;
  own->current = file_rec->current;
  own->retries = file_rec->retries;
  own->dev = file_rec->dev;
  if (file_rec->status == TASK_PENDING && after != nullptr) after->wake(entry->job);
  return 0;
}

int Task_seen_next_id(const Job* job) {
  int seen = 0;
  for (const TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
    if (e->job == job && job != nullptr) seen = std::max(seen, e->seen_next_id);
  }
  return seen;
}

void Task_note_group(const Job* job, const TaskGroup* group) {
  if (job == nullptr || group == nullptr) return;
  for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
    if (e->job == job) e->seen_next_id = std::max(e->seen_next_id, group->next_task_id);
  }
}

bool Task_group_rebuilt(const Job* job, const TaskGroup* group) {
  if (job == nullptr) return false;
  std::unordered_map<int, const TaskRec*> ids;
  int seen = 0;
  for (const TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
    if (e->job != job || e->rec == nullptr) continue;
    ids.emplace(e->rec->id, e->rec);
    seen = std::max(seen, e->seen_next_id);
  }
  if (ids.empty()) return false;  // nothing here that could belong to another life
  if (group == nullptr || group->next_task_id < seen) return true;
  for (const TaskRec* rec = group->tasks; rec != nullptr; rec = rec->next) {
    auto it = ids.find(rec->id);
    if (it != ids.end() && !Task_same_rec(it->second, rec)) return true;
  }
  return false;
}

void Task_retire_job(const Job* job, TaskAfterLock* after) {
  if (job == nullptr) return;
  TASK* next = nullptr;
  for (TASK* e = rndctl.tasks; e != nullptr; e = next) {
    next = e->next;
    if (e->job != job) continue;
    dbgpnt("freeing Task %x\n", px(e));
    Task_let_go(e, after);
    TASK_free(e);
  }
}

void Task_mark_rebuilt(const Job* job) {
  if (job == nullptr) return;
  for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
    if (e->job == job) e->rebuilt = 1;
  }
}

int Task_retire_rebuilt(const std::vector<Job*>& jobs) {
  TaskGroup* groups = nullptr;
  bool read;
  {
    FileopLock lock(FILE_TASKS);
    FILE* fp = read_fileop(FILE_TASKS);
    read = fp != nullptr;
    if (read) {
      groups = Task_read(fp);
      (void)close_fileop(FILE_TASKS);  // read only: nothing to lose
    }
  }
  int dropped = 0;
  TaskAfterLock after;
  for (Job* job : jobs) {
    if (!read || !Task_group_rebuilt(job, TaskGroup_by_job(groups, job))) continue;
    for (const TASK* e = rndctl.tasks; e != nullptr; e = e->next) dropped += e->job == job;
    Task_retire_job(job, &after);
  }
  TaskGroup_free_all(&groups);
  after.run();
  return dropped;
}

int Task_retire_marked() {
  int dropped = 0;
  TASK* next = nullptr;
  for (TASK* e = rndctl.tasks; e != nullptr; e = next) {
    next = e->next;
    if (!e->rebuilt) continue;
    dbgpnt("freeing Task %x\n", px(e));
    Task_let_go(e, nullptr);
    TASK_free(e);
    ++dropped;
  }
  return dropped;
}

namespace {

// Keeps the entries' record pointers valid across reloads of the lists.
void follow_records(int event) {
  for (TASK* t = rndctl.tasks; t != nullptr; t = t->next) {
    if (event == RJC_RECORDS_DROPPING_DELETED) {
      if (t->job != nullptr && t->job->deleted) t->job = nullptr;
    } else if (event == RJC_RECORDS_REPLACED) {
      // Entries of jobs or resources that left the files end with a null
      // pointer instead of a dangling one.
      if (t->job != nullptr) t->job = Job_by_index(t->job->index);
      if (t->rec != nullptr && t->rec->dev != nullptr) {
        t->rec->dev = Dev_by_index(t->rec->dev->index);
      }
    }
  }
}

}  // namespace

TASK* Task_add(Job* job, TaskRec* rec) {
  RJC_records_hook = follow_records;
  dbgpnt("Task_add to \"%s\" id = %d start = %f\t%s\n",
         job != nullptr ? job->name.or_else("(null)") : "(null)", rec != nullptr ? rec->id : -1,
         rec != nullptr ? rec->start : 0.0f, GetTaskStatusStr(rec != nullptr ? rec->status : 0));
  TASK* entry = MA_new<TASK>(__LINE__, kUnit);
  if (entry == nullptr) return nullptr;
  entry->rec = rec;
  entry->job = job;
  if (rec != nullptr) rec->task = entry;

  TASK* last = list_tail();
  entry->prev = last;
  if (last != nullptr) {
    last->next = entry;
  } else {
    rndctl.tasks = entry;
  }
  tail_hint = entry;
  tail_hint_head = rndctl.tasks;
  dbgpnt("Adding Task: %x, rec = %x\n", px(entry), px(rec));
  return entry;
}

void TASK_free(TASK* entry) {
  if (entry == nullptr) return;
  bool hint_valid = tail_hint_valid();
  TASK* prev = entry->prev;
  if (in_task_list(entry)) {
    if (entry->prev != nullptr) {
      entry->prev->next = entry->next;
    } else {
      rndctl.tasks = entry->next;
    }
    if (entry->next != nullptr) entry->next->prev = entry->prev;
  } else {
    dbgpnt("Task to free %x not found\n", px(entry));
  }
  entry->next = entry->prev = nullptr;
  if (hint_valid) {
    if (tail_hint == entry) tail_hint = prev;
    tail_hint_head = rndctl.tasks;
  } else {
    tail_hint = nullptr;
  }

  if (TaskRec* rec = entry->rec) {
    // The record goes with its entry.  If it still sits in a group that is
    // being worked on, TaskRec_free takes it out of that list first.
    entry->rec = nullptr;
    rec->task = nullptr;
    TaskRec_free(rec);
  }
  if (entry->stream != nullptr) {
    fclose(entry->stream);
    entry->stream = nullptr;
  }
  entry->out_path.reset();
  entry->stream_path.reset();
  entry->output.reset();
  entry->pid = -1;
  MA_delete(entry, __LINE__, kUnit);
}

TASK* Task_by_pid(int pid) {
  if (pid == 0) return nullptr;
  for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
    if (e->pid == pid) return e;
  }
  return nullptr;
}

namespace {

// Decodes one reaped child into its running-task entry.
void judge_exit(int pid, int status) {
  rndctl.running = rndctl.running - 1;
  rj_render_ended(pid);
  daemon_updatetime_set(rndctl.host.c_str());
  TASK* entry = Task_by_pid(pid);
  if (entry == nullptr) {
    dbgpnt("=======SIGCLD pid(%d) is UNKNOWN  remaining children(%d)\n", pid, rndctl.running);
    return;
  }
  entry->waitstatus = 0;
  if (status == 0) {
    entry->pid = 0;
  } else if ((status & 0xff) == 0) {
    int code = (status >> 8) & 255;
    dbgpnt("\t\tEXITED with to %d\n", code);
    entry->pid = 0;
    entry->waitstatus = code;
  } else if (((status >> 8) & 255) == 0) {
    entry->pid = 0;
    entry->waitstatus = status & 127;
  } else {
    entry->pid = 0;
    entry->waitstatus = 1;
  }
  const char* name = "no job";
  if (entry->job != nullptr) name = entry->job->name.or_else("noname");
  dbgpnt("=======SIGCLD %s(%d) %d  remaining children(%d)\n", name,
         entry->rec != nullptr ? entry->rec->id : -1, pid, rndctl.running);
}

}  // namespace

int Task_judge_exits() {
  int pid = 0;
  int status = 0;
  int n = 0;
  while (RJ_take_exit(&pid, &status) != 0) {
    judge_exit(pid, status);
    n++;
  }
  return n;
}
