// Task groups and task records, the Render_Tasks file and the per-host
// status files under TSKSTAT.
//
// Render_Tasks is shared by every daemon and editor and is rewritten whole on
// each pick, so it is read and written in one piece: the whole file is read
// into memory and scanned there, and each group is formatted into a buffer
// and written with one call.  The text is the same as field-by-field stdio
// would give ("%d", "%f" of a float), only cheaper for files of many
// thousand records.
//
// A damaged file (cut short, garbled, hand-edited) must never take a daemon
// down: every field is checked as it is scanned, scanning stops where the
// text stops making sense, and the next rewrite writes what was understood.
#include "Utility/rndctl/tasks/rj_tskio.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_fileio.h"
#include "Utility/rndctl/ctlfile/rj_ctlfile.h"
#include "Utility/rndctl/proc/rj_signal.h"
#include "Utility/rndctl/records/rj_dev.h"
#include "Utility/rndctl/records/rj_job.h"
#include "Utility/rndctl/records/rj_recindex.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/tasks/rj_task.h"
#include "Utility/rndctl/tasks/rj_taskrec.h"

namespace {

constexpr const char* kUnit = "Utility/rndctl/rj_tskio";
constexpr int kStatusCount = 8;

// Debug lines print record addresses with "%x", as the log readers expect.
unsigned px(const void* p) { return static_cast<unsigned>(reinterpret_cast<uintptr_t>(p)); }

// The blanks of the C library's "C" locale, as a table: the reader asks
// about every character of a file of some megabytes.
constexpr struct SpaceTable {
  bool is[257] = {};
  constexpr SpaceTable() {
    for (int c : {' ', '\t', '\n', '\v', '\f', '\r'}) is[c + 1] = true;
  }
} kSpace;

// c is a character as getc returns it: unsigned char value or EOF.
bool is_space(int c) { return kSpace.is[c + 1]; }

// Where a token in a buffer may end: a blank, or the NUL that ends the
// buffer (a NUL inside the text is part of the token).
constexpr struct TokenEndTable {
  bool is[256] = {};
  constexpr TokenEndTable() {
    for (int c : {'\0', ' ', '\t', '\n', '\v', '\f', '\r'}) is[c] = true;
  }
} kTokenEnd;

// Whitespace-separated tokens, either from a buffer that the source may
// write into (each token is NUL-terminated in place) or straight from a
// stream (only as far as needed, so that a caller may go on reading the
// stream after one group).  Over-long tokens in stream mode are consumed
// whole but kept only up to kMaxToken characters: no field of these files is
// legitimately longer.
class TokenSource {
 public:
  static constexpr size_t kMaxToken = 4096;

  explicit TokenSource(FILE* fp) : fp_(fp) {}
  /// text[length] must be a NUL: the scans stop on it instead of counting.
  TokenSource(char* text, size_t length) : p_(text), end_(text + length) {}

  /// The first character of the next token, or EOF; consumes only whitespace.
  int peek() {
    if (fp_ != nullptr) {
      int c;
      do c = getc_unlocked(fp_);
      while (c != EOF && is_space(c));
      if (c != EOF) ungetc(c, fp_);
      return c;
    }
    while (is_space(static_cast<unsigned char>(*p_))) ++p_;  // the NUL at end_ stops it
    return p_ < end_ ? static_cast<unsigned char>(*p_) : EOF;
  }

  /// The next token, NUL-terminated, or null at the end of the input.
  const char* next() {
    if (peek() == EOF) return nullptr;
    if (fp_ != nullptr) {
      token_.clear();
      int c;
      while ((c = getc_unlocked(fp_)) != EOF && !is_space(c)) {
        if (token_.size() < kMaxToken) token_.push_back(static_cast<char>(c));
      }
      return token_.c_str();
    }
    char* start = p_;
    for (;;) {
      while (!kTokenEnd.is[static_cast<unsigned char>(*p_)]) ++p_;
      if (*p_ != '\0' || p_ >= end_) break;
      ++p_;
    }
    // The buffer has one spare byte past its end, so the last token can be
    // terminated too.
    *p_ = '\0';
    if (p_ < end_) ++p_;
    return start;
  }

  // The numbers of a buffer are converted where they stand, without finding
  // the end of the token first; whatever the quick look does not take is
  // read the long way below.
  bool next_int(int* out) {
    if (fp_ == nullptr && peek() != EOF) {
      const char* t = p_;
      const char* d = t + (*t == '-' || *t == '+');
      int digits = 0;
      int v9 = 0;
      while (d[digits] >= '0' && d[digits] <= '9' && digits < 10)
        v9 = v9 * 10 + (d[digits++] - '0');
      if (digits > 0 && digits < 10 && take_token_ending_at(p_ + (d - t) + digits)) {
        *out = *t == '-' ? -v9 : v9;
        return true;
      }
    }
    const char* t = next();
    if (t == nullptr) return false;
    // Plain decimal numbers of up to nine digits cannot overflow: done here.
    const char* d = t + (*t == '-' || *t == '+');
    int digits = 0;
    int v9 = 0;
    while (d[digits] >= '0' && d[digits] <= '9' && digits < 10) v9 = v9 * 10 + (d[digits++] - '0');
    if (digits > 0 && digits < 10 && d[digits] == '\0') {
      *out = *t == '-' ? -v9 : v9;
      return true;
    }
    char* stop = nullptr;
    errno = 0;
    long v = strtol(t, &stop, 10);
    if (stop == t || *stop != '\0' || errno != 0 || v < INT_MIN || v > INT_MAX) return false;
    *out = static_cast<int>(v);
    return true;
  }

