// The control block and the settings every process fills in at start-up.
#include "Utility/rndctl/base/rj_control.h"

#include <pwd.h>
#include <unistd.h>

#include <climits>
#include <cstdio>
#include <cstdlib>

#include "General/pst/pst.h"
#include "Utility/rndctl/base/rj_log.h"

RndCtl rndctl;

void RJC_init_rndctl(const char* location) {
  if (location == nullptr) location = get_zarno_variable("ZARNO_RNDCTL_LOCATION");
  if (location == nullptr) {
    fprintf(stderr, "Zarno variable ZARNO_RNDCTL_LOCATION must be set\n");
    exit(-1);
  }
  rndctl.location.set(location);

  char host[64];
  if (gethostname(host, sizeof host) != 0) host[0] = '\0';
  host[sizeof host - 1] = '\0';
  rndctl.host.set(host);

  rndctl.pid = getpid();

  // The login name of the effective user.
  struct passwd* pw = getpwuid(geteuid());
  rndctl.user.set(pw != nullptr ? pw->pw_name : nullptr);

  const char* install = getenv("ZARNO_LOCATION");
  rndctl.install.set(install != nullptr ? install : "/usr/qm/zarno");

  // The optional access-log lines (idle exits, timed-out locks): on when
  // ZARNO_RNDCTL_ACCESS_LOG, from the environment or else the preferences
  // file (only when there is one to read: its lookup complains otherwise),
  // is a non-zero number.
  const char* access_log = getenv("ZARNO_RNDCTL_ACCESS_LOG");
  const char* prefs = access_log == nullptr ? find_variable_file(0, nullptr, nullptr) : nullptr;
  if (prefs != nullptr && *prefs != '\0' && access(prefs, R_OK) == 0)
    access_log = get_zarno_variable("ZARNO_RNDCTL_ACCESS_LOG");
  if (access_log != nullptr && atoi(access_log) != 0) debug_fileacc = 1;

  dbgpnt("%s %d %s -------------------------------------------RJC_init_rndctl\n",
         rndctl.host.or_else(""), rndctl.pid, rndctl.user.or_else("(null)"));
}

namespace {
// The last value refused, so that a bad header read again at every reload
// is reported once, not every few seconds.
bool refused_any = false;
long refused_min = 0;
long refused_sec = 0;
}  // namespace

int RJC_set_check_interval(long minutes, long seconds, const char* from) {
  // The loop waits interval_min * 60 + interval_sec seconds, as an int: a
  // negative part, or a total past that, wraps round to a negative wait,
  // which the loop takes as "reload now", at full speed for ever.
  bool valid = minutes >= 0 && seconds >= 0 && seconds <= 59 && minutes <= (INT_MAX - seconds) / 60;
  if (valid) {
    rndctl.interval_min = static_cast<unsigned>(minutes);
    rndctl.interval_sec = static_cast<unsigned>(seconds);
    refused_any = false;
    return 1;
  }
  if (!refused_any || refused_min != minutes || refused_sec != seconds) {
    char line[256];
    snprintf(line, sizeof line,
             "ignoring check interval %ld:%02ld from %s: out of range, keeping %u:%02u", minutes,
             seconds, from != nullptr ? from : "(null)", rndctl.interval_min, rndctl.interval_sec);
    EDuprintf("%s", line);
    refused_any = true;
    refused_min = minutes;
    refused_sec = seconds;
  }
  return 0;
}
