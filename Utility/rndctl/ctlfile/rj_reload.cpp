// The reload and write-back cycle of the two control files.
//
// The job and resource files are the shared truth.  The daemon holds them as
// the control block's lists; its running-task entries point into those lists,
// so every reload that replaces the lists must re-point the entries before the
// old records are freed.
#include "Utility/rndctl/ctlfile/rj_reload.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <utility>
#include <vector>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_fileio.h"
#include "Utility/rndctl/ctldir/rj_updatetime.h"
#include "Utility/rndctl/ctlfile/rj_ctlfile.h"
#include "Utility/rndctl/records/rj_dev.h"
#include "Utility/rndctl/records/rj_job.h"
#include "Utility/rndctl/records/rj_recindex.h"
#include "Utility/rndctl/records/rj_records.h"

void (*RJC_records_hook)(int event) = nullptr;

namespace {

// Whoever points at records from outside the lists (the running-task
// entries) lets go of jobs about to be dropped by the writer (deletion mark),
// so that nothing keeps a pointer to a freed record.
void detach_tasks_of_deleted_jobs() {
  if (RJC_records_hook != nullptr) RJC_records_hook(RJC_RECORDS_DROPPING_DELETED);
}

bool is_number_state(const char* text, float* value) {
  return text != nullptr && get_fvalue(text, value) != 0;
}

// Whether the file's state text of job `index` is not what this process
// last read from the file or wrote to it: somebody else wrote it since.
bool state_is_news(int index, const Text& file_state);

// Settles the state text of old job J against the freshly read job N.
void reconcile(Job* J, Job* N, int editor) {
  const char* js = J->status.c_str();
  const char* ns = N->status.c_str();
  // An editor's restart ("restarted", then "pending" once it cleared the
  // job's tasks) is an order, not a report of progress: a host's write-back
  // of the progress it worked out before it had read the order must not
  // undo it, or the job never renders again and waits for ever.
  const bool ordered = editor != 0 && (N->status.is("restarted") || N->status.is("pending")) &&
                       !J->status.is("aborted") && state_is_news(J->index, N->status);
  if (ordered) J->doneframes = N->doneframes;
  bool take_file;
  if (editor == 0 || ns == nullptr || N->status.is("aborted") || N->status.is("finished") ||
      J->status.is("aborted") || ordered) {
    take_file = true;
  } else if ((N->status.is("pending") && J->status.is("finished")) ||
             (N->status.is("started") && J->status.is("pending")) || J->status.is("none")) {
    take_file = true;
  } else {
    float n = 0.0f;
    if (!is_number_state(ns, &n)) {
      take_file = false;
    } else {
      float j = 0.0f;
      take_file =
          J->status.is("pending") || J->status.is("started") || (is_number_state(js, &j) && j < n);
    }
  }
  if (take_file) {
    J->status.set(ns);
  } else {
    N->status.set(js);
  }

  if (editor == 0) {
    J->comment.set(N->comment.c_str());
    J->doneframes = N->doneframes;
    J->deleted = N->deleted;
  } else {
    N->comment.set(J->comment.c_str());
    N->doneframes = J->doneframes;
    N->deleted = J->deleted;
  }
}

struct Lists {
  Job* jobs = nullptr;
  Dev* devs = nullptr;
  RecordIndex<Job, int> job_index;
  RecordIndex<Dev, int> dev_index;
  RecordIndex<Dev, std::string> dev_name_index;
};

// Swaps the control block's lists (heads and lookup tables) with `lists`.
void swap_lists(Lists& lists) {
  std::swap(rndctl.jobs, lists.jobs);
  std::swap(rndctl.devs, lists.devs);
  std::swap(rndctl.job_index, lists.job_index);
  std::swap(rndctl.dev_index, lists.dev_index);
  std::swap(rndctl.dev_name_index, lists.dev_name_index);
}

}  // namespace

int get_fvalue(const char* text, float* value) {
  if (text == nullptr) return 0;
  float v = 0.0f;
  if (sscanf(text, "%f", &v) != 1) return 0;
  if (value != nullptr) *value = v;
  return 1;
}

