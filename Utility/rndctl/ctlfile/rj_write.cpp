// The writers of the two control files.  What they print is read back by the
// control-file grammar (RJCgram.y) in every daemon and editor, and by people:
// every line is kept exactly as it has always been written, oddities
// included (tabs against blanks, the resource comment that nothing reads
// back, the two-blank default_dev line, the indented resource brace).
//
// The texts inside the lines are another matter.  A render program's error
// line ends up in a job's comment, and a host may be called 10.1.2.3: one
// "*/" or quote in the wrong place, one name that lexes as a number, and
// the file no longer parses, and every daemon that reads it stops on the
// syntax error.  So every text goes through the forms below, which pass
// what the reader takes as it is and change only what it could not take.
#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <memory>
#include <new>
#include <string>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctlfile/rj_ctlfile.h"
#include "Utility/rndctl/records/rj_job.h"
#include "Utility/rndctl/records/rj_recindex.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/records/rj_schedule.h"

namespace {

bool word_start(unsigned char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '.' ||
         c == '_';
}
bool word_char(unsigned char c) { return word_start(c) || c == '-' || c == '#' || c == '@'; }

// Keywords lex as keywords only as whole words, so a name equal to one is
// read as that keyword.  "End" ends the file; the headers switch the file.
const char* const kEveryKeyword[] = {
    "RenderJobControl", "RenderResourceControl", "End", "lock_pid", "TRUE", "FALSE", "to"};
const char* const kJobKeywords[] = {
    "user",          "status",    "priority",    "executable", "use_sdl_paths", "output_mask",
    "save_out",      "sdl",       "pix",         "matte",      "animate",       "fields",
    "frames",        "extension", "totalframes", "doneframes", "resources",     "searchpath",
    "del_when_done", "rnd_opts",  "ctrl",        "runs"};
const char* const kResourceKeywords[] = {"host_name",  "remote_location", "status",
                                         "max_frames", "num_processors",  "locks",
                                         "default_dev"};

// Word characters only and no number: what the word rule of the lexer takes
// whole.  A run of digits, points and minus signs that starts with a digit
// is a number however long (the number rules win a tie).  Returns its
// length, or 0 when it is not one: one walk serves both the test and the
// copy.
size_t plain_word_length(const char* text) {
  const auto* p = reinterpret_cast<const unsigned char*>(text);
  if (p == nullptr || !word_start(p[0])) return 0;
  const unsigned char* start = p;
  bool numeric = p[0] >= '0' && p[0] <= '9';
  for (; *p != '\0'; ++p) {
    if (!word_char(*p)) return 0;
    if (!((*p >= '0' && *p <= '9') || *p == '.' || *p == '-')) numeric = false;
  }
  return numeric ? 0 : static_cast<size_t>(p - start);
}

// Whether a word of `length` characters is a keyword of the section; the
// length sorts out nearly every name at once.
template <size_t N>
bool listed_n(const char* const (&table)[N], const char* text, size_t length) {
  for (const char* keyword : table)
    if (keyword[0] == text[0] && strlen(keyword) == length && memcmp(keyword, text, length) == 0)
      return true;
  return false;
}

bool is_keyword(const char* text, size_t length, int section) {
  if (listed_n(kEveryKeyword, text, length)) return true;
  if (section == RJC_JOB_SECTION) return listed_n(kJobKeywords, text, length);
  if (section == RJC_RESOURCE_SECTION) return listed_n(kResourceKeywords, text, length);
  return listed_n(kJobKeywords, text, length) || listed_n(kResourceKeywords, text, length);
}

bool label_char_ok(unsigned char c) { return c > ' ' && c != 0x7f; }

}  // namespace

bool RJC_is_word(const char* text, int section) {
  size_t length = plain_word_length(text);
  return length != 0 && !is_keyword(text, length, section);
}

std::string RJC_string_form(const char* text) {
  std::string form;
  if (text == nullptr) return form;
  // The reader counts the characters between the quotes, so the quotes go
  // first and the cut comes after.
  for (const char* p = text; *p != '\0' && form.size() < RJC_STRING_LIMIT; ++p)
    if (*p != '"') form += *p;
  return form;
}

std::string RJC_comment_form(const char* text) {
  std::string form;
  if (text == nullptr) return form;
  for (const char* p = text; *p != '\0'; ++p) {
    form += *p;
    if (p[0] == '*' && p[1] == '/') form += ' ';
  }
  return form;
}

std::string RJC_name_form(const char* text) {
  if (text == nullptr) return std::string();
  return plain_word_length(text) != 0 ? std::string(text) : RJC_string_form(text);
}

