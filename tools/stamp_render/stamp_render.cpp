// stamp_render: a render program that proves where and when frames ran.
//
// It takes the argument list the render daemon builds for a render program
// and, for each frame of its range, reports progress on its error output the
// way a real renderer does, sleeps the frame time, and then appends one line
//   HOST FRAME START_NS END_NS PID
// to the stamp file (CLOCK_REALTIME nanoseconds).  The stamp file is named by
// the environment variable STAMP_FILE, which the daemon hands on to its
// children, or by the option stamp=PATH.  Each line goes out in one write to
// a file opened with O_APPEND, so lines of concurrent renders never mix.
//
// A frame that is killed before it ends leaves no stamp: a stamp means the
// frame was rendered completely.  The program starts no children of its own,
// so killing it (or its process group) ends the render.

#include <fcntl.h>
#include <signal.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <sstream>
#include <string>
#include <vector>

namespace {

constexpr const char* kUsage =
    "usage: stamp_render -p PIX [-m MATTE] [-A] [-s START -e END -b BY]\n"
    "                    [-S FIRSTEXT -B EXTSTEP] [-E EXTSIZE] [-V] [-nN]\n"
    "                    [\"OPTIONS\"] SCENE\n"
    "\n"
    "For each frame START, START+BY, ... up to END: reports progress on stderr\n"
    "as \"<PIX base>.<extension> r <lines done + 2> of <lines>\", sleeps the frame\n"
    "time and appends \"HOST FRAME START_NS END_NS PID\" to the stamp file.\n"
    "The scene is not read.\n"
    "\n"
    "OPTIONS is one argument of blank-separated settings:\n"
    "  sleep=SECONDS   the frame time (default 0)\n"
    "  stamp=PATH      the stamp file (default: $STAMP_FILE; none: no stamps)\n"
    "  fail_at=F       stop with exit status 1 on reaching frame F\n";

// Progress lines per frame: enough for the daemon to see a frame move.
constexpr int kLines = 4;

struct Settings {
  std::string pix, stamp;
  float start = 1, end = 1, by = 1;
  bool have_start = false, have_end = false;
  bool have_first_ext = false;
  int first_ext = 0, ext_step = 1, ext_size = 1;
  double sleep = 0;
  bool have_fail_at = false;
  float fail_at = 0;
};

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

// Returns 0 when parsed, 1 for a usage error (reported), 2 after -h.
int parse_arguments(int argc, char** argv, Settings* st) {
  std::vector<const char*> positional;
  for (int i = 1; i < argc; i++) {
    std::string opt = argv[i];
    if (opt.size() < 2 || opt[0] != '-') {
      positional.push_back(argv[i]);
      continue;
    }
    if (opt == "-h") {
      fputs(kUsage, stdout);
      return 2;
    }
    if (opt == "-A" || opt == "-V") continue;
    if (opt.compare(0, 2, "-n") == 0 && opt.size() > 2 &&
        opt.find_first_not_of("0123456789", 2) == std::string::npos)
      continue;
    if (opt.size() != 2 || std::string("pmsebSBE").find(opt[1]) == std::string::npos ||
        i + 1 >= argc) {
      fprintf(stderr, "stamp_render: bad option \"%s\"\n", opt.c_str());
      return 1;
    }
    const char* v = argv[++i];
    bool ok = true;
    switch (opt[1]) {
      case 'p':
        st->pix = v;
        break;
      case 's':
        ok = to_float(v, &st->start), st->have_start = true;
        break;
      case 'e':
        ok = to_float(v, &st->end), st->have_end = true;
        break;
      case 'b':
        ok = to_float(v, &st->by);
        break;
      case 'S':
        ok = to_int(v, &st->first_ext), st->have_first_ext = true;
        break;
      case 'B':
        ok = to_int(v, &st->ext_step);
        break;
      case 'E':
        ok = to_int(v, &st->ext_size) && st->ext_size >= 0 && st->ext_size <= 32;
        break;
      default:  // -m: accepted, no matte is made
        break;
    }
    if (!ok) {
      fprintf(stderr, "stamp_render: bad value \"%s\" for %s\n", v, opt.c_str());
      return 1;
    }
  }
  if (positional.empty() || positional.size() > 2 || st->pix.empty()) {
    fputs("stamp_render: need -p PIX and a scene (stamp_render -h for help)\n", stderr);
    return 1;
  }
  const char* env = getenv("STAMP_FILE");
  if (env != nullptr) st->stamp = env;
  if (positional.size() == 2) {
    std::istringstream in(positional.front());
    std::string item;
    while (in >> item) {
      size_t eq = item.find('=');
      std::string key = item.substr(0, eq);
      std::string value = eq == std::string::npos ? "" : item.substr(eq + 1);
      float f = 0;
      if (key == "sleep" && to_float(value.c_str(), &f) && f >= 0 && f <= 3600) {
        st->sleep = f;
      } else if (key == "stamp" && !value.empty()) {
        st->stamp = value;
      } else if (key == "fail_at" && to_float(value.c_str(), &st->fail_at)) {
        st->have_fail_at = true;
      } else if (key != "size" && key != "slow") {  // frame_painter's settings pass
        fprintf(stderr, "stamp_render: bad render option \"%s\"\n", item.c_str());
        return 1;
      }
    }
  }
  if (!st->have_end) st->end = st->start;
  return 0;
}

// The frames of start..end by step as the queue counts them (see
// frame_painter): the end itself counts when the steps land on it within a
// thousandth of a step.
std::vector<float> frame_list(float start, float end, float by) {
  if (end <= start || by <= 0.0f) return {start};
  std::vector<float> frames;
  float f = start;
  while (f < end) {
    frames.push_back(f);
    float next = f + by;
    if (next == f) break;
    f = next;
  }
  if (f >= end && std::fabs(static_cast<double>(f) - end) <= 0.001 * by) frames.push_back(end);
  return frames;
}

long long now_ns() {
  struct timespec ts;
  clock_gettime(CLOCK_REALTIME, &ts);
  return static_cast<long long>(ts.tv_sec) * 1000000000LL + ts.tv_nsec;
}

void sleep_seconds(double seconds) {
  if (seconds <= 0) return;
  struct timespec ts;
  ts.tv_sec = static_cast<time_t>(seconds);
  ts.tv_nsec = static_cast<long>((seconds - static_cast<double>(ts.tv_sec)) * 1e9);
  while (nanosleep(&ts, &ts) != 0 && errno == EINTR) {
  }
}

// One write of one whole line: O_APPEND keeps concurrent writers' lines whole.
bool append_stamp(const std::string& path, const char* line, size_t len) {
  int fd = open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
  if (fd < 0) return false;
  ssize_t n;
  do {
    n = write(fd, line, len);
  } while (n < 0 && errno == EINTR);
  bool ok = n == static_cast<ssize_t>(len);
  return close(fd) == 0 && ok;
}

}  // namespace