int RJC_parse() {
  if (RJCin == nullptr) return 0;
  // A control file that does not exist yet was just created empty: there is
  // nothing to read, and an empty file is not a syntax error.
  int c = fgetc(RJCin);
  if (c == EOF) return 0;
  ungetc(c, RJCin);
  return RJCparse();
}

namespace {

// What this process last read from, or wrote to, one control file: its
// bytes.  While the file still holds them, parsing it again is waste: one
// change of a file costs one parse however many reloads a pass makes.
//
// Whether it still holds them is asked of its contents, not of its time
// stamps.  A network file system may keep whole seconds and report a file's
// attributes from a cache of its own for a while (a stat by name is not
// revalidated; an open is), and a rewrite within one second to the same
// size, as a job's progress text moving from "42.50% " to "45.00% ", would
// look unchanged.  Reading a few megabytes and comparing them costs a few
// milliseconds; a missed change costs a lost job.
struct Seen {
  bool valid = false;
  std::string path;  // the file it was read from (a process may change directory)
  std::string bytes;
};
Seen seen[2];
bool marks_valid = false;  // see take_marks

void remember(int index, const std::string& bytes) {
  const char* path = fileop_path(index);
  seen[index].valid = path != nullptr;
  seen[index].path = path != nullptr ? path : "";
  seen[index].bytes = bytes;
}

void forget(int index) {
  seen[index].valid = false;
  seen[index].bytes.clear();
}

// True when the file (opened afresh, so that a network client revalidates
// it) still holds what this process last read or wrote.  Read without the
// lock: a writer that rewrites in place under the lock may be caught half
// way, which reads as a change and sends the caller to the locked read.
bool holds(int index, const std::string& want) {
  const char* path = fileop_path(index);
  if (path == nullptr) return false;
  int fd;
  do {
    fd = open(path, O_RDONLY | O_CLOEXEC);
  } while (fd < 0 && errno == EINTR);
  if (fd < 0) return false;
  struct stat st;
  bool same = fstat(fd, &st) == 0 && static_cast<size_t>(st.st_size) == want.size();
  char buf[1 << 16];
  size_t at = 0;
  while (same) {
    ssize_t n = read(fd, buf, sizeof buf);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      same = n == 0 && at == want.size();
      break;
    }
    size_t got = static_cast<size_t>(n);
    same = at + got <= want.size() && memcmp(buf, want.data() + at, got) == 0;
    at += got;
  }
  close(fd);
  return same;
}

bool unchanged(int index) {
  const char* path = fileop_path(index);
  return seen[index].valid && path != nullptr && seen[index].path == path &&
         holds(index, seen[index].bytes);
}

// Reads the whole of file `index` into `bytes`; the caller holds its lock.
// False when it cannot be opened or read (reported by the file operations).
bool read_held(int index, std::string* bytes) {
  FILE* fp = read_fileop(index);
  if (fp == nullptr) return false;
  char buf[1 << 16];
  size_t n;
  while ((n = fread(buf, 1, sizeof buf, fp)) > 0) bytes->append(buf, n);
  const bool ok = ferror(fp) == 0;
  (void)close_fileop(index);  // a failure is reported there; the old file stands
  return ok;
}

// Replaces file `index` with `text`; the caller holds its lock.  Returns 1
// written, -1 when the write failed (reported; the old file stands).
int write_held(int index, const std::string& text) {
  FILE* fp = update_fileop(index);
  if (fp == nullptr) {
    forget(index);
    return -1;
  }
  rewind_fileop(index);
  bool ok = fwrite(text.data(), 1, text.size(), fp) == text.size();
  ok = close_and_truncate_fileop(index) == 0 && ok;
  if (ok) {
    remember(index, text);
  } else {
    forget(index);
  }
  return ok ? 1 : -1;
}

