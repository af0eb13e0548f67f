// The command-line tool against a real control directory and a real daemon.
#if defined(RNDCTL_TOOL)
#include <sys/wait.h>

#include <nlohmann/json.hpp>

#include "tests/e2e/render_farm.h"

namespace {

struct ToolRun {
  int status = -1;
  std::string out;
};

// Runs the tool with `args` on the farm; stderr joins stdout.
ToolRun rndctl(Farm& farm, const std::vector<std::string>& args) {
  std::string cmd = std::string(RNDCTL_PATH) + " -l '" + farm.dir() + "'";
  for (const auto& a : args) cmd += " '" + a + "'";
  cmd += " 2>&1";
  ToolRun r;
  FILE* p = popen(cmd.c_str(), "r");
  if (p == nullptr) return r;
  char buf[4096];
  size_t n;
  while ((n = fread(buf, 1, sizeof buf, p)) > 0) r.out.append(buf, n);
  int st = pclose(p);
  r.status = WIFEXITED(st) ? WEXITSTATUS(st) : -1;
  return r;
}

class RndctlTest : public ::testing::Test {
 protected:
  void SetUp() override {
    host_ = this_host_name();
    scene_ = make_project(farm_);
    ResourceSpec here;
    here.name = host_;
    farm_.write("Render_Resource_Control", resource_file({here}));
    farm_.write("Render_Job_Control", job_file({}, scene_));
  }
  std::vector<std::string> submit(const std::string& name, const std::string& frames) {
    return {"submit",       scene_,          "--name", name,          "--frames", frames,
            "--executable", "frame_painter", "--pix",  "pix/" + name, "--hosts",  host_};
  }
  Farm farm_;
  std::string host_;
  std::string scene_;
};

TEST_F(RndctlTest, ASubmittedJobRendersToFinishedAndListsAsJson) {
  Daemon& d = farm_.start_on_farm({}, "", render_env());
  ToolRun r = rndctl(farm_, submit("spin", "1-4"));
  ASSERT_EQ(r.status, 0) << r.out;
  EXPECT_EQ(r.out.substr(r.out.find(' ')), " spin\n");
  ASSERT_TRUE(wait_for([&] { return job_status(farm_, "spin") == "finished"; }, 120, &d))
      << d.log();
  ToolRun j = rndctl(farm_, {"jobs", "--json"});
  ASSERT_EQ(j.status, 0) << j.out;
  nlohmann::json jobs = nlohmann::json::parse(j.out);
  ASSERT_EQ(jobs.size(), 1u);
  EXPECT_EQ(jobs[0]["name"], "spin");
  EXPECT_EQ(jobs[0]["state"], "finished");
  EXPECT_EQ(jobs[0]["doneframes"], 4);
  EXPECT_EQ(jobs[0]["hosts"][0], host_);
  ToolRun h = rndctl(farm_, {"hosts", "--json"});
  nlohmann::json hosts = nlohmann::json::parse(h.out);
  EXPECT_EQ(hosts[0]["alive"], true) << h.out;
}

// Input the reader would not take back is refused before anything is written.
TEST_F(RndctlTest, RefusedInputLeavesBothFilesByteIdentical) {
  ASSERT_EQ(rndctl(farm_, submit("spin", "1-4")).status, 0);
  std::string jobs = farm_.read("Render_Job_Control");
  std::string devs = farm_.read("Render_Resource_Control");
  const std::vector<std::vector<std::string>> refused = {
      submit("two words", "1-4"),
      submit("spin2", "4-1"),
      {"submit", scene_, "--name", "x", "--hosts", "nohost"},
      {"submit", scene_, "--name", "x", "--pix", "a\"b"},
      {"submit", scene_, "--name", "x", "--schedule", "800-1700 Friday-Monday"},
      {"submit", farm_.path("missing.sdl"), "--name", "x"},
      submit("spin", "1-2"),  // a second job of one name
      {"pause", "nojob"},
      {"host", "lock", "nohost"},
      {"host", "schedule", host_, "815-900 Mon"},
      {"host", "add", "12"},
  };
  for (const auto& args : refused) {
    ToolRun r = rndctl(farm_, args);
    EXPECT_EQ(r.status, 1) << args[0] << " " << args[1] << ": " << r.out;
    EXPECT_EQ(count_of(r.out, "\n"), 1) << r.out;
  }
  EXPECT_EQ(rndctl(farm_, {"submit", "--nonsense"}).status, 2);
  EXPECT_EQ(farm_.read("Render_Job_Control"), jobs);
  EXPECT_EQ(farm_.read("Render_Resource_Control"), devs);
}

TEST_F(RndctlTest, PauseHoldsNewTasksAndResumeLetsThemRun) {
  Daemon& d = farm_.start_on_farm({}, "", render_env());
  ASSERT_EQ(rndctl(farm_, submit("spin", "1-3")).status, 0);
  ASSERT_EQ(rndctl(farm_, {"pause", "spin"}).status, 0);
  EXPECT_NE(job_block(farm_, "spin").find("ctrl\t\t= PAUSED;"), std::string::npos);
  for (int i = 0; i < 5; i++) {
    d.wake();
    usleep(100000);
  }
  EXPECT_NE(job_status(farm_, "spin"), "finished");
  ASSERT_EQ(rndctl(farm_, {"resume", "spin"}).status, 0);
  ASSERT_TRUE(wait_for([&] { return job_status(farm_, "spin") == "finished"; }, 120, &d))
      << d.log();
}

TEST_F(RndctlTest, RestartRendersEveryFrameAgain) {
  Daemon& d = farm_.start_on_farm({}, "", render_env());
  ASSERT_EQ(rndctl(farm_, submit("spin", "1-3")).status, 0);
  ASSERT_TRUE(wait_for([&] { return job_status(farm_, "spin") == "finished"; }, 120, &d))
      << d.log();
  std::string image = farm_.path("project/pix/spin.1");
  ASSERT_EQ(unlink(image.c_str()), 0);
  ToolRun r = rndctl(farm_, {"restart", "spin", "--timeout", "60"});
  ASSERT_EQ(r.status, 0) << r.out;
  ASSERT_TRUE(wait_for([&] { return job_status(farm_, "spin") == "finished"; }, 120, &d))
      << d.log();
  EXPECT_EQ(access(image.c_str(), F_OK), 0);
  ASSERT_EQ(rndctl(farm_, {"delete", "spin"}).status, 0);
  EXPECT_EQ(job_block(farm_, "spin"), "");
}

TEST_F(RndctlTest, TheWatchViewDrawsAndQuitsCleanlyInTmux) {
  if (system("command -v tmux >/dev/null 2>&1") != 0) GTEST_SKIP() << "tmux is not installed";
  ASSERT_EQ(rndctl(farm_, submit("spin", "1-3")).status, 0);
  std::string session = "rndctl_watch_" + std::to_string(getpid());
  std::string cmd = "tmux new-session -d -s " + session + " -x 80 -y 24 \"" + RNDCTL_PATH +
                    " -l '" + farm_.dir() + "' watch --interval 100; echo WATCH_ENDED; sleep 30\"";
  ASSERT_EQ(system(cmd.c_str()), 0);
  auto pane = [&] {
    std::string out;
    FILE* p = popen(("tmux capture-pane -p -t " + session).c_str(), "r");
    char buf[4096];
    size_t n;
    while (p != nullptr && (n = fread(buf, 1, sizeof buf, p)) > 0) out.append(buf, n);
    if (p != nullptr) pclose(p);
    return out;
  };
  bool drawn = wait_for([&] { return pane().find("spin") != std::string::npos; }, 30);
  std::string seen = pane();
  ASSERT_EQ(system(("tmux send-keys -t " + session + " q").c_str()), 0);
  bool ended = wait_for([&] { return pane().find("WATCH_ENDED") != std::string::npos; }, 30);
  std::string after = pane();
  (void)system(("tmux kill-session -t " + session).c_str());
  ASSERT_TRUE(drawn) << seen;
  EXPECT_NE(seen.find("[...."), std::string::npos) << seen;
  ASSERT_TRUE(ended) << after;
  // The view's own screen is gone: only the shell's line is left.
  EXPECT_EQ(after.find("rndctl watch"), std::string::npos) << after;
}

}  // namespace
#endif
