// The job's error record: why a task ended badly, piled into the job's
// comment so that whoever looks at the job in the control file sees it.
#include "Utility/rndctl/tasks/rj_joberr.h"

#include <cstdio>
#include <cstring>
#include <memory>
#include <string>

#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_scoped.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/proc/rj_signal.h"
#include "Utility/rndctl/records/rj_recindex.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"

namespace {

constexpr const char* kUnknownReason = "Quit for Unknown reasons";

bool reports_error(const char* line) {
  return strstr(line, " error") != nullptr || strstr(line, "did not build") != nullptr ||
         strstr(line, "Error") != nullptr;
}

// One line of a render program's output, at most 254 characters with its
// newline (a longer line comes in pieces), as fgets would give it.  Output
// is not always text: a NUL would hide the rest of the line from the search
// and from the comment, and terminal controls are noise in a file people
// read, so every control character but the tab and the newline reads as a
// blank.  False at the end of the output.
bool read_line(FILE* fp, std::string* line) {
  constexpr size_t kLineMax = 254;
  line->clear();
  int c;
  while (line->size() < kLineMax && (c = getc_unlocked(fp)) != EOF) {
    auto byte = static_cast<unsigned char>(c);
    if ((byte < ' ' && byte != '\t' && byte != '\n') || byte == 0x7f) byte = ' ';
    line->push_back(static_cast<char>(byte));
    if (byte == '\n') break;
  }
  return !line->empty();
}

}  // namespace

void Job_Error_Update(TASK* entry) {
  if (entry == nullptr || entry->rec == nullptr || entry->job == nullptr) return;
  TaskRec* rec = entry->rec;
  Job* job = entry->job;
  Dev* dev = rec->dev;
  if (dev == nullptr || entry->out_path.none()) return;

  ScopedFILE log(fopen(entry->out_path.c_str(), "re"));
  if (!log) return;

  // Lines keep their newline: the report goes into the comment as read.
  std::string reason;
  std::string report;
  int code = entry->waitstatus;
  if (code >= 2) {
    // Exit values of 2 and up are read as the signal that ended the program;
    // its own output says nothing useful then.
    const char* desc = RGget_sig_desc(code);
    reason = desc != nullptr ? desc : "Unrecognized SIGNAL";
    reason += '\n';
  } else {
    reason = kUnknownReason;
    std::string text;
    while (read_line(log.get(), &text)) {
      const char* line = text.c_str();
      if (reports_error(line)) {
        report = line;
        break;
      }
      reason = line;
    }
  }
  log.reset();
  if (report.empty()) report = reason.empty() ? kUnknownReason : reason;

  const double frame = static_cast<double>(rec->start);
  const char* dev_name = dev->name.or_else("");
  const char* host_name = dev->host_name.or_else("");
  const char* old = job->comment.c_str();
  int length = old != nullptr ? snprintf(nullptr, 0, "%sERROR: %s (%s) frame %.1f\n%s\n \n", old,
                                         dev_name, host_name, frame, report.c_str())
                              : snprintf(nullptr, 0, "ERROR: %s (%s) frame %.1f\n%s\n \n", dev_name,
                                         host_name, frame, report.c_str());
  if (length < 0) return;
  auto* comment = static_cast<char*>(
      MA_malloc(static_cast<size_t>(length) + 1, __LINE__, "Utility/rndctl/rj_joberr", 1));
  if (comment == nullptr) return;
  if (old != nullptr) {
    snprintf(comment, static_cast<size_t>(length) + 1, "%sERROR: %s (%s) frame %.1f\n%s\n \n", old,
             dev_name, host_name, frame, report.c_str());
  } else {
    snprintf(comment, static_cast<size_t>(length) + 1, "ERROR: %s (%s) frame %.1f\n%s\n \n",
             dev_name, host_name, frame, report.c_str());
  }
  job->comment.adopt(comment);
  dbgpnt("%s", comment);
}
