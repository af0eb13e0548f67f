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
#include <string>
#include <vector>

#include "tools/render_wrap/render_wrap.h"

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
  RwArgs args;  // -m is accepted, no matte is made
  std::string stamp;
  double sleep = 0;
  bool have_fail_at = false;
  float fail_at = 0;
};

// Returns false after a usage error on stderr.
bool parse_render_options(Settings* st) {
  for (const RwSetting& setting : Rw_settings(st->args.options)) {
    const std::string& key = setting.key;
    const std::string& value = setting.value;
    float f = 0;
    if (key == "sleep" && Rw_to_float(value.c_str(), &f) && f >= 0 && f <= 3600) {
      st->sleep = f;
    } else if (key == "stamp" && !value.empty()) {
      st->stamp = value;
    } else if (key == "fail_at" && Rw_to_float(value.c_str(), &st->fail_at)) {
      st->have_fail_at = true;
    } else if (key != "size" && key != "slow") {  // frame_painter's settings pass
      fprintf(stderr, "stamp_render: bad render option \"%s\"\n", setting.word.c_str());
      return false;
    }
  }
  return true;
}

// Returns 0 when parsed, 1 for a usage error (reported), 2 after -h.
int parse_arguments(int argc, char** argv, Settings* st) {
  // The plainest rules of the render programs: no long options, "-t 2" is
  // a bad option, -n0 and -b 0 pass.
  RwScan scan = Rw_scan(argc, argv, Rw_first_rules(false), &st->args);
  switch (scan.result) {
    case RwScanResult::kOk:
      break;
    case RwScanResult::kHelp:
      fputs(kUsage, stdout);
      return 2;
    case RwScanResult::kUnknown:
    case RwScanResult::kNoValue:
      fprintf(stderr, "stamp_render: bad option \"%s\"\n", scan.word);
      return 1;
    case RwScanResult::kBadValue:
      fprintf(stderr, "stamp_render: bad value \"%s\" for %s\n", scan.value, scan.word);
      return 1;
    case RwScanResult::kNoScene:
    case RwScanResult::kTooMany:
    case RwScanResult::kNoPix:
      fputs("stamp_render: need -p PIX and a scene (stamp_render -h for help)\n", stderr);
      return 1;
  }
  const char* env = getenv("STAMP_FILE");
  if (env != nullptr) st->stamp = env;
  if (!parse_render_options(st)) return 1;
  if (!st->args.have_end) st->args.end = st->args.start;
  return 0;
}

// The frames of start..end by step as the queue counts them (see
// frame_painter): the end itself counts when the steps land on it within a
// thousandth of a step.
std::vector<float> frame_list(float start, float end, float by) {
  if (end <= start || by <= 0.0f) return {start};
  return Rw_frame_values(start, end, by);
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
  size_t slash = st.args.pix.rfind('/');
  std::string base = slash == std::string::npos ? st.args.pix : st.args.pix.substr(slash + 1);

  std::vector<float> frames = frame_list(st.args.start, st.args.end, st.args.by);
  for (size_t i = 0; i < frames.size(); i++) {
    float f = frames[i];
    if (st.have_fail_at && std::fabs(f - st.fail_at) <= 0.001f) {
      printf("Error: frame %g did not render (requested failure)\n", f);
      return 1;
    }
    int ext = st.args.have_first_ext ? st.args.first_ext + static_cast<int>(i) * st.args.ext_step
                                     : static_cast<int>(f);
    long long began = now_ns();
    for (int line = 0; line < kLines; line++) {
      // The daemon subtracts 2 from the line number it reads.
      fprintf(stderr, "%s.%0*d r %d of %d\n", base.c_str(), st.args.ext_size, ext, line + 1 + 2,
              kLines);
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
