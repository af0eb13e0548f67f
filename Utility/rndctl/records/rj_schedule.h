/// Weekly schedules: the half-hour week grids of a job's run slots
/// (`Job::runs`, when its run state is SCHEDULE) and a resource's lock slots
/// (`Dev::locks`), filled from the control files' schedule entries, turned
/// back into blocks for writing, and checked against the local clock.
///
/// A grid has RJ_WEEK entries, index = day * 48 + half hour, day 0 =
/// Sunday; times are given as HHMM (1730), a day by any of its names in
/// day_nametable.  The scans for the next free time visit one more position,
/// the week's end, which is never set, so a host locked all week still
/// wakes at the week boundary.
///
/// Calling order for the clock: get_current_schedule_index (Dev_schedule_check
/// and Job_schedule_check call it) before get_next_available_time or
/// job_get_next_available_time, which measure from the time it read.
///
/// Control block: reads `devs` (a host's resources); writes none of its
/// fields.  The clock position read last is kept in last_float_time_index.
#pragma once

#include "Utility/rndctl/records/rj_records.h"

/// Day names as the writer prints them, Sunday first.
extern const char* const day_table[7];
/// Per day: the parser's canonical name ("monday"), its short form, the
/// written name and the clock's "%a" form ("Mon"); matching is exact.
extern const char* const day_nametable[7][4];
/// The writer's text for each half hour of a day: "Midnight", "0:30", ...
/// "Noon", ... "23:30".
extern const char* const time_table[48];
/// The clock position last read by get_current_schedule_index, in half hours
/// since Sunday midnight with the fraction of the half hour.
extern float last_float_time_index;
/// The canonical (parser) name of a day given by any of its names, or null
/// for a name that is not a day.
const char* Schedule_get_day(const char* name);
/// Sets the half hours from `start` up to `end` (HHMM) on every day from
/// `first_day` to `last_day` in the job's run grid (resp. the resource's
/// lock grid).  Nothing is set for an unknown day, a range over the week's
/// end or a span over midnight; a time past 2400 runs into the next day but
/// never past the week.  A null record: nothing.
void Schedule_job_runs(Job* job, int start, int end, const char* first_day, const char* last_day);
void Schedule_dev_lock(Dev* dev, int start, int end, const char* first_day, const char* last_day);
/// Takes the first block off `grid` (the grid is changed: pass a copy): the
/// longest span of half hours from the first set one, within one day, and
/// every following day that has the same span set.  Stores the span as HHMM
/// in `times` (end exclusive, 2400 for midnight) and the first and last day
/// (day_table names) in `days`.  Returns 1 for a block, 0 when the grid is
/// empty (`times` and `days` untouched).  The writer calls it until 0.
int Schedule_get_a_block(int* grid, int times[2], const char* days[2]);
/// Sets (`mode` 1) or clears (`mode` -1) every half hour of the rectangle
/// between corners `a` and `b`, each {half hour, day}; positions outside
/// the week are skipped, other modes change nothing.  Returns 1 when some
/// entry changed, 0 when none did or an argument is null.
int set_in_betweens(int* grid, const int a[2], const int b[2], int mode);
/// The day number of the clock's abbreviation ("Sun" 0 ... "Sat" 6), -1 for
/// anything else; an empty or null text gives 0 (Sunday).
int get_abbreviated_day_index(const char* abbr);
/// The current half hour of the week by the local clock (0 .. 335), and
/// sets last_float_time_index.  -1 when the clock cannot be read or its
/// weekday name is not an English abbreviation (another locale): then no
/// schedule applies.
int get_current_schedule_index();
/// Whether the job may run now by its run state: 2 yes (AVAILABLE, NOW, or
/// SCHEDULE inside a run slot), 1 PAUSED, 0 not now (SCHEDULE outside its
/// slots or with an unreadable clock, an unset state, a null job).
int Job_schedule_check(Job* job);
/// Whether `host` is locked now: the current schedule index (0 or more)
/// when one of its resources is LOCKED or SCHEDULE with the current half
/// hour set in its lock grid; -1 when it is free (every resource AVAILABLE
/// or outside its lock slots), has no resources, or `host` is null.  With
/// an unreadable clock a LOCKED resource also gives -1.
int Dev_schedule_check(const char* host);
/// Seconds from the clock position last read to the start of the first half
/// hour after `index` at which no resource of `host` has its lock slot set
/// (a null host: the next half hour); wraps into next week.  0 when the
/// host is locked all week (no wake-up to set).  Looks at the grids only,
/// not at a LOCKED state.
int get_next_available_time(const char* host, int index);
/// The same for the first half hour after `index` outside the job's run
/// slots (a null job: the next half hour); 0 when every slot is set.
int job_get_next_available_time(Job* job, int index);
