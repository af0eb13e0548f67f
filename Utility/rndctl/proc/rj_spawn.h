/// Spawning a program as a child of this process, with everything the child
/// needs prepared before `fork`.
///
/// The daemon forks from a process whose heap, stdio and environment locks
/// may be held at that moment, so the child only makes async-signal-safe
/// calls (sigaction, sigprocmask, setpgid, chdir, open, dup2, close, write,
/// execve, _exit): the program path is looked up on PATH, the environment is
/// built and the failure texts' pieces are ready in the parent.  Nothing here
/// changes the parent's own environment or working directory.
///
/// The child: every signal back to its default disposition and none blocked
/// (the daemon keeps SIGALRM and SIGCHLD blocked outside its wait, and exec
/// keeps ignored dispositions and the mask); the leader of its own process
/// group, so that it and whatever it starts can be killed as one; in the
/// working directory, when given; stderr and stdout on fresh files; then the
/// program.  A failed exec writes "system(\"PROG\") failed at exec <REASON>\n"
/// to its stderr and stdout and exits with status 255.
///
/// Calling order: RJ_env_with to build an environment, then RJ_spawn.
/// Reaping the child is the caller's business (the SIGCHLD handler).  Reads
/// no field of the control block and writes none.
#pragma once

#include <string>
#include <vector>

/// One program to start.  Every pointer is non-owning and must stay valid
/// for the call only: the child has its own copy of everything after fork.
struct RjSpawn {
  char* const* argv = nullptr;  // argv[0] is the program; without a '/' it is searched on PATH
  char* const* envp = nullptr;  // the child's whole environment
  const char* stderr_path = nullptr;  // created or truncated; a symbolic link is not followed
  const char* stdout_path = nullptr;  // the same
  const char* workdir = nullptr;      // null: the parent's working directory
  // Null: silent.  Else failures in the child (a file that could not be
  // opened, a failed exec) are also written to stderr as "PREFIX:\tTEXT".
  const char* trace_prefix = nullptr;
};

/// Starts the program of `spawn`.  Returns the child's pid (above 0), which
/// is already the leader of its own process group; -1 when `fork` failed
/// (errno tells why; no child exists) or `spawn` has no argv[0].  A program
/// that cannot be executed still gives a pid: the child reports and exits
/// with 255.
[[nodiscard]] int RJ_spawn(const RjSpawn& spawn);

/// The path `name` is executed from, as execvp would look for it: a name
/// holding a '/' is taken as it is; otherwise the first regular file of that
/// name that may be executed in the directories of PATH (when PATH is unset,
/// "/bin:/usr/bin"; an empty entry is the working directory).  Returns 0 and
/// sets `*path`, or the errno an exec would give: EACCES when only files that
/// may not be executed were found, ENOENT when none (or `name` is empty).
[[nodiscard]] int RJ_find_program(const char* name, std::string* path);

/// This process's environment with `name` set to `value`: an entry of that
/// name is replaced where it stands, else the entry is added at the end.
/// The process's own environment is left alone.
std::vector<std::string> RJ_env_with(const char* name, const char* value);

/// The one kill of a render: sends `sig` to the process group that the
/// render program `pid` leads on this host (so its own children go too).
/// For another host nothing is sent (RJ_signal traces it) and 0 is returned;
/// a pid below 2 is no render and returns 0.  Otherwise kill's result: 0
/// when sent, -1 with errno set.  Not [[nodiscard]]: the killers only ask
/// for the signal; the reaping side sees whether the render ended.
int rj_kill_render(const char* host, int pid, int sig);
