#include "tests/e2e/e2e_support.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <thread>

std::string this_host_name() {
  char host[64] = {};
  return gethostname(host, sizeof host - 1) == 0 ? host : "";
}

bool Daemon::in_loop() const {
  if (pid <= 0 || reaped) return false;
  std::string status = read_text_file("/proc/" + std::to_string(pid) + "/status");
  return (signal_mask(status, "SigCgt:", 0) & 1ULL << (SIGALRM - 1)) != 0;
}

bool Daemon::ended() {
  if (!reaped && pid > 0 && waitpid(pid, &status, WNOHANG) == pid) reaped = true;
  return reaped || pid <= 0;
}

int Daemon::exit_code() const { return reaped && WIFEXITED(status) ? WEXITSTATUS(status) : -1; }

namespace {
// Kills a process and everything below it (render programs run in process
// groups of their own).
void kill_tree(int pid, std::vector<int>* killed) {
  for (int child : children_of(pid)) kill_tree(child, killed);
  kill(pid, SIGKILL);
  killed->push_back(pid);
}
}  // namespace

void Daemon::stop() {
  if (pid <= 0 || reaped) return;
  std::vector<int> killed;
  kill_tree(pid, &killed);
  reaped = waitpid(pid, &status, 0) == pid;
  // Orphans are reaped by someone else: wait until they are really gone, so
  // that a probe of their pid no longer finds them.
  wait_for([&] { return std::ranges::all_of(killed, pid_gone); }, 10);
}

Farm::Farm() {
  const char* tmp = getenv("TMPDIR");
  std::string base = std::string(tmp != nullptr ? tmp : "/tmp") + "/rndctl_e2e_XXXXXX";
  if (mkdtemp(base.data()) != nullptr) scratch_ = base, dir_ = base + "/ctl";
  mkdir(dir_.c_str(), 0777);
}

Farm::~Farm() {
  for (auto& d : daemons_) d->stop();  // with its renders, in process groups of their own
  if (!scratch_.empty() && getenv("RJ_KEEP_TEST_DIRS") == nullptr) remove_tree(scratch_);
}

Daemon& Farm::start(const std::vector<std::string>& args, const std::string& host,
                    const std::vector<std::string>& env) {
  std::vector<std::string> argv;
  if (!host.empty() && host != this_host_name()) {
    argv = uts_unshare();
    argv.insert(argv.end(), {"/bin/sh", "-c", "hostname \"$0\" && exec \"$@\"", host});
  }
  argv.push_back(DAEMON_PATH);
  argv.insert(argv.end(), args.begin(), args.end());
  return run(argv, host.empty() ? this_host_name() : host, env);
}

Daemon& Farm::run(std::vector<std::string> argv, const std::string& host,
                  const std::vector<std::string>& env) {
  std::string tmpdir = scratch_ + "/tmp" + std::to_string(counter_++);
  Daemon* d = daemons_.emplace_back(new Daemon{.host = host, .tmpdir = tmpdir}).get();
  mkdir(d->tmpdir.c_str(), 0777);
  d->pid = fork();
  if (d->pid == 0) {
    setenv("DRCTMPDIR", d->tmpdir.c_str(), 1);
    unsetenv("RNDCTL_DEBUG");
    for (const auto& e : env) putenv(const_cast<char*>(e.c_str()));
    int fd = open((d->tmpdir + "/early").c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    if (fd >= 0) dup2(fd, 1), dup2(fd, 2);
    // The daemon starts as from a boot script, with the three streams only:
    // what the test runner holds open is not the daemon's to pass on.
    for (int other = 3; other < 1024; ++other) close(other);
    std::vector<char*> cargv;
    for (auto& a : argv) cargv.push_back(a.data());
    cargv.push_back(nullptr);
    execv(cargv[0], cargv.data());
    _exit(127);
  }
  return *d;
}

Daemon& Farm::start_on_farm(const std::vector<std::string>& extra, const std::string& host,
                            const std::vector<std::string>& env) {
  std::vector<std::string> args = {"-l", dir_, "-d", "1"};
  args.insert(args.end(), extra.begin(), extra.end());
  return start(args, host, env);
}

bool wait_for(const std::function<bool()>& done, double seconds, Daemon* wake) {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
  for (int round = 1; std::chrono::steady_clock::now() < deadline; ++round) {
    if (done()) return true;
    // Before its loop a daemon would die of SIGALRM: wake it only from then on.
    if (wake != nullptr && round % 25 == 0 && wake->in_loop()) wake->wake();
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return done();
}

int free_port() {
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in a{
      .sin_family = AF_INET, .sin_port = 0, .sin_addr = {htonl(INADDR_LOOPBACK)}, .sin_zero = {}};
  socklen_t len = sizeof a;
  if (bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) != 0 ||
      getsockname(fd, reinterpret_cast<sockaddr*>(&a), &len) != 0)
    a.sin_port = 0;
  close(fd);
  return ntohs(a.sin_port);
}

bool stop_between_locks(const Farm& farm, const Daemon& d, double seconds) {
  return wait_for(
      [&] {
        kill(d.pid, SIGSTOP);
        for (const std::string& name : dir_names(farm.dir()))
          if (name.ends_with(".lock") && access(farm.path(name + "/" + d.host).c_str(), F_OK) == 0)
            return kill(d.pid, SIGCONT), false;
        return true;
      },
      seconds);
}

bool pid_gone(int pid) { return access(("/proc/" + std::to_string(pid)).c_str(), F_OK) != 0; }

int count_of(const std::string& text, const std::string& needle) {
  int n = 0;
  for (size_t at = text.find(needle); at != std::string::npos; at = text.find(needle, at + 1)) ++n;
  return n;
}

std::vector<std::string> uts_unshare() {
  if (geteuid() == 0) return {"/usr/bin/unshare", "-u"};
  // Without root a user namespace of its own lets the daemon set its host
  // name; the pid namespace stays shared, so probes and signals still reach.
  return {"/usr/bin/unshare", "--user", "--map-root-user", "--uts"};
}

bool can_name_hosts() {
  static const bool can = [] {
    std::string cmd;
    for (const auto& a : uts_unshare()) cmd += a + " ";
    return system((cmd + "hostname probe.invalid >/dev/null 2>&1").c_str()) == 0;
  }();
  return can;
}

int read_pid_file(const std::string& path) {
  std::string data = read_text_file(path);
  int32_t pid = 0;
  if (data.size() >= sizeof pid) memcpy(&pid, data.data(), sizeof pid);
  return pid;
}

std::vector<int> children_of(int pid, int* zombies) {
  std::vector<int> kids;
  int z = 0;
  for (const std::string& name : dir_names("/proc")) {
    std::string stat = read_text_file("/proc/" + name + "/stat");
    size_t close = stat.rfind(')');
    char state = 0;
    int ppid = 0;
    if (atoi(name.c_str()) > 0 && close != std::string::npos &&
        sscanf(stat.c_str() + close + 1, " %c %d", &state, &ppid) == 2 && ppid == pid)
      kids.push_back(atoi(name.c_str())), z += state == 'Z';
  }
  if (zombies != nullptr) *zombies = z;
  return kids;
}
