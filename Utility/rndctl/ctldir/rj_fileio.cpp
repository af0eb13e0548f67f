// Shared files: the path table, the open and close operations, and the
// atomic rewrite that every writer goes through.  The lock directories are
// rj_lockdir's.
//
// An update stream is a stdio stream over our own functions: reads come
// from the file as it was at the open (its descriptor stays open), writes
// land in memory.  The close compares the new contents with the old ones
// (sizes first) and only when they differ writes them to a temporary file
// beside the old one, forces it to disk and renames it over the old one.
// Callers keep their shape (read, rewind, write to the same stream, close
// with truncation) and still can never leave a torn file: a torn control
// file stops every daemon of the farm.
#include "Utility/rndctl/ctldir/rj_fileio.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <string>

#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"

namespace {

constexpr const char* kUnit = "Utility/rndctl/rj_fileio";

struct FdCloser {
  int fd = -1;
  ~FdCloser() {
    if (fd >= 0) close(fd);
  }
};

// The state behind an update stream.  The old contents are read whole at
// the open and the file is closed at once: a file that this process still
// holds open when the new one is renamed over it is not replaced in one
// step by a network file system client (nor by a file system in user
// space): the client first moves the open file aside under a hidden name,
// and for that moment the file is not there for the other hosts.
struct UpdateStream {
  std::string old;        // the file as it was at the open
  struct stat old_st {};  // and its mode and owner then
  std::string out;        // the new contents, from the start of the file
  int64_t pos = 0;        // the stream's position
  bool written = false;
  bool rewound = false;  // rewound and written nothing: the new contents are empty
};

struct FileRecord {
  // The room of the last update stream's new contents, kept for the next
  // one: a rewrite of a file of megabytes would otherwise take fresh pages
  // from the kernel every time.
  std::string spare_out;
  char* path = nullptr;                  // "%s/%s": control directory, file name (owned)
  char* lock_path = nullptr;             // "%s/%s.lock" (owned)
  FILE* stream = nullptr;                // open between an open and a close operation (owned)
  std::unique_ptr<UpdateStream> update;  // behind `stream` after update_fileop
};

FileRecord files[FILE_COUNT];

bool valid_index(int index) { return index >= 0 && index < FILE_COUNT; }

// Heap copy of a path through the checking allocator.
char* copy_path(const std::string& path, int line) {
  if (path.empty()) return nullptr;
  char* p = static_cast<char*>(MA_malloc(path.size() + 1, line, kUnit, 1));
  if (p != nullptr) memcpy(p, path.c_str(), path.size() + 1);
  return p;
}

ssize_t pread_full(int fd, char* buf, size_t size, int64_t at) {
  size_t done = 0;
  while (done < size) {
    ssize_t n =
        pread(fd, buf + done, size - done, static_cast<off_t>(at) + static_cast<off_t>(done));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return -1;
    if (n == 0) break;
    done += static_cast<size_t>(n);
  }
  return static_cast<ssize_t>(done);
}

// Appends the old file's bytes [from, to) to `out`; past the old end, zeros
// (what a write past the end of a file leaves between).
bool append_old(const UpdateStream& u, std::string& out, int64_t from, int64_t to) {
  const int64_t have = static_cast<int64_t>(u.old.size());
  if (from < have) {
    int64_t upto = to < have ? to : have;
    out.append(u.old, static_cast<size_t>(from), static_cast<size_t>(upto - from));
    from = upto;
  }
  if (from < to) out.append(static_cast<size_t>(to - from), '\0');
  return true;
}

int64_t old_size(const UpdateStream& u) { return static_cast<int64_t>(u.old.size()); }

ssize_t update_read(void* cookie, char* buf, size_t size) {
  auto* u = static_cast<UpdateStream*>(cookie);
  const int64_t have = static_cast<int64_t>(u->old.size());
  if (u->pos >= have) return 0;
  size_t n = static_cast<size_t>(have - u->pos) < size ? static_cast<size_t>(have - u->pos) : size;
  memcpy(buf, u->old.data() + u->pos, n);
  u->pos += static_cast<int64_t>(n);
  return static_cast<ssize_t>(n);
}

ssize_t update_write(void* cookie, const char* buf, size_t size) {
  auto* u = static_cast<UpdateStream*>(cookie);
  // Never let an exception out into stdio: a write that cannot be kept is
  // a write error of the stream, and its close reports it.
  try {
    if (static_cast<int64_t>(u->out.size()) < u->pos &&
        !append_old(*u, u->out, static_cast<int64_t>(u->out.size()), u->pos)) {
      return -1;
    }
    size_t at = static_cast<size_t>(u->pos);
    if (at == u->out.size()) {
      // The usual case, a whole file written from its start: appended
      // without first filling the room with zeros.
      if (u->out.capacity() < at + size) u->out.reserve(std::max(at + size, u->old.size()));
      u->out.append(buf, size);
    } else {
      if (at + size > u->out.size()) u->out.resize(at + size);
      memcpy(&u->out[at], buf, size);
    }
  } catch (const std::bad_alloc&) {
    errno = ENOMEM;
    return -1;
  }
  u->pos += static_cast<int64_t>(size);
  u->written = true;
  return static_cast<ssize_t>(size);
}

int update_seek(void* cookie, off64_t* offset, int whence) {
  auto* u = static_cast<UpdateStream*>(cookie);
  int64_t base = 0;
  if (whence == SEEK_CUR) base = u->pos;
  if (whence == SEEK_END) {
    int64_t size = old_size(*u);
    base = u->written && static_cast<int64_t>(u->out.size()) > size
               ? static_cast<int64_t>(u->out.size())
               : size;
  }
  if (base + *offset < 0) {
    errno = EINVAL;
    return -1;
  }
  u->pos = base + *offset;
  *offset = u->pos;
  if (whence == SEEK_SET) u->rewound = true;
  return 0;
}

// The record owns the state; the stream's close leaves it to the record.
int update_close(void*) { return 0; }

const cookie_io_functions_t kUpdateFunctions = {update_read, update_write, update_seek,
                                                update_close};

void report_write_failure(const char* path, int error) {
  EDuprintf("ERROR: failed to write %s: %s", path, strerror(error));
  dbgpnt("ERROR: failed to write %s: %s\n", path, strerror(error));
}

// Forces a directory entry change (a rename) to disk.  Failing that, the new
// contents are in place but might not survive a crash of the file server;
// nothing the caller could do about it, so it is traced, not returned.
void sync_directory(const char* path) {
  std::string dir(path);
  size_t slash = dir.rfind('/');
  dir = slash == std::string::npos ? "." : slash == 0 ? "/" : dir.substr(0, slash);
  FdCloser d{open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)};
  if (d.fd < 0 || (fsync(d.fd) != 0 && errno != EINVAL)) {
    dbgpnt("fsync of directory %s: %s\n", dir.c_str(), strerror(errno));
  }
}

