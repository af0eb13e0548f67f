// End-to-end support: a control directory in a temporary folder and real
// daemon processes started on it, woken with SIGALRM instead of waiting.
#pragma once

#include <signal.h>
#include <sys/types.h>

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "tests/support/test_support.h"

/// This machine's host name, as a daemon started here sees it.
std::string this_host_name();

/// A running (or ended) daemon process.
struct Daemon {
  pid_t pid = -1;
  int status = -1;  // wait status once reaped
  bool reaped = false;
  std::string host;    // the host name it runs under
  std::string tmpdir;  // its DRCTMPDIR (where its log is)
  std::string log_path() const { return tmpdir + "/zarno_render_demon.LOG"; }
  std::string log() const { return read_text_file(log_path()); }
  /// True once the daemon catches SIGALRM (it has entered its service loop;
  /// before that a SIGALRM would end it).
  bool in_loop() const;
  /// Sends SIGALRM: the daemon wakes as from its 20-second alarm.
  void wake() const {
    if (pid > 0 && !reaped) kill(pid, SIGALRM);
  }
  /// True once the process has ended (reaps it).
  bool ended();
  /// Exit code once ended (-1 when killed by a signal or still running).
  int exit_code() const;
  /// Kills and reaps the process when it still runs.
  void stop();
};

/// A temporary control directory and the daemons started on it.
class Farm {
 public:
  Farm();
  ~Farm();
  Farm(const Farm&) = delete;
  Farm& operator=(const Farm&) = delete;

  const std::string& dir() const { return dir_; }
  std::string path(const std::string& name) const { return dir_ + "/" + name; }
  void write(const std::string& name, const std::string& content) const {
    write_text_file(path(name), content);
  }
  std::string read(const std::string& name) const { return read_text_file(path(name)); }

  /// Starts a daemon with `args` (the control directory is not added) and
  /// its own DRCTMPDIR.  With a host name other than this machine's, the
  /// daemon runs in its own UTS namespace under that name (needs root).
  /// Its stdout and stderr before the log takes over go to "<tmpdir>/early".
  Daemon& start(const std::vector<std::string>& args, const std::string& host = "",
                const std::vector<std::string>& env = {});
  /// Starts `argv` (a daemon, or a command that becomes one) as the daemon
  /// of `host`, with its own DRCTMPDIR and the three streams only; the farm
  /// owns it and ends it at the latest when the farm goes.
  Daemon& run(std::vector<std::string> argv, const std::string& host,
              const std::vector<std::string>& env);
  /// Starts a daemon on this control directory ("-l dir -d 1" plus `extra`).
  Daemon& start_on_farm(const std::vector<std::string>& extra = {}, const std::string& host = "",
                        const std::vector<std::string>& env = {});

 private:
  std::string dir_;
  std::string scratch_;
  int counter_ = 0;
  std::vector<std::unique_ptr<Daemon>> daemons_;
};

/// Polls `done` every few milliseconds, waking `daemon` (when given) now and
/// then, until it holds or `seconds` have passed.  Returns whether it held.
bool wait_for(const std::function<bool()>& done, double seconds, Daemon* wake = nullptr);

/// A loopback port nobody listens on now, or 0 (a race with another program
/// shows as a failed start).
int free_port();

/// Stops `d` (SIGSTOP) at a moment it holds no lock of the control directory:
/// a stopped holder keeps every other host waiting until the lock counts as
/// stale.  False, the daemon running, when no such moment came in `seconds`.
bool stop_between_locks(const Farm& farm, const Daemon& d, double seconds = 60);

/// Counts the occurrences of `needle` in `text`.
int count_of(const std::string& text, const std::string& needle);

/// True once no process of that pid exists (a zombie still does).
bool pid_gone(int pid);

/// Pids of a process's children, and how many of them are zombies.
std::vector<int> children_of(int pid, int* zombies = nullptr);

/// The command that runs a daemon in a UTS namespace of its own: plain
/// `unshare -u` as root, else inside a user namespace mapping us to root.
std::vector<std::string> uts_unshare();
/// True when daemons can run under other host names here.
bool can_name_hosts();
/// Why a test that needs them is skipped.
inline constexpr const char* kCannotNameHosts =
    "needs root or user namespaces: daemons run under other host names";

/// The 4-byte native pid stored in a pid file, or 0.
int read_pid_file(const std::string& path);
