// The job log: one file per job in JOBLOG, rewritten from the job's entries.
#include "Utility/rndctl/tasks/rj_joblog.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_scoped.h"
#include "Utility/rndctl/ctldir/rj_paths.h"
#include "Utility/rndctl/records/rj_frames.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/tasks/rj_tskio.h"

namespace {

const char* status_name(int code) {
  if (code < TASK_PENDING || code > TASK_STOPPED) return "UNKNOWN";
  return task_status_table[code];
}

}  // namespace

FILE* Logfile_open_nr(Job* job) {
  if (job == nullptr || job->name.none()) return nullptr;
  return fopen(rj_joblog_path(job->name.c_str()).c_str(), "re");
}

FILE* Logfile_open(Job* job) {
  FILE* fp = Logfile_open_nr(job);
  if (fp == nullptr) return nullptr;
  // The header is four lines; the task lines follow.
  char line[120];
  for (int i = 0; i < 4; ++i) {
    if (fgets(line, sizeof line, fp) == nullptr) break;
  }
  return fp;
}

void Job_Log_out(Job* job) {
  if (job == nullptr || job->name.none()) return;
  bool any = false;
  for (TASK* entry = rndctl.tasks; entry != nullptr && !any; entry = entry->next) {
    any = entry->job == job;
  }
  if (!any) return;

  mkdir(rj_joblog_dir().c_str(), 0775);
  const std::string path = rj_joblog_path(job->name.c_str());
  dbgpnt("%s (job index %d) using the %s\n", job->name.c_str(), job->index,
         job->executable.or_else(""));
  int fd;
  do {
    fd = open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0666);
  } while (fd < 0 && errno == EINTR);
  if (fd < 0) return;
  ScopedFILE fp(fdopen(fd, "w+"));
  if (!fp) {
    close(fd);
    return;
  }

  fprintf(fp.get(), "%s %d using the %s\n", job->name.c_str(), job->index,
          job->executable.or_else(""));
  fprintf(fp.get(), "\tsdl = \"%s\"\n", job->sdl.or_else(""));
  fprintf(fp.get(), "\tframes = %f to %f by %f\n", static_cast<double>(job->frames[0]),
          static_cast<double>(job->frames[1]), static_cast<double>(job->frames[2]));
  if (job->extension != 0) {
    fprintf(fp.get(), "\textension = %d by %d  size(%d)\n", job->ext_start, job->ext_by,
            job->ext_size);
  } else {
    fprintf(fp.get(), "  no extension set\n");
  }
  for (TASK* entry = rndctl.tasks; entry != nullptr; entry = entry->next) {
    if (entry->job != job || entry->rec == nullptr) continue;
    const TaskRec* rec = entry->rec;
    fprintf(fp.get(), "\t%d\t %f - %f\t%d - %d\t %s\t %s  %d\n", rec->id,
            static_cast<double>(rec->start), static_cast<double>(rec->end),
            rj_frame_extension(job, rec->start), rj_frame_extension(job, rec->end),
            rec->dev != nullptr ? rec->dev->name.or_else("nodev") : "nodev",
            status_name(rec->status), rec->retries);
  }
}
