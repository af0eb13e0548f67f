/// The render queue: records, the process-wide control block and the
/// operations shared by the render daemon, the queue editors and the tools.
///
/// Everything lives in one shared control directory of plain-text files:
/// jobs (Render_Job_Control), render hosts or "resources"
/// (Render_Resource_Control), the tasks the jobs are cut into (Render_Tasks),
/// lock directories, per-host pid files.  Every read-modify-write of a shared
/// file happens under that file's lock directory (lock_fileop).
///
/// Records hang from the control block `rndctl` in doubly linked lists; the
/// list order is part of the behaviour (writers print in list order, lookups
/// return the first match).  List links and the back pointers between records
/// are non-owning raw pointers: the lists own their records, and each record
/// is freed only by its delete operation (Job_del, Dev_del, TASK_free, ...).
///
/// Return codes, never exceptions: 1/0, a count, or a pointer/null.  None of
/// these functions is safe inside a signal handler except where noted; the
/// daemon runs its handler only inside its one wait (RJ_pause), so the
/// handler never interrupts work on these structures.
#pragma once

#include <sys/types.h>

#include <csignal>
#include <cstdint>
#include <cstdio>
#include <ctime>
#include <functional>
#include <string>
#include <unordered_map>
#include <vector>

#include "Utility/rndctl/rj_text.h"

struct Job;
struct Dev;
struct TASK;
struct TaskGroup;
struct TaskRec;
struct RndDevList;
struct RndJobList;
struct RndPathList;

// ---------------------------------------------------------------------------
// Week grids: 336 half hours, index = day * 48 + slot, day 0 = Sunday.  One
// more always-clear entry stands for the week's end (position 336), which the
// next-available-time scans visit.
constexpr int RJ_WEEK = 336;
constexpr int RJ_WEEK_SCAN = 337;

// Job run states (Job_get_runstate) and resource lock states (Dev_get_lockstate).
enum { RUN_UNSET = 0, RUN_PAUSED = 1, RUN_AVAILABLE = 2, RUN_SCHEDULE = 3, RUN_NOW = 4 };
enum { LOCK_UNSET = 0, LOCK_LOCKED = 1, LOCK_AVAILABLE = 2, LOCK_SCHEDULE = 3 };

// Task status codes: the index into task_status_table.
enum {
  TASK_PENDING = 0,
  TASK_CRASHED = 1,
  TASK_RUNNING = 2,
  TASK_FINISHED = 3,
  TASK_ABORTED = 4,
  TASK_FAILED = 5,
  TASK_STARTED = 6,
  TASK_STOPPED = 7
};

// The shared files, by index into control_names.
enum {
  FILE_JOBS = 0,
  FILE_RESOURCES = 1,
  FILE_TASKS = 2,
  FILE_EDITPIDS = 3,
  FILE_DEV_INDEX = 4,
  FILE_JOB_INDEX = 5,
  FILE_ACCESS = 6,
  FILE_STATUS = 7,
  FILE_COUNT = 8
};

/// First-match lookup table for a record list: for each key, the first record
/// in list order and how many records of the list share the key.  Kept up to
/// date by the list operations of the record kind (rj_job, rj_dev); swapped
/// together with the list head when a list is set aside (Update_from_demon).
template <class T, class Key>
struct RecordIndex {
  struct Slot {
    T* first = nullptr;  // non-owning
    int count = 0;
  };
  std::unordered_map<Key, Slot> slots;
};

// ---------------------------------------------------------------------------
// Job record (rj_job).  Strings are owned Texts; links are non-owning.
struct Job {
  Job* next = nullptr;
  Job* prev = nullptr;
  int pick_level = 0;
  void* listitem = nullptr;  // editor's list entry; non-owning
  int index = 0;
  Text name;
  Text status;
  int priority = 0;
  Text sdl;
  int use_sdl_paths = 1;
  int output_mask = 0;
  Text pix;
  Text matte;
  int animate = 0;
  float frames[3] = {0.0f, 0.0f, 0.0f};  // start, end, by
  int fields = 0;
  int extension = 0;  // flag word; the reader stores 291
  int ext_start = 0;
  int ext_by = 1;
  int ext_size = 1;
  int totalframes = 1;
  int doneframes = 0;
  int further[4] = {0, 0, 0, 0};
  Text comment;
  Text executable;
  Text rnd_opts;
  Text further_text;
  Text user;
  RndDevList* resources = nullptr;    // owned pick list
  RndPathList* searchpath = nullptr;  // owned path list
  // Last entries of the two lists, so that an append does not walk the list
  // (a job may have hundreds of thousands of search paths); kept by rj_lst.
  RndDevList* resources_tail = nullptr;    // non-owning
  RndPathList* searchpath_tail = nullptr;  // non-owning
  int lock_pid = 0;
  int deleted = 0;  // deletion mark: the next write of the job file drops it
  int del_when_done = 0;
  int save_out = 0;
  int ctrl = RUN_AVAILABLE;
  int runs[RJ_WEEK_SCAN] = {};
};

