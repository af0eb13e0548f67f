// Taking back tasks whose render went away with its daemon: the put-back of
// a held record, the start-up and exit cycles of this host, the heartbeat
// that tells a dead host from a quiet one, and the render registry through
// which a restarted daemon finds the renders of the one that crashed.
#include "Utility/rndctl/tasks/rj_reclaim.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "General/pst/pst.h"
#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_fileio.h"
#include "Utility/rndctl/ctldir/rj_paths.h"
#include "Utility/rndctl/ctldir/rj_pidfile.h"
#include "Utility/rndctl/proc/rj_registry.h"
#include "Utility/rndctl/proc/rj_signal.h"
#include "Utility/rndctl/proc/rj_spawn.h"
#include "Utility/rndctl/records/rj_dev.h"
#include "Utility/rndctl/records/rj_recindex.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/tasks/rj_perform.h"
#include "Utility/rndctl/tasks/rj_select.h"
#include "Utility/rndctl/tasks/rj_task.h"
#include "Utility/rndctl/tasks/rj_taskfile.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"
#include "Utility/rndctl/tasks/rj_tskio.h"

namespace {

bool held(const TaskRec* rec) { return rec->status == TASK_STARTED || rec->status == TASK_RUNNING; }

// Whether the file as it stands holds a record that `wanted` would put back.
// Every daemon looks at start-up and once a minute, nearly always for
// nothing; a look without the lock keeps those looks from queueing at the
// lock with the hosts that take work.
template <class Wanted>
bool any_to_put_back(Wanted wanted) {
  TaskGroup* groups = Task_file_peek();
  bool found = false;
  for (TaskGroup* g = groups; g != nullptr && !found; g = g->next) {
    for (TaskRec* rec = g->tasks; rec != nullptr && !found; rec = rec->next) {
      found = held(rec) && wanted(g, rec);
    }
  }
  TaskGroup_free_all(&groups);
  return found;
}

// One locked read-modify-write of the task file: every held record for which
// `pick` says yes is put back.  The other hosts of each job touched are woken
// once the lock is gone.
template <class Pick>
int put_back_cycle(Pick pick) {
  TaskAfterLock after;
  int count = 0;
  (void)Task_file_rewrite([&](TaskGroup** groups) {  // a failure is reported there
    for (TaskGroup* g = *groups; g != nullptr; g = g->next) {
      // Remainders are appended at the tail; they are PENDING and not held.
      for (TaskRec* rec = g->tasks; rec != nullptr; rec = rec->next) {
        if (!held(rec) || !pick(g, rec)) continue;
        Task_put_back(groups, g, rec);
        ++count;
        after.wake(g->job);
      }
    }
    after.note_full(*groups);
    return count > 0;
  });
  after.run();
  return count;
}

// The daemon-alive test.
bool daemon_alive(const char* host) { return Pidfile_probe(host) != 0; }

}  // namespace

TaskRec* Task_put_back(TaskGroup** groups, TaskGroup* group, TaskRec* rec) {
  if (group == nullptr || rec == nullptr || group->job == nullptr) return nullptr;
  const float by = group->job->frames[2];
  dbgpnt("put back %d of \"%s\": %f %f %f %s\n", rec->id, group->job->name.or_else("noname"),
         static_cast<double>(rec->start), static_cast<double>(rec->current),
         static_cast<double>(rec->end), GetTaskStatusStr(rec->status));
  if (by > 0.0f && rec->start < rec->current && rec->current <= rec->end) {
    TaskRec* rest = insert_task(groups, group->job, rec->current, rec->end, TASK_PENDING);
    if (rest != nullptr) {
      rest->retries = rec->retries;
      rec->status = TASK_FINISHED;
      rec->end = rec->current - by;
      rec->current = rec->end;
      return rest;
    }
  }
  rec->status = TASK_PENDING;
  rec->current = rec->start;
  rec->dev = nullptr;
  return nullptr;
}

int Task_reclaim_this_host() {
  int killed = rj_render_kill_leftovers();
  auto mine = [](TaskGroup*, TaskRec* rec) { return rj_dev_is_this_host(rec->dev); };
  int count = any_to_put_back(mine) ? put_back_cycle(mine) : 0;
  dbgpnt("start-up: %d render(s) killed, %d task(s) put back\n", killed, count);
  return count;
}

