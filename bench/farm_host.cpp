// Starts one host of the farm benchmark, already inside its own UTS
// namespace: takes the host name, notes "NAME NANOSECONDS" (the host's start)
// in the starts file, and becomes the daemon.
//   farm_host NAME STARTS_FILE PROGRAM [ARG...]
// A shell with `hostname` and `date` forks two programs a host; with a hundred
// hosts starting on two processors, that work was taken from the daemons
// already running and showed up as their queue time.
#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>

int main(int argc, char* argv[]) {
  if (argc < 4) {
    fprintf(stderr, "usage: farm_host NAME STARTS_FILE PROGRAM [ARG...]\n");
    return 2;
  }
  const char* name = argv[1];
  if (sethostname(name, strlen(name)) != 0) {
    fprintf(stderr, "farm_host: cannot take the host name %s: %s\n", name, strerror(errno));
    return 1;
  }
  struct timespec now;
  clock_gettime(CLOCK_REALTIME, &now);
  char line[256];
  int n = snprintf(line, sizeof line, "%s %lld\n", name,
                   static_cast<long long>(now.tv_sec) * 1000000000LL + now.tv_nsec);
  int fd = open(argv[2], O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0666);
  // One write of one short line: appends of many hosts do not mix.
  if (fd < 0 || n <= 0 || write(fd, line, static_cast<size_t>(n)) != n) {
    fprintf(stderr, "farm_host: cannot note the start in %s: %s\n", argv[2], strerror(errno));
    return 1;
  }
  close(fd);
  execv(argv[3], argv + 3);
  fprintf(stderr, "farm_host: cannot run %s: %s\n", argv[3], strerror(errno));
  return 127;
}
