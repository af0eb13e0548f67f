#include "tests/e2e/farm_hosts.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>

#include "tests/e2e/render_farm.h"

namespace {

bool shell(const std::string& command) {
  int st = system(command.c_str());
  return st != -1 && WIFEXITED(st) && WEXITSTATUS(st) == 0;
}

std::string uts_of(int pid) {
  char link[128];
  ssize_t n = readlink(("/proc/" + std::to_string(pid) + "/ns/uts").c_str(), link, sizeof link);
  return n > 0 ? std::string(link, static_cast<size_t>(n)) : "";
}

std::vector<int> pids_where(const std::function<bool(int)>& keep) {
  std::vector<int> pids;
  for (const std::string& name : dir_names("/proc"))
    if (int pid = atoi(name.c_str()); pid > 0 && keep(pid)) pids.push_back(pid);
  return pids;
}

}  // namespace

long long wall_ns() {
  auto since_epoch = std::chrono::system_clock::now().time_since_epoch();  // CLOCK_REALTIME
  return std::chrono::duration_cast<std::chrono::nanoseconds>(since_epoch).count();
}

std::vector<Stamp> read_stamps(const std::string& path) {
  std::vector<Stamp> stamps;
  std::ifstream in(path);
  for (std::string line; std::getline(in, line);) {
    std::istringstream fields(line);
    if (Stamp s; fields >> s.host >> s.frame >> s.start_ns >> s.end_ns) stamps.push_back(s);
  }
  return stamps;
}

SshServer::~SshServer() {
  if (pid_ > 0 && kill(pid_, SIGTERM) == 0) waitpid(pid_, nullptr, 0);
  if (!dir_.empty()) remove_tree(dir_);
}

