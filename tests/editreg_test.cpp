#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "tests/support/test_support.h"

namespace {

std::string entry(const std::string& host, int pid, const std::string& user) {
  return host + " " + std::to_string(pid) + " " + user + "\n";
}

const std::string kGood = "h1 10 u1\n";

std::string registry(int entries) {
  std::string s;
  for (int i = 0; i < entries; i++) s += entry("h" + std::to_string(i), 1000 + i, "u");
  return s;
}

class EditRegTest : public ControlDirTest {
 protected:
  void SetUp() override {
    ControlDirTest::SetUp();
    fileop_poll_seconds = 0;
  }
  // Records linked in by a test are the test's own, not the fixture's to free.
  void TearDown() override {
    std::tie(rndctl.jobs, rndctl.devs) = std::pair(nullptr, nullptr);
    ControlDirTest::TearDown();
  }
};

TEST_F(EditRegTest, DeadEditorIsDroppedAndItsRecordsFreed) {
  int dead = exited_pid(), alive = getppid();
  write_file("RndCtl_EditPids", entry("testhost", dead, "gone") + entry("testhost", alive, "ed"));

  Job held_by_dead, held_by_alive;
  Dev dev;
  std::tie(held_by_dead.lock_pid, held_by_alive.lock_pid, dev.lock_pid) =
      std::tuple(dead, alive, dead);
  held_by_dead.next = &held_by_alive;
  std::tie(rndctl.jobs, rndctl.devs) = std::pair(&held_by_dead, &dev);

  Editor_process_list(0);
  EXPECT_EQ(read_file("RndCtl_EditPids"), entry("testhost", alive, "ed"));
  EXPECT_EQ(std::tuple(held_by_dead.lock_pid, held_by_alive.lock_pid, dev.lock_pid),
            std::tuple(0, alive, 0));

  // Only entry dead: the registry ends up empty.
  write_file("RndCtl_EditPids", entry("testhost", dead, "gone"));
  Editor_process_list(0);
  EXPECT_EQ(read_file("RndCtl_EditPids"), "");
  EXPECT_NE(access(path("RndCtl_EditPids.lock").c_str(), F_OK), 0);
}

TEST_F(EditRegTest, ValidateAnswersFromTheTableUntilTheFileChanges) {
  write_file("RndCtl_EditPids",
             entry("h1", 111, "anna") + entry("h2", 222, "bert") + entry("h4", 444, "dora"));
  EXPECT_EQ(Editor_process_validate(222), 222);
  EXPECT_STREQ(Editor_process_getuser(111), "anna");
  EXPECT_EQ(Editor_process_getuser(333), nullptr);

  // Rewritten behind our back with the same modification time: not re-read.
  struct stat st;
  ASSERT_EQ(stat(path("RndCtl_EditPids").c_str(), &st), 0);
  write_file("RndCtl_EditPids", entry("h3", 333, "carl"));
  struct timespec same[2] = {st.st_atim, st.st_mtim};
  ASSERT_EQ(utimensat(AT_FDCWD, path("RndCtl_EditPids").c_str(), same, 0), 0);
  EXPECT_EQ(std::pair(Editor_process_validate(222), Editor_process_validate(333)),
            std::pair(222, 0));

  // One nanosecond newer is a change.
  same[1].tv_sec += (same[1].tv_nsec + 1) / 1000000000;
  same[1].tv_nsec = (same[1].tv_nsec + 1) % 1000000000;
  ASSERT_EQ(utimensat(AT_FDCWD, path("RndCtl_EditPids").c_str(), same, 0), 0);
  EXPECT_EQ(std::pair(Editor_process_validate(333), Editor_process_validate(222)),
            std::pair(333, 0));
  // Users of an earlier load are still found past the end of the table.
  EXPECT_STREQ(Editor_process_getuser(444), "dora");
}

TEST_F(EditRegTest, RegistersUpToFifteenEditors) {
  for (int already : {0, 14, 15}) {
    const std::string before = registry(already);
    write_file("RndCtl_EditPids", before);
    testing::internal::CaptureStderr();
    Editor_process_list(1);
    const std::string err = testing::internal::GetCapturedStderr();
    EXPECT_EQ(read_file("RndCtl_EditPids"),
              before + (already == 15 ? "" : entry("testhost", getpid(), "tester")));
    EXPECT_EQ(err.find("not registered") != std::string::npos, already == 15) << err;
  }
}

// Reading stops where the file stops making sense: what a rewrite keeps of a
// truncated entry, a pid that is no number, a host or user too long, a pid
// too big, binary bytes, and one entry too many.
TEST_F(EditRegTest, ReadingStopsWhereTheFileStopsMakingSense) {
  for (const auto& [file, kept] : std::vector<std::pair<std::string, std::string>>{
           {kGood + "h2 20", kGood},
           {kGood + "h2 x u2\n" + entry("h3", 30, "u3"), kGood},
           {std::string(100, 'H') + " 20 u2\n" + kGood, ""},
           {kGood + "h2 20 " + std::string(200, 'U') + "\n" + kGood, kGood},
           {kGood + "h2 99999999999 u2\n", kGood},
           {kGood + std::string("\x01\xff\x00\x02", 4), kGood},
           {registry(16), registry(15)}}) {
    write_file("RndCtl_EditPids", file);
    Editor_process_list(2);
    EXPECT_EQ(read_file("RndCtl_EditPids"), kept) << file;
  }
}

}  // namespace
