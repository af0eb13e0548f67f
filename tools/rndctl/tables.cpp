#include "tools/rndctl/tables.h"

#include <unistd.h>

#include <cstdlib>
#include <cstring>

namespace {

const char* run_name(int ctrl) {
  switch (ctrl) {
    case RUN_PAUSED:
      return "PAUSED";
    case RUN_SCHEDULE:
      return "SCHEDULE";
    case RUN_NOW:
      return "NOW";
    default:
      return "AVAILABLE";
  }
}

const char* lock_name(int status) {
  switch (status) {
    case LOCK_LOCKED:
      return "LOCKED";
    case LOCK_AVAILABLE:
      return "AVAILABLE";
    case LOCK_SCHEDULE:
      return "SCHEDULE";
    default:
      return "-";
  }
}

std::string hosts_of(const Job* job) {
  std::string s;
  for (const RndDevList* e = job->resources; e != nullptr; e = e->next) {
    if (e->dev == nullptr || !e->dev->name) continue;
    if (!s.empty()) s += ",";
    s += e->dev->name.c_str();
  }
  return s.empty() ? "all" : s;
}

const char* state_colour(const Job* job) {
  if (job->status.is("finished")) return "\033[32m";
  if (job->status.is("failed") || job->status.is("aborted")) return "\033[31m";
  if (job->status.is("pending") || job->status.is("none")) return "";
  return "\033[33m";
}

nlohmann::json tasks_json(const CtlTasks& tasks, const Job* job) {
  nlohmann::json out = nlohmann::json::array();
  for (const TaskGroup* g = tasks.groups; g != nullptr; g = g->next) {
    if (g->job == nullptr || g->job->index != job->index) continue;
    for (const TaskRec* r = g->tasks; r != nullptr; r = r->next) {
      out.push_back({{"id", r->id},
                     {"start", r->start},
                     {"end", r->end},
                     {"current", r->current},
                     {"status", GetTaskStatusStr(r->status)},
                     {"retries", r->retries},
                     {"host", r->dev != nullptr ? r->dev->name.or_else("") : ""}});
    }
  }
  return out;
}

// Whether `host`'s lock schedule holds it now (not only its lock state).
bool locked_now(const Dev* dev) {
  if (dev->status == LOCK_LOCKED) return true;
  if (dev->status != LOCK_SCHEDULE) return false;
  int i = get_current_schedule_index();
  return i >= 0 && i < RJ_WEEK && dev->locks[i] != 0;
}

std::string renders_on(const CtlTasks& tasks, const Dev* dev) {
  std::string s;
  for (const TaskGroup* g = tasks.groups; g != nullptr; g = g->next) {
    for (const TaskRec* r = g->tasks; r != nullptr; r = r->next) {
      if (r->dev != dev || (r->status != TASK_RUNNING && r->status != TASK_STARTED)) continue;
      char item[160];
      snprintf(item, sizeof item, "%s%s:%g-%g", s.empty() ? "" : " ",
               g->job != nullptr ? g->job->name.or_else("?") : "?", static_cast<double>(r->start),
               static_cast<double>(r->end));
      s += item;
    }
  }
  return s;
}

}  // namespace

bool Out_colour(FILE* fp) {
  const char* no = getenv("NO_COLOR");
  return (no == nullptr || *no == '\0') && isatty(fileno(fp));
}

double Out_job_fraction(const Job* job) {
  if (job->status.is("finished")) return 1.0;
  float pct = 0;
  if (get_fvalue(job->status.c_str(), &pct)) return std::min(1.0, std::max(0.0, pct / 100.0));
  if (job->totalframes > 0) return static_cast<double>(job->doneframes) / job->totalframes;
  return 0.0;
}

std::string Out_bar(double fraction, int width) {
  if (width < 3) return "";
  int inner = width - 2;
  int full = static_cast<int>(fraction * inner + 0.5);
  full = std::max(0, std::min(inner, full));
  return "[" + std::string(static_cast<size_t>(full), '#') +
         std::string(static_cast<size_t>(inner - full), '.') + "]";
}

std::string Out_fit(const std::string& text, size_t width) {
  if (text.size() <= width) return text;
  if (width == 0) return "";
  return text.substr(0, width - 1) + "~";
}

nlohmann::json Out_job_json(const Job* job, const CtlTasks* tasks) {
  nlohmann::json hosts = nlohmann::json::array();
  for (const RndDevList* e = job->resources; e != nullptr; e = e->next)
    if (e->dev != nullptr && e->dev->name) hosts.push_back(e->dev->name.c_str());
  nlohmann::json j = {{"index", job->index},
                      {"name", job->name.or_else("")},
                      {"user", job->user.or_else("")},
                      {"state", job->status.or_else("")},
                      {"priority", job->priority},
                      {"frames", {job->frames[0], job->frames[1], job->frames[2]}},
                      {"doneframes", job->doneframes},
                      {"totalframes", job->totalframes},
                      {"hosts", hosts},
                      {"run", run_name(job->ctrl)},
                      {"scene", job->sdl.or_else("")},
                      {"executable", job->executable.or_else("")},
                      {"held_by", job->lock_pid}};
  if (tasks != nullptr) {
    j["comment"] = job->comment.or_else("");
    j["tasks"] = tasks_json(*tasks, job);
  }
  return j;
}

