/// The status page's picture of the control directory: the parsed control
/// files turned into the JSON texts the page asks for, rebuilt only when a
/// file changed.
///
/// One thread (the watcher) owns the queue library's control block and calls
/// State_refresh; the request threads only take the published snapshot with
/// State_current, which never blocks on a file.  A snapshot is immutable once
/// published: a request keeps the one it took even when a newer one comes.
///
/// The control files are looked at by their stamps (modification time, size,
/// inode) rather than by inotify, which does not see another host's write on
/// a network-mounted control directory.  A changed job, resource or task file
/// reloads all three (the task file names jobs and hosts by index), each
/// under its lock as an editor reads; the host status files, pid files and
/// the access log only rebuild the host list.  The generation counts
/// snapshots whose content differs: the page polls it.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "tools/rndctl/editor_side.h"

/// Where a job's files are, for the requests that read them.
struct ServeJobFiles {
  std::string out_dir;   // the directory of its frames (from its pix path)
  std::string base;      // the frames' name before ".NNNN"
  std::string log_path;  // JOBLOG/<job>
  struct Running {
    int task = 0;
    std::string out_prefix;  // "out.<pix>.<host>.<resource>." in out_dir
  };
  std::vector<Running> running;
};

/// What a load of the control files gives; shared by the snapshots until
/// the next load (a large queue's texts are not copied for a host change).
struct ServeJobs {
  std::string json;                    // JSON array
  std::map<int, std::string> detail;   // JSON object per job index
  std::map<int, ServeJobFiles> files;  // per job index
};

struct ServeSnapshot {
  uint64_t generation = 0;
  std::shared_ptr<const ServeJobs> jobs = std::make_shared<ServeJobs>();
  std::string hosts = "[]";  // JSON array
  std::string problem;       // why the last load failed, or ""
};

struct ServeStamp {
  struct timespec mtime {};
  off_t size = -1;
  ino_t ino = 0;
  bool operator==(const ServeStamp& o) const {
    return mtime.tv_sec == o.mtime.tv_sec && mtime.tv_nsec == o.mtime.tv_nsec && size == o.size &&
           ino == o.ino;
  }
};

struct ServeState {
  mutable std::mutex mu;
  std::shared_ptr<const ServeSnapshot> snap = std::make_shared<ServeSnapshot>();
  // The watcher's own, never touched by a request thread.
  ServeStamp control[3];
  std::map<std::string, ServeStamp> around;  // TSKSTAT, pid files, access log
  time_t hosts_built = 0;
  std::unique_ptr<CtlTasks> tasks;
  bool loaded = false;
  uint64_t loads = 0;  // full reloads, for tests and the benchmark
};

/// Looks at the files and publishes a new snapshot when something changed.
/// True when the published content changed (the generation moved).
bool State_refresh(ServeState* state);
/// The snapshot to answer from.
std::shared_ptr<const ServeSnapshot> State_current(const ServeState& state);

/// The stamp of `path` (size -1 when it does not exist).
ServeStamp State_stamp(const std::string& path);

/// A job's frame files as the page lists them: regular files in `files`'s
/// out_dir named "<base>.<digits>[.<ext>]" that start with the PNG
/// signature, in frame order.  `newest` (when given) gets the one written
/// last.
std::vector<std::string> State_frames(const ServeJobFiles& files, std::string* newest);
/// Whether `name` is one of the job's frames and a PNG: its bytes in `png`.
/// Opened without following links, only inside out_dir.
bool State_frame_bytes(const ServeJobFiles& files, const std::string& name, std::string* png);
/// The last `max_bytes` of a text file, cut at a line start ("" when absent).
std::string State_tail(const std::string& path, size_t max_bytes);
