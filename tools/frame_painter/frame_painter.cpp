// frame_painter: a small renderer for trying out the render queue.
//
// It takes the argument list the render daemon builds for a render program,
// paints each frame of its range into a PNG, and reports progress on its
// error output one scanline at a time in the form the daemon reads back.
// Failures can be requested through the options argument so that retries,
// crashes and error reports can be shown without a broken scene.
//
// Output streams: the daemon sends stderr to the task's stream file (only its
// last line is read, as progress) and stdout to the task's output file (which
// is searched for error lines when a task fails). Error lines go to both,
// except a failure between frames: there the last progress line must stay
// the stream's last line, because the daemon cuts a failed task at the frame
// that line reports and an error line would read as no progress at all.

#include <fcntl.h>
#include <signal.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <string>
#include <vector>

#include "tools/frame_painter/paint.h"
#include "tools/frame_painter/png_writer.h"
#include "tools/frame_painter/scene.h"
#include "tools/render_wrap/render_wrap.h"

namespace {

constexpr const char* kUsage =
    "usage: frame_painter -p PIX [-m MATTE] [-A] [-s START -e END -b BY]\n"
    "                     [-S FIRSTEXT -B EXTSTEP] [-E EXTSIZE] [-V] [-nN]\n"
    "                     [\"OPTIONS\"] SCENE\n"
    "       frame_painter -h | --help\n"
    "\n"
    "Paints the frames START, START+BY, ... up to END of SCENE into PNG files\n"
    "named PIX.<extension> (MATTE.<extension> for the ball's matte with -m).\n"
    "The extension of the i-th frame (from 0) is FIRSTEXT + i*EXTSTEP, else the\n"
    "frame number with its fraction dropped, zero-padded to EXTSIZE digits.\n"
    "Without -s the scene's own range is used when its animation is ON;\n"
    "otherwise one still image is written to PIX. -A, -V and -nN are accepted\n"
    "and have no effect.\n"
    "\n"
    "OPTIONS is one argument of blank-separated settings:\n"
    "  size=WxH        image size (the scene is scaled to it)\n"
    "  slow=SECONDS    take at least this long per frame\n"
    "  fail_at=F       stop with exit status 1 on reaching frame F\n"
    "  die_at=F:SIG    end by signal SIG (number or name) on reaching frame F\n"
    "  fail_once=PATH  the requested failure (or, without one, a failure at\n"
    "                  the first frame) happens only while PATH does not\n"
    "                  exist; the failing run creates it\n"
    "\n"
    "Progress goes to stderr as \"<image> r <lines done + 2> of <lines>\".\n";

// Frames that lie this close together count as the same frame.
constexpr float kFrameTolerance = 0.001f;

struct Settings {
  RwArgs args;  // the daemon's argument list; args.options holds the settings below

