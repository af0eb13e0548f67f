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
#include <sstream>
#include <string>
#include <vector>

#include "tools/frame_painter/paint.h"
#include "tools/frame_painter/png_writer.h"
#include "tools/frame_painter/scene.h"

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
  std::string pix, matte, scene, render_options;
  bool have_start = false, have_end = false, have_by = false;
  float start = 0, end = 0, by = 1;
  bool have_first_ext = false;
  int first_ext = 0, ext_step = 1;
  bool have_ext_size = false;
  int ext_size = 1;

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

bool to_float(const char* s, float* out) {
  char* end = nullptr;
  errno = 0;
  float v = strtof(s, &end);
  if (end == s || *end != '\0' || errno == ERANGE || !std::isfinite(v)) return false;
  *out = v;
  return true;
}

bool to_int(const char* s, int* out) {
  char* end = nullptr;
  errno = 0;
  long v = strtol(s, &end, 10);
  if (end == s || *end != '\0' || errno == ERANGE || v < -1000000000L || v > 1000000000L)
    return false;
  *out = static_cast<int>(v);
  return true;
}

bool to_signal(const std::string& s, int* out) {
  int n = 0;
  if (to_int(s.c_str(), &n)) {
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

// Returns 0 when parsed, 1 for a bad argument (reported), 2 after -h, 3 for
// an unknown option (reported, with the usage on stderr).
int parse_arguments(int argc, char** argv, Settings* st) {
  std::vector<const char*> positional;
  bool options_done = false;
  for (int i = 1; i < argc; i++) {
    const char* a = argv[i];
    if (options_done || a[0] != '-' || a[1] == '\0') {
      positional.push_back(a);
      continue;
    }
    std::string opt = a;
    if (opt == "--") {
      options_done = true;
      continue;
    }
    if (opt == "-h" || opt == "--help") {
      fputs(kUsage, stdout);
      return 2;
    }
    if (opt == "-A" || opt == "-V") continue;
    // The daemon passes the host's processor count as one word "-n4".
    if (opt.compare(0, 2, "-n") == 0 && opt.size() > 2 &&
        opt.find_first_not_of("0123456789", 2) == std::string::npos)
      continue;

    static const std::string kWithValue = "pmsebSBE";
    if (opt.size() != 2 || kWithValue.find(opt[1]) == std::string::npos) {
      error_line("unknown option \"%s\"", a);
      fputs(kUsage, stderr);
      return 3;
    }
    if (i + 1 >= argc) {
      error_line("option %s needs a value", a);
      return 1;
    }
    const char* v = argv[++i];
    bool ok = true;
    switch (opt[1]) {
      case 'p':
        st->pix = v;
        break;
      case 'm':
        st->matte = v;
        break;
      case 's':
        ok = to_float(v, &st->start), st->have_start = true;
        break;
      case 'e':
        ok = to_float(v, &st->end), st->have_end = true;
        break;
      case 'b':
        ok = to_float(v, &st->by), st->have_by = true;
        break;
      case 'S':
        ok = to_int(v, &st->first_ext), st->have_first_ext = true;
        break;
      case 'B':
        ok = to_int(v, &st->ext_step);
        break;
      case 'E':
        ok = to_int(v, &st->ext_size) && st->ext_size >= 0 && st->ext_size <= 32;
        st->have_ext_size = true;
        break;
    }
    if (!ok) {
      error_line("bad value \"%s\" for option %s", v, a);
      return 1;
    }
  }

  if (positional.empty() || positional.size() > 2) {
    error_line(positional.empty() ? "no scene file given (frame_painter -h for help)"
                                  : "too many arguments (frame_painter -h for help)");
    return 1;
  }
  st->scene = positional.back();
  if (positional.size() == 2) st->render_options = positional.front();
  if (st->pix.empty()) {
    error_line("no image path given (-p PIX)");
    return 1;
  }
  return 0;
}

// Returns false (reported) on an unknown or malformed setting.
bool parse_render_options(Settings* st) {
  std::istringstream in(st->render_options);
  std::string item;
  while (in >> item) {
    size_t eq = item.find('=');
    std::string key = item.substr(0, eq);
    std::string value = eq == std::string::npos ? "" : item.substr(eq + 1);
    bool ok = eq != std::string::npos && !value.empty();
    if (!ok) {
      // fall through to the report below
    } else if (key == "size") {
      ok = parse_size(value, &st->width, &st->height);
    } else if (key == "slow") {
      float s = 0;
      ok = to_float(value.c_str(), &s) && s >= 0 && s <= 3600;
      st->slow = s;
    } else if (key == "fail_at") {
      ok = to_float(value.c_str(), &st->fail_at);
      st->have_fail_at = true;
    } else if (key == "die_at") {
      size_t colon = value.find(':');
      ok = colon != std::string::npos && to_float(value.substr(0, colon).c_str(), &st->die_at) &&
           to_signal(value.substr(colon + 1), &st->die_signal);
      st->have_die_at = true;
    } else if (key == "fail_once") {
      st->fail_once = value;
    } else {
      error_line("unknown render option \"%s\"", item.c_str());
      return false;
    }
    if (!ok) {
      error_line("bad render option \"%s\"", item.c_str());
      return false;
    }
  }
  return true;
}

// The frames of start..end by step, as the queue counts them: values below
// the end, plus the end itself when the steps land on it within a thousandth
// of a step. A descending or single-frame range is its start frame alone.
std::vector<float> frame_list(float start, float end, float by) {
  std::vector<float> frames;
  if (end == start || by == 0.0f || end < start) return {start};
  float f = start;
  while (f < end) {
    frames.push_back(f);
    float next = f + by;
    if (next == f) break;
    f = next;
  }
  if (f >= end && std::fabs(static_cast<double>(f) - end) <= 0.001 * by) frames.push_back(end);
  if (frames.empty()) frames.push_back(start);
  return frames;
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

}  // namespace

int main(int argc, char** argv) {
  Settings st;
  int rc = parse_arguments(argc, argv, &st);
  if (rc == 2) return 0;
  if (rc == 3) return 2;
  if (rc != 0 || !parse_render_options(&st)) return 1;

  Scene scene;
  std::string err;
  if (!scene_load(st.scene, &scene, &err)) {
    error_line("%s", err.c_str());
    return 1;
  }
  int width = st.width ? st.width : scene.width;
  int height = st.height ? st.height : scene.height;

  // The command line's range wins; without one the scene's own animation
  // settings decide, so the program is also usable by hand.
  bool animated = st.have_start || scene.animation;
  std::vector<float> frames;
  std::vector<int> extensions;
  int ext_size = st.have_ext_size ? st.ext_size : scene.extensionsize;
  if (st.have_start) {
    frames = frame_list(st.start, st.have_end ? st.end : st.start, st.have_by ? st.by : 1.0f);
    for (size_t i = 0; i < frames.size(); i++)
      extensions.push_back(st.have_first_ext ? st.first_ext + static_cast<int>(i) * st.ext_step
                                             : static_cast<int>(frames[i]));
  } else if (scene.animation) {
    frames = frame_list(scene.startframe, scene.endframe, scene.byframe);
    for (size_t i = 0; i < frames.size(); i++)
      extensions.push_back(scene.has_start_extension
                               ? scene.start_extension + static_cast<int>(i) * scene.by_extension
                               : static_cast<int>(frames[i]));
  } else {
    frames = {scene.startframe};
  }
  if (ext_size < 0 || ext_size > 32) ext_size = 1;

  // Field rendering: the second field of each frame is half a frame step
  // later than the first, so fast motion combs the way video does.
  bool interlaced = scene.fields && (scene.odd || scene.even);
  float step = st.have_by ? st.by : scene.byframe;
  int first_field_parity = scene.odd ? 0 : 1;  // row 0 is the first (odd) line

  printf("frame_painter: scene \"%s\", %zu frame%s, %dx%d\n", st.scene.c_str(), frames.size(),
         frames.size() == 1 ? "" : "s", width, height);
  fflush(stdout);

  bool fail_first = !st.fail_once.empty() && !st.have_fail_at && !st.have_die_at;
  std::vector<uint8_t> rgb(static_cast<size_t>(width) * height * 3);
  std::vector<uint8_t> matte(st.matte.empty() ? 0 : static_cast<size_t>(width) * height);

  for (size_t i = 0; i < frames.size(); i++) {
    float f = frames[i];
    if (st.have_die_at && same_frame(f, st.die_at) && failure_armed(st))
      die_by_signal(f, st.die_signal);
    if (((st.have_fail_at && same_frame(f, st.fail_at)) || (fail_first && i == 0)) &&
        failure_armed(st)) {
      frame_error_line("frame %g did not render (requested failure)", f);
      return 1;
    }

    std::string image = animated ? with_extension(st.pix, extensions[i], ext_size) : st.pix;
    size_t slash = image.rfind('/');
    std::string image_name = slash == std::string::npos ? image : image.substr(slash + 1);
    char stamp[32];
    snprintf(stamp, sizeof stamp, "%g", f);

    for (int y = 0; y < height; y++) {
      float t = f;
      if (interlaced && (y % 2) != first_field_parity) t += step / 2;
      size_t row = static_cast<size_t>(y) * width;
      paint_row(scene, width, height, y, t, stamp, &rgb[row * 3],
                matte.empty() ? nullptr : &matte[row]);
      // The reader takes the number, adds the line count when it is 0 or
      // less, then subtracts 2; reporting lines done + 2 makes that exact.
      fprintf(stderr, "%s r %d of %d\n", image_name.c_str(), y + 1 + 2, height);
      fflush(stderr);
      sleep_seconds(st.slow / height);
    }

    int werr = png_write_file(image, png_encode(rgb, static_cast<uint32_t>(width),
                                                static_cast<uint32_t>(height), PngColour::kRgb));
    if (werr != 0) {
      error_line("cannot write image \"%s\": %s", image.c_str(), strerror(werr));
      return 1;
    }
    printf("wrote %s\n", image.c_str());
    if (!st.matte.empty()) {
      std::string mpath = animated ? with_extension(st.matte, extensions[i], ext_size) : st.matte;
      werr = png_write_file(mpath, png_encode(matte, static_cast<uint32_t>(width),
                                              static_cast<uint32_t>(height), PngColour::kGrey));
      if (werr != 0) {
        error_line("cannot write matte \"%s\": %s", mpath.c_str(), strerror(werr));
        return 1;
      }
      printf("wrote %s\n", mpath.c_str());
    }
    fflush(stdout);
  }
  return 0;
}
