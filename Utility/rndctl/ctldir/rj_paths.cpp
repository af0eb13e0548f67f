// The control directory's layout.  The formats here are what every other
// process of the farm (editors, tools, older daemons) looks for: change
// none of them.
#include "Utility/rndctl/ctldir/rj_paths.h"

#include <cstdio>

#include "Utility/rndctl/base/rj_control.h"

const char* const control_names[FILE_COUNT] = {
    "Render_Job_Control",    "Render_Resource_Control", "Render_Tasks",  "RndCtl_EditPids",
    "Render_Dev_next_index", "Render_Job_next_index",   "Render_Access", "Render_Status"};

namespace {

bool valid_index(int index) { return index >= 0 && index < FILE_COUNT; }

// "DIR/" + name + suffix, the only shape of path in the directory.
std::string in_ctldir(const char* name, const char* suffix = "") {
  std::string path(rj_ctldir());
  path += '/';
  path += name != nullptr ? name : "";
  path += suffix != nullptr ? suffix : "";
  return path;
}

}  // namespace

const char* rj_ctldir() {
  const char* dir = rndctl.location.or_else(".");
  return dir[0] != '\0' ? dir : ".";
}

std::string rj_control_path(int index) {
  return valid_index(index) ? in_ctldir(control_names[index]) : std::string();
}

std::string rj_lock_path(int index) {
  return valid_index(index) ? in_ctldir(control_names[index], ".lock") : std::string();
}

std::string rj_pid_path(const char* host) { return in_ctldir(host, ".pid"); }

bool rj_pid_path(char* out, size_t size, const char* host) {
  if (size == 0) return false;
  int n = snprintf(out, size, "%s/%s.pid", rj_ctldir(), host != nullptr ? host : "");
  return n >= 0 && static_cast<size_t>(n) < size;
}

std::string rj_pid_claim_path(const char* host, int pid) {
  std::string name = ".";
  name += host != nullptr ? host : "";
  return in_ctldir(name.c_str(), (".pid." + std::to_string(pid)).c_str());
}

std::string rj_clock_path(const char* host) {
  std::string name = ".clock.";
  name += host != nullptr ? host : "";
  return in_ctldir(name.c_str());
}

std::string rj_joblog_dir() { return in_ctldir("JOBLOG"); }

std::string rj_joblog_path(const char* job) { return in_ctldir("JOBLOG/", job); }

std::string rj_tskstat_dir() { return in_ctldir("TSKSTAT"); }

std::string rj_tskstat_path(const char* host) { return in_ctldir("TSKSTAT/", host); }