// Resource ("dev") record: one render host as the queue sees it (rj_dev).
struct Dev {
  Dev* next = nullptr;
  Dev* prev = nullptr;
  int index = 0;
  Text name;
  Text host_name;
  Text comment;
  Text remote_location;
  int status = LOCK_SCHEDULE;
  void* listitem = nullptr;  // editor's list entry; non-owning
  int word1 = 0;
  int max_frames = 4;
  int num_processors = 0;
  int locks[RJ_WEEK_SCAN] = {};
  int words[2] = {0, 0};
  int lock_pid = 0;
  int word2 = 0;
  int default_dev = 0;
  RndJobList* jobs = nullptr;       // owned mirror of the jobs' pick lists
  RndJobList* jobs_tail = nullptr;  // its last entry, kept by rj_lst; non-owning
  TASK* last_task = nullptr;        // last task started on it; non-owning
};

// Pick lists (rj_lst).
struct RndDevList {  // hangs from a job: a resource the job may use
  RndDevList* next = nullptr;
  RndDevList* prev = nullptr;
  Dev* dev = nullptr;  // non-owning
  int picked = 0;
  RndJobList* mirror = nullptr;  // the matching entry of dev->jobs; non-owning
};
struct RndJobList {  // hangs from a resource: a job that names it
  RndJobList* next = nullptr;
  RndJobList* prev = nullptr;
  Job* job = nullptr;  // non-owning
  int picked = 0;
  RndDevList* mirror = nullptr;  // non-owning
};
struct RndPathList {  // hangs from a job: one image search path
  RndPathList* next = nullptr;
  RndPathList* prev = nullptr;
  Text path;
};

// ---------------------------------------------------------------------------
// Tasks (rj_tskio, rj_task).
struct TaskGroup {
  TaskGroup* next = nullptr;
  Job* job = nullptr;        // non-owning
  TaskRec* tasks = nullptr;  // records in creation order
  int next_task_id = 0;
};

struct TaskRec {
  TaskRec* next = nullptr;
  TaskGroup* group = nullptr;  // owning group, or null once the group is gone
  TASK* task = nullptr;        // running-task entry that owns it; non-owning
  float start = 0.0f;
  float end = 0.0f;
  float current = 0.0f;
  int status = TASK_PENDING;
  int retries = 0;
  int id = 0;
  int keep = 0;  // 1: the group's release frees it; 2: the next release only clears the mark
  Text output;
  Dev* dev = nullptr;  // non-owning
};

/// Running-task entry: links a task record to the process that renders it.
struct TASK {
  TASK* next = nullptr;
  TASK* prev = nullptr;
  TaskRec* rec = nullptr;       // owned once the entry has taken it over
  Job* job = nullptr;           // non-owning; null when the job left the file
  volatile int pid = 0;         // written by the SIGCHLD handler
  volatile int waitstatus = 0;  // exit value, written by the SIGCHLD handler
  FILE* stream = nullptr;       // owned: the task's log stream, open for reading
  Text out_path;
  Text stream_path;
  Text output;
  float progress = 0.0f;
  int work = 0;
  int stale = 0;
  // This daemon took the record (wrote it STARTED) to render it here.  Only
  // such an entry's record is this host's to write, and only its reaped exit
  // is judged; an entry made from the file for a record that names this host
  // (left by an earlier daemon) never is.
  int taken = 0;
  int killed = 0;        // its job left the file and its render was killed; freed once reaped
  int seen_next_id = 0;  // the highest next_task_id seen of its group
  int rebuilt = 0;       // its group was found built again: dropped at the next safe point
};

// ---------------------------------------------------------------------------
/// The control block: the one process-wide record every part reads.
struct RndCtl {
  Job* current_job = nullptr;  // non-owning
  Job* jobs = nullptr;         // owned list
  Dev* current_dev = nullptr;  // non-owning
  Dev* devs = nullptr;         // owned list
  TASK* tasks = nullptr;       // owned list of running-task entries
  Text location;               // the control directory
  Text user;
  Text host;
  int64_t last_update = 0;  // host update time (ns) as of the last reconciling reload
  int pid = 0;
  volatile int running = 0;  // render children started and not yet reaped
  unsigned interval_min = 0;
  unsigned interval_sec = 0;
  volatile int signal_seen = 0;
  int editors = 0;
  int single_pass = 0;
  Text install;
  int out_counter = 0;     // names the render output files
  int stream_counter = 0;  // names the task log streams
  RecordIndex<Job, int> job_index;
  RecordIndex<Dev, int> dev_index;
  RecordIndex<Dev, std::string> dev_name_index;  // names as set by Dev_new/Dev_set_name
};

