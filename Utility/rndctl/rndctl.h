/// The render queue, for editors and tools: one include for everything the
/// queue library offers.  Library sources include the unit headers they use
/// instead; each unit's header says what the unit is for, in which order its
/// functions are called, and which fields of the control block it reads and
/// writes.
///
/// The units, each using only those above it:
///   base/     the owned text type, diagnostics and the access log, the
///             clock, the control block, editor hooks
///   proc/     signals, the liveness probe, child tracking
///   ctldir/   the control directory: locked file operations, update
///             times (pid files), the editor registry
///   records/  jobs, resources, pick lists, schedules, validation
///   ctlfile/  the control-file language: lexer, grammar, writer, reload
///   tasks/    task records and the task file, selection and cutting,
///             running a task, status and progress, job log and errors,
///             taking back the tasks of dead daemons
///
/// Everything lives in one shared control directory of plain-text files:
/// jobs (Render_Job_Control), render hosts or "resources"
/// (Render_Resource_Control), the tasks the jobs are cut into (Render_Tasks),
/// lock directories, per-host pid files.  Every read-modify-write of a shared
/// file happens under that file's lock directory.
///
/// Return codes, never exceptions: 1/0, a count, or a pointer/null.  None of
/// these functions is safe inside a signal handler except where noted; the
/// daemon runs its handler only inside its one wait (RJ_pause), so the
/// handler never interrupts work on these structures.
#pragma once

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_scoped.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_editreg.h"
#include "Utility/rndctl/ctldir/rj_fileio.h"
#include "Utility/rndctl/ctldir/rj_paths.h"
#include "Utility/rndctl/ctldir/rj_pidfile.h"
#include "Utility/rndctl/ctldir/rj_updatetime.h"
#include "Utility/rndctl/ctlfile/rj_ctlfile.h"
#include "Utility/rndctl/ctlfile/rj_reload.h"
#include "Utility/rndctl/proc/rj_registry.h"
#include "Utility/rndctl/proc/rj_signal.h"
#include "Utility/rndctl/proc/rj_spawn.h"
#include "Utility/rndctl/records/rj_dev.h"
#include "Utility/rndctl/records/rj_frames.h"
#include "Utility/rndctl/records/rj_job.h"
#include "Utility/rndctl/records/rj_jobcheck.h"
#include "Utility/rndctl/records/rj_lst.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/records/rj_schedule.h"
#include "Utility/rndctl/tasks/rj_joberr.h"
#include "Utility/rndctl/tasks/rj_joblog.h"
#include "Utility/rndctl/tasks/rj_perform.h"
#include "Utility/rndctl/tasks/rj_pick.h"
#include "Utility/rndctl/tasks/rj_reclaim.h"
#include "Utility/rndctl/tasks/rj_select.h"
#include "Utility/rndctl/tasks/rj_status.h"
#include "Utility/rndctl/tasks/rj_task.h"
#include "Utility/rndctl/tasks/rj_taskfile.h"
#include "Utility/rndctl/tasks/rj_taskgroup.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"
#include "Utility/rndctl/tasks/rj_tskio.h"
