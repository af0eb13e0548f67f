// Task-file updates for one job, and the per-host status files under
// TSKSTAT.  See rj_tskio.h.
#include "Utility/rndctl/tasks/rj_tskio.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>
#include <unordered_map>
#include <vector>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_paths.h"
#include "Utility/rndctl/ctldir/rj_pidfile.h"
#include "Utility/rndctl/ctlfile/rj_ctlfile.h"
#include "Utility/rndctl/proc/rj_signal.h"
#include "Utility/rndctl/records/rj_dev.h"
#include "Utility/rndctl/records/rj_job.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/tasks/rj_task.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"
#include "Utility/rndctl/tasks/rj_tasktext.h"

namespace {

using rj_tasktext::TokenSource;

bool on_this_host(const Dev* dev) { return rj_dev_is_this_host(dev); }

// States in which the job's group leaves the task file.
bool job_is_over(const Job* job) {
  const Text& state = job->status;
  return state.is("aborted") || state.is("failed") || state.is("finished") || state.is("restarted");
}

// Reads a status file whole: lines "%s %d %d %s" (job name, job index,
// status code, output).  Stops at the first line that does not scan.
struct StatusLine {
  std::string job;
  int index;
  int status;
  std::string output;
};

bool read_status_file(const char* host, std::vector<StatusLine>* lines) {
  const std::string path_text = rj_tskstat_path(host);
  const char* path = path_text.c_str();
  int fd = open(path, O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
  if (fd < 0) return false;
  std::string text;
  char chunk[65536];
  for (;;) {
    ssize_t n = read(fd, chunk, sizeof chunk);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    text.append(chunk, static_cast<size_t>(n));
  }
  close(fd);
  text.push_back('\0');
  TokenSource in(text.data(), text.size() - 1);
  for (;;) {
    const char* job = in.next();
    if (job == nullptr) break;
    StatusLine line{job, 0, 0, {}};
    if (!in.next_int(&line.index) || !in.next_int(&line.status)) break;
    const char* output = in.next();
    if (output == nullptr) break;
    line.output = output;
    lines->push_back(std::move(line));
  }
  return true;
}

}  // namespace

void Task_file_update(Job* job) {
  dbgpnt("\nTask_file_update-----------------------------\n");
  TaskAfterLock after;
  (void)Task_file_rewrite([&](TaskGroup** list) {  // reported there; the next update writes again
    TaskGroup*& groups = *list;
    bool job_seen = false;
    TaskGroup* g = groups;
    while (g != nullptr) {
      TaskGroup* next = g->next;
      dbgpnt("\"%s\" -> %s\n", g->job->name.or_else("(null)"), g->job->status.or_else("(null)"));
      if (job != nullptr && g->job == job) {
        job_seen = true;
        if (Task_group_rebuilt(job, g)) {
          // Built again since this host last looked: nothing this host holds
          // belongs to it, not even the end of the job it knew.
          Task_mark_rebuilt(job);
        } else if (job_is_over(job)) {
          dbgpnt("free up task info\n");
          while (g->tasks != nullptr) TaskRec_freeOnly(g->tasks);
          TaskGroup_free(&groups, g);
        } else {
          std::unordered_map<int, TASK*> mine;  // first entry of each id, as a list walk finds it
          for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
            if (e->job == job && e->rec != nullptr) mine.emplace(e->rec->id, e);
          }
          for (TaskRec* rec = g->tasks; rec != nullptr; rec = rec->next) {
            auto it = mine.find(rec->id);
            if (it == mine.end() || !Task_same_rec(it->second->rec, rec)) continue;
            TASK* e = it->second;
            if (Task_settle(e, rec, &after) != 0) {
              rec->current = e->rec->current;
              dbgpnt("%d) %s %.2f\n", rec->id, GetTaskStatusStr(rec->status), rec->current);
            }
          }
        }
      }
      g = next;
    }
    // The group left the file while this host still holds entries of a job it
    // thinks under way: the group was cleared behind its back (a restart it
    // did not see).  A job over in this host's eyes dropped it itself.
    if (job != nullptr && !job_seen && !job_is_over(job) && Task_group_rebuilt(job, nullptr)) {
      Task_mark_rebuilt(job);
    }
    after.note_full(groups);
    return true;
  });
  after.run();
  dbgpnt("Task_file_update-------------------------DONE\n");
}

