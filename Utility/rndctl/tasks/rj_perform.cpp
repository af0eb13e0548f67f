#include "Utility/rndctl/tasks/rj_perform.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_scoped.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/proc/rj_registry.h"
#include "Utility/rndctl/proc/rj_signal.h"
#include "Utility/rndctl/proc/rj_spawn.h"
#include "Utility/rndctl/records/rj_dev.h"
#include "Utility/rndctl/records/rj_frames.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/tasks/rj_status.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"
#include "Utility/rndctl/tasks/rj_tskio.h"

namespace {

constexpr const char* kUnit = "Utility/rndctl/rj_perform";

struct MaFree {
  void operator()(char* p) const { MA_free(p, __LINE__, kUnit); }
};
using ScopedBlock = std::unique_ptr<char, MaFree>;

std::string formatted(const char* format, ...) __attribute__((format(printf, 1, 2)));
std::string formatted(const char* format, ...) {
  char buf[64];
  va_list ap;
  va_start(ap, format);
  vsnprintf(buf, sizeof buf, format, ap);
  va_end(ap);
  return buf;
}

// The NULL-terminated array execve takes, pointing into `texts`.
std::vector<char*> c_array(std::vector<std::string>& texts) {
  std::vector<char*> array;
  array.reserve(texts.size() + 1);
  for (std::string& t : texts) array.push_back(t.data());
  array.push_back(nullptr);
  return array;
}

// The directory a job's render program runs in: its project directory when
// that exists, else (false) wherever the daemon is.
bool render_dir_of(const Job* job, std::string* dir) {
  if (job == nullptr || !rj_project_dir_of(job->sdl.c_str(), dir)) return false;
  struct stat st;
  return stat(dir->c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

// The two paths of a job, for the trace only.
void trace_paths(Job* job) {
  if (debug == 0) return;
  char* path = nullptr;
  char* root = nullptr;
  rj_set_paths(job, &path, &root);
  dbgpnt("------ Perform_a_Task path: \"%s\", root: \"%s\"\n", path != nullptr ? path : "",
         root != nullptr ? root : "");
  MA_free(path, __LINE__, kUnit);
  MA_free(root, __LINE__, kUnit);
}

// Names the file the render program's stdout goes to, "out.PIX.HOST.DEV.N"
// beside the images, and counts the output counter on.
void set_out_path(TASK* entry, const Job* job, const Dev* dev) {
  char* pix_file = nullptr;
  char* pix_dir = nullptr;
  rj_splitpath(job->pix.c_str(), &pix_file, &pix_dir, "");
  ScopedBlock pix_file_guard(pix_file);
  ScopedBlock pix_dir_guard(pix_dir);
  char out[4096];
  snprintf(out, sizeof out, "%s/out.%s.%s.%s.%d", pix_dir != nullptr ? pix_dir : ".",
           pix_file != nullptr ? pix_file : "", dev->host_name.or_else(""), dev->name.c_str(),
           rndctl.out_counter);
  // Wraps to 0 rather than going negative.
  rndctl.out_counter = rndctl.out_counter == INT_MAX ? 0 : rndctl.out_counter + 1;
  // The program opens its output from its own working directory; the
  // daemon, which stays where it is, reads and removes the same file, so a
  // relative path is anchored there for both.
  std::string workdir;
  if (out[0] != '/' && render_dir_of(job, &workdir)) {
    if (workdir[0] != '/') {
      char cwd[4096];
      if (getcwd(cwd, sizeof cwd) != nullptr) workdir = std::string(cwd) + "/" + workdir;
    }
    entry->out_path.set((workdir + "/" + out).c_str());
  } else {
    entry->out_path.set(out);
  }
}

void trace_argv(const std::vector<std::string>& args) {
  if (debug == 0) return;
  fprintf(stderr, "%s: ", rndctl.host.or_else(""));
  for (const std::string& a : args) fprintf(stderr, "%s ", a.c_str());
  fprintf(stderr, "\n");
  fflush(stderr);
}

}  // namespace

int rj_splitpath(const char* path, char** base, char** dir, const char* last) {
  if (base != nullptr) *base = nullptr;
  if (dir != nullptr) *dir = nullptr;
  if (path == nullptr) return 0;

  std::string d;
  std::string b;
  const char* slash = strrchr(path, '/');
  if (slash != nullptr) {
    d.assign(path, static_cast<size_t>(slash - path));
    b.assign(slash + 1);
  } else {
    d = ".";
    b = path;
  }

  int stripped = 0;
  if (last != nullptr && *last != '\0') {
    size_t cut = d.rfind('/');
    const char* component = cut == std::string::npos ? d.c_str() : d.c_str() + cut + 1;
    if (strcmp(component, last) == 0) {
      d = cut == std::string::npos ? std::string(".") : d.substr(0, cut);
      stripped = 1;
    }
  }

  if (base != nullptr) *base = MA_strdup(b.c_str(), __LINE__, kUnit);
  if (dir != nullptr) *dir = MA_strdup(d.c_str(), __LINE__, kUnit);
  return stripped;
}

void rj_set_paths(Job* job, char** path, char** root) {
  if (path != nullptr) *path = nullptr;
  if (root != nullptr) *root = nullptr;
  if (job == nullptr || job->sdl.none()) return;
  // path: the scene's own directory; root: the project directory, the one
  // above the scene's "sdl" directory (the scene's directory when there is
  // no such level).
  if (path != nullptr) rj_splitpath(job->sdl.c_str(), nullptr, path, nullptr);
  if (root != nullptr) rj_splitpath(job->sdl.c_str(), nullptr, root, "sdl");
}

int rj_system(char* const argv[], const char* stream_path, const char* out_path, Job* job) {
  if (argv == nullptr || argv[0] == nullptr) return -1;

  // The render program finds its images through this; one entry per path,
  // each after a space, so the value begins with a space.  Only the child's
  // environment has it: the daemon's own is never changed.
  std::string search;
  if (job != nullptr) {
    for (RndPathList* p = job->searchpath; p != nullptr; p = p->next) {
      search += ' ';
      search += p->path.or_else("");
    }
  }
  std::vector<std::string> env = RJ_env_with("ZARNO_PIX_SEARCHPATH", search.c_str());
  std::vector<char*> envp = c_array(env);

  // Only the child changes directory: the daemon holds relative paths.
  std::string workdir;
  RjSpawn spawn;
  spawn.argv = argv;
  spawn.envp = envp.data();
  spawn.stderr_path = stream_path;
  spawn.stdout_path = out_path;
  spawn.workdir = render_dir_of(job, &workdir) ? workdir.c_str() : nullptr;
  spawn.trace_prefix = debug != 0 ? rndctl.host.or_else("") : nullptr;
  const int pid = RJ_spawn(spawn);
  if (pid < 0) {
    fprintf(stderr, "ERROR: Could not fork off\n");
    fflush(stderr);
    // Not counted: no child exists that the SIGCHLD side would ever reap.
    return -1;
  }
  rndctl.running = rndctl.running + 1;
  // Remembered outside the daemon, so that a daemon started after a crash
  // of this one can end the render instead of letting it run unowned.
  rj_render_started(pid);
  return pid;
}

std::vector<std::string> Task_build_argv(const Job* job, int num_processors, float start,
                                         float end) {
  std::vector<std::string> args;
  if (job->executable.is("edgepass")) {
    args.emplace_back("shadepass");
    args.emplace_back("-V");
  } else if (job->executable.is("glintcast") || job->executable.is("glintwalk")) {
    args.emplace_back(job->executable.c_str());
    args.push_back(formatted("-n%d", num_processors));
  } else {
    args.emplace_back(job->executable.or_else(""));
  }
  args.emplace_back("-p");
  args.emplace_back(job->pix.or_else(""));
  if (job->output_mask != 0) {
    args.emplace_back("-m");
    args.emplace_back(job->matte.or_else(""));
  }
  args.emplace_back("-A");
  if (job->animate != 0) {
    args.emplace_back("-s");
    args.push_back(formatted("%f", static_cast<double>(start)));
    args.emplace_back("-e");
    args.push_back(formatted("%f", static_cast<double>(end)));
    args.emplace_back("-b");
    args.push_back(formatted("%f", static_cast<double>(job->frames[2])));
    int step = 0;
    if (rj_frames_numbering(job, &step) != 0) {
      args.emplace_back("-S");
      args.push_back(formatted("%d", rj_frame_extension(job, start)));
      args.emplace_back("-B");
      args.push_back(formatted("%d", step));
    }
    args.emplace_back("-E");
    args.push_back(formatted("%d", job->ext_size));
  }
  if (job->rnd_opts && job->rnd_opts.c_str()[strspn(job->rnd_opts.c_str(), " ")] != '\0') {
    args.emplace_back(job->rnd_opts.c_str());
  }
  args.emplace_back(job->sdl.or_else(""));
  return args;
}

int Perform_a_Task(TASK* entry) {
  if (entry == nullptr || entry->job == nullptr || entry->rec == nullptr) return 0;
  Job* job = entry->job;
  Dev* dev = entry->rec->dev;
  if (job->name.none() || job->executable.none() || dev == nullptr || dev->name.none()) return 0;

  dbgpnt("-----------------------------------Perform_a_Task( %d )\n", entry->rec->id);
  dev->last_task = entry;
  trace_paths(job);
  set_out_path(entry, job, dev);

  std::vector<std::string> args =
      Task_build_argv(job, dev->num_processors, entry->rec->start, entry->rec->end);
  trace_argv(args);
  std::vector<char*> argv = c_array(args);
  int pid = rj_system(argv.data(), entry->stream_path.c_str(), entry->out_path.c_str(), job);
  entry->pid = pid;
  dbgpnt("%s.%s = %d\n", job->name.c_str(), dev->name.c_str(), pid);
  dbgpnt("---------------------------done----Perform_a_Task\n");
  // A failed fork started nothing: the caller marks the task FAILED and it
  // is put back for another try.
  return pid > 0 ? 1 : 0;
}

void daemon_kill_running_tasks(const char* host) {
  if (host == nullptr) return;
  for (TASK* entry = rndctl.tasks; entry != nullptr; entry = entry->next) {
    if (entry->rec == nullptr || !rj_dev_on_host(entry->rec->dev, host)) continue;
    rj_kill_render(host, entry->pid, 9);
  }
}

bool rj_project_dir_of(const char* sdl, std::string* dir) {
  if (sdl == nullptr) return false;
  const char* hit = strstr(sdl, "sdl");
  if (hit == nullptr || hit == sdl) return false;
  dir->assign(sdl, static_cast<size_t>(hit - sdl - 1));
  return true;
}