extern RndCtl rndctl;

// ---------------------------------------------------------------------------
// Diagnostics and process identity (rj_rndctl).
extern int debug;          // gates dbgpnt; any non-zero level acts as 1
extern int debug_fileacc;  // gates dbg_logfile
extern const char* PrgName;
extern char* ProgramName;
extern char ApplModeName[64];

void dbgpnt(const char* format, ...) __attribute__((format(printf, 1, 2)));
void EDuprintf(const char* format, ...) __attribute__((format(printf, 1, 2)));
void wrt_logfile(const char* format, ...) __attribute__((format(printf, 1, 2)));
void dbg_logfile(const char* format, ...) __attribute__((format(printf, 1, 2)));

/// The clock of the whole queue.  Tests replace `rj_clock`.
extern time_t (*rj_clock)();
time_t rj_now();

/// The temporary directory: DRCTMPDIR, else "/usr/tmp" when it exists, else "/var/tmp".
const char* rj_tmpdir();

/// Whether a resource stands for `host`: its host_name names it.  A resource
/// name is only a label (one host may offer several resources, "fast1" on
/// host "hostA"); every "is this task / job / resource ours" question asks
/// this, never the resource name.  Null resource or host: false.
bool rj_dev_on_host(const Dev* dev, const char* host);
/// rj_dev_on_host(dev, this host's name).
bool rj_dev_is_this_host(const Dev* dev);
/// Writes all of `text` to `fd`, retrying after signals; gives up silently on
/// an error (the callers have nowhere to report it).  Safe between fork and
/// exec and in a signal handler.
void rj_write_all(int fd, const char* text, size_t length);
/// Work of `job` appeared (put back, cut off, created): touches the pid file
/// of every other host in the job's host list, once each, so that an idle
/// daemon there takes it without waiting for its check interval.
void Job_wake_other_hosts(const Job* job);

void RJC_init_rndctl(const char* location);
/// Sets the check interval to `minutes`:`seconds` and returns 1, or refuses
/// a value the service loop cannot wait for (either part negative, seconds
/// above 59, a total beyond an int of seconds) and returns 0, keeping the
/// interval in force.  A refusal is reported on stderr (the daemon's log)
/// once per distinct bad value, naming `from` (a file name, "-u"), so that a
/// bad header reread at every reload does not fill the log.  0:00 is valid:
/// no timed pass.
[[nodiscard]] int RJC_set_check_interval(long minutes, long seconds, const char* from);
int64_t daemon_updatetime_set(const char* host);
int64_t daemon_updatetime_get(const char* host);
int64_t editor_updatetime_get();
long IS_enough_disk();
extern long min_disk_space;

// Editor stubs: the daemon shares code with the editors.
int is_editor();
void sounder(int code);
void IR_repoint_editor_list();
void IR_rebuild_rndctl();
void Update_control_and_editors(void* what);

