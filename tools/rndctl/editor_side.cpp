#include "tools/rndctl/editor_side.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <optional>

#include "General/pst/pst.h"

namespace {

// The reader's fatal path ends the process; in the tool a file that does not
// parse is a refusal, so the parse is abandoned and reported instead.
bool parse_failed = false;
void parse_fails(int) { parse_failed = true; }

int day_number(const char* canonical) {
  for (int d = 0; d < 7; d++)
    if (strcmp(canonical, day_nametable[d][0]) == 0) return d;
  return -1;
}

bool parse_time(const std::string& text, bool end, int* hhmm) {
  if (text.empty() || text.size() > 4) return false;
  for (char c : text)
    if (c < '0' || c > '9') return false;
  int v = atoi(text.c_str());
  int h = v / 100, m = v % 100;
  if (m != 0 && m != 30) return false;  // the week grid holds half hours
  if (h > 24 || (h == 24 && (m != 0 || !end))) return false;
  *hhmm = v;
  return true;
}

void free_lists() {
  rndctl.current_job = nullptr;
  rndctl.current_dev = nullptr;
  while (rndctl.jobs != nullptr) Job_del(rndctl.jobs);
  while (rndctl.devs != nullptr) Dev_del(rndctl.devs);
}

// The whole of an open control-file stream.
std::string slurp(FILE* fp) {
  std::string bytes;
  // One allocation for the whole file: growing by doubling touches every
  // page of a large job file several times.
  struct stat st;
  if (fileno(fp) >= 0 && fstat(fileno(fp), &st) == 0 && st.st_size > 0)
    bytes.reserve(static_cast<size_t>(st.st_size));
  char buf[1 << 16];
  size_t n;
  while ((n = fread(buf, 1, sizeof buf, fp)) > 0) bytes.append(buf, n);
  return bytes;
}

bool parse(const std::string& bytes, int index) {
  if (bytes.empty()) return true;
  parse_failed = false;
  int r = RJC_parse_string(bytes.data(), bytes.size(), fileop_path(index));
  return r == 0 && !parse_failed;
}

bool read_locked(int index, std::string* bytes) {
  FileopLock lock(index);
  if (!lock.held()) return false;
  FILE* fp = read_fileop(index);
  if (fp == nullptr) return false;
  *bytes = slurp(fp);
  return close_fileop(index) == 0;
}

std::string render(int index) {
  char* buf = nullptr;
  size_t size = 0;
  FILE* fp = open_memstream(&buf, &size);
  if (fp == nullptr) return std::string();
  if (index == FILE_JOBS)
    Job_control_write_dev(fp);
  else
    Resource_control_write_dev(fp);
  fclose(fp);
  std::string text(buf != nullptr ? buf : "", size);
  free(buf);  // open_memstream's, from the C library
  return text;
}

int count_jobs() {
  int n = 0;
  for (Job* j = rndctl.jobs; j != nullptr; j = j->next) n++;
  return n;
}
int count_devs() {
  int n = 0;
  for (Dev* d = rndctl.devs; d != nullptr; d = d->next)
    if (d->name) n++;
  return n;
}

// Whether the reader takes `jobs` and `devs` back whole: parsed into
// lists of their own, set aside from the control block's for the proof.
bool reads_back(const std::string& devs, const std::string& jobs, int want_devs, int want_jobs) {
  Job* keep_jobs = rndctl.jobs;
  Dev* keep_devs = rndctl.devs;
  Job* keep_cj = rndctl.current_job;
  Dev* keep_cd = rndctl.current_dev;
  auto ji = std::move(rndctl.job_index);
  auto di = std::move(rndctl.dev_index);
  auto dn = std::move(rndctl.dev_name_index);
  rndctl.jobs = nullptr;
  rndctl.devs = nullptr;
  rndctl.job_index = {};
  rndctl.dev_index = {};
  rndctl.dev_name_index = {};
  bool ok = parse(devs, FILE_RESOURCES) && parse(jobs, FILE_JOBS) && count_devs() == want_devs &&
            count_jobs() == want_jobs;
  free_lists();
  rndctl.jobs = keep_jobs;
  rndctl.devs = keep_devs;
  rndctl.current_job = keep_cj;
  rndctl.current_dev = keep_cd;
  rndctl.job_index = std::move(ji);
  rndctl.dev_index = std::move(di);
  rndctl.dev_name_index = std::move(dn);
  return ok;
}

// Replaces the file held open for update with `text`.
bool replace(int index, const std::string& text) {
  FILE* fp = update_fileop(index);
  if (fp == nullptr) return false;
  rewind_fileop(index);
  bool ok = fwrite(text.data(), 1, text.size(), fp) == text.size();
  return close_and_truncate_fileop(index) == 0 && ok;
}

CtlEdit edit(int index,
             const std::function<bool(std::string* why, std::vector<std::string>* wake)>& change,
             std::string* why) {
  std::vector<std::string> wake;
  {
    // Job file first, then the resource file, as the daemons take them.
    FileopLock jobs_lock(FILE_JOBS);
    if (!jobs_lock.held()) {
      *why = "cannot lock the job file";
      return CTL_FAILED;
    }
    // The resource file's lock is held for its read alone, or to the end
    // when the resource file is the one rewritten.
    std::optional<FileopLock> devs_lock(std::in_place, FILE_RESOURCES);
    std::string dev_bytes, job_bytes;
    FILE* dp = devs_lock->held() ? read_fileop(FILE_RESOURCES) : nullptr;
    if (dp == nullptr) {
      *why = "cannot read the resource file";
      return CTL_FAILED;
    }
    dev_bytes = slurp(dp);
    (void)close_fileop(FILE_RESOURCES);
    if (index == FILE_JOBS) devs_lock.reset();
    FILE* fp = read_fileop(FILE_JOBS);
    if (fp == nullptr) {
      *why = "cannot read the job file";
      return CTL_FAILED;
    }
    job_bytes = slurp(fp);
    (void)close_fileop(FILE_JOBS);

    free_lists();
    if (!parse(dev_bytes, FILE_RESOURCES) || !parse(job_bytes, FILE_JOBS)) {
      *why = "the control files do not parse; nothing changed";
      return CTL_FAILED;
    }
    if (!change(why, &wake)) return CTL_REFUSED;
    // The writer drops jobs marked deleted: count what must come back first.
    int want_jobs = 0;
    for (Job* j = rndctl.jobs; j != nullptr; j = j->next)
      if (!j->deleted) want_jobs++;
    int want_devs = count_devs();
    std::string devs = render(FILE_RESOURCES);
    std::string jobs = render(FILE_JOBS);
    if (!reads_back(devs, jobs, want_devs, want_jobs)) {
      *why = "the change would make a file the daemons cannot read; nothing written";
      return CTL_REFUSED;
    }
    if (index == FILE_RESOURCES) {
      if (!replace(FILE_RESOURCES, devs)) {
        *why = "cannot write the resource file";
        return CTL_FAILED;
      }
    } else if (!replace(FILE_JOBS, jobs)) {
      *why = "cannot write the job file";
      return CTL_FAILED;
    }
  }
  Ctl_wake(wake);
  return CTL_WRITTEN;
}

}  // namespace

