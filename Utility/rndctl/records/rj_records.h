/// The records of the queue: jobs, resources (render hosts) and the pick
/// lists that tie them together.  Strings are owned Texts; list links and
/// back pointers are non-owning raw pointers: a record list owns its
/// records, and each record is freed only by its delete operation (Job_del,
/// Dev_del).  The list order is part of the behaviour: writers print in list
/// order and lookups return the first match.
///
/// A record's `index` is its identity in the files (names are labels and
/// need not be unique); a freed record reads index -1 until its memory is
/// reused, so a stale pointer reads as dead.  `lock_pid` is the pid of the
/// editor that has the record open (0: nobody), a claim the field checks
/// drop when that editor is gone, not a file lock.
///
/// Control block: these are plain types; the lists hang from `rndctl.jobs`
/// and `rndctl.devs`, kept by rj_job and rj_dev.
#pragma once

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_text.h"

// ---------------------------------------------------------------------------
// Week grids: 336 half hours, index = day * 48 + slot, day 0 = Sunday.  One
// more always-clear entry stands for the week's end (position 336), which the
// next-available-time scans visit.
constexpr int RJ_WEEK = 336;
constexpr int RJ_WEEK_SCAN = 337;

// Job run states (Job_get_runstate) and resource lock states (Dev_get_lockstate).
enum { RUN_UNSET = 0, RUN_PAUSED = 1, RUN_AVAILABLE = 2, RUN_SCHEDULE = 3, RUN_NOW = 4 };
enum { LOCK_UNSET = 0, LOCK_LOCKED = 1, LOCK_AVAILABLE = 2, LOCK_SCHEDULE = 3 };

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
  int ctrl = RUN_AVAILABLE;     // run state (RUN_...)
  int runs[RJ_WEEK_SCAN] = {};  // week grid of run slots, used when ctrl is SCHEDULE
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
  int status = LOCK_SCHEDULE;  // lock state (LOCK_...)
  void* listitem = nullptr;    // editor's list entry; non-owning
  int word1 = 0;
  int max_frames = 4;
  int num_processors = 0;
  int locks[RJ_WEEK_SCAN] = {};  // week grid of lock slots, used when status is SCHEDULE
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
  Dev* dev = nullptr;            // non-owning
  int picked = 0;                // an editor's selection mark
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
