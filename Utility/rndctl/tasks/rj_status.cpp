// Task status, render progress and job state.
//
// The SIGCHLD handler only clears an entry's pid and stores the exit value;
// everything else about a task's end happens here, in the service loop:
// UpdateRunningTasks judges every entry, writes changed states back to the
// task file and recomputes the state text of every job this host works for.
#include "Utility/rndctl/tasks/rj_status.h"

#include <unistd.h>

#include <cstdio>
#include <cstring>

#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_updatetime.h"
#include "Utility/rndctl/ctlfile/rj_reload.h"
#include "Utility/rndctl/records/rj_dev.h"
#include "Utility/rndctl/records/rj_job.h"
#include "Utility/rndctl/records/rj_jobcheck.h"
#include "Utility/rndctl/records/rj_recindex.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/tasks/rj_joberr.h"
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

// Frames done of the image a render program reports, counted from the first
// frame of its task.  The count follows the numbering the program was given
// on its command line: the job's own extension numbers, the numbering of a
// fractional step, or plain frame numbers.
int frames_done_at(const Job* job, const TaskRec* rec, int first_extension, int extension) {
  float by = job->frames[2];
  if (job->extension != 0) {
    return Calc_frame_range(static_cast<float>(first_extension), static_cast<float>(extension),
                            static_cast<float>(job->ext_by));
  }
  int by_int = static_cast<int>(by);
  if (by_int == 0) by_int = by < 0.0f ? -1 : 1;
  if (static_cast<float>(by_int) != by) {
    return Calc_frame_range(static_cast<float>(first_extension), static_cast<float>(extension),
                            static_cast<float>(by_int));
  }
  return Calc_frame_range(rec->start, static_cast<float>(extension), by);
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

  // The program may be in the middle of writing a line: a piece without its
  // newline at the end of the stream is read again, whole, next time.
  clearerr(entry->stream);
  char buf[256] = "";
  char prev[256] = "";
  char line[256];
  for (;;) {
    long at = ftell(entry->stream);
    if (fgets(line, sizeof line, entry->stream) == nullptr) break;
    if (strchr(line, '\n') == nullptr && feof(entry->stream)) {
      if (at >= 0) fseek(entry->stream, at, SEEK_SET);
      break;
    }
    if (strchr(line, ' ') == nullptr) continue;
    memcpy(prev, buf, sizeof prev);
    memcpy(buf, line, sizeof buf);
  }
  dbgpnt("prev = \"%s\"\n", prev);
  dbgpnt("buf = \"%s\"\n", buf);

  // Only a progress line counts, and only when it is the last line: what a
  // program writes after its progress is news the percentage cannot show.
  char image[256];
  char letter = 0;
  int line_no = 0;
  int lines_per_frame = 0;
  if (sscanf(buf, "%255s %c %d of %d", image, &letter, &line_no, &lines_per_frame) != 4 ||
      letter != 'r' || lines_per_frame <= 0) {
    dbgpnt("\tset_image_percentage_done----same-----done\n");
    return 0;
  }
  // Programs report line 0 (or less) for the last line of a frame.
  if (line_no <= 0) line_no += lines_per_frame;
  line_no -= 2;

  int extension = 0;
  int first_extension = 0;
  int frames_in_task = 1;
  int frames_done = 0;
  if (job->animate != 0) {
    const char* dot = strrchr(image, '.');
    if (dot == nullptr) {
      dbgpnt("\tset_image_percentage_done----same-----done\n");
      return 0;
    }
    extension = atoi(dot + 1);
    frames_in_task = get_task_frame_range(entry, &first_extension);
    frames_done = frames_done_at(job, rec, first_extension, extension);
  }

  const float old_current = rec->current;
  const float old_progress = entry->progress;
  // `current` is the frame under way, not the one after it: a task that
  // fails in the middle of a frame is cut before that frame, so that it is
  // rendered again.  Once a frame's last line is in, the next one is under
  // way; never past the task's end, which would leave an empty remainder.
  float current = rec->start;
  if (job->animate != 0) {
    int under_way = line_no >= lines_per_frame ? frames_done : frames_done - 1;
    if (under_way > 0) current = rec->start + static_cast<float>(under_way) * job->frames[2];
    if (current < rec->start) current = rec->start;
    if (current > rec->end) current = rec->end;
  }
  rec->current = current;
  const int lines_done = frames_done * lines_per_frame + line_no;
  const int lines_all = frames_in_task * lines_per_frame;
  entry->progress = lines_all != 0 ? static_cast<float>(static_cast<double>(lines_done) /
                                                        static_cast<double>(lines_all) * 100.0)
                                   : 0.0f;

  if (!entry->output.is(image)) entry->output.set(image);

  dbgpnt("\n");
  dbgpnt("buf = \"%s\"\n", buf);
  dbgpnt("frame_end = %f \n", static_cast<double>(rec->end));
  dbgpnt("ext_start = %d \n", first_extension);
  dbgpnt("numframes_intsk = %d \n", frames_in_task);
  dbgpnt("numframes_done = %d \n", frames_done);
  dbgpnt("lines_per_frame = %d \n", lines_per_frame);
  dbgpnt("currentframe = %d \n", extension);
  dbgpnt("\"%s\" %d %d of %d (%3.3f%s)\n", image, extension, lines_done, lines_all,
         static_cast<double>(entry->progress), "%");

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
    Job* job = entry->job;
    if (job == nullptr) {
      dbgpnt("Crash Alert - task->job is NULL\n");
      // Its job left the job file.  A render of it still running here is
      // killed; once it is reaped nothing of the job is left behind.
      if (entry->pid >= 2) {
        if (!entry->killed) {
          rj_kill_render(rndctl.host.c_str(), entry->pid, 9);
          entry->killed = 1;
        }
        continue;
      }
      Task_let_go(entry, nullptr);
      TASK_free(entry);
      changed = true;
      continue;
    }
    if (rec == nullptr) continue;

    const int s = rec->status;
    int status = s;
    bool progressed = false;
    const bool here = runs_here(rec);

    const bool stopping = job->status.is("restarted") || job->status.is("aborted");
    if (stopping && (here || s == TASK_PENDING)) status = TASK_ABORTED;
    // Only a render this daemon started and reaped is judged: an entry made
    // from the file (a record of an earlier daemon here) ended nothing.
    if (s == TASK_RUNNING && here && entry->taken) {
      // A process that has already ended is judged even in a stopping job:
      // its output file goes and its failure is recorded; the next pass
      // turns the task ABORTED.
      progressed = set_image_percentage_done(entry) != 0;
      if (entry->pid == 0) {
        if (entry->waitstatus == 0) {
          status = TASK_FINISHED;
          rec->current = rec->end;
        } else {
          status = TASK_FAILED;
          Job_Error_Update(entry);
        }
        if (entry->out_path) {
          if (job->save_out == 0) unlink(entry->out_path.c_str());
          entry->out_path.reset();
        }
      }
      dbgpnt("***** %s(%d) on %s is %s\t process(%d) waitstatus(%d)\n", job->name.or_else("noname"),
             rec->id, rndctl.host.or_else(""), status_name(s), entry->pid, entry->waitstatus);
    } else if (s == TASK_STARTED && here && !stopping && ISA_task_running(entry) != 0) {
      status = TASK_RUNNING;
    }

    if (status != rec->status || progressed) {
      changed = true;
      SetTaskStatus(entry, status);
    }
    if (status == TASK_STARTED || status == TASK_RUNNING) result = 1;
  }

  // Entries of a group found rebuilt while the list was walked go now,
  // before they count towards any job's state.
  if (Task_retire_marked() != 0) changed = true;
  // A job the files show "pending" while entries here say its tasks were
  // taken or done: an editor restarted it and cleared its group, and this
  // host missed the "restarted" between.  Ask the task file before those
  // entries make up a state for it that would be written over "pending".
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
  if (!reset.empty() && Task_retire_rebuilt(reset) != 0) changed = true;
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

  int mask = 0;
  int done_sum = 0;
  float progress_sum = 0.0f;
  bool any = false;
  const float by = job->frames[2];
  for (TASK* entry = rndctl.tasks; entry != nullptr; entry = entry->next) {
    if (entry->job != job || entry->rec == nullptr) continue;
    any = true;
    TaskRec* rec = entry->rec;
    int first_extension = 0;
    const int frames = get_task_frame_range(entry, &first_extension);
    int done = 0;
    switch (rec->status) {
      case TASK_PENDING:
        mask |= 1;
        break;
      case TASK_RUNNING:
      case TASK_FAILED:
        mask |= rec->status == TASK_RUNNING ? 4 : 0x20;
        done = job->animate != 0 ? Calc_frame_range(rec->start, rec->current, by) : 0;
        progress_sum += entry->progress;
        break;
      case TASK_FINISHED:
        mask |= 8;
        done = job->animate != 0 ? Calc_frame_range(rec->start, rec->end, by) : 1;
        entry->progress = 100.0f;
        break;
      case TASK_ABORTED:
        mask |= 0x40;
        break;
      case TASK_STARTED:
        mask |= 2;
        break;
      default:
        break;
    }
    done_sum += done;
    printf(
        "% 3d %7s on %10s frames( % 2.1f, % 2.1f, % 2.1f )  task( % 2d in % 2d % 3.2f )   Job( % "
        "2d )\n",
        rec->id, status_name(rec->status),
        rec->dev != nullptr ? rec->dev->name.or_else("(nodev)") : "(nodev)",
        static_cast<double>(rec->start), static_cast<double>(by), static_cast<double>(rec->current),
        done, frames, static_cast<double>(entry->progress), done_sum);
  }
  if (any) job->doneframes = done_sum;

  float percent = 0.0f;
  if (rndctl.tasks == nullptr) {
    if (pending || restarted) mask = 1;
  } else if (!restarted) {
    const float total = job->totalframes != 0 ? static_cast<float>(job->totalframes) : 1.0f;
    percent = static_cast<float>(job->doneframes) / total * 100.0f + progress_sum / total;
    dbgpnt("job frames done ( %d in %d ) %f  %f%s\n", job->doneframes, job->totalframes,
           static_cast<double>(progress_sum), static_cast<double>(percent), "%");
  } else {
    printf("%s %s\n\n", pending ? "job_pending" : " ", restarted ? "job_restarted" : " ");
  }
  fflush(stdout);

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

  if (mask == 8 || mask == 0x20 || mask == 0x40) Job_clear_tasks(job);
  if (mask == 8 || (restarted && mask == 1)) {
    for (RndDevList* d = job->resources; d != nullptr; d = d->next) {
      if (d->dev != nullptr && d->dev->host_name) daemon_updatetime_set(d->dev->host_name.c_str());
    }
  }
  dbgpnt("\n---------done----UpdateJobState for \"%s\" \"%s\"\n", job->name.or_else("noname"),
         job->status.or_else(""));
}
