#include "tests/support/test_support.h"

#include <dirent.h>
#include <fcntl.h>
#include <ftw.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>

void rndctl_reset() {
  while (rndctl.tasks != nullptr) TASK_free(rndctl.tasks);
  while (rndctl.jobs != nullptr) Job_del(rndctl.jobs);
  while (rndctl.devs != nullptr) Dev_del(rndctl.devs);
  fileop_reset();
  rndctl = RndCtl{};
}

bool write_text_file(const std::string& path, const std::string& content) {
  return static_cast<bool>(std::ofstream(path, std::ios::binary | std::ios::trunc) << content);
}

std::string read_text_file(const std::string& path) {
  std::ostringstream s;
  s << std::ifstream(path, std::ios::binary).rdbuf();
  return s.str();
}

pid_t exited_pid() {
  pid_t child = fork();
  if (child == 0) _exit(0);
  waitpid(child, nullptr, 0);
  return child;
}

std::vector<std::string> dir_names(const std::string& dir) {
  std::vector<std::string> names;
  if (DIR* d = opendir(dir.c_str())) {
    while (struct dirent* e = readdir(d))
      if (strcmp(e->d_name, ".") != 0 && strcmp(e->d_name, "..") != 0) names.push_back(e->d_name);
    closedir(d);
  }
  std::sort(names.begin(), names.end());
  return names;
}

std::vector<RaceChild> race_children(int n, int (*body)(int i, void* ctx), void* ctx) {
  int go[2];
  if (pipe(go) != 0) return {};
  std::vector<pid_t> children;
  for (int i = 0; i < n; i++) {
    pid_t child = fork();
    if (child == 0) {
      rndctl.pid = getpid();
      close(go[1]);
      char byte;
      if (read(go[0], &byte, 1) != 0) _exit(100);  // released by the close below
      int result = body(i, ctx);
      fflush(nullptr);
      _exit(result);
    }
    children.push_back(child);
  }
  close(go[0]);
  close(go[1]);
  std::vector<RaceChild> raced;
  for (pid_t child : children) waitpid(child, &raced.emplace_back(RaceChild{child, -1}).status, 0);
  return raced;
}

Ran run_program(std::vector<std::string> args, const std::string& scratch, const std::string& cwd) {
  const std::string out_path = scratch + ".out", err_path = scratch + ".err";
  std::vector<char*> argv;
  for (std::string& a : args) argv.push_back(a.data());
  argv.push_back(nullptr);
  pid_t pid = fork();
  if (pid == 0) {
    int out = open(out_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    int err = open(err_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    if (out < 0 || err < 0 || (!cwd.empty() && chdir(cwd.c_str()) != 0)) _exit(127);
    dup2(out, 1);
    dup2(err, 2);
    execvp(argv[0], argv.data());
    _exit(127);
  }
  Ran r;
  waitpid(pid, &r.status, 0);
  std::tie(r.out, r.err) = std::pair(read_text_file(out_path), read_text_file(err_path));
  for (const std::string& p : {out_path, err_path}) unlink(p.c_str());
  return r;
}

void remove_tree(const std::string& path) {
  nftw(
      path.c_str(), [](const char* p, const struct stat*, int, struct FTW*) { return ::remove(p); },
      16, FTW_DEPTH | FTW_PHYS);
}

void ControlDirTest::SetUp() {
  const char* tmp = getenv("TMPDIR");
  std::string templ = std::string(tmp != nullptr ? tmp : "/tmp") + "/rndctl_test_XXXXXX";
  ASSERT_NE(mkdtemp(templ.data()), nullptr);
  dir_ = templ;
  rndctl_reset();
  rndctl.location.set(dir_.c_str());
  rndctl.host.set("testhost");
  rndctl.user.set("tester");
  rndctl.pid = getpid();
  // Streams and the render registry of a test stay in its own directory.
  setenv("DRCTMPDIR", dir_.c_str(), 1);
}

void ControlDirTest::use_local_rsh() const {
  write_file("local_rsh", "#!/bin/sh\nshift; shift\nexec /bin/sh -c \"$1\"\n");
  chmod(path("local_rsh").c_str(), 0755);
  setenv("ZARNO_RSH", path("local_rsh").c_str(), 1);
}

void ControlDirTest::TearDown() {
  unsetenv("ZARNO_RSH");
  unsetenv("DRCTMPDIR");
  rndctl_reset();
  if (!dir_.empty() && getenv("RJ_KEEP_TEST_DIRS") == nullptr) remove_tree(dir_);
}
