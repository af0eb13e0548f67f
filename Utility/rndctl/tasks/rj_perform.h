/// Running a task: turning a running-task entry into a render process, the
/// per-job log under JOBLOG, and killing this daemon's render processes.
///
/// A render program runs as a child of the daemon in its own process group
/// (proc/rj_spawn), with its error output in the task's log stream (which
/// the progress reading of rj_status follows) and its stdout in an output
/// file next to the images.  The SIGCHLD handler records the child's exit;
/// Task_judge_exits clears the entry's pid and stores the exit value, and
/// UpdateRunningTasks judges the outcome on the next pass.
///
/// Calling order: the service loop calls Perform_a_Task once for each entry
/// the selection handed it (its stream_path already set); Job_Log_out when a
/// job's tasks are cleared; daemon_kill_running_tasks on request.
///
/// Control block: reads host, location, tasks and the trace switch `debug`;
/// writes out_counter (Perform_a_Task) and running (rj_system, one up per
/// child started).
#pragma once

#include <cstdio>
#include <string>
#include <vector>

#include "Utility/rndctl/tasks/rj_taskrec.h"

/// Starts the render program of `entry`: sets its out_path, records it as
/// its resource's last task and stores the child's pid (or -1) in `pid`.
/// Returns 1 when a process was started; 0 when nothing was started: the
/// entry, its job, the job's name or executable, the task's resource or the
/// resource's name is missing, or the fork failed (the caller marks the task
/// FAILED).
[[nodiscard]] int Perform_a_Task(TASK* entry);

/// The argument list of the render program for frames start..end of `job`
/// on a resource with `num_processors`, argument 0 first: the program (by
/// the job's executable), "-p" pix, ["-m" matte], "-A", for an animated job
/// "-s" start "-e" end "-b" by, ["-S" first extension "-B" step] and "-E"
/// extension size, then the options as one argument when not blank, and the
/// scene file.  Pure: reads nothing but its arguments.
std::vector<std::string> Task_build_argv(const Job* job, int num_processors, float start,
                                         float end);

/// Starts argv[0] (searched on PATH) with `argv`, its stderr on
/// `stream_path`, its stdout on `out_path`, ZARNO_PIX_SEARCHPATH set to the
/// job's search paths and, when the job's scene lies in a project directory
/// that exists, working there.  Returns the child's pid, or -1 when argv is
/// empty or the fork failed ("ERROR: Could not fork off" on stderr; nothing
/// is counted).  A program that cannot be executed still gives a pid; its
/// child exits with 255.
[[nodiscard]] int rj_system(char* const argv[], const char* stream_path, const char* out_path,
                            Job* job);

/// Splits `path` at its last '/' into owned copies `*dir` (before, "." when
/// there is no '/') and `*base` (after); either may be null.  Returns 1 when
/// the last component of the directory equals `last` and was removed, else 0.
int rj_splitpath(const char* path, char** base, char** dir, const char* last);

/// Owned copies of the scene's directory (`*path`) and of the project
/// directory above its "sdl" directory (`*root`); both null without a scene.
/// Only traced.
void rj_set_paths(Job* job, char** path, char** root);

/// Kills (signal 9) the render of every entry whose resource is on `host`.
void daemon_kill_running_tasks(const char* host);

/// The project directory of a scene path: everything before the character
/// that precedes the first "sdl" ("/proj/sdl/a.sdl" -> "/proj"), where a
/// job's render program runs and relative output paths start.  False (and
/// `dir` untouched) for a null path or one that starts with "sdl" or holds
/// none.
bool rj_project_dir_of(const char* sdl, std::string* dir);
