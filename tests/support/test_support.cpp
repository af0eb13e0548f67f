#include "tests/support/test_support.h"

#include <ftw.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <sstream>

void rndctl_reset() {
  while (rndctl.tasks != nullptr) TASK_free(rndctl.tasks);
  while (rndctl.jobs != nullptr) Job_del(rndctl.jobs);
  while (rndctl.devs != nullptr) Dev_del(rndctl.devs);
  fileop_reset();
  rndctl.current_job = nullptr;
  rndctl.current_dev = nullptr;
  rndctl.job_index.slots.clear();
  rndctl.dev_index.slots.clear();
  rndctl.location.reset();
  rndctl.user.reset();
  rndctl.host.reset();
  rndctl.install.reset();
  rndctl.last_update = 0;
  rndctl.pid = 0;
  rndctl.running = 0;
  rndctl.interval_min = 0;
  rndctl.interval_sec = 0;
  rndctl.signal_seen = 0;
  rndctl.out_counter = 0;
  rndctl.stream_counter = 0;
}

bool write_text_file(const std::string& path, const std::string& content) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << content;
  return static_cast<bool>(out);
}

std::string read_text_file(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream s;
  s << in.rdbuf();
  return s.str();
}

void remove_tree(const std::string& path) {
  nftw(
      path.c_str(),
      [](const char* p, const struct stat*, int, struct FTW*) { return ::remove(p); }, 16,
      FTW_DEPTH | FTW_PHYS);
}

void ControlDirTest::SetUp() {
  const char* tmp = getenv("TMPDIR");
  std::string templ = std::string(tmp != nullptr ? tmp : "/tmp") + "/rndctl_test_XXXXXX";
  char* made = mkdtemp(templ.data());
  ASSERT_NE(made, nullptr);
  dir_ = made;
  rndctl_reset();
  rndctl.location.set(dir_.c_str());
  rndctl.host.set("testhost");
  rndctl.user.set("tester");
  rndctl.pid = getpid();
}

void ControlDirTest::TearDown() {
  rndctl_reset();
  if (!dir_.empty() && getenv("RJ_KEEP_TEST_DIRS") == nullptr) remove_tree(dir_);
}