// ---------------------------------------------------------------------------
// Locked file operations (rj_fileio, rj_lockdir).
//
// Mutual exclusion and atomic rewrites of the shared files.  Every shared
// file has a fixed index (FILE_JOBS ...) and a lock directory "NAME.lock"
// beside it that holds one holder file, named after the holder's host and
// containing "%d\n" with its pid.
//
// Calling order, always:
//   lock_fileop(i, 1)                     waits until the lock is this process's
//   read_fileop(i) | update_fileop(i)     stream, or null (reported)
//   ... read; for a rewrite rewind_fileop(i) and write from the start ...
//   close_fileop(i) | close_and_truncate_fileop(i)   0, or -1 (reported)
//   lock_fileop(i, 0)                     releases, only when it is ours
// New code uses FileopLock and fileop_rewrite below instead.
//
// A rewrite never shows half done: an update stream reads the file as it
// was, keeps what is written to it in memory, and close_and_truncate_fileop
// (or fileop_rewrite) puts the new contents in a temporary file beside the
// old one ("NAME.new.XXXXXX"), forces it to disk and renames it over the old
// one; a reader sees the old file or the new one.  When the new contents
// equal the old, nothing is written and the file keeps its inode and times.
//
// What a crash leaves behind: during a rewrite at most the temporary file,
// which nobody reads (the old file stands); while holding a lock, the lock
// directory: this host's next waiter breaks it at once (its holder pid is
// dead), other hosts when it is 181 s old.  A lock is made aside
// ("NAME.lock.HOST.PID.N") with its holder file and renamed into place, so
// no lock directory of ours ever stands without its holder; a process
// killed while waiting leaves its aside directory, which nobody reads.
//
// Nothing here is safe inside a signal handler.
extern const char* const control_names[FILE_COUNT];
int init_fileop();
/// take non-zero: waits (backing off, see fileop_poll_seconds) until the lock
/// of file `index` is taken, breaking it when its holder is gone; returns 1.
/// take zero: releases it when this process holds it (its holder file names
/// this host and this pid) and leaves anyone else's alone; returns 1.
/// 0 only for a bad index or when the paths cannot be built.
int lock_fileop(int index, int take);
/// Opens file `index` for reading, creating it empty when absent.
FILE* read_fileop(int index);
/// Opens file `index` for a rewrite (creating it empty when absent): reads
/// give the file as it was; writes go to the new contents, from the start of
/// the file (right after the open or after rewind_fileop).  The stream has
/// no descriptor (fileno is -1).
FILE* update_fileop(int index);
/// Rewinds the open stream: an update stream then writes from the start.
void rewind_fileop(int index);
/// Closes the stream; an update stream that was written keeps the old bytes
/// past the written ones (nothing is cut).  0 ok, -1 failed and reported.
[[nodiscard]] int close_fileop(int index);
/// Closes the stream; the new contents of an update stream end at the
/// stream's position and replace the file atomically (see above); a stream
/// that was neither rewound nor written is closed without a rewrite.  0 ok (also when
/// nothing changed), -1 when the rewrite failed: the old file stands, the
/// temporary is gone, and the path with the system's reason was reported to
/// the user and the trace.
[[nodiscard]] int close_and_truncate_fileop(int index);
mode_t get_original_umask();
/// The path of shared file `index` ("%s/%s"), building the table when needed.
const char* fileop_path(int index);
/// The path of the lock directory of file `index` ("%s/%s.lock"), likewise.
const char* fileop_lock_path(int index);
/// The access log stream opened by init_fileop, or null.
FILE* fileop_access_stream();
/// Closes the access log and forgets every path, so that the next lock or
/// open builds the table again (a process that changes control directory).
void fileop_reset();
/// The longest pause, in seconds, between two attempts at a busy lock (5).
/// A waiter retries after a few milliseconds, then after growing, jittered
/// pauses up to this.  0: no pauses at all (tests); editors never pause.
extern unsigned fileop_poll_seconds;
/// Pauses the waiter for `ns` nanoseconds (nanosleep); tests replace it.
extern void (*fileop_sleep)(int64_t ns);
/// A monotonic clock in nanoseconds for pauses and hold times; tests replace it.
extern int64_t (*fileop_monotonic_ns)();
/// The file server's clock, against which lock ages are judged: the
/// modification time of ".clock.HOST" in the control directory, touched at
/// most once a second and carried forward on the monotonic clock in
/// between (rj_now() when it cannot be touched).  Tests replace it.
extern time_t (*fileop_server_clock)();
/// One look at a busy lock directory: when its access time is 181 seconds
/// old or older by the server clock, takes it away (a rename, so only one
/// waiter wins), removes it with its holder file, reports the break on
/// stderr and in the access log, and returns 1; otherwise 0.
int fileop_break_stale_lock(const char* lock_path);
/// Releases every lock this process holds, and no other.  For fatal paths
/// (a syntax error ends the daemon): the other hosts go on at once.
void fileop_release_held_locks();
/// How long the lock of one file was held by this process, for benchmarks.
struct FileopHoldStats {
  long count = 0;  // releases of a held lock
  int64_t longest_ns = 0;
  int64_t total_ns = 0;
};
FileopHoldStats fileop_hold_stats(int index);

/// Holds the lock of one shared file for the life of the object: the
/// constructor waits for it (lock_fileop(index, 1)), the destructor releases
/// it on every way out of the scope.
class FileopLock {
 public:
  explicit FileopLock(int index) : index_(index), held_(lock_fileop(index, 1) == 1) {}
  ~FileopLock() {
    if (held_) lock_fileop(index_, 0);
  }
  FileopLock(const FileopLock&) = delete;
  FileopLock& operator=(const FileopLock&) = delete;
  [[nodiscard]] bool held() const { return held_; }

 private:
  int index_;
  bool held_;
};

/// Rewrites file `index` under its lock in one call: takes the lock, opens
/// the file (empty when absent) as `in`, lets `change(in, out)` write the
/// new contents to `out` (a memory stream), writes them aside and renames
/// them over the file, releases the lock.  `change` returns false when
/// there is nothing to change.  Returns 1 written, 0 nothing to change
/// (`change` said so, or wrote the same bytes: the file is not touched),
/// -1 failed (reported; the old file stands).
[[nodiscard]] int fileop_rewrite(int index, bool (*change)(FILE* in, FILE* out, void* context),
                                 void* context);
template <class Change>
[[nodiscard]] int fileop_rewrite(int index, Change change) {
  return fileop_rewrite(
      index,
      [](FILE* in, FILE* out, void* context) -> bool {
        return (*static_cast<Change*>(context))(in, out);
      },
      &change);
}

