// Job and resource records and the pick lists between them.
#include <cstdlib>
#include <string>
#include <vector>

#include "tests/support/test_support.h"

namespace {

class RecordsTest : public ControlDirTest {};

}  // namespace

TEST_F(RecordsTest, NewRecordsTakeTheirNamesFromWhatTheyAreGiven) {
  // A job is named after its scene file; without a path it has neither.
  Job* job = Job_new(nullptr, nullptr, "/proj/sdl/ball.sdl", 12);
  EXPECT_STREQ(job->name.c_str(), "ball.sdl");
  EXPECT_STREQ(job->sdl.c_str(), "/proj/sdl/ball.sdl");
  EXPECT_STREQ(Job_new(nullptr, nullptr, "shot", 14)->name.c_str(), "shot");
  Job* bare = Job_new(nullptr, nullptr, nullptr, 13);
  EXPECT_TRUE(bare->name.none() && bare->sdl.none());

  // The editor's placeholder resource name gets the index; others are kept.
  // The remote directory follows the temporary-directory setting.
  setenv("DRCTMPDIR", "/scratch/tmp", 1);
  Dev* dev = Dev_new(nullptr, nullptr, "new_resource", 7);
  unsetenv("DRCTMPDIR");
  EXPECT_STREQ(dev->name.c_str(), "new_resource_7");
  EXPECT_EQ(Dev_by_name("new_resource_7"), dev);
  EXPECT_STREQ(dev->host_name.c_str(), "testhost");
  EXPECT_STREQ(dev->remote_location.c_str(), "/scratch/tmp");
  Dev* other = Dev_new(nullptr, nullptr, "new_resourceX", 8);
  EXPECT_STREQ(other->name.c_str(), "new_resourceX");
  EXPECT_STREQ(other->remote_location.c_str(), "/usr/tmp");
  EXPECT_TRUE(Dev_new(nullptr, nullptr, nullptr, 9)->name.none());
}

TEST_F(RecordsTest, AddFindsByIndexAndLookupsReturnFirstMatch) {
  Job* a = Add_a_job(nullptr, "shot", 7);
  a->priority = 5;
  // Rereading the same index updates the record in memory: same job back.
  EXPECT_EQ(Add_a_job(nullptr, "other", 7), a);
  EXPECT_STREQ(a->name.c_str(), "shot");
  EXPECT_EQ(Insert_a_job(nullptr, nullptr, "x", 7), a);

  // Duplicate indexes and names can be made by hand; lookups give the first
  // in list order, also after the first one goes.
  Job* second = Job_new(nullptr, nullptr, "shot", 7);
  Job* third = Job_new(a, nullptr, "shot", 7);  // now first in the list
  EXPECT_EQ(Job_by_index(7), third);
  EXPECT_EQ(Job_by_name("shot"), third);
  Job_del(third);
  EXPECT_EQ(Job_by_index(7), a);
  Job_del(a);
  EXPECT_EQ(Job_by_index(7), second);
  Job_del(second);
  EXPECT_EQ(Job_by_index(7), nullptr);
  EXPECT_EQ(Job_by_name(nullptr), nullptr);

  int item[4] = {};
  Job* listed = Job_new(nullptr, item, "listed", 8);
  EXPECT_EQ(Job_by_listitem(item), listed);
}

TEST_F(RecordsTest, PickListsStayMirrored) {
  Job* job = Job_new(nullptr, nullptr, "job", 1);
  Job* other = Job_new(nullptr, nullptr, "other", 2);
  Dev* a = Dev_new(nullptr, nullptr, "a", 1);
  Dev* b = Dev_new(nullptr, nullptr, "b", 2);

  RndDevList* first = RndDevList_add(job, a);
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(RndDevList_add(job, a), first);  // no second entry
  RndDevList_add(job, b);
  RndDevList_add(other, a);
  EXPECT_EQ(first->mirror->mirror, first);
  EXPECT_EQ(first->mirror->job, job);
  EXPECT_EQ(ISA_resource_usedby(job, b), 1);
  EXPECT_EQ(ISA_resource_usedby(other, b), 0);

  EXPECT_EQ(RndDevList_picked(job), nullptr);
  RndDevList_pick(job, b);
  EXPECT_EQ(RndDevList_picked(job), b);
  RndJobList_pick(a, other);
  EXPECT_EQ(RndJobList_picked(a), other);

  // Removing from the job's side removes the resource's mirror too.
  EXPECT_EQ(RndDevList_del(job, a), b);
  EXPECT_EQ(RndDevList_del(job, a), nullptr);
  ASSERT_NE(a->jobs, nullptr);
  EXPECT_EQ(a->jobs->job, other);
  EXPECT_EQ(a->jobs->next, nullptr);

  // Deleting a resource takes it out of every job; deleting a job takes it
  // out of every resource.
  RndDevList_add(job, a);
  Dev_del(a);
  EXPECT_EQ(ISA_resource_usedby(job, a), 0);
  EXPECT_EQ(other->resources, nullptr);
  ASSERT_NE(job->resources, nullptr);
  EXPECT_EQ(job->resources->dev, b);
  Job_del(job);
  EXPECT_EQ(b->jobs, nullptr);
}

TEST(StateWords, DecodeCaseSensitively) {
  struct {
    const char* word;
    int run, lock;
  } const words[] = {{nullptr, 0, 0},     {"", 0, 0},         {"PAUSED", 1, 0}, {"paused", 0, 0},
                     {"AVAILABLE", 2, 2}, {"SCHEDULE", 3, 3}, {"NOW", 4, 0},    {"LOCKED", 0, 1},
                     {"Locked", 0, 0},    {"NOW ", 0, 0}};
  for (const auto& w : words) {
    SCOPED_TRACE(w.word != nullptr ? w.word : "(none)");
    EXPECT_EQ(Job_get_runstate(w.word), w.run);
    EXPECT_EQ(Dev_get_lockstate(w.word), w.lock);
  }
}
