/// Small services on job and resource records: fresh indexes from the index
/// files, settings read from a job's scene file, frame counts, the checks
/// that drop the claims of dead editors, and whether two copies of a record
/// differ (which the reload uses to tell what changed).
///
/// None of it has a calling order of its own: the reader and the editors
/// call it on records already in the lists.
///
/// Control block: reads `jobs`, `devs`, `user`, `pid` and `location` (the
/// index files and the editor registry lie there); writes no field of the
/// block itself, only fields of the records in its lists: a job's `user`
/// and `lock_pid`, a resource's `lock_pid`, and the frame and extension
/// fields the scene readers fill.
#pragma once

#include "Utility/rndctl/records/rj_records.h"

/// Hands out the next index of the index file `file_id` (FILE_JOB_INDEX or
/// FILE_DEV_INDEX) under its lock and stores the one after it ("%ul\n").
/// A missing, empty or unreadable file starts at 1; 0 is never handed out
/// nor stored, since index 0 asks the record constructors for a fresh one.
/// When the file cannot be opened 1 is returned and nothing is stored (the
/// open failure was reported); a failed rewrite is reported and the old
/// file stands, so the same index may be handed out again.
[[nodiscard]] int RJCget_next_index(int file_id);
/// The value of "KEY=VALUE;" in a scene line: finds `key`, then the '=' after
/// it, cuts `line` at the next ';' (the line is changed) and returns the text
/// after the '=', pointing into `line`.  Null when either is null, the key
/// is absent or no '=' follows it.  A key matches inside longer words too.
char* get_strstr(const char* key, char* line);
/// Reads the job's scene file (its sdl path) for the field settings
/// "fields", "odd" and "even" and sets `job->fields` (bit 0 odd, bit 1 even;
/// 0 when fields are not TRUE).  Returns the new `fields`, or 0 when the
/// scene cannot be opened (the job is not changed then).
int Job_check_sdlfields(Job* job);
/// Reads the job's scene file for its animation settings (animation, start,
/// end and by frame, extension start, step and size) and sets them and
/// `totalframes` (1 when not animated).  Returns `totalframes`, or 0 when
/// the scene cannot be opened (the job is not changed then).
int Job_set_frame_range(Job* job);
/// The number of frames from `start` to `end` by `step`, the end included
/// when the steps land on it (within rounding).  1 for a single frame, a
/// zero step or a descending range: the renderer never walks backwards.
int Calc_frame_range(float start, float end, float step);
/// Like Job_set_frame_range, but keeps the job's frame range and, when the
/// job has its own extension settings (`extension` non-zero), those too;
/// otherwise the extension starts at the first frame, step 1, unless the
/// scene says otherwise.  Returns `totalframes`, or 0 when the scene cannot
/// be opened.
int Job_check_sdl(Job* job);
/// Gives every job without a user this process's user, and clears each
/// job's `lock_pid` whose holder (another process) is no longer a
/// registered editor.
void Job_field_check();
/// 1 when some job under way (status other than "none", "failed",
/// "aborted" and "finished") names a resource on `host`; else 0, also for
/// a null host.  A daemon without such a job has nothing to wait for.
int Job_file_search(const char* host);
/// Whether two copies of a resource (resp. job) differ in anything the
/// control file holds: 0 the same (also the same pointer), 1 different or
/// one of them null.  Linked records are compared by index, since the copies
/// come from different lists.  A difference is traced as "... is differnt
/// from ..." (spelling kept: log readers match on it).
int ISA_devdif(Dev* a, Dev* b);
int ISA_jobdif(Job* a, Job* b);

/// Updates the editor registry (Editor_registry_update with `mode`) and
/// clears the `lock_pid` of every job and resource held by an editor the
/// update found dead.
void Editor_process_list(int mode);
