// Choosing the next task for this host, cutting it to the host's size, and
// putting failed tasks back.
//
// Every daemon mirrors every record of Render_Tasks in its running-task list
// (rndctl.tasks), so that it knows what the other hosts are doing.  A
// selection cycle runs wholly under the task file's lock: read the file,
// bring the mirror in line, pick and cut, mark the piece STARTED, write the
// file back.  The STARTED mark written under the lock is what keeps another
// host from taking the same piece.
#include "Utility/rndctl/tasks/rj_select.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <functional>
#include <unordered_map>
#include <unordered_set>
#include <utility>
#include <vector>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/proc/rj_signal.h"
#include "Utility/rndctl/records/rj_dev.h"
#include "Utility/rndctl/records/rj_job.h"
#include "Utility/rndctl/records/rj_recindex.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/records/rj_schedule.h"
#include "Utility/rndctl/tasks/rj_task.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"
#include "Utility/rndctl/tasks/rj_tskio.h"

namespace {

constexpr int kMaxRetries = 10;

// Debug lines print addresses with "%x", as the log readers expect.
unsigned px(const void* p) { return static_cast<unsigned>(reinterpret_cast<uintptr_t>(p)); }

// Creates (or empties) the task's log stream file and opens it for reading.
// The directory is world-writable: a link planted under the name must not
// send the render output somewhere else, nor let us read from elsewhere.
FILE* open_stream_file(const char* path) {
  int fd;
  do fd = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0666);
  while (fd < 0 && errno == EINTR);
  if (fd < 0) return nullptr;
  close(fd);
  do fd = open(path, O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
  while (fd < 0 && errno == EINTR);
  if (fd < 0) return nullptr;
  FILE* fp = fdopen(fd, "r");
  if (fp == nullptr) close(fd);
  return fp;
}

// First-match lookup of running-task entries by (job, record id), the
// question match_a_taskrec answers, for the one place that asks it for
// every record of the file.  One walk of the list files the entries under
// their job, in list order; a group then turns its job's entries into a
// table by id (ids of a job are a short run of numbers), the first entry in
// list order winning, as in the list walk.  Entries made while the groups
// are worked through are filed under their job too.
class EntryIndex {
 public:
  /// With `mark_stale`, also sets every entry's stale mark on the way: a
  /// selection cycle needs both, and the list is long.
  /// With `rebuilt`, entries marked as of another life of their group are
  /// collected there instead of being filed.
  explicit EntryIndex(bool mark_stale = false, std::vector<TASK*>* rebuilt = nullptr) {
    for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
      if (rebuilt != nullptr && e->rebuilt) {
        rebuilt->push_back(e);
        continue;
      }
      if (mark_stale) e->stale = 1;
      if (e->rec != nullptr) by_job_[e->job].list.push_back(e);
    }
  }

  /// True when `job` has entries.
  bool has(const Job* job) const {
    auto it = by_job_.find(job);
    return it != by_job_.end() && !it->second.list.empty();
  }

  /// Forgets the entries of a job whose entries have all been freed.
  void drop(const Job* job) {
    auto it = by_job_.find(job);
    if (it != by_job_.end()) it->second = JobEntries{};
    current_ = nullptr;
  }

  /// Files a new entry under its job, wherever the selection stands.
  void file(TASK* e) {
    if (e != nullptr && e->rec != nullptr) by_job_[e->job].list.push_back(e);
  }

  /// The first entry of `job` in list order whose record is `rec`'s (the
  /// answer of match_a_taskrec), once stale lives are gone: then the first
  /// entry of an id is the only one that can match.
  TASK* match(const Job* job, const TaskRec* rec) {
    select(job);
    TASK* e = find(rec->id);
    return e != nullptr && Task_same_rec(e->rec, rec) ? e : nullptr;
  }

  /// Narrows the search to one job's entries.  The table of a job is made
  /// once a cycle; entries filed after it are looked up one by one.
  void select(const Job* job) {
    current_ = &by_job_[job];
    if (!current_->indexed) index(*current_);
  }