  bool next_float(float* out) {
    if (fp_ == nullptr && peek() != EOF) {
      float v = 0;
      const char* stop = scan_decimal(p_, &v);
      if (stop != nullptr && take_token_ending_at(p_ + (stop - p_))) {
        *out = v;
        return true;
      }
    }
    const char* t = next();
    if (t == nullptr) return false;
    if (fast_decimal(t, out)) return true;
    char* stop = nullptr;
    errno = 0;
    float v = strtof(t, &stop);
    // Infinities and NaNs are not frame numbers; a file holding them is
    // damaged, and letting them through would poison every later division.
    if (stop == t || *stop != '\0' || !std::isfinite(v)) return false;
    *out = v;
    return true;
  }

 private:
  // Buffer mode, p_ at the start of a token: when `stop` is where next()
  // would end that token (a blank, or the NUL that closes the buffer), takes
  // it as next() would and returns true.
  bool take_token_ending_at(char* stop) {
    unsigned char c = static_cast<unsigned char>(*stop);
    if (!kTokenEnd.is[c] || (c == '\0' && stop < end_)) return false;
    *stop = '\0';
    p_ = stop < end_ ? stop + 1 : stop;
    return true;
  }

  static bool fast_decimal(const char* t, float* out) {
    float v = 0;
    const char* stop = scan_decimal(t, &v);
    if (stop == nullptr || *stop != '\0') return false;
    *out = v;
    return true;
  }

  // "[-]d{1,7}[.d{0,6}]" is all the writer ever produces for sensible frame
  // numbers.  Such a value is m / 10^k with m < 10^13: both are exact
  // doubles, so the quotient is correctly rounded, and it lies too far from
  // any float rounding midpoint for the second rounding to float to differ
  // from strtof's.
  // Reads such a number from the start of t; returns where it stopped, or
  // null when t does not start with one.
  static const char* scan_decimal(const char* t, float* out) {
    const char* s = t;
    bool negative = false;
    if (*s == '-') {
      negative = true;
      ++s;
    }
    int64_t m = 0;
    int int_digits = 0;
    while (*s >= '0' && *s <= '9') {
      if (++int_digits > 7) return nullptr;
      m = m * 10 + (*s++ - '0');
    }
    if (int_digits == 0) return nullptr;
    int frac_digits = 0;
    if (*s == '.') {
      ++s;
      while (*s >= '0' && *s <= '9') {
        if (++frac_digits > 6) return nullptr;
        m = m * 10 + (*s++ - '0');
      }
    }
    static const double kPow10[] = {1e0, 1e1, 1e2, 1e3, 1e4, 1e5, 1e6};
    double v = static_cast<double>(m) / kPow10[frac_digits];
    *out = static_cast<float>(negative ? -v : v);
    return s;
  }

  FILE* fp_ = nullptr;
  std::string token_;
  char* p_ = nullptr;
  char* end_ = nullptr;
};

// ---------------------------------------------------------------------------
// Formatting into a buffer, with the exact output of "%d" and of "%f" of a
// float promoted to double.

// A growable text buffer written through a pointer: the writer formats
// every number of a file of many thousand records, and appending character
// by character to a std::string costs a capacity check each.
class TextOut {
 public:
  /// Room for at least `n` more characters; write them, then commit().
  char* room(size_t n) {
    if (used_ + n > capacity_) grow(used_ + n);
    return text_.get() + used_;
  }
  void commit(char* end) { used_ = static_cast<size_t>(end - text_.get()); }
  void put(const char* s) {
    size_t n = strlen(s);
    char* p = room(n);
    memcpy(p, s, n);
    commit(p + n);
  }
  /// Makes room for `n` characters in all, to save growing step by step.
  void reserve(size_t n) {
    if (n > capacity_) grow(n);
  }
  /// Empties the text and keeps the room.
  void clear() { used_ = 0; }
  const char* data() const { return text_.get(); }
  char* data() { return text_.get(); }
  size_t size() const { return used_; }

 private:
  // Grown without clearing: every character is written before it is read.
  void grow(size_t need) {
    size_t capacity = std::max(capacity_ * 2, need + 4096);
    std::unique_ptr<char[]> text = std::make_unique_for_overwrite<char[]>(capacity);
    if (used_ > 0) memcpy(text.get(), text_.get(), used_);
    text_ = std::move(text);
    capacity_ = capacity;
  }

