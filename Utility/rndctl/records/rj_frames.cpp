#include "Utility/rndctl/records/rj_frames.h"

#include "Utility/rndctl/records/rj_jobcheck.h"

namespace {

// The base and step of the job's extension numbers.
void extension_base_step(const Job* job, int* base, int* step) {
  if (job->extension != 0) {
    *base = job->ext_start;
    *step = job->ext_by;
  } else {
    *base = static_cast<int>(job->frames[0]);
    *step = 1;
  }
}

}  // namespace

int rj_frames_numbering(const Job* job, int* step) {
  if (job->extension != 0) {
    *step = job->ext_by;
    return 1;
  }
  const float by = job->frames[2];
  int by_int = static_cast<int>(by);
  if (by_int == 0) by_int = by < 0.0f ? -1 : 1;
  if (static_cast<float>(by_int) != by) {
    *step = by_int;
    return 1;
  }
  *step = 0;
  return 0;
}

int rj_frame_extension(const Job* job, float frame) {
  int base = 0;
  int step = 1;
  extension_base_step(job, &base, &step);
  return (Calc_frame_range(job->frames[0], frame, job->frames[2]) - 1) * step + base;
}

int rj_frames_span(const Job* job, float from, float to) {
  return Calc_frame_range(from, to, job->frames[2]);
}

int rj_frames_done_at(const Job* job, float start, int extension) {
  int step = 0;
  if (rj_frames_numbering(job, &step) != 0) {
    return Calc_frame_range(static_cast<float>(rj_frame_extension(job, start)),
                            static_cast<float>(extension), static_cast<float>(step));
  }
  return Calc_frame_range(start, static_cast<float>(extension), job->frames[2]);
}

void rj_frame_progress(const Job* job, float start, float end, int extension, int line,
                       int lines_per_frame, RjFrameProgress* out) {
  *out = RjFrameProgress{};
  if (line <= 0) line += lines_per_frame;
  line -= 2;
  out->line = line;
  out->current = start;
  if (job->animate != 0) {
    out->first_extension = rj_frame_extension(job, start);
    out->frames_in_task = rj_frames_span(job, start, end);
    out->frames_done = rj_frames_done_at(job, start, extension);
    const int under_way = line >= lines_per_frame ? out->frames_done : out->frames_done - 1;
    if (under_way > 0) out->current = start + static_cast<float>(under_way) * job->frames[2];
    if (out->current < start) out->current = start;
    if (out->current > end) out->current = end;
  }
  out->lines_done = out->frames_done * lines_per_frame + line;
  out->lines_all = out->frames_in_task * lines_per_frame;
  out->percent = out->lines_all != 0
                     ? static_cast<float>(static_cast<double>(out->lines_done) /
                                          static_cast<double>(out->lines_all) * 100.0)
                     : 0.0f;
}
