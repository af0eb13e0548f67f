// The command-line tool's pure parts: what it accepts before anything is written, how it draws.
#if defined(RNDCTL_TOOL)
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdio>
#include <cstdlib>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "tests/support/test_support.h"
#include "tests/support/text_records.h"
#include "tools/rndctl/editor_side.h"
#include "tools/rndctl/tables.h"

namespace {

using nlohmann::json;
using namespace std::string_literals;

// What a frame range parses to, "refused" or "refused, no reason".
std::string frames(const char* text) {
  CtlFrames f;
  std::string why;
  char buf[64];
  if (!Ctl_parse_frames(text, &f, &why)) return why.empty() ? "refused, no reason" : "refused";
  snprintf(buf, sizeof buf, "%g-%g:%g", f.start, f.end, f.by);
  return buf;
}
// The spans a schedule block fills in the week, or "refused".
std::string block(const char* text) {
  CtlBlock b;
  std::string why, fills;
  if (!Ctl_parse_block(text, &b, &why)) return "refused";
  Ctl_apply_block(b, [&](int s, int e, const char* f, const char* l) {
    fills += std::to_string(s) + "-" + std::to_string(e) + " " + f + "-" + l + ", ";
  });
  return fills.substr(0, fills.size() - 2);
}

TEST(RndctlText, ParsesOrRefusesInputAndKeepsWidths) {
  const std::vector<std::pair<const char*, const char*>> ranges = {
      {"1-10", "1-10:1"},    {"1-10:2", "1-10:2"},           {"-5--1", "-5--1:1"},
      {"3-3", "3-3:1"},      {"1.5-2.5:0.5", "1.5-2.5:0.5"}, {"10-1", "refused"},
      {"1-10:0", "refused"}, {"1-10:-1", "refused"},         {"1", "refused"},
      {"a-b", "refused"},    {"1-10x", "refused"},           {"", "refused"}};
  for (const auto& [text, want] : ranges) EXPECT_EQ(frames(text), want) << text;
  // A span over midnight is split, and Saturday night runs into Sunday.
  const std::vector<std::pair<const char*, const char*>> blocks = {
      {"800-1700 Monday-Friday", "800-1700 monday-friday"},
      {"0-2400 Sun", "0-2400 sunday-sunday"},
      {"830-1700 Mon", "830-1700 monday-monday"},
      {"2200-600 Fri-sat",
       "2200-2400 friday-saturday, 0-600 saturday-saturday, 0-600 sunday-sunday"}};
  for (const auto& [text, want] : blocks) EXPECT_EQ(block(text), want) << text;
  // Off the half hours, past the day, 2400 only ends, empty, backwards, not the queue's day
  // names, no days, not the queue's times.
  for (const char* bad : {"815-1700 Mon", "800-2500 Mon", "2400-100 Mon", "800-800 Mon",
                          "800-1700 Friday-Monday", "800-1700 SUN", "800-1700", "8am-5pm Mon"})
    EXPECT_EQ(block(bad), "refused") << bad;
  std::string why;
  EXPECT_TRUE(Ctl_word_ok("spin_2.v3", &why));
  for (const char* bad : {"two words", "12", "status", "runs", "-x", "a\"b", ""})
    EXPECT_FALSE(Ctl_word_ok(bad, &why)) << bad;
  EXPECT_TRUE(Ctl_string_ok("/a path/with blanks", &why));
  for (const std::string& bad : {"a\"b"s, "a\nb"s, std::string(RJC_STRING_LIMIT + 1, 'x')})
    EXPECT_FALSE(Ctl_string_ok(bad, &why)) << bad;
  EXPECT_EQ(Ctl_split("a,,b,", ','), (std::vector<std::string>{"a", "b"}));
  EXPECT_EQ((std::vector<std::string>{Out_bar(0.0, 7), Out_bar(0.5, 12), Out_bar(2.0, 7),
                                      Out_fit("abcdef", 4), Out_fit("abc", 4)}),
            (std::vector<std::string>{"[.....]", "[#####.....]", "[#####]", "abc~", "abc"}));
}

// The tables and the JSON a user reads, on a farm of three hosts and three jobs: one part rendered
// on a live host, one paused with names too long for their columns, one finished on every host.
// Regenerate the tables with RNDCTL_GOLDEN_UPDATE=1.
using RndctlTables = ControlDirTest;

TEST_F(RndctlTables, MatchTheirGoldenTextAndJsonCarriesEveryField) {
  const std::string golden = TESTS_DIR "/golden/rndctl/";
  for (const char* f : {"Render_Resource_Control", "Render_Job_Control", "Render_Tasks"})
    write_file(f, read_text_file(golden + f));
  // render01's heartbeat is fresh: its daemon counts as up.
  mkdir(path("TSKSTAT").c_str(), 0777);
  write_file("TSKSTAT/render01", "");
  std::string why;
  ASSERT_TRUE(Ctl_load(&why)) << why;
  CtlTasks tasks;
  ASSERT_TRUE(Ctl_read_tasks(&tasks));

  for (const auto& [name, got] :
       {std::pair("jobs.txt", text_records::written([](FILE* fp) { Out_jobs_table(fp, false); })),
        std::pair("hosts.txt",
                  text_records::written([&](FILE* fp) { Out_hosts_table(fp, tasks, false); }))}) {
    if (getenv("RNDCTL_GOLDEN_UPDATE") != nullptr) write_text_file(golden + name, got);
    EXPECT_EQ(got, read_text_file(golden + name)) << got;
    for (size_t at = 0, end; (end = got.find('\n', at)) != std::string::npos; at = end + 1)
      EXPECT_LE(end - at, 80u) << got.substr(at, end - at);
  }
  // Colour only when asked for, and then without shifting the columns.
  std::string coloured = text_records::written([](FILE* fp) { Out_jobs_table(fp, true); });
  EXPECT_NE(coloured.find("\033[32mfinished  \033[0m"), std::string::npos) << coloured;

  json got =
      json::parse(json{{"jobs", Out_jobs_json(&tasks)}, {"hosts", Out_hosts_json(tasks)}}.dump(2));
  ASSERT_EQ(json({got["jobs"].size(), got["hosts"].size(), got["jobs"][0]["tasks"].size()}),
            json({3, 3, 2}));
  // A pointer into the answer, and the JSON there.  Long names are never cut; a schedule
  // covering the whole week is locked now.
  const json want = json::parse(R"({"/jobs/0/name": "shot_010", "/jobs/0/state": "45.00%",
      "/jobs/0/hosts": ["render02","render01"], "/jobs/0/frames": [1.0,120.0,1.0],
      "/jobs/0/doneframes": 54, "/jobs/0/tasks/0/status": "RUNNING",
      "/jobs/0/tasks/0/host": "render01", "/jobs/1/name": "a_very_long_job_name_indeed",
      "/jobs/1/run": "PAUSED", "/jobs/2/hosts": ["render01","render02","nightshift_workstation"],
      "/hosts/0/alive": true, "/hosts/0/renders": "shot_010:1-4", "/hosts/1/host": "render02.farm",
      "/hosts/1/lock": "LOCKED", "/hosts/1/alive": false, "/hosts/2/lock": "SCHEDULE",
      "/hosts/2/locked_now": true})");
  for (const auto& [at, value] : want.items()) EXPECT_EQ(got[json::json_pointer(at)], value) << at;
}

}  // namespace
#endif
