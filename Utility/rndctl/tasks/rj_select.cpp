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

unsigned px(const void* p) { return static_cast<unsigned>(reinterpret_cast<uintptr_t>(p)); }

bool dev_on_host(const Dev* dev, const char* host) { return rj_dev_on_host(dev, host); }

bool dev_on_this_host(const Dev* dev) { return rj_dev_is_this_host(dev); }

bool is_active(int status) { return status == TASK_STARTED || status == TASK_RUNNING; }

// True when the job's host list names a host other than this one.
bool job_names_other_host(const Job* job) {
  for (RndDevList* e = job != nullptr ? job->resources : nullptr; e != nullptr; e = e->next) {
    if (e->dev != nullptr && e->dev->host_name.c_str() != nullptr && !dev_on_this_host(e->dev)) {
      return true;
    }
  }
  return false;
}

template <class A, class B>
struct PairHash {
  size_t operator()(const std::pair<A, B>& p) const {
    size_t h = std::hash<A>()(p.first);
    return h ^ (std::hash<B>()(p.second) + 0x9e3779b97f4a7c15ULL + (h << 6) + (h >> 2));
  }
};

// What one pick needs to know of the running-task list, gathered once per
// pick rather than once per job: the list mirrors the whole task file and
// may hold many thousand entries, while the picture does not change during
// the pick.
struct PickView {
  // (job, resource of this host) pairs that this host is already working on.
  std::unordered_set<std::pair<const Job*, const Dev*>, PairHash<const Job*, const Dev*>> worked_on;
  // Free process slots of this host's resources, asked once each.
  std::unordered_map<Dev*, int> slots;

  // This host's resources (usually one): every resource a record or a job
  // names comes from the control block's list, so a pointer test will do
  // where a name compare per entry would cost a string compare each.
  std::vector<const Dev*> here;

  bool is_here(const Dev* dev) const {
    return dev != nullptr && std::find(here.begin(), here.end(), dev) != here.end();
  }

  // Tasks started or running on each of this host's resources, counted in
  // the same walk: what Dev_processes_available would count, one walk of the
  // list for all of them.
  std::vector<int> active;

  PickView() {
    for (Dev* d = rndctl.devs; d != nullptr; d = d->next) {
      if (dev_on_this_host(d)) here.push_back(d);
    }
    active.assign(here.size(), 0);
    for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
      const TaskRec* rec = e->rec;
      if (rec == nullptr || rec->dev == nullptr) continue;
      auto at = std::find(here.begin(), here.end(), rec->dev);
      if (at == here.end()) continue;
      int s = rec->status;
      if (is_active(s)) ++active[static_cast<size_t>(at - here.begin())];
      if (e->job != nullptr && (s == TASK_STARTED || s == TASK_RUNNING || s == TASK_FAILED)) {
        worked_on.insert({e->job, rec->dev});
      }
    }
  }

  int free_slots(Dev* dev) {
    auto it = slots.find(dev);
    if (it != slots.end()) return it->second;
    int n;
    auto at = std::find(here.begin(), here.end(), dev);
    if (at == here.end() || debug) {
      // The trace lists every entry it looks at; only the long way has it.
      n = Dev_processes_available(dev);
    } else {
      if (dev->num_processors < 1) dev->num_processors = 1;
      n = std::max(0, dev->num_processors - active[static_cast<size_t>(at - here.begin())]);
    }
    slots.emplace(dev, n);
    return n;
  }
};

PickView* current_view = nullptr;  // non-owning; set during extract_pending_task

bool already_worked_on(const Job* job, const Dev* dev) {
  if (current_view != nullptr) return current_view->worked_on.count({job, dev}) != 0;
  for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
    if (e->job != job || e->rec == nullptr || e->rec->dev != dev) continue;
    int s = e->rec->status;
    if (s == TASK_STARTED || s == TASK_RUNNING || s == TASK_FAILED) return true;
  }
  return false;
}