// Editor registry (rj_editreg).
void Editor_process_list(int mode);
int Editor_process_validate(int pid);
const char* Editor_process_getuser(int pid);

// Reload and write-back (rj_reload).
int RJC_reload(int flag);
int RRC_reload(int flag);
void Job_control_write(const char* dir);
void Resource_control_write(const char* dir);
int RJC_parse();
int get_fvalue(const char* text, float* value);
void Update_from_demon(int editor);
int RJC_in();
void RJC_out();

// Signals and child tracking (rj_signal).
extern volatile int last_signal;
void sig_handler(int sig);
int RJ_signal(const char* host, int pid, int sig);
const char* RGget_sig_desc(int sig);
int RJ_sighold(int sig);
int RJ_sigrelse(int sig);
int RJ_sigignore(int sig);
int RJ_sigset(int sig, void (*handler)(int));
unsigned RJ_alarm(unsigned seconds);
int RJ_pause();
/// Like RJ_pause, but gives up after `ms` milliseconds: 1 when a signal was
/// handled, 0 when the time ran out.
int RJ_pause_for(long ms);
int RJ_wait(int* status);

// ---------------------------------------------------------------------------
// Control-file language (RJClex.l, RJCgram.y, rj_write).
extern FILE* RJCin;
extern FILE* RJCout;
extern const char* RJCreadfile;
extern const char* RJCpath;
extern int RJCcurrent_lineno;
extern int RJClineno;
int RJCparse();
int RJClex();
int RJCwrap();
void RJCerror(const char* message);
void RJClexerror(const char* text);
/// How a syntax or lexical error ends the process; tests replace it.
extern void (*RJC_fatal_exit)(int status);
/// Parses a control file held in memory (for tests and fuzzers).
int RJC_parse_string(const char* text, size_t length, const char* file_name);
void Job_control_write_dev(FILE* fp);
void Resource_control_write_dev(FILE* fp);

/// The text forms of the control files (rj_write).  Every text a daemon or
/// editor writes into a control file goes through these, so that whatever a
/// record holds, the file reads back: the reader has no escapes, so what it
/// cannot read is dropped or broken up rather than escaped.  Each *_form
/// function returns exactly what the reader gives back for the text written.
enum { RJC_JOB_SECTION = 1, RJC_RESOURCE_SECTION = 2 };
/// Longest quoted string the reader takes.
constexpr size_t RJC_STRING_LIMIT = 1023;
/// True when `text` lexes back, in that file's section, as one word token:
/// word characters only, starting with a letter, digit, point or underscore,
/// no number, no keyword of the section.
bool RJC_is_word(const char* text, int section);
/// A quoted string: without its '"' characters, cut at RJC_STRING_LIMIT.
std::string RJC_string_form(const char* text);
/// A comment: every "*/" inside broken to "* /".
std::string RJC_comment_form(const char* text);
/// A name (user, executable, host, resource or block name), written bare
/// when it is a word and quoted otherwise: the text itself when it is a
/// word, else its string form.  The same in both sections.
std::string RJC_name_form(const char* text);
/// A job name in the task and status files, which read it back with "%s":
/// blanks and control characters become '_', an empty name "-".
std::string RJC_label_form(const char* text);
/// Whether RJC_label_form would change `text` (the common case is no).
bool RJC_label_needs_form(const char* text);

// ---------------------------------------------------------------------------
// Job records (rj_job).
Job* Job_new(Job* before, void* listitem, const char* path, int index);
Job* Add_a_job(void* listitem, const char* path, int index);
Job* Insert_a_job(Job* before, void* listitem, const char* path, int index);
Job* Job_by_listitem(void* item);
Job* Job_by_name(const char* name);
Job* Job_by_index(int index);
int ISA_resource_usedby(Job* job, Dev* dev);
int get_job_pick_level(Job* job);
void reorder_picklevels();
Job* Job_del(Job* job);
int Job_get_runstate(const char* word);
int Job_available(Job* job);
void setcurrent_job(Job* job);
Job* Job_clone(Job* job);
void Job_Error_Update(TASK* entry);  // rj_joberr

// Resource records (rj_dev) and pick lists (rj_lst).
Dev* Dev_new(Dev* before, void* listitem, const char* name, int index);
Dev* Add_a_dev(void* listitem, const char* name, int index);
Dev* Insert_a_dev(Dev* before, void* listitem, const char* name, int index);
Dev* Dev_by_name(const char* name);
Dev* Dev_by_index(int index);
Dev* dev_by_listitem(void* item);
Dev* Dev_del(Dev* dev);
int Dev_get_lockstate(const char* word);
void Dev_field_check();
void reset_autoadd_dev();
void setcurrent_dev(Dev* dev);
/// Renames a resource; renames must go through here so Dev_by_name stays right.
void Dev_set_name(Dev* dev, const char* name);
int Dev_processes_available(Dev* dev);  // rj_select

