// The reload and write-back cycle of the two control files.
//
// The job and resource files are the shared truth.  The daemon holds them as
// the control block's lists; its running-task entries point into those lists,
// so every reload that replaces the lists must re-point the entries before the
// old records are freed.
#include <cstdio>
#include <cstring>
#include <utility>

#include "Utility/rndctl/rndctl.h"

namespace {

// Entries whose job is about to be dropped by the writer (deletion mark) lose
// their job first, so that no entry keeps a pointer to a freed record.
void detach_tasks_of_deleted_jobs() {
  for (TASK* t = rndctl.tasks; t != nullptr; t = t->next) {
    if (t->job != nullptr && t->job->deleted) t->job = nullptr;
  }
}

bool is_number_state(const char* text, float* value) {
  return text != nullptr && get_fvalue(text, value) != 0;
}

// Settles the state text of old job J against the freshly read job N.
void reconcile(Job* J, Job* N, int editor) {
  const char* js = J->status.c_str();
  const char* ns = N->status.c_str();
  bool take_file;
  if (editor == 0 || ns == nullptr || N->status.is("aborted") || N->status.is("finished") ||
      J->status.is("aborted")) {
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
// Reads one control file under its lock into the control block's lists.
int reload_file(int index) {
  int result = 0;
  lock_fileop(index, 1);
  if (read_fileop(index) != nullptr) {
    result = RJC_parse();
    close_fileop(index);
  }
  lock_fileop(index, 0);
  return result;
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
  lock_fileop(FILE_JOBS, 1);
  FILE* fp = update_fileop(FILE_JOBS);
  if (fp != nullptr) {
    Job_control_write_dev(fp);
    close_and_truncate_fileop(FILE_JOBS);
  }
  lock_fileop(FILE_JOBS, 0);
}

void Resource_control_write(const char* /*dir*/) {
  dbgpnt("Resource_control_write\n");
  lock_fileop(FILE_RESOURCES, 1);
  FILE* fp = update_fileop(FILE_RESOURCES);
  if (fp != nullptr) {
    Resource_control_write_dev(fp);
    close_and_truncate_fileop(FILE_RESOURCES);
  }
  lock_fileop(FILE_RESOURCES, 0);
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

void Update_from_demon(int editor) {
  dbgpnt("Update_from_demon................................%s\n", editor ? "TRUE" : "FALSE");
  // The update time as it stands before the files are read is the one these
  // files answer.  A touch that lands while they are being read or written
  // must still read as a change afterwards, or an editor's change that came
  // in during the pass would wait for the next timed check.
  const int64_t seen_before = daemon_updatetime_get(rndctl.host.c_str());

  // Set the in-memory lists aside; the parse below fills fresh ones.
  Lists old;
  swap_lists(old);
  rndctl.current_job = nullptr;
  rndctl.current_dev = nullptr;

  lock_fileop(FILE_JOBS, 1);
  lock_fileop(FILE_RESOURCES, 1);

  FILE* resources = update_fileop(FILE_RESOURCES);
  if (resources != nullptr) RJC_parse();
  FILE* jobs = update_fileop(FILE_JOBS);
  if (jobs != nullptr) RJC_parse();

  // Re-point every running-task entry at the fresh records (by index) while
  // the old ones still exist.  Entries of jobs or resources that left the
  // files end with a null pointer instead of a dangling one.
  for (TASK* t = rndctl.tasks; t != nullptr; t = t->next) {
    if (t->job != nullptr) t->job = Job_by_index(t->job->index);
    if (t->rec != nullptr && t->rec->dev != nullptr) t->rec->dev = Dev_by_index(t->rec->dev->index);
  }

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
  if (resources != nullptr) {
    rewind_fileop(FILE_RESOURCES);
    Resource_control_write_dev(resources);
    close_and_truncate_fileop(FILE_RESOURCES);
  }
  if (jobs != nullptr) {
    rewind_fileop(FILE_JOBS);
    Job_control_write_dev(jobs);
    close_and_truncate_fileop(FILE_JOBS);
  }

  lock_fileop(FILE_RESOURCES, 0);
  lock_fileop(FILE_JOBS, 0);

  rndctl.last_update = seen_before;
  dbgpnt("Update_from_demon done..........................\n\n");
}
