#include "tools/rndctl/state.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <nlohmann/json.hpp>

#include "tools/rndctl/tables.h"

namespace {

constexpr unsigned char kPngSignature[8] = {0x89, 'P', 'N', 'G', '\r', '\n', 0x1a, '\n'};
// A frame larger than this is not a preview any browser should be sent.
constexpr off_t kFrameLimit = 64 << 20;
// Host lists depend on the clock too (a heartbeat ages, a lock schedule
// starts): rebuilt at least this often even when no file moved.
constexpr time_t kHostsEvery = 5;

struct CloseFd {
  int fd;
  ~CloseFd() {
    if (fd >= 0) close(fd);
  }
};
struct CloseDir {
  void operator()(DIR* d) const { closedir(d); }
};
using ScopedDIR = std::unique_ptr<DIR, CloseDir>;

std::string location() { return rndctl.location.or_else("."); }

// The blocks of a week grid as the job file writes them ("800-1700 Monday-Friday").
std::string schedule_text(const int* grid) {
  int copy[RJ_WEEK_SCAN];
  memcpy(copy, grid, sizeof copy);
  std::string text;
  int times[2];
  const char* days[2];
  while (Schedule_get_a_block(copy, times, days) != 0) {
    char block[96];
    if (strcmp(days[0], days[1]) == 0)
      snprintf(block, sizeof block, "%s%d-%d %s", text.empty() ? "" : ", ", times[0], times[1],
               days[0]);
    else
      snprintf(block, sizeof block, "%s%d-%d %s-%s", text.empty() ? "" : ", ", times[0], times[1],
               days[0], days[1]);
    text += block;
  }
  return text;
}

ServeJobFiles job_files(const Job* job, const CtlTasks& tasks) {
  ServeJobFiles f;
  f.log_path = location() + "/JOBLOG/" + RJC_label_form(job->name.c_str());
  if (!job->pix) return f;
  std::string pix = job->pix.c_str();
  size_t slash = pix.rfind('/');
  std::string dir = slash == std::string::npos ? "." : pix.substr(0, slash);
  f.base = slash == std::string::npos ? pix : pix.substr(slash + 1);
  // A relative path is the render program's, which runs in the project.
  std::string project;
  if (dir[0] != '/' && rj_project_dir_of(job->sdl.c_str(), &project)) dir = project + "/" + dir;
  f.out_dir = dir;
  for (const TaskGroup* g = tasks.groups; g != nullptr; g = g->next) {
    if (g->job == nullptr || g->job->index != job->index) continue;
    for (const TaskRec* r = g->tasks; r != nullptr; r = r->next) {
      if (r->dev == nullptr || (r->status != TASK_RUNNING && r->status != TASK_STARTED)) continue;
      f.running.push_back({r->id, "out." + f.base + "." +
                                      r->dev->host_name.or_else(r->dev->name.or_else("")) + "." +
                                      r->dev->name.or_else("") + "."});
    }
  }
  return f;
}

nlohmann::json job_json(const Job* job, const CtlTasks* tasks) {
  nlohmann::json j = Out_job_json(job, tasks);
  j["comment"] = job->comment.or_else("");
  j["percent"] = Out_job_fraction(job) * 100.0;
  j["schedule"] = schedule_text(job->runs);
  if (tasks != nullptr) j["pix"] = job->pix.or_else("");
  return j;
}

// This host's lines of the shared access log ("* msg --  HOST:prog(pid) time").
std::vector<std::string> host_lines(const std::string& log, const std::string& host, size_t keep) {
  std::vector<std::string> lines;
  std::string mark = "--  " + host + ":";
  size_t end = log.size();
  while (end > 0 && lines.size() < keep) {
    size_t start = log.rfind('\n', end - 1);
    start = start == std::string::npos ? 0 : start + 1;
    std::string line = log.substr(start, end - start);
    if (line.find(mark) != std::string::npos) lines.insert(lines.begin(), line);
    if (start == 0) break;
    end = start - 1;
  }
  return lines;
}

// What a host's status file says it renders: "job index status output" lines.
nlohmann::json host_status(const std::string& host) {
  nlohmann::json out = nlohmann::json::array();
  std::string text = State_tail(location() + "/TSKSTAT/" + host, 1 << 16);
  for (const std::string& line : Text_lines(text)) {
    char job[256], output[1024];
    int index = 0, status = 0;
    if (sscanf(line.c_str(), "%255s %d %d %1023s", job, &index, &status, output) != 4) continue;
    out.push_back(
        {{"job", job}, {"index", index}, {"status", GetTaskStatusStr(status)}, {"output", output}});
  }
  return out;
}

std::string hosts_json(const CtlTasks& tasks) {
  nlohmann::json hosts = Out_hosts_json(tasks);
  std::string log = State_tail(location() + "/Render_Access", 1 << 16);
  size_t i = 0;
  for (const Dev* d = rndctl.devs; d != nullptr && i < hosts.size(); d = d->next, i++) {
    std::string host = d->host_name.or_else(d->name.or_else(""));
    hosts[i]["schedule"] = schedule_text(d->locks);
    hosts[i]["status"] = host_status(host);
    hosts[i]["log"] = host_lines(log, host, 5);
  }
  return hosts.dump();
}

// Stamps of the files that only touch the host list.
std::map<std::string, ServeStamp> around_stamps() {
  std::map<std::string, ServeStamp> out;
  std::string loc = location();
  out["Render_Access"] = State_stamp(loc + "/Render_Access");
  for (const Dev* d = rndctl.devs; d != nullptr; d = d->next) {
    std::string host = d->host_name.or_else(d->name.or_else(""));
    out[host + ".pid"] = State_stamp(loc + "/" + host + ".pid");
    out["TSKSTAT/" + host] = State_stamp(loc + "/TSKSTAT/" + host);
  }
  return out;
}

bool frame_name(const std::string& base, const std::string& name, long* number) {
  if (base.empty() || name.size() <= base.size() + 1 || name.compare(0, base.size(), base) != 0 ||
      name[base.size()] != '.')
    return false;
  const char* p = name.c_str() + base.size() + 1;
  char* end = nullptr;
  if (*p < '0' || *p > '9') return false;
  *number = strtol(p, &end, 10);
  if (*end == '\0') return true;
  // One extension of letters and digits after the number.
  if (*end != '.' || end[1] == '\0') return false;
  for (const char* e = end + 1; *e != '\0'; e++)
    if (!isalnum(static_cast<unsigned char>(*e))) return false;
  return true;
}

bool png_head(int fd) {
  unsigned char head[8];
  return pread(fd, head, sizeof head, 0) == static_cast<ssize_t>(sizeof head) &&
         memcmp(head, kPngSignature, sizeof head) == 0;
}

}  // namespace

