// The status page server against a real control directory: its JSON API,
// the requests it must refuse, many clients at once, and the page itself in
// a headless browser while a daemon renders.
#if defined(RNDCTL_SERVE)
#include <fcntl.h>
#include <httplib.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <nlohmann/json.hpp>
#include <regex>
#include <thread>

#include "tests/support/test_support.h"
#include "tests/e2e/render_farm.h"

namespace {

// A port nobody listens on now (a race with another program is possible,
// and shows as a failed start).
int free_port() {
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof a;
  int port = 0;
  if (bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) == 0 &&
      getsockname(fd, reinterpret_cast<sockaddr*>(&a), &len) == 0)
    port = ntohs(a.sin_port);
  close(fd);
  return port;
}

// `rndctl serve` on a farm; stopped with SIGTERM, which must end it cleanly.
struct Server {
  pid_t pid = -1;
  int port = 0;
  std::string banner;
  explicit Server(Farm& farm) {
    port = free_port();
    int out[2];
    if (pipe2(out, O_CLOEXEC) != 0) return;
    pid = fork();
    if (pid == 0) {
      dup2(out[1], STDOUT_FILENO);
      std::string listen = "127.0.0.1:" + std::to_string(port);
      execl(RNDCTL_PATH, "rndctl", "-l", farm.dir().c_str(), "serve", "--listen", listen.c_str(),
            static_cast<char*>(nullptr));
      _exit(127);
    }
    close(out[1]);
    char c;
    while (read(out[0], &c, 1) == 1 && c != '\n') banner += c;
    close(out[0]);
  }
  ~Server() { (void)stop(); }
  int stop() {
    if (pid <= 0) return -1;
    kill(pid, SIGTERM);
    int st = 0;
    waitpid(pid, &st, 0);
    pid = -1;
    return WIFEXITED(st) ? WEXITSTATUS(st) : 128 + WTERMSIG(st);
  }
  httplib::Client client() const {
    httplib::Client c("127.0.0.1", port);
    c.set_read_timeout(30, 0);
    return c;
  }
  nlohmann::json json(const std::string& path) const {
    auto r = client().Get(path.c_str());
    if (!r || r->status != 200) return nullptr;
    return nlohmann::json::parse(r->body, nullptr, false);
  }
  int status(const std::string& path) const {
    auto r = client().Get(path.c_str());
    return r ? r->status : -1;
  }
};

// The status code of one request written as is.
int raw_status(int port, const std::string& request) {
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  a.sin_port = htons(static_cast<uint16_t>(port));
  std::string reply;
  if (connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) == 0) {
    // The server may answer and close before it has read everything.
    (void)send(fd, request.data(), request.size(), MSG_NOSIGNAL);
    char buf[256];
    ssize_t n = recv(fd, buf, sizeof buf, 0);
    if (n > 0) reply.assign(buf, static_cast<size_t>(n));
  }
  close(fd);
  return reply.size() > 12 ? atoi(reply.c_str() + 9) : -1;
}

// The smallest PNG header the server looks for, and a body behind it.
const std::string kPng = std::string("\x89PNG\r\n\x1a\n", 8) + "not really pixels";

class ServeTest : public ::testing::Test {
 protected:
  void SetUp() override {
    host_ = this_host_name();
    scene_ = make_project(farm_);
    ResourceSpec here, night;
    here.name = host_;
    night.name = "nightowl";
    night.index = 2;
    night.status = "SCHEDULE";
    night.locks = "\t{ 0 to 2400 Sunday to Saturday }";  // locked all week
    farm_.write("Render_Resource_Control", resource_file({here, night}));
    JobSpec pending, half, done;
    pending.name = "spin";
    half.name = "half";
    half.index = 2;
    half.status = "50.00% ";
    half.hosts = {host_};
    done.name = "done";
    done.index = 3;
    done.status = "finished";
    std::string jobs = job_file({pending, half, done}, scene_);
    // A wrangler's note that is also markup.
    size_t at = jobs.find("half 2 {\n") + 9;
    jobs.insert(at, "\t/*<script>alert(1)</script>*/\n");
    farm_.write("Render_Job_Control", jobs);
    // This host's daemon is gone: a pid file naming an ended process.
    write_pid_file(farm_.path(host_ + ".pid"), exited_pid());
  }
  Farm farm_;
  std::string host_;
  std::string scene_;
};

