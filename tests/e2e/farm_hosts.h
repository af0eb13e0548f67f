// Farms of many render hosts on one machine, for chaos and contention tests.
//
// Each host's daemon runs in a UTS namespace of its own under the host's
// name; with a network mount it also gets a mount namespace of its own in
// which the control directory is mounted over sshfs from an sshd on the
// loopback, so that every host sees the directory through its own client as
// render hosts on a network do.  All hosts share this machine's pid
// namespace, so a liveness probe of another host's pid (through the rsh
// shim the daemons are given) asks the right process.
//
// Calling order: make an SshServer when network mounts are wanted (skip the
// test when `why_unavailable` says so), then a FarmHosts on a Farm, `start`
// each host, inject faults (`kill_daemon`, `power_cut`, `freeze`/`thaw`),
// `idle` or `wait_until` while the farm works, and `shut_down` at the end.
// The destructor ends every process it started, sshfs clients included.
#pragma once

#include <sys/types.h>

#include <functional>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "tests/e2e/e2e_support.h"

/// A temporary directory, removed with everything in it.
class TempDir {
 public:
  TempDir();
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

/// An sshd on 127.0.0.1 with a throw-away host key that lets root in with a
/// throw-away key, for sshfs mounts of the control directory.
class SshServer {
 public:
  SshServer() = default;
  ~SshServer();
  SshServer(const SshServer&) = delete;
  SshServer& operator=(const SshServer&) = delete;

  /// Why network mounts cannot be made here ("" when they can): no sshfs,
  /// no sshd, no /dev/fuse, not root.
  static std::string why_unavailable();
  /// Starts the server with its keys under `dir`; false (with the reason in
  /// `why`) when it does not come up or a trial mount fails.
  [[nodiscard]] bool start(const std::string& dir, std::string* why);
  /// The shell command that mounts `remote_dir` on `mount_point` and stays in
  /// the foreground.
  std::string sshfs_command(const std::string& remote_dir, const std::string& mount_point) const;

 private:
  pid_t pid_ = -1;
  int port_ = 0;
  std::string dir_;
};

/// One frame rendered completely, as the stamping render program notes it.
struct Stamp {
  std::string host;
  float frame = 0;
  long long start_ns = 0, end_ns = 0;
  int pid = 0;
};
/// The stamps of a stamp file (malformed lines are skipped).
std::vector<Stamp> read_stamps(const std::string& path);

/// Nanoseconds of the clock the stamps use.
long long wall_ns();

class FarmHosts {
 public:
  /// `ssh` (may be null: local directory) must outlive the hosts.
  FarmHosts(Farm& farm, const SshServer* ssh);
  ~FarmHosts();
  FarmHosts(const FarmHosts&) = delete;
  FarmHosts& operator=(const FarmHosts&) = delete;

  /// Environment of every daemon: the render program on PATH and the rsh
  /// shim for liveness probes, plus `extra`.
  void set_env(const std::vector<std::string>& extra);
  /// Starts (or starts again) the daemon of `host`; waits until it runs its
  /// service loop.  False when it did not get there within 30 seconds.
  [[nodiscard]] bool start(const std::string& host);
  /// The daemon of `host`'s latest start (null before the first).
  Daemon* daemon(const std::string& host);
  const std::vector<std::string>& hosts() const { return order_; }

  /// kill -9 of the daemon alone: its renders run on, orphaned.
  void kill_daemon(const std::string& host);
  /// The host loses power: its daemon, every render and the sshfs client of
  /// every earlier start of the host end at once.
  void power_cut(const std::string& host);
  /// SIGSTOP and SIGCONT of the daemon alone.
  void freeze(const std::string& host);
  void thaw(const std::string& host);

  /// Wakes every daemon that runs its loop and is not frozen (SIGALRM).
  void wake_all();
  /// Lets the farm work for `seconds`, waking the daemons about once a second.
  void idle(double seconds);
  /// Waits up to `seconds` for `done`, waking the daemons as `idle` does.
  bool wait_until(const std::function<bool()>& done, double seconds);
  /// Touches the pid file of every host (what an editor does after a change).
  void touch_pid_files() const;

  /// Ends every daemon as an operator does (its pid file removed, then a
  /// wake-up); returns the hosts whose daemon was still there after
  /// `seconds` (they are killed).
  std::vector<std::string> shut_down(double seconds);
  /// Pids of render programs started on this farm that still run.
  std::vector<int> renders_left() const;
  /// Kills them.
  void kill_renders() const;

 private:
  struct Host {
    std::vector<Daemon*> starts;       // the latest last; owned by the farm
    std::set<std::string> namespaces;  // "uts:[...]" of every start
    bool frozen = false;
  };
  std::vector<int> processes_of(const Host& host) const;

  Farm& farm_;
  const SshServer* ssh_;  // not owned
  std::string scratch_;
  std::vector<std::string> env_;
  std::map<std::string, Host> hosts_;
  std::vector<std::string> order_;
};
