// The Render_Tasks file: reading it, writing it, and the one locked
// read-modify-write every writer goes through.  See rj_taskfile.h.
//
// Render_Tasks is shared by every daemon and editor and is rewritten whole on
// each pick, so it is read and written in one piece: the whole file is read
// into memory and scanned there, and each group is formatted into a buffer
// and written with one call.  The text is the same as field-by-field stdio
// would give ("%d", "%f" of a float), only cheaper for files of many
// thousand records.
#include "Utility/rndctl/tasks/rj_taskfile.h"

#include <sys/stat.h>

#include <cstdint>
#include <cstdio>
#include <cstring>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_fileio.h"
#include "Utility/rndctl/ctldir/rj_paths.h"
#include "Utility/rndctl/ctlfile/rj_ctlfile.h"
#include "Utility/rndctl/records/rj_dev.h"
#include "Utility/rndctl/records/rj_job.h"
#include "Utility/rndctl/records/rj_recindex.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/tasks/rj_task.h"
#include "Utility/rndctl/tasks/rj_taskgroup.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"
#include "Utility/rndctl/tasks/rj_tasktext.h"

namespace {

using rj_tasktext::kFloatRoom;
using rj_tasktext::put_fixed6;
using rj_tasktext::put_int;
using rj_tasktext::put_literal;
using rj_tasktext::TextOut;
using rj_tasktext::TokenSource;

// ---------------------------------------------------------------------------
// Reading groups.

enum class GroupRead { kGroup, kSkipped, kEnd };

// Reads one group.  kGroup: *out is the new group (it may have fewer records
// than its line claimed when the file stops early).  kSkipped: the group's job
// is gone; its records were read and dropped.  kEnd: nothing more can be
// read; *out may still hold a group that was read before the end was found.
GroupRead read_group(TokenSource& in, TaskGroup** out, bool* more) {
  *out = nullptr;
  *more = false;
  int c = in.peek();
  if (c == EOF) return GroupRead::kEnd;
  const char* name = in.next();
  // The name is kept for the trace only; the numbers after it may overwrite
  // the text it points into.
  char name_copy[1024];
  if (debug) snprintf(name_copy, sizeof name_copy, "%s", name);
  int index = 0, numrecs = 0, next_id = 0;
  if (!in.next_int(&index) || !in.next_int(&numrecs) || !in.next_int(&next_id)) {
    return GroupRead::kEnd;
  }
  if (debug)
    dbgpnt("%d   name(%s) id(%d) numrecs(%d) next_task_id(%d)\n", 4, name_copy, index, numrecs,
           next_id);

  Job* job = Job_by_index(index);
  TaskGroup* group = nullptr;
  if (job != nullptr) {
    group = TaskGroup_alloc(job, next_id);
    if (group == nullptr) return GroupRead::kEnd;
  }
  // Records are linked here at the tail as they come, rather than by
  // TaskRec_alloc, which looks for the tail from the head each time.
  TaskRec** tail = group != nullptr ? &group->tasks : nullptr;

  for (int i = 0; i < numrecs; ++i) {
    // A record begins with its id.  Anything else means the group line
    // claimed more records than there are: the next group starts here.
    c = in.peek();
    if (c == EOF) {
      *out = group;
      return GroupRead::kEnd;
    }
    if (!(c == '-' || c == '+' || (c >= '0' && c <= '9'))) break;
    int id = 0, dev_index = 0, retries = 0;
    float start = 0, end = 0, current = 0;
    const char* status = nullptr;
    if (!in.next_int(&id) || !in.next_float(&start) || !in.next_float(&end) ||
        !in.next_float(&current) || !in.next_int(&dev_index) || !in.next_int(&retries) ||
        (status = in.next()) == nullptr) {
      *out = group;
      return GroupRead::kEnd;
    }
    if (group == nullptr) continue;
    TaskRec* rec = TaskRec_pooled();
    if (rec != nullptr) {
      rec->start = start;
      rec->end = end;
      rec->current = current;
      rec->dev = Dev_by_index(dev_index);
      rec->id = id;
      ISA_task_status(status, &rec->status);
    }
    if (rec == nullptr) {
      *out = group;
      return GroupRead::kEnd;
    }
    rec->group = group;
    rec->retries = retries;
    *tail = rec;
    tail = &rec->next;
  }
  *out = group;
  *more = true;
  return group != nullptr ? GroupRead::kGroup : GroupRead::kSkipped;
}

TaskGroup* read_all(TokenSource& in) {
  dbgpnt("Task_read--------------------------------------\n");
  TaskGroup* list = nullptr;
  for (;;) {
    TaskGroup* group = nullptr;
    bool more = false;
    GroupRead r = read_group(in, &group, &more);
    // Each group goes on the front: every read-and-rewrite cycle reverses the
    // order of the groups in the file, and the readers of the file live with
    // that.
    if (group != nullptr) {
      group->next = list;
      list = group;
    }
    if (r == GroupRead::kEnd) break;
  }
  dbgpnt("Task_read---------------------------------done\n\n");
  return list;
}

// ---------------------------------------------------------------------------
// Writing groups.

void format_group(TextOut& out, const TaskGroup* group, int numrecs) {
  put_literal(out, "\n", 1);
  // The group is found again by the job index; the name is a label, and one
  // with a blank in it would shift every field after it.
  const char* name = group->job->name.or_else("(null)");
  if (RJC_label_needs_form(name))
    out.put(RJC_label_form(name).c_str());
  else
    out.put(name);
  char* p = out.room(48);
  *p++ = '\t';
  *p++ = ' ';
  p = put_int(p, group->job->index);
  *p++ = '\t';
  *p++ = ' ';
  p = put_int(p, numrecs);
  *p++ = '\t';
  *p++ = ' ';
  p = put_int(p, group->next_task_id);
  *p++ = '\n';
  out.commit(p);
}

void format_record(TextOut& out, const TaskRec* rec) {
  // The whole line in one piece: three numbers, four integers of at most 11
  // characters, blanks and a status name of at most 8.
  char* p = out.room(3 * kFloatRoom + 64);
  *p++ = '\t';
  p = put_int(p, rec->id);
  *p++ = '\t';
  *p++ = ' ';
  p = put_fixed6(p, rec->start);
  *p++ = '\t';
  *p++ = ' ';
  p = put_fixed6(p, rec->end);
  *p++ = '\t';
  *p++ = ' ';
  p = put_fixed6(p, rec->current);
  *p++ = ' ';
  *p++ = ' ';
  p = put_int(p, rec->dev != nullptr ? rec->dev->index : 0);
  *p++ = '\t';
  *p++ = ' ';
  p = put_int(p, rec->retries);
  *p++ = '\t';
  const char* name = GetTaskStatusStr(rec->status);
  size_t n = strlen(name);
  memcpy(p, name, n);  // status names are at most 8 characters
  p += n;
  *p++ = '\n';
  out.commit(p);
}

}  // namespace

