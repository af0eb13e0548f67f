#include "Utility/rndctl/tasks/rj_status.h"

#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_updatetime.h"
#include "Utility/rndctl/ctlfile/rj_reload.h"
#include "Utility/rndctl/proc/rj_spawn.h"
#include "Utility/rndctl/records/rj_dev.h"
#include "Utility/rndctl/records/rj_frames.h"
#include "Utility/rndctl/records/rj_job.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/tasks/rj_joberr.h"
#include "Utility/rndctl/tasks/rj_joblog.h"
#include "Utility/rndctl/tasks/rj_perform.h"
#include "Utility/rndctl/tasks/rj_select.h"
#include "Utility/rndctl/tasks/rj_task.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"
#include "Utility/rndctl/tasks/rj_tskio.h"

namespace {

const char* status_name(int code) {
  if (code < TASK_PENDING || code > TASK_STOPPED) return "UNKNOWN";
  return task_status_table[code];
}

bool runs_here(const TaskRec* rec) { return rec != nullptr && rj_dev_is_this_host(rec->dev); }

bool job_uses_this_host(const Job* job) {
  if (!rndctl.host) return false;
  for (RndDevList* d = job->resources; d != nullptr; d = d->next) {
    if (rj_dev_is_this_host(d->dev)) return true;
  }
  return false;
}

// Reads the stream to its end into `buf`: the last line that holds a space.
// The program may be in the middle of writing a line: a piece without its
// newline at the end of the stream is read again, whole, next time.
void read_last_line(FILE* stream, char (&buf)[256]) {
  clearerr(stream);
  char prev[256] = "";
  char line[256];
  for (;;) {
    long at = ftell(stream);
    if (fgets(line, sizeof line, stream) == nullptr) break;
    if (strchr(line, '\n') == nullptr && feof(stream)) {
      if (at >= 0) fseek(stream, at, SEEK_SET);
      break;
    }
    if (strchr(line, ' ') == nullptr) continue;
    memcpy(prev, buf, sizeof prev);
    memcpy(buf, line, sizeof buf);
  }
  dbgpnt("prev = \"%s\"\n", prev);
  dbgpnt("buf = \"%s\"\n", buf);
}

// A progress line "IMAGE r LINE of LINES"; an animated job's image name
// ends in its extension number after the last '.'.  False for anything else.
bool parse_progress(const char* buf, bool animate, char (&image)[256], int* extension, int* line,
                    int* lines_per_frame) {
  char letter = 0;
  if (sscanf(buf, "%255s %c %d of %d", image, &letter, line, lines_per_frame) != 4 ||
      letter != 'r' || *lines_per_frame <= 0) {
    return false;
  }
  *extension = 0;
  if (!animate) return true;
  const char* dot = strrchr(image, '.');
  if (dot == nullptr) return false;
  *extension = atoi(dot + 1);
  return true;
}

void trace_progress(const char* buf, float end, const char* image, int extension,
                    int lines_per_frame, const RjFrameProgress& p) {
  dbgpnt("\n");
  dbgpnt("buf = \"%s\"\n", buf);
  dbgpnt("frame_end = %f \n", static_cast<double>(end));
  dbgpnt("ext_start = %d \n", p.first_extension);
  dbgpnt("numframes_intsk = %d \n", p.frames_in_task);
  dbgpnt("numframes_done = %d \n", p.frames_done);
  dbgpnt("lines_per_frame = %d \n", lines_per_frame);
  dbgpnt("currentframe = %d \n", extension);
  dbgpnt("\"%s\" %d %d of %d (%3.3f%s)\n", image, extension, p.lines_done, p.lines_all,
         static_cast<double>(p.percent), "%");
}

// An entry whose job left the job file.  A render of it still running here
// is killed; once it is reaped nothing of the job is left behind.  True when
// the entry was freed.
bool end_jobless_entry(TASK* entry) {
  if (entry->pid >= 2) {
    if (!entry->killed) {
      rj_kill_render(rndctl.host.c_str(), entry->pid, 9);
      entry->killed = 1;
    }
    return false;
  }
  Task_let_go(entry, nullptr);
  TASK_free(entry);
  return true;
}

// The status a reaped render leaves: FINISHED (the task done to its end) on
// a clean exit, else FAILED with the job's error record updated.  Its output
// file goes unless the job keeps output.
int judge_exit(TASK* entry) {
  TaskRec* rec = entry->rec;
  int status = TASK_FAILED;
  if (entry->waitstatus == 0) {
    status = TASK_FINISHED;
    rec->current = rec->end;
  } else {
    Job_Error_Update(entry);
  }
  if (entry->out_path) {
    if (entry->job->save_out == 0) unlink(entry->out_path.c_str());
    entry->out_path.reset();
  }
  return status;
}

// The status an entry of a present job should have now; `*progressed` tells
// whether its render reported progress.
int judge_entry(TASK* entry, bool* progressed) {
  TaskRec* rec = entry->rec;
  Job* job = entry->job;
  const int s = rec->status;
  int status = s;
  const bool here = runs_here(rec);
  const bool stopping = job->status.is("restarted") || job->status.is("aborted");
  if (stopping && (here || s == TASK_PENDING)) status = TASK_ABORTED;
  // Only a render this daemon started and reaped is judged: an entry made
  // from the file (a record of an earlier daemon here) ended nothing.
  if (s == TASK_RUNNING && here && entry->taken) {
    // A process that has already ended is judged even in a stopping job:
    // its output file goes and its failure is recorded; the next pass
    // turns the task ABORTED.
    *progressed = set_image_percentage_done(entry) != 0;
    if (entry->pid == 0) status = judge_exit(entry);
    dbgpnt("***** %s(%d) on %s is %s\t process(%d) waitstatus(%d)\n", job->name.or_else("noname"),
           rec->id, rndctl.host.or_else(""), status_name(s), entry->pid, entry->waitstatus);
  } else if (s == TASK_STARTED && here && !stopping && ISA_task_running(entry) != 0) {
    status = TASK_RUNNING;
  }
  return status;
}

// A job the files show "pending" while entries here say its tasks were
// taken or done: an editor restarted it and cleared its group, and this
// host missed the "restarted" between.  Asks the task file before those
// entries make up a state for it that would be written over "pending".
// True when entries were retired.
bool retire_missed_restarts() {
  std::vector<Job*> reset;
  for (Job* job = rndctl.jobs; job != nullptr; job = job->next) {
    if (!job->status.is("pending") || !job_uses_this_host(job)) continue;
    for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
      if (e->job == job && e->rec != nullptr && e->rec->status != TASK_PENDING) {
        reset.push_back(job);
        break;
      }
    }
  }
  return !reset.empty() && Task_retire_rebuilt(reset) != 0;
}