  std::unique_ptr<char[]> text_;
  size_t capacity_ = 0;
  size_t used_ = 0;
};

// "%d" into p (room for 11 characters); returns the end.
char* put_int(char* p, int value) {
  char digits[16];
  int n = 0;
  unsigned u = value < 0 ? 0u - static_cast<unsigned>(value) : static_cast<unsigned>(value);
  do {
    digits[n++] = static_cast<char>('0' + u % 10);
    u /= 10;
  } while (u != 0);
  if (value < 0) *p++ = '-';
  while (n > 0) *p++ = digits[--n];
  return p;
}

// "00" "01" ... "99": the six decimals go out two at a time.
constexpr struct DigitPairs {
  char text[201] = {};
  constexpr DigitPairs() {
    for (int i = 0; i < 100; ++i) {
      text[2 * i] = static_cast<char>('0' + i / 10);
      text[2 * i + 1] = static_cast<char>('0' + i % 10);
    }
  }
} kDigitPairsTable;
constexpr const char* kDigitPairs = kDigitPairsTable.text;

// "%f" of value into p, which has room for kFloatRoom characters.  Exact
// when value * 10^6 is a whole number below 2^50: the product is then
// computed exactly (or within a rounding error far below the last printed
// digit), which covers every frame number with at most six decimals.  For
// anything else returns null and the caller asks the C library.
char* put_fixed6_fast(char* p, double value) {
  double scaled = value * 1e6;
  if (!(std::fabs(scaled) < 1125899906842624.0)) return nullptr;
  // Below 2^50 the conversion is exact for whole numbers, so this is the
  // test for one.
  int64_t signed_scaled = static_cast<int64_t>(scaled);
  if (static_cast<double>(signed_scaled) != scaled) return nullptr;
  uint64_t s = static_cast<uint64_t>(signed_scaled < 0 ? -signed_scaled : signed_scaled);
  if (std::signbit(value)) *p++ = '-';
  uint64_t whole = s / 1000000;
  uint32_t frac = static_cast<uint32_t>(s - whole * 1000000);
  char digits[24];
  int n = 0;
  do {
    digits[n++] = static_cast<char>('0' + whole % 10);
    whole /= 10;
  } while (whole != 0);
  while (n > 0) *p++ = digits[--n];
  *p++ = '.';
  uint32_t high = frac / 10000;
  uint32_t low = frac % 10000;
  memcpy(p, kDigitPairs + 2 * high, 2);
  memcpy(p + 2, kDigitPairs + 2 * (low / 100), 2);
  memcpy(p + 4, kDigitPairs + 2 * (low % 100), 2);
  return p + 6;
}

// "%f" of a float promoted to double is at most 47 characters (sign, 39
// digits, point, six decimals), "-nan" and "-inf" fewer.
constexpr size_t kFloatRoom = 64;

// "%f" of value into p, which has room for kFloatRoom characters.
char* put_fixed6(char* p, double value) {
  if (char* end = put_fixed6_fast(p, value)) return end;
  int n = snprintf(p, kFloatRoom, "%f", value);
  if (n < 0) return p;
  return p + std::min(static_cast<size_t>(n), kFloatRoom - 1);
}

void put_literal(TextOut& out, const char* s, size_t n) {
  char* p = out.room(n);
  memcpy(p, s, n);
  out.commit(p + n);
}

// ---------------------------------------------------------------------------
// The records of a read come from blocks of many, in file order: a file of
// a hundred thousand records would otherwise cost as many heap blocks taken
// and given back per cycle, and lie scattered over the heap for every later
// walk.  A record keeps its meaning (TaskRec_free releases it like any
// other); a block goes back to the heap once every record in it has been
// freed.  The selection cycle gives the records its entries keep a heap
// block of their own (TaskRec_unpool), so that a block is not kept for one
// survivor.
struct RecBlock {
  static constexpr size_t kRecords = 1024;
  alignas(TaskRec) unsigned char space[kRecords * sizeof(TaskRec)];
  size_t used = 0;  // records made so far
  size_t live = 0;  // made and not yet freed

