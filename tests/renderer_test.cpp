// The demo renderer, run as the daemon runs it: a real process in a project
// directory, its images checked byte by byte by an independent PNG reader.

#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "tests/support/test_support.h"

namespace {

const char kScene[] =
    "# test scene\n"
    "animation = ON;\n"
    "startframe = 1;\n"
    "endframe = 10;\n"
    "byframe = 1;\n"
    "size = 32x24;\n"
    "ball_radius = 4;\n"
    "ball_path = 4 16 28 16;\n"
    "bounce = 8;\n"
    "box = 0 20 32 4 40 110 50;\n";

struct Outcome {
  int status = -1;  // as waitpid reports it
  std::string out, err;
};

// Bitwise on purpose: a second, table-free implementation to check against.
uint32_t crc32_bitwise(const uint8_t* p, size_t n) {
  uint32_t c = 0xFFFFFFFFu;
  for (size_t i = 0; i < n; i++) {
    c ^= p[i];
    for (int k = 0; k < 8; k++) c = (c >> 1) ^ (0xEDB88320u & (0u - (c & 1)));
  }
  return ~c;
}

uint32_t be32(const uint8_t* p) {
  return (uint32_t{p[0]} << 24) | (uint32_t{p[1]} << 16) | (uint32_t{p[2]} << 8) | p[3];
}

struct Png {
  uint32_t width = 0, height = 0;
  int colour = -1;
  std::vector<uint8_t> rows;  // filter bytes included
};

// Reads a PNG made of stored deflate blocks; "" on success, else what is wrong.
std::string read_png(const std::string& path, Png* png) {
  std::string bytes = read_text_file(path);
  const auto* d = reinterpret_cast<const uint8_t*>(bytes.data());
  size_t n = bytes.size();
  static const uint8_t kSig[8] = {0x89, 'P', 'N', 'G', '\r', '\n', 0x1A, '\n'};
  if (n < 8 || memcmp(d, kSig, 8) != 0) return "bad signature";
  std::vector<uint8_t> z;
  std::vector<std::string> order;
  for (size_t p = 8; p < n;) {
    if (p + 12 > n) return "truncated chunk";
    uint32_t len = be32(d + p);
    if (p + 12 + len > n) return "chunk runs past the end";
    std::string type(reinterpret_cast<const char*>(d + p + 4), 4);
    if (crc32_bitwise(d + p + 4, len + 4) != be32(d + p + 8 + len)) return "bad CRC in " + type;
    if (type == "IHDR") {
      if (len != 13) return "IHDR length";
      png->width = be32(d + p + 8);
      png->height = be32(d + p + 12);
      if (d[p + 16] != 8) return "bit depth";
      png->colour = d[p + 17];
    }
    if (type == "IDAT") z.insert(z.end(), d + p + 8, d + p + 8 + len);
    order.push_back(type);
    p += 12 + len;
  }
  if (order.empty() || order.front() != "IHDR" || order.back() != "IEND") return "chunk order";
  if (z.size() < 6 || z[0] != 0x78 || ((z[0] << 8) | z[1]) % 31 != 0) return "zlib header";
  size_t p = 2;
  for (bool last = false; !last;) {
    if (p + 5 > z.size()) return "truncated deflate block";
    last = z[p] & 1;
    if ((z[p] >> 1) != 0) return "not a stored block";
    uint16_t len = static_cast<uint16_t>(z[p + 1] | (z[p + 2] << 8));
    uint16_t nlen = static_cast<uint16_t>(z[p + 3] | (z[p + 4] << 8));
    if (static_cast<uint16_t>(~len) != nlen) return "NLEN";
    if (p + 5 + len > z.size()) return "stored block runs past the end";
    png->rows.insert(png->rows.end(), z.begin() + p + 5, z.begin() + p + 5 + len);
    p += 5 + len;
  }
  if (p + 4 != z.size()) return "trailing bytes after the deflate data";
  uint32_t a = 1, b = 0;
  for (uint8_t c : png->rows) a = (a + c) % 65521, b = (b + a) % 65521;
  if (((b << 16) | a) != be32(&z[p])) return "Adler-32";
  size_t channels = png->colour == 2 ? 3 : 1;
  if (png->rows.size() != (png->width * channels + 1) * png->height) return "data size";
  return "";
}

std::vector<std::string> split_lines(const std::string& text) {
  std::vector<std::string> lines;
  std::istringstream in(text);
  for (std::string l; std::getline(in, l);) lines.push_back(l);
  return lines;
}

bool has_error_line(const std::string& text) {
  for (const std::string& l : split_lines(text))
    if (l.find("Error") != std::string::npos) return true;
  return false;
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

  // Runs the renderer in `cwd` (the project directory by default) with the
  // arguments given, its streams caught in files outside the project.
  Outcome render(const std::vector<std::string>& args, std::string cwd = "") {
    if (cwd.empty()) cwd = project_;
    std::string out_path = project_ + ".out", err_path = project_ + ".err";
    std::vector<std::string> all = {FRAME_PAINTER_PATH};
    all.insert(all.end(), args.begin(), args.end());
    std::vector<char*> argv;
    for (std::string& a : all) argv.push_back(a.data());
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

  std::vector<std::string> pix_files() const {
    std::vector<std::string> names;
    DIR* dir = opendir((project_ + "/pix").c_str());
    if (!dir) return names;
    while (dirent* e = readdir(dir))
      if (e->d_name[0] != '.') names.push_back(e->d_name);
    closedir(dir);
    std::sort(names.begin(), names.end());
    return names;
  }

  std::string pix(const std::string& name) const { return project_ + "/pix/" + name; }

  std::string project_;
};

bool exited_with(const Outcome& r, int code) {
  return WIFEXITED(r.status) && WEXITSTATUS(r.status) == code;
}

// ---------------------------------------------------------------------------
struct NamingCase {
  std::vector<std::string> args;
  std::vector<std::string> images;
};

class RendererNaming : public RendererTest, public ::testing::WithParamInterface<NamingCase> {};

TEST_P(RendererNaming, WritesOneValidDistinctPngPerFrameUnderItsExtension) {
  const NamingCase& c = GetParam();
  std::vector<std::string> args = {"-p", "pix/ball"};
  args.insert(args.end(), c.args.begin(), c.args.end());
  args.push_back("sdl/scene.sdl");
  Outcome r = render(args);
  ASSERT_TRUE(exited_with(r, 0)) << r.err;
  EXPECT_FALSE(has_error_line(r.out + r.err));
  // Exactly the frames, nothing else: no temporaries left beside them.
  ASSERT_EQ(pix_files(), c.images);

  std::vector<std::vector<uint8_t>> seen;
  for (const std::string& name : c.images) {
    Png png;
    ASSERT_EQ(read_png(pix(name), &png), "") << name;
    EXPECT_EQ(png.width, 32u);
    EXPECT_EQ(png.height, 24u);
    EXPECT_EQ(png.colour, 2);
    for (const auto& earlier : seen) EXPECT_NE(earlier, png.rows) << name << " repeats a frame";
    seen.push_back(png.rows);
  }
}

INSTANTIATE_TEST_SUITE_P(
    Ranges, RendererNaming,
    testing::Values(
        // The daemon's own shape for a shading program, with flags to ignore.
        NamingCase{
            {"-V", "-n4", "-A", "-s", "1.000000", "-e", "3.000000", "-b", "1.000000", "-E", "4"},
            {"ball.0001", "ball.0002", "ball.0003"}},
        NamingCase{{"-s", "1", "-e", "3", "-b", "1", "-S", "10", "-B", "5", "-E", "3"},
                   {"ball.010", "ball.015", "ball.020"}},
        // Fractional steps need -S: the frame number alone would repeat.
        NamingCase{{"-s", "1", "-e", "2", "-b", "0.5", "-S", "1", "-B", "1", "-E", "1"},
                   {"ball.1", "ball.2", "ball.3"}},
        NamingCase{{"-s", "1", "-e", "10", "-b", "3", "-E", "2"},
                   {"ball.01", "ball.04", "ball.07", "ball.10"}},
        NamingCase{{"-s", "1", "-e", "10", "-b", "4", "-E", "2"},
                   {"ball.01", "ball.05", "ball.09"}},
        NamingCase{{"-s", "10", "-e", "1", "-b", "1", "-E", "1"}, {"ball.10"}},
        // No range: the scene's own.
        NamingCase{{"-E", "2", " "},
                   {"ball.01", "ball.02", "ball.03", "ball.04", "ball.05", "ball.06", "ball.07",
                    "ball.08", "ball.09", "ball.10"}}));

// The daemon counts a task's frames with its own arithmetic and judges
// progress by it; the renderer must paint exactly that many.
class RendererFrameCount : public RendererTest,
                           public ::testing::WithParamInterface<std::vector<float>> {};

TEST_P(RendererFrameCount, AgreesWithTheQueue) {
  const std::vector<float>& r = GetParam();
  auto text = [](float v) {
    char buf[32];
    snprintf(buf, sizeof buf, "%f", v);
    return std::string(buf);
  };
  Outcome out = render({"-p", "pix/ball", "-s", text(r[0]), "-e", text(r[1]), "-b", text(r[2]),
                        "-S", "1", "-B", "1", "-E", "3", "size=2x2", "sdl/scene.sdl"});
  ASSERT_TRUE(exited_with(out, 0)) << out.err;
  EXPECT_EQ(static_cast<int>(pix_files().size()), Calc_frame_range(r[0], r[1], r[2]));
}

INSTANTIATE_TEST_SUITE_P(Ranges, RendererFrameCount,
                         testing::Values(std::vector<float>{1, 10, 0.1f},
                                         std::vector<float>{0, 1, 0.3f},
                                         std::vector<float>{1.5f, 4.5f, 0.75f},
                                         std::vector<float>{1, 100, 7}));

TEST_F(RendererTest, StillSceneWritesThePixPathItself) {
  ASSERT_TRUE(write_text_file(project_ + "/sdl/still.sdl", "animation = OFF;\nsize = 8x6;\n"));
  Outcome r = render({"-p", "pix/still", "sdl/still.sdl"});
  ASSERT_TRUE(exited_with(r, 0)) << r.err;
  ASSERT_EQ(pix_files(), std::vector<std::string>{"still"});
  Png png;
  EXPECT_EQ(read_png(pix("still"), &png), "");
}

// ---------------------------------------------------------------------------
TEST_F(RendererTest, ProgressLinesGiveTheDaemonTheLinesDone) {
  Outcome r = render(
      {"-p", "pix/ball", "-s", "1", "-e", "3", "-b", "1", "-E", "2", "size=8x5", "sdl/scene.sdl"});
  ASSERT_TRUE(exited_with(r, 0)) << r.err;
  Png png;
  ASSERT_EQ(read_png(pix("ball.02"), &png), "");
  EXPECT_EQ(png.width, 8u);
  EXPECT_EQ(png.height, 5u);

  std::vector<std::string> lines = split_lines(r.err);
  ASSERT_EQ(lines.size(), 15u) << r.err;
  for (size_t i = 0; i < lines.size(); i++) {
    char name[256];
    char letter = 0;
    int line = 0, of = 0;
    ASSERT_EQ(sscanf(lines[i].c_str(), "%255s %c %d of %d", name, &letter, &line, &of), 4)
        << lines[i];
    EXPECT_EQ(letter, 'r');
    EXPECT_EQ(of, 5);
    // The image name carries the frame extension after its last '.'.
    char expect_name[32];
    snprintf(expect_name, sizeof expect_name, "ball.%02zu", i / 5 + 1);
    EXPECT_STREQ(name, expect_name);
    // What the daemon does with the number.
    if (line <= 0) line += of;
    line -= 2;
    EXPECT_EQ(line, static_cast<int>(i % 5) + 1) << lines[i];
  }
}

// ---------------------------------------------------------------------------
TEST_F(RendererTest, FailAtStopsBeforeTheFrameLeavingTheLastProgressLineLast) {
  Outcome r = render({"-p", "pix/ball", "-s", "1", "-e", "4", "-b", "1", "-E", "1",
                      "size=8x6 fail_at=3", "sdl/scene.sdl"});
  EXPECT_TRUE(exited_with(r, 1));
  EXPECT_EQ(pix_files(), (std::vector<std::string>{"ball.1", "ball.2"}));
  // The output file is searched for the error line ...
  std::string last_out = split_lines(r.out).back();
  EXPECT_NE(last_out.find("Error"), std::string::npos) << last_out;
  EXPECT_NE(last_out.find("frame 3"), std::string::npos) << last_out;
  // ... while the stream still ends on frame 2 complete, which is where the
  // daemon cuts the task for its retry.
  EXPECT_FALSE(has_error_line(r.err));
  EXPECT_EQ(split_lines(r.err).back(), "ball.2 r 8 of 6");
}

TEST_F(RendererTest, DieAtEndsTheProcessByTheSignalAtThatFrame) {
  struct {
    const char* signal_name;
    int sig;
  } cases[] = {{"9", SIGKILL}, {"TERM", SIGTERM}, {"SIGINT", SIGINT}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.signal_name);
    Outcome r = render({"-p", "pix/ball", "-s", "1", "-e", "4", "-b", "1", "-E", "1",
                        std::string("size=8x6 die_at=3:") + c.signal_name, "sdl/scene.sdl"});
    ASSERT_TRUE(WIFSIGNALED(r.status)) << r.err;
    EXPECT_EQ(WTERMSIG(r.status), c.sig);
    EXPECT_EQ(pix_files(), (std::vector<std::string>{"ball.1", "ball.2"}));
    remove(pix("ball.1").c_str());
    remove(pix("ball.2").c_str());
  }
}

TEST_F(RendererTest, FailOnceFailsTheFirstRunAndLetsTheRetryThrough) {
  struct {
    const char* options;
    std::vector<std::string> after_failure;
  } cases[] = {{"size=8x6 fail_at=2 fail_once=once_at", {"ball.1"}},
               {"size=8x6 fail_once=once_first", {}}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.options);
    std::vector<std::string> args = {"-p", "pix/ball", "-s", "1", "-e",      "3",
                                     "-b", "1",        "-E", "1", c.options, "sdl/scene.sdl"};
    Outcome first = render(args);
    EXPECT_TRUE(exited_with(first, 1));
    EXPECT_TRUE(has_error_line(first.out));
    EXPECT_EQ(pix_files(), c.after_failure);
    Outcome retry = render(args);
    EXPECT_TRUE(exited_with(retry, 0)) << retry.err;
    EXPECT_EQ(pix_files(), (std::vector<std::string>{"ball.1", "ball.2", "ball.3"}));
    for (const std::string& f : pix_files()) remove(pix(f).c_str());
  }
}

