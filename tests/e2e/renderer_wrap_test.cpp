// The installed programs from the outside: their command lines, the real
// renderers' wrappers under the real daemon, the systemd units, and an
// install into a scratch prefix whose daemon renders the demo.
#include <arpa/inet.h>
#include <gmock/gmock.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <regex>

#include "tests/e2e/render_farm.h"

namespace {

Ran run(const std::vector<std::string>& args, const std::string& dir, const std::string& cwd = "") {
  return run_program(args, dir + "/run", cwd);
}
bool on_path(const std::string& program) {
  return system(("command -v " + program + " >/dev/null 2>&1").c_str()) == 0;
}

// Width and height from a PNG's header; (0, 0) when it is not a PNG.
std::pair<int, int> png_size(const std::string& path) {
  std::string data = read_text_file(path);
  if (data.size() < 24 || data.compare(0, 8, "\x89PNG\r\n\x1a\n") != 0 ||
      data.compare(12, 4, "IHDR") != 0)
    return {0, 0};
  uint32_t size[2];
  memcpy(size, data.data() + 16, sizeof size);
  return {static_cast<int>(ntohl(size[0])), static_cast<int>(ntohl(size[1]))};
}

// Each installed program: its help goes to stdout with exit 0, a bad option to stderr with the
// usage and exit 2.
class CommandLine : public ::testing::TestWithParam<const char*> {};

TEST_P(CommandLine, HelpExitsZeroAndABadOptionExitsTwoWithTheUsage) {
  Farm scratch;
  for (const char* help : {"-h", "--help"}) {
    Ran r = run({GetParam(), help}, scratch.dir());
    EXPECT_TRUE(r.code() == 0 && r.out.starts_with("usage:")) << help << r.out << r.err;
  }
  // The bad option first: the daemon must not start on the directory "p"
  // that getopt would read out of "--help-me".
  mkdir(scratch.path("p").c_str(), 0777);
  for (const char* bad : {"--help-me", "-x"}) {
    Ran r = run({GetParam(), bad, "-p", "pix/x", "scene"}, scratch.dir(), scratch.dir());
    EXPECT_TRUE(r.code() == 2 && r.err.find(bad) != std::string::npos &&
                r.err.find("usage:") != std::string::npos)
        << bad << ": " << r.err;
  }
  EXPECT_FALSE(access(scratch.path(this_host_name() + ".pid").c_str(), F_OK) == 0);
}

INSTANTIATE_TEST_SUITE_P(InstalledPrograms, CommandLine,
                         testing::Values(DAEMON_PATH, FRAME_PAINTER_PATH, BLENDER_RENDER_PATH,
                                         POVRAY_RENDER_PATH));

// The renderer itself, the job's executable (its wrapper), and the message in
// the job's comment for a broken scene.
struct Renderer {
  const char *program, *wrapper, *broken_message;
};

class RealRenderer : public ::testing::TestWithParam<Renderer> {
 protected:
  void SetUp() override {
    if (!on_path(GetParam().program))
      GTEST_SKIP() << GetParam().program
                   << " is not installed (RJ_WITH_RENDERERS=1 tools/install-deps.sh)";
    for (const char* dir : {"", "/sdl", "/pix"}) mkdir((project_ + dir).c_str(), 0777);
  }
  // The demo scene of the renderer, made or copied into the project.
  std::string demo_scene() {
    std::string demo = DEMO_DIR, scene = project_ + "/sdl/ball.blend";
    if (std::string(GetParam().program) != "blender") {
      for (const char* f : {"ball.pov", "ball.ini"})
        write_text_file(project_ + "/sdl/" + f, read_text_file(demo + "/povray/" + f));
      return project_ + "/sdl/ball.ini";
    }
    Ran r = run({"blender", "-b", "--factory-startup", "--python", demo + "/blender/make_scene.py",
                 "--", scene},
                farm_.dir());
    EXPECT_EQ(r.code(), 0) << r.out << r.err;
    return scene;
  }
  Daemon& start(const std::string& scene, int processors) {
    farm_.write("Render_Resource_Control",
                resource_file({{.name = host_, .max_frames = 2, .num_processors = processors}}));
    JobSpec job{.name = "ball", .hosts = {host_}, .executable = GetParam().wrapper};
    farm_.write("Render_Job_Control", job_file({job}, scene));
    return farm_.start_on_farm({}, "", render_env());
  }

