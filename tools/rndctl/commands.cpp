#include "tools/rndctl/commands.h"

#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <thread>

#include "tools/rndctl/editor_side.h"
#include "tools/rndctl/tables.h"

namespace {

int fail(const std::string& why) {
  fprintf(stderr, "rndctl: %s\n", why.c_str());
  return 1;
}

int finish(CtlEdit result, const std::string& why) { return result == CTL_WRITTEN ? 0 : fail(why); }

bool grid_empty(const int* grid) {
  for (int i = 0; i < RJ_WEEK; i++)
    if (grid[i] != 0) return false;
  return true;
}

// `found` (a job or host, null when there is none) unless an editor holds
// it and the change is not forced; else null with the reason in *why.
template <typename Record>
Record* editable(Record* found, const char* kind, const std::string& key, bool force,
                 std::string* why) {
  std::string what = std::string(kind) + " \"" + key + "\"";
  if (found == nullptr) {
    *why = "no " + what;
  } else if (!force && Ctl_held(found->lock_pid)) {
    *why = what + " is held by editor pid " + std::to_string(found->lock_pid) + " (use --force)";
  } else {
    return found;
  }
  return nullptr;
}

Job* editable_job(const std::string& key, bool force, std::string* why) {
  return editable(Ctl_find_job(key), "job", key, force, why);
}

Dev* editable_dev(const std::string& name, bool force, std::string* why) {
  return editable(Dev_by_name(name.c_str()), "host", name, force, why);
}

bool load(std::string* why) { return Ctl_load(why); }

std::string read_whole(const std::string& path) {
  std::string text;
  FILE* fp = fopen(path.c_str(), "re");
  if (fp == nullptr) return text;
  char buf[1 << 14];
  size_t n;
  while ((n = fread(buf, 1, sizeof buf, fp)) > 0) text.append(buf, n);
  fclose(fp);
  return text;
}

}  // namespace