// The whole of one control file: the bytes held when it has not changed,
// else read under its lock (held for the read alone; parsing happens after
// it is released).  The file is made when it does not exist.  Null when it
// cannot be opened.
const Seen* read_file(int index) {
  if (unchanged(index)) return &seen[index];
  std::string bytes;
  bool ok;
  {
    FileopLock lock(index);
    ok = read_held(index, &bytes);
  }
  if (!ok) {
    forget(index);
    return nullptr;
  }
  remember(index, bytes);
  return &seen[index];
}

int parse_bytes(int index, const std::string& bytes) {
  // An empty file (just made) is no syntax error: there is nothing to read.
  if (bytes.empty()) return 0;
  const char* saved_path = RJCpath;
  RJCpath = fileop_path(index);
  int result = RJC_parse_string(bytes.data(), bytes.size(), fileop_path(index));
  RJCpath = saved_path;
  return result;
}

// The text the writer makes of the control block's list for file `index`.
std::string render(int index) {
  char* buf = nullptr;
  size_t size = 0;
  FILE* fp = open_memstream(&buf, &size);
  if (fp == nullptr) return std::string();
  if (index == FILE_JOBS) {
    Job_control_write_dev(fp);
  } else {
    Resource_control_write_dev(fp);
  }
  fclose(fp);
  std::string text(buf != nullptr ? buf : "", size);
  free(buf);  // made by open_memstream with the C library's allocator
  return text;
}

// Replaces file `index` with `text` under its lock, when the file still
// holds `expected` (what the caller read).  Returns 1 written, 0 when
// somebody else rewrote the file since (nothing written: the caller reads
// the newer version), -1 when the write failed (reported by the file
// operations; the old file stands).
int write_if_unchanged(int index, const std::string& text, const std::string& expected) {
  FileopLock lock(index);
  if (!holds(index, expected)) return 0;
  return write_held(index, text);
}

// Reads one control file into the control block's lists (a plain reload).
// A file that is still what this process last read or wrote is not parsed
// again: the lists already hold it.
int reload_file(int index) {
  if (unchanged(index)) return 0;
  const Seen* file = read_file(index);
  if (file == nullptr) return 0;
  // The lists now hold what no sync settled (and a plain reload keeps the
  // records that left the file): the next reconciling reload reads in full.
  marks_valid = false;
  return parse_bytes(index, file->bytes);
}

// The fields the reconciling reload settles, as they stood in the files at
// the last sync, so that a pass that changed none of them costs no read and
// no write.  The daemon changes job records only there (state, comment,
// frames done, deletion mark) and its own resources' frames and processors.
struct JobMark {
  const Job* job;
  int index;
  Text status;
  Text comment;
  int doneframes;
  int deleted;
};
struct DevMark {
  const Dev* dev;
  int index;
  int max_frames;
  int num_processors;
};
std::vector<JobMark> job_marks;
std::vector<DevMark> dev_marks;
std::string marks_location;  // the control directory the marks were taken in

bool same_text(const Text& a, const Text& b) {
  if (a.none() || b.none()) return a.none() == b.none();
  return strcmp(a.c_str(), b.c_str()) == 0;
}

bool state_is_news(int index, const Text& file_state) {
  if (!rndctl.location.is(marks_location.c_str())) return false;
  for (const JobMark& m : job_marks) {
    if (m.index == index) return !same_text(m.status, file_state);
  }
  return false;  // never seen here: nothing to tell apart, the rules above decide
}

void take_marks() {
  marks_location = rndctl.location.or_else("");
  job_marks.clear();
  dev_marks.clear();
  for (const Job* j = rndctl.jobs; j != nullptr; j = j->next) {
    job_marks.push_back({j, j->index, j->status, j->comment, j->doneframes, j->deleted});
  }
  for (const Dev* d = rndctl.devs; d != nullptr; d = d->next) {
    dev_marks.push_back({d, d->index, d->max_frames, d->num_processors});
  }
  marks_valid = true;
}

