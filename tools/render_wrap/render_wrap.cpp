#include "tools/render_wrap/render_wrap.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <sstream>

namespace {

const char* base_name(const char* path) {
  const char* slash = strrchr(path, '/');
  return slash != nullptr ? slash + 1 : path;
}

struct FdCloser {
  void operator()(int* fd) const {
    if (*fd >= 0) close(*fd);
    delete fd;
  }
};
using ScopedFd = std::unique_ptr<int, FdCloser>;
ScopedFd scoped_fd(int fd) { return ScopedFd(new int(fd)); }

void vline(FILE* to, const char* prefix, const char* format, va_list ap) {
  char msg[2048];
  vsnprintf(msg, sizeof msg, format, ap);
  fprintf(to, "%s%s\n", prefix, msg);
  fflush(to);
}

}  // namespace

namespace {

bool is_option(const char* word, bool options_done, const RwScanRules& rules) {
  if (options_done || word[0] != '-' || word[1] == '\0') return false;
  // The options argument may begin with a dash ("-t 2").
  return !rules.blank_is_word || strchr(word, ' ') == nullptr;
}

// The daemon passes the host's processor count as one word "-n4".
bool processors_word(const char* word, const RwScanRules& rules, int* processors) {
  if (strncmp(word, "-n", 2) != 0 || word[2] == '\0') return false;
  if (rules.processors_positive) return Rw_to_int(word + 2, processors) && *processors > 0;
  return strspn(word + 2, "0123456789") == strlen(word + 2);
}

// Stores the value of option -`letter`; false when it does not do.
bool take_value(char letter, const char* v, const RwScanRules& rules, RwArgs* out) {
  switch (letter) {
    case 'p':
      out->pix = v;
      return true;
    case 'm':
      out->matte = v;
      return true;
    case 's':
      out->animate = true;
      return Rw_to_float(v, &out->start);
    case 'e':
      out->have_end = true;
      return Rw_to_float(v, &out->end);
    case 'b':
      out->have_by = true;
      return Rw_to_float(v, &out->by) && (!rules.by_positive || out->by > 0);
    case 'S':
      out->have_first_ext = true;
      return Rw_to_int(v, &out->first_ext);
    case 'B':
      return Rw_to_int(v, &out->ext_step);
    case 'E':
      out->have_ext_size = true;
      return Rw_to_int(v, &out->ext_size) && out->ext_size >= 0 && out->ext_size <= 32;
  }
  return false;
}

RwScan fault(RwScanResult result, const char* word = nullptr, const char* value = nullptr) {
  return RwScan{result, word, value};
}

}  // namespace

bool Rw_to_float(const char* s, float* out) {
  char* end = nullptr;
  errno = 0;
  float v = strtof(s, &end);
  if (end == s || *end != '\0' || errno == ERANGE || !std::isfinite(v)) return false;
  *out = v;
  return true;
}

bool Rw_to_int(const char* s, int* out) {
  char* end = nullptr;
  errno = 0;
  long v = strtol(s, &end, 10);
  if (end == s || *end != '\0' || errno == ERANGE || v < -1000000000L || v > 1000000000L)
    return false;
  *out = static_cast<int>(v);
  return true;
}

RwScan Rw_scan(int argc, char** argv, const RwScanRules& rules, RwArgs* out) {
  std::vector<const char*> positional;
  bool options_done = false;
  for (int i = 1; i < argc; i++) {
    const char* a = argv[i];
    if (!is_option(a, options_done, rules)) {
      positional.push_back(a);
      continue;
    }
    if (rules.long_options && strcmp(a, "--") == 0) {
      options_done = true;
      continue;
    }
    if (strcmp(a, "-h") == 0 || (rules.long_options && strcmp(a, "--help") == 0))
      return fault(RwScanResult::kHelp);
    if (strcmp(a, "-A") == 0 || strcmp(a, "-V") == 0) continue;
    if (processors_word(a, rules, &out->processors)) continue;
    if (strlen(a) != 2 || strchr("pmsebSBE", a[1]) == nullptr)
      return fault(RwScanResult::kUnknown, a);
    if (i + 1 >= argc) return fault(RwScanResult::kNoValue, a);
    const char* v = argv[++i];
    if (!take_value(a[1], v, rules, out)) return fault(RwScanResult::kBadValue, a, v);
  }
  if (positional.empty()) return fault(RwScanResult::kNoScene);
  if (positional.size() > 2) return fault(RwScanResult::kTooMany);
  out->scene = positional.back();
  if (positional.size() == 2) out->options = positional.front();
  if (out->pix.empty()) return fault(RwScanResult::kNoPix);
  return RwScan{};
}