// What a job's entries add up to: one mask bit per status present, the
// frames done and the progress of the tasks under way.
struct JobTally {
  int mask = 0;
  int done_sum = 0;
  float progress_sum = 0.0f;
  bool any = false;
};

// Frames done of one task by its status; a finished task's progress is 100.
int frames_done_of(const Job* job, TASK* entry, int* mask, float* progress_sum) {
  const TaskRec* rec = entry->rec;
  switch (rec->status) {
    case TASK_PENDING:
      *mask |= 1;
      return 0;
    case TASK_RUNNING:
    case TASK_FAILED:
      *mask |= rec->status == TASK_RUNNING ? 4 : 0x20;
      *progress_sum += entry->progress;
      return job->animate != 0 ? rj_frames_span(job, rec->start, rec->current) : 0;
    case TASK_FINISHED:
      *mask |= 8;
      entry->progress = 100.0f;
      return job->animate != 0 ? rj_frames_span(job, rec->start, rec->end) : 1;
    case TASK_ABORTED:
      *mask |= 0x40;
      return 0;
    case TASK_STARTED:
      *mask |= 2;
      return 0;
    default:
      return 0;
  }
}

JobTally tally_tasks(Job* job) {
  JobTally t;
  for (TASK* entry = rndctl.tasks; entry != nullptr; entry = entry->next) {
    if (entry->job != job || entry->rec == nullptr) continue;
    t.any = true;
    const TaskRec* rec = entry->rec;
    const int frames = get_task_frame_range(entry, nullptr);
    const int done = frames_done_of(job, entry, &t.mask, &t.progress_sum);
    t.done_sum += done;
    printf(
        "% 3d %7s on %10s frames( % 2.1f, % 2.1f, % 2.1f )  task( % 2d in % 2d % 3.2f )   Job( % "
        "2d )\n",
        rec->id, status_name(rec->status),
        rec->dev != nullptr ? rec->dev->name.or_else("(nodev)") : "(nodev)",
        static_cast<double>(rec->start), static_cast<double>(job->frames[2]),
        static_cast<double>(rec->current), done, frames, static_cast<double>(entry->progress),
        t.done_sum);
  }
  return t;
}