namespace {

// What a submission asks for, judged before anything is written.
struct SubmitPlan {
  CtlFrames frames;
  bool have_frames = false;
  std::vector<CtlBlock> blocks;
  std::string name;
  std::vector<std::string> host_names;  // empty: every host
};

bool plan_submit(const SubmitOptions& o, SubmitPlan* plan, std::string* why) {
  plan->have_frames = !o.frames.empty();
  if (plan->have_frames && !Ctl_parse_frames(o.frames, &plan->frames, why)) return false;
  for (const auto& s : o.schedules) {
    CtlBlock b;
    if (!Ctl_parse_block(s, &b, why)) return false;
    plan->blocks.push_back(b);
  }
  plan->name = o.name;
  if (plan->name.empty()) {
    size_t slash = o.scene.rfind('/');
    plan->name = slash == std::string::npos ? o.scene : o.scene.substr(slash + 1);
  }
  if (!Ctl_word_ok(plan->name, why)) {
    *why += "; give one with --name";
    return false;
  }
  for (const std::string* s : {&o.scene, &o.pix, &o.matte, &o.opts})
    if (!Ctl_string_ok(*s, why)) return false;
  for (const auto& s : o.searchpaths)
    if (!Ctl_string_ok(s, why)) return false;
  if (!o.executable.empty() && !Ctl_word_ok(o.executable, why)) return false;
  if (rndctl.user && !Ctl_word_ok(rndctl.user.c_str(), why)) {
    *why = "your user name: " + *why;
    return false;
  }
  struct stat st;
  if (stat(o.scene.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) {
    *why = "cannot read scene \"" + o.scene + "\"";
    return false;
  }
  if (o.hosts != "all") {
    plan->host_names = Ctl_split(o.hosts, ',');
    if (plan->host_names.empty()) {
      *why = "no hosts given";
      return false;
    }
  }
  return true;
}

// The resources the job may use, from the freshly loaded lists.
bool submit_devs(const SubmitPlan& plan, std::vector<Dev*>* devs, std::string* why) {
  for (const auto& h : plan.host_names) {
    Dev* d = Dev_by_name(h.c_str());
    if (d == nullptr) {
      *why = "unknown host \"" + h + "\"";
      return false;
    }
    devs->push_back(d);
  }
  if (devs->empty())
    for (Dev* d = rndctl.devs; d != nullptr; d = d->next) devs->push_back(d);
  if (devs->empty()) {
    *why = "no hosts in the resource file";
    return false;
  }
  return true;
}

void fill_job_fields(Job* job, const SubmitOptions& o, const SubmitPlan& plan) {
  job->name.set(plan.name.c_str());
  job->user.set(rndctl.user.c_str());
  job->status.set("pending");
  job->priority = o.priority;
  if (!o.executable.empty()) job->executable.set(o.executable.c_str());
  if (!o.pix.empty()) {
    job->pix.set(o.pix.c_str());
    job->use_sdl_paths = 0;
  }
  if (!o.matte.empty()) job->matte.set(o.matte.c_str());
  if (!o.opts.empty()) job->rnd_opts.set(o.opts.c_str());
  for (const auto& p : o.searchpaths) RndPathList_add(job, p.c_str());
  job->del_when_done = o.delete_when_done ? 1 : 0;
  job->save_out = o.keep_output ? 1 : 0;
}

// The frame range: the scene's unless given, never running backwards.
bool fill_job_frames(Job* job, const SubmitPlan& plan, std::string* why) {
  (void)Job_set_frame_range(job);
  (void)Job_check_sdlfields(job);
  if (plan.have_frames) {
    job->animate = 1;
    job->frames[0] = plan.frames.start;
    job->frames[1] = plan.frames.end;
    job->frames[2] = plan.frames.by;
    job->totalframes = Calc_frame_range(plan.frames.start, plan.frames.end, plan.frames.by);
  }
  if (job->animate && job->frames[2] <= 0) job->frames[2] = 1;
  if (job->animate && job->frames[1] < job->frames[0]) {
    *why = "the scene's frame range runs backwards; give one with --frames";
    return false;
  }
  job->doneframes = 0;
  return true;
}

}  // namespace

int Cmd_submit(const SubmitOptions& o) {
  std::string why;
  SubmitPlan plan;
  if (!plan_submit(o, &plan, &why)) return fail(why);
  int index = 0;
  CtlEdit r = Ctl_edit_jobs(
      [&](std::string* why, std::vector<std::string>* wake) {
        if (Job_by_name(plan.name.c_str()) != nullptr) {
          *why = "a job named \"" + plan.name + "\" is already queued";
          return false;
        }
        std::vector<Dev*> devs;
        if (!submit_devs(plan, &devs, why)) return false;
        index = RJCget_next_index(FILE_JOB_INDEX);
        Job* job = Add_a_job(nullptr, o.scene.c_str(), index);
        fill_job_fields(job, o, plan);
        if (!fill_job_frames(job, plan, why)) return false;
        job->ctrl = o.paused ? RUN_PAUSED : plan.blocks.empty() ? RUN_AVAILABLE : RUN_SCHEDULE;
        for (const auto& b : plan.blocks)
          Ctl_apply_block(b, [&](int s, int e, const char* f, const char* l) {
            Schedule_job_runs(job, s, e, f, l);
          });
        for (Dev* d : devs) RndDevList_add(job, d);
        *wake = Ctl_job_hosts(job);
        return true;
      },
      &why);
  if (r != CTL_WRITTEN) return fail(why);
  printf("%d %s\n", index, plan.name.c_str());
  return 0;
}

int Cmd_jobs(bool json) {
  std::string why;
  if (!load(&why)) return fail(why);
  if (json) {
    printf("%s\n", Out_jobs_json(nullptr).dump(2).c_str());
  } else {
    Out_jobs_table(stdout, Out_colour(stdout));
  }
  return 0;
}

int Cmd_show(const std::string& key, bool json) {
  std::string why;
  if (!load(&why)) return fail(why);
  Job* job = Ctl_find_job(key);
  if (job == nullptr) return fail("no job \"" + key + "\"");
  CtlTasks tasks;
  if (!Ctl_read_tasks(&tasks)) return fail("cannot read the task file");
  std::string log_path =
      std::string(rndctl.location.c_str()) + "/JOBLOG/" + RJC_label_form(job->name.c_str());
  std::string log = read_whole(log_path);
  if (json) {
    nlohmann::json j = Out_job_json(job, &tasks);
    j["log"] = log;
    printf("%s\n", j.dump(2).c_str());
  } else {
    Out_job_full(stdout, job, tasks);
    if (!log.empty()) printf("  log\n%s", log.c_str());
  }
  return 0;
}

int Cmd_job_change(const std::string& what, const std::string& key, bool force) {
  std::string why;
  return finish(Ctl_edit_jobs(
                    [&](std::string* why, std::vector<std::string>* wake) {
                      Job* job = editable_job(key, force, why);
                      if (job == nullptr) return false;
                      *wake = Ctl_job_hosts(job);
                      if (what == "pause") {
                        job->ctrl = RUN_PAUSED;
                      } else if (what == "resume") {
                        job->ctrl = grid_empty(job->runs) ? RUN_AVAILABLE : RUN_SCHEDULE;
                      } else if (what == "abort") {
                        job->status.set("aborted");
                      } else {
                        job->deleted = 1;
                      }
                      return true;
                    },
                    &why),
                why);
}

int Cmd_restart(const std::string& key, bool force, double timeout_seconds) {
  std::string why;
  int index = 0;
  // First the order to stop: the daemons abort the job's tasks they run.
  CtlEdit r = Ctl_edit_jobs(
      [&](std::string* why, std::vector<std::string>* wake) {
        Job* job = editable_job(key, force, why);
        if (job == nullptr) return false;
        index = job->index;
        job->status.set("restarted");
        *wake = Ctl_job_hosts(job);
        return true;
      },
      &why);
  if (r != CTL_WRITTEN) return fail(why);
  // Then wait until no task of the job is taken or running any more.
  auto until = std::chrono::steady_clock::now() + std::chrono::duration<double>(timeout_seconds);
  for (;;) {
    if (!load(&why)) return fail(why);
    Job* job = Job_by_index(index);
    if (job == nullptr) return fail("job \"" + key + "\" left the queue while restarting");
    CtlTasks tasks;
    if (!Ctl_read_tasks(&tasks)) return fail("cannot read the task file");
    int active = Ctl_active_tasks(tasks, job);
    if (active == 0) break;
    if (std::chrono::steady_clock::now() > until) {
      return fail("job \"" + key + "\" still has " + std::to_string(active) +
                  " task(s) running after " + std::to_string(static_cast<int>(timeout_seconds)) +
                  " s; it stays \"restarted\" (run restart again later)");
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
  }
  // Clear the group, then make the job pending from frame one.
  int cleared = Task_file_rewrite([&](TaskGroup** groups) {
    Job* job = Job_by_index(index);
    TaskGroup* g = job != nullptr ? TaskGroup_by_job(*groups, job) : nullptr;
    if (g == nullptr) return false;
    TaskGroup_free(groups, g);
    return true;
  });
  if (cleared < 0) return fail("cannot rewrite the task file");
  r = Ctl_edit_jobs(
      [&](std::string* why, std::vector<std::string>* wake) {
        Job* job = Job_by_index(index);
        if (job == nullptr) {
          *why = "job \"" + key + "\" left the queue while restarting";
          return false;
        }
        job->doneframes = 0;
        job->comment.reset();
        job->status.set("pending");
        *wake = Ctl_job_hosts(job);
        return true;
      },
      &why);
  return finish(r, why);
}

int Cmd_hosts(bool json) {
  std::string why;
  if (!load(&why)) return fail(why);
  CtlTasks tasks;
  if (!Ctl_read_tasks(&tasks)) return fail("cannot read the task file");
  if (json) {
    printf("%s\n", Out_hosts_json(tasks).dump(2).c_str());
  } else {
    Out_hosts_table(stdout, tasks, Out_colour(stdout));
  }
  return 0;
}

int Cmd_host_change(const std::string& what, const HostOptions& o, bool force) {
  std::string why;
  if (what == "add" && !Ctl_word_ok(o.name, &why)) return fail(why);
  if (!o.host.empty() && !Ctl_word_ok(o.host, &why)) return fail(why);
  if (o.processors == 0 || o.processors < -1) return fail("--processors must be at least 1");
  if (o.frames == 0 || o.frames < -1) return fail("--frames must be at least 1");
  return finish(Ctl_edit_devs(
                    [&](std::string* why, std::vector<std::string>* wake) {
                      Dev* dev;
                      if (what == "add") {
                        if (Dev_by_name(o.name.c_str()) != nullptr) {
                          *why = "host \"" + o.name + "\" exists already";
                          return false;
                        }
                        dev = Add_a_dev(nullptr, o.name.c_str(), RJCget_next_index(FILE_DEV_INDEX));
                        dev->host_name.set(o.host.empty() ? o.name.c_str() : o.host.c_str());
                        dev->status = LOCK_AVAILABLE;
                        dev->num_processors = 1;
                      } else {
                        dev = editable_dev(o.name, force, why);
                        if (dev == nullptr) return false;
                      }
                      wake->push_back(dev->host_name.or_else(o.name.c_str()));
                      if (what == "remove") {
                        Dev_del(dev);
                        return true;
                      }
                      if (what == "lock") dev->status = LOCK_LOCKED;
                      if (what == "unlock")
                        dev->status = grid_empty(dev->locks) ? LOCK_AVAILABLE : LOCK_SCHEDULE;
                      if (!o.host.empty()) dev->host_name.set(o.host.c_str());
                      if (o.processors > 0) dev->num_processors = o.processors;
                      if (o.frames > 0) dev->max_frames = o.frames;
                      wake->push_back(dev->host_name.c_str());
                      return true;
                    },
                    &why),
                why);
}

int Cmd_host_schedule(const std::string& name, const std::vector<std::string>& texts, bool force) {
  std::string why;
  std::vector<CtlBlock> blocks;
  for (const auto& s : texts) {
    CtlBlock b;
    if (!Ctl_parse_block(s, &b, &why)) return fail(why);
    blocks.push_back(b);
  }
  return finish(Ctl_edit_devs(
                    [&](std::string* why, std::vector<std::string>* wake) {
                      Dev* dev = editable_dev(name, force, why);
                      if (dev == nullptr) return false;
                      for (int i = 0; i < RJ_WEEK_SCAN; i++) dev->locks[i] = 0;
                      for (const auto& b : blocks)
                        Ctl_apply_block(b, [&](int s, int e, const char* f, const char* l) {
                          Schedule_dev_lock(dev, s, e, f, l);
                        });
                      dev->status = blocks.empty() ? LOCK_AVAILABLE : LOCK_SCHEDULE;
                      wake->push_back(dev->host_name.or_else(name.c_str()));
                      return true;
                    },
                    &why),
                why);
}

int Cmd_check(bool json) {
  std::string why;
  if (!load(&why)) return fail(why);
  int put_back = 0;
  for (Job* j = rndctl.jobs; j != nullptr; j = j->next) put_back += Task_file_check(j);
  Editor_process_list(0);
  int jobs_fixed = 0, devs_fixed = 0;
  CtlEdit r = Ctl_edit_jobs(
      [&](std::string*, std::vector<std::string>*) {
        std::vector<std::pair<int, std::string>> before;
        for (Job* j = rndctl.jobs; j != nullptr; j = j->next)
          before.push_back({j->lock_pid, j->user.or_else("")});
        Job_field_check();
        size_t i = 0;
        for (Job* j = rndctl.jobs; j != nullptr; j = j->next, i++)
          if (before[i].first != j->lock_pid || before[i].second != j->user.or_else(""))
            jobs_fixed++;
        return true;
      },
      &why);
  if (r != CTL_WRITTEN) return fail(why);
  r = Ctl_edit_devs(
      [&](std::string*, std::vector<std::string>*) {
        std::vector<int> before;
        for (Dev* d = rndctl.devs; d != nullptr; d = d->next) before.push_back(d->lock_pid);
        Dev_field_check();
        size_t i = 0;
        for (Dev* d = rndctl.devs; d != nullptr; d = d->next, i++)
          if (before[i] != d->lock_pid) devs_fixed++;
        return true;
      },
      &why);
  if (r != CTL_WRITTEN) return fail(why);
  if (json) {
    nlohmann::json j = {
        {"jobs_put_back", put_back}, {"jobs_fixed", jobs_fixed}, {"hosts_fixed", devs_fixed}};
    printf("%s\n", j.dump(2).c_str());
  } else {
    printf("jobs with tasks put back: %d\njobs fixed: %d\nhosts fixed: %d\n", put_back, jobs_fixed,
           devs_fixed);
  }
  return 0;
}

namespace {

// The output streams of `job`'s tasks on `dev` that this machine holds,
// newest first.  The daemon writes a render's messages to
// "TMPDIR/JOB.RESOURCE.N" (N counts that daemon's tasks) and removes the file
// when the task ends, so a name alone cannot tell two tasks of one job on
// one host apart.
std::vector<std::string> local_streams(const Job* job, const Dev* dev) {
  std::vector<std::pair<struct timespec, std::string>> found;
  std::string prefix = std::string(job->name.or_else("")) + "." + dev->name.or_else("") + ".";
  const char* dir = rj_tmpdir();
  DIR* d = opendir(dir);
  if (d == nullptr) return {};
  while (const struct dirent* e = readdir(d)) {
    const char* n = e->d_name;
    if (strncmp(n, prefix.c_str(), prefix.size()) != 0) continue;
    const char* counter = n + prefix.size();
    if (*counter == '\0' || strspn(counter, "0123456789") != strlen(counter)) continue;
    std::string path = std::string(dir) + "/" + n;
    struct stat st;
    if (stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode)) found.push_back({st.st_mtim, path});
  }
  closedir(d);
  std::sort(found.begin(), found.end(), [](const auto& a, const auto& b) {
    if (a.first.tv_sec != b.first.tv_sec) return a.first.tv_sec > b.first.tv_sec;
    return a.first.tv_nsec > b.first.tv_nsec;
  });
  std::vector<std::string> paths;
  for (auto& f : found) paths.push_back(std::move(f.second));
  return paths;
}

int show_stream(const Job* job, const TaskRec* r) {
  const Dev* dev = r->dev;
  if (dev == nullptr || (r->status != TASK_STARTED && r->status != TASK_RUNNING)) {
    printf("task %d is not running: a task's output stream lasts only while it runs\n", r->id);
    return 0;
  }
  if (!rj_dev_is_this_host(dev)) {
    printf(
        "task %d runs on %s: its output stream is there, in %s:TMPDIR/%s.%s.N "
        "(TMPDIR: that daemon's DRCTMPDIR, else /usr/tmp or /var/tmp)\n",
        r->id, dev->host_name.or_else(dev->name.or_else("?")), dev->host_name.or_else("?"),
        job->name.or_else("?"), dev->name.or_else("?"));
    return 0;
  }
  std::vector<std::string> paths = local_streams(job, dev);
  if (paths.empty())
    return fail("task " + std::to_string(r->id) + " has no output stream in " + rj_tmpdir() +
                " yet");
  for (const auto& path : paths) {
    // Several tasks of the job may run here at once: then each is named.
    if (paths.size() > 1) printf("== %s\n", path.c_str());
    fputs(read_whole(path).c_str(), stdout);
  }
  return 0;
}

}  // namespace

int Cmd_log(const std::string& key, int task) {
  std::string why;
  if (!load(&why)) return fail(why);
  Job* job = Ctl_find_job(key);
  if (job == nullptr) return fail("no job \"" + key + "\"");
  std::string path =
      std::string(rndctl.location.c_str()) + "/JOBLOG/" + RJC_label_form(job->name.c_str());
  if (task < 0) {
    std::string log = read_whole(path);
    if (log.empty()) return fail("job \"" + key + "\" has no log yet");
    fputs(log.c_str(), stdout);
    return 0;
  }
  CtlTasks tasks;
  if (!Ctl_read_tasks(&tasks)) return fail("cannot read the task file");
  for (TaskGroup* g = tasks.groups; g != nullptr; g = g->next) {
    if (g->job == nullptr || g->job->index != job->index) continue;
    for (TaskRec* r = g->tasks; r != nullptr; r = r->next) {
      if (r->id != task) continue;
      printf("task %d %g-%g %s at %g on %s\n", r->id, static_cast<double>(r->start),
             static_cast<double>(r->end), GetTaskStatusStr(r->status),
             static_cast<double>(r->current), r->dev != nullptr ? r->dev->name.or_else("-") : "-");
      if (r->output) printf("%s\n", r->output.c_str());
      fflush(stdout);
      return show_stream(job, r);
    }
  }
  return fail("job \"" + key + "\" has no task " + std::to_string(task));
}