  TaskRec* at(size_t i) { return reinterpret_cast<TaskRec*>(space) + i; }
  bool holds(const TaskRec* rec) const {
    auto p = reinterpret_cast<uintptr_t>(rec);
    auto b = reinterpret_cast<uintptr_t>(space);
    return p >= b && p < b + sizeof space;
  }
};

// Every block with records in it, by address; the last one made is filled
// first.
std::vector<RecBlock*> rec_blocks;
RecBlock* rec_current = nullptr;

RecBlock* block_of(const TaskRec* rec) {
  auto it = std::upper_bound(
      rec_blocks.begin(), rec_blocks.end(), rec, [](const TaskRec* r, const RecBlock* b) {
        return reinterpret_cast<uintptr_t>(r) < reinterpret_cast<uintptr_t>(b);
      });
  if (it == rec_blocks.begin()) return nullptr;
  RecBlock* b = *(it - 1);
  return b->holds(rec) ? b : nullptr;
}

TaskRec* pooled_rec() {
  if (rec_current == nullptr || rec_current->used == RecBlock::kRecords) {
    void* p = MA_malloc(sizeof(RecBlock), __LINE__, kUnit, 1);
    if (p == nullptr) return nullptr;
    RecBlock* b;
    try {
      rec_blocks.insert(
          std::upper_bound(rec_blocks.begin(), rec_blocks.end(), static_cast<RecBlock*>(p)),
          static_cast<RecBlock*>(p));
    } catch (const std::bad_alloc&) {
      MA_free(p, __LINE__, kUnit);
      return nullptr;
    }
    b = new (p) RecBlock;
    rec_current = b;
  }
  ++rec_current->live;
  return new (rec_current->at(rec_current->used++)) TaskRec;
}

// Ends a record of a block; false when the record is a heap block of its own.
bool release_pooled(TaskRec* rec) {
  RecBlock* b = block_of(rec);
  if (b == nullptr) return false;
  rec->~TaskRec();
  if (--b->live > 0) return true;
  if (b == rec_current) {
    b->used = 0;  // empty again: the next read fills it from the start
    return true;
  }
  rec_blocks.erase(std::lower_bound(rec_blocks.begin(), rec_blocks.end(), b));
  b->~RecBlock();
  MA_free(b, __LINE__, kUnit);
  return true;
}

// ---------------------------------------------------------------------------
// Reading groups.

enum class GroupRead { kGroup, kSkipped, kEnd };

// Reads one group.  kGroup: *out is the new group (it may have fewer records
// than its line claimed when the file stops early).  kSkipped: the group's job
// is gone; its records were read and dropped.  kEnd: nothing more can be
// read; *out may still hold a group that was read before the end was found.
GroupRead read_group(TokenSource& in, TaskGroup** out, bool* more) {
  *out = nullptr;
  *more = false;
  int c = in.peek();
  if (c == EOF) return GroupRead::kEnd;
  const char* name = in.next();
  // The name is kept for the trace only; the numbers after it may overwrite
  // the text it points into.
  char name_copy[1024];
  if (debug) snprintf(name_copy, sizeof name_copy, "%s", name);
  int index = 0, numrecs = 0, next_id = 0;
  if (!in.next_int(&index) || !in.next_int(&numrecs) || !in.next_int(&next_id)) {
    return GroupRead::kEnd;
  }
  if (debug)
    dbgpnt("%d   name(%s) id(%d) numrecs(%d) next_task_id(%d)\n", 4, name_copy, index, numrecs,
           next_id);

  Job* job = Job_by_index(index);
  TaskGroup* group = nullptr;
  if (job != nullptr) {
    group = TaskGroup_alloc(job, next_id);
    if (group == nullptr) return GroupRead::kEnd;
  }
  // Records are linked here at the tail as they come, rather than by
  // TaskRec_alloc, which looks for the tail from the head each time.
  TaskRec** tail = group != nullptr ? &group->tasks : nullptr;

  for (int i = 0; i < numrecs; ++i) {
    // A record begins with its id.  Anything else means the group line
    // claimed more records than there are: the next group starts here.
    c = in.peek();
    if (c == EOF) {
      *out = group;
      return GroupRead::kEnd;
    }
    if (!(c == '-' || c == '+' || (c >= '0' && c <= '9'))) break;
    int id = 0, dev_index = 0, retries = 0;
    float start = 0, end = 0, current = 0;
    const char* status = nullptr;
    if (!in.next_int(&id) || !in.next_float(&start) || !in.next_float(&end) ||
        !in.next_float(&current) || !in.next_int(&dev_index) || !in.next_int(&retries) ||
        (status = in.next()) == nullptr) {
      *out = group;
      return GroupRead::kEnd;
    }
    if (group == nullptr) continue;
    TaskRec* rec = pooled_rec();
    if (rec != nullptr) {
      rec->start = start;
      rec->end = end;
      rec->current = current;
      rec->dev = Dev_by_index(dev_index);
      rec->id = id;
      ISA_task_status(status, &rec->status);
    }
    if (rec == nullptr) {
      *out = group;
      return GroupRead::kEnd;
    }
    rec->group = group;
    rec->retries = retries;
    *tail = rec;
    tail = &rec->next;
  }
  *out = group;
  *more = true;
  return group != nullptr ? GroupRead::kGroup : GroupRead::kSkipped;
}

TaskGroup* read_all(TokenSource& in) {
  dbgpnt("Task_read--------------------------------------\n");
  TaskGroup* list = nullptr;
  for (;;) {
    TaskGroup* group = nullptr;
    bool more = false;
    GroupRead r = read_group(in, &group, &more);
    // Each group goes on the front: every read-and-rewrite cycle reverses the
    // order of the groups in the file, and the readers of the file live with
    // that.
    if (group != nullptr) {
      group->next = list;
      list = group;
    }
    if (r == GroupRead::kEnd) break;
  }
  dbgpnt("Task_read---------------------------------done\n\n");
  return list;
}

// ---------------------------------------------------------------------------
// Writing groups.

void format_group(TextOut& out, const TaskGroup* group, int numrecs) {
  put_literal(out, "\n", 1);
  // The group is found again by the job index; the name is a label, and one
  // with a blank in it would shift every field after it.
  const char* name = group->job->name.or_else("(null)");
  if (RJC_label_needs_form(name))
    out.put(RJC_label_form(name).c_str());
  else
    out.put(name);
  char* p = out.room(48);
  *p++ = '\t';
  *p++ = ' ';
  p = put_int(p, group->job->index);
  *p++ = '\t';
  *p++ = ' ';
  p = put_int(p, numrecs);
  *p++ = '\t';
  *p++ = ' ';
  p = put_int(p, group->next_task_id);
  *p++ = '\n';
  out.commit(p);
}

void format_record(TextOut& out, const TaskRec* rec) {
  // The whole line in one piece: three numbers, four integers of at most 11
  // characters, blanks and a status name of at most 8.
  char* p = out.room(3 * kFloatRoom + 64);
  *p++ = '\t';
  p = put_int(p, rec->id);
  *p++ = '\t';
  *p++ = ' ';
  p = put_fixed6(p, rec->start);
  *p++ = '\t';
  *p++ = ' ';
  p = put_fixed6(p, rec->end);
  *p++ = '\t';
  *p++ = ' ';
  p = put_fixed6(p, rec->current);
  *p++ = ' ';
  *p++ = ' ';
  p = put_int(p, rec->dev != nullptr ? rec->dev->index : 0);
  *p++ = '\t';
  *p++ = ' ';
  p = put_int(p, rec->retries);
  *p++ = '\t';
  const char* name = GetTaskStatusStr(rec->status);
  size_t n = strlen(name);
  memcpy(p, name, n);  // status names are at most 8 characters
  p += n;
  *p++ = '\n';
  out.commit(p);
}

// The daemon-alive test: the pid file names the daemon of a host.
int daemon_alive(const char* host) {
  char path[4096];
  snprintf(path, sizeof path, "%s/%s.pid", rndctl.location.or_else("."), host);
  int fd = open(path, O_RDONLY | O_CLOEXEC);
  if (fd < 0) return 0;
  int pid = 0;
  ssize_t n;
  do n = read(fd, &pid, sizeof pid);
  while (n < 0 && errno == EINTR);
  if (n != static_cast<ssize_t>(sizeof pid)) {
    dbgpnt("%s\n", strerror(n < 0 ? errno : EIO));
    if (n < 0) pid = 0;
  }
  close(fd);
  if (pid == 0) return 0;
  if (RJ_signal(host, pid, 0) == 0) {
    dbgpnt("process is alive --> %s:%d\n", host, pid);
    return 1;
  }
  dbgpnt("process is DEAD --> %s:%d\n", host, pid);
  return 0;
}

bool on_this_host(const Dev* dev) { return rj_dev_is_this_host(dev); }

// States in which the job's group leaves the task file.
bool job_is_over(const Job* job) {
  const Text& state = job->status;
  return state.is("aborted") || state.is("failed") || state.is("finished") || state.is("restarted");
}

void status_file_path(char* out, size_t size, const char* host) {
  snprintf(out, size, "%s/TSKSTAT/%s", rndctl.location.or_else("."), host);
}

// Reads a status file whole: lines "%s %d %d %s" (job name, job index,
// status code, output).  Stops at the first line that does not scan.
struct StatusLine {
  std::string job;
  int index;
  int status;
  std::string output;
};

bool read_status_file(const char* host, std::vector<StatusLine>* lines) {
  char path[4096];
  status_file_path(path, sizeof path, host);
  int fd = open(path, O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
  if (fd < 0) return false;
  std::string text;
  char chunk[65536];
  for (;;) {
    ssize_t n = read(fd, chunk, sizeof chunk);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    text.append(chunk, static_cast<size_t>(n));
  }
  close(fd);
  text.push_back('\0');
  TokenSource in(text.data(), text.size() - 1);
  for (;;) {
    const char* job = in.next();
    if (job == nullptr) break;
    StatusLine line{job, 0, 0, {}};
    if (!in.next_int(&line.index) || !in.next_int(&line.status)) break;
    const char* output = in.next();
    if (output == nullptr) break;
    line.output = output;
    lines->push_back(std::move(line));
  }
  return true;
}

}  // namespace

// ---------------------------------------------------------------------------
// Status names.

const char* const task_status_table[] = {"PENDING", "CRASHED", "RUNNING", "FINISHED", "ABORTED",
                                         "FAILED",  "STARTED", "STOPPED", nullptr};

const char* GetTaskStatusStr(int code) {
  // A code out of the table can only come from a damaged status file; it
  // reads as PENDING, as an unknown name does.
  if (code < 0 || code >= kStatusCount) return task_status_table[TASK_PENDING];
  return task_status_table[code];
}

int ISA_task_status(const char* text, int* code) {
  if (text == nullptr || code == nullptr) return 0;
  for (int i = 0; task_status_table[i] != nullptr; ++i) {
    // The first letters tell most names apart without a call.
    if (text[0] == task_status_table[i][0] && strcmp(text, task_status_table[i]) == 0) {
      *code = i;
      return 1;
    }
  }
  return 0;
}

// ---------------------------------------------------------------------------
// Groups and records.

TaskGroup* TaskGroup_alloc(Job* job, int next_task_id) {
  TaskGroup* group = MA_new<TaskGroup>(__LINE__, kUnit);
  if (group == nullptr) return nullptr;
  group->job = job;
  group->next_task_id = next_task_id;
  dbgpnt("TaskGroup_alloc 0x%x for \"%s\"\n", px(group),
         job != nullptr ? job->name.or_else("null") : "null");
  return group;
}

TaskRec* TaskRec_alloc(TaskGroup* group, float start, float end, float current, Dev* dev,
                       int status, const char* status_text, int id) {
  TaskRec* rec = MA_new<TaskRec>(__LINE__, kUnit);
  if (rec == nullptr) return nullptr;
  rec->group = group;
  rec->start = start;
  rec->end = end;
  rec->current = current;
  rec->dev = dev;
  rec->status = status;
  rec->id = id;
  if (status_text != nullptr) ISA_task_status(status_text, &rec->status);
  if (group != nullptr) {
    TaskRec** tail = &group->tasks;
    while (*tail != nullptr) tail = &(*tail)->next;
    *tail = rec;
  }
  return rec;
}

void TaskRec_free(TaskRec* rec) {
  if (rec == nullptr) return;
  if (rec->group != nullptr) {
    for (TaskRec** p = &rec->group->tasks; *p != nullptr; p = &(*p)->next) {
      if (*p == rec) {
        *p = rec->next;
        break;
      }
    }
  }
  // Only the entry that owns the record points back at it; an entry that
  // has since taken another record keeps that one.
  if (rec->task != nullptr && rec->task->rec == rec) rec->task->rec = nullptr;
  dbgpnt("TaskRec_free 0x%x\n", px(rec));
  rec->id = -1;
  rec->status = TASK_PENDING;
  if (release_pooled(rec)) return;
  MA_delete(rec, __LINE__, kUnit);
}

TaskRec* TaskRec_unpool(TaskRec** link) {
  if (link == nullptr || *link == nullptr) return nullptr;
  TaskRec* rec = *link;
  if (block_of(rec) == nullptr) return rec;
  TaskRec* copy = MA_new<TaskRec>(__LINE__, kUnit, *rec);
  if (copy == nullptr) return rec;  // stays where it is, and keeps its block
  // Nothing else points at a record just read but its group's list (and an
  // entry that owns it, if any).
  if (rec->task != nullptr && rec->task->rec == rec) rec->task->rec = copy;
  *link = copy;
  rec->task = nullptr;
  rec->group = nullptr;
  rec->next = nullptr;
  rec->id = -1;
  rec->status = TASK_PENDING;
  release_pooled(rec);
  return copy;
}

void TaskRec_freeOnly(TaskRec* rec) {
  if (rec == nullptr) return;
  if (rec->keep == 2) {
    rec->keep = 0;
    return;
  }
  TaskRec_free(rec);
}

void TaskGroup_free(TaskGroup** list, TaskGroup* group) {
  if (group == nullptr) return;
  if (list != nullptr) {
    for (TaskGroup** p = list; *p != nullptr; p = &(*p)->next) {
      if (*p == group) {
        *p = group->next;
        break;
      }
    }
  }
  dbgpnt("TaskGroup_free 0x%x {\n", px(group));
  TaskRec* rec = group->tasks;
  while (rec != nullptr) {
    TaskRec* next = rec->next;
    if (rec->keep == 1) {
      rec->group = nullptr;  // the group's list is being taken apart anyway
      TaskRec_freeOnly(rec);
    } else {
      // Survives, owned by its running-task entry.
      rec->group = nullptr;
      rec->next = nullptr;
    }
    rec = next;
  }
  group->tasks = nullptr;
  dbgpnt("}\n");
  MA_delete(group, __LINE__, kUnit);
}

void TaskGroup_free_all(TaskGroup** list) {
  if (list == nullptr) return;
  while (*list != nullptr) {
    TaskGroup* group = *list;
    // A record that a running-task entry has taken over stays with it, and
    // one marked 2 is released only by a second call: both survive.
    // Everything else read from the file goes now.
    TaskRec* rec = group->tasks;
    while (rec != nullptr) {
      TaskRec* next = rec->next;
      bool owned = rec->task != nullptr && rec->task->rec == rec;
      if (rec->keep == 2) {
        TaskRec_freeOnly(rec);
      } else if (!owned) {
        rec->keep = 1;
      }
      rec = next;
    }
    TaskGroup_free(list, group);
  }
}

int TaskGroup_find(TaskGroup* group, const char* host) {
  if (group == nullptr || group->job == nullptr || host == nullptr) return 0;
  for (TaskRec* rec = group->tasks; rec != nullptr; rec = rec->next) {
    if (rec->dev != nullptr && rec->dev->host_name.is(host)) return 1;
  }
  return 0;
}

int Task_find(TaskGroup* groups, const char* host) {
  for (TaskGroup* g = groups; g != nullptr; g = g->next) {
    if (TaskGroup_find(g, host)) return 1;
  }
  return 0;
}

TaskGroup* TaskGroup_by_job(TaskGroup* groups, Job* job) {
  for (TaskGroup* g = groups; g != nullptr; g = g->next) {
    if (g->job == job) return g;
  }
  return nullptr;
}

// ---------------------------------------------------------------------------
// Reading and writing the task file.

TaskGroup* TaskGroup_read(FILE* fp) {
  if (fp == nullptr) return nullptr;
  TokenSource in(fp);
  TaskGroup* group = nullptr;
  bool more = false;
  read_group(in, &group, &more);
  return group;
}

TaskGroup* Task_read(FILE* fp) {
  if (fp == nullptr) return nullptr;
  // The buffer is kept from one read to the next: a fresh one of some
  // megabytes per cycle is fresh pages for the kernel to map every time,
  // and giving it back makes the allocator sweep every small block freed
  // since.  Nothing read keeps a pointer into it.
  static TextOut text;
  text.clear();
  struct stat st;
  if (fstat(fileno(fp), &st) == 0 && S_ISREG(st.st_mode) && st.st_size > 0)
    text.reserve(static_cast<size_t>(st.st_size) + 65536 + 1);
  // Straight into the buffer, which grows only if the file holds more than
  // it said.
  for (;;) {
    char* p = text.room(65536);
    size_t n = fread(p, 1, 65536, fp);
    if (n == 0) break;
    text.commit(p + n);
  }
  char* end = text.room(1);
  *end = '\0';
  TokenSource in(text.data(), text.size());
  return read_all(in);
}

namespace {

// Appends the group's text; false when the group is not written at all.
bool append_group(TextOut& out, const TaskGroup* group) {
  if (group == nullptr || group->tasks == nullptr || group->job == nullptr) return false;
  int numrecs = 0;
  for (TaskRec* rec = group->tasks; rec != nullptr; rec = rec->next) ++numrecs;
  format_group(out, group, numrecs);
  for (TaskRec* rec = group->tasks; rec != nullptr; rec = rec->next) {
    format_record(out, rec);
    if (debug) {
      dbgpnt("\t%d\t %.1f\t %.1f\t%.1f %d\t %d\t%s\n", rec->id, rec->start, rec->end, rec->current,
             rec->dev != nullptr ? rec->dev->index : 0, rec->retries,
             GetTaskStatusStr(rec->status));
    }
  }
  return true;
}

bool write_text(FILE* fp, const TextOut& text) {
  if (fwrite(text.data(), 1, text.size(), fp) == text.size()) return true;
  perror("in TaskGroup_write");
  return false;
}

}  // namespace

int TaskGroup_write(FILE* fp, TaskGroup* group) {
  if (fp == nullptr) return 0;
  TextOut out;
  if (!append_group(out, group)) return 0;
  return write_text(fp, out) ? 1 : -1;
}

int Task_write(FILE* fp, TaskGroup* groups) {
  dbgpnt("Task_write--------------------------------------\n");
  if (fp == nullptr) return -1;
  // The whole file in one write: the stream is line-buffered, and a write
  // per group costs a system call each on a file of thousands of groups.
  // Kept from one write to the next, for the reasons the reader keeps its
  // buffer.
  static TextOut out;
  out.clear();
  // A record's line is some fifty characters; reserving for all of them at
  // once saves copying the text as it grows.
  size_t records = 0;
  for (TaskGroup* g = groups; g != nullptr; g = g->next)
    for (TaskRec* rec = g->tasks; rec != nullptr; rec = rec->next) ++records;
  out.reserve(records * 64 + 4096);
  for (TaskGroup* g = groups; g != nullptr; g = g->next) append_group(out, g);
  if (!write_text(fp, out)) return -1;
  dbgpnt("Task_write---------------------------------done\n\n");
  return 0;
}

int TaskGroup_write_dump(TaskGroup* group) {
  if (group == nullptr || group->tasks == nullptr || group->job == nullptr) return 0;
  int numrecs = 0;
  for (TaskRec* rec = group->tasks; rec != nullptr; rec = rec->next) ++numrecs;
  if (printf("\n%s   %d  %d  %d\n", group->job->name.or_else("(null)"), group->job->index, numrecs,
             group->next_task_id) < 0) {
    perror("in TaskGroup_write_dump");
    return -1;
  }
  for (TaskRec* rec = group->tasks; rec != nullptr; rec = rec->next) {
    if (printf("\t%d   %f  %f  %f  %d  %d %s\n", rec->id, rec->start, rec->end, rec->current,
               rec->dev != nullptr ? rec->dev->index : 0, rec->retries,
               GetTaskStatusStr(rec->status)) < 0) {
      perror("in TaskGroup_write_dump");
      return -1;
    }
  }
  return 1;
}

int Task_write_dump(TaskGroup* groups) {
  for (TaskGroup* g = groups; g != nullptr; g = g->next) {
    if (TaskGroup_write_dump(g) < 0) return -1;
  }
  fflush(stdout);
  return 0;
}

void Task_file_dump() {
  lock_fileop(FILE_TASKS, 1);
  FILE* fp = read_fileop(FILE_TASKS);
  if (fp != nullptr) {
    TaskGroup* groups = Task_read(fp);
    Task_write_dump(groups);
    (void)close_fileop(FILE_TASKS);  // read only: nothing to lose
    TaskGroup_free_all(&groups);
  }
  lock_fileop(FILE_TASKS, 0);
}

int Task_file_search(const char* host) {
  int found = 0;
  lock_fileop(FILE_TASKS, 1);
  FILE* fp = read_fileop(FILE_TASKS);
  if (fp != nullptr) {
    TaskGroup* groups = Task_read(fp);
    found = Task_find(groups, host);
    (void)close_fileop(FILE_TASKS);  // read only: nothing to lose
    TaskGroup_free_all(&groups);
  }
  lock_fileop(FILE_TASKS, 0);
  return found;
}

int Task_file_rewrite(const std::function<bool(TaskGroup** groups)>& change) {
  lock_fileop(FILE_TASKS, 1);
  FILE* fp = update_fileop(FILE_TASKS);
  if (fp == nullptr) {
    lock_fileop(FILE_TASKS, 0);
    return -1;
  }
  TaskGroup* groups = Task_read(fp);
  int result = 0;
  if (change(&groups)) {
    rewind_fileop(FILE_TASKS);
    bool written = Task_write(fp, groups) >= 0;
    result = close_and_truncate_fileop(FILE_TASKS) == 0 && written ? 1 : -1;
  } else {
    // Nothing changed: a rewrite would only turn the groups round.
    (void)close_fileop(FILE_TASKS);  // read only: nothing to lose
  }
  lock_fileop(FILE_TASKS, 0);
  TaskGroup_free_all(&groups);
  return result;
}

void Task_file_update(Job* job) {
  dbgpnt("\nTask_file_update-----------------------------\n");
  TaskAfterLock after;
  (void)Task_file_rewrite([&](TaskGroup** list) {  // reported there; the next update writes again
    TaskGroup*& groups = *list;
    bool job_seen = false;
    TaskGroup* g = groups;
    while (g != nullptr) {
      TaskGroup* next = g->next;
      dbgpnt("\"%s\" -> %s\n", g->job->name.or_else("(null)"), g->job->status.or_else("(null)"));
      if (job != nullptr && g->job == job) {
        job_seen = true;
        if (Task_group_rebuilt(job, g)) {
          // Built again since this host last looked: nothing this host holds
          // belongs to it, not even the end of the job it knew.
          Task_mark_rebuilt(job);
        } else if (job_is_over(job)) {
          dbgpnt("free up task info\n");
          while (g->tasks != nullptr) TaskRec_freeOnly(g->tasks);
          TaskGroup_free(&groups, g);
        } else {
          std::unordered_map<int, TASK*> mine;  // first entry of each id, as a list walk finds it
          for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
            if (e->job == job && e->rec != nullptr) mine.emplace(e->rec->id, e);
          }
          for (TaskRec* rec = g->tasks; rec != nullptr; rec = rec->next) {
            auto it = mine.find(rec->id);
            if (it == mine.end() || !Task_same_rec(it->second->rec, rec)) continue;
            TASK* e = it->second;
            if (Task_settle(e, rec, &after) != 0) {
              rec->current = e->rec->current;
              dbgpnt("%d) %s %.2f\n", rec->id, GetTaskStatusStr(rec->status), rec->current);
            }
          }
        }
      }
      g = next;
    }
    // The group left the file while this host still holds entries of a job it
    // thinks under way: the group was cleared behind its back (a restart it
    // did not see).  A job over in this host's eyes dropped it itself.
    if (job != nullptr && !job_seen && !job_is_over(job) && Task_group_rebuilt(job, nullptr)) {
      Task_mark_rebuilt(job);
    }
    return true;
  });
  after.run();
  dbgpnt("Task_file_update-------------------------DONE\n");
}