// Replaces the file `path` (which held `old`, with the mode and owner of
// `st`) by `data`: 1 written, 0 unchanged (nothing touched), -1 failed and
// reported (old file stands).
int replace_file(const char* path, const std::string& old, const struct stat& st,
                 const std::string& data) {
  if (old == data) return 0;
  const bool have_old = st.st_ino != 0;

  std::string temp = std::string(path) + ".new.XXXXXX";
  int fd = mkostemp(&temp[0], O_CLOEXEC);
  if (fd < 0) {
    report_write_failure(path, errno);
    return -1;
  }
  int error = 0;
  if (have_old) {
    // The file keeps its mode (and, where we may, its owner): other users'
    // daemons and editors must still be able to rewrite it.
    if (fchmod(fd, st.st_mode & 07777) != 0)
      dbgpnt("fchmod %s: %s\n", temp.c_str(), strerror(errno));
    if (geteuid() == 0 && fchown(fd, st.st_uid, st.st_gid) != 0) {
      dbgpnt("fchown %s: %s\n", temp.c_str(), strerror(errno));
    }
  }
  size_t done = 0;
  while (error == 0 && done < data.size()) {
    ssize_t n = write(fd, data.data() + done, data.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0)
      error = n < 0 ? errno : EIO;
    else
      done += static_cast<size_t>(n);
  }
  if (error == 0 && fsync(fd) != 0) error = errno;
  // A network file system may report a failed write only here.
  if (close(fd) != 0 && error == 0) error = errno;
  if (error == 0 && rename(temp.c_str(), path) != 0) error = errno;
  if (error != 0) {
    unlink(temp.c_str());
    report_write_failure(path, error);
    errno = error;
    return -1;
  }
  sync_directory(path);
  return 1;
}

void report_open_failure(int index, const char* verb) {
  // "ERROR: failed to <verb> <path>" to the user, stdout and the trace, with
  // the system's reason; both open paths say "in read_fileop", which log
  // readers match.
  const char* path = files[index].path != nullptr ? files[index].path : "";
  int saved_errno = errno;
  EDuprintf("ERROR: failed to %s %s", verb, path);
  printf("ERROR: failed to %s %s\n", verb, path);
  errno = saved_errno;
  perror("in read_fileop");
  dbgpnt("ERROR: failed to %s %s\n", verb, path);
}