  int width = 0, height = 0;  // 0: the scene's size
  double slow = 0;
  bool have_fail_at = false, have_die_at = false;
  float fail_at = 0, die_at = 0;
  int die_signal = 0;
  std::string fail_once;
};

enum class Streams { kBoth, kOutputOnly };

void report(Streams where, const char* fmt, va_list ap) {
  char msg[1024];
  vsnprintf(msg, sizeof msg, fmt, ap);
  fprintf(stdout, "Error: %s\n", msg);
  fflush(stdout);
  if (where == Streams::kBoth) {
    fprintf(stderr, "Error: %s\n", msg);
    fflush(stderr);
  }
}

void error_line(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
void error_line(const char* fmt, ...) {
  va_list ap;
  va_start(ap, fmt);
  report(Streams::kBoth, fmt, ap);
  va_end(ap);
}

// For a failure between frames; see the note on output streams at the top.
void frame_error_line(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
void frame_error_line(const char* fmt, ...) {
  va_list ap;
  va_start(ap, fmt);
  report(Streams::kOutputOnly, fmt, ap);
  va_end(ap);
}

bool to_signal(const std::string& s, int* out) {
  int n = 0;
  if (Rw_to_int(s.c_str(), &n)) {
    if (n < 1 || n >= NSIG) return false;
    *out = n;
    return true;
  }
  std::string name = s.compare(0, 3, "SIG") == 0 ? s.substr(3) : s;
  for (int i = 1; i < NSIG; i++) {
    const char* abbrev = sigabbrev_np(i);
    if (abbrev && name == abbrev) {
      *out = i;
      return true;
    }
  }
  return false;
}

// The exit status for a command line that is not to be run, else -1.
int parse_arguments(int argc, char** argv, Settings* st) {
  // Older than the wrappers' rules: "-t 2" is an unknown option, -n0 and
  // -b 0 pass.
  RwScan scan = Rw_scan(argc, argv, Rw_first_rules(true), &st->args);
  switch (scan.result) {
    case RwScanResult::kOk:
      return -1;
    case RwScanResult::kHelp:
      fputs(kUsage, stdout);
      return 0;
    case RwScanResult::kUnknown:
      error_line("unknown option \"%s\"", scan.word);
      fputs(kUsage, stderr);
      return 2;
    case RwScanResult::kNoValue:
      error_line("option %s needs a value", scan.word);
      break;
    case RwScanResult::kBadValue:
      error_line("bad value \"%s\" for option %s", scan.value, scan.word);
      break;
    case RwScanResult::kNoScene:
      error_line("no scene file given (frame_painter -h for help)");
      break;
    case RwScanResult::kTooMany:
      error_line("too many arguments (frame_painter -h for help)");
      break;
    case RwScanResult::kNoPix:
      error_line("no image path given (-p PIX)");
      break;
  }
  return 1;
}

// Returns false (reported) on an unknown or malformed setting.
bool parse_render_options(Settings* st) {
  for (const RwSetting& setting : Rw_settings(st->args.options)) {
    const std::string& key = setting.key;
    const std::string& value = setting.value;
    const char* item = setting.word.c_str();
    bool ok = setting.has_value && !value.empty();
    if (!ok) {
      // fall through to the report below
    } else if (key == "size") {
      ok = parse_size(value, &st->width, &st->height);
    } else if (key == "slow") {
      float s = 0;
      ok = Rw_to_float(value.c_str(), &s) && s >= 0 && s <= 3600;
      st->slow = s;
    } else if (key == "fail_at") {
      ok = Rw_to_float(value.c_str(), &st->fail_at);
      st->have_fail_at = true;
    } else if (key == "die_at") {
      size_t colon = value.find(':');
      ok = colon != std::string::npos && Rw_to_float(value.substr(0, colon).c_str(), &st->die_at) &&
           to_signal(value.substr(colon + 1), &st->die_signal);
      st->have_die_at = true;
    } else if (key == "fail_once") {
      st->fail_once = value;
    } else {
      error_line("unknown render option \"%s\"", item);
      return false;
    }
    if (!ok) {
      error_line("bad render option \"%s\"", item);
      return false;
    }
  }
  return true;
}

// The frames of start..end by step, as the queue counts them: values below
// the end, plus the end itself when the steps land on it within a thousandth
// of a step. A descending or single-frame range is its start frame alone.
std::vector<float> frame_list(float start, float end, float by) {
  if (end == start || by == 0.0f || end < start) return {start};
  return Rw_frame_values(start, end, by);
}

std::string with_extension(const std::string& path, int ext, int size) {
  char buf[48];
  snprintf(buf, sizeof buf, ".%0*d", size, ext);
  return path + buf;
}

bool same_frame(float a, float b) { return std::fabs(a - b) <= kFrameTolerance; }

// A requested failure goes ahead unless fail_once names a file that already
// exists; the first failing run creates it, so the next run gets through.
bool failure_armed(const Settings& st) {
  if (st.fail_once.empty()) return true;
  int fd = open(st.fail_once.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644);
  if (fd >= 0) {
    close(fd);
    return true;
  }
  if (errno == EEXIST) return false;
  error_line("cannot create \"%s\": %s", st.fail_once.c_str(), strerror(errno));
  exit(1);
}

[[noreturn]] void die_by_signal(float frame, int sig) {
  printf("frame %g: ending by signal %d as asked\n", frame, sig);
  fflush(stdout);
  fflush(stderr);
  struct sigaction sa {};
  sa.sa_handler = SIG_DFL;
  sigemptyset(&sa.sa_mask);
  sigaction(sig, &sa, nullptr);
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, sig);
  sigprocmask(SIG_UNBLOCK, &set, nullptr);
  kill(getpid(), sig);
  // Signals whose default is to be ignored (or to stop) come back here.
  error_line("frame %g: signal %d did not end the renderer", frame, sig);
  exit(1);
}

void sleep_seconds(double seconds) {
  if (seconds <= 0) return;
  struct timespec ts;
  ts.tv_sec = static_cast<time_t>(seconds);
  ts.tv_nsec = static_cast<long>((seconds - static_cast<double>(ts.tv_sec)) * 1e9);
  while (nanosleep(&ts, &ts) != 0 && errno == EINTR) {
  }
}

// What the command line and the scene together ask for.
struct Plan {
  int width = 0, height = 0;
  bool animated = false;  // images get extensions; else one still to PIX
  std::vector<float> frames;
  std::vector<int> extensions;
  int ext_size = 1;
  // Field rendering: the second field of each frame is half a frame step
  // later than the first, so fast motion combs the way video does.
  bool interlaced = false;
  float step = 1;
  int first_field_parity = 0;  // row 0 is the first (odd) line
};

Plan make_plan(const Settings& st, const Scene& scene) {
  const RwArgs& a = st.args;
  Plan plan;
  plan.width = st.width ? st.width : scene.width;
  plan.height = st.height ? st.height : scene.height;
  // The command line's range wins; without one the scene's own animation
  // settings decide, so the program is also usable by hand.
  plan.animated = a.animate || scene.animation;
  plan.ext_size = a.have_ext_size ? a.ext_size : scene.extensionsize;
  if (a.animate) {
    plan.frames = frame_list(a.start, a.have_end ? a.end : a.start, a.have_by ? a.by : 1.0f);
    for (size_t i = 0; i < plan.frames.size(); i++)
      plan.extensions.push_back(a.have_first_ext ? a.first_ext + static_cast<int>(i) * a.ext_step
                                                 : static_cast<int>(plan.frames[i]));
  } else if (scene.animation) {
    plan.frames = frame_list(scene.startframe, scene.endframe, scene.byframe);
    for (size_t i = 0; i < plan.frames.size(); i++)
      plan.extensions.push_back(scene.has_start_extension
                                    ? scene.start_extension +
                                          static_cast<int>(i) * scene.by_extension
                                    : static_cast<int>(plan.frames[i]));
  } else {
    plan.frames = {scene.startframe};
  }
  if (plan.ext_size < 0 || plan.ext_size > 32) plan.ext_size = 1;
  plan.interlaced = scene.fields && (scene.odd || scene.even);
  plan.step = a.have_by ? a.by : scene.byframe;
  plan.first_field_parity = scene.odd ? 0 : 1;
  return plan;
}

struct Canvas {
  std::vector<uint8_t> rgb;
  std::vector<uint8_t> matte;  // empty without -m
};

// Paints frame i of the plan and writes its image (and matte); false after
// an error line.
bool paint_frame(const Settings& st, const Scene& scene, const Plan& plan, size_t i,
                 Canvas* canvas) {
  float f = plan.frames[i];
  int width = plan.width, height = plan.height;
  std::string image =
      plan.animated ? with_extension(st.args.pix, plan.extensions[i], plan.ext_size) : st.args.pix;
  size_t slash = image.rfind('/');
  std::string image_name = slash == std::string::npos ? image : image.substr(slash + 1);
  char stamp[32];
  snprintf(stamp, sizeof stamp, "%g", f);

  for (int y = 0; y < height; y++) {
    float t = f;
    if (plan.interlaced && (y % 2) != plan.first_field_parity) t += plan.step / 2;
    size_t row = static_cast<size_t>(y) * width;
    paint_row(scene, width, height, y, t, stamp, &canvas->rgb[row * 3],
              canvas->matte.empty() ? nullptr : &canvas->matte[row]);
    // The reader takes the number, adds the line count when it is 0 or
    // less, then subtracts 2; reporting lines done + 2 makes that exact.
    fprintf(stderr, "%s r %d of %d\n", image_name.c_str(), y + 1 + 2, height);
    fflush(stderr);
    sleep_seconds(st.slow / height);
  }

  int werr = png_write_file(image, png_encode(canvas->rgb, static_cast<uint32_t>(width),
                                              static_cast<uint32_t>(height), PngColour::kRgb));
  if (werr != 0) {
    error_line("cannot write image \"%s\": %s", image.c_str(), strerror(werr));
    return false;
  }
  printf("wrote %s\n", image.c_str());
  if (!st.args.matte.empty()) {
    std::string mpath = plan.animated
                            ? with_extension(st.args.matte, plan.extensions[i], plan.ext_size)
                            : st.args.matte;
    werr = png_write_file(mpath, png_encode(canvas->matte, static_cast<uint32_t>(width),
                                            static_cast<uint32_t>(height), PngColour::kGrey));
    if (werr != 0) {
      error_line("cannot write matte \"%s\": %s", mpath.c_str(), strerror(werr));
      return false;
    }
    printf("wrote %s\n", mpath.c_str());
  }
  fflush(stdout);
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  Settings st;
  int rc = parse_arguments(argc, argv, &st);
  if (rc >= 0) return rc;
  if (!parse_render_options(&st)) return 1;

  Scene scene;
  std::string err;
  if (!scene_load(st.args.scene, &scene, &err)) {
    error_line("%s", err.c_str());
    return 1;
  }
  Plan plan = make_plan(st, scene);
  printf("frame_painter: scene \"%s\", %zu frame%s, %dx%d\n", st.args.scene.c_str(),
         plan.frames.size(), plan.frames.size() == 1 ? "" : "s", plan.width, plan.height);
  fflush(stdout);

  bool fail_first = !st.fail_once.empty() && !st.have_fail_at && !st.have_die_at;
  Canvas canvas;
  canvas.rgb.resize(static_cast<size_t>(plan.width) * plan.height * 3);
  if (!st.args.matte.empty()) canvas.matte.resize(static_cast<size_t>(plan.width) * plan.height);

  for (size_t i = 0; i < plan.frames.size(); i++) {
    float f = plan.frames[i];
    if (st.have_die_at && same_frame(f, st.die_at) && failure_armed(st))
      die_by_signal(f, st.die_signal);
    if (((st.have_fail_at && same_frame(f, st.fail_at)) || (fail_first && i == 0)) &&
        failure_armed(st)) {
      frame_error_line("frame %g did not render (requested failure)", f);
      return 1;
    }
    if (!paint_frame(st, scene, plan, i, &canvas)) return 1;
  }
  return 0;
}