int Task_file_check(Job* job) {
  dbgpnt("\nTask_file_check-----------------------------\n");
  int set_back = 0;
  (void)Task_file_rewrite([&](TaskGroup** groups) {  // reported there
    TaskGroup* g = TaskGroup_by_job(*groups, job);
    if (g != nullptr) {
      for (TaskRec* rec = g->tasks; rec != nullptr; rec = rec->next) {
        rec->retries = 0;
        if ((rec->status == TASK_RUNNING || rec->status == TASK_STARTED) && rec->dev != nullptr &&
            rec->dev->host_name.c_str() != nullptr && !daemon_alive(rec->dev->host_name.c_str())) {
          rec->status = TASK_PENDING;
          set_back = 1;
          dbgpnt("set job pending failed daemon on \"%s\"\n", rec->dev->host_name.c_str());
        }
      }
    }
    return true;
  });
  if (set_back) Job_wake_other_hosts(job);
  dbgpnt("Task_file_check-------------------------DONE\n");
  return set_back;
}

void Editor_load_Tasks() {
  while (rndctl.tasks != nullptr) TASK_free(rndctl.tasks);
  lock_fileop(FILE_TASKS, 1);
  FILE* fp = read_fileop(FILE_TASKS);
  if (fp == nullptr) {
    lock_fileop(FILE_TASKS, 0);
    return;
  }
  TaskGroup* groups = Task_read(fp);
  for (TaskGroup* g = groups; g != nullptr; g = g->next) {
    for (TaskRec** link = &g->tasks; *link != nullptr; link = &(*link)->next)
      Task_add(g->job, TaskRec_unpool(link));
  }
  (void)close_fileop(FILE_TASKS);  // read only: nothing to lose
  lock_fileop(FILE_TASKS, 0);
  TaskGroup_free_all(&groups);
}

