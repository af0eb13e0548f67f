/// The tool's commands.  Each returns the process's exit status: 0 done,
/// 1 a user error (reported on stderr in one line).  Options come parsed;
/// every command loads what it needs from the control directory.
#pragma once

#include <string>
#include <vector>

struct SubmitOptions {
  std::string scene, name, frames, hosts = "all", executable, pix, matte, opts;
  std::vector<std::string> searchpaths, schedules;
  int priority = 0;
  bool paused = false, delete_when_done = false, keep_output = false;
};
struct HostOptions {
  std::string name, host;
  int processors = -1, frames = -1;
};

int Cmd_submit(const SubmitOptions& o);
int Cmd_jobs(bool json);
int Cmd_show(const std::string& job, bool json);
/// pause, resume, abort, delete.
int Cmd_job_change(const std::string& what, const std::string& job, bool force);
int Cmd_restart(const std::string& job, bool force, double timeout_seconds);
int Cmd_hosts(bool json);
/// add, set, remove, lock, unlock.
int Cmd_host_change(const std::string& what, const HostOptions& o, bool force);
int Cmd_host_schedule(const std::string& name, const std::vector<std::string>& blocks, bool force);
int Cmd_check(bool json);
int Cmd_log(const std::string& job, int task);
/// The live view; `interval_ms` bounds how long a change may go unseen.
int Cmd_watch(int interval_ms);