bool RJC_label_needs_form(const char* text) {
  if (text == nullptr || *text == '\0') return true;
  for (const auto* p = reinterpret_cast<const unsigned char*>(text); *p != '\0'; ++p)
    if (!label_char_ok(*p)) return true;
  return false;
}

std::string RJC_label_form(const char* text) {
  if (text == nullptr || *text == '\0') return "-";
  std::string form(text);
  for (char& c : form)
    if (!label_char_ok(static_cast<unsigned char>(c))) c = '_';
  return form;
}

namespace {

// The text of a file is put together here and handed to the stream in one
// piece: a file of ten thousand jobs is some hundred thousand lines, and one
// formatted stream call per line costs more than everything else together,
// and a system call per piece of a few kilobytes is still some hundreds of
// them.  The room is kept from one write to the next, as a fresh one of
// megabytes is fresh pages for the kernel to map each time.  Numbers print
// as "%d" would; the rare general float goes through snprintf.
class Out {
 public:
  explicit Out(FILE* fp) : fp_(fp), room_(room()) {}
  Out(const Out&) = delete;
  Out& operator=(const Out&) = delete;
  ~Out() { flush(); }

  Out& s(const char* text) { return n(text, strlen(text)); }
  // Called for every piece of every line: kept inline, so that a literal's
  // copy is a few moves.
  [[gnu::always_inline]] Out& n(const char* text, size_t length) {
    if (__builtin_expect(length > room_.size - used_, 0) && !grow(length)) {
      // No room to be had: what is gathered goes out now, this piece with it.
      flush();
      fwrite(text, 1, length, fp_);
      return *this;
    }
    memcpy(room_.text.get() + used_, text, length);
    used_ += length;
    return *this;
  }
  template <size_t N>
  Out& lit(const char (&text)[N]) {
    return n(text, N - 1);
  }
  Out& d(int value) {
    char digits[16];
    char* end = digits + sizeof digits;
    char* p = end;
    unsigned u = value < 0 ? 0u - static_cast<unsigned>(value) : static_cast<unsigned>(value);
    do {
      *--p = static_cast<char>('0' + u % 10);
      u /= 10;
    } while (u != 0);
    if (value < 0) *--p = '-';
    return n(p, static_cast<size_t>(end - p));
  }
  Out& f(double value) {
    char text[512];
    int length = snprintf(text, sizeof text, "%f", value);
    if (length < 0) return *this;
    return n(text, std::min(static_cast<size_t>(length), sizeof text - 1));
  }
  Out& str(const std::string& text) { return n(text.data(), text.size()); }
  Out& truth(int flag) {
    if (flag != 0) return lit("TRUE");
    return lit("FALSE");
  }

  /// A quoted string.  Nearly every text is taken as it is; only the rare
  /// one with a quote or beyond the limit is copied.
  Out& quoted(const char* text) {
    size_t length = strlen(text);
    lit("\"");
    if (length <= RJC_STRING_LIMIT && memchr(text, '"', length) == nullptr)
      n(text, length);
    else
      str(RJC_string_form(text));
    return lit("\"");
  }

  /// The text of a comment, between marks the caller writes.
  Out& comment(const char* text) {
    if (strstr(text, "*/") == nullptr) return s(text);
    return str(RJC_comment_form(text));
  }

  /// A name: bare when it reads back as one word of the section, else quoted.
  /// A text that is a word only once its quotes are gone is written bare,
  /// so that the next write of what is read back writes the same.
  Out& name(const char* text, int section) {
    size_t length = plain_word_length(text);
    if (length != 0) {
      if (!is_keyword(text, length, section)) return n(text, length);
      return quoted(text);  // a keyword: no quote to drop
    }
    std::string form = RJC_string_form(text);
    if (RJC_is_word(form.c_str(), section)) return str(form);
    return quoted(form.c_str());
  }

  void flush() {
    if (used_ != 0) fwrite(room_.text.get(), 1, used_, fp_);
    used_ = 0;
  }

 private:
  // The room is kept from one write to the next.  One writer runs at a
  // time: the two files are written one after the other, never one inside
  // the other.
  struct Room {
    std::unique_ptr<char[]> text;
    size_t size = 0;
  };

  bool grow(size_t length) {
    const size_t size = std::max(used_ + length, 2 * room_.size + 65536);
    try {
      auto bigger = std::make_unique_for_overwrite<char[]>(size);
      if (used_ != 0) memcpy(bigger.get(), room_.text.get(), used_);
      room_.text = std::move(bigger);
      room_.size = size;
      return true;
    } catch (const std::bad_alloc&) {
      return false;
    }
  }

