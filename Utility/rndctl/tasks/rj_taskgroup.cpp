// Task groups and task records in memory: allocation, the blocks the
// records of a read share, release, and lookups.  See rj_taskgroup.h.
#include "Utility/rndctl/tasks/rj_taskgroup.h"

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <new>
#include <vector>

#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"

namespace {

constexpr const char* kUnit = "Utility/rndctl/rj_tskio";
constexpr int kStatusCount = 8;

// Debug lines print record addresses with "%x", as the log readers expect.
unsigned px(const void* p) { return static_cast<unsigned>(reinterpret_cast<uintptr_t>(p)); }

// ---------------------------------------------------------------------------
// The records of a read come from blocks of many, in file order: a file of
// a hundred thousand records would otherwise cost as many heap blocks taken
// and given back per cycle, and lie scattered over the heap for every later
// walk.  A record keeps its meaning (TaskRec_free releases it like any
// other); a block goes back to the heap once every record in it has been
// freed.  The selection cycle gives the records its entries keep a heap
// block of their own (TaskRec_unpool), so that a block is not kept for one
// survivor.
struct RecBlock {
  static constexpr size_t kRecords = 1024;
  alignas(TaskRec) unsigned char space[kRecords * sizeof(TaskRec)];
  size_t used = 0;  // records made so far
  size_t live = 0;  // made and not yet freed

  TaskRec* at(size_t i) { return reinterpret_cast<TaskRec*>(space) + i; }
  bool holds(const TaskRec* rec) const {
    auto p = reinterpret_cast<uintptr_t>(rec);
    auto b = reinterpret_cast<uintptr_t>(space);
    return p >= b && p < b + sizeof space;
  }
};

// Every block with records in it, by address; the last one made is filled
// first.
std::vector<RecBlock*> rec_blocks;
RecBlock* rec_current = nullptr;

RecBlock* block_of(const TaskRec* rec) {
  auto it = std::upper_bound(
      rec_blocks.begin(), rec_blocks.end(), rec, [](const TaskRec* r, const RecBlock* b) {
        return reinterpret_cast<uintptr_t>(r) < reinterpret_cast<uintptr_t>(b);
      });
  if (it == rec_blocks.begin()) return nullptr;
  RecBlock* b = *(it - 1);
  return b->holds(rec) ? b : nullptr;
}

// Ends a record of a block; false when the record is a heap block of its own.
bool release_pooled(TaskRec* rec) {
  RecBlock* b = block_of(rec);
  if (b == nullptr) return false;
  rec->~TaskRec();
  if (--b->live > 0) return true;
  if (b == rec_current) {
    b->used = 0;  // empty again: the next read fills it from the start
    return true;
  }
  rec_blocks.erase(std::lower_bound(rec_blocks.begin(), rec_blocks.end(), b));
  b->~RecBlock();
  MA_free(b, __LINE__, kUnit);
  return true;
}

}  // namespace

// ---------------------------------------------------------------------------
// Status names.

const char* const task_status_table[] = {"PENDING", "CRASHED", "RUNNING", "FINISHED", "ABORTED",
                                         "FAILED",  "STARTED", "STOPPED", nullptr};

const char* GetTaskStatusStr(int code) {
  // A code out of the table can only come from a damaged status file; it
  // reads as PENDING, as an unknown name does.
  if (code < 0 || code >= kStatusCount) return task_status_table[TASK_PENDING];
  return task_status_table[code];
}

int ISA_task_status(const char* text, int* code) {
  if (text == nullptr || code == nullptr) return 0;
  for (int i = 0; task_status_table[i] != nullptr; ++i) {
    // The first letters tell most names apart without a call.
    if (text[0] == task_status_table[i][0] && strcmp(text, task_status_table[i]) == 0) {
      *code = i;
      return 1;
    }
  }
  return 0;
}

// ---------------------------------------------------------------------------
// Groups and records.

TaskGroup* TaskGroup_alloc(Job* job, int next_task_id) {
  TaskGroup* group = MA_new<TaskGroup>(__LINE__, kUnit);
  if (group == nullptr) return nullptr;
  group->job = job;
  group->next_task_id = next_task_id;
  dbgpnt("TaskGroup_alloc 0x%x for \"%s\"\n", px(group),
         job != nullptr ? job->name.or_else("null") : "null");
  return group;
}

TaskRec* TaskRec_alloc(TaskGroup* group, float start, float end, float current, Dev* dev,
                       int status, const char* status_text, int id) {
  TaskRec* rec = MA_new<TaskRec>(__LINE__, kUnit);
  if (rec == nullptr) return nullptr;
  rec->group = group;
  rec->start = start;
  rec->end = end;
  rec->current = current;
  rec->dev = dev;
  rec->status = status;
  rec->id = id;
  if (status_text != nullptr) ISA_task_status(status_text, &rec->status);
  if (group != nullptr) {
    TaskRec** tail = &group->tasks;
    while (*tail != nullptr) tail = &(*tail)->next;
    *tail = rec;
  }
  return rec;
}

