// The live view: the job list with a progress bar per job and per running
// task, redrawn in place when the job or task file changes.
//
// The terminal is put in non-canonical mode without echo and without
// signal keys (Ctrl-C arrives as a byte), so that every way out goes through
// the one restore; SIGTERM, SIGHUP and SIGINT from elsewhere are caught only
// inside the wait (ppoll) and end the loop the same way.
#include <poll.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <termios.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <functional>
#include <string>

#include "tools/rndctl/commands.h"
#include "tools/rndctl/editor_side.h"
#include "tools/rndctl/tables.h"

namespace {

volatile sig_atomic_t stop_signal = 0;
void on_stop(int sig) { stop_signal = sig; }

// Restores the terminal as it was found, on every way out of the view.
class TerminalGuard {
 public:
  TerminalGuard() {
    tty_ = isatty(STDIN_FILENO) && tcgetattr(STDIN_FILENO, &saved_) == 0;
    if (tty_) {
      struct termios raw = saved_;
      raw.c_lflag &= static_cast<tcflag_t>(~(ICANON | ECHO | ISIG));
      raw.c_cc[VMIN] = 1;
      raw.c_cc[VTIME] = 0;
      tcsetattr(STDIN_FILENO, TCSANOW, &raw);
    }
    fputs("\033[?1049h\033[?25l", stdout);  // own screen, no cursor
    fflush(stdout);
  }
  ~TerminalGuard() {
    fputs("\033[?25h\033[?1049l", stdout);
    fflush(stdout);
    if (tty_) tcsetattr(STDIN_FILENO, TCSANOW, &saved_);
  }
  TerminalGuard(const TerminalGuard&) = delete;
  TerminalGuard& operator=(const TerminalGuard&) = delete;

 private:
  bool tty_ = false;
  struct termios saved_ {};
};

struct Stamp {
  struct timespec jobs {
  }, tasks{};
  off_t jobs_size = -1, tasks_size = -1;
  bool operator==(const Stamp& o) const {
    return jobs.tv_sec == o.jobs.tv_sec && jobs.tv_nsec == o.jobs.tv_nsec &&
           tasks.tv_sec == o.tasks.tv_sec && tasks.tv_nsec == o.tasks.tv_nsec &&
           jobs_size == o.jobs_size && tasks_size == o.tasks_size;
  }
};

Stamp stamp() {
  Stamp s;
  struct stat st;
  if (stat(fileop_path(FILE_JOBS), &st) == 0) {
    s.jobs = st.st_mtim;
    s.jobs_size = st.st_size;
  }
  if (stat(fileop_path(FILE_TASKS), &st) == 0) {
    s.tasks = st.st_mtim;
    s.tasks_size = st.st_size;
  }
  return s;
}

struct winsize terminal_size() {
  struct winsize ws {};
  if (ioctl(STDOUT_FILENO, TIOCGWINSZ, &ws) != 0 || ws.ws_col < 40) ws.ws_col = 80;
  if (ws.ws_row < 5) ws.ws_row = 24;
  return ws;
}

// What the view shows: the lists of the last load and the task groups read
// with them (which point into those lists, so they go first).
struct View {
  CtlTasks tasks;
  std::string why;  // the load failed: this is shown instead
  void load() {
    TaskGroup_free_all(&tasks.groups);
    why.clear();
    if (!Ctl_load(&why)) return;
    why.clear();
    (void)Ctl_read_tasks(&tasks);
  }
};

// The lines of one job: its bar, then one bar per task it renders.
void job_lines(const Job* j, const CtlTasks& tasks, int bar,
               const std::function<void(const std::string&)>& line) {
  char head[128];
  snprintf(head, sizeof head, "%5d %-14s %-10s %5d/%-5d ", j->index,
           Out_fit(j->name.or_else("-"), 14).c_str(), Out_fit(j->status.or_else("-"), 10).c_str(),
           j->doneframes, j->totalframes);
  line(head + Out_bar(Out_job_fraction(j), bar));
  for (const TaskGroup* g = tasks.groups; g != nullptr; g = g->next) {
    if (g->job == nullptr || g->job->index != j->index) continue;
    for (const TaskRec* r = g->tasks; r != nullptr; r = r->next) {
      if (r->status != TASK_RUNNING && r->status != TASK_STARTED) continue;
      double span = static_cast<double>(r->end - r->start) + 1;
      double done = r->status == TASK_RUNNING ? static_cast<double>(r->current - r->start) : 0;
      char task[128];
      snprintf(task, sizeof task, "      task %-3d %6g-%-6g %-10s ", r->id,
               static_cast<double>(r->start), static_cast<double>(r->end),
               r->dev != nullptr ? Out_fit(r->dev->name.or_else("-"), 10).c_str() : "-");
      line(task + Out_bar(span > 0 ? done / span : 0, bar));
    }
  }
}

// Draws the screen from what `view` holds; only as many lines as the
// terminal has rows are built, however long the queue.
void draw(const View& view) {
  struct winsize ws = terminal_size();
  int width = ws.ws_col;
  int rows = ws.ws_row - 1;  // the last row stays free: a full one would scroll
  std::string out = "\033[H";
  int used = 0;
  auto line = [&](const std::string& text) {
    if (used++ >= rows) return;
    out += Out_fit(text, static_cast<size_t>(width)) + "\033[K\n";
  };
  line("rndctl watch  " + std::string(rndctl.location.or_else("")) + "   q: quit");
  line("");
  if (!view.why.empty()) {
    line(view.why);
  } else {
    int bar = std::max(10, width - 44);
    int left = 0;
    for (const Job* j = rndctl.jobs; j != nullptr; j = j->next) {
      if (used >= rows - 1) {
        left++;
        continue;
      }
      job_lines(j, view.tasks, bar, line);
    }
    if (left > 0) line("  ... " + std::to_string(left) + " more job(s)");
    if (rndctl.jobs == nullptr) line("no jobs");
  }
  out += "\033[J";
  fputs(out.c_str(), stdout);
  fflush(stdout);
}

}  // namespace