int free_slots(Dev* dev) {
  return current_view != nullptr ? current_view->free_slots(dev) : Dev_processes_available(dev);
}

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
      if (e->rec != nullptr) by_job_[e->job].push_back(e);
    }
  }

  /// True when `job` has entries.
  bool has(const Job* job) const {
    auto it = by_job_.find(job);
    return it != by_job_.end() && !it->second.empty();
  }

  /// Forgets the entries of a job whose entries have all been freed.
  void drop(const Job* job) {
    auto it = by_job_.find(job);
    if (it != by_job_.end()) it->second.clear();
    entries_ = nullptr;
  }

  /// Files a new entry under its job, wherever the selection stands.
  void file(TASK* e) {
    if (e != nullptr && e->rec != nullptr) by_job_[e->job].push_back(e);
  }

  /// The first entry of `job` in list order whose record is `rec`'s (the
  /// answer of match_a_taskrec), once stale lives are gone: then the first
  /// entry of an id is the only one that can match.
  TASK* match(const Job* job, const TaskRec* rec) {
    select(job);
    TASK* e = find(rec->id);
    return e != nullptr && Task_same_rec(e->rec, rec) ? e : nullptr;
  }

  /// Narrows the search to one job's entries.
  void select(const Job* job) {
    entries_ = &by_job_[job];
    table_.clear();
    sorted_.clear();
    base_ = 0;
    if (entries_->empty()) return;
    int lo = INT_MAX, hi = INT_MIN;
    for (TASK* e : *entries_) {
      lo = std::min(lo, e->rec->id);
      hi = std::max(hi, e->rec->id);
    }
    int64_t span = static_cast<int64_t>(hi) - lo + 1;
    if (span <= 4 * static_cast<int64_t>(entries_->size()) + 64) {
      base_ = lo;
      table_.assign(static_cast<size_t>(span), nullptr);
      for (TASK* e : *entries_) {
        TASK*& slot = table_[static_cast<size_t>(e->rec->id - lo)];
        if (slot == nullptr) slot = e;
      }
    } else {
      // Ids scattered far apart: a damaged or hand-made file.
      sorted_ = *entries_;
      std::stable_sort(sorted_.begin(), sorted_.end(),
                       [](const TASK* a, const TASK* b) { return a->rec->id < b->rec->id; });
    }
    indexed_ = entries_->size();
  }

  TASK* find(int id) const {
    if (!table_.empty()) {
      int64_t at = static_cast<int64_t>(id) - base_;
      if (at >= 0 && at < static_cast<int64_t>(table_.size())) {
        TASK* e = table_[static_cast<size_t>(at)];
        if (e != nullptr) return e;
      }
    } else if (!sorted_.empty()) {
      auto it = std::lower_bound(sorted_.begin(), sorted_.end(), id,
                                 [](const TASK* e, int i) { return e->rec->id < i; });
      if (it != sorted_.end() && (*it)->rec->id == id) return *it;
    }
    for (size_t i = indexed_; i < entries_->size(); ++i) {
      if ((*entries_)[i]->rec->id == id) return (*entries_)[i];
    }
    return nullptr;
  }

  /// A new entry of the selected job.
  void add(TASK* e) { entries_->push_back(e); }

  /// The entries of the selected job (new ones included).
  const std::vector<TASK*>& selected() const { return *entries_; }

  /// Every job that has entries (the null job of entries whose job left
  /// the file included).
  template <class F>
  void for_each_job(F f) const {
    for (const auto& [job, entries] : by_job_) {
      if (!entries.empty()) f(job);
    }
  }

 private:
  std::unordered_map<const Job*, std::vector<TASK*>> by_job_;
  std::vector<TASK*>* entries_ = nullptr;
  size_t indexed_ = 0;
  int base_ = 0;
  std::vector<TASK*> table_;
  std::vector<TASK*> sorted_;
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

int Dev_processes_available(Dev* dev) {
  if (dev == nullptr) return 0;
  dbgpnt("Dev_processes_avail ----- start %s\n", dev->name.or_else("(null)"));
  if (dev->num_processors < 1) dev->num_processors = 1;
  int count = dev->num_processors;
  // Every task started or running on the resource takes a slot, whichever
  // job it belongs to: counting one per job would let several tasks of one
  // job flood a host beyond its processors.
  for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
    const TaskRec* rec = e->rec;
    if (rec == nullptr) continue;
    if (rec->dev == dev && is_active(rec->status)) {
      --count;
      dbgpnt("matched %d\n", rec->status);
    } else if (rec->dev != nullptr) {
      dbgpnt("no match %d\n", rec->status);
    } else {
      dbgpnt("no dev found\n");
    }
  }
  if (count < 0) count = 0;
  dbgpnt("Dev_processes_avail ----- end  (count = %d )\n", count);
  return count;
}

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