// ---------------------------------------------------------------------------
// Reading and writing the task file.

TaskGroup* TaskGroup_read(FILE* fp) {
  if (fp == nullptr) return nullptr;
  TokenSource in(fp);
  TaskGroup* group = nullptr;
  bool more = false;
  read_group(in, &group, &more);
  return group;
}

TaskGroup* Task_read(FILE* fp) {
  if (fp == nullptr) return nullptr;
  // The buffer is kept from one read to the next: a fresh one of some
  // megabytes per cycle is fresh pages for the kernel to map every time,
  // and giving it back makes the allocator sweep every small block freed
  // since.  Nothing read keeps a pointer into it.
  static TextOut text;
  text.clear();
  struct stat st;
  if (fstat(fileno(fp), &st) == 0 && S_ISREG(st.st_mode) && st.st_size > 0)
    text.reserve(static_cast<size_t>(st.st_size) + 65536 + 1);
  // Straight into the buffer, which grows only if the file holds more than
  // it said.
  for (;;) {
    char* p = text.room(65536);
    size_t n = fread(p, 1, 65536, fp);
    if (n == 0) break;
    text.commit(p + n);
  }
  char* end = text.room(1);
  *end = '\0';
  TokenSource in(text.data(), text.size());
  return read_all(in);
}

namespace {

// Appends the group's text; false when the group is not written at all.
bool append_group(TextOut& out, const TaskGroup* group) {
  if (group == nullptr || group->tasks == nullptr || group->job == nullptr) return false;
  int numrecs = 0;
  for (TaskRec* rec = group->tasks; rec != nullptr; rec = rec->next) ++numrecs;
  format_group(out, group, numrecs);
  for (TaskRec* rec = group->tasks; rec != nullptr; rec = rec->next) {
    format_record(out, rec);
    if (debug) {
      dbgpnt("\t%d\t %.1f\t %.1f\t%.1f %d\t %d\t%s\n", rec->id, rec->start, rec->end, rec->current,
             rec->dev != nullptr ? rec->dev->index : 0, rec->retries,
             GetTaskStatusStr(rec->status));
    }
  }
  return true;
}

bool write_text(FILE* fp, const TextOut& text) {
  if (fwrite(text.data(), 1, text.size(), fp) == text.size()) return true;
  perror("in TaskGroup_write");
  return false;
}

}  // namespace

int TaskGroup_write(FILE* fp, TaskGroup* group) {
  if (fp == nullptr) return 0;
  TextOut out;
  if (!append_group(out, group)) return 0;
  return write_text(fp, out) ? 1 : -1;
}

