// Choosing, cutting and putting back tasks, against real task files.  A
// second host is simulated by a resource whose host name is another host's.
#include <unistd.h>

#include <climits>
#include <string>
#include <vector>

#include "tests/support/task_text.h"
#include "tests/support/test_support.h"

namespace {

/// The task file of the one job "scene.sdl" holding the records `rows` (see rec_lines).
std::string scene(const std::string& rows) {
  int n = 0;
  std::string records = rec_lines(rows, &n);
  return group_line("scene.sdl", 1, n, n) + records;
}

class SelectTest : public ControlDirTest {
 protected:
  void SetUp() override {
    ControlDirTest::SetUp();
    here_ = host_dev("render1", 1, "testhost");
    there_ = host_dev("render2", 2, "otherhost");
    ASSERT_TRUE(here_ && there_);
    std::tie(here_->max_frames, here_->num_processors) = std::pair(3, 4);
  }

  /// A pending, animated job over frames 1..end by `by` that the given hosts may render.
  Job* make_job(int index, const char* name, int priority, std::initializer_list<Dev*> hosts,
                float end = 10, float by = 1) {
    Job* job = Add_a_job(nullptr, name, index);
    EXPECT_NE(job, nullptr);
    job->status.set("pending");
    std::tie(job->priority, job->animate) = std::pair(priority, 1);
    std::tie(job->frames[0], job->frames[1], job->frames[2]) = std::tuple(1.0f, end, by);
    for (Dev* d : hosts) RndDevList_add(job, d);
    return job;
  }

  std::string tasks() const { return read_file("Render_Tasks"); }

  static int count_entries() {
    int n = 0;
    for (TASK* e = rndctl.tasks; e != nullptr; e = e->next) ++n;
    return n;
  }

  static TASK* entry_of(Job* job, int id) {
    for (TASK* e = rndctl.tasks; e != nullptr; e = e->next)
      if (e->job == job && e->rec != nullptr && e->rec->id == id) return e;
    return nullptr;
  }

