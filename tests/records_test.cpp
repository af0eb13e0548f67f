// Job and resource records and the pick lists between them.
#include <cstdlib>
#include <string>
#include <vector>

#include "tests/support/test_support.h"

namespace {

template <class T>
std::vector<int> order(T* head) {
  std::vector<int> v;
  for (; head != nullptr; head = head->next) v.push_back(head->index);
  return v;
}

// Back links must mirror forward links, or deletes corrupt the list.
template <class T>
void expect_back_links(T* head) {
  for (T* prev = nullptr; head != nullptr; prev = head, head = head->next) {
    EXPECT_EQ(head->prev, prev);
  }
}

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

TEST_F(RecordsTest, JobListOrderInsertAndDelete) {
  Job* a = Job_new(nullptr, nullptr, "a", 1);
  Job* b = Job_new(nullptr, nullptr, "b", 2);
  Job_new(a, nullptr, "head", 3);  // before the head: becomes the head
  Job_new(b, nullptr, "mid", 4);   // before an inner job
  EXPECT_EQ(order(rndctl.jobs), (std::vector<int>{3, 1, 4, 2}));
  expect_back_links(rndctl.jobs);

  // Deleting returns the job before, else the one after.
  EXPECT_EQ(Job_del(b)->index, 4);
  EXPECT_EQ(Job_del(rndctl.jobs)->index, 1);  // the head: its successor
  EXPECT_EQ(order(rndctl.jobs), (std::vector<int>{1, 4}));
  expect_back_links(rndctl.jobs);
  // Appending after deletes lands at the real tail.
  Job_new(nullptr, nullptr, "c", 5);
  EXPECT_EQ(order(rndctl.jobs), (std::vector<int>{1, 4, 5}));
  Job_del(Job_by_index(5));
  Job_del(Job_by_index(4));
  EXPECT_EQ(Job_del(rndctl.jobs), nullptr);  // the only job
  EXPECT_EQ(rndctl.jobs, nullptr);
  EXPECT_EQ(Job_del(nullptr), nullptr);
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

TEST_F(RecordsTest, ResourceListAndRename) {
  Dev* a = Add_a_dev(nullptr, "a", 1);
  Dev* b = Add_a_dev(nullptr, "b", 2);
  EXPECT_EQ(Add_a_dev(nullptr, "zz", 1), a);
  Dev* head = Insert_a_dev(a, nullptr, "head", 3);
  EXPECT_EQ(order(rndctl.devs), (std::vector<int>{3, 1, 2}));
  expect_back_links(rndctl.devs);

  Dev_set_name(b, "a");  // two resources called a: the first wins
  EXPECT_EQ(Dev_by_name("a"), a);
  EXPECT_EQ(Dev_by_name("b"), nullptr);
  Dev_del(a);
  EXPECT_EQ(Dev_by_name("a"), b);
  // A name set behind the table's back is still found.
  head->name.set("renamed");
  EXPECT_EQ(Dev_by_name("renamed"), head);
  EXPECT_EQ(Dev_del(head), b);
  EXPECT_EQ(rndctl.devs, b);
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

// Appends go through the tail each list keeps: after any mix of adds and
// deletes (head, middle, tail, the only entry, a clone's own lists) every
// list must still end where its tail says and hold what a plain model holds.
template <class E>
void expect_tail(E* head, E* tail) {
  expect_back_links(head);
  E* last = nullptr;
  for (E* e = head; e != nullptr; e = e->next) last = e;
  EXPECT_EQ(tail, last);
}

TEST_F(RecordsTest, ListsAppendAtTheirTailAfterAnyDelete) {
  Dev* host = Dev_new(nullptr, nullptr, "host", 1);
  Dev* other = Dev_new(nullptr, nullptr, "other", 2);
  Job* job = Job_new(nullptr, nullptr, "j", 1);
  std::vector<int> jobs_model;
  std::vector<std::string> paths_model;
  unsigned seed = 7;
  auto next = [&seed](unsigned n) { return (seed = seed * 1103515245u + 12345u) / 65536u % n; };
  for (int step = 0; step < 400; ++step) {
    if (next(3) != 0 || jobs_model.empty()) {
      int index = step + 10;
      RndDevList_add(Job_new(nullptr, nullptr, "j", index), host);
      jobs_model.push_back(index);
      std::string p = "/p/" + std::to_string(step);
      RndPathList_add(job, p.c_str());
      paths_model.push_back(p);
    } else {
      size_t at = next(static_cast<unsigned>(jobs_model.size()));
      Job_del(Job_by_index(jobs_model[at]));
      jobs_model.erase(jobs_model.begin() + static_cast<long>(at));
      RndPathList_del(job, paths_model[at].c_str());
      paths_model.erase(paths_model.begin() + static_cast<long>(at));
    }
    expect_tail(host->jobs, host->jobs_tail);
    expect_tail(job->searchpath, job->searchpath_tail);
  }
  std::vector<int> seen;
  for (RndJobList* e = host->jobs; e != nullptr; e = e->next) seen.push_back(e->job->index);
  EXPECT_EQ(seen, jobs_model);
  std::vector<std::string> paths;
  for (RndPathList* p = job->searchpath; p != nullptr; p = p->next)
    paths.push_back(p->path.c_str());
  EXPECT_EQ(paths, paths_model);

  // A job's resource list down to nothing and back; a clone owns its lists.
  RndDevList_add(job, host);
  RndDevList_add(job, other);
  RndDevList_del(job, other);
  RndDevList_del(job, host);
  EXPECT_TRUE(job->resources == nullptr && job->resources_tail == nullptr);
  RndDevList_add(job, other);
  Job* copy = Job_clone(job);
  ASSERT_NE(copy, nullptr);
  RndPathList_add(copy, "/copy");
  RndDevList_add(copy, host);
  expect_tail(job->searchpath, job->searchpath_tail);
  expect_tail(copy->searchpath, copy->searchpath_tail);
  expect_tail(copy->resources, copy->resources_tail);
  EXPECT_STREQ(copy->searchpath_tail->path.c_str(), "/copy");
  EXPECT_EQ(job->resources_tail->dev, other);
  Dev_del(other);
  expect_tail(job->resources, job->resources_tail);
  expect_tail(copy->resources, copy->resources_tail);
  EXPECT_EQ(job->resources, nullptr);
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
