// The running-task list: one entry per task record of Render_Tasks that this
// process knows about, linking the record to the render process (if any)
// that works on it here.
#include <cstdint>
#include <cstdio>

#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/rndctl.h"

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

}  // namespace

TASK* Task_add(Job* job, TaskRec* rec) {
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