RndDevList* RndDevList_add(Job* job, Dev* dev);
Dev* RndDevList_del(Job* job, Dev* dev);
void RndDevList_pick(Job* job, Dev* dev);
Dev* RndDevList_picked(Job* job);
RndJobList* RndJobList_add(Dev* dev, Job* job, RndDevList* mirror);
Job* RndJobList_del(Dev* dev, Job* job);
void RndJobList_pick(Dev* dev, Job* job);
Job* RndJobList_picked(Dev* dev);
RndPathList* RndPathList_add(Job* job, const char* path);
void RndPathList_del(Job* job, const char* path);

// Job validation and comparison (rj_jobcheck).
int RJCget_next_index(int file_id);
char* get_strstr(const char* key, char* line);
int Job_check_sdlfields(Job* job);
int Job_set_frame_range(Job* job);
int Calc_frame_range(float start, float end, float step);
int Job_check_sdl(Job* job);
int rj_strcmp(const char* a, const char* b);
void Job_field_check();
int Job_file_search(const char* host);
int ISA_devdif(Dev* a, Dev* b);
int ISA_jobdif(Job* a, Job* b);

// Weekly schedules (rj_schedule).
extern const char* const day_table[7];
extern const char* const day_nametable[7][4];
extern const char* const time_table[48];
extern float last_float_time_index;
const char* Schedule_get_day(const char* name);
void Schedule_job_runs(Job* job, int start, int end, const char* first_day, const char* last_day);
void Schedule_dev_lock(Dev* dev, int start, int end, const char* first_day, const char* last_day);
int Schedule_get_a_block(int* grid, int times[2], const char* days[2]);
int set_in_betweens(int* grid, const int a[2], const int b[2], int mode);
int get_abbreviated_day_index(const char* abbr);
int get_current_schedule_index();
int Job_schedule_check(Job* job);
int Dev_schedule_check(const char* host);
int get_next_available_time(const char* host, int index);
int job_get_next_available_time(Job* job, int index);

// ---------------------------------------------------------------------------
// Task groups, records and the task file (rj_tskio); running-task entries (rj_task).
extern const char* const task_status_table[];
const char* GetTaskStatusStr(int code);
int ISA_task_status(const char* text, int* code);
TaskGroup* TaskGroup_alloc(Job* job, int next_task_id);
TaskRec* TaskRec_alloc(TaskGroup* group, float start, float end, float current, Dev* dev,
                       int status, const char* status_text, int id);
/// The records Task_read makes share larger blocks.  For the record at *link
/// (a link of a group's list) that is one of them, puts a copy in a heap
/// block of its own in its place (an entry that owns it owns the copy) and
/// returns the copy; any other record is returned as it is.  For a record
/// that an entry is to keep beyond the cycle that read it.
TaskRec* TaskRec_unpool(TaskRec** link);
void TaskRec_free(TaskRec* rec);
void TaskRec_freeOnly(TaskRec* rec);
void TaskGroup_free(TaskGroup** list, TaskGroup* group);
/// Frees every group of a list and every record still owned by a group.
void TaskGroup_free_all(TaskGroup** list);
int TaskGroup_find(TaskGroup* group, const char* host);
int Task_find(TaskGroup* groups, const char* host);
TaskGroup* TaskGroup_by_job(TaskGroup* groups, Job* job);
TASK* Task_add(Job* job, TaskRec* rec);
void TASK_free(TASK* entry);
TASK* Task_by_pid(int pid);  // safe in the SIGCHLD handler (a list walk)

/// Who may write a record of Render_Tasks.  Another host or an editor may put
/// a record back (PENDING) or another host may take it while its owner here
/// is slow (waiting for a lock, stopped); a group may be cleared and built
/// again from id 0 (a restarted job).  So a file record is this host's to
/// write only while it names this host and shows a state this daemon wrote
/// and still owns: STARTED or RUNNING, or FAILED until this host puts it back.
/// `entry` is this host's entry for the record (null: none).
[[nodiscard]] bool Task_owns(const TASK* entry, const TaskRec* file_rec);
/// Whether an entry's record and a file record are one task: same id and the
/// same start frame (which never changes for an id within one life of a
/// group; a rebuilt group hands out the same ids again).
[[nodiscard]] bool Task_same_rec(const TaskRec* own, const TaskRec* file_rec);

/// What a cycle on Render_Tasks leaves to do once the file's lock is released:
/// kills of this host's renders and wake-ups of other hosts.
struct TaskAfterLock {
  std::vector<int> kills;
  std::vector<Job*> wakes;  // non-owning; each job once
  void kill(int pid);
  void wake(Job* job);
  /// Kills, then wakes.  Call only without the task file's lock.
  void run();
};

