// The settings the allocator reads from the environment (see MA_rtns.h).
#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>

#include "Shared/memory/MA_internal.h"

int ma_debug = 0;
int ma_trace = 0;
int ma_scatter = 1;
int ma_chkalloc = 0;
int ma_chkfree = 0;
int ma_tstart = 0;
int ma_stomp = 0;
int ma_start = 0;
int ma_stop = 0;
int ma_line = 0;
const char* ma_file = nullptr;

namespace {

int env_int(const char* name, int fallback) {
  const char* v = getenv(name);
  return v != nullptr ? atoi(v) : fallback;
}

}  // namespace

void MA_read_settings() {
  using ma_detail::ma_trace_fd;
  ma_debug = env_int("MA_DEBUG", 0);
  if (ma_debug == 0) return;
  ma_trace = env_int("MA_TRACE", 0);
  ma_scatter = env_int("MA_SCATTER", 1);
  if (ma_scatter < 1) ma_scatter = 1;
  ma_chkalloc = env_int("MA_ACHECK", 0);
  ma_chkfree = env_int("MA_FCHECK", 0);
  ma_tstart = getenv("MA_TSTART") != nullptr ? 1 : 0;
  ma_stomp = getenv("MA_STOMP") != nullptr ? 1 : 0;
  ma_start = env_int("MA_START", 0);
  if (ma_start < 0) ma_start = 0;
  ma_stop = env_int("MA_STOP", 0);
  ma_line = env_int("MA_LINE", 0);
  ma_file = getenv("MA_FILE");
  const char* home = getenv("HOME");
  if (ma_trace_fd < 0 && ma_trace > 0 && home != nullptr) {
    char path[4096];
    int n = snprintf(path, sizeof path, "%s/trace", home);
    if (n > 0 && static_cast<size_t>(n) < sizeof path) {
      ma_trace_fd = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
      if (ma_trace_fd >= 0) {
        // Kept from the first version of the trace, which proved the file
        // writable this way before anything was traced.
        ma_detail::write_all(ma_trace_fd, "Kludge", 6);
        lseek(ma_trace_fd, 0, SEEK_SET);
      }
    }
  }
}
