// Locked file operations on the shared control directory.
//
// Every shared file has a fixed index; its path and the path of its lock
// directory are built once per process.  A lock is a directory made with
// mkdir (the atomic test-and-set that works across hosts on a shared file
// system) holding one file named after the holder's host, with the holder's
// pid in it.
//
// What a crash leaves behind: a process that dies while holding a lock leaves
// the lock directory and its holder file.  Nobody cleans it up on purpose;
// the next waiter breaks it once the directory's access time is 181 seconds
// old.  Locks are held only for one read or one rewrite, far below that.
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <memory>

#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/rndctl.h"

const char* const control_names[FILE_COUNT] = {
    "Render_Job_Control",    "Render_Resource_Control", "Render_Tasks",  "RndCtl_EditPids",
    "Render_Dev_next_index", "Render_Job_next_index",   "Render_Access", "Render_Status"};

unsigned fileop_poll_seconds = 5;

namespace {

constexpr const char* kUnit = "Utility/rndctl/rj_fileio";
// A lock this old (by its directory's access time) is taken to be left by a
// dead holder.
constexpr long kStaleSeconds = 181;

struct FileRecord {
  char* path = nullptr;       // "%s/%s": control directory, file name (owned)
  char* lock_path = nullptr;  // "%s/%s.lock" (owned)
  FILE* stream = nullptr;     // open between an open and a close operation (owned)
  int fd = -1;                // descriptor of `stream`, for fsync and ftruncate
  bool for_update = false;    // opened by update_fileop: its close forces it to disk
};

FileRecord files[FILE_COUNT];
mode_t saved_umask = 0;
bool umask_saved = false;

bool valid_index(int index) { return index >= 0 && index < FILE_COUNT; }

// Heap copy of a "%s/%s%s" path through the checking allocator.
char* make_path(const char* dir, const char* name, const char* suffix, int line) {
  int n = snprintf(nullptr, 0, "%s/%s%s", dir, name, suffix);
  if (n < 0) return nullptr;
  size_t size = static_cast<size_t>(n) + 1;
  char* p = static_cast<char*>(MA_malloc(size, line, kUnit, 1));
  if (p != nullptr) snprintf(p, size, "%s/%s%s", dir, name, suffix);
  return p;
}

void close_stream(FileRecord& rec) {
  if (rec.stream != nullptr) {
    // The access log is opened by init_fileop only; other records are
    // closed by their close operation.  Reaching here means forgetting.
    fclose(rec.stream);
  }
  rec.stream = nullptr;
  rec.fd = -1;
}

struct DirCloser {
  void operator()(DIR* d) const { closedir(d); }
};
using ScopedDIR = std::unique_ptr<DIR, DirCloser>;

// Waits between two attempts at a busy lock.  Editors do not wait: they
// retry at once so that the user sees no delay.
void poll_pause() {
  if (is_editor()) return;
  if (fileop_poll_seconds > 0) sleep(fileop_poll_seconds);
}

// Opens the stream of a record for reading or rewriting; shared by the two
// open operations.  `modes` are tried in order.
FILE* open_record(int index, const char* first_mode, const char* second_mode) {
  FileRecord& rec = files[index];
  if (rec.path == nullptr) init_fileop();
  if (rec.path == nullptr) return nullptr;
  if (rec.stream != nullptr) {
    // A previous open of the same file was never closed: do not leak it.
    fclose(rec.stream);
    rec.stream = nullptr;
  }
  FILE* fp = fopen(rec.path, first_mode);
  if (fp == nullptr) fp = fopen(rec.path, second_mode);
  rec.stream = fp;
  rec.fd = fp != nullptr ? fileno(fp) : -1;
  rec.for_update = false;
  return fp;
}

void after_open(int index, FILE* fp) {
  // Fully buffered: whole files are read or rewritten under their lock, and
  // a line-buffered stream would cost one system call per line of a large
  // job file.  Nobody reads a locked file half-written either way.
  setvbuf(fp, nullptr, _IOFBF, 1 << 16);
  if (index == FILE_JOBS || index == FILE_RESOURCES) {
    RJCin = fp;
    RJCreadfile = files[index].path;
    RJCpath = files[index].path;
  }
}

}  // namespace

