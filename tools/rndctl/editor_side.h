/// The editor's side of the queue protocols, for the command-line tool.
///
/// The tool holds no state between runs: every command loads what it needs
/// from the control directory, and every change is one read-modify-write of
/// the whole job or resource file under that file's lock, written by the
/// queue's own writer, after which the pid file of every host the change
/// concerns is touched so that its daemon reloads at once.
///
/// Calling order: Ctl_open(location) once; then Ctl_load to read, or
/// Ctl_edit_jobs / Ctl_edit_devs to change.  The records live in the control
/// block's lists (rndctl.jobs, rndctl.devs) until the next load.
///
/// The parse functions here take strings and touch no file, so that a test
/// can drive them directly.  Each returns true and fills its result, or false
/// with a one-line reason in `why`.
#pragma once

#include <functional>
#include <string>
#include <vector>

#include "Utility/rndctl/rndctl.h"

/// A frame range "S-E[:BY]"; negative frames are written "-5--1".
struct CtlFrames {
  float start = 1, end = 1, by = 1;
};
[[nodiscard]] bool Ctl_parse_frames(const std::string& text, CtlFrames* out, std::string* why);

/// One schedule block "HHMM-HHMM Day[-Day]" (days by any name the queue
/// knows: "Monday", "Mon", ...).  Times are HHMM on the half hour grid.
struct CtlBlock {
  int start = 0, end = 0;
  std::string first_day, last_day;  // the queue's own day names
};
[[nodiscard]] bool Ctl_parse_block(const std::string& text, CtlBlock* out, std::string* why);
/// Applies a block to a week grid through `fill` (Schedule_job_runs or
/// Schedule_dev_lock): the grid takes no span over midnight, so "2200-600"
/// becomes 2200-2400 on the days and 0-600 on the days after (Saturday's
/// night runs into Sunday morning).
void Ctl_apply_block(const CtlBlock& block,
                     const std::function<void(int, int, const char*, const char*)>& fill);

/// Whether `text` can stand as a quoted string of a control file: no '"',
/// no newline, not longer than the reader takes.
[[nodiscard]] bool Ctl_string_ok(const std::string& text, std::string* why);
/// Whether `text` reads back as one bare word of the job file (names, users,
/// executables).
[[nodiscard]] bool Ctl_word_ok(const std::string& text, std::string* why);
/// Splits "a,b,c" into its non-empty parts.
std::vector<std::string> Ctl_split(const std::string& text, char separator);

/// Sets up the control block on `location` (null: the preference).  The
/// parser's fatal path is turned into a plain failure.  False with `why`
/// when there is no location and the preferences name none.
[[nodiscard]] bool Ctl_open(const char* location, std::string* why);

/// Reads both control files into the control block (resources first, each
/// under its lock).  False with `why` when one could not be read.
[[nodiscard]] bool Ctl_load(std::string* why);

/// The job named by `key`: its index when `key` is a number, else its name.
Job* Ctl_find_job(const std::string& key);

/// Whether the record is held by a live editor (its lock_pid is confirmed).
[[nodiscard]] bool Ctl_held(int lock_pid);

/// Result of an edit.
enum CtlEdit { CTL_WRITTEN = 0, CTL_REFUSED = 1, CTL_FAILED = 2 };

/// Read-modify-write of the job file: takes its lock, then (for the read
/// alone) the resource file's, loads both, calls `change`, which returns
/// false (and a reason) to refuse; renders the new file, proves that the
/// reader takes it back with every job, and writes it.  The hosts to wake
/// are those `change` put in `wake` (host names), touched after the lock is
/// released.
[[nodiscard]] CtlEdit Ctl_edit_jobs(
    const std::function<bool(std::string* why, std::vector<std::string>* wake)>& change,
    std::string* why);
/// The same for the resource file.
[[nodiscard]] CtlEdit Ctl_edit_devs(
    const std::function<bool(std::string* why, std::vector<std::string>* wake)>& change,
    std::string* why);

/// Host names of a job's pick list, or of every resource when it has none.
std::vector<std::string> Ctl_job_hosts(const Job* job);
/// Touches the pid file of each host once.
void Ctl_wake(const std::vector<std::string>& hosts);

/// The task groups of the task file, read under its lock against the lists
/// of the control block; freed by the destructor.
struct CtlTasks {
  TaskGroup* groups = nullptr;
  CtlTasks() = default;
  CtlTasks(const CtlTasks&) = delete;
  CtlTasks& operator=(const CtlTasks&) = delete;
  ~CtlTasks() { TaskGroup_free_all(&groups); }
};
[[nodiscard]] bool Ctl_read_tasks(CtlTasks* tasks);
/// Records of `job` still STARTED or RUNNING.
int Ctl_active_tasks(const CtlTasks& tasks, const Job* job);

/// Whether the daemon of `host` looks alive: its pid file names a live
/// process on this machine, or its heartbeat is younger than the timeout.
[[nodiscard]] bool Ctl_daemon_alive(const std::string& host);