TASK* Task_get() {
  const char* host = rndctl.host.c_str();
  TaskAfterLock after;
  TASK* chosen = nullptr;
  bool opened = false;
  const int written = Task_file_rewrite([&](TaskGroup** list) {
    opened = true;
    TaskGroup*& groups = *list;
    // Every entry that finds its record in the file loses the mark again;
    // those that keep it have left the file.  One index of the entries
    // serves the whole cycle.
    // Entries marked as of another life go first, as Task_retire_marked
    // would drop them, found in the same walk of the list.
    std::vector<TASK*> marked;
    EntryIndex index(true, &marked);
    for (TASK* e : marked) {
      dbgpnt("freeing Task %x\n", px(e));
      Task_let_go(e, &after);
      TASK_free(e);
    }
    retire_other_lives(groups, &after, index);

    insert_unknown_pending_jobs(&groups);

    if (TaskRec* rec = extract_pending_task(&groups)) {
      chosen = index.match(rec->group->job, rec);
      // The record is PENDING in the file: an entry here that still held it
      // lost it, and its render stops before the piece is taken again.
      if (chosen != nullptr && chosen->rec != rec) Task_settle(chosen, rec, &after);
      const int ids_before = rec->group->next_task_id;
      split_a_task(rec->group, rec);
      if (rec->group->next_task_id != ids_before) after.wake(rec->group->job);
      if (chosen == nullptr) {
        TaskRec** link = &rec->group->tasks;
        while (*link != nullptr && *link != rec) link = &(*link)->next;
        if (*link == rec) rec = TaskRec_unpool(link);
        chosen = Task_add(rec->group->job, rec);
        index.file(chosen);
      } else if (chosen->rec != rec) {
        TaskRec* own = chosen->rec;
        own->start = rec->start;
        own->end = rec->end;
        own->retries = rec->retries;
        own->current = rec->current;
        own->dev = rec->dev;
      }
      rec->status = TASK_STARTED;
      if (chosen != nullptr) {
        chosen->rec->status = TASK_STARTED;
        chosen->stale = 0;
        chosen->taken = 1;
      }
    }

    // Bring the mirror in line with the file, group by group.
    for (TaskGroup* g = groups; g != nullptr; g = g->next) {
      Job* job = g->job;
      int uses_host = isa_job_using_host(host, job);
      index.select(job);
      for (TaskRec** link = &g->tasks; *link != nullptr; link = &(*link)->next) {
        TaskRec* rec = *link;
        TASK* e = index.find(rec->id);
        if (e != nullptr && !Task_same_rec(e->rec, rec)) e = nullptr;
        if (e == nullptr) {
          rec = TaskRec_unpool(link);
          e = Task_add(job, rec);  // the entry owns the record from now on
          if (e != nullptr) index.add(e);
        } else if (e->rec != rec && uses_host) {
          TaskRec* own = e->rec;
          own->start = rec->start;
          own->end = rec->end;
          own->retries = rec->retries;
          own->current = rec->current;
          if (rec->dev != nullptr) own->dev = rec->dev;
          // This host knows best what its own tasks are doing, while they are
          // its own; for the others the file is the news.
          if (Task_settle(e, rec, &after) != 0) {
            dbgpnt("Task_get: use old status %d\n", own->status);
          } else {
            own->status = rec->status;
          }
        }
        if (e != nullptr && !e->taken && rj_dev_is_this_host(rec->dev) &&
            held_status(rec->status)) {
          // Names this host as its renderer, but no daemon here took it: an
          // earlier daemon of this host did and ended.  Nobody renders it.
          rec->status = TASK_PENDING;
          if (e->rec != nullptr) e->rec->status = TASK_PENDING;
          after.wake(job);
        }
        if (e != nullptr && e->rec != rec) {
          if (uses_host) dbgpnt("extra task_rec %x, setting dead state\n", px(rec));
          rec->keep = 1;
        }
        if (e != nullptr) e->stale = 0;
      }
      for (TASK* e : index.selected()) e->seen_next_id = std::max(e->seen_next_id, g->next_task_id);
    }

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
  Check_RndTasks("Task_get 3");
  return chosen;
}

void insert_unknown_pending_jobs(TaskGroup** groups) {
  if (groups == nullptr) return;
  std::unordered_set<const Job*> grouped;
  for (TaskGroup* g = *groups; g != nullptr; g = g->next) grouped.insert(g->job);
  for (Job* job = rndctl.jobs; job != nullptr; job = job->next) {
    if (grouped.count(job) != 0 || !job->status.is("pending") || job->resources == nullptr) {
      continue;
    }
    dbgpnt("Insert a task for %s\n", job->name.or_else("(null)"));
    if (insert_task(groups, job, job->frames[0], job->frames[1], TASK_PENDING) != nullptr) {
      grouped.insert(job);
    }
  }
}

TaskRec* insert_task(TaskGroup** groups, Job* job, float start, float end, int status) {
  if (groups == nullptr) return nullptr;
  TaskGroup* group = TaskGroup_by_job(*groups, job);
  if (group == nullptr) {
    group = TaskGroup_alloc(job, 0);
    if (group == nullptr) return nullptr;
    group->next = *groups;
    *groups = group;
  }
  TaskRec* rec =
      TaskRec_alloc(group, start, end, start, nullptr, status, nullptr, group->next_task_id);
  if (rec != nullptr) ++group->next_task_id;
  return rec;
}

TaskRec* extract_pending_task(TaskGroup** groups) {
  if (groups == nullptr) return nullptr;
  PickView view;
  // With every process slot of this host taken, no group can win, and
  // trying them one after the other costs a walk of the list per group.
  bool any_slot = false;
  for (Dev* dev = rndctl.devs; dev != nullptr && !any_slot; dev = dev->next) {
    any_slot = dev_on_this_host(dev) && view.free_slots(dev) > 0;
  }
  if (!any_slot) {
    dbgpnt("No task to extract - no dev found\n");
    return nullptr;
  }
  current_view = &view;
  TaskRec* found = nullptr;
  for (int mode = 0; mode <= 2 && found == nullptr; ++mode) {
    TaskGroup* from = *groups;
    while (found == nullptr) {
      TaskGroup* g = get_highest_taskgroup(from, mode);
      if (g == nullptr) break;
      from = g->next;
      TaskRec* rec = check_for_pending_tasks(g);
      if (rec == nullptr) {
        dbgpnt("No task to extract\n");
        continue;
      }
      for (RndDevList* e = g->job->resources; e != nullptr; e = e->next) {
        if (dev_on_this_host(e->dev) && free_slots(e->dev) > 0) {
          rec->dev = e->dev;
          found = rec;
          dbgpnt("Extracting task\n");
          break;
        }
      }
      if (found == nullptr) dbgpnt("No task to extract - no dev found\n");
    }
  }
  current_view = nullptr;
  return found;
}

TaskGroup* get_highest_taskgroup(TaskGroup* groups, int mode) {
  const char* host = rndctl.host.c_str();
  bool immediate = rndctl.running > 0;
  dbgpnt(" get_highest_taskgroup ---- start\n");
  if (groups == nullptr) dbgpnt("There are no more jobs\n");
  if (immediate) {
    dbgpnt("Looking for immedate job tasks\n");
  } else if (mode == 0) {
    dbgpnt("Looking for highest job tasks\n");
  } else {
    dbgpnt("Looking for next job tasks\n");
  }

  TaskGroup* chosen = nullptr;
  for (TaskGroup* g = groups; g != nullptr; g = g->next) {
    Job* job = g->job;
    // Only a job that may be worked on now (2) is taken: a paused one (1)
    // keeps what it has but starts nothing new, as its owner asked.  It is
    // asked once per job: the answer could only change if the clock crossed
    // a half-hour mark during the walk.
    if (job == nullptr || job->resources == nullptr || Job_available(job) != 2) continue;
    for (RndDevList* e = job->resources; e != nullptr; e = e->next) {
      if (!dev_on_host(e->dev, host)) continue;
      if (mode != 2 && already_worked_on(job, e->dev)) {
        dbgpnt("already working on \"%s\"\n", job->name.or_else("(null)"));
        continue;
      }
      if (immediate) {
        // A process already runs here: only jobs that must not wait get in.
        if (job->priority != 0) continue;
        if (check_for_pending_tasks(g) != nullptr) {
          chosen = g;
          dbgpnt("found immediate task - \"%s\"\n", job->name.or_else("(null)"));
          break;
        }
        dbgpnt("no pending tasks for \"%s\"\n", job->name.or_else("(null)"));
      } else if (chosen == nullptr || job->priority < chosen->job->priority) {
        if (check_for_pending_tasks(g) != nullptr) {
          chosen = g;
          dbgpnt("found task - \"%s\"\n", job->name.or_else("(null)"));
        } else {
          dbgpnt("no pending tasks for \"%s\"\n", job->name.or_else("(null)"));
        }
      }
    }
    if (chosen != nullptr && (mode != 0 || immediate)) return chosen;
  }
  return chosen;
}

TaskRec* check_for_pending_tasks(TaskGroup* group) {
  if (group == nullptr) return nullptr;
  int other_host = -1;  // asked only when needed
  for (TaskRec* rec = group->tasks; rec != nullptr; rec = rec->next) {
    if (rec->status != TASK_PENDING) continue;
    if (rec->retries != 0 && dev_on_this_host(rec->dev)) {
      // It failed here: leave it to another host if the job has one.  A job
      // that only this host may render retries here, or it would never end.
      if (other_host < 0) other_host = job_names_other_host(group->job) ? 1 : 0;
      if (other_host) continue;
    }
    return rec;
  }
  return nullptr;
}

int isa_job_using_host(const char* host, Job* job) {
  if (job == nullptr) return 0;
  for (RndDevList* e = job->resources; e != nullptr; e = e->next) {
    if (dev_on_host(e->dev, host)) return 1;
  }
  return 0;
}

TASK* match_a_taskrec(TaskRec* rec) {
  if (rec == nullptr || rec->group == nullptr) return nullptr;
  const Job* job = rec->group->job;
  for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
    if (e->job == job && Task_same_rec(e->rec, rec)) return e;
  }
  return nullptr;
}

void split_a_task(TaskGroup* group, TaskRec* rec) {
  if (group == nullptr || rec == nullptr || rec->dev == nullptr || group->job == nullptr ||
      !group->job->animate) {
    return;
  }
  Job* job = group->job;
  float by = job->frames[2];
  float span = (rec->end - rec->start) / by;
  // A zero or negative step, or a range no int can count, cannot be cut.
  int steps = std::isfinite(span) && span > -2147483648.0f && span < 2147483648.0f
                  ? static_cast<int>(span)
                  : 0;
  dbgpnt(" split frames_to_do = %d\n", steps);
  dbgpnt(" (frame1 - frame0) / job_frame_by = ( %f - %f ) / %f\n", rec->start, rec->end, by);
  if (rec->dev->max_frames < 1) rec->dev->max_frames = 1;
  int n = rec->dev->max_frames;
  if (n > steps) return;

  float old_end = rec->end;
  float new_start = rec->start + static_cast<float>(n) * by;
  dbgpnt(" doing task split: old_end = %f, new_start = %f, new_end = %f\n", old_end, new_start,
         old_end);
  TaskRec* rest = TaskRec_alloc(group, new_start, old_end, new_start, nullptr, TASK_PENDING,
                                nullptr, group->next_task_id);
  if (rest == nullptr) return;
  ++group->next_task_id;
  // The remainder gets its own entry when the mirror is brought in line; it
  // is not linked to the entry of the piece, which may go away first.
  rest->task = nullptr;
  rest->dev = nullptr;
  rec->end = new_start - by;
  dbgpnt(" back from doing split\n");
  dbgpnt("\nsplit_a_task -------------------------------\n");
  dbgpnt("0x%x %d\t(%3.3f, %3.3f, %d)\n", px(rec), rec->id, rec->start, rec->end, rec->status);
  dbgpnt("0x%x  %d\t(%3.3f, %3.3f, %d)\n", px(rest), rest->id, rest->start, rest->end,
         rest->status);
  dbgpnt("--------------------------------------------\n");
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
