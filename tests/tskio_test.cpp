// The task file: its exact text, reading damaged files, the locked
// read-modify-write cycles, the daemon-alive test and the status files.
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <string>
#include <vector>

#include "tests/support/task_text.h"
#include "tests/support/test_support.h"
#include "tests/support/text_records.h"

namespace {

using text_records::written_tasks;

class TaskFileTest : public ControlDirTest {
 protected:
  void SetUp() override {
    ControlDirTest::SetUp();
    alpha_ = Add_a_job(nullptr, "alpha.sdl", 1);
    beta_ = Add_a_job(nullptr, "beta.sdl", 2);
    here_ = host_dev("render1", 1, "testhost");
    there_ = host_dev("render2", 2, "otherhost");
    ASSERT_TRUE(alpha_ && beta_ && here_ && there_);
  }

  /// An entry of `job` for frames 1..10, owning a fresh record in no group.
  static TASK* entry(Job* job, int id, Dev* dev, int status) {
    return Task_add(job, TaskRec_alloc(nullptr, 1, 10, 1, dev, status, nullptr, id));
  }

  Job *alpha_ = nullptr, *beta_ = nullptr;
  Dev *here_ = nullptr, *there_ = nullptr;
};

TEST_F(TaskFileTest, WritesGroupsAndRecordsInTheFileFormat) {
  // A group without records is not written at all.
  TaskGroup* groups = TaskGroup_alloc(beta_, 7);
  insert_task(&groups, alpha_, 1, 3, TASK_STARTED);
  TaskRec* r = insert_task(&groups, alpha_, 4, 10, TASK_PENDING);
  std::tie(r->dev, r->retries, r->current) = std::tuple(there_, 3, 6.5f);
  EXPECT_EQ(written_tasks(groups),
            "\nalpha.sdl\t 1\t 2\t 2\n"
            "\t0\t 1.000000\t 3.000000\t 1.000000  0\t 0\tSTARTED\n"
            "\t1\t 4.000000\t 10.000000\t 6.500000  2\t 3\tPENDING\n");
  TaskGroup_free_all(&groups);
}

struct ReadCase {
  const char* label;
  std::string input, output;
};

class ReadDamaged : public TaskFileTest, public testing::WithParamInterface<ReadCase> {};

TEST_P(ReadDamaged, KeepsWhatItUnderstood) {
  TaskGroup* groups = text_records::read_tasks(GetParam().input);
  EXPECT_EQ(written_tasks(groups), GetParam().output);
  TaskGroup_free_all(&groups);
}

const std::string kAlpha =
    group_line("alpha.sdl", 1, 2, 2) + rec_lines("0 1 3 2 1 0 STARTED, 1 4 10 4 0 0 PENDING");
const std::string kBetaRec = rec_line(0, 1, 5, 1, 2, 3, "FAILED");
const std::string kBeta = group_line("beta.sdl", 2, 1, 1) + kBetaRec;
// The same group claiming two records, and as the rewrite then writes it.
const std::string kBetaOf2 = group_line("beta.sdl", 2, 2, 2) + kBetaRec;
const std::string kBetaAs1 = group_line("beta.sdl", 2, 1, 2) + kBetaRec;

// Each read puts the groups in reverse order.
// clang-format off
INSTANTIATE_TEST_SUITE_P(Files, ReadDamaged, testing::Values(
    ReadCase{"well_formed", kAlpha + kBeta, kBeta + kAlpha}, ReadCase{"empty", "", ""},
    ReadCase{"layout_does_not_matter", "alpha.sdl 1 2 2 0 1 3 2 1 0 STARTED 1 4.0 10 4 0 0 PENDING", kAlpha},
    ReadCase{"unknown_status_and_resource", group_line("alpha.sdl", 1, 1, 1) + rec_line(0, 1, 3, 1, 77, 0, "BOGUS"), group_line("alpha.sdl", 1, 1, 1) + rec_line(0, 1, 3, 1, 0, 0, "PENDING")},
    ReadCase{"job_gone_others_kept", kAlpha + group_line("gone.sdl", 99, 2, 2) + rec_lines("0 1 2 1 1 0 RUNNING, 1 3 4 3 0 0 PENDING") + kBeta, kBeta + kAlpha},
    ReadCase{"fewer_records_than_claimed", group_line("alpha.sdl", 1, 5, 2) + rec_lines("0 1 3 2 1 0 STARTED, 1 4 10 4 0 0 PENDING") + kBeta, kBeta + kAlpha},
    ReadCase{"cut_in_a_record", kAlpha + kBetaOf2 + "\t1\t 6.000000\t 9.0", kBetaAs1 + kAlpha},
    ReadCase{"not_a_number", kAlpha + kBetaOf2 + "\t1\t six\t 9.0\t 6  0\t 0\tPENDING\n" + kAlpha, kBetaAs1 + kAlpha},
    ReadCase{"not_finite", kAlpha + group_line("beta.sdl", 2, 1, 1) + "\t0\t nan\t 9.0\t 6  0\t 0\tPENDING\n", kAlpha},
    ReadCase{"garbled_group_line", "alpha.sdl\t x\t 1\t 1\n" + kBeta, ""},
    ReadCase{"over_long_names", group_line(std::string(5000, 'n'), 1, 1, 1) + rec_line(0, 1, 3, 1, 1, 0, std::string(3000, 'S')) + kBeta, kBeta + group_line("alpha.sdl", 1, 1, 1) + rec_line(0, 1, 3, 1, 1, 0, "PENDING")},
    ReadCase{"group_without_records", group_line("alpha.sdl", 1, 0, 3) + kBeta, kBeta}),
    by_label);
// clang-format on

TEST_F(TaskFileTest, FileUpdateDropsTheGroupOfAJobThatIsOver) {
  for (const char* state : {"aborted", "failed", "finished", "restarted"}) {
    write_file("Render_Tasks", kAlpha + kBeta);
    alpha_->status.set(state);
    Task_file_update(alpha_);
    EXPECT_EQ(read_file("Render_Tasks"), kBeta) << state;
  }
  EXPECT_EQ(std::pair(Task_file_search("otherhost"), Task_file_search("nohost")), std::pair(1, 0));
}

// One record in the file, this host's entry of id 0 (frames 4..6, RUNNING,
// at frame 5) holding a live render: what the next update writes and what
// becomes of the entry and its render.
struct OwnCase {
  const char* label;
  float file_start;                   // 4: the same task; anything else: a group built again
  int file_dev;                       // 1: this host, 2: another host
  const char *file_status, *written;  // the record's status before and after
  float written_current;
  int entry_status;  // the entry's status afterwards
  // This daemon took the piece (else the entry was made from the file); its render was killed.
  bool taken, killed;
};

class FileUpdateOwnership : public TaskFileTest, public testing::WithParamInterface<OwnCase> {};

TEST_P(FileUpdateOwnership, WritesOnlyWhatThisHostStillOwns) {
  const OwnCase& c = GetParam();
  const std::string other = group_line("beta.sdl", 2, 1, 1) + rec_line(0, 4, 6, 4, 1, 0, "STARTED");
  write_file("Render_Tasks", other + group_line("alpha.sdl", 1, 1, 1) +
                                 rec_line(0, c.file_start, 6, 4, c.file_dev, 0, c.file_status));
  alpha_->status.set("started");
  TASK* e = Task_add(alpha_, TaskRec_alloc(nullptr, 4, 6, 5, here_, TASK_RUNNING, nullptr, 0));
  e->taken = c.taken;
  const int child = sleeper();
  e->pid = child;
  Task_file_update(alpha_);
  // Another job's record of the same id is not touched.
  EXPECT_EQ(read_file("Render_Tasks"),
            group_line("alpha.sdl", 1, 1, 1) +
                rec_line(0, c.file_start, 6, c.written_current, c.file_dev, 0, c.written) + other);
  EXPECT_EQ(e->rec->status, c.entry_status);
  if (!c.killed) kill(child, SIGKILL);
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL);
  EXPECT_TRUE(!c.killed || e->pid == 0) << e->pid;
  e->pid = 0;
  // Entries of a group built again are dropped at the next safe point.
  EXPECT_EQ(Task_retire_marked() != 0, c.file_start != 4.0f);
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(Owners, FileUpdateOwnership, testing::Values(
    OwnCase{"ours_follows_the_entry", 4, 1, "STARTED", "RUNNING", 5, TASK_RUNNING, true, false},
    OwnCase{"put_back_is_left_and_lost", 4, 1, "PENDING", "PENDING", 4, TASK_PENDING, true, true},
    OwnCase{"taken_by_another_host", 4, 2, "RUNNING", "RUNNING", 4, TASK_RUNNING, true, true},
    OwnCase{"left_by_an_earlier_daemon", 4, 1, "RUNNING", "RUNNING", 4, TASK_RUNNING, false, false},
    OwnCase{"rebuilt_group_same_id", 1, 1, "STARTED", "STARTED", 4, TASK_RUNNING, true, false}),
    by_label);
// clang-format on

// 0: no pid file, 1: the pid of this live process, 2: the pid of one that ended.
class DaemonAlive : public TaskFileTest, public testing::WithParamInterface<int> {};

TEST_P(DaemonAlive, TasksOfADeadDaemonGoBackToPending) {
  const int pid = GetParam() == 2 ? exited_pid() : getpid();
  if (GetParam() != 0)
    write_file("testhost.pid", std::string(reinterpret_cast<const char*>(&pid), sizeof pid));
  write_file("Render_Tasks",
             kBeta + group_line("alpha.sdl", 1, 3, 3) +
                 rec_lines("0 1 3 2 1 4 RUNNING, 1 4 6 4 1 0 STARTED, 2 7 10 7 1 2 FINISHED"));
  const bool dead = GetParam() != 1;
  EXPECT_EQ(Task_file_check(alpha_), dead ? 1 : 0);
  // Retries are cleared in the checked job's group only.
  const char* rows = dead ? "0 1 3 2 1 0 PENDING, 1 4 6 4 1 0 PENDING, 2 7 10 7 1 0 FINISHED"
                          : "0 1 3 2 1 0 RUNNING, 1 4 6 4 1 0 STARTED, 2 7 10 7 1 0 FINISHED";
  EXPECT_EQ(read_file("Render_Tasks"), group_line("alpha.sdl", 1, 3, 3) + rec_lines(rows) + kBeta);
}

INSTANTIATE_TEST_SUITE_P(PidFiles, DaemonAlive, testing::Values(0, 1, 2));

// Records read from the file share blocks.  Kept by an entry through
// TaskRec_unpool, kept by an entry directly, or freed in any order, each
// stays what it was: values, group link, owner, and the text around it.
TEST_F(TaskFileTest, RecordsOfAReadOutliveTheReadAsTheirOwnersNeed) {
  // Three blocks' worth of records in one group, then beta's.
  std::string alpha_text = "\nalpha.sdl\t 1\t 2500\t 2500\n";
  for (int i = 0; i < 2500; ++i) alpha_text += rec_line(i, i, i, i, 1, 0, "PENDING");
  const std::string text = alpha_text + kBeta, reversed = kBeta + alpha_text;
  TaskGroup* groups = text_records::read_tasks(text);
  TaskGroup* alpha = TaskGroup_by_job(groups, alpha_);
  ASSERT_NE(alpha, nullptr);

  // Unpooled at the head, in the middle and at the end of the group's list.
  std::vector<TASK*> kept;
  for (int at : {0, 1500, 2499}) {
    TaskRec** link = &alpha->tasks;
    for (int i = 0; i < at; ++i) link = &(*link)->next;
    TaskRec *old = *link, *next = old->next, *own = TaskRec_unpool(link);
    EXPECT_EQ(std::tuple(own == old, *link, own->next, own->group, own->id, own->dev),
              std::tuple(false, own, next, alpha, at, here_));
    EXPECT_EQ(TaskRec_unpool(link), own);  // already its own
    kept.push_back(Task_add(alpha_, own));
  }
  // Kept without unpooling: its block stays for it.
  TASK* direct = Task_add(beta_, TaskGroup_by_job(groups, beta_)->tasks);
  EXPECT_EQ(written_tasks(groups), reversed);
  // Some freed one by one, out of order, the rest with their groups.
  for (int i = 2000; i > 1000; i -= 7) {
    TaskRec* rec = alpha->tasks;
    for (int k = 0; k < i && rec->next != nullptr; ++k) rec = rec->next;
    if (rec->task == nullptr) TaskRec_free(rec);
  }
  TaskGroup_free_all(&groups);
  EXPECT_EQ(
      std::tuple(kept[1]->rec->id, kept[2]->rec->start, direct->rec->status, direct->rec->retries),
      std::tuple(1500, 2499.0f, TASK_FAILED, 3));
  // A second read reuses the room and is read as the first.
  groups = text_records::read_tasks(text);
  EXPECT_EQ(written_tasks(groups), reversed);
  TaskGroup_free_all(&groups);
  while (rndctl.tasks != nullptr) TASK_free(rndctl.tasks);
}

// Releasing the groups of a read: a record an entry owns survives unless
// marked 1; one marked 2 only loses the mark, owned or not; the rest go.
struct ReleaseCase {
  int keep;
  bool owned, survives;
};

class ReleaseMarks : public TaskFileTest, public testing::WithParamInterface<ReleaseCase> {};

TEST_P(ReleaseMarks, GroupsReleaseWhatNobodyKeeps) {
  const ReleaseCase c = GetParam();
  TaskGroup* groups = TaskGroup_alloc(alpha_, 2);
  TaskRec* rec = TaskRec_alloc(groups, 1, 10, 1, here_, TASK_PENDING, nullptr, 0);
  ASSERT_TRUE(rec && TaskRec_alloc(groups, 11, 20, 11, here_, TASK_PENDING, nullptr, 1));
  rec->keep = c.keep;
  TASK* owner = c.owned ? Task_add(alpha_, rec) : nullptr;
  TaskGroup_free_all(&groups);
  EXPECT_EQ(groups, nullptr);
  EXPECT_TRUE(owner == nullptr || owner->rec == (c.survives ? rec : nullptr));
  EXPECT_TRUE(!c.survives || (rec->group == nullptr && rec->next == nullptr && rec->keep == 0));
  if (c.survives && owner == nullptr) TaskRec_free(rec);
  while (rndctl.tasks != nullptr) TASK_free(rndctl.tasks);
}

INSTANTIATE_TEST_SUITE_P(Marks, ReleaseMarks,
                         testing::Values(ReleaseCase{0, true, true}, ReleaseCase{1, true, false},
                                         ReleaseCase{2, true, true}, ReleaseCase{2, false, true},
                                         ReleaseCase{0, false, false},
                                         ReleaseCase{1, false, false}));

// The file is read back by "%s": a job name with blanks must not shift the fields after it.
TEST_F(TaskFileTest, StatusFileListsThisHostsLiveEntries) {
  alpha_->name.set("my shot\tv2\xc3\xa9\n");
  beta_->name.set("");
  entry(alpha_, 0, here_, TASK_RUNNING)->output.set("/pix/alpha.0001");
  entry(alpha_, 1, here_, TASK_STARTED);
  entry(beta_, 0, there_, TASK_RUNNING)->output.set("/pix/beta.0001");
  entry(beta_, 1, here_, TASK_RUNNING)->stale = 1;
  entry(beta_, 2, here_, TASK_FINISHED)->output.set("/pix/beta.0009");
  Task_update_status();
  EXPECT_EQ(
      read_file("TSKSTAT/testhost"),
      "my_shot_v2\xc3\xa9_ 1 2 /pix/alpha.0001\nmy_shot_v2\xc3\xa9_ 1 6 -\n- 2 3 /pix/beta.0009\n");

  EXPECT_STREQ(Task_current_filenames(alpha_, here_), "/pix/alpha.0001 ");
  EXPECT_STREQ(Task_current_filenames(beta_, here_), "/pix/beta.0009 ");
  EXPECT_STREQ(Task_current_filenames(beta_, there_), "");  // no file for that host

  // With no entries the file is emptied.
  while (rndctl.tasks != nullptr) TASK_free(rndctl.tasks);
  Task_update_status();
  EXPECT_EQ(read_file("TSKSTAT/testhost"), "");
}

TEST_F(TaskFileTest, CurrentFileNamesStayWithin1024Characters) {
  std::string text;
  for (int i = 0; i < 40; ++i)
    text += "alpha.sdl 1 2 /pix/" + std::string(40, 'a' + i % 26) + "." + std::to_string(i) + "\n";
  ASSERT_EQ(mkdir(path("TSKSTAT").c_str(), 0775), 0);
  write_file("TSKSTAT/testhost", text + "alpha.sdl 1 99 " + std::string(3000, 'z') + "\n");
  const char* got = Task_current_filenames(alpha_, here_);
  ASSERT_NE(got, nullptr);
  // Whole names only, each followed by a space, as many as fit.
  const std::string names = got;
  EXPECT_TRUE(names.size() <= 1024u && names.size() + 47 > 1024u) << names.size();
  EXPECT_TRUE(names.back() == ' ' && names.starts_with("/pix/aaaa")) << names;

  // A damaged code reads as pending; the dump stops where the file breaks.
  write_file("TSKSTAT/testhost", "alpha.sdl 1 99 out\nalpha.sdl x\n");
  testing::internal::CaptureStdout();
  Task_sfile_dump(here_);
  EXPECT_EQ(testing::internal::GetCapturedStdout(),
            "\"alpha.sdl\" is PENDING on testhost, output: out\n");
}

}  // namespace