bool SshServer::start(std::string* why) {
  *why = geteuid() != 0 ? "needs root: mount namespaces and FUSE mounts"
         : !shell("command -v sshfs ssh-keygen >/dev/null")
             ? "sshfs or ssh-keygen is not installed (tools/install-deps.sh installs them)"
         : access("/usr/sbin/sshd", X_OK) != 0   ? "sshd is not installed (package openssh-server)"
         : access("/dev/fuse", R_OK | W_OK) != 0 ? "/dev/fuse cannot be opened"
                                                 : "";
  if (!why->empty()) return false;
  const char* tmp = getenv("TMPDIR");
  std::string base = std::string(tmp != nullptr ? tmp : "/tmp") + "/rndctl_ssh_XXXXXX";
  if (mkdtemp(base.data()) == nullptr) return false;
  dir_ = base;
  mkdir("/run/sshd", 0755);  // sshd's privilege separation directory
  port_ = free_port();
  std::string keygen = "ssh-keygen -q -t ed25519 -N '' -f ";
  if (port_ == 0 || !shell("cd '" + dir_ + "' && " + keygen + "host_key </dev/null && " + keygen +
                           "client_key </dev/null && cp client_key.pub authorized_keys"))
    return *why = "could not make throw-away ssh keys", false;
  std::string config = dir_ + "/sshd_config", d = dir_;
  write_text_file(config, "Port " + std::to_string(port_) + "\nHostKey " + d +
                              "/host_key\nPidFile " + d + "/sshd.pid\nAuthorizedKeysFile " + d +
                              "/authorized_keys\n" +
                              "ListenAddress 127.0.0.1\nPermitRootLogin prohibit-password\n"
                              "PasswordAuthentication no\nKbdInteractiveAuthentication no\n"
                              "UsePAM no\nStrictModes no\nSubsystem sftp internal-sftp\n"
                              "MaxStartups 200\nMaxSessions 200\nLogLevel ERROR\n");
  std::string log = dir_ + "/sshd.log";
  pid_ = fork();
  if (pid_ == 0) {
    int fd = open(log.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    dup2(fd, 1), dup2(fd, 2);
    execl("/usr/sbin/sshd", "/usr/sbin/sshd", "-D", "-e", "-f", config.c_str(),
          static_cast<char*>(nullptr));
    _exit(127);
  }
  // sshd writes its pid file once it listens.
  if (!wait_for([&] { return access((dir_ + "/sshd.pid").c_str(), F_OK) == 0; }, 10))
    return *why = "sshd did not come up: " + read_text_file(log), false;
  // A trial mount in a throw-away mount namespace: FUSE may be there and
  // still refuse (no privileges in a container, say).
  std::string trial = dir_ + "/trial";
  mkdir(trial.c_str(), 0755);
  write_text_file(dir_ + "/trial.sh",
                  sshfs_command(dir_, trial) + " &\nfor i in $(seq 200); do\n  [ -e '" + trial +
                      "/sshd_config' ] && exit 0\n  sleep 0.05\ndone\nexit 1\n");
  if (!shell("timeout 30 unshare -m --propagation private sh '" + dir_ + "/trial.sh' >'" + dir_ +
             "/trial.log' 2>&1"))
    return *why = "an sshfs trial mount failed: " + read_text_file(dir_ + "/trial.log"), false;
  return true;
}

std::string SshServer::sshfs_command(const std::string& remote_dir,
                                     const std::string& mount_point) const {
  return "sshfs -f -o cache=no,StrictHostKeyChecking=no,UserKnownHostsFile=/dev/null,"
         "LogLevel=ERROR,IdentityFile=" +
         dir_ + "/client_key,port=" + std::to_string(port_) + " root@127.0.0.1:" + remote_dir +
         " " + mount_point;
}

FarmHosts::FarmHosts(Farm& farm, const SshServer* ssh)
    : farm_(farm), ssh_(ssh), env_(render_env()) {
  // Probes of another host's pid go through a remote shell; every host of
  // this farm shares this machine's pids, so the shim runs the probe here.
  std::string rsh = farm.path("../rsh_here");
  write_text_file(rsh,
                  "#!/bin/sh\n# rsh HOST -n COMMAND\nshift\n[ \"$1\" = -n ] && shift\n"
                  "exec /bin/sh -c \"$1\"\n");
  chmod(rsh.c_str(), 0755);
  env_.push_back("ZARNO_RSH=" + rsh);
}

FarmHosts::~FarmHosts() {
  for (auto& [name, host] : hosts_) power_cut(name);
  for (int pid : renders_left()) kill(pid, SIGKILL);
  for (auto& [name, host] : hosts_)
    for (int fd : host.namespace_fds) close(fd);
}

Daemon* FarmHosts::daemon(const std::string& host) {
  auto it = hosts_.find(host);
  return it == hosts_.end() || it->second.starts.empty() ? nullptr : it->second.starts.back();
}

bool FarmHosts::start(const std::string& name) {
  Host& host = hosts_[name];
  std::string dir = farm_.dir(), script = "hostname \"$0\" || exit 1; ";
  std::vector<std::string> argv = uts_unshare();
  if (ssh_ != nullptr) {
    // The client runs in the foreground as a child of the shell, and so of
    // the daemon once the shell has become it.
    std::string mnt = farm_.path("../mnt_" + name);
    mkdir(mnt.c_str(), 0755);
    for (const char* a : {"-m", "--propagation", "private"}) argv.push_back(a);
    script += ssh_->sshfs_command(dir, mnt) + " & for i in $(seq 600); do [ -e '" + mnt +
              "/Render_Job_Control' ] && break; sleep 0.05; done; ";
    dir = mnt;
  }
  argv.insert(argv.end(),
              {"/bin/sh", "-c", script + "exec \"$@\"", name, DAEMON_PATH, "-l", dir, "-d", "1"});
  Daemon* started = host.starts.emplace_back(&farm_.run(argv, name, env_));
  bool up =
      wait_for([&] { return started->in_loop() || started->ended(); }, 30) && !started->ended();
  if (std::string ns = up ? uts_of(started->pid) : ""; !ns.empty()) {
    int fd =
        open(("/proc/" + std::to_string(started->pid) + "/ns/uts").c_str(), O_RDONLY | O_CLOEXEC);
    // The namespace is kept only when the file opened is still the one read.
    if (fd >= 0 && uts_of(started->pid) == ns) {
      host.namespaces.insert(ns);
      host.namespace_fds.push_back(fd);
    } else if (fd >= 0) {
      close(fd);
    }
  }
  return up;
}

void FarmHosts::power_cut(const std::string& name) {
  Host& host = hosts_[name];
  Daemon* d = daemon(name);
  // Stopped first, so that it cannot start a render while the rest dies.
  if (d != nullptr && !d->ended()) kill(d->pid, SIGSTOP);
  std::vector<int> victims =
      pids_where([&](int pid) { return host.namespaces.count(uts_of(pid)) != 0; });
  for (int pid : victims) kill(pid, SIGKILL);
  if (d != nullptr) d->stop();
  wait_for([&] { return std::ranges::all_of(victims, pid_gone); }, 10);
}

bool FarmHosts::wait_until(const std::function<bool()>& done, double seconds) {
  auto next_wake = std::chrono::steady_clock::now() + std::chrono::seconds(1);
  return wait_for(
      [&] {
        if (std::chrono::steady_clock::now() < next_wake) return done();
        // A stopped daemon keeps the wake-up for when it continues.
        for (auto& [name, host] : hosts_)
          if (Daemon* d = daemon(name); d != nullptr && !d->ended() && d->in_loop()) d->wake();
        next_wake += std::chrono::seconds(1);
        return done();
      },
      seconds);
}

void FarmHosts::touch_pid_files() const {
  for (const auto& [name, host] : hosts_)
    utimensat(AT_FDCWD, farm_.path(name + ".pid").c_str(), nullptr, 0);
}

std::vector<std::string> FarmHosts::shut_down(double seconds) {
  for (const auto& [name, host] : hosts_) unlink(farm_.path(name + ".pid").c_str());
  auto stuck = [&] {
    std::vector<std::string> names;
    for (auto& [name, host] : hosts_)
      if (!host.starts.empty() && !host.starts.back()->ended()) names.push_back(name);
    return names;
  };
  wait_until([&] { return stuck().empty(); }, seconds);
  return stuck();
}

std::vector<int> FarmHosts::renders_left() const {
  return pids_where([&](int pid) {
    std::string cmdline = read_text_file("/proc/" + std::to_string(pid) + "/cmdline");
    std::string argv0 = cmdline.substr(0, cmdline.find('\0'));
    return argv0.substr(argv0.rfind('/') + 1) == "stamp_render" &&
           cmdline.find(farm_.dir()) != std::string::npos;
  });
}