int Task_file_check(Job* job) {
  dbgpnt("\nTask_file_check-----------------------------\n");
  int set_back = 0;
  TaskAfterLock after;
  (void)Task_file_rewrite([&](TaskGroup** groups) {  // reported there
    TaskGroup* g = TaskGroup_by_job(*groups, job);
    if (g != nullptr) {
      for (TaskRec* rec = g->tasks; rec != nullptr; rec = rec->next) {
        rec->retries = 0;
        if ((rec->status == TASK_RUNNING || rec->status == TASK_STARTED) && rec->dev != nullptr &&
            rec->dev->host_name.c_str() != nullptr &&
            Pidfile_probe(rec->dev->host_name.c_str()) == 0) {
          rec->status = TASK_PENDING;
          set_back = 1;
          dbgpnt("set job pending failed daemon on \"%s\"\n", rec->dev->host_name.c_str());
        }
      }
    }
    if (set_back) after.wake(job);
    after.note_full(*groups);
    return true;
  });
  after.run();
  dbgpnt("Task_file_check-------------------------DONE\n");
  return set_back;
}

// ---------------------------------------------------------------------------
// Status files.

void Task_update_status() {
  const char* host = rndctl.host.c_str();
  if (host == nullptr) return;
  if (mkdir(rj_tskstat_dir().c_str(), 0775) != 0 && errno != EEXIST) {
    perror("in Task_update_status");
    return;
  }
  const std::string path_text = rj_tskstat_path(host);
  const char* path = path_text.c_str();
  // The control directory is writable by every user of the farm: refuse to
  // follow a link planted where the file should be.
  int fd = open(path, O_RDWR | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0666);
  if (fd < 0) {
    perror("in Task_update_status");
    return;
  }
  FILE* fp = fdopen(fd, "w+");
  if (fp == nullptr) {
    close(fd);
    return;
  }
  for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
    if (e->job == nullptr || e->rec == nullptr || e->stale) continue;
    if (!on_this_host(e->rec->dev)) continue;
    const std::string label = RJC_label_form(e->job->name.or_else("(null)"));
    fprintf(fp, "%s %d %d %s\n", label.c_str(), e->job->index, e->rec->status,
            e->output.or_else("-"));
  }
  if (fclose(fp) != 0) perror("in Task_update_status");
}

void Task_sfile_dump(Dev* dev) {
  if (dev == nullptr || dev->host_name.c_str() == nullptr) return;
  std::vector<StatusLine> lines;
  if (!read_status_file(dev->host_name.c_str(), &lines)) return;
  for (const StatusLine& line : lines) {
    printf("\"%s\" is %s on %s, output: %s\n", line.job.c_str(), GetTaskStatusStr(line.status),
           dev->host_name.c_str(), line.output.c_str());
  }
  fflush(stdout);
}

char* Task_current_filenames(Job* job, Dev* dev) {
  static char names[1025];
  if (job == nullptr || dev == nullptr) return nullptr;
  names[0] = '\0';
  if (dev->host_name.c_str() == nullptr) return names;
  std::vector<StatusLine> lines;
  if (!read_status_file(dev->host_name.c_str(), &lines)) return names;
  size_t used = 0;
  for (const StatusLine& line : lines) {
    if (line.index != job->index || line.output == "-") continue;
    size_t add = line.output.size() + 1;
    if (used + add > sizeof names - 1) break;
    memcpy(names + used, line.output.data(), line.output.size());
    used += line.output.size();
    names[used++] = ' ';
    names[used] = '\0';
  }
  return names;
}