// Sets the job's status text by the mask of its tasks' states and returns
// the mask, with bit 1 added for a restarted job of mixed tasks.
int set_job_status(Job* job, int mask, bool restarted, float percent) {
  switch (mask) {
    case 0:
      break;
    case 1:
      job->status.set("pending");
      break;
    case 2:
      job->status.set("started");
      break;
    case 8:
      job->status.set("finished");
      break;
    case 0x20:
      job->status.set("failed");
      break;
    default:
      if (restarted) {
        mask |= 1;
      } else {
        char text[64];
        snprintf(text, sizeof text, "%3.2f%s%s", static_cast<double>(percent), "%",
                 Job_available(job) == 2 ? " " : " Paused");
        job->status.set(text);
      }
      break;
  }
  return mask;
}

}  // namespace

int ISA_task_active(TASK* entry) {
  if (entry == nullptr || entry->rec == nullptr) return 0;
  return entry->rec->status == TASK_RUNNING || entry->rec->status == TASK_STARTED ? 1 : 0;
}

int ISA_task_running(TASK* entry) {
  if (entry == nullptr) return 0;
  if (entry->pid >= 2) return 1;
  if (entry->rec == nullptr || entry->rec->dev == nullptr) return 0;
  // Another host's task: its own daemon knows whether it runs.
  return runs_here(entry->rec) ? 0 : 1;
}

int SetTaskStatus(TASK* entry, int status) {
  if (entry == nullptr || entry->rec == nullptr) return 0;
  TaskRec* rec = entry->rec;
  Job* job = entry->job;
  if (status == rec->status) {
    // Still written: progress may have moved without a change of status.
    if (job != nullptr) Task_file_update(job);
    return 0;
  }
  dbgpnt("task status = %s\n", status_name(status));
  int old = rec->status;
  rec->status = status;
  if (job != nullptr) Task_file_update(job);

  if (status != TASK_FINISHED && status != TASK_ABORTED && status != TASK_FAILED) return 1;

  if ((old == TASK_RUNNING || old == TASK_STARTED) && entry->pid >= 2) {
    Dev* dev = rec->dev;
    const char* host =
        dev != nullptr && dev->host_name ? dev->host_name.c_str() : rndctl.host.c_str();
    dbgpnt("**************** KILL %s on %s:%s\n",
           job != nullptr ? job->name.or_else("noname") : "noname", host != nullptr ? host : "",
           dev != nullptr ? dev->name.or_else("") : "");
    rj_kill_render(host, entry->pid, 9);
  }
  entry->pid = 0;
  Task_drop_stream(entry);
  entry->output.reset();
  return 1;
}

int set_image_percentage_done(TASK* entry) {
  if (entry == nullptr || entry->stream == nullptr || entry->job == nullptr ||
      entry->rec == nullptr || entry->rec->dev == nullptr) {
    return 0;
  }
  Job* job = entry->job;
  TaskRec* rec = entry->rec;
  dbgpnt("\tset_image_percentage_done------------------\n");
  char buf[256] = "";
  read_last_line(entry->stream, buf);

  // Only a progress line counts, and only when it is the last line: what a
  // program writes after its progress is news the percentage cannot show.
  char image[256];
  int extension = 0;
  int line_no = 0;
  int lines_per_frame = 0;
  if (!parse_progress(buf, job->animate != 0, image, &extension, &line_no, &lines_per_frame)) {
    dbgpnt("\tset_image_percentage_done----same-----done\n");
    return 0;
  }
  RjFrameProgress p;
  rj_frame_progress(job, rec->start, rec->end, extension, line_no, lines_per_frame, &p);
  const float old_current = rec->current;
  const float old_progress = entry->progress;
  rec->current = p.current;
  entry->progress = p.percent;
  if (!entry->output.is(image)) entry->output.set(image);
  trace_progress(buf, rec->end, image, extension, lines_per_frame, p);

  if (rec->current != old_current || entry->progress != old_progress) {
    dbgpnt("\tset_image_percentage_done--different---done\n");
    return 1;
  }
  dbgpnt("\tset_image_percentage_done----same-----done\n");
  return 0;
}