/// Settles this host's entry against the file record of the same task.
/// Ours (Task_owns): the file takes the entry's status and 1 is returned.
/// Otherwise nothing is written and 0 is returned; when the entry still held
/// the piece (it took it, and its own status is STARTED, RUNNING or FAILED)
/// the piece is lost: the entry takes the file's state, gives up the piece
/// (its render is to be killed, its exit is not judged, its stream goes), and
/// when the file shows the piece PENDING the job's other hosts are to be woken.
int Task_settle(TASK* entry, TaskRec* file_rec, TaskAfterLock* after);
/// Gives up the piece an entry rendered: its render (if any) is killed (at
/// once when `after` is null), its pid becomes 0 so that the reaped exit finds
/// no entry and is not judged, its stream and output files are removed.
void Task_let_go(TASK* entry, TaskAfterLock* after);
/// Closes an entry's log stream and removes its file: the render program is
/// gone or about to be, and nobody reads the stream any more.
void Task_drop_stream(TASK* entry);

/// Lives of a task group.  This host's entries of a job remember the highest
/// next_task_id seen of its group.  A group is a new life when it vanished from the
/// file, when its next_task_id went below what this host saw, or when one of
/// its ids names another start frame than this host's entry of that id.
/// Task_group_rebuilt answers for `job` against the groups read from the file
/// (`group` is the job's group there or null); Task_note_group records what
/// was seen.  Every entry of a job of another life is dropped with
/// Task_retire_job; where entries cannot be freed at once (a caller walks
/// the list) Task_mark_rebuilt marks its entries and Task_retire_marked, at a
/// point where nobody walks the list, drops them.
[[nodiscard]] bool Task_group_rebuilt(const Job* job, const TaskGroup* group);
/// The highest next_task_id this host's entries of `job` have seen (0: none).
int Task_seen_next_id(const Job* job);
void Task_note_group(const Job* job, const TaskGroup* group);
void Task_retire_job(const Job* job, TaskAfterLock* after);
void Task_mark_rebuilt(const Job* job);
/// Returns the number of entries dropped.
int Task_retire_marked();
/// Reads the task file (under its lock) and drops every entry of those of
/// `jobs` whose group there was rebuilt or is gone; returns how many entries
/// went.  For a suspicion the daemon cannot settle from its own lists.
int Task_retire_rebuilt(const std::vector<Job*>& jobs);
TaskGroup* Task_read(FILE* fp);
TaskGroup* TaskGroup_read(FILE* fp);
int Task_write(FILE* fp, TaskGroup* groups);
int TaskGroup_write(FILE* fp, TaskGroup* group);
int Task_write_dump(TaskGroup* groups);
int TaskGroup_write_dump(TaskGroup* group);
void Task_file_dump();
int Task_file_search(const char* host);
void Task_file_update(Job* job);
int Task_file_check(Job* job);
/// The one locked read-modify-write of the task file: takes its lock, reads
/// the groups, hands them to `change` (which may add, cut and free records
/// and groups), and when it returns true writes them back (aside, then
/// renamed in); releases the lock and frees the groups on every way out.
/// Returns 1 written, 0 left alone, -1 when the file could not be opened or
/// written (reported; the old file stands).
int Task_file_rewrite(const std::function<bool(TaskGroup** groups)>& change);
void Editor_load_Tasks();
void Task_update_status();
void Task_sfile_dump(Dev* dev);
char* Task_current_filenames(Job* job, Dev* dev);

// Task selection and splitting (rj_select).
TASK* GetaPendingTask();
TASK* Get_a_task();
TASK* Task_get();
void insert_unknown_pending_jobs(TaskGroup** groups);
TaskRec* insert_task(TaskGroup** groups, Job* job, float start, float end, int status);
TaskRec* extract_pending_task(TaskGroup** groups);
TaskGroup* get_highest_taskgroup(TaskGroup* groups, int mode);
TaskRec* check_for_pending_tasks(TaskGroup* group);
int isa_job_using_host(const char* host, Job* job);
TASK* match_a_taskrec(TaskRec* rec);
void split_a_task(TaskGroup* group, TaskRec* rec);
TaskRec* Split_first_splittable_failed_tasks();
TaskRec* Task_split_and_insert(TaskRec* rec);
void Walk_rndctl_tasks(const char* label);
void Check_for_same_task(TASK* entry);
void Check_RndTasks(const char* label);

