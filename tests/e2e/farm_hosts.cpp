#include "tests/e2e/farm_hosts.h"

#include <arpa/inet.h>
#include <dirent.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <thread>

namespace {

bool executable(const std::string& path) { return access(path.c_str(), X_OK) == 0; }

bool on_path(const char* name) {
  const char* path = getenv("PATH");
  std::string dirs = path != nullptr ? path : "/usr/bin:/bin";
  size_t from = 0;
  while (from <= dirs.size()) {
    size_t colon = dirs.find(':', from);
    std::string dir =
        dirs.substr(from, colon == std::string::npos ? std::string::npos : colon - from);
    if (!dir.empty() && executable(dir + "/" + name)) return true;
    if (colon == std::string::npos) break;
    from = colon + 1;
  }
  return false;
}

// Runs a shell command; true on exit status 0.
bool shell(const std::string& command) {
  int st = system(command.c_str());
  return st != -1 && WIFEXITED(st) && WEXITSTATUS(st) == 0;
}

int free_port() {
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return 0;
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof addr;
  int port = 0;
  if (bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0 &&
      getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len) == 0)
    port = ntohs(addr.sin_port);
  close(fd);
  return port;
}

bool accepts(int port) {
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  addr.sin_port = htons(static_cast<uint16_t>(port));
  bool ok = connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0;
  close(fd);
  return ok;
}

std::string uts_of(int pid) {
  char link[128];
  std::string path = "/proc/" + std::to_string(pid) + "/ns/uts";
  ssize_t n = readlink(path.c_str(), link, sizeof link - 1);
  if (n <= 0) return "";
  link[n] = '\0';
  return link;
}

std::vector<int> all_pids() {
  std::vector<int> pids;
  DIR* proc = opendir("/proc");
  if (proc == nullptr) return pids;
  while (struct dirent* e = readdir(proc)) {
    int pid = atoi(e->d_name);
    if (pid > 0) pids.push_back(pid);
  }
  closedir(proc);
  return pids;
}

void tree_of(int pid, std::vector<int>* out) {
  for (int child : children_of(pid)) tree_of(child, out);
  out->push_back(pid);
}

bool gone(int pid) { return access(("/proc/" + std::to_string(pid)).c_str(), F_OK) != 0; }

}  // namespace

long long wall_ns() {
  struct timespec ts;
  clock_gettime(CLOCK_REALTIME, &ts);
  return static_cast<long long>(ts.tv_sec) * 1000000000LL + ts.tv_nsec;
}

std::vector<Stamp> read_stamps(const std::string& path) {
  std::vector<Stamp> stamps;
  FILE* fp = fopen(path.c_str(), "r");
  if (fp == nullptr) return stamps;
  char line[512];
  while (fgets(line, sizeof line, fp) != nullptr) {
    char host[128];
    Stamp s;
    if (sscanf(line, "%127s %f %lld %lld %d", host, &s.frame, &s.start_ns, &s.end_ns, &s.pid) != 5)
      continue;
    s.host = host;
    stamps.push_back(s);
  }
  fclose(fp);
  return stamps;
}

TempDir::TempDir() {
  const char* tmp = getenv("TMPDIR");
  std::string base = std::string(tmp != nullptr ? tmp : "/tmp") + "/rndctl_farm_XXXXXX";
  if (mkdtemp(base.data()) != nullptr) path_ = base;
}

TempDir::~TempDir() {
  if (!path_.empty()) remove_tree(path_);
}

// ---------------------------------------------------------------- SshServer

SshServer::~SshServer() {
  if (pid_ > 0) {
    kill(pid_, SIGTERM);
    int st;
    waitpid(pid_, &st, 0);
  }
}

std::string SshServer::why_unavailable() {
  if (geteuid() != 0) return "needs root: mount namespaces and FUSE mounts";
  if (!on_path("sshfs")) return "sshfs is not installed (tools/install-deps.sh installs it)";
  if (!executable("/usr/sbin/sshd")) return "sshd is not installed (package openssh-server)";
  if (!on_path("ssh-keygen")) return "ssh-keygen is not installed";
  int fd = open("/dev/fuse", O_RDWR | O_CLOEXEC);
  if (fd < 0) return std::string("/dev/fuse cannot be opened: ") + strerror(errno);
  close(fd);
  return "";
}