  static Room& room() {
    static Room shared;
    return shared;
  }

  FILE* fp_;  // not owned
  Room& room_;
  size_t used_ = 0;
};

// Writes `keyword` and the blocks of a week grid, or nothing when no half
// hour is set.  The blocks are taken out of a scratch copy: taking a block
// clears it, and the record must keep its grid.
void write_week(Out& out, const char* keyword, const int* grid) {
  int scratch[RJ_WEEK_SCAN];
  memcpy(scratch, grid, sizeof(int) * RJ_WEEK);
  scratch[RJ_WEEK] = 0;

  int times[2];
  const char* days[2];
  bool first = true;
  while (Schedule_get_a_block(scratch, times, days) != 0) {
    out.s(first ? keyword : ",\n\t\t");
    first = false;
    const char* d0 = days[0] != nullptr ? days[0] : "(null)";
    const char* d1 = days[1] != nullptr ? days[1] : "(null)";
    out.lit("\t{ ").d(times[0]).lit(" to ").d(times[1]).lit(" ").s(d0);
    if (strcmp(d0, d1) != 0) out.lit(" to ").s(d1);
    out.lit(" }");
  }
  if (!first) out.lit(";\n");
}

// Frame numbers are nearly always whole.  For a whole float within int range
// (negative zero excepted) "%d.000000" prints what "%f" would, without the
// cost of the general floating-point conversion.
bool whole(float f) {
  return f == std::trunc(f) && std::fabs(f) < 1e9f && !(f == 0.0f && std::signbit(f));
}

void write_frames(Out& out, const float* frames) {
  out.lit("\tframes\t\t= ");
  if (whole(frames[0]) && whole(frames[1]) && whole(frames[2])) {
    out.d(static_cast<int>(frames[0])).lit(".000000, ");
    out.d(static_cast<int>(frames[1])).lit(".000000, ");
    out.d(static_cast<int>(frames[2])).lit(".000000;\n");
  } else {
    out.f(static_cast<double>(frames[0])).lit(", ");
    out.f(static_cast<double>(frames[1])).lit(", ");
    out.f(static_cast<double>(frames[2])).lit(";\n");
  }
}

void write_job(Out& out, const Job* job) {
  // The reader names a job after the last part of the text, as it names a
  // job after its scene file; written that way, the name reads back as it is.
  const char* name = job->name.or_else("");
  const char* slash = strrchr(name, '/');
  out.name(slash != nullptr ? slash + 1 : name, RJC_JOB_SECTION).lit(" ").d(job->index).lit(" {\n");
  if (job->comment) out.lit("\t/*").comment(job->comment.c_str()).lit("*/\n");
  if (job->lock_pid != 0) out.lit("\tlock_pid \t= ").d(job->lock_pid).lit(";\n");
  if (job->del_when_done != 0) out.lit("\tdel_when_done \t= TRUE;\n");
  if (job->user) out.lit("\tuser\t \t= ").name(job->user.c_str(), RJC_JOB_SECTION).lit(";\n");
  if (job->status) out.lit("\tstatus \t\t= ").quoted(job->status.c_str()).lit(";\n");
  out.lit("\tpriority \t= ").d(job->priority).lit(";\n");
  if (job->executable)
    out.lit("\texecutable \t= ").name(job->executable.c_str(), RJC_JOB_SECTION).lit(";\n");
  if (job->sdl) out.lit("\tsdl \t\t= ").quoted(job->sdl.c_str()).lit(";\n");
  if (job->pix) out.lit("\tpix \t\t= ").quoted(job->pix.c_str()).lit(";\n");
  if (job->matte) out.lit("\tmatte \t\t= ").quoted(job->matte.c_str()).lit(";\n");
  out.lit("\tuse_sdl_paths = ").truth(job->use_sdl_paths).lit(";\n\toutput_mask = ");
  out.truth(job->output_mask).lit(";\n");

  // A still job carries none of the animation group, its run state
  // included: a paused still job comes back from a rewrite unpaused.
  if (job->animate != 0) {
    out.lit("\tanimate\t\t= TRUE;\n");
    write_frames(out, job->frames);
    if (job->extension != 0) {
      out.lit("\textension\t= ").d(job->ext_start).lit(", ").d(job->ext_by).lit(", ");
      out.d(job->ext_size).lit(";\n");
    }
    if (job->save_out != 0) out.lit("\tsave_out\t= TRUE;\n");
    // AVAILABLE is the normal state and goes without saying.
    switch (job->ctrl) {
      case RUN_PAUSED:
        out.lit("\tctrl\t\t= PAUSED;\n");
        break;
      case RUN_SCHEDULE:
        out.lit("\tctrl\t\t= SCHEDULE;\n");
        break;
      case RUN_NOW:
        out.lit("\tctrl\t\t= NOW;\n");
        break;
      default:
        break;
    }
    if (job->fields != 0) out.lit("\tfields\t\t= ").d(job->fields).lit(";\n");
    if (job->rnd_opts) out.lit("\trnd_opts\t= ").quoted(job->rnd_opts.c_str()).lit(";\n");
    out.lit("\ttotalframes\t= ").d(job->totalframes).lit(";\n\tdoneframes\t= ");
    out.d(job->doneframes).lit(";\n");
  }

  // A resource without a name is not in the resource file, so the reader
  // would drop it from the job anyway; a line of nothing but such resources
  // would not parse at all.
  bool first = true;
  for (const RndDevList* e = job->resources; e != nullptr; e = e->next) {
    if (e->dev == nullptr || e->dev->name.none()) continue;
    out.s(first ? "\tresources\t= " : ", ").name(e->dev->name.c_str(), RJC_JOB_SECTION);
    first = false;
  }
  if (!first) out.lit(";\n");
  for (const RndPathList* p = job->searchpath; p != nullptr; p = p->next) {
    if (p->path) out.lit("\tsearchpath\t= ").quoted(p->path.c_str()).lit(";\n");
  }
  write_week(out, "\truns\t\t=", job->runs);
  out.lit("}\n\n");
}

void write_dev(Out& out, const Dev* dev) {
  out.name(dev->name.c_str(), RJC_RESOURCE_SECTION).lit(" ").d(dev->index).lit(" {\n");
  out.lit("\tlock_pid \t= ").d(dev->lock_pid).lit(";\n");
  if (dev->comment) out.lit("/* ").comment(dev->comment.c_str()).lit(" */\n");
  if (dev->host_name)
    out.lit("\thost_name\t\t= ").name(dev->host_name.c_str(), RJC_RESOURCE_SECTION).lit(";\n");
  if (dev->remote_location)
    out.lit("\tremote_location\t= ").quoted(dev->remote_location.c_str()).lit(";\n");
  switch (dev->status) {
    case LOCK_LOCKED:
      out.lit("\tstatus \t\t\t= LOCKED;\n");
      break;
    case LOCK_AVAILABLE:
      out.lit("\tstatus \t\t\t= AVAILABLE;\n");
      break;
    case LOCK_SCHEDULE:
      out.lit("\tstatus \t\t\t= SCHEDULE;\n");
      break;
    default:
      break;
  }
  // default_dev has always been indented with two blanks and padded with
  // blanks, unlike every other line.
  out.lit("\tmax_frames \t\t= ").d(dev->max_frames).lit(";\n\tnum_processors \t= ");
  out.d(dev->num_processors).lit(";\n  default_dev     = ").d(dev->default_dev).lit(";\n");
  write_week(out, "\tlocks =", dev->locks);
  out.lit("\t}\n\n");
}

// The writer touches every record once, and a record of ten thousand is
// hardly ever in the cache: most of the write was waiting for memory.  The
// next record (its fields and week grid) is asked for while this one is
// written.
template <class Record>
void prefetch_record(const Record* record) {
  if (record == nullptr) return;
  const char* first = reinterpret_cast<const char*>(record);
  const char* end = reinterpret_cast<const char*>(record + 1);
  for (const char* p = first; p < end; p += 64) __builtin_prefetch(p);
}

}  // namespace

void Job_control_write_dev(FILE* fp) {
  if (fp == nullptr) return;
  Out out(fp);
  out.lit("RenderJobControl ").d(static_cast<int>(rndctl.interval_min)).lit(" ");
  out.d(static_cast<int>(rndctl.interval_sec)).lit("\n");
  Job* job = rndctl.jobs;
  while (job != nullptr) {
    Job* next = job->next;
    prefetch_record(next);
    // Editors only mark a job deleted; it leaves the queue here, when the
    // file that every other process reads no longer holds it.
    if (job->deleted != 0)
      Job_del(job);
    else
      write_job(out, job);
    job = next;
  }
  out.lit("End\n");
}

void Resource_control_write_dev(FILE* fp) {
  if (fp == nullptr) return;
  Out out(fp);
  out.lit("RenderResourceControl\n");
  for (const Dev* dev = rndctl.devs; dev != nullptr; dev = dev->next) {
    prefetch_record(dev->next);
    if (dev->name) write_dev(out, dev);
  }
  out.lit("End\n");
}