int UpdateRunningTasks() {
  dbgpnt("\n------------------------------------------UpdateRunningTasks\n");
  int result = 0;
  bool changed = false;

  TASK* next = nullptr;
  for (TASK* entry = rndctl.tasks; entry != nullptr; entry = next) {
    next = entry->next;
    TaskRec* rec = entry->rec;
    if (entry->job == nullptr) {
      dbgpnt("Crash Alert - task->job is NULL\n");
      if (end_jobless_entry(entry)) changed = true;
      continue;
    }
    if (rec == nullptr) continue;

    bool progressed = false;
    const int status = judge_entry(entry, &progressed);
    if (status != rec->status || progressed) {
      changed = true;
      SetTaskStatus(entry, status);
    }
    if (status == TASK_STARTED || status == TASK_RUNNING) result = 1;
  }

  // Entries of a group found rebuilt while the list was walked go now,
  // before they count towards any job's state.
  if (Task_retire_marked() != 0) changed = true;
  if (retire_missed_restarts()) changed = true;
  for (Job* job = rndctl.jobs; job != nullptr; job = job->next) {
    if (job_uses_this_host(job)) UpdateJobState(job);
  }
  if (changed) Task_update_status();

  Update_from_demon(1);
  dbgpnt("\n----------------------------------done----UpdateRunningTasks\n");
  return result;
}

int VerifyRunningTasks() { return UpdateRunningTasks(); }

void Job_clear_tasks(Job* job) {
  if (job == nullptr) return;
  Job_Log_out(job);
  TASK* next = nullptr;
  for (TASK* entry = rndctl.tasks; entry != nullptr; entry = next) {
    next = entry->next;
    if (entry->job != job) continue;
    dbgpnt("freeing task %lx in Job_clear_tasks\n", reinterpret_cast<unsigned long>(entry));
    Task_drop_stream(entry);
    TASK_free(entry);
  }
  dbgpnt("Tasks cleared \"%s\" set to not running\n", job->name.or_else("noname"));
  Task_file_update(job);
  if (job->del_when_done != 0) job->deleted = 1;
}

void UpdateJobState(Job* job) {
  if (job == nullptr) return;
  dbgpnt("\n-----------------UpdateJobState for \"%s\"  %s\n", job->name.or_else("noname"),
         job->status.or_else(""));
  // Each call handles every failed task at once and answers null; the bound
  // only keeps a misbehaving answer from hanging the daemon.
  for (int i = 0; i < 100000 && Split_first_splittable_failed_tasks() != nullptr; ++i) {
  }

  const bool restarted = job->status.is("restarted");
  const bool pending = job->status.is("pending");
  JobTally tally = tally_tasks(job);
  if (tally.any) job->doneframes = tally.done_sum;

  float percent = 0.0f;
  if (rndctl.tasks == nullptr) {
    if (pending || restarted) tally.mask = 1;
  } else if (!restarted) {
    const float total = job->totalframes != 0 ? static_cast<float>(job->totalframes) : 1.0f;
    percent = static_cast<float>(job->doneframes) / total * 100.0f + tally.progress_sum / total;
    dbgpnt("job frames done ( %d in %d ) %f  %f%s\n", job->doneframes, job->totalframes,
           static_cast<double>(tally.progress_sum), static_cast<double>(percent), "%");
  } else {
    printf("%s %s\n\n", pending ? "job_pending" : " ", restarted ? "job_restarted" : " ");
  }
  fflush(stdout);

  const int mask = set_job_status(job, tally.mask, restarted, percent);
  if (mask == 8 || mask == 0x20 || mask == 0x40) Job_clear_tasks(job);
  // Finished, or restarted back to pending: the other hosts of the job reload.
  if (mask == 8 || (restarted && mask == 1)) {
    for (RndDevList* d = job->resources; d != nullptr; d = d->next) {
      if (d->dev != nullptr && d->dev->host_name) daemon_updatetime_set(d->dev->host_name.c_str());
    }
  }
  dbgpnt("\n---------done----UpdateJobState for \"%s\" \"%s\"\n", job->name.or_else("noname"),
         job->status.or_else(""));
}

int get_task_frame_range(TASK* entry, int* first_extension) {
  if (entry == nullptr || entry->job == nullptr || entry->rec == nullptr) {
    if (first_extension != nullptr) *first_extension = 0;
    return 0;
  }
  const Job* job = entry->job;
  const TaskRec* rec = entry->rec;
  if (first_extension != nullptr) *first_extension = rj_frame_extension(job, rec->start);
  return rj_frames_span(job, rec->start, rec->end);
}

int get_current_frame_extension(Job* job, Dev* dev, int* extension) {
  for (TASK* entry = rndctl.tasks; entry != nullptr; entry = entry->next) {
    if (entry->job != job || entry->rec == nullptr) continue;
    if (entry->rec->dev != dev || entry->rec->status != TASK_RUNNING) continue;
    set_image_percentage_done(entry);
    if (extension != nullptr) *extension = rj_frame_extension(job, entry->rec->current);
    return 1;
  }
  return 0;
}