int Task_reclaim_dead_hosts(time_t server_now) {
  const long bound = rj_host_timeout();
  // One verdict per host and cycle; the alive test may run a remote probe.
  struct Verdict {
    bool dead;
    long age;
  };
  std::map<std::string, Verdict> verdicts;
  auto judge = [&](const char* host) -> Verdict {
    auto it = verdicts.find(host);
    if (it != verdicts.end()) return it->second;
    Verdict v{false, 0};
    struct stat st;
    // Without a heartbeat file the host runs a daemon that keeps none: leave
    // it to a person's Task_file_check.
    if (stat(rj_tskstat_path(host).c_str(), &st) == 0) {
      v.age = static_cast<long>(server_now - st.st_mtim.tv_sec);
      v.dead = v.age > bound && !daemon_alive(host);
    }
    verdicts.emplace(host, v);
    return v;
  };
  auto dead_holder = [&](const TaskRec* rec) {
    if (rec->dev == nullptr || rec->dev->host_name.none() || rj_dev_is_this_host(rec->dev)) {
      return Verdict{false, 0};
    }
    return judge(rec->dev->host_name.c_str());
  };
  if (!any_to_put_back([&](TaskGroup*, TaskRec* rec) { return dead_holder(rec).dead; })) return 0;
  return put_back_cycle([&](TaskGroup* g, TaskRec* rec) {
    Verdict v = dead_holder(rec);
    if (!v.dead) return false;
    wrt_logfile("put back task %d of \"%s\" from host %s: no heartbeat for %ld seconds", rec->id,
                g->job->name.or_else("noname"), rec->dev->host_name.c_str(), v.age);
    return true;
  });
}

int Task_release_own_renders() {
  const char* host = rndctl.host.c_str();
  std::vector<std::pair<int, int>> mine;  // job index, record id
  int killed = 0;
  for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
    if (e->job == nullptr || e->rec == nullptr || !rj_dev_is_this_host(e->rec->dev)) continue;
    if (!held(e->rec)) continue;
    if (e->pid >= 2 && rj_kill_render(host, e->pid, SIGKILL) == 0) ++killed;
    mine.emplace_back(e->job->index, e->rec->id);
  }
  rj_render_forget_all();

  // A daemon that took the pid file over put back this host's records when
  // it started and may be rendering them again under the same ids.
  int owner = Pidfile_read(host).pid;
  if (owner != 0 && owner != rndctl.pid && RJ_signal(host, owner, 0) == 0) {
    dbgpnt("exit: %d render(s) killed, records left to daemon %d\n", killed, owner);
    return killed;
  }
  int count = 0;
  if (!mine.empty()) {
    count = put_back_cycle([&](TaskGroup* g, TaskRec* rec) {
      if (!rj_dev_is_this_host(rec->dev)) return false;
      for (const auto& [index, id] : mine) {
        if (index == g->job->index && id == rec->id) return true;
      }
      return false;
    });
  }
  dbgpnt("exit: %d render(s) killed, %d task(s) put back\n", killed, count);
  return killed;
}

time_t rj_heartbeat() {
  const char* host = rndctl.host.c_str();
  if (host == nullptr) return 0;
  if (mkdir(rj_tskstat_dir().c_str(), 0775) != 0 && errno != EEXIST) return 0;
  const std::string path = rj_tskstat_path(host);
  // Never truncated here: the file also lists this host's tasks.
  int fd;
  do fd = open(path.c_str(), O_WRONLY | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0666);
  while (fd < 0 && errno == EINTR);
  if (fd < 0) return 0;
  // Null times: the file server stamps its own clock, the one every host's
  // heartbeat is judged by.
  struct stat st;
  bool ok = futimens(fd, nullptr) == 0 && fstat(fd, &st) == 0;
  close(fd);
  return ok ? st.st_mtim.tv_sec : 0;
}

long rj_host_timeout() {
  const char* text = getenv("ZARNO_RNDCTL_HOST_TIMEOUT");
  if (text == nullptr || *text == '\0') {
    // Asked once a minute: a farm without a preferences file would have the
    // lookup's complaint in the log each time.
    const char* prefs = find_variable_file(0, nullptr, nullptr);
    text = prefs != nullptr && *prefs != '\0' && access(prefs, R_OK) == 0
               ? get_zarno_variable("ZARNO_RNDCTL_HOST_TIMEOUT")
               : nullptr;
  }
  if (text != nullptr) {
    char* end = nullptr;
    long value = strtol(text, &end, 10);
    if (end != text && value > 0) return value;
  }
  return 600;
}

bool rj_update_time_settled(int64_t seen_ns, time_t server_now) {
  constexpr int64_t kSecond = 1000000000;
  if (seen_ns <= 0 || seen_ns % kSecond != 0) return true;
  return static_cast<int64_t>(server_now) > seen_ns / kSecond;
}
