/// Running-task entries: this daemon's list of the pieces it renders
/// (rndctl.tasks), and the rules by which an entry and the task file agree.
#pragma once

#include <vector>

#include "Utility/rndctl/tasks/rj_taskrec.h"

TASK* Task_add(Job* job, TaskRec* rec);
void TASK_free(TASK* entry);
TASK* Task_by_pid(int pid);
/// Judges every exit the SIGCHLD handler recorded (RJ_take_exit): counts the
/// child off `rndctl.running`, drops it from the render registry, touches
/// this host's pid file, and when an entry renders that pid sets its `pid`
/// to 0 and its `waitstatus` to the exit code (a signal's number for a
/// killed render, 1 for anything else).  The service loop calls it after
/// each wait.  Returns the number of exits judged.
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
  std::vector<Job*> wakes;  // non-owning; each job once
  void kill_later(int pid);
  void wake(Job* job);
  /// Kills, then wakes.  Call only without the task file's lock.
  void run();
};

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
void Task_note_group(const Job* job, const TaskGroup* group);
void Task_retire_job(const Job* job, TaskAfterLock* after);
void Task_mark_rebuilt(const Job* job);
/// Returns the number of entries dropped.
int Task_retire_marked();
/// Reads the task file (under its lock) and drops every entry of those of
/// `jobs` whose group there was rebuilt or is gone; returns how many entries
/// went.  For a suspicion the daemon cannot settle from its own lists.
int Task_retire_rebuilt(const std::vector<Job*>& jobs);