// Closes the stream of a record.  The new contents of an update stream that
// was written end at the stream's position (a close with truncation) or
// where the longer of old and new ends (a plain close, which cuts nothing).
int close_record(int index, bool cut_at_position) {
  if (!valid_index(index) || index == FILE_ACCESS) return 0;
  FileRecord& rec = files[index];
  if (rec.stream == nullptr) return 0;
  int result = 0;
  int error = 0;
  errno = 0;
  if (fflush(rec.stream) != 0 || ferror(rec.stream)) error = errno != 0 ? errno : EIO;
  std::unique_ptr<UpdateStream> update = std::move(rec.update);
  if (fclose(rec.stream) != 0 && error == 0 && !update) error = errno;
  rec.stream = nullptr;
  if (error != 0) {
    report_write_failure(rec.path, error);
    return -1;
  }
  if (update && (update->written || update->rewound)) {
    int64_t end = update->pos;
    if (!cut_at_position) {
      int64_t size = old_size(*update);
      end = static_cast<int64_t>(update->out.size()) > size
                ? static_cast<int64_t>(update->out.size())
                : size;
    }
    std::string& data = update->out;
    try {
      if (static_cast<int64_t>(data.size()) > end) data.resize(static_cast<size_t>(end));
      if (static_cast<int64_t>(data.size()) < end &&
          !append_old(*update, data, static_cast<int64_t>(data.size()), end)) {
        report_write_failure(rec.path, errno);
        return -1;
      }
    } catch (const std::bad_alloc&) {
      report_write_failure(rec.path, ENOMEM);
      return -1;
    }
    if (replace_file(rec.path, update->old, update->old_st, data) < 0) result = -1;
  }
  if (update) rec.spare_out = std::move(update->out);
  return result;
}

// Reads the whole file as it stands (creating it when absent) for an
// update, and closes it again.
bool read_old(int index, UpdateStream* u) {
  int fd;
  do {
    fd = open(files[index].path, O_RDONLY | O_CREAT | O_CLOEXEC, 0666);
  } while (fd < 0 && errno == EINTR);
  if (fd < 0) return false;
  FdCloser closer{fd};
  if (fstat(fd, &u->old_st) != 0) return false;
  try {
    u->old.resize(static_cast<size_t>(u->old_st.st_size));
    ssize_t n = pread_full(fd, u->old.data(), u->old.size(), 0);
    if (n < 0) return false;
    u->old.resize(static_cast<size_t>(n));
    // Grown since the stat: read on to its end.
    char chunk[65536];
    for (;;) {
      n = pread_full(fd, chunk, sizeof chunk, static_cast<int64_t>(u->old.size()));
      if (n < 0) return false;
      if (n == 0) break;
      u->old.append(chunk, static_cast<size_t>(n));
    }
  } catch (const std::bad_alloc&) {
    errno = ENOMEM;
    return false;
  }
  return true;
}

bool ensure_paths(int index) {
  if (files[index].path == nullptr) init_fileop();
  return files[index].path != nullptr;
}

void forget_stream(FileRecord& rec) {
  if (rec.stream != nullptr) {
    // A previous open of the same file was never closed: do not leak it.
    fclose(rec.stream);
  }
  rec.stream = nullptr;
  rec.update.reset();
}

void after_open(FILE* fp) {
  // Fully buffered: whole files are read or rewritten under their lock, and
  // a line-buffered stream would cost one system call per line of a large
  // job file.
  setvbuf(fp, nullptr, _IOFBF, 1 << 16);
}

}  // namespace

int init_fileop() {
  if (rndctl.location.none() || rndctl.location.c_str()[0] == '\0') rndctl.location.set(".");
  for (int i = 0; i < FILE_COUNT; i++) {
    MA_free(files[i].path, __LINE__, kUnit);
    MA_free(files[i].lock_path, __LINE__, kUnit);
    files[i].path = copy_path(rj_control_path(i), __LINE__);
    files[i].lock_path = copy_path(rj_lock_path(i), __LINE__);
  }
  // Only the first initialisation sees the umask the process started with;
  // a later one (after fileop_reset) would see our own.
  mode_t previous = umask(1);
  rj_note_original_umask(previous);

  FileRecord& log = files[FILE_ACCESS];
  if (log.stream == nullptr) {
    // Close-on-exec: the log stays open for the life of the process and must
    // not leak into the render programs it starts.
    log.stream = fopen(log.path, "a+e");
    if (log.stream == nullptr) {
      int saved_errno = errno;
      EDuprintf("ERROR: failed to open %s", log.path);
      printf("ERROR: failed to open %s\n", log.path);
      errno = saved_errno;
      perror("in init_fileop");
    } else {
      fprintf(log.stream, "\n\n *** Start of new process entries ***\n\n");
      fflush(log.stream);
    }
  }
  rj_set_access_stream(log.stream);
  return 1;
}

