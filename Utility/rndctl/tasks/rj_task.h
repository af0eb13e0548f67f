/// Running-task entries: this daemon's list of the pieces it renders
/// (rndctl.tasks), and the rules by which an entry and the task file agree.
/// An entry ties a task record (which it owns) to its job, the render
/// process working on it here (pid), that render's log stream and output.
///
/// Calling order: an entry is made (Task_add) when this host takes a piece
/// from Render_Tasks, and freed (TASK_free, after Task_let_go when a render
/// may still run) when the piece ends or is lost.  After every wait the
/// service loop calls Task_judge_exits before it judges the entries
/// (UpdateRunningTasks, rj_status).  Inside a locked cycle on the task file,
/// each entry is settled against its file record (Task_owns, Task_settle)
/// and kills and wake-ups are left to a TaskAfterLock run after the lock is
/// released.  A task group that was rebuilt in the file retires this host's
/// entries of its job (Task_group_rebuilt, Task_retire_job).
///
/// Control block: writes `tasks` (the list head) and `running` (one off per
/// judged exit); the first Task_add sets RJC_records_hook so that a reload
/// moves each entry's job and resource pointers to the fresh records (or to
/// null); reads `host` (this host's renders and pid file) and `jobs`,
/// `devs` through that hook.  Entries' `job` pointers do not own.
#pragma once

#include <vector>

#include "Utility/rndctl/tasks/rj_taskrec.h"

/// Appends an entry for `rec` of `job` to rndctl.tasks; the entry takes
/// ownership of `rec` (TASK_free frees it) and `rec->task` points back.
/// Returns the entry, or null when out of memory (`rec` still the caller's).
TASK* Task_add(Job* job, TaskRec* rec);
/// Unlinks and frees an entry with its record, closes its stream and forgets
/// its file names (the files stay: Task_let_go or Task_drop_stream removes
/// them).  Does not kill its render.  Null: nothing.
void TASK_free(TASK* entry);
/// The entry whose render has process `pid`, or null (also for pid 0).
TASK* Task_by_pid(int pid);
/// Judges every exit the SIGCHLD handler recorded (RJ_take_exit): counts the
/// child off `rndctl.running`, drops it from the render registry, touches
/// this host's pid file, and when an entry renders that pid sets its `pid`
/// to 0 and its `waitstatus`: 0 for a clean exit, the exit code of a render
/// that exited, the signal's number of one that was killed, 1 for anything
/// else.  The service loop calls it after each wait.  Returns the number of
/// exits judged (entries or not).
int Task_judge_exits();

/// Who may write a record of Render_Tasks.  Another host or an editor may put
/// a record back (PENDING) or another host may take it while its owner here
/// is slow (waiting for a lock, stopped); a group may be cleared and built
/// again from id 0 (a restarted job).  So a file record is this host's to
/// write only while it names this host and shows a state this daemon wrote
/// and still owns: STARTED or RUNNING, or FAILED until this host puts it back.
/// `entry` is this host's entry for the record (null: none).
[[nodiscard]] bool Task_owns(const TASK* entry, const TaskRec* file_rec);
/// Whether an entry's record and a file record are one task: same id and the
/// same start frame (which never changes for an id within one life of a
/// group; a rebuilt group hands out the same ids again).
[[nodiscard]] bool Task_same_rec(const TaskRec* own, const TaskRec* file_rec);

/// What a cycle on Render_Tasks leaves to do once the file's lock is released:
/// kills of this host's renders and wake-ups of other hosts.
struct TaskAfterLock {
  std::vector<int> kills;
  std::vector<Job*> wakes;       // non-owning; each job once
  std::vector<const Dev*> full;  // non-owning; resources with no free processor
  void kill_later(int pid);
  void wake(Job* job);
  /// Before the lock goes, when there are wake-ups: notes the resources the
  /// file shows rendering on every processor (Task_full_devs), which the
  /// wake-ups pass over.
  void note_full(const TaskGroup* groups);
  /// Kills, then wakes.  Call only without the task file's lock.
  void run();
};

/// Of the resources that `jobs` name, those that the jobs' records in
/// `groups` show STARTED or RUNNING on as many times as they have processors
/// (at least 1).
/// Such a host has nothing to take now and looks for work itself when one of
/// its renders ends, so waking it would only make it read the files for
/// nothing.
std::vector<const Dev*> Task_full_devs(const TaskGroup* groups, const std::vector<Job*>& jobs);

/// Settles this host's entry against the file record of the same task.
/// Ours (Task_owns): the file takes the entry's status and 1 is returned.
/// Otherwise nothing is written and 0 is returned; when the entry still held
/// the piece (it took it, and its own status is STARTED, RUNNING or FAILED)
/// the piece is lost: the entry takes the file's state, gives up the piece
/// (its render is to be killed, its exit is not judged, its stream goes), and
/// when the file shows the piece PENDING the job's other hosts are to be woken.
int Task_settle(TASK* entry, TaskRec* file_rec, TaskAfterLock* after);
/// Gives up the piece an entry rendered: its render (if any) is killed (at
/// once when `after` is null), its pid becomes 0 so that the reaped exit finds
/// no entry and is not judged, its stream and output files are removed.
void Task_let_go(TASK* entry, TaskAfterLock* after);
/// Closes an entry's log stream and removes its file: the render program is
/// gone or about to be, and nobody reads the stream any more.
void Task_drop_stream(TASK* entry);

/// Lives of a task group.  This host's entries of a job remember the highest
/// next_task_id seen of its group.  A group is a new life when it vanished from the
/// file, when its next_task_id went below what this host saw, or when one of
/// its ids names another start frame than this host's entry of that id.
/// Task_group_rebuilt answers for `job` against the groups read from the file
/// (`group` is the job's group there or null); Task_note_group records what
/// was seen.  Every entry of a job of another life is dropped with
/// Task_retire_job; where entries cannot be freed at once (a caller walks
/// the list) Task_mark_rebuilt marks its entries and Task_retire_marked, at a
/// point where nobody walks the list, drops them.
[[nodiscard]] bool Task_group_rebuilt(const Job* job, const TaskGroup* group);
/// The highest next_task_id this host's entries of `job` have seen (0: none).
int Task_seen_next_id(const Job* job);
/// Raises each entry of `job` to the group's next_task_id (null: nothing).
void Task_note_group(const Job* job, const TaskGroup* group);
/// Lets go of and frees every entry of `job` (kills left to `after`, or at
/// once when it is null).
void Task_retire_job(const Job* job, TaskAfterLock* after);
/// Marks every entry of `job` for Task_retire_marked.
void Task_mark_rebuilt(const Job* job);
/// Lets go of (killing at once) and frees every marked entry.  Returns the
/// number of entries dropped.
int Task_retire_marked();
/// Reads the task file (under its lock) and drops every entry of those of
/// `jobs` whose group there was rebuilt or is gone; returns how many entries
/// went.  For a suspicion the daemon cannot settle from its own lists.
int Task_retire_rebuilt(const std::vector<Job*>& jobs);
