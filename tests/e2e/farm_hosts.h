// Farms of many render hosts on one machine, for chaos and contention tests.
//
// Each host's daemon runs in a UTS namespace of its own under the host's
// name; with a network mount it also gets a mount namespace of its own in
// which the control directory is mounted over sshfs from an sshd on the
// loopback, so that every host sees the directory through its own client.
// All hosts share this machine's pid namespace, so a liveness probe of
// another host's pid (through the rsh shim the daemons are given) asks the
// right process.
#pragma once

#include <sys/types.h>

#include <functional>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "tests/e2e/e2e_support.h"

/// An sshd on 127.0.0.1 with throw-away keys that lets root in, for sshfs
/// mounts of the control directory.
class SshServer {
 public:
  SshServer() = default;
  ~SshServer();
  SshServer(const SshServer&) = delete;
  SshServer& operator=(const SshServer&) = delete;

  /// Starts the server and tries a mount; false with the reason in `why`
  /// (not root, no sshfs or sshd, no FUSE, a failed trial mount).
  [[nodiscard]] bool start(std::string* why);
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
};
/// The stamps of a stamp file (malformed lines are skipped).
std::vector<Stamp> read_stamps(const std::string& path);
/// Names the instances of a test run on a local directory and on network mounts.
inline std::string mount_name(const testing::TestParamInfo<bool>& info) {
  return info.param ? "Sshfs" : "Local";
}
/// Nanoseconds of the clock the stamps use.
long long wall_ns();

class FarmHosts {
 public:
  /// `ssh` (null: the local directory) must outlive the hosts.
  FarmHosts(Farm& farm, const SshServer* ssh);
  ~FarmHosts();
  FarmHosts(const FarmHosts&) = delete;
  FarmHosts& operator=(const FarmHosts&) = delete;

  /// Starts (or starts again) the daemon of `host`; false when it did not
  /// reach its service loop within 30 seconds.
  [[nodiscard]] bool start(const std::string& host);
  /// The daemon of `host`'s latest start (null before the first).
  Daemon* daemon(const std::string& host);
  /// The host loses power: every process of every start of the host (daemon,
  /// renders, sshfs client) ends at once.
  void power_cut(const std::string& host);
  /// Waits up to `seconds` for `done`, waking every daemon about once a second.
  bool wait_until(const std::function<bool()>& done, double seconds);
  /// Touches the pid file of every host (what an editor does after a change).
  void touch_pid_files() const;
  /// Stops every daemon as an operator does (pid file removed, then woken);
  /// returns the hosts whose daemon was still there after `seconds`.
  std::vector<std::string> shut_down(double seconds);
  /// Pids of stamping render programs of this farm that still run.
  std::vector<int> renders_left() const;

 private:
  struct Host {
    std::vector<Daemon*> starts;       // the latest last; owned by the farm
    std::set<std::string> namespaces;  // "uts:[...]" of every start
    // Held open until the farm goes: a namespace no longer referenced may
    // have its number given to another one (a host of a test running
    // beside this one), whose processes a power cut here would then kill.
    std::vector<int> namespace_fds;
  };

  Farm& farm_;
  const SshServer* ssh_;
  std::vector<std::string> env_;
  std::map<std::string, Host> hosts_;
};
