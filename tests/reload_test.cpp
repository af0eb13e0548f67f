// The reconciling reload: fresh records from the files, running-task entries
// re-pointed at them, the state text settled, both files written back.
#include "tests/support/test_support.h"

namespace {

const char kResources[] =
    "RenderResourceControl\n"
    "testhost 1 {\n\tlock_pid \t= 0;\n\thost_name\t\t= testhost;\n\tmax_frames \t\t= 3;\n"
    "\tnum_processors \t= 2;\n  default_dev     = 0;\n\t}\n\nEnd\n";

/// The job file holding job 7 in `state` (none when `state` is null).
std::string jobs_file(const char* state, int minutes = 0, int seconds = 0) {
  return "RenderJobControl " + std::to_string(minutes) + " " + std::to_string(seconds) + "\n" +
         (state == nullptr ? ""
                           : "shot 7 {\n\tstatus \t\t= \"" + std::string(state) +
                                 "\";\n\tpriority \t= 0;\n\tuse_sdl_paths = TRUE;\n"
                                 "\toutput_mask = FALSE;\n\tresources\t= testhost;\n}\n\n") +
         "End\n";
}

class ReloadTest : public ControlDirTest {
 protected:
  void load(const std::string& jobs) {
    write_file("Render_Resource_Control", kResources);
    write_file("Render_Job_Control", jobs);
    RJC_in();
    ASSERT_NE(Job_by_index(7), nullptr);
  }
  std::string state_in_file() {
    const std::string text = read_file("Render_Job_Control");
    const size_t at = text.find("status \t\t= \"") + 12;
    return at < 12 ? "(none)" : text.substr(at, text.find('"', at) - at);
  }
};

struct Case {
  const char* label;
  int editor;
  const char *in_file, *in_memory, *expected;
};

class Reconcile : public ReloadTest, public ::testing::WithParamInterface<Case> {};

TEST_P(Reconcile, FurtherProgressWinsAndTheFileWinsInTheDaemon) {
  const Case& c = GetParam();
  load(jobs_file("none"));
  write_file("Render_Job_Control", jobs_file(c.in_file));
  Job_by_index(7)->status.set(c.in_memory);
  Update_from_demon(c.editor);
  ASSERT_NE(Job_by_index(7), nullptr);
  EXPECT_STREQ(Job_by_index(7)->status.c_str(), c.expected);
  EXPECT_EQ(state_in_file(), c.expected);
}

INSTANTIATE_TEST_SUITE_P(
    States, Reconcile,
    ::testing::Values(Case{"daemon_takes_file", 0, "pending", "started", "pending"},
                      Case{"editor_keeps_more_progress", 1, "40.00% ", "55.00% ", "55.00% "},
                      Case{"editor_takes_file_progress", 1, "60", "55", "60"},
                      Case{"file_abort_wins", 1, "aborted", "55", "aborted"},
                      Case{"file_finished_wins", 1, "finished", "started", "finished"},
                      Case{"memory_abort_taken_from_file", 1, "40", "aborted", "40"},
                      Case{"started_over_pending", 1, "started", "pending", "started"},
                      Case{"keyword_kept_over_keyword", 1, "pending", "started", "started"},
                      Case{"number_over_started", 1, "12.5", "started", "12.5"}),
    by_label);

TEST_F(ReloadTest, RunningTaskEntriesFollowTheFreshRecordsOrLoseAVanishedJob) {
  load(jobs_file("started"));
  TASK* entry = Task_add(
      Job_by_index(7), TaskRec_alloc(nullptr, 0, 0, 0, Dev_by_index(1), TASK_PENDING, nullptr, 0));
  ASSERT_NE(entry, nullptr);

  Update_from_demon(0);
  ASSERT_NE(Job_by_index(7), nullptr);
  EXPECT_EQ(std::tuple(entry->job, entry->rec->dev, entry->rec->dev->index),
            std::tuple(Job_by_index(7), Dev_by_index(1), 1));

  write_file("Render_Job_Control", jobs_file(nullptr));
  Update_from_demon(0);
  EXPECT_EQ(std::tuple(entry->job, Job_by_index(7), entry->rec->dev),
            std::tuple(nullptr, nullptr, Dev_by_index(1)));
}

TEST_F(ReloadTest, TheJobFileHeaderSetsTheCheckIntervalAndTheUpdateTimeIsRecorded) {
  write_file("testhost.pid", "abcd");
  load(jobs_file("pending", 2, 30));
  write_file("Render_Job_Control", jobs_file("pending", 4, 5));
  daemon_updatetime_set("testhost");
  Update_from_demon(0);
  EXPECT_EQ(std::tuple(rndctl.interval_min, rndctl.interval_sec, rndctl.last_update),
            std::tuple(4u, 5u, daemon_updatetime_get("testhost")));
}

TEST_F(ReloadTest, AnEmptyOrMissingControlFileReadsAsNoRecords) {
  EXPECT_EQ(RJC_in(), 0);
  EXPECT_TRUE(rndctl.jobs == nullptr && rndctl.devs == nullptr);
  RJC_out();
  EXPECT_EQ(read_file("Render_Resource_Control"), "RenderResourceControl\nEnd\n");
  EXPECT_EQ(read_file("Render_Job_Control"), "RenderJobControl 0 0\nEnd\n");
}

}  // namespace
