// Weekly schedules: the half-hour week grid of job run slots and resource
// lock slots, filling it from control-file entries, turning it back into
// blocks for writing, and checking it against the clock.
//
// Grid index = day * 48 + slot, day 0 = Sunday, slot k = minutes k*30 up to
// (k+1)*30.  Entry 336 is never set: the wake-up scans visit it as the
// week's end, so a locked host wakes at the week boundary at the latest.
#include "Utility/rndctl/records/rj_schedule.h"

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <ctime>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/records/rj_recindex.h"
#include "Utility/rndctl/records/rj_records.h"

const char* const day_table[7] = {"Sunday",   "Monday", "Tuesday", "Wednesday",
                                  "Thursday", "Friday", "Saturday"};

// Column 0 is the canonical name the parser keeps; column 3 is what the
// clock's "%a" gives.  Matching is exact: SUN is not a day.
const char* const day_nametable[7][4] = {
    {"sunday", "sun", "Sunday", "Sun"},     {"monday", "mon", "Monday", "Mon"},
    {"tuesday", "tue", "Tuesday", "Tue"},   {"wednesday", "wed", "Wednesday", "Wed"},
    {"thursday", "thu", "Thursday", "Thu"}, {"friday", "fri", "Friday", "Fri"},
    {"saturday", "sat", "Saturday", "Sat"},
};

const char* const time_table[48] = {
    "Midnight", "0:30",  "1:00",  "1:30",  "2:00",  "2:30",  "3:00",  "3:30",  "4:00",  "4:30",
    "5:00",     "5:30",  "6:00",  "6:30",  "7:00",  "7:30",  "8:00",  "8:30",  "9:00",  "9:30",
    "10:00",    "10:30", "11:00", "11:30", "Noon",  "12:30", "13:00", "13:30", "14:00", "14:30",
    "15:00",    "15:30", "16:00", "16:30", "17:00", "17:30", "18:00", "18:30", "19:00", "19:30",
    "20:00",    "20:30", "21:00", "21:30", "22:00", "22:30", "23:00", "23:30",
};

float last_float_time_index = 0.0f;

namespace {

constexpr int kSlotsPerDay = 48;

int day_index(const char* name) {
  if (name == nullptr) return -1;
  for (int d = 0; d < 7; d++)
    for (int form = 0; form < 4; form++)
      if (strcmp(name, day_nametable[d][form]) == 0) return d;
  return -1;
}

// HHMM to slot: minutes 0-29 are the first half of the hour, 30-59 the second.
int time_slot(int hhmm) { return (hhmm / 100) * 2 + (hhmm % 100) / 30; }

// Slot to HHMM of its start; slot 48 is 2400, the end of the day.
int slot_time(int slot) { return (slot / 2) * 100 + ((slot % 2) != 0 ? 30 : 0); }

bool is_set(const int* grid, int n) { return n >= 0 && n < RJ_WEEK && grid[n] != 0; }

// The same span of hours on every day of the range; a range over the week's
// end or a span over midnight sets nothing.  Slots past the end of a day run
// into the next day, but never past the grid.
void fill_grid(int* grid, int start, int end, const char* first_day, const char* last_day) {
  int first = day_index(first_day);
  int last = day_index(last_day);
  if (first < 0 || last < 0 || last < first) return;
  int from = time_slot(start);
  int to = time_slot(end);
  for (int d = first; d <= last; d++) {
    // Out-of-range times run into the neighbouring days of the grid; only
    // the part inside the week is visited (a hostile file could name
    // billions of slots).
    long long lo = std::max<long long>(from, -static_cast<long long>(d) * kSlotsPerDay);
    long long hi = std::min<long long>(to, static_cast<long long>(RJ_WEEK) - d * kSlotsPerDay);
    for (long long k = lo; k < hi; k++) grid[d * kSlotsPerDay + k] = 1;
  }
}

// Seconds from the clock position to the start of position n of the scan.
int seconds_until(int n, int index) {
  dbgpnt("next_time index = %d\n", n);
  dbgpnt("last_float_time_index %f\n", static_cast<double>(last_float_time_index));
  float delta;
  if (n < index)  // the scan wrapped into next week
    delta = static_cast<float>(n + 336.0 - last_float_time_index);
  else
    delta = static_cast<float>(n - last_float_time_index);
  return static_cast<int>(delta * 30.0 * 60.0);
}

// Advances n past the set positions of grid over the 337-position week.
// Returns false when it comes back to index: set all week.
bool skip_set(const int* grid, int& n, int index) {
  if (n < 0 || n >= RJ_WEEK_SCAN) n = 0;
  while (is_set(grid, n)) {
    n++;
    if (n >= RJ_WEEK_SCAN) n = 0;
    if (n == index) return false;
  }
  return true;
}

}  // namespace

const char* Schedule_get_day(const char* name) {
  int d = day_index(name);
  return d < 0 ? nullptr : day_nametable[d][0];
}

void Schedule_job_runs(Job* job, int start, int end, const char* first_day, const char* last_day) {
  if (job != nullptr) fill_grid(job->runs, start, end, first_day, last_day);
}

void Schedule_dev_lock(Dev* dev, int start, int end, const char* first_day, const char* last_day) {
  if (dev != nullptr) fill_grid(dev->locks, start, end, first_day, last_day);
}