bool Ctl_parse_frames(const std::string& text, CtlFrames* out, std::string* why) {
  // "S-E[:BY]": the separating '-' is the first one after the start's digits.
  CtlFrames f;
  const char* s = text.c_str();
  char* end = nullptr;
  errno = 0;
  f.start = strtof(s, &end);
  if (end == s || *end != '-') {
    *why = "bad frame range \"" + text + "\" (want START-END[:BY])";
    return false;
  }
  const char* e = end + 1;
  f.end = strtof(e, &end);
  if (end == e) {
    *why = "bad frame range \"" + text + "\" (want START-END[:BY])";
    return false;
  }
  if (*end == ':') {
    const char* b = end + 1;
    f.by = strtof(b, &end);
    if (end == b) {
      *why = "bad frame step in \"" + text + "\"";
      return false;
    }
  }
  if (*end != '\0' || errno == ERANGE) {
    *why = "bad frame range \"" + text + "\" (want START-END[:BY])";
    return false;
  }
  if (!(f.by > 0)) {
    *why = "frame step must be positive in \"" + text + "\"";
    return false;
  }
  if (f.end < f.start) {
    *why = "frame range \"" + text + "\" runs backwards";
    return false;
  }
  *out = f;
  return true;
}

bool Ctl_parse_block(const std::string& text, CtlBlock* out, std::string* why) {
  auto bad = [&](const char* what) {
    *why = std::string(what) + " in schedule \"" + text + "\" (want HHMM-HHMM Day[-Day])";
    return false;
  };
  size_t blank = text.find(' ');
  if (blank == std::string::npos) return bad("no days");
  std::string times = text.substr(0, blank);
  std::string days = text.substr(text.find_first_not_of(' ', blank));
  size_t dash = times.find('-');
  if (dash == std::string::npos) return bad("no time range");
  CtlBlock b;
  if (!parse_time(times.substr(0, dash), false, &b.start) ||
      !parse_time(times.substr(dash + 1), true, &b.end))
    return bad("bad time (half hours, 0 to 2400)");
  if (b.start == b.end) return bad("empty time range");
  size_t ddash = days.find('-');
  std::string first = days.substr(0, ddash);
  std::string last = ddash == std::string::npos ? first : days.substr(ddash + 1);
  const char* f = Schedule_get_day(first.c_str());
  const char* l = Schedule_get_day(last.c_str());
  if (f == nullptr || l == nullptr) return bad("unknown day");
  if (day_number(l) < day_number(f)) return bad("days run backwards");
  b.first_day = f;
  b.last_day = l;
  *out = b;
  return true;
}