// ---------------------------------------------------------------------------
// Status files.

void Task_update_status() {
  const char* host = rndctl.host.c_str();
  if (host == nullptr) return;
  char dir[4096];
  snprintf(dir, sizeof dir, "%s/TSKSTAT", rndctl.location.or_else("."));
  if (mkdir(dir, 0775) != 0 && errno != EEXIST) {
    perror("in Task_update_status");
    return;
  }
  char path[4096];
  status_file_path(path, sizeof path, host);
  // The control directory is writable by every user of the farm: refuse to
  // follow a link planted where the file should be.
  int fd = open(path, O_RDWR | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0666);
  if (fd < 0) {
    perror("in Task_update_status");
    return;
  }
  FILE* fp = fdopen(fd, "w+");
  if (fp == nullptr) {
    close(fd);
    return;
  }
  for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
    if (e->job == nullptr || e->rec == nullptr || e->stale) continue;
    if (!on_this_host(e->rec->dev)) continue;
    const std::string label = RJC_label_form(e->job->name.or_else("(null)"));
    fprintf(fp, "%s %d %d %s\n", label.c_str(), e->job->index, e->rec->status,
            e->output.or_else("-"));
  }
  if (fclose(fp) != 0) perror("in Task_update_status");
}

void Task_sfile_dump(Dev* dev) {
  if (dev == nullptr || dev->host_name.c_str() == nullptr) return;
  std::vector<StatusLine> lines;
  if (!read_status_file(dev->host_name.c_str(), &lines)) return;
  for (const StatusLine& line : lines) {
    printf("\"%s\" is %s on %s, output: %s\n", line.job.c_str(), GetTaskStatusStr(line.status),
           dev->host_name.c_str(), line.output.c_str());
  }
  fflush(stdout);
}

char* Task_current_filenames(Job* job, Dev* dev) {
  static char names[1025];
  if (job == nullptr || dev == nullptr) return nullptr;
  names[0] = '\0';
  if (dev->host_name.c_str() == nullptr) return names;
  std::vector<StatusLine> lines;
  if (!read_status_file(dev->host_name.c_str(), &lines)) return names;
  size_t used = 0;
  for (const StatusLine& line : lines) {
    if (line.index != job->index || line.output == "-") continue;
    size_t add = line.output.size() + 1;
    if (used + add > sizeof names - 1) break;
    memcpy(names + used, line.output.data(), line.output.size());
    used += line.output.size();
    names[used++] = ' ';
    names[used] = '\0';
  }
  return names;
}
