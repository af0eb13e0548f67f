// Index files, scene-file settings, frame counts, field checks, record comparison.
#include <gmock/gmock.h>

#include <array>
#include <filesystem>
#include <functional>
#include <string>

#include "tests/support/test_support.h"

namespace {

class JobCheckTest : public ControlDirTest {
 protected:
  Job* scene_job(const std::string& scene) {
    write_file("scene.sdl", scene);
    return Job_new(nullptr, nullptr, path("scene.sdl").c_str(), 1);
  }
};

}  // namespace

// A missing file starts at 1; the two counters are separate files; records
// made without an index take the next one, as does a new resource's name;
// wrapping past the top never stores 0, which would ask for a fresh index.
TEST_F(JobCheckTest, NextIndexReadsAndAdvancesTheFile) {
  write_file("Render_Job_next_index", "41l\n");
  EXPECT_EQ((std::pair{RJCget_next_index(FILE_JOB_INDEX), RJCget_next_index(FILE_DEV_INDEX)}),
            std::pair(41, 1));
  EXPECT_EQ(read_file("Render_Job_next_index") + read_file("Render_Dev_next_index"), "42l\n2l\n");
  EXPECT_FALSE(std::filesystem::exists(path("Render_Job_next_index.lock")));
  EXPECT_EQ(Job_new(nullptr, nullptr, "a", 0)->index, 42);
  EXPECT_STREQ(Dev_new(nullptr, nullptr, "new_resource", 0)->name.c_str(), "new_resource_2");
  write_file("Render_Dev_next_index", "-1l\n");
  EXPECT_EQ(RJCget_next_index(FILE_DEV_INDEX), -1);
  EXPECT_EQ(read_file("Render_Dev_next_index"), "1l\n");
}

TEST(FrameCount, CountsFramesLandingOnTheEnd) {
  // 0.1 accumulates past 2.0 by rounding, and still counts within tolerance.
  const std::tuple<float, float, float, int> rows[] = {
      {1, 10, 3, 4}, {10, 1, 1, 1}, {1, 10, 0, 1}, {1, 2, .1f, 11}};
  for (auto [start, end, step, count] : rows)
    EXPECT_EQ(Calc_frame_range(start, end, step), count) << start << " " << end << " " << step;
}

TEST_F(JobCheckTest, FieldSettingsFromTheScene) {
  // FALSE ends the scan, so the odd and even lines after it are not read; a
  // line holding ENVIRONMENT with its newline does not stop it; a scene
  // without the keys, or no scene file (null), leaves fields alone.
  for (auto [scene, before, result, after] :
       {std::tuple{"fields = TRUE;\nodd = TRUE;\neven = FALSE;\n", 0, 1, 1},
        {"fields = FALSE;\nodd = TRUE;\neven = TRUE;\n", 3, 0, 0},
        {"ENVIRONMENT\nfields = TRUE;\nodd = ON;\neven = TRUE;\n", 0, 3, 3},
        {"camera = persp;\n", 2, 2, 2},
        {nullptr, 2, 0, 2}}) {
    Job* job = scene_job(scene != nullptr ? scene : "");
    if (scene == nullptr) job->sdl.set(path("missing.sdl").c_str());
    job->fields = before;
    EXPECT_EQ((std::pair{Job_check_sdlfields(job), job->fields}), std::pair(result, after))
        << scene;
  }
  EXPECT_EQ(Job_check_sdlfields(nullptr), 0);
}

TEST_F(JobCheckTest, AnimationSettingsFromTheScene) {
  Job* job = scene_job(
      "DEFINITION\n  animation = ON;\n  startframe = 1;\n  endframe = 10.0;\n  byframe = 2;\n"
      "  start_extension = 100;\n  by_extension = 5;\n  extensionsize = 4;\n");
  EXPECT_EQ((std::pair{Job_set_frame_range(job), job->animate}), std::pair(5, 1));
  EXPECT_THAT(job->frames, testing::ElementsAre(1.0f, 10.0f, 2.0f));
  // The extension flag word belongs to the job file.
  EXPECT_THAT((std::array{job->ext_start, job->ext_by, job->ext_size, job->extension}),
              testing::ElementsAre(100, 5, 4, 0));
  // animation OFF stops reading: the frames after it are not taken.
  job = scene_job("animation = OFF;\nstartframe = 7;\n");
  EXPECT_EQ((std::tuple{Job_set_frame_range(job), job->animate, job->frames[0]}),
            std::tuple(1, 0, 0.0f));
  job->sdl.reset();
  EXPECT_EQ(Job_set_frame_range(job), 0);
}