void TaskRec_free(TaskRec* rec) {
  if (rec == nullptr) return;
  if (rec->group != nullptr) {
    for (TaskRec** p = &rec->group->tasks; *p != nullptr; p = &(*p)->next) {
      if (*p == rec) {
        *p = rec->next;
        break;
      }
    }
  }
  // Only the entry that owns the record points back at it; an entry that
  // has since taken another record keeps that one.
  if (rec->task != nullptr && rec->task->rec == rec) rec->task->rec = nullptr;
  dbgpnt("TaskRec_free 0x%x\n", px(rec));
  rec->id = -1;
  rec->status = TASK_PENDING;
  if (release_pooled(rec)) return;
  MA_delete(rec, __LINE__, kUnit);
}

TaskRec* TaskRec_unpool(TaskRec** link) {
  if (link == nullptr || *link == nullptr) return nullptr;
  TaskRec* rec = *link;
  if (block_of(rec) == nullptr) return rec;
  TaskRec* copy = MA_new<TaskRec>(__LINE__, kUnit, *rec);
  if (copy == nullptr) return rec;  // stays where it is, and keeps its block
  // Nothing else points at a record just read but its group's list (and an
  // entry that owns it, if any).
  if (rec->task != nullptr && rec->task->rec == rec) rec->task->rec = copy;
  *link = copy;
  rec->task = nullptr;
  rec->group = nullptr;
  rec->next = nullptr;
  rec->id = -1;
  rec->status = TASK_PENDING;
  release_pooled(rec);
  return copy;
}

void TaskRec_freeOnly(TaskRec* rec) {
  if (rec == nullptr) return;
  if (rec->keep == 2) {
    rec->keep = 0;
    return;
  }
  TaskRec_free(rec);
}

void TaskGroup_free(TaskGroup** list, TaskGroup* group) {
  if (group == nullptr) return;
  if (list != nullptr) {
    for (TaskGroup** p = list; *p != nullptr; p = &(*p)->next) {
      if (*p == group) {
        *p = group->next;
        break;
      }
    }
  }
  dbgpnt("TaskGroup_free 0x%x {\n", px(group));
  TaskRec* rec = group->tasks;
  while (rec != nullptr) {
    TaskRec* next = rec->next;
    if (rec->keep == 1) {
      rec->group = nullptr;  // the group's list is being taken apart anyway
      TaskRec_freeOnly(rec);
    } else {
      // Survives, owned by its running-task entry.
      rec->group = nullptr;
      rec->next = nullptr;
    }
    rec = next;
  }
  group->tasks = nullptr;
  dbgpnt("}\n");
  MA_delete(group, __LINE__, kUnit);
}

void TaskGroup_free_all(TaskGroup** list) {
  if (list == nullptr) return;
  // What TaskGroup_free would do after marking, in one walk of the records
  // instead of two: a file of a hundred thousand records is a cache miss a
  // record each time round.  A record that a running-task entry has taken
  // over stays with it unless marked 1, and one marked 2 only loses the mark
  // (a second call releases it); everything else read from the file goes.
  while (*list != nullptr) {
    TaskGroup* group = *list;
    *list = group->next;
    dbgpnt("TaskGroup_free 0x%x {\n", px(group));
    TaskRec* rec = group->tasks;
    while (rec != nullptr) {
      TaskRec* next = rec->next;
      bool owned = rec->task != nullptr && rec->task->rec == rec;
      rec->group = nullptr;  // the group's list is being taken apart anyway
      if (rec->keep == 2) {
        rec->keep = 0;
        rec->next = nullptr;
      } else if (rec->keep == 1 || !owned) {
        rec->keep = 1;
        TaskRec_freeOnly(rec);
      } else {
        rec->next = nullptr;  // survives, owned by its running-task entry
      }
      rec = next;
    }
    group->tasks = nullptr;
    dbgpnt("}\n");
    MA_delete(group, __LINE__, kUnit);
  }
}

int TaskGroup_find(TaskGroup* group, const char* host) {
  if (group == nullptr || group->job == nullptr || host == nullptr) return 0;
  for (TaskRec* rec = group->tasks; rec != nullptr; rec = rec->next) {
    if (rec->dev != nullptr && rec->dev->host_name.is(host)) return 1;
  }
  return 0;
}

int Task_find(TaskGroup* groups, const char* host) {
  for (TaskGroup* g = groups; g != nullptr; g = g->next) {
    if (TaskGroup_find(g, host)) return 1;
  }
  return 0;
}

TaskGroup* TaskGroup_by_job(TaskGroup* groups, Job* job) {
  for (TaskGroup* g = groups; g != nullptr; g = g->next) {
    if (g->job == job) return g;
  }
  return nullptr;
}

TaskRec* TaskRec_pooled() {
  if (rec_current == nullptr || rec_current->used == RecBlock::kRecords) {
    void* p = MA_malloc(sizeof(RecBlock), __LINE__, kUnit, 1);
    if (p == nullptr) return nullptr;
    RecBlock* b;
    try {
      rec_blocks.insert(
          std::upper_bound(rec_blocks.begin(), rec_blocks.end(), static_cast<RecBlock*>(p)),
          static_cast<RecBlock*>(p));
    } catch (const std::bad_alloc&) {
      MA_free(p, __LINE__, kUnit);
      return nullptr;
    }
    b = new (p) RecBlock;
    rec_current = b;
  }
  ++rec_current->live;
  return new (rec_current->at(rec_current->used++)) TaskRec;
}