int Cmd_watch(int interval_ms) {
  sigset_t block, old;
  sigemptyset(&block);
  sigaddset(&block, SIGINT);
  sigaddset(&block, SIGTERM);
  sigaddset(&block, SIGHUP);
  sigprocmask(SIG_BLOCK, &block, &old);
  struct sigaction sa {
  }, saved[3];
  sa.sa_handler = on_stop;
  sigemptyset(&sa.sa_mask);
  const int sigs[3] = {SIGINT, SIGTERM, SIGHUP};
  for (int i = 0; i < 3; i++) sigaction(sigs[i], &sa, &saved[i]);
  {
    TerminalGuard guard;
    View view;
    Stamp seen;
    bool first = true;
    int idle_ms = 0;
    while (stop_signal == 0) {
      // The files are read again only when they changed; the screen is also
      // drawn again every few seconds from what was read (a resized window).
      Stamp now = stamp();
      bool changed = first || !(now == seen);
      if (changed) view.load();
      if (changed || idle_ms >= 5000) {
        draw(view);
        seen = now;
        first = false;
        idle_ms = 0;
      }
      struct pollfd p = {STDIN_FILENO, POLLIN, 0};
      struct timespec wait = {interval_ms / 1000, (interval_ms % 1000) * 1000000L};
      int n = ppoll(&p, 1, &wait, &old);
      idle_ms += interval_ms;
      if (n > 0 && (p.revents & (POLLHUP | POLLERR))) break;
      if (n > 0 && (p.revents & POLLIN)) {
        char c = 0;
        if (read(STDIN_FILENO, &c, 1) <= 0) break;
        if (c == 'q' || c == 'Q' || c == 3) break;
      }
    }
  }
  for (int i = 0; i < 3; i++) sigaction(sigs[i], &saved[i], nullptr);
  sigprocmask(SIG_SETMASK, &old, nullptr);
  return 0;
}
