// Job and resource records: their names and state words, and the owned text they hold.
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
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

  // Only the editor's exact placeholder name gets the index (the file tests show it); without a
  // temporary-directory setting the remote directory is the default.
  unsetenv("DRCTMPDIR");
  Dev* other = Dev_new(nullptr, nullptr, "new_resourceX", 8);
  EXPECT_STREQ(other->name.c_str(), "new_resourceX");
  EXPECT_EQ(Dev_by_name("new_resourceX"), other);
  EXPECT_STREQ(other->remote_location.c_str(), "/usr/tmp");
  EXPECT_TRUE(Dev_new(nullptr, nullptr, nullptr, 9)->name.none());
}

// The file readers' state words are exact: anything else is no state (the golden files read
// the words themselves).
TEST(StateWords, AnythingButTheExactWordIsNoState) {
  for (const char* word : {static_cast<const char*>(nullptr), "", "paused", "Locked", "NOW ", "x"})
    EXPECT_EQ(std::pair(Job_get_runstate(word), Dev_get_lockstate(word)), std::pair(0, 0))
        << (word != nullptr ? word : "(none)");
  EXPECT_EQ(Job_get_runstate("NOW"), RUN_NOW);  // a run state no golden file holds
}

TEST_F(RecordsTest, NewWorkWakesOnlyOtherHostsWithAFreeProcessor) {
  // Hosts: a (1 processor, rendering: full), b (2 processors, one render),
  // c (one full resource and one free), d (idle), and this host.
  struct DevRow {
    const char* name;
    const char* host;
    int procs;
  } const rows[] = {{"a1", "a", 1}, {"b1", "b", 2}, {"c1", "c", 1},
                    {"c2", "c", 1}, {"d1", "d", 1}, {"me", "testhost", 1}};
  Job* job = Job_new(nullptr, nullptr, "shot", 1);
  std::vector<Dev*> devs;
  for (const DevRow& s : rows) {
    Dev* dev = Dev_new(nullptr, nullptr, s.name, 0);
    dev->host_name.set(s.host);
    dev->num_processors = s.procs;
    RndDevList_add(job, dev);
    devs.push_back(dev);
    write_file(std::string(s.host) + ".pid", "1\n");
  }
  TaskRec recs[5];
  const int status[] = {TASK_RUNNING, TASK_STARTED, TASK_RUNNING, TASK_FAILED, TASK_STARTED};
  Dev* const on[] = {devs[0], devs[1], devs[2], devs[4], devs[5]};
  TaskGroup group;
  group.job = job;
  for (int i = 0; i < 5; ++i) {
    recs[i].status = status[i];
    recs[i].dev = on[i];
    recs[i].next = i + 1 < 5 ? &recs[i + 1] : nullptr;
  }
  group.tasks = &recs[0];
  std::vector<const Dev*> full = Task_full_devs(&group, {job});
  std::sort(full.begin(), full.end(),
            [](const Dev* x, const Dev* y) { return x->index < y->index; });
  EXPECT_EQ(full, (std::vector<const Dev*>{devs[0], devs[2], devs[5]}));

  std::vector<int64_t> before;
  for (const char* h : {"a", "b", "c", "d", "testhost"}) {
    struct timespec old[2] = {{1000, 0}, {1000, 0}};
    ASSERT_EQ(utimensat(AT_FDCWD, path(std::string(h) + ".pid").c_str(), old, 0), 0);
    before.push_back(daemon_updatetime_get(h));
  }
  Job_wake_other_hosts(job, &full);
  std::string woken;
  int i = 0;
  for (const char* h : {"a", "b", "c", "d", "testhost"}) {
    if (daemon_updatetime_get(h) != before[static_cast<size_t>(i++)]) woken += h;
  }
  EXPECT_EQ(woken, "bcd");
}

TEST(Text, HoldsACopyOrNoneAndReplacesOnSet) {
  char source[] = "alpha";
  Text t(source);
  source[0] = 'X';
  EXPECT_STREQ(t.c_str(), "alpha");
  t.set(t.c_str() + 1);  // overlapping: the copy is taken before the free
  EXPECT_STREQ(t.c_str(), "lpha");
  Text copy = t;
  t.set(nullptr);
  EXPECT_TRUE(t.none());
  EXPECT_STREQ(t.or_else("noname"), "noname");
  EXPECT_TRUE(copy.is("lpha"));
}
