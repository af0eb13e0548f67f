// A control directory with one job, one resource on this host and helpers
// to make running-task entries and to start and wait for real children.
#pragma once

#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <tuple>

#include "tests/support/task_text.h"
#include "tests/support/test_support.h"

class TaskFixture : public ControlDirTest {
 protected:
  void SetUp() override {
    ControlDirTest::SetUp();
    job_ = Job_new(nullptr, nullptr, path("proj/sdl/scene.sdl").c_str(), 1);
    ASSERT_NE(job_, nullptr);
    job_->executable.set("myrender");
    job_->pix.set(path("pix/img").c_str());
    std::tie(job_->animate, job_->frames[0], job_->frames[1], job_->frames[2], job_->totalframes) =
        std::tuple(1, 1.0f, 10.0f, 1.0f, 10);
    ASSERT_NE(dev_ = host_dev("render1", 1, "testhost"), nullptr);
    mkdir_p("proj/sdl");
    mkdir_p("pix");
  }

  void mkdir_p(const std::string& rel) const { std::filesystem::create_directories(path(rel)); }

  /// A running-task entry of `job` for start..end on `dev`, in `status`.
  /// An entry on this host stands for a piece this daemon took.
  TASK* add_entry(Job* job, Dev* dev, float start, float end, int status, int id = 0) {
    TASK* entry =
        Task_add(job, TaskRec_alloc(nullptr, start, end, start, dev, status, nullptr, id));
    if (entry != nullptr) entry->taken = rj_dev_is_this_host(dev) ? 1 : 0;
    return entry;
  }

  /// Writes Render_Tasks as the entries made so far came from it: the
  /// updates of this host find the groups they belong to.
  void write_task_file() const {
    std::string text;
    for (Job* job = rndctl.jobs; job != nullptr; job = job->next) {
      std::string recs;
      int n = 0, next_id = 0;
      for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) {
        if (e->job != job || e->rec == nullptr) continue;
        const TaskRec* r = e->rec;
        recs += rec_line(r->id, r->start, r->end, r->current, r->dev != nullptr ? r->dev->index : 0,
                         r->retries, GetTaskStatusStr(r->status));
        ++n;
        next_id = std::max(next_id, r->id + 1);
      }
      if (n != 0) text += group_line(job->name.c_str(), job->index, n, next_id) + recs;
    }
    write_file("Render_Tasks", text);
  }

  /// Waits for `pid` and returns its raw wait status.
  static int wait_for(int pid) {
    int status = 0;
    EXPECT_EQ(waitpid(pid, &status, 0), pid);
    return status;
  }

  Job* job_ = nullptr;  // owned by the control block's list
  Dev* dev_ = nullptr;  // owned by the control block's list
};