  TASK* find(int id) const {
    const JobEntries& j = *current_;
    if (!j.table.empty()) {
      int64_t at = static_cast<int64_t>(id) - j.base;
      if (at >= 0 && at < static_cast<int64_t>(j.table.size())) {
        TASK* e = j.table[static_cast<size_t>(at)];
        if (e != nullptr) return e;
      }
    } else if (!j.sorted.empty()) {
      auto it = std::lower_bound(j.sorted.begin(), j.sorted.end(), id,
                                 [](const TASK* e, int i) { return e->rec->id < i; });
      if (it != j.sorted.end() && (*it)->rec->id == id) return *it;
    }
    for (size_t i = j.in_table; i < j.list.size(); ++i) {
      if (j.list[i]->rec->id == id) return j.list[i];
    }
    return nullptr;
  }

  /// A new entry of the selected job.
  void add(TASK* e) { current_->list.push_back(e); }

  /// The entries of the selected job (new ones included).
  const std::vector<TASK*>& selected() const { return current_->list; }

  /// Every job that has entries (the null job of entries whose job left
  /// the file included).
  template <class F>
  void for_each_job(F f) const {
    for (const auto& [job, entries] : by_job_) {
      if (!entries.list.empty()) f(job);
    }
  }

 private:
  struct JobEntries {
    std::vector<TASK*> list;  // in list order
    bool indexed = false;
    size_t in_table = 0;  // entries of `list` in `table` or `sorted`
    int base = 0;
    std::vector<TASK*> table;   // by id - base, the first entry of an id
    std::vector<TASK*> sorted;  // by id, when the ids lie far apart
  };

  static void index(JobEntries& j) {
    j.indexed = true;
    j.in_table = j.list.size();
    if (j.list.empty()) return;
    int lo = INT_MAX, hi = INT_MIN;
    for (TASK* e : j.list) {
      lo = std::min(lo, e->rec->id);
      hi = std::max(hi, e->rec->id);
    }
    int64_t span = static_cast<int64_t>(hi) - lo + 1;
    if (span <= 4 * static_cast<int64_t>(j.list.size()) + 64) {
      j.base = lo;
      j.table.assign(static_cast<size_t>(span), nullptr);
      for (TASK* e : j.list) {
        TASK*& slot = j.table[static_cast<size_t>(e->rec->id - lo)];
        if (slot == nullptr) slot = e;
      }
    } else {
      // Ids scattered far apart: a damaged or hand-made file.
      j.sorted = j.list;
      std::stable_sort(j.sorted.begin(), j.sorted.end(),
                       [](const TASK* a, const TASK* b) { return a->rec->id < b->rec->id; });
    }
  }

  std::unordered_map<const Job*, JobEntries> by_job_;
  JobEntries* current_ = nullptr;  // non-owning: the selected job's
};

bool held_status(int status) {
  return status == TASK_STARTED || status == TASK_RUNNING || status == TASK_FAILED;
}

// Drops every entry of a job whose group in the file is of another life than
// the one this host knew: the group vanished, its next id went below what
// was seen here, or an id of it names another start frame.  Otherwise a
// group built again from id 0 would be taken for the old one, id by id.
void retire_other_lives(TaskGroup* groups, TaskAfterLock* after, EntryIndex& index) {
  // The groups are looked at in file order, in which their records lie in
  // memory; the first group of a job is the one that counts.
  std::unordered_set<const Job*> in_file;
  std::vector<const Job*> gone;
  for (const TaskGroup* g = groups; g != nullptr; g = g->next) {
    const Job* job = g->job;
    if (!in_file.insert(job).second || job == nullptr || !index.has(job)) continue;
    index.select(job);
    int seen = 0;
    for (const TASK* e : index.selected()) seen = std::max(seen, e->seen_next_id);
    if (g->next_task_id < seen) {
      gone.push_back(job);
      continue;
    }
    for (const TaskRec* rec = g->tasks; rec != nullptr; rec = rec->next) {
      TASK* e = index.find(rec->id);
      if (e != nullptr && !Task_same_rec(e->rec, rec)) {
        gone.push_back(job);
        break;
      }
    }
  }
  // Entries whose job left the file (the null job) are UpdateRunningTasks'
  // to end; a job with entries but no group has lost its group.
  index.for_each_job([&](const Job* job) {
    if (job != nullptr && in_file.count(job) == 0) gone.push_back(job);
  });
  for (const Job* job : gone) {
    Task_retire_job(job, after);
    index.drop(job);
  }
}

}  // namespace

// ---------------------------------------------------------------------------

