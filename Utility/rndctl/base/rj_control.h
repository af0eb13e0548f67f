/// The control block: the one process-wide record through which the parts of
/// the queue hand each other their data.  The record lists hang from it (the
/// lists own their records), with this process's identity (host, user, pid),
/// the control directory and the daemon's counters.
///
/// Who writes what: RJC_init_rndctl sets location, host, pid, user and
/// install once at start-up; the record units (records/) keep jobs, devs and
/// their index tables; the reload (ctlfile/) swaps the lists as a whole and
/// sets last_update and the check interval; the task units (tasks/) keep
/// tasks, running, out_counter and stream_counter; the signal handler
/// (proc/) writes signal_seen only.  Everyone else reads.
#pragma once

#include <cstdint>
#include <string>
#include <unordered_map>

#include "Utility/rndctl/base/rj_text.h"

struct Job;
struct Dev;
struct TASK;
struct TaskGroup;
struct TaskRec;
struct RndDevList;
struct RndJobList;
struct RndPathList;

/// First-match lookup table for a record list: for each key, the first record
/// in list order and how many records of the list share the key.  Kept up to
/// date by the list operations of the record kind (rj_job, rj_dev); swapped
/// together with the list head when a list is set aside (Update_from_demon).
template <class T, class Key>
struct RecordIndex {
  struct Slot {
    T* first = nullptr;  // non-owning
    int count = 0;
  };
  std::unordered_map<Key, Slot> slots;
};

// ---------------------------------------------------------------------------
/// The control block: the one process-wide record every part reads.
struct RndCtl {
  Job* current_job = nullptr;  // non-owning
  Job* jobs = nullptr;         // owned list
  Dev* current_dev = nullptr;  // non-owning
  Dev* devs = nullptr;         // owned list
  TASK* tasks = nullptr;       // owned list of running-task entries
  Text location;               // the control directory
  Text user;
  Text host;
  int64_t last_update = 0;  // host update time (ns) as of the last reconciling reload
  int pid = 0;
  volatile int running = 0;  // render children started and not yet reaped
  unsigned interval_min = 0;
  unsigned interval_sec = 0;
  volatile int signal_seen = 0;
  int editors = 0;
  int single_pass = 0;
  Text install;
  int out_counter = 0;     // names the render output files
  int stream_counter = 0;  // names the task log streams
  RecordIndex<Job, int> job_index;
  RecordIndex<Dev, int> dev_index;
  RecordIndex<Dev, std::string> dev_name_index;  // names as set by Dev_new/Dev_set_name
};

extern RndCtl rndctl;

/// Fills the control block's identity at start-up: the control directory
/// `location` (null: the preference ZARNO_RNDCTL_LOCATION, which must then be
/// set, else the process exits with a message), this host's name, pid, user
/// and install directory.
void RJC_init_rndctl(const char* location);
/// Sets the check interval to `minutes`:`seconds` and returns 1, or refuses
/// a value the service loop cannot wait for (either part negative, seconds
/// above 59, a total beyond an int of seconds) and returns 0, keeping the
/// interval in force.  A refusal is reported on stderr (the daemon's log)
/// once per distinct bad value, naming `from` (a file name, "-u"), so that a
/// bad header reread at every reload does not fill the log.  0:00 is valid:
/// no timed pass.
[[nodiscard]] int RJC_set_check_interval(long minutes, long seconds, const char* from);
