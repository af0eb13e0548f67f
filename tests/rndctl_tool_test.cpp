// The command-line tool's pure parts: what it accepts from a user before
// anything is written, and how it draws.
#if defined(RNDCTL_TOOL)
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdio>
#include <cstdlib>
#include <functional>
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#include <vector>

#include "tests/support/test_support.h"
#include "tools/rndctl/editor_side.h"
#include "tools/rndctl/tables.h"

namespace {

struct FramesCase {
  const char* text;
  bool ok;
  float start, end, by;
};
class FramesTest : public ::testing::TestWithParam<FramesCase> {};

TEST_P(FramesTest, ParsesOrRefuses) {
  const FramesCase& c = GetParam();
  CtlFrames f;
  std::string why;
  ASSERT_EQ(Ctl_parse_frames(c.text, &f, &why), c.ok) << c.text << ": " << why;
  if (!c.ok) {
    EXPECT_FALSE(why.empty());
    return;
  }
  EXPECT_EQ(f.start, c.start);
  EXPECT_EQ(f.end, c.end);
  EXPECT_EQ(f.by, c.by);
}

INSTANTIATE_TEST_SUITE_P(
    Ranges, FramesTest,
    ::testing::Values(FramesCase{"1-10", true, 1, 10, 1}, FramesCase{"1-10:2", true, 1, 10, 2},
                      FramesCase{"-5--1", true, -5, -1, 1}, FramesCase{"3-3", true, 3, 3, 1},
                      FramesCase{"1.5-2.5:0.5", true, 1.5f, 2.5f, 0.5f},
                      FramesCase{"10-1", false, 0, 0, 0}, FramesCase{"1-10:0", false, 0, 0, 0},
                      FramesCase{"1-10:-1", false, 0, 0, 0}, FramesCase{"1", false, 0, 0, 0},
                      FramesCase{"a-b", false, 0, 0, 0}, FramesCase{"1-10x", false, 0, 0, 0},
                      FramesCase{"", false, 0, 0, 0}));

struct BlockCase {
  const char* text;
  bool ok;
  int start, end;
  const char* first;
  const char* last;
};
class BlockTest : public ::testing::TestWithParam<BlockCase> {};

TEST_P(BlockTest, ParsesOrRefuses) {
  const BlockCase& c = GetParam();
  CtlBlock b;
  std::string why;
  ASSERT_EQ(Ctl_parse_block(c.text, &b, &why), c.ok) << c.text << ": " << why;
  if (!c.ok) return;
  EXPECT_EQ(b.start, c.start);
  EXPECT_EQ(b.end, c.end);
  EXPECT_EQ(b.first_day, c.first);
  EXPECT_EQ(b.last_day, c.last);
}

INSTANTIATE_TEST_SUITE_P(
    Schedules, BlockTest,
    ::testing::Values(BlockCase{"800-1700 Monday-Friday", true, 800, 1700, "monday", "friday"},
                      BlockCase{"2200-600 sat", true, 2200, 600, "saturday", "saturday"},
                      BlockCase{"0-2400 Sun", true, 0, 2400, "sunday", "sunday"},
                      BlockCase{"830-1700 Mon", true, 830, 1700, "monday", "monday"},
                      BlockCase{"815-1700 Mon", false, 0, 0, "", ""},  // off the half hours
                      BlockCase{"800-2500 Mon", false, 0, 0, "", ""},  // past the day
                      BlockCase{"2400-100 Mon", false, 0, 0, "", ""},  // 2400 only ends
                      BlockCase{"800-800 Mon", false, 0, 0, "", ""},   // empty
                      BlockCase{"800-1700 Friday-Monday", false, 0, 0, "", ""},
                      BlockCase{"800-1700 SUN", false, 0, 0, "", ""},  // the queue's names only
                      BlockCase{"800-1700", false, 0, 0, "", ""},
                      BlockCase{"8am-5pm Mon", false, 0, 0, "", ""}));

// A span over midnight is split, and Saturday night runs into Sunday.
TEST(RndctlSchedule, ASpanOverMidnightFillsTheNightsAndMorningsAfter) {
  CtlBlock b;
  std::string why;
  ASSERT_TRUE(Ctl_parse_block("2200-600 Friday-Saturday", &b, &why)) << why;
  std::vector<std::string> fills;
  Ctl_apply_block(b, [&](int s, int e, const char* f, const char* l) {
    fills.push_back(std::to_string(s) + "-" + std::to_string(e) + " " + f + "-" + l);
  });
  EXPECT_EQ(fills, (std::vector<std::string>{"2200-2400 friday-saturday", "0-600 saturday-saturday",
                                             "0-600 sunday-sunday"}));
}

TEST(RndctlInput, RefusesWhatTheReaderCannotCarry) {
  std::string why;
  EXPECT_TRUE(Ctl_word_ok("spin_2.v3", &why));
  for (const char* bad : {"two words", "12", "status", "runs", "-x", "a\"b", ""})
    EXPECT_FALSE(Ctl_word_ok(bad, &why)) << bad;
  EXPECT_TRUE(Ctl_string_ok("/a path/with blanks", &why));
  EXPECT_FALSE(Ctl_string_ok("a\"b", &why));
  EXPECT_FALSE(Ctl_string_ok("a\nb", &why));
  EXPECT_FALSE(Ctl_string_ok(std::string(RJC_STRING_LIMIT + 1, 'x'), &why));
  EXPECT_EQ(Ctl_split("a,,b,", ','), (std::vector<std::string>{"a", "b"}));
}

TEST(RndctlOutput, BarsAndCutsKeepTheirWidth) {
  EXPECT_EQ(Out_bar(0.0, 7), "[.....]");
  EXPECT_EQ(Out_bar(0.5, 12), "[#####.....]");
  EXPECT_EQ(Out_bar(2.0, 7), "[#####]");
  EXPECT_EQ(Out_fit("abcdef", 4), "abc~");
  EXPECT_EQ(Out_fit("abc", 4), "abc");
}

// The tables a user reads, on a farm of three hosts and three jobs: one part
// rendered on a live host, one paused with names too long for their columns,
// one finished on every host.  Regenerate with RNDCTL_GOLDEN_UPDATE=1.
class RndctlTables : public ControlDirTest {
 protected:
  void SetUp() override {
    ControlDirTest::SetUp();
    golden_ = std::string(TESTS_DIR) + "/golden/rndctl/";
    for (const char* f : {"Render_Resource_Control", "Render_Job_Control", "Render_Tasks"})
      write_file(f, read_text_file(golden_ + f));
    // render01's heartbeat is fresh: its daemon counts as up.
    mkdir(path("TSKSTAT").c_str(), 0777);
    write_file("TSKSTAT/render01", "");
    std::string why;
    ASSERT_TRUE(Ctl_load(&why)) << why;
    ASSERT_TRUE(Ctl_read_tasks(&tasks_));
  }
  void expect_golden(const std::string& name, const std::string& got) {
    if (getenv("RNDCTL_GOLDEN_UPDATE") != nullptr) write_text_file(golden_ + name, got);
    EXPECT_EQ(got, read_text_file(golden_ + name)) << got;
    std::istringstream lines(got);
    for (std::string line; std::getline(lines, line);) EXPECT_LE(line.size(), 80u) << line;
  }
  static std::string printed(const std::function<void(FILE*)>& print) {
    char* buf = nullptr;
    size_t size = 0;
    FILE* fp = open_memstream(&buf, &size);
    print(fp);
    fclose(fp);
    std::string text(buf, size);
    free(buf);
    return text;
  }
  std::string golden_;
  CtlTasks tasks_;
};

TEST_F(RndctlTables, JobAndHostTablesMatchTheirGoldenText) {
  expect_golden("jobs.txt", printed([](FILE* fp) { Out_jobs_table(fp, false); }));
  expect_golden("hosts.txt", printed([&](FILE* fp) { Out_hosts_table(fp, tasks_, false); }));
  // Colour only when asked for, and then without shifting the columns.
  std::string coloured = printed([](FILE* fp) { Out_jobs_table(fp, true); });
  EXPECT_NE(coloured.find("\033[32mfinished  \033[0m"), std::string::npos) << coloured;
}

TEST_F(RndctlTables, JsonReadsBackWithEveryField) {
  nlohmann::json jobs = nlohmann::json::parse(Out_jobs_json(&tasks_).dump(2));
  ASSERT_EQ(jobs.size(), 3u);
  EXPECT_EQ(jobs[0]["name"], "shot_010");
  EXPECT_EQ(jobs[0]["state"], "45.00%");
  EXPECT_EQ(jobs[0]["hosts"], nlohmann::json({"render02", "render01"}));
  EXPECT_EQ(jobs[0]["frames"], nlohmann::json({1.0, 120.0, 1.0}));
  EXPECT_EQ(jobs[0]["doneframes"], 54);
  ASSERT_EQ(jobs[0]["tasks"].size(), 2u);
  EXPECT_EQ(jobs[0]["tasks"][0]["status"], "RUNNING");
  EXPECT_EQ(jobs[0]["tasks"][0]["host"], "render01");
  EXPECT_EQ(jobs[1]["name"], "a_very_long_job_name_indeed");  // never cut
  EXPECT_EQ(jobs[1]["run"], "PAUSED");
  EXPECT_EQ(jobs[2]["hosts"].size(), 3u);

  nlohmann::json hosts = nlohmann::json::parse(Out_hosts_json(tasks_).dump(2));
  ASSERT_EQ(hosts.size(), 3u);
  EXPECT_EQ(hosts[0]["alive"], true);
  EXPECT_EQ(hosts[0]["renders"], "shot_010:1-4");
  EXPECT_EQ(hosts[1]["host"], "render02.farm");
  EXPECT_EQ(hosts[1]["lock"], "LOCKED");
  EXPECT_EQ(hosts[1]["alive"], false);
  EXPECT_EQ(hosts[2]["lock"], "SCHEDULE");
  EXPECT_EQ(hosts[2]["locked_now"], true);  // its schedule covers the whole week
}

}  // namespace
#endif
