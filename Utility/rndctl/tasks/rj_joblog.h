/// The job log, JOBLOG/JOB in the control directory: a four-line header
/// and one line per task of the job this daemon rendered, rewritten whole
/// when a task of the job ends.  Editors read it; nothing in the queue
/// reads it back.
///
/// Control block: reads `rndctl.tasks` (the job's entries) and the control
/// directory; writes nothing of it.
#pragma once

#include <cstdio>

#include "Utility/rndctl/tasks/rj_taskrec.h"

/// Rewrites JOBLOG/JOB: a four-line header and one line per entry of the
/// job.  Does nothing when the job has no entry or the file cannot be made.
void Job_Log_out(Job* job);
/// The job log opened for reading past its header (Logfile_open) or from
/// its start (Logfile_open_nr); null when it cannot be opened.  The caller
/// closes it.
FILE* Logfile_open(Job* job);
FILE* Logfile_open_nr(Job* job);
