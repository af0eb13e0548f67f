// The status page server against a real control directory: its JSON API, the requests it must
// refuse, many clients at once, and the page itself in a headless browser while a daemon renders.
#if defined(RNDCTL_SERVE)
#include <httplib.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <nlohmann/json.hpp>
#include <regex>
#include <thread>

#include "tests/e2e/render_farm.h"
#include "tests/support/test_support.h"

namespace {

using nlohmann::json;

// `rndctl serve` on a farm, which owns the process; SIGTERM must end it cleanly.
struct Server {
  int port = free_port();
  Daemon& d;
  explicit Server(Farm& farm)
      : d(farm.run({RNDCTL_PATH, "-l", farm.dir(), "serve", "--listen",
                    "127.0.0.1:" + std::to_string(port)},
                   "", {})) {
    wait_for([&] { return banner().find("read-only on") != std::string::npos || d.ended(); }, 30);
  }
  bool stopped = false;
  // A server that ended by itself has crashed: what it printed says why (a sanitizer's report
  // too), where the requests after the crash only see no answer.
  ~Server() { EXPECT_TRUE(stopped || !d.ended()) << "the server ended by itself:\n" << banner(); }
  std::string banner() const { return read_text_file(d.tmpdir + "/early"); }
  int stop() {  // its exit code, -1 when it had ended before or does not end
    stopped = true;
    bool ends = !d.ended() && kill(d.pid, SIGTERM) == 0 && wait_for([&] { return d.ended(); }, 30);
    return ends ? d.exit_code() : -1;
  }
  httplib::Client client() const {
    httplib::Client c("127.0.0.1", port);
    c.set_read_timeout(30, 0);
    return c;
  }
  json get(const std::string& path) const {
    auto r = client().Get(path.c_str());
    return r && r->status == 200 ? json::parse(r->body, nullptr, false) : nullptr;
  }
  int status(const std::string& path) const {
    auto r = client().Get(path.c_str());
    return r ? r->status : -1;
  }
};

// The status code of a GET with a body of `size` bytes, written as is.
int status_of_get_with_body(int port, size_t size) {
  std::string request =
      "GET /api/jobs HTTP/1.1\r\nHost: x\r\nContent-Length: " + std::to_string(size) + "\r\n\r\n" +
      std::string(size, 'x');
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in a{.sin_family = AF_INET,
                .sin_port = htons(static_cast<uint16_t>(port)),
                .sin_addr = {htonl(INADDR_LOOPBACK)},
                .sin_zero = {}};
  char reply[256] = {};
  // The server may answer and close before it has read everything: a failed send is no fault.
  if (connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) == 0)
    (void)send(fd, request.data(), request.size(), MSG_NOSIGNAL);
  ssize_t n = recv(fd, reply, sizeof reply - 1, 0);
  close(fd);
  return n > 12 ? atoi(reply + 9) : -1;
}

// The smallest PNG header the server looks for, and a body behind it.
const std::string kPng = std::string("\x89PNG\r\n\x1a\n", 8) + "not really pixels";

// A job file with a wrangler's note that is also markup inside the block opened by `head`.
std::string with_markup_note(std::string jobs, const std::string& head) {
  return jobs.insert(jobs.find(head) + head.size(), "\t/*<script>alert(1)</script>*/\n");
}

class ServeTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::vector<ResourceSpec> hosts = {{.name = host_},
                                       {.name = "nightowl", .index = 2, .status = "SCHEDULE"}};
    hosts[1].locks = "\t{ 0 to 2400 Sunday to Saturday }";  // locked all week
    farm_.write("Render_Resource_Control", resource_file(hosts));
    std::vector<JobSpec> jobs = {
        {.name = "spin"},
        {.name = "half", .index = 2, .status = "50.00% ", .hosts = {host_}},
        {.name = "done", .index = 3, .status = "finished"}};
    farm_.write("Render_Job_Control", with_markup_note(job_file(jobs, scene_), "half 2 {\n"));
    // This host's daemon is gone: a pid file naming an ended process.
    write_text_file(farm_.path(host_ + ".pid"), pid_bytes(exited_pid()));
  }
  Farm farm_;
  std::string host_ = this_host_name();
  std::string scene_ = make_project(farm_);
};

TEST_F(ServeTest, ApiShowsJobsHostsAndFollowsChanges) {
  Server s(farm_);
  ASSERT_NE(s.banner().find("read-only on http://127.0.0.1:"), std::string::npos) << s.banner();
  json got = {
      {"jobs", s.get("/api/jobs")}, {"hosts", s.get("/api/hosts")}, {"one", s.get("/api/jobs/2")}};
  ASSERT_EQ(json({got["jobs"].size(), got["hosts"].size()}), json({3, 2})) << got;
  // A pointer into the answers, and the JSON there.
  const json want = json::parse(R"({"/jobs/0/state": "pending", "/jobs/1/percent": 50.0,
      "/jobs/1/comment": "<script>alert(1)</script>", "/jobs/2/percent": 100.0,
      "/hosts/0/alive": false, "/hosts/0/locked_now": false, "/hosts/1/lock": "SCHEDULE",
      "/hosts/1/locked_now": true, "/hosts/1/schedule": "0-2400 Sunday-Saturday",
      "/one/frames": [1.0, 6.0, 1.0], "/one/images": [], "/one/tasks": []})");
  for (const auto& [at, value] : want.items())
    EXPECT_EQ(got.value(json::json_pointer(at), json()), value) << at;

  // A change to the job file shows, and moves the generation the page polls.
  uint64_t gen = s.get("/api/changed")["generation"];
  ASSERT_TRUE(set_job_status(farm_, "spin", "aborted", host_));
  ASSERT_TRUE(wait_for([&] { return s.get("/api/jobs")[0]["state"] == "aborted"; }, 10));
  EXPECT_GT(s.get("/api/changed")["generation"].get<uint64_t>(), gen);
  EXPECT_EQ(s.stop(), 0);
}

