// Week grids: filling them from entries, taking blocks back out, and the
// checks against a clock that the tests set.
#include <algorithm>
#include <cstdlib>
#include <ctime>
#include <string>
#include <vector>

#include "tests/support/test_support.h"

namespace {

time_t fake_now = 0;

class ScheduleTest : public ControlDirTest {
 protected:
  void SetUp() override {
    ControlDirTest::SetUp();
    setenv("TZ", "UTC", 1);
    tzset();
    rj_clock = [] { return fake_now; };
  }
  // A time of the week starting on 2024-01-07, a Sunday.
  void at(int day, int hour, int minute) {
    fake_now = 1704585600 + day * 86400 + hour * 3600 + minute * 60;
  }
  // This host's position in the week and the seconds it would sleep from there
  // (none when it is not locked).
  static std::pair<int, int> check() {
    int now = Dev_schedule_check("testhost");
    return {now, now < 0 ? 0 : get_next_available_time("testhost", now)};
  }
};

struct Entry {
  int start, end;
  const char *first, *last;
};

// What the writer would print for a grid: the blocks in order.
std::vector<std::string> blocks_of(const int* grid) {
  int scratch[RJ_WEEK_SCAN], times[2];
  std::copy(grid, grid + RJ_WEEK_SCAN, scratch);
  std::vector<std::string> out;
  const char* days[2];
  for (char text[80]; Schedule_get_a_block(scratch, times, days) != 0; out.push_back(text)) {
    bool one_day = std::string(days[0]) == days[1];
    snprintf(text, sizeof text, "{ %d to %d %s%s%s }", times[0], times[1], days[0],
             one_day ? "" : " to ", one_day ? "" : days[1]);
  }
  return out;
}

}  // namespace

// Entries come back as blocks, and set as many half-hour slots; days may be
// written in any case or cut short, but must be days.
TEST(BlockRoundTrip, EntriesComeBackAsBlocks) {
  using Row = std::tuple<std::vector<Entry>, int, std::vector<std::string>>;
  // clang-format off
  for (const auto& [entries, slots_set, blocks] : {
           Row{{{0, 2400, "Sunday", "Saturday"}}, 336, {"{ 0 to 2400 Sunday to Saturday }"}},
           Row{{{800, 1745, "Monday", "Monday"}}, 19, {"{ 800 to 1730 Monday }"}},
           Row{{{830, 831, "Monday", "Monday"}}, 0, {}},
           Row{{{2200, 600, "Monday", "Monday"}}, 0, {}},  // over midnight
           Row{{{900, 1700, "Friday", "Monday"}}, 0, {}},  // over the week's end
           Row{{{900, 1700, "mon", "Fri"}}, 80, {"{ 900 to 1700 Monday to Friday }"}},
           Row{{{900, 1700, "MON", "MON"}, {900, 1700, "Sund", "Sund"}}, 0, {}},
           Row{{{800, 1200, "monday", "friday"}, {1300, 1700, "monday", "monday"}}, 48,
               {"{ 800 to 1200 Monday to Friday }", "{ 1300 to 1700 Monday }"}}}) {
    // clang-format on
    Dev dev;
    Job job;
    for (const Entry& e : entries) {
      // The parser keeps only entries whose day words are days.
      const char *first = Schedule_get_day(e.first), *last = Schedule_get_day(e.last);
      if (first == nullptr || last == nullptr) continue;
      Schedule_dev_lock(&dev, e.start, e.end, first, last);
      Schedule_job_runs(&job, e.start, e.end, first, last);
    }
    int set = RJ_WEEK_SCAN - std::count(dev.locks, dev.locks + RJ_WEEK_SCAN, 0);
    EXPECT_EQ(std::tuple(set, dev.locks[RJ_WEEK], blocks_of(dev.locks), blocks_of(job.runs)),
              std::tuple(slots_set, 0, blocks, blocks))
        << entries[0].start << " " << entries[0].first;
  }
}