TEST_F(ServeTest, ApiShowsJobsHostsAndFollowsChanges) {
  Server s(farm_);
  ASSERT_NE(s.banner.find("read-only on http://127.0.0.1:"), std::string::npos) << s.banner;
  nlohmann::json jobs = s.json("/api/jobs");
  ASSERT_TRUE(jobs.is_array()) << jobs;
  ASSERT_EQ(jobs.size(), 3u);
  EXPECT_EQ(jobs[0]["state"], "pending");
  EXPECT_NEAR(jobs[1]["percent"].get<double>(), 50.0, 0.01);
  EXPECT_EQ(jobs[1]["comment"], "<script>alert(1)</script>");
  EXPECT_EQ(jobs[2]["percent"], 100.0);
  nlohmann::json hosts = s.json("/api/hosts");
  ASSERT_EQ(hosts.size(), 2u) << hosts;
  EXPECT_EQ(hosts[0]["alive"], false);
  EXPECT_EQ(hosts[0]["locked_now"], false);
  EXPECT_EQ(hosts[1]["lock"], "SCHEDULE");
  EXPECT_EQ(hosts[1]["locked_now"], true);
  EXPECT_EQ(hosts[1]["schedule"], "0-2400 Sunday-Saturday");
  nlohmann::json one = s.json("/api/jobs/2");
  ASSERT_TRUE(one.is_object());
  EXPECT_TRUE(one["tasks"].is_array());
  EXPECT_EQ(one["frames"].size(), 0u);

  // A change to the job file shows, and moves the generation the page polls.
  uint64_t gen = s.json("/api/changed")["generation"];
  ASSERT_TRUE(set_job_status(farm_, "spin", "aborted", host_));
  ASSERT_TRUE(wait_for([&] { return s.json("/api/jobs")[0]["state"] == "aborted"; }, 10));
  EXPECT_GT(s.json("/api/changed")["generation"].get<uint64_t>(), gen);
  EXPECT_EQ(s.stop(), 0);
}

// Frames come only from the job's own output directory, only as PNG.
TEST_F(ServeTest, FramesAreServedOnlyAsPngFromTheJobsDirectory) {
  std::string pix = farm_.path("project/pix/");
  write_text_file(pix + "half.0001", kPng);
  write_text_file(pix + "half.0002", "GIF89a: not a PNG");
  write_text_file(farm_.path("secret.png"), kPng);
  ASSERT_EQ(symlink(farm_.path("secret.png").c_str(), (pix + "half.0003").c_str()), 0);
  write_text_file(pix + "spin.0001", kPng);  // another job's frame
  Server s(farm_);
  nlohmann::json one = s.json("/api/jobs/2");
  EXPECT_EQ(one["frames"], nlohmann::json::array({"half.0001"}));
  auto r = s.client().Get("/api/jobs/2/frames/half.0001");
  ASSERT_TRUE(r);
  EXPECT_EQ(r->status, 200);
  EXPECT_EQ(r->get_header_value("Content-Type"), "image/png");
  EXPECT_EQ(r->body, kPng);
  EXPECT_EQ(s.client().Get("/api/jobs/2/thumb")->body, kPng);

  const std::vector<std::pair<std::string, int>> refused = {
      {"/api/jobs/2/frames/half.0002", 404},             // not a PNG
      {"/api/jobs/2/frames/half.0003", 404},             // a link out of the directory
      {"/api/jobs/2/frames/spin.0001", 404},             // another job's
      {"/api/jobs/2/frames/..%2F..%2Fsecret.png", 400},  // climbing out
      {"/api/jobs/2/frames/%2e%2e", 400},
      {"/api/jobs/99", 404},
      {"/api/jobs/99/thumb", 404},
      {"/api/jobs/3/thumb", 404},  // nothing rendered
      {"/api/nothing", 404},
      {"/" + std::string(20000, 'a'), 414},
  };
  for (const auto& [path, want] : refused) EXPECT_EQ(s.status(path), want) << path.substr(0, 60);
  EXPECT_EQ(
      raw_status(s.port, "GET /api/jobs HTTP/1.1\r\nHost: x\r\nContent-Length: 1048576\r\n\r\n" +
                             std::string(1 << 20, 'x')),
      413);
  EXPECT_EQ(s.client().Post("/api/jobs", "x", "text/plain")->status, 405);
  EXPECT_EQ(s.status("/api/jobs"), 200);
}

