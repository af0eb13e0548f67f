/// The job's error record: why a task ended badly, piled into the job's
/// comment so that whoever looks at the job in the control file, or in an
/// editor, sees it without reading the render's output.
///
/// Calling order: the status unit calls Job_Error_Update when it judges a
/// reaped render's non-zero exit, before the render's output file is removed
/// (the reason is read from it); the job file is written later by the
/// reload and write-back cycle, not here.
///
/// Control block: reads and writes no field of it; writes only the job's
/// `comment` (through the entry's `job`).
#pragma once

#include "Utility/rndctl/tasks/rj_taskrec.h"

/// Appends "ERROR: RESOURCE (HOST) frame START\nREASON\n \n" to the comment
/// of the entry's job.  REASON is the description of signal N when the
/// entry's `waitstatus` N is 2 or more: a killed render's signal, but a
/// render's own exit code of 2 or more reads as a signal too (the two share
/// `waitstatus`), and its output is not searched then.  Otherwise it is the
/// first line of the render's output (`out_path`) that reports an error
/// (" error", "Error", "did not build"), else its last line, else "Quit for
/// Unknown reasons".  Control characters of the output read as blanks.
/// Does nothing when the entry lacks its job, record, resource or output
/// name, or the output cannot be opened; out of memory leaves the comment
/// as it was.
void Job_Error_Update(TASK* entry);