TASK* GetaPendingTask() {
  const char* host = rndctl.host.or_else("");
  dbgpnt("\n--------------------------------------------GetaPendingTask\n");
  dbgpnt("-------------------------SCHEDULE CHECK start\n");
  int this_time = Dev_schedule_check(host);
  dbgpnt("this_time = %d\n", this_time);
  if (this_time >= 0) {
    int secs = get_next_available_time(host, this_time);
    if (secs != 0) {
      RJ_alarm(static_cast<unsigned>(secs));
      dbgpnt("now( %d ) Set an ALARM for %f minutes from now\n", this_time, secs / 30.0);
    }
    return nullptr;
  }
  dbgpnt("No lock for this host \"%s\"\n", host);
  dbgpnt("-------------------------SCHEDULE CHECK end\n");
  // A host rendering on every processor has nothing to take: it looks again
  // when a render ends, and the task file's lock stays free for the others.
  if (!Task_host_has_free_slot()) {
    dbgpnt("no free processor on this host\n");
    return nullptr;
  }

  TASK* entry = Get_a_task();
  if (entry == nullptr) {
    dbgpnt("no valid task found\n");
  } else {
    const char* job_name = entry->job != nullptr ? entry->job->name.or_else("(null)") : "(null)";
    const Dev* dev = entry->rec != nullptr ? entry->rec->dev : nullptr;
    const char* dev_name = dev != nullptr ? dev->name.or_else("(null)") : "(null)";
    char path[4096];
    snprintf(path, sizeof path, "%s/%s.%s.%d", rj_tmpdir(), job_name, dev_name,
             rndctl.stream_counter);
    rndctl.stream_counter = rndctl.stream_counter == INT_MAX || rndctl.stream_counter < 0
                                ? 0
                                : rndctl.stream_counter + 1;
    entry->stream_path.set(path);
    if (entry->stream != nullptr) fclose(entry->stream);
    entry->stream = open_stream_file(path);
    if (entry->stream == nullptr) perror("in GetaPendingTask");
    dbgpnt("TASK of %s on %s is from %f to %f\n", job_name, dev_name,
           entry->rec != nullptr ? entry->rec->start : 0.0f,
           entry->rec != nullptr ? entry->rec->end : 0.0f);
    dbgpnt("task stream: \"%s\"\n", path);
  }
  dbgpnt("\n--------------------------------------done--GetaPendingTask\n");
  return entry;
}

TASK* Get_a_task() { return Task_get(); }