  Farm farm_;
  std::string host_ = this_host_name(), project_ = farm_.path("project");
};

TEST_P(RealRenderer, RendersSixFramesInPiecesOfTwoWithProgress) {
  Daemon& d = start(demo_scene(), 1);
  // One processor: the three pieces run in turn, the job's percentage between them.
  std::string seen;
  auto state = [&] { return seen = job_status(farm_, "ball"); };
  std::regex progress("[0-9]+\\.[0-9][0-9]% ");
  ASSERT_TRUE(wait_for([&] { return std::regex_match(state(), progress); }, 120, &d))
      << seen + "\n" + d.log();
  ASSERT_TRUE(wait_for([&] { return state() == "finished" || d.ended(); }, 240, &d));
  ASSERT_EQ(seen, "finished") << d.log();
  for (int f = 1; f <= 6; ++f)
    EXPECT_EQ(png_size(project_ + "/pix/ball." + std::to_string(f)), std::pair(64, 48)) << f;
  EXPECT_FALSE(access((project_ + "/pix/ball.7").c_str(), F_OK) == 0);
  EXPECT_EQ(count_of(farm_.read("JOBLOG/ball"), "FINISHED"), 3) << farm_.read("JOBLOG/ball");
}

// Blender gets a scene that is no .blend, POV-Ray an .ini that is not there.
TEST_P(RealRenderer, ABrokenOrMissingSceneFailsWithTheRenderersMessageInTheComment) {
  bool blender = std::string(GetParam().program) == "blender";
  std::string scene = project_ + (blender ? "/sdl/broken.blend" : "/sdl/missing.ini");
  if (blender) write_text_file(scene, "sphere { <0, 0, 0> 1 }\n");
  Daemon& d = start(scene, 2);
  std::string block;
  auto says = [&](const char* what) {
    return (block = job_block(farm_, "ball")).find(what) != std::string::npos;
  };
  ASSERT_TRUE(wait_for([&] { return says("ERROR: "); }, 120, &d)) << block << d.log();
  EXPECT_TRUE(says(GetParam().broken_message)) << block;
}

INSTANTIATE_TEST_SUITE_P(
    Wrappers, RealRenderer,
    testing::Values(Renderer{"blender", "blender_render", "Error: File format is not supported"},
                    Renderer{"povray", "povray_render", "Error: Problem with option setting"}),
    [](const testing::TestParamInfo<Renderer>& info) { return std::string(info.param.program); });

TEST(Install, TheInstalledDaemonRendersTheDemo) {
  Farm scratch;
  std::string prefix = scratch.path("prefix");
  Ran install = run({"cmake", "--install", BUILD_DIR, "--prefix", prefix}, scratch.dir());
  ASSERT_EQ(install.code(), 0) << install.out << install.err;
  for (std::string file :
       {"bin/zarno_render_demon", "bin/frame_painter", "bin/blender_render", "bin/povray_render",
        "lib/systemd/system/zarno-render.service", "lib/systemd/system/zarno-render@.service"})
    EXPECT_EQ(access((prefix + "/" + file).c_str(), file.starts_with("bin/") ? X_OK : R_OK), 0)
        << file;

  // The installed demo script, run on the installed programs only.
  Ran demo = run({"env", "PATH=/usr/bin:/bin", prefix + "/share/zarno_render/demo/run.sh", prefix},
                 scratch.dir());
  ASSERT_EQ(demo.code(), 0) << demo.out << demo.err;
  EXPECT_NE(demo.out.find("ball: finished"), std::string::npos) << demo.out;
  EXPECT_NE(png_size(prefix + "/demo_farm/project/pix/ball.0024"), std::pair(0, 0)) << demo.out;
}

TEST(Install, SystemdAcceptsTheUnits) {
  if (!on_path("systemd-analyze")) GTEST_SKIP() << "systemd-analyze is not installed";
  Farm scratch;
  std::string unit_dir = scratch.path("units");
  mkdir(unit_dir.c_str(), 0777);
  for (const char* unit : {"zarno-render.service", "zarno-render@.service"})
    write_text_file(unit_dir + "/" + unit, read_text_file(std::string(BUILD_DIR) + "/" + unit));
  // A template is checked through an instance of it.
  symlink((unit_dir + "/zarno-render@.service").c_str(),
          (unit_dir + "/zarno-render@farm.service").c_str());
  for (const char* unit : {"zarno-render.service", "zarno-render@farm.service"}) {
    Ran r = run({"systemd-analyze", "verify", "--man=no", unit_dir + "/" + unit}, scratch.dir());
    EXPECT_TRUE(r.code() == 0 && r.err.find(unit) == std::string::npos) << unit << "\n"
                                                                        << r.out << r.err;
  }
}

}  // namespace