TEST_F(ServeTest, FramesAreServedOnlyAsPngFromTheJobsDirectory) {
  std::string pix = farm_.path("project/pix/");
  write_text_file(pix + "half.0001", kPng);
  write_text_file(pix + "half.0002", "GIF89a: not a PNG");
  write_text_file(farm_.path("secret.png"), kPng);
  ASSERT_EQ(symlink(farm_.path("secret.png").c_str(), (pix + "half.0003").c_str()), 0);
  write_text_file(pix + "spin.0001", kPng);  // another job's frame
  Server s(farm_);
  EXPECT_EQ(s.get("/api/jobs/2")["images"], json::array({"half.0001"}));
  auto r = s.client().Get("/api/jobs/2/frames/half.0001");
  ASSERT_TRUE(r);
  EXPECT_EQ(std::make_tuple(r->status, r->get_header_value("Content-Type"), r->body),
            std::make_tuple(200, std::string("image/png"), kPng));
  EXPECT_EQ(s.client().Get("/api/jobs/2/thumb")->body, kPng);

  // Not a PNG, a link out of the directory, another job's, climbing out, nothing rendered.
  for (std::string row : {"404 /api/jobs/2/frames/half.0002", "404 /api/jobs/2/frames/half.0003",
                          "404 /api/jobs/2/frames/spin.0001", "400 /api/jobs/2/frames/%2e%2e",
                          "400 /api/jobs/2/frames/..%2F..%2Fsecret.png", "404 /api/jobs/99",
                          "404 /api/jobs/99999999999", "404 /api/jobs/99/thumb",
                          "404 /api/jobs/3/thumb", "404 /api/nothing"})
    EXPECT_EQ(s.status(row.substr(4)), atoi(row.c_str())) << row;
  EXPECT_EQ(s.status("/" + std::string(20000, 'a')), 414);
  EXPECT_EQ(status_of_get_with_body(s.port, 1 << 20), 413);
  EXPECT_EQ(s.client().Post("/api/jobs", "x", "text/plain")->status, 405);
  EXPECT_EQ(s.status("/api/jobs"), 200);
}

TEST_F(ServeTest, TwoHundredClientsAtOnceAreAllAnswered) {
  Server s(farm_);
  std::atomic<int> ok{0};
  std::vector<std::thread> clients;
  for (int i = 0; i < 200; i++)
    clients.emplace_back([&] {
      for (const char* path : {"/api/jobs", "/api/hosts", "/api/jobs"}) ok += s.status(path) == 200;
    });
  for (auto& t : clients) t.join();
  EXPECT_EQ(ok.load(), 600);
  EXPECT_EQ(s.status("/"), 200);
  EXPECT_EQ(s.stop(), 0);
}

// The progress shown in the jobs table's row of job 1, or -1.
double shown_progress(const std::string& dom) {
  std::smatch m;
  std::regex row("<tr data-job=\"1\">.*?aria-valuenow=\"([0-9.]+)\"");
  return std::regex_search(dom, m, row) ? std::stod(m[1]) : -1;
}

TEST_F(ServeTest, BrowserShowsTheFarmWhileItRendersAndEscapesComments) {
  std::string browser = "/usr/bin/chromium";
  if (access(browser.c_str(), X_OK) != 0) browser += "-browser";
  if (access(browser.c_str(), X_OK) != 0) GTEST_SKIP() << "no chromium (make deps installs it)";
  farm_.write("Render_Job_Control",
              with_markup_note(job_file({{.end = 12, .opts = "slow=1", .hosts = {host_}}}, scene_),
                               "spin 1 {\n"));
  Daemon& d = farm_.start_on_farm({}, "", render_env());
  Server s(farm_);
  // What the headless browser prints (`what`: --dump-dom or --screenshot=PATH) once the page's
  // script had time to fetch.
  auto browse = [&](const std::string& what) {
    return run_program(
               {browser, "--headless", "--no-sandbox", "--disable-gpu", "--no-first-run",
                "--user-data-dir=" + farm_.path("browser"), "--virtual-time-budget=5000",
                "--window-size=1280,900", what, "http://127.0.0.1:" + std::to_string(s.port) + "/"},
               farm_.path("browser.run"))
        .out;
  };

  auto percent = [&] {  // the first job's, or -1
    return json{{"jobs", s.get("/api/jobs")}}.value(json::json_pointer("/jobs/0/percent"), -1.0);
  };
  ASSERT_TRUE(wait_for([&] { return percent() > 0; }, 120, &d)) << d.log();
  std::string first = browse("--dump-dom");
  double before = shown_progress(first);
  ASSERT_GE(before, 0) << first.substr(0, 2000);
  // The comment's characters, never an element.
  EXPECT_NE(first.find("&lt;script&gt;alert(1)&lt;/script&gt;"), std::string::npos);
  EXPECT_EQ(first.find("<script>alert"), std::string::npos);

  ASSERT_TRUE(wait_for([&] { return percent() > before + 5 || percent() >= 100; }, 120, &d));
  EXPECT_GT(shown_progress(browse("--dump-dom")), before);

  std::string shot = std::string(BUILD_DIR) + "/serve_page.png";
  unlink(shot.c_str());
  browse("--screenshot=" + shot);
  EXPECT_EQ(read_text_file(shot).substr(0, 8), kPng.substr(0, 8)) << "no screenshot at " << shot;
}

}  // namespace
#endif
