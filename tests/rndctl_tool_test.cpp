// The command-line tool's pure parts: what it accepts from a user before
// anything is written, and how it draws.
#if defined(RNDCTL_TOOL)
#include <gtest/gtest.h>

#include <string>
#include <vector>

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

}  // namespace
#endif