namespace {

// Gives an entry the place and progress of the file's record it mirrors.
void take_place(TaskRec* own, const TaskRec* rec) {
  own->start = rec->start;
  own->end = rec->end;
  own->retries = rec->retries;
  own->current = rec->current;
}

// Drops the entries marked as of another life (as Task_retire_marked would)
// and retires those whose group in the file is of another life.
void retire_old_entries(TaskGroup* groups, const std::vector<TASK*>& marked, EntryIndex& index,
                        TaskAfterLock* after) {
  for (TASK* e : marked) {
    dbgpnt("freeing Task %x\n", px(e));
    Task_let_go(e, after);
    TASK_free(e);
  }
  retire_other_lives(groups, after, index);
}

// The entry that takes the picked record `rec` (already cut to size):
// this host's entry of it if there is one, else a new one that owns it.
TASK* take_record(TaskRec* rec, EntryIndex& index, TaskAfterLock* after) {
  TASK* chosen = index.match(rec->group->job, rec);
  // The record is PENDING in the file: an entry here that still held it
  // lost it, and its render stops before the piece is taken again.
  if (chosen != nullptr && chosen->rec != rec) Task_settle(chosen, rec, after);
  const int ids_before = rec->group->next_task_id;
  split_a_task(rec->group, rec);
  if (rec->group->next_task_id != ids_before) after->wake(rec->group->job);
  if (chosen == nullptr) {
    TaskRec** link = &rec->group->tasks;
    while (*link != nullptr && *link != rec) link = &(*link)->next;
    if (*link == rec) rec = TaskRec_unpool(link);
    chosen = Task_add(rec->group->job, rec);
    index.file(chosen);
  } else if (chosen->rec != rec) {
    take_place(chosen->rec, rec);
    chosen->rec->dev = rec->dev;
  }
  rec->status = TASK_STARTED;
  return chosen;
}

// Picks the piece this host renders next, cuts it, and marks it STARTED in
// the file and in its entry.  Returns the entry, or null when there is none.
TASK* pick_and_cut(TaskGroup** groups, EntryIndex& index, TaskAfterLock* after) {
  insert_unknown_pending_jobs(groups);
  TaskRec* rec = extract_pending_task(groups);
  if (rec == nullptr) return nullptr;
  TASK* chosen = take_record(rec, index, after);
  if (chosen != nullptr) {
    chosen->rec->status = TASK_STARTED;
    chosen->stale = 0;
    chosen->taken = 1;
  }
  return chosen;
}

// Brings the entry of one record (at *link of group g) in line with it.
void mirror_record(Job* job, TaskRec** link, bool uses_host, EntryIndex& index,
                   TaskAfterLock* after) {
  TaskRec* rec = *link;
  TASK* e = index.find(rec->id);
  if (e != nullptr && !Task_same_rec(e->rec, rec)) e = nullptr;
  if (e == nullptr) {
    rec = TaskRec_unpool(link);
    e = Task_add(job, rec);  // the entry owns the record from now on
    if (e != nullptr) index.add(e);
  } else if (e->rec != rec && uses_host) {
    TaskRec* own = e->rec;
    take_place(own, rec);
    if (rec->dev != nullptr) own->dev = rec->dev;
    // This host knows best what its own tasks are doing, while they are
    // its own; for the others the file is the news.
    if (Task_settle(e, rec, after) != 0) {
      dbgpnt("Task_get: use old status %d\n", own->status);
    } else {
      own->status = rec->status;
    }
  }
  if (e != nullptr && !e->taken && rj_dev_is_this_host(rec->dev) && held_status(rec->status)) {
    // Names this host as its renderer, but no daemon here took it: an
    // earlier daemon of this host did and ended.  Nobody renders it.
    rec->status = TASK_PENDING;
    if (e->rec != nullptr) e->rec->status = TASK_PENDING;
    after->wake(job);
  }
  if (e != nullptr && e->rec != rec) {
    if (uses_host) dbgpnt("extra task_rec %x, setting dead state\n", px(rec));
    rec->keep = 1;
  }
  if (e != nullptr) e->stale = 0;
}

// Brings the running-task list in line with the file, group by group: an
// entry for every record, this host's view of its own pieces kept.
void mirror_groups(TaskGroup* groups, EntryIndex& index, TaskAfterLock* after) {
  const char* host = rndctl.host.c_str();
  for (TaskGroup* g = groups; g != nullptr; g = g->next) {
    Job* job = g->job;
    const bool uses_host = isa_job_using_host(host, job) != 0;
    index.select(job);
    for (TaskRec** link = &g->tasks; *link != nullptr; link = &(*link)->next) {
      mirror_record(job, link, uses_host, index, after);
    }
    for (TASK* e : index.selected()) e->seen_next_id = std::max(e->seen_next_id, g->next_task_id);
  }
}

// One selection cycle on the groups read under the lock: old lives out,
// pick and cut, mirror.  Returns the entry to render, or null.
TASK* select_cycle(TaskGroup** groups, TaskAfterLock* after) {
  // Every entry that finds its record in the file loses the stale mark
  // again; those that keep it have left the file.  One index of the
  // entries serves the whole cycle; entries marked as of another life are
  // found in the same walk of the list.
  std::vector<TASK*> marked;
  EntryIndex index(true, &marked);
  retire_old_entries(*groups, marked, index, after);
  TASK* chosen = pick_and_cut(groups, index, after);
  mirror_groups(*groups, index, after);
  return chosen;
}

// Frees the entries whose records left the file.  Returns `chosen`, or null
// when it was one of them.
TASK* sweep_stale_entries(TASK* chosen) {
  TASK* e = rndctl.tasks;
  while (e != nullptr) {
    TASK* next = e->next;
    // A render whose job left the file is ended by UpdateRunningTasks once
    // it is reaped; any other entry without a record in the file goes, and
    // a render of it with it.
    if (e->stale && !(e->job == nullptr && e->pid >= 2)) {
      dbgpnt("freeing Task %x\n", px(e));
      if (e == chosen) chosen = nullptr;
      Task_let_go(e, nullptr);
      TASK_free(e);
    }
    e = next;
  }
  return chosen;
}

}  // namespace

