// Test fixtures: a temporary control directory and a clean control block.
#pragma once

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "Utility/rndctl/rndctl.h"

/// Frees every record list of the control block and clears it, keeping
/// nothing from an earlier test.
void rndctl_reset();

/// Writes `content` to `path` (replacing it); returns false on failure.
bool write_text_file(const std::string& path, const std::string& content);
/// The whole content of `path`, or "" when it cannot be read.
std::string read_text_file(const std::string& path);
/// The pid of a child that has already exited and been reaped.
pid_t exited_pid();
/// The first `bytes` bytes of `pid` as a pid file holds it.
inline std::string pid_bytes(int32_t pid, size_t bytes = sizeof(int32_t)) {
  return std::string(reinterpret_cast<const char*>(&pid), bytes);
}
/// A child in its own process group that waits to be killed.
inline pid_t sleeper() {
  pid_t pid = fork();
  if (pid == 0)
    for (setpgid(0, 0);;) pause();
  setpgid(pid, pid);
  return pid;
}
/// The hexadecimal signal mask after `key` ("SigCgt:", ...) in a /proc status text, or
/// `absent` when the text has none.
inline unsigned long long signal_mask(const std::string& status, const char* key,
                                      unsigned long long absent = ~0ULL) {
  size_t at = status.find(key);
  return at == std::string::npos ? absent
                                 : strtoull(status.c_str() + at + strlen(key), nullptr, 16);
}
/// A resource `name` of `host`, added to the control block's list as a file's would be.
inline Dev* host_dev(const char* name, int index, const char* host) {
  Dev* dev = Add_a_dev(nullptr, name, index);
  if (dev != nullptr) dev->host_name.set(host);
  return dev;
}
/// Names each instance of a parameterised test by its case's `label`.
inline constexpr auto by_label = [](const auto& info) { return std::string(info.param.label); };
/// The sorted names in `dir`, without "." and "..".
std::vector<std::string> dir_names(const std::string& dir);
/// Forks `n` children that each run `body(i)` and _exit with its result,
/// all released at once; returns their pids and wait statuses.
struct RaceChild {
  pid_t pid;
  int status;
};
std::vector<RaceChild> race_children(int n, int (*body)(int i, void* ctx), void* ctx);
/// How a program run by run_program ended, and what it wrote.
struct Ran {
  int status = -1;  // as waitpid reports it
  std::string out, err;
  int code() const { return WIFEXITED(status) ? WEXITSTATUS(status) : -1; }
};
/// Runs `args` (a path, or a name found through PATH) in `cwd` (unless
/// empty), its stdout and stderr caught in files beside `scratch`.
Ran run_program(std::vector<std::string> args, const std::string& scratch,
                const std::string& cwd = "");
/// Removes a directory tree (for cleanup; errors are ignored).
void remove_tree(const std::string& path);

/// A fresh control directory under the temporary directory, made the control
/// block's control directory and DRCTMPDIR, with the host name "testhost" and this pid.
class ControlDirTest : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  std::string path(const std::string& name) const { return dir_ + "/" + name; }
  void write_file(const std::string& name, const std::string& content) const {
    ASSERT_TRUE(write_text_file(path(name), content)) << name;
  }
  std::string read_file(const std::string& name) const { return read_text_file(path(name)); }
  /// Makes probes of other hosts go through a stand-in remote shell that runs the command here
  /// (until the test ends).
  void use_local_rsh() const;

  std::string dir_;
};