// ---------------------------------------------------------------------------
class RendererRefuses : public RendererTest,
                        public ::testing::WithParamInterface<std::vector<std::string>> {};

TEST_P(RendererRefuses, WithAnErrorLineAndStatusOne) {
  ASSERT_TRUE(write_text_file(project_ + "/sdl/bad.sdl", "size = 8x6;\nball_radius = fat;\n"));
  Outcome r = render(GetParam());
  EXPECT_TRUE(exited_with(r, 1));
  EXPECT_TRUE(has_error_line(r.err)) << r.err;
  EXPECT_EQ(pix_files(), std::vector<std::string>{});
}

INSTANTIATE_TEST_SUITE_P(
    BadInvocations, RendererRefuses,
    testing::Values(std::vector<std::string>{"-p", "pix/ball", "-x", "sdl/scene.sdl"},
                    std::vector<std::string>{"-p", "pix/ball", "-s", "one", "sdl/scene.sdl"},
                    std::vector<std::string>{"-p", "pix/ball", "-s", "1", "-e"},
                    std::vector<std::string>{"-p", "pix/ball", "sdl/missing.sdl"},
                    std::vector<std::string>{"-p", "pix/ball", "sdl/bad.sdl"},
                    std::vector<std::string>{"sdl/scene.sdl"},
                    std::vector<std::string>{"-p", "nodir/ball", "sdl/scene.sdl"},
                    std::vector<std::string>{"-p", "pix/ball", "bogus=1", "sdl/scene.sdl"},
                    std::vector<std::string>{"-p", "pix/ball", "size=0x5", "sdl/scene.sdl"},
                    std::vector<std::string>{"-p", "pix/ball", "die_at=3", "sdl/scene.sdl"},
                    std::vector<std::string>{"-p", "pix/ball", "a=1", "b=2", "sdl/scene.sdl"}));