  Dev *here_ = nullptr, *there_ = nullptr;
};

struct CutCase {
  const char* label;
  int max_frames, animate, max_frames_after;
  float end, by;
  const char* after;  // the records of the task file afterwards
};

class Cutting : public SelectTest, public testing::WithParamInterface<CutCase> {};

TEST_P(Cutting, FirstPickCutsTheHostsShareOffTheJob) {
  const CutCase& c = GetParam();
  here_->max_frames = c.max_frames;
  make_job(1, "scene.sdl", 0, {here_}, c.end, c.by)->animate = c.animate;
  TASK* picked = Task_get();
  EXPECT_EQ(picked != nullptr ? picked->rec->status : -1, TASK_STARTED);
  EXPECT_EQ(tasks(), scene(c.after));
  EXPECT_EQ(here_->max_frames, c.max_frames_after);
}

INSTANTIATE_TEST_SUITE_P(
    Ranges, Cutting,
    testing::Values(
        CutCase{"three_of_ten", 3, 1, 3, 10, 1, "0 1 3 1 1 0 STARTED, 1 4 10 4 0 0 PENDING"},
        CutCase{"zero_means_one", 0, 1, 1, 10, 1, "0 1 1 1 1 0 STARTED, 1 2 10 2 0 0 PENDING"},
        CutCase{"by_two", 3, 1, 3, 10, 2, "0 1 5 1 1 0 STARTED, 1 7 10 7 0 0 PENDING"},
        CutCase{"fewer_steps_than_max", 3, 1, 3, 3, 1, "0 1 3 1 1 0 STARTED"},
        CutCase{"still_image_never_cut", 3, 0, 3, 10, 1, "0 1 10 1 1 0 STARTED"},
        CutCase{"zero_step_never_cut", 3, 1, 3, 10, 0, "0 1 10 1 1 0 STARTED"}),
    by_label);

TEST_F(SelectTest, EachTaskOnTheHostTakesAProcessSlot) {
  here_->num_processors = 2;
  Job* job = make_job(1, "scene.sdl", 0, {here_});
  TASK* first = Task_get();
  // The job is being worked on here: only the last mode takes more of it.
  TASK* second = Task_get();
  ASSERT_TRUE(first && second);
  // Two tasks of one job fill both processors: nothing more.
  EXPECT_EQ(Task_get(), nullptr);
  EXPECT_EQ(tasks(), scene("0 1 3 1 1 0 STARTED, 1 4 6 4 1 0 STARTED, 2 7 10 7 0 0 PENDING"));
  // The running-task list mirrors the file.
  EXPECT_TRUE(count_entries() == 3 && entry_of(job, 0) == first && entry_of(job, 1) == second);

  // A host that never set its processors runs one task.
  there_->num_processors = 0;
  EXPECT_EQ(std::pair(Dev_processes_available(there_), there_->num_processors), std::pair(1, 1));
}

struct PriorityCase {
  const char* label;
  int running, chosen;  // chosen: a position in the list below, -1 for none
  // One job each, in job list order; their groups run the other way: "first" means last here.
  std::vector<int> priorities;
};

class Priority : public SelectTest, public testing::WithParamInterface<PriorityCase> {};

TEST_P(Priority, ChoosesTheJob) {
  const PriorityCase& c = GetParam();
  std::vector<Job*> jobs;
  for (size_t i = 0; i < c.priorities.size(); ++i)
    jobs.push_back(make_job(static_cast<int>(i) + 1, ("job" + std::to_string(i) + ".sdl").c_str(),
                            c.priorities[i], {here_}));
  rndctl.running = c.running;
  TASK* picked = Task_get();
  EXPECT_EQ(picked != nullptr ? picked->job : nullptr,
            c.chosen < 0 ? nullptr : jobs[static_cast<size_t>(c.chosen)]);
  // None picked, the jobs' first tasks are in the file all the same, waiting.
  EXPECT_TRUE(c.chosen >= 0 || count_entries() == static_cast<int>(jobs.size())) << count_entries();
}

INSTANTIATE_TEST_SUITE_P(Jobs, Priority,
                         testing::Values(PriorityCase{"lowest_number_wins", 0, 1, {5, 1, 3}},
                                         PriorityCase{"tie_goes_to_the_first", 0, 1, {2, 2}},
                                         PriorityCase{"busy_takes_priority_0", 1, 1, {0, 0, 1}},
                                         PriorityCase{"busy_host_leaves_the_rest", 1, -1, {1, 2}}),
                         by_label);

TEST_F(SelectTest, JobsThisHostMayNotRenderAreLeftAlone) {
  make_job(1, "elsewhere.sdl", 0, {there_});
  Job* nohosts = make_job(2, "nohosts.sdl", 0, {});
  make_job(3, "done.sdl", 0, {here_})->status.set("finished");
  EXPECT_EQ(Task_get(), nullptr);
  // The other host's job gets its first task for that host to take.
  EXPECT_EQ(tasks(), group_line("elsewhere.sdl", 1, 1, 1) + rec_line(0, 1, 10, 1, 0, 0, "PENDING"));
  EXPECT_EQ(isa_job_using_host("testhost", nohosts), 0);
}

struct FailCase {
  const char* label;
  float current;
  int retries, status;  // status: of the failed task's entry afterwards
  const char* file;     // its records afterwards
};

class PutBack : public SelectTest, public testing::WithParamInterface<FailCase> {};

TEST_P(PutBack, FailedTaskGoesBackOrIsCutWhereItStopped) {
  const FailCase& c = GetParam();
  here_->max_frames = 100;
  Job* job = make_job(1, "scene.sdl", 0, {here_, there_});
  TASK* failed = Task_get();
  ASSERT_NE(failed, nullptr);
  std::tie(failed->rec->status, failed->rec->current, failed->rec->retries) =
      std::tuple(TASK_FAILED, c.current, c.retries);

  EXPECT_EQ(Split_first_splittable_failed_tasks(), nullptr);
  EXPECT_EQ(std::pair(tasks(), failed->rec->status), std::pair(scene(c.file), c.status));
  // A remainder cut off is a fresh task: any host, this one included, takes it.
  TASK* again = c.status == TASK_FINISHED ? Task_get() : nullptr;
  EXPECT_EQ(again != nullptr && again == entry_of(job, 1), c.status == TASK_FINISHED);
  EXPECT_TRUE(c.status == TASK_FINISHED || count_entries() == 1) << count_entries();
}

INSTANTIATE_TEST_SUITE_P(
    Failures, PutBack,
    testing::Values(FailCase{"after_progress", 5, 0, TASK_FINISHED,
                             "0 1 4 4 1 1 FINISHED, 1 5 10 5 0 0 PENDING"},
                    FailCase{"no_progress", 1, 0, TASK_PENDING, "0 1 10 1 1 1 PENDING"},
                    FailCase{"tenth_failure", 5, 10, TASK_FAILED, "0 1 10 1 1 0 STARTED"}),
    by_label);

struct RetryCase {
  const char* label;
  const char* failed_on;  // resource index the task failed on
  bool other_host_listed;
  const char* after;  // the record afterwards
};

class Retry : public SelectTest, public testing::WithParamInterface<RetryCase> {};

TEST_P(Retry, TaskThatFailedHereWaitsOnlyWhenAnotherHostCanTakeIt) {
  const RetryCase& c = GetParam();
  Job* job = c.other_host_listed ? make_job(1, "scene.sdl", 0, {here_, there_})
                                 : make_job(1, "scene.sdl", 0, {here_});
  job->status.set("started");
  write_file("Render_Tasks", scene(std::string("0 1 3 1 ") + c.failed_on + " 2 PENDING"));
  TASK* picked = Task_get();
  EXPECT_EQ(tasks(), scene(c.after));
  EXPECT_EQ(picked != nullptr, std::string(c.after).ends_with("STARTED"));
}

INSTANTIATE_TEST_SUITE_P(
    Hosts, Retry,
    testing::Values(RetryCase{"failed_here_other_host_waits", "1", true, "0 1 3 1 1 2 PENDING"},
                    RetryCase{"failed_here_only_host_retries", "1", false, "0 1 3 1 1 2 STARTED"},
                    RetryCase{"failed_elsewhere", "2", true, "0 1 3 1 1 2 STARTED"}),
    by_label);

TEST_F(SelectTest, EntriesFollowTheFileAndThisHostKeepsItsOwnStatus) {
  Job* job = make_job(1, "scene.sdl", 0, {here_, there_});
  job->status.set("started");
  write_file("Render_Tasks", scene("0 1 3 1 2 0 STARTED, 1 4 10 4 0 0 PENDING"));
  TASK* mine = Task_get();
  ASSERT_TRUE(mine != nullptr && mine->rec->id == 1);
  TASK* theirs = entry_of(job, 0);
  ASSERT_NE(theirs, nullptr);

  // Meanwhile: the other host finished, this one got its process going.
  mine->rec->status = TASK_RUNNING;
  write_file("Render_Tasks",
             scene("0 1 3 3 2 0 FINISHED, 1 4 6 4 1 0 STARTED, 2 7 10 7 0 0 PENDING"));
  rndctl.running = 1;  // only priority 0 jobs, as this one is
  TASK* next = Task_get();
  ASSERT_TRUE(next != nullptr && next->rec->id == 2);
  EXPECT_EQ(std::tuple(entry_of(job, 0), theirs->rec->status, theirs->rec->current),
            std::tuple(theirs, TASK_FINISHED, 3.0f));
  EXPECT_EQ(tasks(), scene("0 1 3 3 2 0 FINISHED, 1 4 6 4 1 0 RUNNING, 2 7 9 7 1 0 STARTED, "
                           "3 10 10 10 0 0 PENDING"));

  // The job's group leaves the file: its entries go too.
  write_file("Render_Tasks", "");
  EXPECT_EQ(Task_get(), nullptr);
  EXPECT_EQ(rndctl.tasks, nullptr);
}

// A record naming this host as its renderer that no daemon here took was left by an earlier
// daemon of this host: nobody renders it, so it goes back.
TEST_F(SelectTest, HeldRecordOfThisHostThatNoDaemonHereTookGoesBack) {
  make_job(1, "scene.sdl", 1, {here_, there_});
  rndctl.running = 1;  // a job of priority 1 is not started now: nothing new is picked
  write_file("Render_Tasks",
             scene("0 1 3 1 2 0 FINISHED, 1 4 6 4 1 0 RUNNING, 2 7 10 7 0 0 PENDING"));
  EXPECT_EQ(Task_get(), nullptr);
  EXPECT_EQ(tasks(), scene("0 1 3 1 2 0 FINISHED, 1 4 6 4 1 0 PENDING, 2 7 10 7 0 0 PENDING"));
}

TEST_F(SelectTest, PickedTaskGetsAnEmptyStreamFileThatALinkCannotRedirect) {
  here_->num_processors = 3;
  make_job(1, "scene.sdl", 0, {here_});
  write_file("scene.sdl.render1.0", "old output");
  TASK* first = GetaPendingTask();
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(std::tuple(std::string(first->stream_path.or_else("")), first->stream != nullptr,
                       read_file("scene.sdl.render1.0"), rndctl.stream_counter),
            std::tuple(path("scene.sdl.render1.0"), true, "", 1));

  write_file("victim", "keep");
  ASSERT_EQ(symlink(path("victim").c_str(), path("scene.sdl.render1.1").c_str()), 0);
  TASK* second = GetaPendingTask();
  ASSERT_NE(second, nullptr);
  EXPECT_EQ(std::pair(second->stream == nullptr, read_file("victim")),
            std::pair(true, std::string("keep")));

  rndctl.stream_counter = INT_MAX;
  TASK* third = GetaPendingTask();
  EXPECT_EQ(std::pair(rndctl.stream_counter, third != nullptr && third->stream != nullptr),
            std::pair(0, true));
}

}  // namespace