// True when the lists still hold exactly what the files held at the last sync.
bool lists_clean() {
  if (!marks_valid || !rndctl.location.is(marks_location.c_str())) return false;
  size_t i = 0;
  for (const Job* j = rndctl.jobs; j != nullptr; j = j->next, ++i) {
    if (i >= job_marks.size()) return false;
    const JobMark& m = job_marks[i];
    if (m.job != j || m.index != j->index || m.doneframes != j->doneframes ||
        m.deleted != j->deleted || !same_text(m.status, j->status) ||
        !same_text(m.comment, j->comment)) {
      return false;
    }
  }
  if (i != job_marks.size()) return false;
  i = 0;
  for (const Dev* d = rndctl.devs; d != nullptr; d = d->next, ++i) {
    if (i >= dev_marks.size()) return false;
    const DevMark& m = dev_marks[i];
    if (m.dev != d || m.index != d->index || m.max_frames != d->max_frames ||
        m.num_processors != d->num_processors) {
      return false;
    }
  }
  return i == dev_marks.size();
}

}  // namespace

int RJC_reload(int /*flag*/) {
  dbgpnt("RJC_reload\n");
  return reload_file(FILE_JOBS);
}

int RRC_reload(int flag) {
  dbgpnt("RRC_reload\n");
  int result = reload_file(FILE_RESOURCES);
  if (flag != 0 && rndctl.editors != 0) IR_rebuild_rndctl();
  return result;
}

void Job_control_write(const char* /*dir*/) {
  dbgpnt("Job_control_write\n");
  detach_tasks_of_deleted_jobs();
  FileopLock lock(FILE_JOBS);
  FILE* fp = update_fileop(FILE_JOBS);
  if (fp == nullptr) return;
  Job_control_write_dev(fp);
  (void)close_and_truncate_fileop(FILE_JOBS);  // a failure is reported there; the old file stands
}

void Resource_control_write(const char* /*dir*/) {
  dbgpnt("Resource_control_write\n");
  FileopLock lock(FILE_RESOURCES);
  FILE* fp = update_fileop(FILE_RESOURCES);
  if (fp == nullptr) return;
  Resource_control_write_dev(fp);
  // A failure is reported there; the old file stands.
  (void)close_and_truncate_fileop(FILE_RESOURCES);
}

int RJC_in() {
  RRC_reload(0);
  int result = RJC_reload(0);
  rndctl.signal_seen = 0;
  return result;
}

void RJC_out() {
  if (rndctl.location.none()) return;
  Resource_control_write(rndctl.location.c_str());
  Job_control_write(rndctl.location.c_str());
}

