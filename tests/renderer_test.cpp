// The demo renderer's command-line contract and fault switches, run as the
// daemon runs it: a real process in a project directory.

#include <dirent.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <sstream>
#include <string>
#include <vector>

#include "tests/support/test_support.h"

namespace {

using Strings = std::vector<std::string>;

const char kScene[] =
    "# test scene\nanimation = ON;\nstartframe = 1;\nendframe = 10;\nbyframe = 1;\n"
    "size = 32x24;\nball_radius = 4;\nball_path = 4 16 28 16;\nbounce = 8;\n"
    "box = 0 20 32 4 40 110 50;\n";

struct Outcome {
  int status = -1;  // as waitpid reports it
  std::string out, err;
  bool exited(int code) const { return WIFEXITED(status) && WEXITSTATUS(status) == code; }
};

Strings split_lines(const std::string& text) {
  Strings lines;
  std::istringstream in(text);
  for (std::string l; std::getline(in, l);) lines.push_back(l);
  return lines;
}

bool has_error_line(const std::string& text) { return text.find("Error") != std::string::npos; }

// The ball scene from frame 1 to `end` by 1, with the extension size and
// the option word given ("" for none).
Strings ball(const char* end, const char* ext, const std::string& options = "") {
  Strings args = {"-p", "pix/ball", "-s", "1", "-e", end, "-b", "1", "-E", ext};
  if (!options.empty()) args.push_back(options);
  args.push_back("sdl/scene.sdl");
  return args;
}

class RendererTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char tmpl[] = "/tmp/frame_painter_test.XXXXXX";
    ASSERT_NE(mkdtemp(tmpl), nullptr);
    project_ = tmpl;
    ASSERT_EQ(mkdir((project_ + "/sdl").c_str(), 0755), 0);
    ASSERT_EQ(mkdir((project_ + "/pix").c_str(), 0755), 0);
    ASSERT_TRUE(write_text_file(project_ + "/sdl/scene.sdl", kScene));
  }
  void TearDown() override { remove_tree(project_); }

  // Runs the renderer in `cwd` (the project directory by default), its
  // streams caught in files outside the project.
  Outcome render(Strings args, std::string cwd = "") {
    if (cwd.empty()) cwd = project_;
    std::string out_path = project_ + ".out", err_path = project_ + ".err";
    args.insert(args.begin(), FRAME_PAINTER_PATH);
    std::vector<char*> argv;
    for (std::string& a : args) argv.push_back(a.data());
    argv.push_back(nullptr);
    pid_t pid = fork();
    if (pid == 0) {
      int out = open(out_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
      int err = open(err_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
      if (out < 0 || err < 0 || chdir(cwd.c_str()) != 0) _exit(127);
      dup2(out, 1);
      dup2(err, 2);
      execv(argv[0], argv.data());
      _exit(127);
    }
    Outcome r;
    waitpid(pid, &r.status, 0);
    r.out = read_text_file(out_path);
    r.err = read_text_file(err_path);
    unlink(out_path.c_str());
    unlink(err_path.c_str());
    return r;
  }

  Strings pix_files() const {
    Strings names;
    DIR* dir = opendir((project_ + "/pix").c_str());
    while (dirent* e = dir != nullptr ? readdir(dir) : nullptr)
      if (e->d_name[0] != '.') names.push_back(e->d_name);
    if (dir != nullptr) closedir(dir);
    std::sort(names.begin(), names.end());
    return names;
  }
  void clear_pix() {
    for (const std::string& f : pix_files()) remove(pix(f).c_str());
  }

  std::string pix(const std::string& name) const { return project_ + "/pix/" + name; }

  std::string project_;
};

struct NamingCase {
  Strings args;
  Strings images;
};

class RendererNaming : public RendererTest, public ::testing::WithParamInterface<NamingCase> {};

TEST_P(RendererNaming, WritesOneImagePerFrameUnderItsExtension) {
  ASSERT_TRUE(write_text_file(project_ + "/sdl/still.sdl", "animation = OFF;\nsize = 32x24;\n"));
  Strings args = {"-p", "pix/ball"};
  args.insert(args.end(), GetParam().args.begin(), GetParam().args.end());
  Outcome r = render(args);
  ASSERT_TRUE(r.exited(0)) << r.err;
  EXPECT_FALSE(has_error_line(r.out + r.err));
  // Exactly the frames, nothing else: no temporaries left beside them.
  ASSERT_EQ(pix_files(), GetParam().images);
}

// The first case is the daemon's own shape for a shading program, with flags
// to ignore; fractional steps need -S, as the frame number alone would repeat.
// clang-format off
INSTANTIATE_TEST_SUITE_P(Ranges, RendererNaming, testing::Values(
    NamingCase{{"-V", "-n4", "-A", "-s", "1.000000", "-e", "3.000000", "-b", "1.000000", "-E", "4", "sdl/scene.sdl"}, {"ball.0001", "ball.0002", "ball.0003"}},
    NamingCase{{"-s", "1", "-e", "3", "-b", "1", "-S", "10", "-B", "5", "-E", "3", "sdl/scene.sdl"}, {"ball.010", "ball.015", "ball.020"}},
    NamingCase{{"-s", "1", "-e", "2", "-b", "0.5", "-S", "1", "-B", "1", "-E", "1", "sdl/scene.sdl"}, {"ball.1", "ball.2", "ball.3"}},
    // No range: the scene's own.
    NamingCase{{"-E", "2", " ", "sdl/scene.sdl"}, {"ball.01", "ball.02", "ball.03", "ball.04", "ball.05", "ball.06", "ball.07", "ball.08", "ball.09", "ball.10"}},
    // A still scene writes the pix path itself.
    NamingCase{{"sdl/still.sdl"}, {"ball"}}));
// clang-format on

// The daemon counts a task's frames with its own arithmetic and judges
// progress by it; the renderer must paint exactly that many.
class RendererFrameCount : public RendererTest,
                           public ::testing::WithParamInterface<std::vector<float>> {};

TEST_P(RendererFrameCount, AgreesWithTheQueue) {
  const std::vector<float>& r = GetParam();
  auto text = [](float v) { return std::to_string(v); };  // "%f"
  Outcome out = render({"-p", "pix/ball", "-s", text(r[0]), "-e", text(r[1]), "-b", text(r[2]),
                        "-S", "1", "-B", "1", "-E", "3", "size=2x2", "sdl/scene.sdl"});
  ASSERT_TRUE(out.exited(0)) << out.err;
  EXPECT_EQ(static_cast<int>(pix_files().size()), Calc_frame_range(r[0], r[1], r[2]));
}

INSTANTIATE_TEST_SUITE_P(Ranges, RendererFrameCount,
                         testing::Values(std::vector<float>{1, 10, 0.1f},
                                         std::vector<float>{1.5f, 4.5f, 0.75f}));

TEST_F(RendererTest, ProgressLinesGiveTheDaemonTheLinesDone) {
  Outcome r = render(ball("3", "2", "size=8x5"));
  ASSERT_TRUE(r.exited(0)) << r.err;

  Strings lines = split_lines(r.err);
  ASSERT_EQ(lines.size(), 15u) << r.err;
  for (size_t i = 0; i < lines.size(); i++) {
    char name[256];
    char letter = 0;
    int line = 0, of = 0;
    ASSERT_EQ(sscanf(lines[i].c_str(), "%255s %c %d of %d", name, &letter, &line, &of), 4)
        << lines[i];
    // The image name carries the frame extension after its last '.'.
    EXPECT_EQ(name, "ball.0" + std::to_string(i / 5 + 1));
    EXPECT_EQ(letter, 'r');
    EXPECT_EQ(of, 5);
    // What the daemon does with the number.
    if (line <= 0) line += of;
    EXPECT_EQ(line - 2, static_cast<int>(i % 5) + 1) << lines[i];
  }
}

TEST_F(RendererTest, FailAtStopsBeforeTheFrameLeavingTheLastProgressLineLast) {
  Outcome r = render(ball("4", "1", "size=8x6 fail_at=3"));
  EXPECT_TRUE(r.exited(1));
  EXPECT_EQ(pix_files(), (Strings{"ball.1", "ball.2"}));
  // The output file is searched for the error line ...
  std::string last_out = split_lines(r.out).back();
  EXPECT_TRUE(has_error_line(last_out) && last_out.find("frame 3") != std::string::npos);
  // ... while the stream still ends on frame 2 complete, which is where the
  // daemon cuts the task for its retry.
  EXPECT_FALSE(has_error_line(r.err));
  EXPECT_EQ(split_lines(r.err).back(), "ball.2 r 8 of 6");
}

TEST_F(RendererTest, DieAtEndsTheProcessByTheSignalAtThatFrame) {
  for (auto [name, sig] : {std::pair{"9", SIGKILL}, {"TERM", SIGTERM}, {"SIGINT", SIGINT}}) {
    SCOPED_TRACE(name);
    Outcome r = render(ball("4", "1", std::string("size=8x6 die_at=3:") + name));
    EXPECT_TRUE(WIFSIGNALED(r.status) && WTERMSIG(r.status) == sig) << r.status;
    EXPECT_EQ(pix_files(), (Strings{"ball.1", "ball.2"}));
    clear_pix();
  }
}

TEST_F(RendererTest, FailOnceFailsTheFirstRunAndLetsTheRetryThrough) {
  for (auto [options, after_failure] :
       {std::pair{"size=8x6 fail_at=2 fail_once=once_at", Strings{"ball.1"}},
        {"size=8x6 fail_once=once_first", Strings{}}}) {
    SCOPED_TRACE(options);
    Outcome first = render(ball("3", "1", options));
    EXPECT_TRUE(first.exited(1) && has_error_line(first.out));
    EXPECT_EQ(pix_files(), after_failure);
    Outcome retry = render(ball("3", "1", options));
    EXPECT_TRUE(retry.exited(0)) << retry.err;
    EXPECT_EQ(pix_files(), (Strings{"ball.1", "ball.2", "ball.3"}));
    clear_pix();
  }
}

class RendererRefuses : public RendererTest, public ::testing::WithParamInterface<Strings> {};

TEST_P(RendererRefuses, WithAnErrorLineAndStatusOne) {
  ASSERT_TRUE(write_text_file(project_ + "/sdl/bad.sdl", "size = 8x6;\nball_radius = fat;\n"));
  Outcome r = render(GetParam());
  EXPECT_TRUE(r.exited(1));
  EXPECT_TRUE(has_error_line(r.err)) << r.err;
  EXPECT_EQ(pix_files(), Strings{});
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(BadInvocations, RendererRefuses, testing::Values(
    Strings{"-p", "pix/ball", "-s", "one", "sdl/scene.sdl"},
    Strings{"-p", "pix/ball", "-s", "1", "-e"},
    Strings{"-p", "pix/ball", "sdl/missing.sdl"},
    Strings{"-p", "pix/ball", "sdl/bad.sdl"},
    Strings{"sdl/scene.sdl"},
    Strings{"-p", "nodir/ball", "sdl/scene.sdl"},
    Strings{"-p", "pix/ball", "bogus=1", "sdl/scene.sdl"},
    Strings{"-p", "pix/ball", "size=0x5", "sdl/scene.sdl"},
    Strings{"-p", "pix/ball", "die_at=3", "sdl/scene.sdl"},
    Strings{"-p", "pix/ball", "a=1", "b=2", "sdl/scene.sdl"}));
// clang-format on

TEST_F(RendererTest, ShippedDemoSceneRendersFromItsProjectDirectory) {
  Outcome r = render({"-p", project_ + "/pix/demo", "-s", "1", "-e", "2", "-b", "1", "-E", "4",
                      "size=16x12", "sdl/bouncing_ball.sdl"},
                     std::string(DEMO_DIR) + "/project");
  ASSERT_TRUE(r.exited(0)) << r.err;
  EXPECT_EQ(pix_files(), (Strings{"demo.0001", "demo.0002"}));
}

}  // namespace

// The queue reads the same scene by searching lines for its keys: a comment
// or a drawing key that happens to hold one of them would change the job.
TEST(DemoScene, QueueReadsTheAnimationTheRendererDraws) {
  Job job;
  job.sdl.set(DEMO_DIR "/project/sdl/bouncing_ball.sdl");
  EXPECT_EQ(Job_set_frame_range(&job), 24);
  EXPECT_EQ(job.animate, 1);
  EXPECT_THAT(job.frames, testing::ElementsAre(1.0f, 24.0f, 1.0f));
  EXPECT_EQ(job.ext_size, 4);
  job.fields = 3;
  EXPECT_EQ(Job_check_sdlfields(&job), 0);
}