int Task_write(FILE* fp, TaskGroup* groups) {
  dbgpnt("Task_write--------------------------------------\n");
  if (fp == nullptr) return -1;
  // The whole file in one write: the stream is line-buffered, and a write
  // per group costs a system call each on a file of thousands of groups.
  // Kept from one write to the next, for the reasons the reader keeps its
  // buffer.
  static TextOut out;
  out.clear();
  // A record's line is some fifty characters; reserving for all of them at
  // once saves copying the text as it grows.
  size_t records = 0;
  for (TaskGroup* g = groups; g != nullptr; g = g->next)
    for (TaskRec* rec = g->tasks; rec != nullptr; rec = rec->next) ++records;
  out.reserve(records * 64 + 4096);
  for (TaskGroup* g = groups; g != nullptr; g = g->next) append_group(out, g);
  if (!write_text(fp, out)) return -1;
  dbgpnt("Task_write---------------------------------done\n\n");
  return 0;
}

int TaskGroup_write_dump(TaskGroup* group) {
  if (group == nullptr || group->tasks == nullptr || group->job == nullptr) return 0;
  int numrecs = 0;
  for (TaskRec* rec = group->tasks; rec != nullptr; rec = rec->next) ++numrecs;
  if (printf("\n%s   %d  %d  %d\n", group->job->name.or_else("(null)"), group->job->index, numrecs,
             group->next_task_id) < 0) {
    perror("in TaskGroup_write_dump");
    return -1;
  }
  for (TaskRec* rec = group->tasks; rec != nullptr; rec = rec->next) {
    if (printf("\t%d   %f  %f  %f  %d  %d %s\n", rec->id, rec->start, rec->end, rec->current,
               rec->dev != nullptr ? rec->dev->index : 0, rec->retries,
               GetTaskStatusStr(rec->status)) < 0) {
      perror("in TaskGroup_write_dump");
      return -1;
    }
  }
  return 1;
}

int Task_write_dump(TaskGroup* groups) {
  for (TaskGroup* g = groups; g != nullptr; g = g->next) {
    if (TaskGroup_write_dump(g) < 0) return -1;
  }
  fflush(stdout);
  return 0;
}

void Task_file_dump() {
  FileopLock lock(FILE_TASKS);
  FILE* fp = read_fileop(FILE_TASKS);
  if (fp != nullptr) {
    TaskGroup* groups = Task_read(fp);
    Task_write_dump(groups);
    (void)close_fileop(FILE_TASKS);  // read only: nothing to lose
    TaskGroup_free_all(&groups);
  }
}

int Task_file_search(const char* host) {
  int found = 0;
  FileopLock lock(FILE_TASKS);
  FILE* fp = read_fileop(FILE_TASKS);
  if (fp != nullptr) {
    TaskGroup* groups = Task_read(fp);
    found = Task_find(groups, host);
    (void)close_fileop(FILE_TASKS);  // read only: nothing to lose
    TaskGroup_free_all(&groups);
  }
  return found;
}

TaskGroup* Task_file_peek() {
  FILE* fp = fopen(rj_control_path(FILE_TASKS).c_str(), "re");
  if (fp == nullptr) return nullptr;
  TaskGroup* groups = Task_read(fp);
  fclose(fp);  // read only: nothing to lose
  return groups;
}

int Task_file_rewrite(const std::function<bool(TaskGroup** groups)>& change) {
  TaskGroup* groups = nullptr;
  int result = 0;
  {
    // The lock covers the read, the change and the write; freeing the
    // groups waits until it is released.
    FileopLock lock(FILE_TASKS);
    FILE* fp = update_fileop(FILE_TASKS);
    if (fp == nullptr) return -1;
    groups = Task_read(fp);
    if (change(&groups)) {
      rewind_fileop(FILE_TASKS);
      bool written = Task_write(fp, groups) >= 0;
      result = close_and_truncate_fileop(FILE_TASKS) == 0 && written ? 1 : -1;
    } else {
      // Nothing changed: a rewrite would only turn the groups round.
      (void)close_fileop(FILE_TASKS);  // read only: nothing to lose
    }
  }
  TaskGroup_free_all(&groups);
  return result;
}

void Editor_load_Tasks() {
  while (rndctl.tasks != nullptr) TASK_free(rndctl.tasks);
  TaskGroup* groups = nullptr;
  {
    FileopLock lock(FILE_TASKS);
    FILE* fp = read_fileop(FILE_TASKS);
    if (fp == nullptr) return;
    groups = Task_read(fp);
    for (TaskGroup* g = groups; g != nullptr; g = g->next) {
      for (TaskRec** link = &g->tasks; *link != nullptr; link = &(*link)->next)
        Task_add(g->job, TaskRec_unpool(link));
    }
    (void)close_fileop(FILE_TASKS);  // read only: nothing to lose
  }
  TaskGroup_free_all(&groups);
}