// Running a task (rj_perform).
int Perform_a_Task(TASK* entry);
int rj_system(char* const argv[], const char* stream_path, const char* out_path, Job* job);
int rj_splitpath(const char* path, char** base, char** dir, const char* last);
void rj_set_paths(Job* job, char** path, char** root);
int get_task_frame_range(TASK* entry, int* first_extension);
int get_current_frame_extension(Job* job, Dev* dev, int* extension);
void Job_Log_out(Job* job);
FILE* Logfile_open(Job* job);
FILE* Logfile_open_nr(Job* job);
void daemon_kill_running_tasks(const char* host);
/// The one kill of a render: sends `sig` to the process group that the
/// render program `pid` leads on this host (so its own children go too).
/// For another host nothing is sent (RJ_signal traces it) and 0 is returned;
/// a pid below 2 is no render and returns 0.  Otherwise kill's result.
int rj_kill_render(const char* host, int pid, int sig);

// Task status, job state and progress (rj_status).
int SetTaskStatus(TASK* entry, int status);
int ISA_task_running(TASK* entry);
int ISA_task_active(TASK* entry);
int UpdateRunningTasks();
int VerifyRunningTasks();
int set_image_percentage_done(TASK* entry);
void Job_clear_tasks(Job* job);
void UpdateJobState(Job* job);

// ---------------------------------------------------------------------------
// Taking back tasks whose render went away with its daemon (rj_reclaim).
//
// A daemon that is killed, loses its host for good or exits leaves records
// STARTED or RUNNING in Render_Tasks that nobody renders, and a STARTED record
// of a host holds one of its slots.  Such a record is put back the way a
// failed task is cut: the frames before `current` stay done, the rest is
// pending again.  `retries` is not counted up: the daemon failed, not the task.
//
// The daemon's calling order: Task_reclaim_this_host once at start-up, after
// the first load of the control files and before the first pass (only then
// does no process of this host render anything); rj_heartbeat at every pass
// and every wake-up; Task_reclaim_dead_hosts from the service loop, about once
// a minute and never while holding another lock; Task_release_own_renders
// before a clean exit.  rj_system and the SIGCHLD handler keep the render
// registry up to date with rj_render_started / rj_render_ended.

/// Puts a held record of `group` (a group read from the task file) back.
/// With progress (start < current <= end) `rec` becomes FINISHED
/// start..current-by and a new PENDING record current..end with the group's
/// next id and the same retries is appended; it is returned.  Without
/// progress `rec` itself goes PENDING with its range and null is returned.
/// A record put back pending names no host, so no host is barred from it.
TaskRec* Task_put_back(TaskGroup** groups, TaskGroup* group, TaskRec* rec);

/// Start-up: ends every render of the registry that a dead predecessor left
/// running (rj_render_kill_leftovers), then puts back, in one locked cycle,
/// every STARTED or RUNNING record of this host and wakes the other hosts of
/// each job touched.  Returns the number of records put back.
int Task_reclaim_this_host();

/// Puts back every record held by another host whose heartbeat is older than
/// rj_host_timeout() seconds by the file server's clock `server_now` (from
/// rj_heartbeat) and whose daemon the daemon-alive test finds gone; one
/// access-log line per record.  A host without a heartbeat file is not
/// judged.  Returns the number of records put back.
int Task_reclaim_dead_hosts(time_t server_now);

/// Clean exit: kills the render process groups this daemon still runs and
/// puts their records back, unless the pid file already names another live
/// daemon (which took this host's records over when it started).  Returns
/// the number of renders killed.
int Task_release_own_renders();

/// The heartbeat: touches "%s/TSKSTAT/%s" (created empty when missing) to the
/// file server's time and returns its new modification time in seconds, or
/// 0 when it cannot be touched.
time_t rj_heartbeat();

/// How long a host's heartbeat may age, in seconds: the environment variable
/// ZARNO_RNDCTL_HOST_TIMEOUT, else that preference, else 600.
long rj_host_timeout();

/// Whether an update time `seen_ns` read by a reload may count as seen when
/// the file server's clock reads `server_now`: false while a whole-second
/// stamp (no nanoseconds) and the clock are still in the same second, since
/// a second touch in that second would leave the same stamp.
bool rj_update_time_settled(int64_t seen_ns, time_t server_now);

/// The render registry: pid and start time of every render program this
/// daemon runs, in "%s/zarno_render_demon.%s.renders" (rj_tmpdir(), host),
/// rewritten whole through a fresh name and a rename at every change.
/// rj_render_ended is safe in the SIGCHLD handler (no allocation, no stdio).
void rj_render_started(int pid);
void rj_render_ended(int pid);
/// Kills (SIGKILL to the process group) every render of the registry file
/// that still runs with the recorded start time, then starts an empty
/// registry.  A file that is not a regular file of this user, or that others
/// may write, is not believed.  Returns the number of renders killed.
int rj_render_kill_leftovers();
/// The registry's path (a static buffer).
const char* rj_render_registry_path();