int init_fileop() {
  if (rndctl.location.none() || rndctl.location.c_str()[0] == '\0') rndctl.location.set(".");
  const char* dir = rndctl.location.c_str();
  for (int i = 0; i < FILE_COUNT; i++) {
    MA_free(files[i].path, __LINE__, kUnit);
    MA_free(files[i].lock_path, __LINE__, kUnit);
    files[i].path = make_path(dir, control_names[i], "", __LINE__);
    files[i].lock_path = make_path(dir, control_names[i], ".lock", __LINE__);
  }
  // Only the first initialisation sees the umask the process started with;
  // a later one (after fileop_reset) would see our own.
  mode_t previous = umask(1);
  if (!umask_saved) {
    saved_umask = previous;
    umask_saved = true;
  }

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
      log.fd = fileno(log.stream);
      fprintf(log.stream, "\n\n *** Start of new process entries ***\n\n");
      fflush(log.stream);
    }
  }
  return 1;
}

int fileop_break_stale_lock(const char* lock_path) {
  // The access time is read before the directory is listed: listing may
  // itself refresh it, and the age must be that of the lock, not of our look.
  struct stat st;
  if (lock_path == nullptr || stat(lock_path, &st) != 0) return 0;
  long age = static_cast<long>(rj_now() - st.st_atime);
  if (age < kStaleSeconds) return 0;

  char entry[NAME_MAX + 1] = "";
  {
    ScopedDIR dir(opendir(lock_path));
    if (dir) {
      // Another waiter may have broken this lock and a new holder taken it
      // since the stat: then it is not the stale lock any more.
      struct stat now_st;
      if (fstat(dirfd(dir.get()), &now_st) == 0 &&
          (now_st.st_ino != st.st_ino || now_st.st_dev != st.st_dev)) {
        return 0;
      }
      while (struct dirent* d = readdir(dir.get())) {
        if (strcmp(d->d_name, ".") == 0 || strcmp(d->d_name, "..") == 0) continue;
        snprintf(entry, sizeof entry, "%s", d->d_name);
      }
    }
  }
  if (entry[0] != '\0') {
    char holder[PATH_MAX];
    if (snprintf(holder, sizeof holder, "%s/%s", lock_path, entry) <
        static_cast<int>(sizeof holder)) {
      unlink(holder);
    }
  }
  rmdir(lock_path);
  EDuprintf("%d second timed out on \"%s\" in \"%s\" removed", static_cast<int>(age), entry,
            lock_path);
  dbg_logfile("%d second timed out on \"%s\" in \"%s\" removed", static_cast<int>(age), entry,
              lock_path);
  sounder(0);
  return 1;
}

int lock_fileop(int index, int take) {
  if (!valid_index(index)) return 0;
  FileRecord& rec = files[index];
  if (rec.lock_path == nullptr) init_fileop();
  if (rec.lock_path == nullptr) return 0;

  char holder[PATH_MAX];
  snprintf(holder, sizeof holder, "%s/%s", rec.lock_path, rndctl.host.or_else(""));

  if (take == 0) {
    // No ownership check: when the lock was broken and retaken by another
    // host, its holder file stays, the rmdir fails and the other keeps it.
    unlink(holder);
    rmdir(rec.lock_path);
    return 1;
  }

  mode_t previous = umask(0);
  if (mkdir(rec.lock_path, 0777) != 0) {
    dbgpnt(":::::: WAITING on %s\n", rec.lock_path);
    for (;;) {
      poll_pause();
      // The retry mode differs from the first attempt's on purpose (without
      // search permission the retaker usually gets no holder file); other
      // tools depend on seeing exactly these modes.
      if (mkdir(rec.lock_path, 0664) == 0) break;
      // A missing control directory lands here too: stat fails, nothing is
      // broken and the waiter keeps trying until the directory is back.
      fileop_break_stale_lock(rec.lock_path);
    }
  }

  // The lock directory is world-writable: never follow a planted link.
  int fd = open(holder, O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0666);
  if (fd >= 0) {
    char text[32];
    int n = snprintf(text, sizeof text, "%d\n", rndctl.pid);
    ssize_t written;
    do {
      written = write(fd, text, static_cast<size_t>(n));
    } while (written < 0 && errno == EINTR);
    close(fd);
  }
  umask(previous);
  return 1;
}