TEST_F(ScheduleTest, ClockPosition) {
  for (auto [day, hour, minute, index, fraction] :
       {std::tuple{1, 8, 45, 65, 65.5f}, {6, 23, 59, 335, 335.9667f}, {0, 0, 0, 0, 0.0f}}) {
    at(day, hour, minute);
    EXPECT_EQ(get_current_schedule_index(), index);
    EXPECT_NEAR(last_float_time_index, fraction, 1e-3) << index;
  }

  // A clock beyond what localtime can express gives no weekday: no position,
  // the last fraction kept, and a resource locked all week counts as unlocked.
  Schedule_dev_lock(Dev_new(nullptr, nullptr, "d", 1), 0, 2400, "sunday", "saturday");
  last_float_time_index = 12.0f;
  fake_now = static_cast<time_t>(1) << 62;
  EXPECT_EQ((std::tuple{get_current_schedule_index(), last_float_time_index,
                        Dev_schedule_check("testhost")}),
            std::tuple(-1, 12.0f, -1));
}

TEST_F(ScheduleTest, JobRunStates) {
  Job* job = Job_new(nullptr, nullptr, "j", 1);
  Schedule_job_runs(job, 800, 1200, "monday", "monday");
  at(1, 9, 0);
  const int expected[] = {0, 1, 2, 2, 2};  // unset, paused, available, schedule (in), now
  for (int state = RUN_UNSET; state <= RUN_NOW; state++)
    EXPECT_EQ((job->ctrl = state, Job_available(job)), expected[state]) << state;
  at(1, 12, 0);
  for (int ctrl : {int(RUN_SCHEDULE), 9}) EXPECT_EQ((job->ctrl = ctrl, Job_schedule_check(job)), 0);
}

// Where a resource's lock state and grid put this host in the week and how
// long it sleeps: to the week's boundary (less the float rounding of 23:10),
// the next half hour, the clear week's end, or not at all (AVAILABLE never is).
TEST_F(ScheduleTest, LockedResourcesWakeWhereTheirLockEnds) {
  const std::vector<Entry> night = {{2200, 2400, "saturday", "saturday"},
                                    {0, 600, "sunday", "sunday"}};
  const std::vector<Entry> week = {{0, 2400, "sunday", "saturday"}};
  const std::tuple<int, std::vector<Entry>, int, int, int, std::pair<int, int>> rows[] = {
      {LOCK_SCHEDULE, night, 6, 23, 10, {334, 2999}},
      {LOCK_SCHEDULE, night, 0, 0, 0, {0, 6 * 3600}},
      {LOCK_SCHEDULE, night, 0, 6, 0, {-1, 0}},
      {LOCK_LOCKED, {}, 2, 14, 0, {2 * 48 + 28, 1800}},
      {LOCK_SCHEDULE, week, 2, 14, 0, {2 * 48 + 28, (336 - 2 * 48 - 28) * 1800}},
      {LOCK_AVAILABLE, week, 2, 14, 0, {-1, 0}}};
  for (const auto& [status, locks, day, hour, minute, wakes] : rows) {
    Dev* dev = Dev_new(nullptr, nullptr, "d", 1);
    dev->status = status;
    for (const Entry& e : locks) Schedule_dev_lock(dev, e.start, e.end, e.first, e.last);
    at(day, hour, minute);
    EXPECT_EQ(check(), wakes) << status << " " << locks.size() << " at " << day << " " << hour;
    EXPECT_EQ(Dev_schedule_check("otherhost"), -1);
    Dev_del(dev);
  }
}

TEST_F(ScheduleTest, TwoResourcesForOneHost) {
  Dev *a = Dev_new(nullptr, nullptr, "A", 1), *b = Dev_new(nullptr, nullptr, "B", 2);
  Schedule_dev_lock(a, 800, 1200, "monday", "monday");
  Schedule_dev_lock(b, 1200, 1400, "monday", "monday");

  at(1, 9, 0);
  EXPECT_EQ(check(), std::pair(66, 5 * 3600));
  // With B first, the scan stops at B's clear slot before A is looked at,
  // and stops short at noon; the check at noon finds B locked.
  Dev_del(b);
  b = Insert_a_dev(a, nullptr, "B", 2);
  Schedule_dev_lock(b, 1200, 1400, "monday", "monday");
  EXPECT_EQ(check(), std::pair(66, 3 * 3600));
  at(1, 12, 0);
  EXPECT_EQ(check(), std::pair(72, 2 * 3600));
}