TEST_F(JobCheckTest, SceneCheckKeepsFramesAndHonoursTheExtensionFlag) {
  const char* scene =
      "animation = ON;\nstartframe = 50;\nstart_extension = 9;\nby_extension = 3;\n";
  Job* job = scene_job(scene);
  std::tie(job->frames[0], job->frames[1], job->frames[2]) = std::tuple(4.7f, 8.f, 1.f);
  // 4.7 5.7 6.7 7.7 from the job, not the scene.
  EXPECT_EQ((std::tuple{Job_check_sdl(job), job->frames[0], job->ext_start, job->ext_by}),
            std::tuple(4, 4.7f, 9, 3));
  // Without extension lines the defaults come from the start frame; with the
  // job file's extension set, the scene's values are not read.
  job = scene_job("animation = ON;\n");
  std::tie(job->frames[0], job->ext_by) = std::tuple(4.7f, 8);
  Job_check_sdl(job);
  EXPECT_EQ(std::pair(job->ext_start, job->ext_by), std::pair(4, 1));
  job = scene_job(scene);
  std::tie(job->extension, job->ext_start, job->ext_by) = std::tuple(291, 20, 2);
  Job_check_sdl(job);
  EXPECT_EQ(std::tuple(job->ext_start, job->ext_by, job->animate), std::tuple(20, 2, 1));
}

TEST_F(JobCheckTest, FieldChecksFillOwnersAndDropDeadLocks) {
  Job *mine = Job_new(nullptr, nullptr, "mine", 1), *stale = Job_new(nullptr, nullptr, "stale", 2);
  Dev* dev = Dev_new(nullptr, nullptr, "d", 1);
  mine->lock_pid = rndctl.pid;
  stale->lock_pid = dev->lock_pid = 999999;  // no editor registered under it
  stale->user.set("alice");
  Job_field_check(), Dev_field_check();
  EXPECT_EQ(std::string(mine->user.c_str()) + " " + stale->user.c_str(), "tester alice");
  EXPECT_EQ(std::tuple(mine->lock_pid, stale->lock_pid, dev->lock_pid),
            std::tuple(rndctl.pid, 0, 0));
}

TEST_F(JobCheckTest, LiveJobsOnAHost) {
  Dev* there = host_dev("there", 2, "elsewhere");
  Job* job = Job_new(nullptr, nullptr, "j", 1);
  RndDevList_add(job, there), RndDevList_add(job, Dev_new(nullptr, nullptr, "here", 1));
  for (const char* dead : {"none", "failed", "aborted", "finished"})
    EXPECT_EQ((job->status.set(dead), Job_file_search("testhost")), 0) << dead;
  job->status.set("pending");
  for (auto [host, live] : {std::pair{"testhost", 1}, {"elsewhere", 1}, {"nowhere", 0}})
    EXPECT_EQ(Job_file_search(host), live) << host;
}

// Fields and pick level take no part; any other change is a difference.
TEST_F(JobCheckTest, JobDifferences) {
  Dev *dev = Dev_new(nullptr, nullptr, "host", 1),
      *other_dev = Dev_new(nullptr, nullptr, "host", 2);
  const std::function<void(Job*)> changes[] = {
      [](Job* j) { j->name.reset(); }, [](Job* j) { j->frames[2] = 1e-9f; },
      [](Job* j) { j->runs[335] = 1; }, [](Job* j) { j->searchpath->path.set("/other"); },
      [&](Job* j) { RndDevList_add(j, other_dev); }};
  for (size_t i = 0; i < std::size(changes); i++) {
    Job *a = Job_new(nullptr, nullptr, "shot", 1), *b = Job_new(nullptr, nullptr, "shot", 1);
    for (Job* j : {a, b}) RndDevList_add(j, dev), RndPathList_add(j, "/maps"), j->runs[100] = 1;
    std::tie(a->fields, a->pick_level) = std::pair(3, 1);
    EXPECT_EQ((std::pair{ISA_jobdif(a, b), (changes[i](b), ISA_jobdif(a, b))}), std::pair(0, 1))
        << i;
  }
}

TEST_F(JobCheckTest, ResourceDifferences) {
  // Copies of records come from different lists: each resource copy gets
  // its own copies of the jobs, linked in the other order.
  auto copy_of_a = [](int first, int second) {
    Dev* d = Dev_new(nullptr, nullptr, "a", 1);
    for (int index : {first, second}) RndDevList_add(Job_new(nullptr, nullptr, "j", index), d);
    return d;
  };
  Dev* a = copy_of_a(1, 2);
  EXPECT_EQ(ISA_devdif(a, copy_of_a(2, 1)), 0);
  const std::function<void(Dev*)> changes[] = {
      [](Dev* d) { d->max_frames = 8; }, [](Dev* d) { d->host_name.reset(); },
      [](Dev* d) { d->locks[0] = 1; }, [](Dev* d) { RndJobList_del(d, d->jobs->job); },
      [](Dev* d) { RndDevList_add(Job_new(nullptr, nullptr, "j", 3), d); }};
  for (size_t i = 0; i < std::size(changes); i++) {
    Dev* copy = copy_of_a(2, 1);
    EXPECT_EQ((changes[i](copy), ISA_devdif(a, copy)), 1) << i;
  }
}
