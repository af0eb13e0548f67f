// Task status, render progress, job state and the job's error record.
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>

#include "tests/support/task_fixture.h"

namespace {

using std::filesystem::exists;

class StatusTest : public TaskFixture {
 protected:
  void SetUp() override {
    TaskFixture::SetUp();
    // The tests reap their own render stand-ins, not an earlier test's handler.
    signal(SIGCHLD, SIG_DFL);
  }
  /// An entry whose stream reads "stream", holding `text`, and whose output is "out", holding
  /// `out`.
  TASK* entry_with_stream(float start, float end, const char* text = "", const char* out = "") {
    TASK* entry = add_entry(job_, dev_, start, end, TASK_RUNNING);
    write_file("stream", text);
    write_file("out", out);
    entry->stream_path.set(path("stream").c_str());
    entry->stream = fopen(entry->stream_path.c_str(), "r");
    entry->out_path.set(path("out").c_str());
    return entry;
  }
  static Dev* other_host() { return host_dev("render2", 2, "otherhost"); }
};

// The last progress line sets the frame and the percentage: the stream, the step, the job's
// extension (0: none; else from 100 by 10), the task's frames, whether it changed, the frame and
// progress then, and the output.  Frame 3 of 1..10 in progress: current is that frame.
TEST_F(StatusTest, LastProgressLineSetsFrameAndPercentage) {
  using Row = std::tuple<const char*, float, int, float, float, int, float, float, const char*>;
  // clang-format off
  for (auto [stream, by, extension, start, end, changed, current, progress, output] : {
           Row{"pix.0003 r 10 of 100\n", 1, 0, 1, 10, 1, 3, 30.8f, "pix.0003"},
           Row{"pix.0001 r 50 of 100\n", 1, 0, 1, 10, 1, 1, 14.8f, "pix.0001"},  // stays at the start
           Row{"pix.0003 r 102 of 100\n", 1, 0, 1, 10, 1, 4, 40, "pix.0003"},  // a finished frame moves on
           Row{"pix.0003 r 102 of 100\n", 1, 0, 1, 3, 1, 3, 133.33333f, "pix.0003"},  // never past the end
           Row{"pix.0003 r 0 of 100\n", 1, 0, 1, 10, 1, 3, 39.8f, "pix.0003"},  // line zero is the frame's last
           Row{"pix.0002 r 10 of 100\npix.0004 r 20 of 100\nnoblanks\n", 1, 0, 1, 10, 1, 4, 41.8f, "pix.0004"},
           Row{"pix.0003 r 10 of 100\nError: frame 4 did not build\n", 1, 0, 1, 10, 0, 1, 0, nullptr},
           Row{"pix.0004 w 10 of 100\n", 1, 0, 1, 10, 0, 1, 0, nullptr},
           Row{"pix.0005 r 10 of 100\n", 2, 0, 1, 9, 1, 5, 61.6f, "pix.0005"},
           Row{"pix.0005 r 10 of 100\n", 0.5f, 0, 2, 4, 1, 3, 61.6f, "pix.0005"},  // its own numbers
           Row{"pix.0140 r 10 of 100\n", 1, 1, 4, 6, 1, 5, 69.33333f, "pix.0140"}}) {
    // clang-format on
    job_->frames[2] = by;
    job_->extension = extension != 0 ? 291 : 0;
    std::tie(job_->ext_start, job_->ext_by) = std::tuple(100, 10);
    TASK* entry = entry_with_stream(start, end, stream);
    SCOPED_TRACE(stream);
    const int got = set_image_percentage_done(entry);
    EXPECT_EQ(std::tuple(got, entry->rec->current, std::string(entry->output.or_else("-"))),
              std::tuple(changed, current, std::string(output ? output : "-")));
    EXPECT_NEAR(entry->progress, progress, 1e-3);
  }
}

TEST_F(StatusTest, HalfWrittenProgressLineWaitsForItsEnd) {
  TASK* entry = entry_with_stream(1, 10, "pix.0002 r 10 of 100\npix.0005 r 1");
  EXPECT_EQ(set_image_percentage_done(entry), 1);
  EXPECT_FLOAT_EQ(entry->rec->current, 2);
  std::ofstream(path("stream"), std::ios::app) << "0 of 100\n";
  EXPECT_EQ(set_image_percentage_done(entry), 1);
  EXPECT_STREQ(entry->output.c_str(), "pix.0005");
}

TEST_F(StatusTest, SameStatusAgainRewritesTheTaskFileAndReportsNoChange) {
  const std::string head = "\nscene.sdl\t 1\t 1\t 1\n\t0\t 1.000000\t 10.000000\t ";
  write_file("Render_Tasks", head + "1.000000  1\t 0\tRUNNING\n");
  TASK* entry = add_entry(job_, dev_, 1, 10, TASK_RUNNING);
  entry->rec->current = 4;
  EXPECT_EQ(SetTaskStatus(entry, TASK_RUNNING), 0);
  EXPECT_EQ(read_file("Render_Tasks"), head + "4.000000  1\t 0\tRUNNING\n");
  EXPECT_EQ(SetTaskStatus(entry, TASK_FAILED), 1);
  EXPECT_EQ(read_file("Render_Tasks"), head + "4.000000  1\t 0\tFAILED\n");
}

TEST_F(StatusTest, OnlyThisHostsOwnRendersChangeState) {
  TASK* mine = add_entry(job_, dev_, 1, 3, TASK_STARTED, 0);
  TASK* theirs = add_entry(job_, other_host(), 4, 6, TASK_STARTED, 1);
  TASK* waiting = add_entry(job_, dev_, 7, 9, TASK_STARTED, 2);
  // Made from the file: a record of this host that an earlier daemon ran;
  // its pid 0 and waitstatus 0 are no clean exit.
  TASK* inherited = add_entry(job_, dev_, 10, 10, TASK_RUNNING, 3);
  inherited->taken = 0;
  mine->pid = 4242;  // any pid of 2 or more counts as a process
  write_task_file();
  EXPECT_EQ(std::pair(ISA_task_running(theirs), ISA_task_running(waiting)), std::pair(1, 0));
  EXPECT_EQ(UpdateRunningTasks(), 1);
  EXPECT_EQ(std::tuple(mine->rec->status, theirs->rec->status, waiting->rec->status,
                       inherited->rec->status),
            std::tuple(TASK_RUNNING, TASK_STARTED, TASK_STARTED, TASK_RUNNING));
  mine->pid = 0;  // no process to be killed by the fixture's cleanup
}

TEST_F(StatusTest, AbortedJobStopsThisHostsTasksAndOthersPendingOnes) {
  Dev* other = other_host();
  job_->status.set("aborted");
  TASK* running = entry_with_stream(1, 3);
  running->output.set("pix.0001");
  TASK* pending = add_entry(job_, other, 4, 6, TASK_PENDING, 1);
  TASK* started = add_entry(job_, other, 7, 9, TASK_STARTED, 2);
  const int pid = sleeper();
  running->pid = pid;
  write_task_file();
  EXPECT_EQ(UpdateRunningTasks(), 1);  // the other host's STARTED task
  EXPECT_EQ(wait_for(pid), SIGKILL);   // the wait status of a kill
  EXPECT_EQ(std::tuple(running->rec->status, pending->rec->status, started->rec->status),
            std::tuple(TASK_ABORTED, TASK_ABORTED, TASK_STARTED));
  EXPECT_TRUE(running->pid == 0 && running->stream == nullptr && running->stream_path.none() &&
              running->output.none() && !exists(path("stream")));
}

struct EndCase {
  const char* label;
  int waitstatus, save_out, status;
  bool out_kept;
};

class EndOfProcess : public StatusTest, public testing::WithParamInterface<EndCase> {};

TEST_P(EndOfProcess, ExitValueDecidesAndOutputGoesUnlessKept) {
  const EndCase& c = GetParam();
  job_->save_out = c.save_out;
  TASK* entry = entry_with_stream(1, 10, "", "rendering\n");
  std::tie(entry->rec->current, entry->waitstatus) = std::pair(4.0f, c.waitstatus);  // reaped
  write_task_file();
  TaskRec* rec = entry->rec;
  EXPECT_EQ(UpdateRunningTasks(), 0);
  EXPECT_EQ(
      std::tuple(rec->status, rec->current, exists(path("out")), entry->out_path.none(),
                 exists(path("stream"))),
      std::tuple(c.status, c.status == TASK_FINISHED ? 10.0f : 4.0f, c.out_kept, true, false));
}

INSTANTIATE_TEST_SUITE_P(
    Outcomes, EndOfProcess,
    testing::Values(EndCase{"clean_exit_finishes", 0, 0, TASK_FINISHED, false},
                    EndCase{"clean_exit_keeps_saved_output", 0, 1, TASK_FINISHED, true},
                    EndCase{"killed_fails_keeping_saved_output", 9, 1, TASK_FAILED, true}),
    by_label);

TEST_F(StatusTest, FailedTaskOfThisHostsJobEndsInTheJobFileWithItsError) {
  // The resource is named after the host, as the reload matches them.
  Dev* named = host_dev("testhost", 3, "testhost");
  RndDevList_add(job_, named);
  RJC_out();
  TASK* entry = entry_with_stream(1, 10, "", "loading scene\nshader did not build\nexiting\n");
  // No more retries: it stays failed.
  std::tie(entry->rec->dev, entry->rec->retries, entry->waitstatus) = std::tuple(named, 10, 1);
  write_task_file();

  EXPECT_EQ(UpdateRunningTasks(), 0);
  ASSERT_NE(Job_by_index(1), nullptr);
  EXPECT_STREQ(Job_by_index(1)->status.c_str(), "failed");
  EXPECT_STREQ(Job_by_index(1)->comment.c_str(),
               "ERROR: testhost (testhost) frame 1.0\nshader did not build\n\n \n");
  EXPECT_EQ(rndctl.tasks, nullptr);  // all tasks ended: cleared
  EXPECT_NE(read_file("JOBLOG/scene.sdl").find("\t FAILED  10\n"), std::string::npos);
}

TEST_F(StatusTest, ErrorReasonPilesUpInTheComment) {
  // The first error line wins, else the last line; a signal's reason skips the log.
  // clang-format off
  for (auto [waitstatus, log, old_comment, comment] : {
           std::tuple<int, const char*, const char*, const char*>{1, "a\nparse error at 3\nb Error\n", nullptr, "ERROR: render1 (testhost) frame 2.5\nparse error at 3\n\n \n"},
           {0, "one\ntwo\n", "old\n", "old\nERROR: render1 (testhost) frame 2.5\ntwo\n\n \n"},
           {1, "", nullptr, "ERROR: render1 (testhost) frame 2.5\nQuit for Unknown reasons\n \n"},
           {9, "parse error\n", nullptr, "ERROR: render1 (testhost) frame 2.5\nSIGKILL (Killed)\n\n \n"}}) {
    // clang-format on
    TASK* entry = entry_with_stream(2.5f, 10, "", log);
    entry->waitstatus = waitstatus;
    job_->comment.set(old_comment);
    Job_Error_Update(entry);
    EXPECT_STREQ(job_->comment.c_str(), comment) << log;
  }
}

// One task of frames i*2+1 .. i*2+2 for each status.  Frames 1-2 finished and frame 3 under way
// count 3 of 4 frames; half of a task spread over the job's 4 frames adds 12.5.
TEST_F(StatusTest, TasksDecideTheJobsStatusText) {
  // clang-format off
  for (auto [statuses, job_status, ctrl, expected] : {
           std::tuple<std::vector<int>, const char*, int, const char*>{{TASK_PENDING, TASK_PENDING}, "none", RUN_AVAILABLE, "pending"},
           {{TASK_STARTED}, "pending", RUN_AVAILABLE, "started"},
           {{TASK_FAILED, TASK_FAILED}, "started", RUN_AVAILABLE, "failed"},
           {{TASK_FINISHED, TASK_RUNNING}, "started", RUN_AVAILABLE, "87.50% "},
           {{TASK_FINISHED, TASK_RUNNING}, "started", RUN_PAUSED, "87.50% Paused"},
           {{TASK_FINISHED, TASK_PENDING}, "restarted", RUN_AVAILABLE, "restarted"},
           {{TASK_PENDING}, "restarted", RUN_AVAILABLE, "pending"},
           {{}, "restarted", RUN_AVAILABLE, "pending"}}) {
    // clang-format on
    while (rndctl.tasks != nullptr) TASK_free(rndctl.tasks);
    job_->status.set(job_status);
    const int frames = static_cast<int>(statuses.size() * 2);
    std::tie(job_->ctrl, job_->frames[1], job_->totalframes) = std::tuple(ctrl, frames, frames);
    for (size_t i = 0; i < statuses.size(); ++i) {
      TASK* entry = add_entry(job_, dev_, static_cast<float>(i * 2 + 1),
                              static_cast<float>(i * 2 + 2), statuses[i], static_cast<int>(i));
      entry->rec->retries = 10;
      if (statuses[i] == TASK_RUNNING) entry->progress = 50.0f;
    }
    UpdateJobState(job_);
    EXPECT_STREQ(job_->status.c_str(), expected) << job_status << " " << statuses.size();
  }
}

TEST_F(StatusTest, FinishedJobWritesItsLogAndClearsItsTasks) {
  job_->executable.set("shadepass");
  job_->del_when_done = 1;
  write_file("testhost.pid", "");
  struct timespec long_ago[2] = {{1000, 0}, {1000, 0}};
  utimensat(AT_FDCWD, path("testhost.pid").c_str(), long_ago, 0);
  int64_t before = daemon_updatetime_get("testhost");
  RndDevList_add(job_, dev_);
  add_entry(job_, dev_, 1, 5, TASK_FINISHED, 0);
  add_entry(job_, nullptr, 6, 10, TASK_FINISHED, 1)->rec->retries = 2;

  UpdateJobState(job_);
  EXPECT_EQ(std::tuple(job_->status.or_else(""), job_->doneframes, rndctl.tasks, job_->deleted),
            std::tuple(std::string("finished"), 10, nullptr, 1));
  EXPECT_NE(daemon_updatetime_get("testhost"), before);
  const char* first_task = "\t0\t 1.000000 - 5.000000\t1 - 5\t render1\t FINISHED  0\n";
  EXPECT_EQ(read_file("JOBLOG/scene.sdl"),
            "scene.sdl 1 using the shadepass\n\tsdl = \"" + path("proj/sdl/scene.sdl") +
                "\"\n\tframes = 1.000000 to 10.000000 by 1.000000\n  no extension set\n" +
                first_task + "\t1\t 6.000000 - 10.000000\t6 - 10\t nodev\t FINISHED  2\n");

  // Reopened, the log is read from its first task line.
  FILE* log = Logfile_open(job_);
  ASSERT_NE(log, nullptr);
  char line[120] = "";
  EXPECT_STREQ(fgets(line, sizeof line, log), first_task);
  fclose(log);
}

}  // namespace
