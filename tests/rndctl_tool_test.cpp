// The command-line tool's pure parts: what it accepts before anything is written, how it draws.
#if defined(RNDCTL_TOOL)
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdio>
#include <cstdlib>
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#include <vector>

#include "tests/support/test_support.h"
#include "tests/support/text_records.h"
#include "tools/rndctl/editor_side.h"
#include "tools/rndctl/tables.h"

namespace {

using nlohmann::json;

// What a frame range or a schedule block parses to, "refused" or "refused, no reason".
std::string frames(const char* text) {
  CtlFrames f;
  std::string why;
  char buf[64];
  if (!Ctl_parse_frames(text, &f, &why)) return why.empty() ? "refused, no reason" : "refused";
  snprintf(buf, sizeof buf, "%g-%g:%g", f.start, f.end, f.by);
  return buf;
}
std::string block(const char* text) {
  CtlBlock b;
  std::string why;
  if (!Ctl_parse_block(text, &b, &why)) return "refused";
  return std::to_string(b.start) + "-" + std::to_string(b.end) + " " + b.first_day + "-" +
         b.last_day;
}

TEST(RndctlInput, FramesAndSchedulesParseOrAreRefused) {
  const std::vector<std::pair<const char*, const char*>> ranges = {
      {"1-10", "1-10:1"},    {"1-10:2", "1-10:2"},           {"-5--1", "-5--1:1"},
      {"3-3", "3-3:1"},      {"1.5-2.5:0.5", "1.5-2.5:0.5"}, {"10-1", "refused"},
      {"1-10:0", "refused"}, {"1-10:-1", "refused"},         {"1", "refused"},
      {"a-b", "refused"},    {"1-10x", "refused"},           {"", "refused"}};
  for (const auto& [text, want] : ranges) EXPECT_EQ(frames(text), want) << text;
  const std::vector<std::pair<const char*, const char*>> blocks = {
      {"800-1700 Monday-Friday", "800-1700 monday-friday"},
      {"2200-600 sat", "2200-600 saturday-saturday"},
      {"0-2400 Sun", "0-2400 sunday-sunday"},
      {"830-1700 Mon", "830-1700 monday-monday"}};
  for (const auto& [text, want] : blocks) EXPECT_EQ(block(text), want) << text;
  // Off the half hours, past the day, 2400 only ends, empty, backwards, not the queue's day
  // names, no days, not the queue's times.
  for (const char* bad : {"815-1700 Mon", "800-2500 Mon", "2400-100 Mon", "800-800 Mon",
                          "800-1700 Friday-Monday", "800-1700 SUN", "800-1700", "8am-5pm Mon"})
    EXPECT_EQ(block(bad), "refused") << bad;
}

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
  for (const std::string& bad :
       {std::string("a\"b"), std::string("a\nb"), std::string(RJC_STRING_LIMIT + 1, 'x')})
    EXPECT_FALSE(Ctl_string_ok(bad, &why)) << bad;
  EXPECT_EQ(Ctl_split("a,,b,", ','), (std::vector<std::string>{"a", "b"}));
}

TEST(RndctlOutput, BarsAndCutsKeepTheirWidth) {
  EXPECT_EQ((std::vector<std::string>{Out_bar(0.0, 7), Out_bar(0.5, 12), Out_bar(2.0, 7),
                                      Out_fit("abcdef", 4), Out_fit("abc", 4)}),
            (std::vector<std::string>{"[.....]", "[#####.....]", "[#####]", "abc~", "abc"}));
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
  std::string golden_;
  CtlTasks tasks_;
};

TEST_F(RndctlTables, JobAndHostTablesMatchTheirGoldenText) {
  expect_golden("jobs.txt", text_records::written([](FILE* fp) { Out_jobs_table(fp, false); }));
  expect_golden("hosts.txt",
                text_records::written([&](FILE* fp) { Out_hosts_table(fp, tasks_, false); }));
  // Colour only when asked for, and then without shifting the columns.
  std::string coloured = text_records::written([](FILE* fp) { Out_jobs_table(fp, true); });
  EXPECT_NE(coloured.find("\033[32mfinished  \033[0m"), std::string::npos) << coloured;
}

TEST_F(RndctlTables, JsonReadsBackWithEveryField) {
  json got = json::parse(
      json{{"jobs", Out_jobs_json(&tasks_)}, {"hosts", Out_hosts_json(tasks_)}}.dump(2));
  ASSERT_EQ(json({got["jobs"].size(), got["hosts"].size(), got["jobs"][0]["tasks"].size()}),
            json({3, 3, 2}));
  // A pointer into the answer, then the JSON there.  Long names are never cut; a schedule
  // covering the whole week is locked now.
  for (std::string row :
       {R"(/jobs/0/name "shot_010")", R"(/jobs/0/state "45.00%")",
        R"(/jobs/0/hosts ["render02","render01"])", R"(/jobs/0/frames [1.0,120.0,1.0])",
        R"(/jobs/0/doneframes 54)", R"(/jobs/0/tasks/0/status "RUNNING")",
        R"(/jobs/0/tasks/0/host "render01")", R"(/jobs/1/name "a_very_long_job_name_indeed")",
        R"(/jobs/1/run "PAUSED")",
        R"(/jobs/2/hosts ["render01","render02","nightshift_workstation"])",
        R"(/hosts/0/alive true)", R"(/hosts/0/renders "shot_010:1-4")",
        R"(/hosts/1/host "render02.farm")", R"(/hosts/1/lock "LOCKED")", R"(/hosts/1/alive false)",
        R"(/hosts/2/lock "SCHEDULE")", R"(/hosts/2/locked_now true)"}) {
    size_t at = row.find(' ');
    EXPECT_EQ(got[json::json_pointer(row.substr(0, at))], json::parse(row.substr(at + 1))) << row;
  }
}

}  // namespace
#endif