FILE* read_fileop(int index) {
  if (!valid_index(index) || !ensure_paths(index)) return nullptr;
  FileRecord& rec = files[index];
  forget_stream(rec);
  FILE* fp = fopen(rec.path, "r+e");
  if (fp == nullptr) fp = fopen(rec.path, "w+e");
  if (fp == nullptr) {
    report_open_failure(index, "open");
    return nullptr;
  }
  rec.stream = fp;
  after_open(fp);
  return fp;
}

FILE* update_fileop(int index) {
  if (!valid_index(index) || !ensure_paths(index)) return nullptr;
  FileRecord& rec = files[index];
  forget_stream(rec);
  auto update = std::make_unique<UpdateStream>();
  update->out = std::move(rec.spare_out);
  update->out.clear();
  FILE* fp =
      read_old(index, update.get()) ? fopencookie(update.get(), "r+", kUpdateFunctions) : nullptr;
  if (fp == nullptr) {
    report_open_failure(index, "create");
    sounder(3);
    return nullptr;
  }
  rec.stream = fp;
  rec.update = std::move(update);
  after_open(fp);
  return fp;
}

void rewind_fileop(int index) {
  if (!valid_index(index) || files[index].stream == nullptr) return;
  FILE* fp = files[index].stream;
  dbgpnt("rewind 0x%x\n", static_cast<unsigned>(reinterpret_cast<uintptr_t>(fp)));
  rewind(fp);
}

int close_fileop(int index) { return close_record(index, false); }

int close_and_truncate_fileop(int index) { return close_record(index, true); }

int fileop_rewrite(int index, bool (*change)(FILE* in, FILE* out, void* context), void* context) {
  if (!valid_index(index) || index == FILE_ACCESS || change == nullptr || !ensure_paths(index)) {
    return -1;
  }
  FileopLock lock(index);
  if (!lock.held()) return -1;
  UpdateStream old;
  if (!read_old(index, &old)) {
    report_open_failure(index, "create");
    return -1;
  }
  struct InCloser {
    void operator()(FILE* f) const { fclose(f); }
  };
  // fmemopen refuses an empty buffer: an empty file reads as /dev/null.
  std::unique_ptr<FILE, InCloser> in(
      old.old.empty() ? fopen("/dev/null", "re")
                      : fmemopen(const_cast<char*>(old.old.data()), old.old.size(), "r"));
  if (!in) {
    report_open_failure(index, "open");
    return -1;
  }
  char* buffer = nullptr;
  size_t length = 0;
  FILE* out = open_memstream(&buffer, &length);
  if (out == nullptr) {
    report_write_failure(files[index].path, errno);
    return -1;
  }
  errno = 0;
  bool changed = change(in.get(), out, context);
  bool out_failed = ferror(out) != 0;
  int close_result = fclose(out);  // sets buffer and length
  std::unique_ptr<char, decltype(&free)> owned(buffer, &free);
  if (!changed) return 0;
  if (out_failed || close_result != 0) {
    report_write_failure(files[index].path, errno != 0 ? errno : ENOMEM);
    return -1;
  }
  std::string data(buffer != nullptr ? buffer : "", length);
  return replace_file(files[index].path, old.old, old.old_st, data);
}

const char* fileop_path(int index) {
  if (!valid_index(index) || !ensure_paths(index)) return nullptr;
  return files[index].path;
}

const char* fileop_lock_path(int index) {
  if (!valid_index(index) || !ensure_paths(index)) return nullptr;
  return files[index].lock_path;
}

FILE* fileop_access_stream() { return files[FILE_ACCESS].stream; }

void fileop_reset() {
  rj_set_access_stream(nullptr);
  for (FileRecord& rec : files) {
    forget_stream(rec);
    MA_free(rec.path, __LINE__, kUnit);
    MA_free(rec.lock_path, __LINE__, kUnit);
    rec.path = nullptr;
    rec.lock_path = nullptr;
  }
}
