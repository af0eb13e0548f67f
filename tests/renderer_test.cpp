// The demo renderer's scene, naming, progress and fault switches, run as the
// daemon runs it: a real process in a project directory.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <sstream>
#include <string>
#include <vector>

#include "tests/support/test_support.h"

namespace {

using Strings = std::vector<std::string>;

Strings split_lines(const std::string& text) {
  Strings lines;
  std::istringstream in(text);
  for (std::string l; std::getline(in, l);) lines.push_back(l);
  return lines;
}
bool has_error_line(const std::string& text) { return text.find("Error") != std::string::npos; }

// The ball scene from frame 1 to `end` by 1, with the extension size and
// the option word given.
Strings ball(const char* end, const char* ext, const std::string& options) {
  return {"-p", "pix/ball", "-s", "1", "-e", end, "-b", "1", "-E", ext, options, "sdl/scene.sdl"};
}

class RendererTest : public ::testing::Test {
 protected:
  void SetUp() override {
    project_ = testing::TempDir() + "frame_painter_test.XXXXXX";
    ASSERT_NE(mkdtemp(project_.data()), nullptr);
    for (const char* sub : {"/sdl", "/pix"}) ASSERT_EQ(mkdir((project_ + sub).c_str(), 0755), 0);
    ASSERT_TRUE(write_text_file(
        project_ + "/sdl/scene.sdl",
        "# test scene\nanimation = ON;\nstartframe = 1;\nendframe = 10;\nbyframe = 1;\n"
        "size = 32x24;\nball_radius = 4;\nball_path = 4 16 28 16;\nbounce = 8;\n"
        "box = 0 20 32 4 40 110 50;\n"));
  }
  void TearDown() override { remove_tree(project_); }
  Ran render(Strings args) {
    args.insert(args.begin(), FRAME_PAINTER_PATH);
    return run_program(args, project_, project_);
  }
  // The images written (and removed, unless `keep`).
  Strings pix_files(bool keep = true) const {
    Strings names = dir_names(project_ + "/pix");
    for (const std::string& f : keep ? Strings{} : names) remove((project_ + "/pix/" + f).c_str());
    return names;
  }
  std::string project_;
};

// Each frame's image under its extension, exactly, with no temporaries left
// beside them; no images are the scene and option words the renderer refuses
// (its command line's own rules are pinned by the wrapper parser's table).
struct NamingCase {
  Strings args, images;
};
class RendererNaming : public RendererTest, public ::testing::WithParamInterface<NamingCase> {};

TEST_P(RendererNaming, WritesOneImagePerFrameOrRefusesWithAnErrorLine) {
  ASSERT_TRUE(write_text_file(project_ + "/sdl/still.sdl", "animation = OFF;\nsize = 32x24;\n"));
  ASSERT_TRUE(write_text_file(project_ + "/sdl/bad.sdl", "size = 8x6;\nball_radius = fat;\n"));
  Ran r = render(GetParam().args);
  bool refused = GetParam().images.empty();
  EXPECT_EQ(std::tuple(r.code(), has_error_line(r.out + r.err), pix_files()),
            std::tuple(refused ? 1 : 0, refused, GetParam().images))
      << r.out << r.err;
}

// The daemon's own shape for a shading program, with flags to ignore;
// fractional steps need -S, as the frame number alone would repeat; no range
// is the scene's own; a still scene writes the pix path itself.
// clang-format off
INSTANTIATE_TEST_SUITE_P(Ranges, RendererNaming, testing::Values(
    NamingCase{{"-p", "pix/ball", "-V", "-n4", "-A", "-s", "1.000000", "-e", "3.000000", "-b", "1.000000", "-E", "4", "sdl/scene.sdl"}, {"ball.0001", "ball.0002", "ball.0003"}},
    NamingCase{{"-p", "pix/ball", "-s", "1", "-e", "2", "-b", "0.5", "-S", "1", "-B", "1", "-E", "1", "sdl/scene.sdl"}, {"ball.1", "ball.2", "ball.3"}},
    NamingCase{{"-p", "pix/ball", "-E", "2", " ", "sdl/scene.sdl"}, {"ball.01", "ball.02", "ball.03", "ball.04", "ball.05", "ball.06", "ball.07", "ball.08", "ball.09", "ball.10"}},
    NamingCase{{"-p", "pix/ball", "sdl/still.sdl"}, {"ball"}},
    NamingCase{{"-p", "pix/ball", "sdl/missing.sdl"}, {}},
    NamingCase{{"-p", "pix/ball", "sdl/bad.sdl"}, {}},
    NamingCase{{"-p", "nodir/ball", "sdl/scene.sdl"}, {}},
    NamingCase{{"-p", "pix/ball", "bogus=1", "sdl/scene.sdl"}, {}},
    NamingCase{{"-p", "pix/ball", "size=0x5", "sdl/scene.sdl"}, {}},
    NamingCase{{"-p", "pix/ball", "die_at=3", "sdl/scene.sdl"}, {}}));
// clang-format on

// The daemon counts a task's frames with its own arithmetic and judges
// progress by it; the renderer must paint exactly that many.
TEST_F(RendererTest, FrameCountAgreesWithTheQueue) {
  for (auto [s, e, b] : {std::tuple{1.f, 10.f, 0.1f}, {1.5f, 4.5f, 0.75f}}) {
    using std::to_string;  // as "%f"
    Ran out = render({"-p", "pix/ball", "-s", to_string(s), "-e", to_string(e), "-b", to_string(b),
                      "-S", "1", "-B", "1", "-E", "3", "size=2x2", "sdl/scene.sdl"});
    ASSERT_EQ(out.code(), 0) << out.err;
    EXPECT_EQ(static_cast<int>(pix_files(false).size()), Calc_frame_range(s, e, b));
  }
}

TEST_F(RendererTest, ProgressLinesGiveTheDaemonTheLinesDone) {
  Ran r = render(ball("3", "2", "size=8x5"));
  ASSERT_EQ(r.code(), 0) << r.err;
  Strings want;
  for (int i = 0; i < 15; i++)
    want.push_back("ball.0" + std::to_string(i / 5 + 1) + " r " + std::to_string(i % 5 + 3) +
                   " of 5");
  EXPECT_EQ(split_lines(r.err), want);
}

// The fault switches fail, kill or fail once at a frame, leaving the frames before it.
TEST_F(RendererTest, FaultSwitchesStopAtTheirFrame) {
  Ran r = render(ball("4", "1", "size=8x6 fail_at=3"));
  EXPECT_EQ(std::pair(r.code(), pix_files(false)), std::pair(1, Strings{"ball.1", "ball.2"}));
  // The output file holds the error line, while the stream still ends on
  // frame 2 complete, which is where the daemon cuts the task for its retry.
  EXPECT_TRUE(has_error_line(split_lines(r.out).back()) && r.out.find("frame 3") != r.out.npos);
  EXPECT_TRUE(!has_error_line(r.err) && split_lines(r.err).back() == "ball.2 r 8 of 6") << r.err;
  for (auto [name, sig] : {std::pair{"9", SIGKILL}, {"TERM", SIGTERM}, {"SIGINT", SIGINT}}) {
    r = render(ball("4", "1", std::string("size=8x6 die_at=3:") + name));
    EXPECT_TRUE(WIFSIGNALED(r.status) && WTERMSIG(r.status) == sig) << name << " " << r.status;
    EXPECT_EQ(pix_files(false), (Strings{"ball.1", "ball.2"})) << name;
  }
  for (auto [options, after_failure] :
       {std::pair{"size=8x6 fail_at=2 fail_once=once_at", Strings{"ball.1"}},
        {"size=8x6 fail_once=once_first", Strings{}}}) {
    r = render(ball("3", "1", options));
    EXPECT_TRUE(r.code() == 1 && has_error_line(r.out) && pix_files() == after_failure) << options;
    r = render(ball("3", "1", options));  // the retry
    EXPECT_EQ(std::pair(r.code(), pix_files(false)),
              std::pair(0, Strings{"ball.1", "ball.2", "ball.3"}))
        << options << r.err;
  }
}

}  // namespace