int main(int argc, char** argv) {
  // Whatever the parent left blocked or ignored, a kill must end the render.
  sigset_t none;
  sigemptyset(&none);
  sigprocmask(SIG_SETMASK, &none, nullptr);
  for (int sig : {SIGTERM, SIGINT, SIGHUP, SIGALRM}) signal(sig, SIG_DFL);

  Settings st;
  int rc = parse_arguments(argc, argv, &st);
  if (rc == 2) return 0;
  if (rc != 0) return 1;

  char host[64];
  if (gethostname(host, sizeof host) != 0) snprintf(host, sizeof host, "unknown");
  host[sizeof host - 1] = '\0';
  size_t slash = st.pix.rfind('/');
  std::string base = slash == std::string::npos ? st.pix : st.pix.substr(slash + 1);

  std::vector<float> frames = frame_list(st.start, st.end, st.by);
  for (size_t i = 0; i < frames.size(); i++) {
    float f = frames[i];
    if (st.have_fail_at && std::fabs(f - st.fail_at) <= 0.001f) {
      printf("Error: frame %g did not render (requested failure)\n", f);
      return 1;
    }
    int ext =
        st.have_first_ext ? st.first_ext + static_cast<int>(i) * st.ext_step : static_cast<int>(f);
    long long began = now_ns();
    for (int line = 0; line < kLines; line++) {
      // The daemon subtracts 2 from the line number it reads.
      fprintf(stderr, "%s.%0*d r %d of %d\n", base.c_str(), st.ext_size, ext, line + 1 + 2, kLines);
      fflush(stderr);
      sleep_seconds(st.sleep / kLines);
    }
    long long ended = now_ns();
    if (!st.stamp.empty()) {
      char stamp[256];
      int len = snprintf(stamp, sizeof stamp, "%s %g %lld %lld %d\n", host, f, began, ended,
                         static_cast<int>(getpid()));
      if (len < 0 || static_cast<size_t>(len) >= sizeof stamp ||
          !append_stamp(st.stamp, stamp, static_cast<size_t>(len))) {
        printf("Error: cannot append to \"%s\": %s\n", st.stamp.c_str(), strerror(errno));
        return 1;
      }
    }
    printf("rendered frame %g\n", f);
    fflush(stdout);
  }
  return 0;
}