void Ctl_apply_block(const CtlBlock& block,
                     const std::function<void(int, int, const char*, const char*)>& fill) {
  if (block.start < block.end) {
    fill(block.start, block.end, block.first_day.c_str(), block.last_day.c_str());
    return;
  }
  fill(block.start, 2400, block.first_day.c_str(), block.last_day.c_str());
  if (block.end == 0) return;
  int first = day_number(block.first_day.c_str()) + 1;
  int last = day_number(block.last_day.c_str()) + 1;
  if (first <= 6) fill(0, block.end, day_nametable[first][0], day_nametable[std::min(last, 6)][0]);
  if (last == 7) fill(0, block.end, day_nametable[0][0], day_nametable[0][0]);
}

bool Ctl_string_ok(const std::string& text, std::string* why) {
  if (text.find('"') != std::string::npos || text.find('\n') != std::string::npos) {
    *why = "\"" + text + "\" holds a quote or a newline, which the control files cannot carry";
    return false;
  }
  if (text.size() > RJC_STRING_LIMIT) {
    *why = "text longer than " + std::to_string(RJC_STRING_LIMIT) + " characters";
    return false;
  }
  return true;
}

bool Ctl_word_ok(const std::string& text, std::string* why) {
  if (!RJC_is_word(text.c_str(), RJC_JOB_SECTION) ||
      !RJC_is_word(text.c_str(), RJC_RESOURCE_SECTION)) {
    *why = "\"" + text + "\" is not a name (letters, digits, . _ - # @; not a number or keyword)";
    return false;
  }
  return true;
}

std::vector<std::string> Ctl_split(const std::string& text, char separator) {
  std::vector<std::string> parts;
  size_t at = 0;
  while (at <= text.size()) {
    size_t end = text.find(separator, at);
    if (end == std::string::npos) end = text.size();
    if (end > at) parts.push_back(text.substr(at, end - at));
    at = end + 1;
  }
  return parts;
}

bool Ctl_open(const char* location, std::string* why) {
  if (location == nullptr) {
    // Asked here first: the library ends the process when neither is set,
    // and its lookup complains about a missing preferences file.
    const char* prefs = find_variable_file(0, nullptr, nullptr);
    if (prefs != nullptr && *prefs != '\0' && access(prefs, R_OK) == 0)
      location = get_zarno_variable("ZARNO_RNDCTL_LOCATION");
    if (location == nullptr) {
      *why = "no control directory: give -l DIR or set ZARNO_RNDCTL_LOCATION in the preferences";
      return false;
    }
  }
  RJC_fatal_exit = parse_fails;
  RJC_init_rndctl(location);
  fileop_poll_seconds = 1;
  return true;
}