// ---------------------------------------------------------------------------
TEST_F(RendererTest, MatteCoversTheBallOnly) {
  Outcome r = render({"-p", "pix/ball", "-m", "pix/matte", "-s", "1", "-e", "2", "-b", "1", "-E",
                      "1", "sdl/scene.sdl"});
  ASSERT_TRUE(exited_with(r, 0)) << r.err;
  Png m1, m2;
  ASSERT_EQ(read_png(pix("matte.1"), &m1), "");
  ASSERT_EQ(read_png(pix("matte.2"), &m2), "");
  EXPECT_EQ(m1.colour, 0);
  std::set<uint8_t> values(m1.rows.begin(), m1.rows.end());
  EXPECT_TRUE(values.count(0) && values.count(255));
  EXPECT_NE(m1.rows, m2.rows);
}

TEST_F(RendererTest, FieldsRenderTheSecondFieldHalfAFrameLater) {
  // Same frame, progressive and interlaced: the odd (first) lines agree,
  // the even lines show the ball moved on.
  ASSERT_TRUE(write_text_file(project_ + "/sdl/fields.sdl",
                              std::string(kScene) + "fields = TRUE;\nodd = TRUE;\n"));
  std::vector<std::string> range = {"-s", "4", "-e", "4", "-b", "1", "-E", "1"};
  std::vector<std::string> progressive = {"-p", "pix/prog"}, interlaced = {"-p", "pix/inter"};
  progressive.insert(progressive.end(), range.begin(), range.end());
  interlaced.insert(interlaced.end(), range.begin(), range.end());
  progressive.push_back("sdl/scene.sdl");
  interlaced.push_back("sdl/fields.sdl");
  ASSERT_TRUE(exited_with(render(progressive), 0));
  ASSERT_TRUE(exited_with(render(interlaced), 0));
  Png prog, inter;
  ASSERT_EQ(read_png(pix("prog.4"), &prog), "");
  ASSERT_EQ(read_png(pix("inter.4"), &inter), "");
  size_t row = prog.width * 3 + 1;
  bool even_differ = false;
  for (size_t y = 0; y < prog.height; y++) {
    bool same = std::equal(prog.rows.begin() + y * row, prog.rows.begin() + (y + 1) * row,
                           inter.rows.begin() + y * row);
    if (y % 2 == 0) {
      EXPECT_TRUE(same) << "row " << y;
    }
    if (y % 2 == 1 && !same) even_differ = true;
  }
  EXPECT_TRUE(even_differ);
}