namespace {

// One reconciling reload from the files' bytes: parse them into fresh lists,
// carry the running-task entries and the settled fields over, drop the old
// records.  The files are read and written outside this step.
void reconcile_from(const std::string& resources, const std::string& jobs, int editor) {
  // Set the in-memory lists aside; the parse below fills fresh ones.
  Lists old;
  swap_lists(old);
  rndctl.current_job = nullptr;
  rndctl.current_dev = nullptr;

  parse_bytes(FILE_RESOURCES, resources);
  parse_bytes(FILE_JOBS, jobs);

  // Pointers held outside the lists move to the fresh records while the old
  // ones still exist.
  if (RJC_records_hook != nullptr) RJC_records_hook(RJC_RECORDS_REPLACED);

  const char* host = rndctl.host.c_str();
  for (Job* J = old.jobs; J != nullptr; J = J->next) {
    for (RndDevList* item = J->resources; item != nullptr; item = item->next) {
      if (!rj_dev_on_host(item->dev, host)) continue;
      Job* N = Job_by_index(J->index);
      if (N != nullptr) reconcile(J, N, editor);
      break;
    }
  }

  // Drop the old records, then install the fresh lists.
  Lists fresh;
  swap_lists(fresh);  // control block empty, fresh lists held here
  swap_lists(old);    // old lists back in the control block for deletion
  while (rndctl.devs != nullptr) Dev_del(rndctl.devs);
  while (rndctl.jobs != nullptr) Job_del(rndctl.jobs);
  swap_lists(old);    // control block empty again (old is now empty too)
  swap_lists(fresh);  // fresh lists installed
  detach_tasks_of_deleted_jobs();
}

// Writes the lists back where they differ from the bytes read.  Returns
// false when a file was rewritten by somebody else since it was read.
bool write_back(const std::string& resources, const std::string& jobs) {
  bool current = true;
  std::string text = render(FILE_RESOURCES);
  if (text != resources)
    current = write_if_unchanged(FILE_RESOURCES, text, resources) != 0 && current;
  text = render(FILE_JOBS);  // the writer drops the jobs marked for deletion
  if (text != jobs) current = write_if_unchanged(FILE_JOBS, text, jobs) != 0 && current;
  return current;
}

// Settles the lists against the job file as it stands and writes the result
// back, all under the job file's lock (the resource file's bytes are those
// read before; its lock is not taken here).  Used once an optimistic try
// found the job file rewritten between its read and its write: on a farm
// of many hosts every host writes its progress into that one file, and the
// next try would most likely meet another writer again.  Returns false only
// when the file could not be read.
bool settle_jobs_locked(const std::string& resources, int editor) {
  FileopLock lock(FILE_JOBS);
  std::string jobs;
  if (!read_held(FILE_JOBS, &jobs)) {
    forget(FILE_JOBS);
    return false;
  }
  reconcile_from(resources, jobs, editor);
  std::string text = render(FILE_JOBS);
  if (text == jobs) {
    remember(FILE_JOBS, jobs);
  } else {
    // A failed write is reported; the old file stands, and trying again
    // would not help.
    (void)write_held(FILE_JOBS, text);
  }
  return true;
}

// Only the reload at the start of a pass (editor 0) may call a change of the
// update time seen.  The write-back at the end of a pass (editor 1) comes
// after this pass has picked its work: a touch that landed during the pass
// (an editor releasing a paused job, a piece put back) would be folded into
// the lists but never picked up, and with a check interval of 0:00 the host
// would wait for ever.  Left unseen, it makes the next wait end at once.
void mark_seen(int editor, int64_t update_time) {
  if (editor == 0) rndctl.last_update = update_time;
}

}  // namespace

void Update_from_demon(int editor) {
  dbgpnt("Update_from_demon................................%s\n", editor ? "TRUE" : "FALSE");
  // The update time as it stands before the files are read is the one these
  // files answer.  A touch that lands while they are being read or written
  // must still read as a change afterwards, or an editor's change that came
  // in during the pass would wait for the next timed check.
  const int64_t seen_before = daemon_updatetime_get(rndctl.host.c_str());

  // Neither file changed since this process last read or wrote it, and the
  // lists still hold what it held: reading them back and writing the same
  // bytes again would change nothing.
  if (unchanged(FILE_RESOURCES) && unchanged(FILE_JOBS) && lists_clean()) {
    mark_seen(editor, seen_before);
    dbgpnt("Update_from_demon done..........................\n\n");
    return;
  }

  // Each file's lock is held only to read it and, when the lists differ from
  // it, to replace it; never both locks at once.  The first try parses with
  // no lock held.  A file rewritten by somebody else between the read and
  // the write sends the job file to one read, settle and write under its
  // lock, which no other writer can come between.
  for (int attempt = 0; attempt < 8; ++attempt) {
    const Seen* res = read_file(FILE_RESOURCES);
    // Copies: a write-back replaces what is remembered of the files.
    const std::string resources = res != nullptr ? res->bytes : std::string();
    if (attempt > 0 && res != nullptr) {
      // The last try lost a race for a file: the job file is now settled
      // under its lock, then the resource file as before.
      if (!settle_jobs_locked(resources, editor)) break;  // reported by the open
      std::string text = render(FILE_RESOURCES);
      if (text == resources || write_if_unchanged(FILE_RESOURCES, text, resources) != 0) break;
      continue;
    }
    const Seen* job = read_file(FILE_JOBS);
    const std::string jobs = job != nullptr ? job->bytes : std::string();
    reconcile_from(resources, jobs, editor);
    if (res == nullptr || job == nullptr) break;  // reported by the open; nothing to write to
    if (write_back(resources, jobs)) break;
  }
  take_marks();

  mark_seen(editor, seen_before);
  dbgpnt("Update_from_demon done..........................\n\n");
}
