#include "tools/rndctl/serve.h"

#include <dirent.h>
#include <httplib.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>

#include <atomic>
#include <condition_variable>
#include <cstdio>
#include <cstring>
#include <nlohmann/json.hpp>
#include <thread>

#include "tools/rndctl/page.h"
#include "tools/rndctl/state.h"

namespace {

// How often the watcher looks at the stamps: well inside the second the
// page promises, and a few stat calls each time.
constexpr int kLookMs = 250;
constexpr size_t kBodyLimit = 4096;
constexpr size_t kLogTail = 16 << 10;
constexpr size_t kOutputTail = 4 << 10;

const char* kJson = "application/json";

// The newest file of `dir` whose name starts with `prefix`.
std::string newest_with(const std::string& dir, const std::string& prefix) {
  std::string best;
  struct timespec latest {};
  DIR* d = opendir(dir.c_str());
  if (d == nullptr) return best;
  while (struct dirent* e = readdir(d)) {
    if (strncmp(e->d_name, prefix.c_str(), prefix.size()) != 0) continue;
    struct stat st;
    if (fstatat(dirfd(d), e->d_name, &st, AT_SYMLINK_NOFOLLOW) != 0 || !S_ISREG(st.st_mode))
      continue;
    if (best.empty() || st.st_mtim.tv_sec > latest.tv_sec ||
        (st.st_mtim.tv_sec == latest.tv_sec && st.st_mtim.tv_nsec > latest.tv_nsec)) {
      latest = st.st_mtim;
      best = e->d_name;
    }
  }
  closedir(d);
  return best;
}

// The library listens with a backlog of 5: a burst of page loads (ten
// screens reconnecting after a restart) would see stalled connects.  On
// Linux a second listen() on the listening socket only widens the backlog;
// the library hands out no descriptor, so it is found by its port.
void widen_backlog(int port) {
  DIR* d = opendir("/proc/self/fd");
  if (d == nullptr) return;
  while (struct dirent* e = readdir(d)) {
    int fd = atoi(e->d_name);
    if (fd <= 2 || fd == dirfd(d)) continue;
    sockaddr_storage a{};
    socklen_t len = sizeof a;
    int listening = 0;
    socklen_t ll = sizeof listening;
    if (getsockname(fd, reinterpret_cast<sockaddr*>(&a), &len) != 0 ||
        getsockopt(fd, SOL_SOCKET, SO_ACCEPTCONN, &listening, &ll) != 0 || listening == 0)
      continue;
    int p = a.ss_family == AF_INET    ? ntohs(reinterpret_cast<sockaddr_in*>(&a)->sin_port)
            : a.ss_family == AF_INET6 ? ntohs(reinterpret_cast<sockaddr_in6*>(&a)->sin6_port)
                                      : -1;
    if (p == port) (void)listen(fd, SOMAXCONN);
  }
  closedir(d);
}

// Bytes of a file that need not be UTF-8 made safe for a JSON text.
std::string valid_utf8(const std::string& text) {
  return nlohmann::json(text).dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

void not_found(httplib::Response& res) {
  res.status = 404;
  res.set_content("{\"error\":\"not found\"}", kJson);
}

bool job_of(const httplib::Request& req, const ServeSnapshot& snap, int* index) {
  // `end` points into this text, so it must outlive the check of *end: a
  // temporary from str() would be gone by then (only a sanitizer notices).
  const std::string text = req.matches[1].str();
  char* end = nullptr;
  long n = strtol(text.c_str(), &end, 10);
  if (*end != '\0' || n < 0 || n > 1000000000) return false;
  *index = static_cast<int>(n);
  return snap.jobs->files.count(*index) != 0;
}

void job_detail(const ServeSnapshot& snap, int index, httplib::Response& res) {
  const ServeJobFiles& files = snap.jobs->files.at(index);
  std::string out = snap.jobs->detail.at(index);
  // The detail object is closed by its last '}': the file parts go before it.
  out.pop_back();
  out += ",\"log\":" + valid_utf8(State_tail(files.log_path, kLogTail));
  nlohmann::json outputs = nlohmann::json::array();
  for (const auto& r : files.running) {
    std::string name = newest_with(files.out_dir, r.out_prefix);
    std::string tail = name.empty() ? "" : State_tail(files.out_dir + "/" + name, kOutputTail);
    outputs.push_back({{"task", r.task}, {"tail", tail}});
  }
  out += ",\"outputs\":" + outputs.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
  std::string newest;
  // The rendered images under a name of their own: "frames" is the job's
  // frame range, and a second key of one name is lost by most readers.
  nlohmann::json images = State_frames(files, &newest);
  out += ",\"images\":" + images.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
  out += ",\"generation\":" + std::to_string(snap.generation) + "}";
  res.set_content(out, kJson);
}

void serve_frame(const ServeSnapshot& snap, int index, const std::string& name,
                 httplib::Response& res) {
  std::string png;
  if (!State_frame_bytes(snap.jobs->files.at(index), name, &png)) return not_found(res);
  res.set_header("Cache-Control", "no-cache");
  res.set_content(png, "image/png");
}

void routes(httplib::Server& svr, const ServeState& state) {
  svr.set_pre_routing_handler([](const httplib::Request& req, httplib::Response& res) {
    // The library reads no body of a GET: the size is judged from the header.
    if (req.has_header("Content-Length") &&
        strtoull(req.get_header_value("Content-Length").c_str(), nullptr, 10) > kBodyLimit) {
      res.status = 413;
      res.set_content("{\"error\":\"request too large\"}", kJson);
      return httplib::Server::HandlerResponse::Handled;
    }
    if (req.method != "GET" && req.method != "HEAD") {
      res.status = 405;
      res.set_content("{\"error\":\"read-only\"}", kJson);
      return httplib::Server::HandlerResponse::Handled;
    }
    // The path arrives decoded: "%2e%2e" is caught here too.
    if (req.path.find("..") != std::string::npos) {
      res.status = 400;
      res.set_content("{\"error\":\"no .. in paths\"}", kJson);
      return httplib::Server::HandlerResponse::Handled;
    }
    return httplib::Server::HandlerResponse::Unhandled;
  });
  svr.Get("/", [](const httplib::Request&, httplib::Response& res) {
    res.set_content(Page_html(), "text/html; charset=utf-8");
  });
  svr.Get("/api/jobs", [&state](const httplib::Request&, httplib::Response& res) {
    res.set_content(State_current(state)->jobs->json, kJson);
  });
  svr.Get("/api/hosts", [&state](const httplib::Request&, httplib::Response& res) {
    res.set_content(State_current(state)->hosts, kJson);
  });
  svr.Get("/api/changed", [&state](const httplib::Request&, httplib::Response& res) {
    auto snap = State_current(state);
    nlohmann::json j = {{"generation", snap->generation}, {"problem", snap->problem}};
    res.set_content(j.dump(), kJson);
  });
  svr.Get(R"(/api/jobs/([0-9]+))", [&state](const httplib::Request& req, httplib::Response& res) {
    auto snap = State_current(state);
    int index = 0;
    if (!job_of(req, *snap, &index)) return not_found(res);
    job_detail(*snap, index, res);
  });
  svr.Get(R"(/api/jobs/([0-9]+)/thumb)",
          [&state](const httplib::Request& req, httplib::Response& res) {
            auto snap = State_current(state);
            int index = 0;
            if (!job_of(req, *snap, &index)) return not_found(res);
            std::string newest;
            (void)State_frames(snap->jobs->files.at(index), &newest);
            if (newest.empty()) return not_found(res);
            serve_frame(*snap, index, newest, res);
          });
  svr.Get(R"(/api/jobs/([0-9]+)/frames/([^/]+))",
          [&state](const httplib::Request& req, httplib::Response& res) {
            auto snap = State_current(state);
            int index = 0;
            if (!job_of(req, *snap, &index)) return not_found(res);
            serve_frame(*snap, index, req.matches[2].str(), res);
          });
  svr.set_error_handler([](const httplib::Request&, httplib::Response& res) {
    if (res.body.empty())
      res.set_content("{\"error\":\"" + std::to_string(res.status) + "\"}", kJson);
  });
}

}  // namespace

bool Serve_parse_listen(const std::string& text, std::string* addr, int* port, std::string* why) {
  size_t colon = text.rfind(':');
  std::string a = colon == std::string::npos ? "127.0.0.1" : text.substr(0, colon);
  std::string p = colon == std::string::npos ? text : text.substr(colon + 1);
  if (a.empty()) a = "127.0.0.1";
  // "[::1]:8470": the brackets are the URL's, not the address's.
  if (a.size() > 2 && a.front() == '[' && a.back() == ']') a = a.substr(1, a.size() - 2);
  char* end = nullptr;
  long n = strtol(p.c_str(), &end, 10);
  if (p.empty() || *end != '\0' || n < 0 || n > 65535) {
    *why = "bad listen address \"" + text + "\" (want ADDR:PORT)";
    return false;
  }
  *addr = a;
  *port = static_cast<int>(n);
  return true;
}

int Cmd_serve(const std::string& listen) {
  std::string addr, why;
  int port = 0;
  if (!Serve_parse_listen(listen, &addr, &port, &why)) {
    fprintf(stderr, "rndctl: %s\n", why.c_str());
    return 2;
  }
  // The stop signals are taken by sigwait below alone: blocked before any
  // thread starts, so that every thread inherits the mask.
  sigset_t stop;
  sigemptyset(&stop);
  sigaddset(&stop, SIGINT);
  sigaddset(&stop, SIGTERM);
  sigaddset(&stop, SIGHUP);
  sigset_t old;
  pthread_sigmask(SIG_BLOCK, &stop, &old);
  // A client that goes away mid-answer must not end the server.
  signal(SIGPIPE, SIG_IGN);

  ServeState state;
  (void)State_refresh(&state);
  auto first = State_current(state);
  if (!first->problem.empty()) fprintf(stderr, "rndctl: %s (will retry)\n", first->problem.c_str());

  httplib::Server svr;
  svr.set_payload_max_length(kBodyLimit);
  svr.set_keep_alive_max_count(1000);
  svr.set_read_timeout(5, 0);
  routes(svr, state);
  if (!svr.bind_to_port(addr.c_str(), port)) {
    fprintf(stderr, "rndctl: cannot listen on %s:%d: %s\n", addr.c_str(), port, strerror(errno));
    pthread_sigmask(SIG_SETMASK, &old, nullptr);
    return 1;
  }
  widen_backlog(port);
  printf("rndctl: serving %s read-only on http://%s:%d/\n", rndctl.location.or_else("."),
         addr.find(':') != std::string::npos ? ("[" + addr + "]").c_str() : addr.c_str(), port);
  fflush(stdout);

  std::atomic<bool> done{false};
  std::mutex mu;
  std::condition_variable cv;
  std::thread server([&] { svr.listen_after_bind(); });
  std::thread watcher([&] {
    std::unique_lock<std::mutex> hold(mu);
    while (!done) {
      hold.unlock();
      (void)State_refresh(&state);
      hold.lock();
      cv.wait_for(hold, std::chrono::milliseconds(kLookMs), [&] { return done.load(); });
    }
  });
  int sig = 0;
  sigwait(&stop, &sig);
  {
    std::lock_guard<std::mutex> hold(mu);
    done = true;
  }
  cv.notify_all();
  svr.stop();
  server.join();
  watcher.join();
  pthread_sigmask(SIG_SETMASK, &old, nullptr);
  return 0;
}