int Schedule_get_a_block(int* grid, int times[2], const char* days[2]) {
  // The writer calls this until the grid is empty, and most grids are empty
  // or nearly so: an empty grid is told by one block compare, and the first
  // set slot is looked for in runs of slots before slot by slot.
  static const int kEmptyWeek[RJ_WEEK] = {};
  if (memcmp(grid, kEmptyWeek, sizeof kEmptyWeek) == 0) return 0;
  constexpr int kRun = 16;
  static_assert(RJ_WEEK % kRun == 0);
  int first = -1;
  for (int base = 0; base < RJ_WEEK && first < 0; base += kRun) {
    int any = 0;
    for (int k = 0; k < kRun; k++) any |= grid[base + k];
    if (any == 0) continue;
    for (int k = 0; k < kRun; k++) {
      if (grid[base + k] != 0) {
        first = base + k;
        break;
      }
    }
  }
  if (first < 0) return 0;
  const int day = first / kSlotsPerDay;
  const int s = first % kSlotsPerDay;
  // A block never runs over midnight within one day...
  int e = s;
  while (e + 1 < kSlotsPerDay && grid[day * kSlotsPerDay + e + 1] != 0) e++;
  // ...but takes in every following day that holds the same span.
  int last = day;
  while (last + 1 < 7) {
    bool all = true;
    for (int k = s; k <= e && all; k++) all = grid[(last + 1) * kSlotsPerDay + k] != 0;
    if (!all) break;
    last++;
  }
  for (int d = day; d <= last; d++)
    for (int k = s; k <= e; k++) grid[d * kSlotsPerDay + k] = 0;
  times[0] = slot_time(s);
  times[1] = slot_time(e + 1);
  days[0] = day_table[day];
  days[1] = day_table[last];
  return 1;
}

int set_in_betweens(int* grid, const int a[2], const int b[2], int mode) {
  if (grid == nullptr || a == nullptr || b == nullptr) return 0;
  const int slot_lo = a[0] < b[0] ? a[0] : b[0];
  const int slot_hi = a[0] < b[0] ? b[0] : a[0];
  const int day_lo = a[1] < b[1] ? a[1] : b[1];
  const int day_hi = a[1] < b[1] ? b[1] : a[1];
  int changed = 0;
  for (int d = day_lo; d <= day_hi; d++) {
    if (d < 0 || d >= 7) continue;
    for (int k = slot_lo; k <= slot_hi; k++) {
      if (k < 0 || k >= kSlotsPerDay) continue;
      int& entry = grid[d * kSlotsPerDay + k];
      if (mode == 1 && entry == 0) {
        entry = 1;
        changed = 1;
      } else if (mode == -1 && entry != 0) {
        entry = 0;
        changed = 1;
      }
    }
  }
  return changed;
}

int get_abbreviated_day_index(const char* abbr) {
  if (abbr == nullptr || *abbr == '\0') return 0;
  for (int d = 0; d < 7; d++)
    if (strcmp(abbr, day_nametable[d][3]) == 0) return d;
  return -1;
}

int get_current_schedule_index() {
  time_t now = rj_now();
  struct tm local;
  if (localtime_r(&now, &local) == nullptr) return -1;
  // The weekday goes through its name, as the clock of the process's locale
  // gives it: under a locale with other names the schedules do not apply.
  char text[12];
  if (strftime(text, sizeof text, "%a %H %M", &local) == 0) return -1;
  char abbr[4] = "";
  int hour = 0, minute = 0;
  if (sscanf(text, "%3s %d %d", abbr, &hour, &minute) != 3) return -1;
  int day = get_abbreviated_day_index(abbr);
  if (day < 0) return -1;
  last_float_time_index =
      static_cast<float>(static_cast<double>(day * 48 + hour * 2) + minute / 30.0);
  return static_cast<int>(last_float_time_index);
}

int Job_schedule_check(Job* job) {
  if (job == nullptr) return 0;
  switch (job->ctrl) {
    case RUN_PAUSED:
      return 1;
    case RUN_AVAILABLE:
    case RUN_NOW:
      return 2;
    case RUN_SCHEDULE: {
      int i = get_current_schedule_index();
      if (is_set(job->runs, i)) {
        dbgpnt("%s is SCHEDULE true\n", job->name.or_else("(null)"));
        return 2;
      }
      return 0;
    }
    default:
      return 0;
  }
}

int Dev_schedule_check(const char* host) {
  if (rndctl.devs == nullptr || host == nullptr) return -1;
  for (Dev* dev = rndctl.devs; dev != nullptr; dev = dev->next) {
    if (!dev->host_name.is(host) || dev->status == LOCK_AVAILABLE) continue;
    int i = get_current_schedule_index();
    if (dev->status == LOCK_LOCKED) {
      dbgpnt("%s is LOCKED\n", dev->name.or_else("(null)"));
      return i;
    }
    // Several resources may stand for one host: the first locked now decides.
    if (is_set(dev->locks, i)) {
      dbgpnt("%s is SCHEDULE true\n", dev->name.or_else("(null)"));
      return i;
    }
  }
  return -1;
}

int get_next_available_time(const char* host, int index) {
  int n = index + 1;
  if (host != nullptr) {
    // n only moves forward: every resource of the host must be clear at n.
    for (Dev* dev = rndctl.devs; dev != nullptr; dev = dev->next) {
      if (!dev->host_name.is(host)) continue;
      if (!skip_set(dev->locks, n, index)) return 0;
    }
  }
  return seconds_until(n, index);
}

int job_get_next_available_time(Job* job, int index) {
  int n = index + 1;
  if (job != nullptr && !skip_set(job->runs, n, index)) return 0;
  return seconds_until(n, index);
}
