/// Task records: a job is cut into pieces (TaskRec) kept per job in a group
/// (TaskGroup) in the task file Render_Tasks; a piece this daemon renders
/// has a running-task entry (TASK) in rndctl.tasks that links it to its
/// render process.
#pragma once

#include <cstdio>

#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/records/rj_records.h"

// Task status codes: the index into task_status_table.
enum {
  TASK_PENDING = 0,
  TASK_CRASHED = 1,
  TASK_RUNNING = 2,
  TASK_FINISHED = 3,
  TASK_ABORTED = 4,
  TASK_FAILED = 5,
  TASK_STARTED = 6,
  TASK_STOPPED = 7
};

// ---------------------------------------------------------------------------
// Tasks (rj_tskio, rj_task).
struct TaskGroup {
  TaskGroup* next = nullptr;
  Job* job = nullptr;        // non-owning
  TaskRec* tasks = nullptr;  // records in creation order
  int next_task_id = 0;
};

struct TaskRec {
  TaskRec* next = nullptr;
  TaskGroup* group = nullptr;  // owning group, or null once the group is gone
  TASK* task = nullptr;        // running-task entry that owns it; non-owning
  float start = 0.0f;
  float end = 0.0f;
  float current = 0.0f;
  int status = TASK_PENDING;
  int retries = 0;
  int id = 0;
  int keep = 0;  // 1: the group's release frees it; 2: the next release only clears the mark
  Text output;
  Dev* dev = nullptr;  // non-owning
};

/// Running-task entry: links a task record to the process that renders it.
struct TASK {
  TASK* next = nullptr;
  TASK* prev = nullptr;
  TaskRec* rec = nullptr;       // owned once the entry has taken it over
  Job* job = nullptr;           // non-owning; null when the job left the file
  volatile int pid = 0;         // written by the SIGCHLD handler
  volatile int waitstatus = 0;  // exit value, written by the SIGCHLD handler
  FILE* stream = nullptr;       // owned: the task's log stream, open for reading
  Text out_path;
  Text stream_path;
  Text output;
  float progress = 0.0f;
  int work = 0;
  int stale = 0;
  // This daemon took the record (wrote it STARTED) to render it here.  Only
  // such an entry's record is this host's to write, and only its reaped exit
  // is judged; an entry made from the file for a record that names this host
  // (left by an earlier daemon) never is.
  int taken = 0;
  int killed = 0;        // its job left the file and its render was killed; freed once reaped
  int seen_next_id = 0;  // the highest next_task_id seen of its group
  int rebuilt = 0;       // its group was found built again: dropped at the next safe point
};
