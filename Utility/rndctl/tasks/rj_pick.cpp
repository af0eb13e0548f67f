// Picking the next piece for this host and cutting it to the host's size:
// the half of a selection cycle that decides.  See rj_pick.h.
#include "Utility/rndctl/tasks/rj_pick.h"

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <functional>
#include <unordered_map>
#include <unordered_set>
#include <utility>
#include <vector>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/records/rj_dev.h"
#include "Utility/rndctl/records/rj_job.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"
#include "Utility/rndctl/tasks/rj_tskio.h"

namespace {

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

namespace {

bool any_free_slot(PickView& view) {
  for (Dev* dev = rndctl.devs; dev != nullptr; dev = dev->next) {
    if (dev_on_this_host(dev) && view.free_slots(dev) > 0) return true;
  }
  return false;
}

}  // namespace

bool Task_host_has_free_slot() {
  PickView view;
  return any_free_slot(view);
}

TaskRec* extract_pending_task(TaskGroup** groups) {
  if (groups == nullptr) return nullptr;
  PickView view;
  // With every process slot of this host taken, no group can win, and
  // trying them one after the other costs a walk of the list per group.
  if (!any_free_slot(view)) {
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
