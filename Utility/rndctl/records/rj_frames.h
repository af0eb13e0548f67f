/// Frame numbering and image extensions: the one place that knows how a
/// job's frames are counted and how its images are numbered, so that the
/// command line a render program is given and the progress read back from it
/// agree.
///
/// An animated job renders the frames start, start+by, ... up to end (its
/// `frames`).  Each image carries a number, its extension: the job's own
/// extension start and step when the job sets an extension, else the job's
/// first frame (truncated) counting up by one.  A render program is handed
/// extension numbers of its own ("-S first -B step") when the job sets an
/// extension or when its step is no whole number (frame numbers could not
/// name the files); otherwise its images carry plain frame numbers.
///
/// Pure arithmetic on a job's numbers and plain frame values: no unit state,
/// no control-block field read or written, callable in any order.
#pragma once

#include "Utility/rndctl/records/rj_records.h"

/// Whether a render program of `job` numbers its own images.  Returns 1 and
/// sets `*step` to the step of those numbers (the job's extension step when
/// it sets an extension, else its step truncated, 0 becoming -1 or 1 by the
/// step's sign); returns 0 and sets `*step` to 0 when the images carry plain
/// frame numbers (a whole step without an extension).
[[nodiscard]] int rj_frames_numbering(const Job* job, int* step);

/// The extension number of `frame` of `job`: its position in the job's
/// frames (1 for the first), less one, times the extension step, plus the
/// extension base.  Never fails.
int rj_frame_extension(const Job* job, float frame);

/// The number of the job's frames from `from` to `to` at the job's step (at
/// least 1: an empty, descending or stepless range counts as one frame).
int rj_frames_span(const Job* job, float from, float to);

/// The frames a task starting at `start` has done once its program reports
/// image `extension`, counted in the numbering the program was given (see
/// rj_frames_numbering); at least 1.
int rj_frames_done_at(const Job* job, float start, int extension);

/// What one progress line "IMAGE r LINE of LINES" of a task start..end means.
struct RjFrameProgress {
  int line = 0;             // the line reported, adjusted as below
  int first_extension = 0;  // extension number of the task's first frame (0: still)
  int frames_in_task = 1;   // frames of the task (1: still)
  int frames_done = 0;      // frames done at the image reported (0: still)
  int lines_done = 0;
  int lines_all = 0;
  float current = 0.0f;  // the frame under way, within start..end
  float percent = 0.0f;  // lines_done / lines_all * 100; 0 when lines_all is 0
};

/// Fills `*out` for a progress line of a task start..end of `job` that
/// names image `extension` (ignored for a still job) at reported line
/// `line` of `lines_per_frame`.  Programs report 0 (or less) for the last
/// line of a frame, so such a line counts lines_per_frame more; every line
/// then counts two less.  `current` is the frame under way, not the one
/// after it, so that a task failing mid-frame renders that frame again; once
/// a frame's last line is in, the next frame is under way, never past `end`.
void rj_frame_progress(const Job* job, float start, float end, int extension, int line,
                       int lines_per_frame, RjFrameProgress* out);