TASK* Task_get() {
  TaskAfterLock after;
  TASK* chosen = nullptr;
  bool opened = false;
  const int written = Task_file_rewrite([&](TaskGroup** groups) {
    opened = true;
    chosen = select_cycle(groups, &after);
    after.note_full(*groups);
    return true;
  });
  if (!opened) {
    Task_retire_marked();
    return nullptr;
  }
  after.run();
  if (written != 1 && chosen != nullptr && chosen->rec != nullptr) {
    // The file does not say STARTED (the failure is reported): another host
    // may take the piece, so this one must not render it.
    chosen->rec->status = TASK_PENDING;
    chosen->taken = 0;
    chosen = nullptr;
  }
  chosen = sweep_stale_entries(chosen);
  Check_RndTasks("Task_get 3");
  return chosen;
}

TASK* match_a_taskrec(TaskRec* rec) {
  if (rec == nullptr || rec->group == nullptr) return nullptr;
  const Job* job = rec->group->job;
  for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
    if (e->job == job && Task_same_rec(e->rec, rec)) return e;
  }
  return nullptr;
}

TaskRec* Split_first_splittable_failed_tasks() {
  // Only a failure of this daemon's own render is this host's to put back.
  TASK* next = nullptr;
  for (TASK* e = rndctl.tasks; e != nullptr; e = next) {
    next = e->next;
    if (e->rec == nullptr || e->rec->status != TASK_FAILED || !e->taken) continue;
    if (e->rec->retries >= kMaxRetries) continue;  // stays FAILED: nothing to write
    if (TaskRec* r = Task_split_and_insert(e->rec)) return r;
  }
  Task_retire_marked();
  return nullptr;
}

TaskRec* Task_split_and_insert(TaskRec* rec) {
  if (rec == nullptr || rec->task == nullptr || rec->task->job == nullptr) return nullptr;
  TASK* entry = rec->task;
  Job* job = entry->job;
  dbgpnt("Task_split_and_insert===========================%d\n", rec->id);
  TaskAfterLock after;
  (void)Task_file_rewrite([&](TaskGroup** groups) {  // reported; the old file stands
    TaskGroup* group = TaskGroup_by_job(*groups, job);
    TaskRec* f = nullptr;
    if (Task_group_rebuilt(job, group)) {
      Task_mark_rebuilt(job);
    } else if (group != nullptr) {
      for (f = group->tasks; f != nullptr && (f == rec || !Task_same_rec(rec, f)); f = f->next) {
      }
    }
    if (f != nullptr && !Task_owns(entry, f)) {
      // Put back or taken by another host meanwhile: not this host's any more.
      Task_settle(entry, f, &after);
    } else if (f != nullptr && rec->retries < kMaxRetries) {
      int n = rec->retries++;
      if (rec->start < rec->current) {
        // Frames up to the one it reached are done; the rest starts afresh.
        TaskRec* rest = insert_task(groups, job, rec->current, rec->end, TASK_PENDING);
        if (rest != nullptr) {
          rest->retries = n;
          rest->keep = 2;
          Task_add(job, rest);
        }
        rec->status = TASK_FINISHED;
        rec->end = rec->current - job->frames[2];
        rec->current = rec->end;
      } else {
        rec->status = TASK_PENDING;
      }
      f->status = rec->status;
      f->start = rec->start;
      f->end = rec->end;
      f->current = rec->current;
      f->retries = rec->retries;
      entry->taken = 0;  // given back
      Task_note_group(job, group);
      after.wake(job);
      after.note_full(*groups);
    }
    return true;
  });
  after.run();
  dbgpnt("done ================= Task_split_and_insert\n");
  return nullptr;
}

// ---------------------------------------------------------------------------
// Debug aids.

void Walk_rndctl_tasks(const char* label) {
  dbgpnt("Walking of rndctl task list from: %s\n", label != nullptr ? label : "");
  for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
    dbgpnt("task\n");
    dbgpnt("    %x\n", px(e));
  }
}

void Check_for_same_task(TASK* entry) {
  for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
    if (e == entry) {
      dbgpnt("This is task is already here\n");
      return;
    }
  }
}

void Check_RndTasks(const char* label) {
  if (!debug) return;  // a walk of the whole list that only the trace needs
  for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
    if (e->stale) dbgpnt("Heh, this is supposed to be dead %x\n", px(e));
    if (e->next != nullptr && e->next->prev != e) {
      dbgpnt("This is probably bad: \"%s\"\n", label != nullptr ? label : "");
    }
  }
}
