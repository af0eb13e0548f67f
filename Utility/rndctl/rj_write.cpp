// The writers of the two control files.  What they print is read back by the
// control-file grammar (RJCgram.y) in every daemon and editor, and by people:
// every line is kept exactly as it has always been written, oddities
// included (tabs against blanks, the resource comment that nothing reads
// back, the two-blank default_dev line, the indented resource brace).
#include <cmath>
#include <cstdio>
#include <cstring>

#include "Utility/rndctl/rndctl.h"

namespace {

const char* truth(int flag) { return flag != 0 ? "TRUE" : "FALSE"; }

// glibc prints a null "%s" as "(null)"; say so rather than rely on it.
const char* shown(const Text& text) { return text.or_else("(null)"); }

// Writes `keyword` and the blocks of a week grid, or nothing when no half
// hour is set.  The blocks are taken out of a scratch copy: taking a block
// clears it, and the record must keep its grid.
void write_week(FILE* fp, const char* keyword, const int* grid) {
  int scratch[RJ_WEEK_SCAN];
  memcpy(scratch, grid, sizeof(int) * RJ_WEEK);
  scratch[RJ_WEEK] = 0;

  int times[2];
  const char* days[2];
  bool first = true;
  while (Schedule_get_a_block(scratch, times, days) != 0) {
    fputs(first ? keyword : ",\n\t\t", fp);
    first = false;
    const char* d0 = days[0] != nullptr ? days[0] : "(null)";
    const char* d1 = days[1] != nullptr ? days[1] : "(null)";
    if (strcmp(d0, d1) != 0)
      fprintf(fp, "\t{ %d to %d %s to %s }", times[0], times[1], d0, d1);
    else
      fprintf(fp, "\t{ %d to %d %s }", times[0], times[1], d0);
  }
  if (!first) fputs(";\n", fp);
}

// Frame numbers are nearly always whole.  For a whole float within int range
// (negative zero excepted) "%d.000000" prints what "%f" would, without the
// cost of the general floating-point conversion.
bool whole(float f) {
  return f == std::trunc(f) && std::fabs(f) < 1e9f && !(f == 0.0f && std::signbit(f));
}

void write_frames(FILE* fp, const float* frames) {
  if (whole(frames[0]) && whole(frames[1]) && whole(frames[2])) {
    fprintf(fp, "\tframes\t\t= %d.000000, %d.000000, %d.000000;\n", static_cast<int>(frames[0]),
            static_cast<int>(frames[1]), static_cast<int>(frames[2]));
  } else {
    fprintf(fp, "\tframes\t\t= %f, %f, %f;\n", static_cast<double>(frames[0]),
            static_cast<double>(frames[1]), static_cast<double>(frames[2]));
  }
}

void write_job(FILE* fp, const Job* job) {
  fprintf(fp, "%s %d {\n", shown(job->name), job->index);
  if (job->comment) fprintf(fp, "\t/*%s*/\n", job->comment.c_str());
  if (job->lock_pid != 0) fprintf(fp, "\tlock_pid \t= %d;\n", job->lock_pid);
  if (job->del_when_done != 0) fputs("\tdel_when_done \t= TRUE;\n", fp);
  if (job->user) fprintf(fp, "\tuser\t \t= %s;\n", job->user.c_str());
  if (job->status) fprintf(fp, "\tstatus \t\t= \"%s\";\n", job->status.c_str());
  fprintf(fp, "\tpriority \t= %d;\n", job->priority);
  if (job->executable) fprintf(fp, "\texecutable \t= %s;\n", job->executable.c_str());
  if (job->sdl) fprintf(fp, "\tsdl \t\t= \"%s\";\n", job->sdl.c_str());
  if (job->pix) fprintf(fp, "\tpix \t\t= \"%s\";\n", job->pix.c_str());
  if (job->matte) fprintf(fp, "\tmatte \t\t= \"%s\";\n", job->matte.c_str());
  fprintf(fp, "\tuse_sdl_paths = %s;\n\toutput_mask = %s;\n", truth(job->use_sdl_paths),
          truth(job->output_mask));

  // A still job carries none of the animation group, its run state
  // included: a paused still job comes back from a rewrite unpaused.
  if (job->animate != 0) {
    fputs("\tanimate\t\t= TRUE;\n", fp);
    write_frames(fp, job->frames);
    if (job->extension != 0)
      fprintf(fp, "\textension\t= %d, %d, %d;\n", job->ext_start, job->ext_by, job->ext_size);
    if (job->save_out != 0) fputs("\tsave_out\t= TRUE;\n", fp);
    // AVAILABLE is the normal state and goes without saying.
    switch (job->ctrl) {
      case RUN_PAUSED:
        fprintf(fp, "\tctrl\t\t= %s;\n", "PAUSED");
        break;
      case RUN_SCHEDULE:
        fprintf(fp, "\tctrl\t\t= %s;\n", "SCHEDULE");
        break;
      case RUN_NOW:
        fprintf(fp, "\tctrl\t\t= %s;\n", "NOW");
        break;
      default:
        break;
    }
    if (job->fields != 0) fprintf(fp, "\tfields\t\t= %d;\n", job->fields);
    if (job->rnd_opts) fprintf(fp, "\trnd_opts\t= \"%s\";\n", job->rnd_opts.c_str());
    fprintf(fp, "\ttotalframes\t= %d;\n\tdoneframes\t= %d;\n", job->totalframes, job->doneframes);
  }

  if (job->resources != nullptr) {
    fputs("\tresources\t=", fp);
    bool first = true;
    for (const RndDevList* e = job->resources; e != nullptr; e = e->next) {
      const char* name = e->dev != nullptr ? e->dev->name.or_else("(null)") : "(null)";
      fprintf(fp, first ? " %s" : ", %s", name);
      first = false;
    }
    fputs(";\n", fp);
  }
  for (const RndPathList* p = job->searchpath; p != nullptr; p = p->next) {
    if (p->path) fprintf(fp, "\tsearchpath\t= \"%s\";\n", p->path.c_str());
  }
  write_week(fp, "\truns\t\t=", job->runs);
  fputs("}\n\n", fp);
}

void write_dev(FILE* fp, const Dev* dev) {
  fprintf(fp, "%s %d {\n", dev->name.c_str(), dev->index);
  fprintf(fp, "\tlock_pid \t= %d;\n", dev->lock_pid);
  if (dev->comment) fprintf(fp, "/* %s */\n", dev->comment.c_str());
  if (dev->host_name) fprintf(fp, "\thost_name\t\t= %s;\n", dev->host_name.c_str());
  if (dev->remote_location)
    fprintf(fp, "\tremote_location\t= \"%s\";\n", dev->remote_location.c_str());
  switch (dev->status) {
    case LOCK_LOCKED:
      fprintf(fp, "\tstatus \t\t\t= %s;\n", "LOCKED");
      break;
    case LOCK_AVAILABLE:
      fprintf(fp, "\tstatus \t\t\t= %s;\n", "AVAILABLE");
      break;
    case LOCK_SCHEDULE:
      fprintf(fp, "\tstatus \t\t\t= %s;\n", "SCHEDULE");
      break;
    default:
      break;
  }
  // default_dev has always been indented with two blanks and padded with
  // blanks, unlike every other line.
  fprintf(fp, "\tmax_frames \t\t= %d;\n\tnum_processors \t= %d;\n  default_dev     = %d;\n",
          dev->max_frames, dev->num_processors, dev->default_dev);
  write_week(fp, "\tlocks =", dev->locks);
  fputs("\t}\n\n", fp);
}

}  // namespace

void Job_control_write_dev(FILE* fp) {
  if (fp == nullptr) return;
  fprintf(fp, "RenderJobControl %d %d\n", static_cast<int>(rndctl.interval_min),
          static_cast<int>(rndctl.interval_sec));
  Job* job = rndctl.jobs;
  while (job != nullptr) {
    Job* next = job->next;
    // Editors only mark a job deleted; it leaves the queue here, when the
    // file that every other process reads no longer holds it.
    if (job->deleted != 0)
      Job_del(job);
    else
      write_job(fp, job);
    job = next;
  }
  fputs("End\n", fp);
}

void Resource_control_write_dev(FILE* fp) {
  if (fp == nullptr) return;
  fputs("RenderResourceControl\n", fp);
  for (const Dev* dev = rndctl.devs; dev != nullptr; dev = dev->next) {
    if (dev->name) write_dev(fp, dev);
  }
  fputs("End\n", fp);
}