ServeStamp State_stamp(const std::string& path) {
  ServeStamp s;
  struct stat st;
  if (stat(path.c_str(), &st) != 0) return s;
  s.mtime = st.st_mtim;
  s.size = st.st_size;
  s.ino = st.st_ino;
  return s;
}

std::shared_ptr<const ServeSnapshot> State_current(const ServeState& state) {
  std::lock_guard<std::mutex> hold(state.mu);
  return state.snap;
}

bool State_refresh(ServeState* state) {
  static const char* const kControl[3] = {"Render_Job_Control", "Render_Resource_Control",
                                          "Render_Tasks"};
  std::shared_ptr<const ServeSnapshot> old = State_current(*state);
  ServeStamp now[3];
  bool control = !state->loaded;
  for (int i = 0; i < 3; i++) {
    now[i] = State_stamp(location() + "/" + kControl[i]);
    if (!(now[i] == state->control[i])) control = true;
  }
  std::map<std::string, ServeStamp> around =
      control ? std::map<std::string, ServeStamp>{} : around_stamps();
  time_t t = time(nullptr);
  bool hosts = control || around != state->around || t - state->hosts_built >= kHostsEvery;
  // The usual look: nothing moved, nothing copied.
  if (!hosts) return false;
  auto next = std::make_shared<ServeSnapshot>(*old);
  if (control) {
    std::string why;
    auto tasks = std::make_unique<CtlTasks>();
    if (!Ctl_load(&why) || !Ctl_read_tasks(tasks.get())) {
      // Keep what was shown; the stamps stay old so the next look retries.
      if (why.empty()) why = "cannot read the task file";
      state->loaded = false;
      state->tasks.reset();
      if (old->problem == why) return false;
      next->problem = why;
      next->generation++;
      std::lock_guard<std::mutex> hold(state->mu);
      state->snap = next;
      return true;
    }
    state->tasks = std::move(tasks);
    state->loaded = true;
    state->loads++;
    std::copy(now, now + 3, state->control);
    auto part = std::make_shared<ServeJobs>();
    nlohmann::json jobs = nlohmann::json::array();
    for (const Job* j = rndctl.jobs; j != nullptr; j = j->next) {
      jobs.push_back(job_json(j, nullptr));
      part->detail[j->index] = job_json(j, state->tasks.get()).dump();
      part->files[j->index] = job_files(j, *state->tasks);
    }
    part->json = jobs.dump();
    if (part->json != old->jobs->json || part->detail != old->jobs->detail) next->jobs = part;
    next->problem.clear();
    around = around_stamps();  // the host list may have changed with the load
  }
  if (state->tasks) {
    state->around = std::move(around);
    state->hosts_built = t;
    next->hosts = hosts_json(*state->tasks);
  }
  if (next->jobs == old->jobs && next->hosts == old->hosts && next->problem == old->problem)
    return false;
  next->generation = old->generation + 1;
  std::lock_guard<std::mutex> hold(state->mu);
  state->snap = next;
  return true;
}

