// Builders for end-to-end rendering tests: control files, a project with a
// scene, and an editor's edits of the job file.
#pragma once

#include <string>
#include <vector>

#include "tests/e2e/e2e_support.h"

struct ResourceSpec {
  std::string name{};  // also the host name
  int index = 1;
  int max_frames = 3;
  int num_processors = 2;
  std::string status = "AVAILABLE";
  std::string locks{};  // e.g. "\t{ 800 to 1700 Monday }"
};

struct JobSpec {
  std::string name = "spin";
  int index = 1;
  int priority = 0;
  std::string status = "pending";
  float start = 1, end = 6, by = 1;
  std::string opts{};  // the render program's options argument
  std::vector<std::string> hosts{};
  std::string ctrl{};  // "SCHEDULE", "PAUSED", ... or empty
  std::string runs{};  // e.g. "\t{ 800 to 900 Monday }"
  bool save_out = false;
  std::string executable = "frame_painter";
};

/// A record of the task file.
struct FileRec {
  int id;
  float start, end, current;
  int dev, retries;
  std::string status;
  bool held() const { return status == "STARTED" || status == "RUNNING"; }
};
/// The records of the task file, of every group.
std::vector<FileRec> task_records(Farm& farm);

std::string resource_file(const std::vector<ResourceSpec>& resources);
std::string job_file(const std::vector<JobSpec>& jobs, const std::string& scene);

/// A project directory with the scene "sdl/scene.sdl" (a tiny image size),
/// inside the farm; returns the scene's path.
std::string make_project(Farm& farm);

/// Environment for daemons that run the demo or the stamping render program.
std::vector<std::string> render_env();

/// Waits up to `seconds`, waking `d`, for `job` to be "finished"; false when
/// it is not (or `d` ended first).
bool job_finishes(Farm& farm, Daemon& d, double seconds = 120, const std::string& job = "spin");

/// The lock directories ("NAME.lock") in the control directory.
std::vector<std::string> lock_dirs(Farm& farm);

/// The state text of a job in the job file ("" when absent).
std::string job_status(Farm& farm, const std::string& job);
/// The job block of a job in the job file ("" when absent).
std::string job_block(Farm& farm, const std::string& job);

/// Takes the lock directory of `file` as an editor does; false when it was
/// not free within `seconds` (a lock nobody releases is a finding, not a
/// reason to hang).
[[nodiscard]] bool take_lock(Farm& farm, const std::string& file, double seconds = 60);
void drop_lock(Farm& farm, const std::string& file);

/// Rewrites the job file as an editor does: under its lock, replacing `from`
/// by `to` in the text, then touches the pid file of `host`; false when
/// `from` is not there or the lock never came free.
bool edit_job_file(Farm& farm, const std::string& from, const std::string& to,
                   const std::string& host);

/// Sets a job's state text as an editor does (under the lock, then touching
/// the pid file of `host`); false when the job has no state line.
bool set_job_status(Farm& farm, const std::string& job, const std::string& status,
                    const std::string& host);