TEST_F(RendererTest, ShippedDemoSceneRendersFromItsProjectDirectory) {
  Outcome r = render({"-p", project_ + "/pix/demo", "-s", "1", "-e", "2", "-b", "1", "-E", "4",
                      "size=16x12", "sdl/bouncing_ball.sdl"},
                     std::string(DEMO_DIR) + "/project");
  ASSERT_TRUE(exited_with(r, 0)) << r.err;
  EXPECT_EQ(pix_files(), (std::vector<std::string>{"demo.0001", "demo.0002"}));
}

}  // namespace

// The queue reads the same scene by searching lines for its keys: a comment
// or a drawing key that happens to hold one of them would change the job.
TEST(DemoScene, QueueReadsTheAnimationTheRendererDraws) {
  Job job;
  job.sdl.set(DEMO_DIR "/project/sdl/bouncing_ball.sdl");
  EXPECT_EQ(Job_set_frame_range(&job), 24);
  EXPECT_EQ(job.animate, 1);
  EXPECT_EQ(job.frames[0], 1.0f);
  EXPECT_EQ(job.frames[1], 24.0f);
  EXPECT_EQ(job.frames[2], 1.0f);
  EXPECT_EQ(job.ext_size, 4);
  job.fields = 3;
  EXPECT_EQ(Job_check_sdlfields(&job), 0);
}