std::vector<std::string> State_frames(const ServeJobFiles& files, std::string* newest) {
  std::vector<std::pair<long, std::string>> found;
  if (newest != nullptr) newest->clear();
  if (files.out_dir.empty()) return {};
  ScopedDIR dir(opendir(files.out_dir.c_str()));
  if (!dir) return {};
  struct timespec latest {};
  while (struct dirent* e = readdir(dir.get())) {
    long number = 0;
    std::string name = e->d_name;
    if (!frame_name(files.base, name, &number)) continue;
    CloseFd fd{openat(dirfd(dir.get()), e->d_name, O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK)};
    struct stat st;
    if (fd.fd < 0 || fstat(fd.fd, &st) != 0 || !S_ISREG(st.st_mode) || !png_head(fd.fd)) continue;
    found.emplace_back(number, name);
    if (newest != nullptr &&
        (st.st_mtim.tv_sec > latest.tv_sec ||
         (st.st_mtim.tv_sec == latest.tv_sec && st.st_mtim.tv_nsec >= latest.tv_nsec))) {
      latest = st.st_mtim;
      *newest = name;
    }
  }
  std::sort(found.begin(), found.end());
  std::vector<std::string> names;
  for (auto& f : found) names.push_back(std::move(f.second));
  return names;
}

bool State_frame_bytes(const ServeJobFiles& files, const std::string& name, std::string* png) {
  long number = 0;
  if (files.out_dir.empty() || name.find('/') != std::string::npos ||
      !frame_name(files.base, name, &number))
    return false;
  CloseFd dir{open(files.out_dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)};
  if (dir.fd < 0) return false;
  // No links followed: a frame is a file the render wrote in place.
  CloseFd fd{openat(dir.fd, name.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK)};
  struct stat st;
  if (fd.fd < 0 || fstat(fd.fd, &st) != 0 || !S_ISREG(st.st_mode) || st.st_size > kFrameLimit ||
      !png_head(fd.fd))
    return false;
  png->resize(static_cast<size_t>(st.st_size));
  size_t got = 0;
  while (got < png->size()) {
    ssize_t n = pread(fd.fd, &(*png)[got], png->size() - got, static_cast<off_t>(got));
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    got += static_cast<size_t>(n);
  }
  png->resize(got);
  return got >= sizeof kPngSignature;
}

std::string State_tail(const std::string& path, size_t max_bytes) {
  CloseFd fd{open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK)};
  struct stat st;
  if (fd.fd < 0 || fstat(fd.fd, &st) != 0 || !S_ISREG(st.st_mode)) return "";
  off_t from =
      st.st_size > static_cast<off_t>(max_bytes) ? st.st_size - static_cast<off_t>(max_bytes) : 0;
  std::string text(static_cast<size_t>(st.st_size - from), '\0');
  ssize_t n = pread(fd.fd, text.data(), text.size(), from);
  text.resize(n > 0 ? static_cast<size_t>(n) : 0);
  if (from > 0) {
    size_t nl = text.find('\n');
    text.erase(0, nl == std::string::npos ? text.size() : nl + 1);
  }
  return text;
}