bool SshServer::start(const std::string& dir, std::string* why) {
  dir_ = dir;
  mkdir(dir.c_str(), 0700);
  mkdir("/run/sshd", 0755);  // sshd's privilege separation directory
  port_ = free_port();
  if (port_ == 0 || !shell("ssh-keygen -q -t ed25519 -N '' -f '" + dir + "/host_key' </dev/null") ||
      !shell("ssh-keygen -q -t ed25519 -N '' -f '" + dir + "/client_key' </dev/null") ||
      !shell("cp '" + dir + "/client_key.pub' '" + dir + "/authorized_keys'")) {
    *why = "could not make throw-away ssh keys";
    return false;
  }
  std::string config = dir + "/sshd_config";
  write_text_file(config, "ListenAddress 127.0.0.1\nPort " + std::to_string(port_) + "\nHostKey " +
                              dir + "/host_key\nAuthorizedKeysFile " + dir +
                              "/authorized_keys\nPermitRootLogin prohibit-password\n"
                              "PasswordAuthentication no\nKbdInteractiveAuthentication no\n"
                              "UsePAM no\nStrictModes no\nPidFile " +
                              dir +
                              "/sshd.pid\nSubsystem sftp internal-sftp\nMaxStartups 200\n"
                              "MaxSessions 200\nLogLevel ERROR\n");
  std::string log = dir + "/sshd.log";
  pid_ = fork();
  if (pid_ == 0) {
    int fd = open(log.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    if (fd >= 0) {
      dup2(fd, 1);
      dup2(fd, 2);
      close(fd);
    }
    execl("/usr/sbin/sshd", "/usr/sbin/sshd", "-D", "-e", "-f", config.c_str(),
          static_cast<char*>(nullptr));
    _exit(127);
  }
  if (!wait_for([&] { return accepts(port_); }, 10)) {
    *why = "sshd did not come up: " + read_text_file(log);
    return false;
  }
  // A trial mount in a throw-away mount namespace: FUSE may be there and
  // still refuse (no privileges in a container, say).
  std::string trial = dir + "/trial";
  mkdir(trial.c_str(), 0755);
  write_text_file(dir + "/trial.sh", sshfs_command(dir, trial) +
                                         " &\nfor i in $(seq 200); do\n  [ -e '" + trial +
                                         "/sshd_config' ] && exit 0\n  sleep 0.05\ndone\nexit 1\n");
  std::string cmd = "timeout 30 unshare -m --propagation private sh '" + dir + "/trial.sh' >'" +
                    dir + "/trial.log' 2>&1";
  if (!shell(cmd)) {
    *why = "an sshfs trial mount failed: " + read_text_file(dir + "/trial.log");
    return false;
  }
  return true;
}

std::string SshServer::sshfs_command(const std::string& remote_dir,
                                     const std::string& mount_point) const {
  return "sshfs -f -o cache=no,StrictHostKeyChecking=no,UserKnownHostsFile=/dev/null,"
         "LogLevel=ERROR,IdentityFile=" +
         dir_ + "/client_key,port=" + std::to_string(port_) + " root@127.0.0.1:" + remote_dir +
         " " + mount_point;
}

// ---------------------------------------------------------------- FarmHosts

FarmHosts::FarmHosts(Farm& farm, const SshServer* ssh) : farm_(farm), ssh_(ssh) {
  scratch_ = farm.dir().substr(0, farm.dir().rfind('/'));
  // Probes of another host's pid go through a remote shell; every host of
  // this farm shares this machine's pids, so the shim runs the probe here.
  std::string rsh = scratch_ + "/rsh_here";
  write_text_file(rsh,
                  "#!/bin/sh\n# rsh HOST -n COMMAND: all hosts share this machine's pids\n"
                  "shift\n[ \"$1\" = -n ] && shift\nexec /bin/sh -c \"$1\"\n");
  chmod(rsh.c_str(), 0755);
  set_env({});
}

FarmHosts::~FarmHosts() {
  for (auto& [name, host] : hosts_) {
    if (host.frozen && !host.starts.empty()) kill(host.starts.back()->pid, SIGCONT);
    for (auto& d : host.starts) d->stop();
    for (int pid : processes_of(host)) kill(pid, SIGKILL);
  }
  kill_renders();
}

void FarmHosts::set_env(const std::vector<std::string>& extra) {
  std::string bin = STAMP_RENDER_PATH;
  bin = bin.substr(0, bin.rfind('/'));
  const char* path = getenv("PATH");
  env_ = {"PATH=" + bin + ":" + (path != nullptr ? path : "/usr/bin:/bin"),
          "ZARNO_RSH=" + scratch_ + "/rsh_here"};
  for (const auto& e : extra) env_.push_back(e);
}

Daemon* FarmHosts::daemon(const std::string& host) {
  auto it = hosts_.find(host);
  if (it == hosts_.end() || it->second.starts.empty()) return nullptr;
  return it->second.starts.back();
}

bool FarmHosts::start(const std::string& name) {
  if (hosts_.find(name) == hosts_.end()) order_.push_back(name);
  Host& host = hosts_[name];
  std::string dir = farm_.dir();
  std::string script = "hostname \"$0\" || exit 1; ";
  std::vector<std::string> argv = uts_unshare();
  if (ssh_ != nullptr) {
    // The client runs in the foreground as a child of the shell, and so of
    // the daemon once the shell has become it: a power cut ends both.
    std::string mnt = scratch_ + "/mnt_" + name;
    mkdir(mnt.c_str(), 0755);
    argv.push_back("-m");
    argv.push_back("--propagation");
    argv.push_back("private");
    script += ssh_->sshfs_command(dir, mnt) + " & for i in $(seq 600); do [ -e '" + mnt +
              "/Render_Job_Control' ] && break; sleep 0.05; done; ";
    dir = mnt;
  }
  script += "exec \"$@\"";
  for (const char* a : {"/bin/sh", "-c"}) argv.push_back(a);
  argv.push_back(script);
  argv.push_back(name);
  for (const char* a : {DAEMON_PATH, "-l"}) argv.push_back(a);
  argv.push_back(dir);
  argv.push_back("-d");
  argv.push_back("1");

  Daemon* started = &farm_.run(argv, name, env_);
  host.starts.push_back(started);
  host.frozen = false;
  bool up =
      wait_for([&] { return started->in_loop() || started->ended(); }, 30) && !started->ended();
  if (up) host.namespaces.insert(uts_of(started->pid));
  return up;
}

std::vector<int> FarmHosts::processes_of(const Host& host) const {
  std::vector<int> pids;
  if (host.namespaces.empty()) return pids;
  for (int pid : all_pids()) {
    if (host.namespaces.count(uts_of(pid)) != 0) pids.push_back(pid);
  }
  return pids;
}

void FarmHosts::kill_daemon(const std::string& name) {
  Daemon* d = daemon(name);
  if (d == nullptr || d->ended()) return;
  kill(d->pid, SIGKILL);
  int st;
  if (waitpid(d->pid, &st, 0) == d->pid) {
    d->status = st;
    d->reaped = true;
  }
  hosts_[name].frozen = false;
}

void FarmHosts::power_cut(const std::string& name) {
  Host& host = hosts_[name];
  Daemon* d = daemon(name);
  std::vector<int> victims;
  if (d != nullptr && !d->ended()) {
    // Stopped first, so that it cannot start a render while the rest dies.
    kill(d->pid, SIGSTOP);
    tree_of(d->pid, &victims);
  }
  for (int pid : processes_of(host)) victims.push_back(pid);
  for (int pid : victims) kill(pid, SIGKILL);
  if (d != nullptr && !d->reaped) {
    int st;
    if (waitpid(d->pid, &st, 0) == d->pid) {
      d->status = st;
      d->reaped = true;
    }
  }
  host.frozen = false;
  wait_for(
      [&] {
        for (int pid : victims) {
          if (!gone(pid)) return false;
        }
        return true;
      },
      10);
}

void FarmHosts::freeze(const std::string& name) {
  Daemon* d = daemon(name);
  if (d == nullptr || d->ended()) return;
  kill(d->pid, SIGSTOP);
  hosts_[name].frozen = true;
}

void FarmHosts::thaw(const std::string& name) {
  Daemon* d = daemon(name);
  if (d == nullptr || d->ended()) return;
  kill(d->pid, SIGCONT);
  hosts_[name].frozen = false;
}

void FarmHosts::wake_all() {
  for (auto& [name, host] : hosts_) {
    if (host.frozen || host.starts.empty()) continue;
    Daemon* d = host.starts.back();
    if (!d->ended() && d->in_loop()) d->wake();
  }
}

void FarmHosts::idle(double seconds) {
  wait_until([] { return false; }, seconds);
}

bool FarmHosts::wait_until(const std::function<bool()>& done, double seconds) {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
  auto next_wake = std::chrono::steady_clock::now() + std::chrono::seconds(1);
  while (std::chrono::steady_clock::now() < deadline) {
    if (done()) return true;
    if (std::chrono::steady_clock::now() >= next_wake) {
      wake_all();
      next_wake += std::chrono::seconds(1);
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return done();
}

void FarmHosts::touch_pid_files() const {
  for (const auto& name : order_) {
    std::string pid_file = farm_.path(name + ".pid");
    utimensat(AT_FDCWD, pid_file.c_str(), nullptr, 0);
  }
}

std::vector<std::string> FarmHosts::shut_down(double seconds) {
  for (auto& [name, host] : hosts_) {
    if (host.frozen) thaw(name);
    unlink(farm_.path(name + ".pid").c_str());
  }
  wait_until(
      [&] {
        for (auto& [name, host] : hosts_) {
          if (!host.starts.empty() && !host.starts.back()->ended()) return false;
        }
        return true;
      },
      seconds);
  std::vector<std::string> stuck;
  for (auto& [name, host] : hosts_) {
    if (host.starts.empty() || host.starts.back()->ended()) continue;
    stuck.push_back(name);
    host.starts.back()->stop();
  }
  return stuck;
}

std::vector<int> FarmHosts::renders_left() const {
  std::vector<int> left;
  for (int pid : all_pids()) {
    std::string cmdline = read_text_file("/proc/" + std::to_string(pid) + "/cmdline");
    std::string argv0 = cmdline.substr(0, cmdline.find('\0'));
    std::string base = argv0.substr(argv0.rfind('/') + 1);
    if (base == "stamp_render" && cmdline.find(farm_.dir()) != std::string::npos)
      left.push_back(pid);
  }
  return left;
}

void FarmHosts::kill_renders() const {
  for (int pid : renders_left()) kill(pid, SIGKILL);
}