// "ERROR: failed to <verb> <path>" to the user, stdout and the trace, with
// the system's reason; both open paths say "in read_fileop", which log
// readers match.
static void report_open_failure(int index, const char* verb) {
  const char* path = files[index].path != nullptr ? files[index].path : "";
  int saved_errno = errno;
  EDuprintf("ERROR: failed to %s %s", verb, path);
  printf("ERROR: failed to %s %s\n", verb, path);
  errno = saved_errno;
  perror("in read_fileop");
  dbgpnt("ERROR: failed to %s %s\n", verb, path);
}

FILE* read_fileop(int index) {
  if (!valid_index(index)) return nullptr;
  FILE* fp = open_record(index, "r+e", "w+e");
  if (fp == nullptr) {
    report_open_failure(index, "open");
    return nullptr;
  }
  after_open(index, fp);
  return fp;
}

FILE* update_fileop(int index) {
  if (!valid_index(index)) return nullptr;
  FILE* fp = open_record(index, "rb+e", "w+e");
  if (fp == nullptr) {
    report_open_failure(index, "create");
    sounder(3);
    return nullptr;
  }
  files[index].for_update = true;
  after_open(index, fp);
  return fp;
}

void rewind_fileop(int index) {
  if (!valid_index(index) || files[index].stream == nullptr) return;
  FILE* fp = files[index].stream;
  dbgpnt("rewind 0x%x\n", static_cast<unsigned>(reinterpret_cast<uintptr_t>(fp)));
  rewind(fp);
}

void close_fileop(int index) {
  if (!valid_index(index) || index == FILE_ACCESS) return;
  FileRecord& rec = files[index];
  if (rec.stream == nullptr) return;
  fflush(rec.stream);
  // Forcing a file that was only read costs a journal commit (its access
  // time) and protects nothing.
  if (rec.for_update) fsync(rec.fd);
  fclose(rec.stream);
  rec.stream = nullptr;
  rec.fd = -1;
}

void close_and_truncate_fileop(int index) {
  if (!valid_index(index) || index == FILE_ACCESS) return;
  FileRecord& rec = files[index];
  if (rec.stream == nullptr) return;
  // The rewrite went over the old content in place; cutting at the current
  // position drops the old tail.  The file is never seen empty in between.
  fflush(rec.stream);
  fsync(rec.fd);
  long position = ftell(rec.stream);
  if (position >= 0) {
    while (ftruncate(rec.fd, position) != 0 && errno == EINTR) {
    }
  }
  fclose(rec.stream);
  rec.stream = nullptr;
  rec.fd = -1;
}

mode_t get_original_umask() { return saved_umask; }

const char* fileop_path(int index) {
  if (!valid_index(index)) return nullptr;
  if (files[index].path == nullptr) init_fileop();
  return files[index].path;
}

FILE* fileop_access_stream() { return files[FILE_ACCESS].stream; }

void fileop_reset() {
  for (FileRecord& rec : files) {
    close_stream(rec);
    MA_free(rec.path, __LINE__, kUnit);
    MA_free(rec.lock_path, __LINE__, kUnit);
    rec.path = nullptr;
    rec.lock_path = nullptr;
  }
}