RwParse Rw_parse(int argc, char** argv, const char* usage, RwArgs* out) {
  const char* name = base_name(argv[0]);
  RwScan scan = Rw_scan(argc, argv, RwScanRules{}, out);
  switch (scan.result) {
    case RwScanResult::kOk:
      break;
    case RwScanResult::kHelp:
      fputs(usage, stdout);
      return RwParse::kHelp;
    case RwScanResult::kUnknown:
      fprintf(stderr, "%s: unknown option \"%s\"\n%s", name, scan.word, usage);
      Rw_error("%s: unknown option \"%s\"", name, scan.word);
      return RwParse::kUsage;
    case RwScanResult::kNoValue:
      Rw_error("%s: option %s needs a value", name, scan.word);
      return RwParse::kBad;
    case RwScanResult::kBadValue:
      Rw_error("%s: bad value \"%s\" for option %s", name, scan.value, scan.word);
      return RwParse::kBad;
    case RwScanResult::kNoScene:
      Rw_error("%s: no scene file given (%s -h for help)", name, name);
      return RwParse::kBad;
    case RwScanResult::kTooMany:
      Rw_error("%s: too many arguments (%s -h for help)", name, name);
      return RwParse::kBad;
    case RwScanResult::kNoPix:
      Rw_error("%s: no image path given (-p PIX)", name);
      return RwParse::kBad;
  }
  if (out->animate && out->end < out->start) out->end = out->start;
  return RwParse::kOk;
}

int Rw_parse_exit(RwParse result) {
  switch (result) {
    case RwParse::kOk:
    case RwParse::kHelp:
      return 0;
    case RwParse::kUsage:
      return 2;
    case RwParse::kBad:
      break;
  }
  return 1;
}

int Rw_start(int argc, char** argv, const char* usage, RwArgs* args, std::vector<RwFrame>* frames) {
  RwParse parsed = Rw_parse(argc, argv, usage, args);
  if (parsed != RwParse::kOk) return Rw_parse_exit(parsed);
  *frames = Rw_frames(*args);
  return -1;
}

std::vector<float> Rw_frame_values(float start, float end, float by) {
  std::vector<float> values;
  float f = start;
  while (f < end) {
    values.push_back(f);
    float next = f + by;
    if (next == f) break;
    f = next;
  }
  // The queue counts the end when the steps land on it within a thousandth
  // of a step; float steps rarely land on it exactly.
  if (f >= end && std::fabs(static_cast<double>(f) - end) <= 0.001 * by) values.push_back(end);
  if (values.empty()) values.push_back(start);
  return values;
}

std::vector<RwFrame> Rw_frames(const RwArgs& args) {
  if (!args.animate) return {RwFrame{args.start, 0, args.pix}};
  std::vector<float> values = Rw_frame_values(args.start, args.end, args.by);

  std::vector<RwFrame> frames;
  for (size_t i = 0; i < values.size(); i++) {
    RwFrame fr;
    fr.frame = values[i];
    fr.extension = args.have_first_ext ? args.first_ext + static_cast<int>(i) * args.ext_step
                                       : static_cast<int>(values[i]);
    char ext[48];
    snprintf(ext, sizeof ext, ".%0*d", args.ext_size, fr.extension);
    fr.image = args.pix + ext;
    frames.push_back(fr);
  }
  return frames;
}

std::vector<std::string> Rw_words(const std::string& text) {
  std::vector<std::string> words;
  std::istringstream in(text);
  std::string w;
  while (in >> w) words.push_back(w);
  return words;
}

std::vector<RwSetting> Rw_settings(const std::string& text) {
  std::vector<RwSetting> settings;
  for (std::string& w : Rw_words(text)) {
    RwSetting s;
    size_t eq = w.find('=');
    s.has_value = eq != std::string::npos;
    s.key = w.substr(0, eq);
    if (s.has_value) s.value = w.substr(eq + 1);
    s.word = std::move(w);
    settings.push_back(std::move(s));
  }
  return settings;
}

void Rw_progress(const std::string& image, int done, int total) {
  fprintf(stderr, "%s r %d of %d\n", base_name(image.c_str()), done + 2, total);
  fflush(stderr);
}