nlohmann::json Out_jobs_json(const CtlTasks* tasks) {
  nlohmann::json out = nlohmann::json::array();
  for (const Job* j = rndctl.jobs; j != nullptr; j = j->next) out.push_back(Out_job_json(j, tasks));
  return out;
}

nlohmann::json Out_hosts_json(const CtlTasks& tasks) {
  nlohmann::json out = nlohmann::json::array();
  for (const Dev* d = rndctl.devs; d != nullptr; d = d->next) {
    const char* host = d->host_name.or_else(d->name.or_else(""));
    out.push_back({{"index", d->index},
                   {"name", d->name.or_else("")},
                   {"host", host},
                   {"lock", lock_name(d->status)},
                   {"locked_now", locked_now(d)},
                   {"alive", Ctl_daemon_alive(host)},
                   {"processors", d->num_processors},
                   {"max_frames", d->max_frames},
                   {"renders", renders_on(tasks, d)}});
  }
  return out;
}

void Out_jobs_table(FILE* fp, bool colour) {
  // 80 columns at most, and no blanks after the last one.
  fprintf(fp, "%5s %-14s %-8s %-10s %3s %11s %-13s %s\n", "INDEX", "NAME", "USER", "STATE", "PRI",
          "FRAMES", "HOSTS", "RUN");
  for (const Job* j = rndctl.jobs; j != nullptr; j = j->next) {
    char frames[32];
    snprintf(frames, sizeof frames, "%d/%d", j->doneframes, j->totalframes);
    std::string state = Out_fit(j->status.or_else("-"), 10);
    // Pad before colouring: escapes would count as columns.
    char padded[16];
    snprintf(padded, sizeof padded, "%-10s", state.c_str());
    fprintf(fp, "%5d %-14s %-8s %s%s%s %3d %11s %-13s %s\n", j->index,
            Out_fit(j->name.or_else("-"), 14).c_str(), Out_fit(j->user.or_else("-"), 8).c_str(),
            colour ? state_colour(j) : "", padded, colour && *state_colour(j) ? "\033[0m" : "",
            j->priority, frames, Out_fit(hosts_of(j), 13).c_str(), run_name(j->ctrl));
  }
}

void Out_hosts_table(FILE* fp, const CtlTasks& tasks, bool colour) {
  fprintf(fp, "%-12s %-12s %-9s %-6s %-5s %4s %4s %s\n", "NAME", "HOST", "LOCK", "NOW", "DEMON",
          "PROC", "FRM", "RENDERS");
  for (const Dev* d = rndctl.devs; d != nullptr; d = d->next) {
    const char* host = d->host_name.or_else(d->name.or_else(""));
    bool alive = Ctl_daemon_alive(host);
    bool now = locked_now(d);
    std::string r = renders_on(tasks, d);
    fprintf(fp, "%-12s %-12s %-9s %s%-6s%s %s%-5s%s %4d %4d %s\n",
            Out_fit(d->name.or_else("-"), 12).c_str(), Out_fit(host, 12).c_str(),
            lock_name(d->status), colour && now ? "\033[31m" : "", now ? "locked" : "free",
            colour && now ? "\033[0m" : "", colour && !alive ? "\033[31m" : "",
            alive ? "up" : "down", colour && !alive ? "\033[0m" : "", d->num_processors,
            d->max_frames, Out_fit(r.empty() ? "-" : r, 19).c_str());
  }
}

void Out_job_full(FILE* fp, const Job* job, const CtlTasks& tasks) {
  fprintf(fp, "job %d %s\n", job->index, job->name.or_else("-"));
  fprintf(fp, "  user        %s\n", job->user.or_else("-"));
  fprintf(fp, "  state       %s\n", job->status.or_else("-"));
  fprintf(fp, "  run         %s\n", run_name(job->ctrl));
  fprintf(fp, "  priority    %d\n", job->priority);
  fprintf(fp, "  scene       %s\n", job->sdl.or_else("-"));
  fprintf(fp, "  executable  %s\n", job->executable.or_else("-"));
  fprintf(fp, "  pix         %s\n", job->pix.or_else("-"));
  fprintf(fp, "  frames      %g-%g:%g  done %d/%d\n", static_cast<double>(job->frames[0]),
          static_cast<double>(job->frames[1]), static_cast<double>(job->frames[2]), job->doneframes,
          job->totalframes);
  fprintf(fp, "  hosts       %s\n", hosts_of(job).c_str());
  if (job->lock_pid != 0) fprintf(fp, "  held by     pid %d\n", job->lock_pid);
  if (job->comment) fprintf(fp, "  comment\n%s\n", job->comment.c_str());
  fprintf(fp, "  tasks\n");
  for (const TaskGroup* g = tasks.groups; g != nullptr; g = g->next) {
    if (g->job == nullptr || g->job->index != job->index) continue;
    for (const TaskRec* r = g->tasks; r != nullptr; r = r->next)
      fprintf(fp, "    %3d %8g-%-8g %-9s at %-8g retries %d %s\n", r->id,
              static_cast<double>(r->start), static_cast<double>(r->end),
              GetTaskStatusStr(r->status), static_cast<double>(r->current), r->retries,
              r->dev != nullptr ? r->dev->name.or_else("") : "");
  }
}