TEST_F(ServeTest, TwoHundredClientsAtOnceAreAllAnswered) {
  Server s(farm_);
  std::atomic<int> ok{0};
  std::vector<std::thread> clients;
  for (int i = 0; i < 200; i++)
    clients.emplace_back([&] {
      for (int k = 0; k < 3; k++) {
        auto r = s.client().Get(k == 1 ? "/api/hosts" : "/api/jobs");
        if (r && r->status == 200) ok++;
      }
    });
  for (auto& t : clients) t.join();
  EXPECT_EQ(ok.load(), 600);
  EXPECT_EQ(s.status("/"), 200);
  EXPECT_EQ(s.stop(), 0);
}

// --- the page in a browser ---------------------------------------------------

std::string chromium() {
  for (const char* p : {"/usr/bin/chromium", "/usr/bin/chromium-browser"})
    if (access(p, X_OK) == 0) return p;
  return "";
}

// Runs the browser headless on `url` with `what` (--dump-dom or
// --screenshot=PATH); the DOM it prints, after the page's script had time to
// fetch.
std::string browse(const std::string& browser, const std::string& url, const std::string& what,
                   const std::string& profile) {
  std::string cmd = browser +
                    " --headless --no-sandbox --disable-gpu --no-first-run --user-data-dir='" +
                    profile + "' --virtual-time-budget=5000 --window-size=1280,900 " + what + " '" +
                    url + "' 2>/dev/null";
  std::string out;
  FILE* p = popen(cmd.c_str(), "r");
  if (p == nullptr) return out;
  char buf[4096];
  size_t n;
  while ((n = fread(buf, 1, sizeof buf, p)) > 0) out.append(buf, n);
  pclose(p);
  return out;
}

// The progress shown in the jobs table's row of job `index`, or -1.
double shown_progress(const std::string& dom, int index) {
  std::smatch m;
  std::regex row("<tr data-job=\"" + std::to_string(index) + "\">.*?aria-valuenow=\"([0-9.]+)\"");
  return std::regex_search(dom, m, row) ? std::stod(m[1]) : -1;
}

TEST_F(ServeTest, BrowserShowsTheFarmWhileItRendersAndEscapesComments) {
  std::string browser = chromium();
  if (browser.empty()) GTEST_SKIP() << "chromium not installed (make deps installs it)";
  JobSpec spin;
  spin.name = "spin";
  spin.start = 1;
  spin.end = 12;
  spin.opts = "slow=1";
  spin.hosts = {host_};
  std::string jobs = job_file({spin}, scene_);
  jobs.insert(jobs.find("spin 1 {\n") + 9, "\t/*<script>alert(1)</script>*/\n");
  farm_.write("Render_Job_Control", jobs);
  Daemon& d = farm_.start_on_farm({}, "", render_env());
  Server s(farm_);
  std::string url = "http://127.0.0.1:" + std::to_string(s.port) + "/";
  std::string profile = farm_.path("browser");

  auto percent = [&] {
    nlohmann::json j = s.json("/api/jobs");
    return j.is_array() && !j.empty() ? j[0]["percent"].get<double>() : -1.0;
  };
  ASSERT_TRUE(wait_for([&] { return percent() > 0; }, 120, &d)) << d.log();
  std::string first = browse(browser, url, "--dump-dom", profile);
  ASSERT_NE(first.find("id=\"jobs\""), std::string::npos) << first.substr(0, 2000);
  double before = shown_progress(first, 1);
  ASSERT_GE(before, 0) << first;
  // The comment's characters, never an element.
  EXPECT_NE(first.find("&lt;script&gt;alert(1)&lt;/script&gt;"), std::string::npos);
  EXPECT_EQ(first.find("<script>alert"), std::string::npos);

  ASSERT_TRUE(wait_for([&] { return percent() > before + 5 || percent() >= 100; }, 120, &d));
  std::string second = browse(browser, url, "--dump-dom", profile);
  EXPECT_GT(shown_progress(second, 1), before);

  std::string shot = std::string(BUILD_DIR) + "/serve_page.png";
  unlink(shot.c_str());
  browse(browser, url, "--screenshot='" + shot + "'", profile);
  EXPECT_EQ(read_text_file(shot).substr(0, 8), kPng.substr(0, 8)) << "no screenshot at " << shot;
}

}  // namespace
#endif