void Rw_error(const char* format, ...) {
  va_list ap;
  va_start(ap, format);
  vline(stdout, "Error: ", format, ap);
  va_end(ap);
}

void Rw_note(const char* format, ...) {
  va_list ap;
  va_start(ap, format);
  vline(stdout, "", format, ap);
  va_end(ap);
}

namespace {

// In the child: the pipe as stdout and stderr, signals as a fresh program
// expects them, then the renderer.
[[noreturn]] void exec_child(int out, char** args) {
  // Only async-signal-safe calls from here to the exec.
  dup2(out, 1);
  dup2(out, 2);
  struct sigaction dfl {};
  dfl.sa_handler = SIG_DFL;
  for (int sig = 1; sig < NSIG; sig++) sigaction(sig, &dfl, nullptr);
  sigset_t none;
  sigemptyset(&none);
  sigprocmask(SIG_SETMASK, &none, nullptr);
  execvp(args[0], args);
  // The marker line lets the parent tell "could not start" from a
  // renderer that failed on its own.
  const char* why = strerror(errno);
  const char* parts[] = {"\nrender_wrap: cannot run ", args[0], ": ", why, "\n"};
  for (const char* p : parts) {
    ssize_t ignored = write(2, p, strlen(p));
    (void)ignored;
  }
  _exit(127);
}

}  // namespace

int Rw_run(const std::vector<std::string>& argv,
           const std::function<void(const std::string&)>& line) {
  int fds[2];
  if (pipe2(fds, O_CLOEXEC) != 0) {
    Rw_error("pipe: %s", strerror(errno));
    return -1;
  }
  ScopedFd read_end = scoped_fd(fds[0]);
  ScopedFd write_end = scoped_fd(fds[1]);
  std::vector<char*> args;
  for (const auto& a : argv) args.push_back(const_cast<char*>(a.c_str()));
  args.push_back(nullptr);

  fflush(stdout);
  fflush(stderr);
  pid_t pid = fork();
  if (pid < 0) {
    Rw_error("fork: %s", strerror(errno));
    return -1;
  }
  if (pid == 0) exec_child(*write_end, args.data());
  write_end.reset();

  bool exec_failed = false;
  std::string pending;
  auto flush_line = [&] {
    if (pending.compare(0, 25, "render_wrap: cannot run ") == 0) {
      exec_failed = true;
      Rw_error("%s", pending.c_str() + 13);
    } else if (!pending.empty()) {
      line(pending);
    }
    pending.clear();
  };
  char buf[4096];
  for (;;) {
    ssize_t n = read(*read_end, buf, sizeof buf);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    for (ssize_t i = 0; i < n; i++) {
      if (buf[i] == '\n' || buf[i] == '\r') {
        flush_line();
      } else {
        pending.push_back(buf[i]);
      }
    }
  }
  flush_line();

  int status = 0;
  while (waitpid(pid, &status, 0) < 0) {
    if (errno != EINTR) {
      Rw_error("waitpid: %s", strerror(errno));
      return -1;
    }
  }
  if (exec_failed) return -1;
  if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
  return WEXITSTATUS(status);
}

bool Rw_move(const std::string& from, const std::string& to, std::string* why) {
  if (rename(from.c_str(), to.c_str()) == 0) return true;
  if (errno != EXDEV) {
    *why = strerror(errno);
    return false;
  }
  ScopedFd in = scoped_fd(open(from.c_str(), O_RDONLY | O_CLOEXEC));
  ScopedFd out = scoped_fd(open(to.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666));
  if (*in < 0 || *out < 0) {
    *why = strerror(errno);
    return false;
  }
  char buf[65536];
  for (;;) {
    ssize_t n = read(*in, buf, sizeof buf);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      *why = strerror(errno);
      return false;
    }
    if (n == 0) break;
    for (ssize_t done = 0; done < n;) {
      ssize_t w = write(*out, buf + done, static_cast<size_t>(n - done));
      if (w < 0 && errno == EINTR) continue;
      if (w < 0) {
        *why = strerror(errno);
        return false;
      }
      done += w;
    }
  }
  int fd = *out;
  *out = -1;
  if (close(fd) != 0) {
    *why = strerror(errno);
    return false;
  }
  unlink(from.c_str());
  return true;
}

std::string Rw_program(const char* env, const char* fallback) {
  const char* value = getenv(env);
  return value != nullptr && *value != '\0' ? value : fallback;
}