bool Ctl_load(std::string* why) {
  std::string devs, jobs;
  if (!read_locked(FILE_RESOURCES, &devs) || !read_locked(FILE_JOBS, &jobs)) {
    *why = std::string("cannot read the control files in ") + rndctl.location.or_else("?");
    return false;
  }
  free_lists();
  if (!parse(devs, FILE_RESOURCES) || !parse(jobs, FILE_JOBS)) {
    *why = "the control files do not parse";
    return false;
  }
  return true;
}

Job* Ctl_find_job(const std::string& key) {
  char* end = nullptr;
  long n = strtol(key.c_str(), &end, 10);
  if (!key.empty() && *end == '\0') {
    if (Job* j = Job_by_index(static_cast<int>(n))) return j;
  }
  return Job_by_name(key.c_str());
}

bool Ctl_held(int lock_pid) { return lock_pid != 0 && Editor_process_validate(lock_pid) != 0; }

CtlEdit Ctl_edit_jobs(
    const std::function<bool(std::string* why, std::vector<std::string>* wake)>& change,
    std::string* why) {
  return edit(FILE_JOBS, change, why);
}

CtlEdit Ctl_edit_devs(
    const std::function<bool(std::string* why, std::vector<std::string>* wake)>& change,
    std::string* why) {
  return edit(FILE_RESOURCES, change, why);
}

std::vector<std::string> Ctl_job_hosts(const Job* job) {
  std::vector<std::string> hosts;
  auto add = [&](const Dev* d) {
    if (d != nullptr && d->host_name &&
        std::find(hosts.begin(), hosts.end(), d->host_name.c_str()) == hosts.end())
      hosts.push_back(d->host_name.c_str());
  };
  if (job != nullptr && job->resources != nullptr) {
    for (const RndDevList* e = job->resources; e != nullptr; e = e->next) add(e->dev);
  } else {
    for (const Dev* d = rndctl.devs; d != nullptr; d = d->next) add(d);
  }
  return hosts;
}

void Ctl_wake(const std::vector<std::string>& hosts) {
  std::vector<std::string> done;
  for (const auto& h : hosts) {
    if (std::find(done.begin(), done.end(), h) != done.end()) continue;
    done.push_back(h);
    (void)daemon_updatetime_set(h.c_str());
  }
}

bool Ctl_read_tasks(CtlTasks* tasks) {
  FileopLock lock(FILE_TASKS);
  if (!lock.held()) return false;
  FILE* fp = read_fileop(FILE_TASKS);
  if (fp == nullptr) return false;
  tasks->groups = Task_read(fp);
  return close_fileop(FILE_TASKS) == 0;
}

int Ctl_active_tasks(const CtlTasks& tasks, const Job* job) {
  int n = 0;
  for (const TaskGroup* g = tasks.groups; g != nullptr; g = g->next) {
    if (g->job == nullptr || g->job->index != job->index) continue;
    for (const TaskRec* r = g->tasks; r != nullptr; r = r->next)
      if (r->status == TASK_STARTED || r->status == TASK_RUNNING) n++;
  }
  return n;
}

bool Ctl_daemon_alive(const std::string& host) {
  std::string pid_path = std::string(rndctl.location.or_else(".")) + "/" + host + ".pid";
  int fd = open(pid_path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd >= 0) {
    int pid = 0;
    ssize_t n = read(fd, &pid, sizeof pid);
    close(fd);
    // Only a pid of this machine can be asked; another host's says nothing here.
    if (n == sizeof pid && pid > 1 && kill(pid, 0) == 0) {
      char comm[64] = "";
      std::string proc = "/proc/" + std::to_string(pid) + "/comm";
      int cfd = open(proc.c_str(), O_RDONLY | O_CLOEXEC);
      if (cfd >= 0) {
        ssize_t c = read(cfd, comm, sizeof comm - 1);
        close(cfd);
        comm[c > 0 ? c : 0] = '\0';
      }
      if (strncmp(comm, "zarno_render", 12) == 0) return true;
    }
  }
  std::string beat = std::string(rndctl.location.or_else(".")) + "/TSKSTAT/" + host;
  struct stat st;
  if (stat(beat.c_str(), &st) != 0) return false;
  return time(nullptr) - st.st_mtime < rj_host_timeout();
}
