// The render programs' shared argument scanner: what each program's rules
// accept and where each stops, without starting a process.

#include "tools/render_wrap/render_wrap.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace {

using Words = std::vector<std::string>;

enum class Rules { kWrapper, kPainter, kStamp };

RwScanRules rules_of(Rules which) {
  return which == Rules::kWrapper ? RwScanRules{} : Rw_first_rules(which == Rules::kPainter);
}

struct ScanCase {
  Rules rules;
  Words words;  // after the program name
  RwScanResult result;
  const char* word;  // the option at fault, or null
};

class RwScanTable : public ::testing::TestWithParam<ScanCase> {};

TEST_P(RwScanTable, StopsWhereTheProgramsRulesSay) {
  const ScanCase& c = GetParam();
  Words all = {"prog"};
  all.insert(all.end(), c.words.begin(), c.words.end());
  std::vector<char*> argv;
  for (std::string& w : all) argv.push_back(w.data());
  argv.push_back(nullptr);
  RwArgs args;
  RwScan scan = Rw_scan(static_cast<int>(all.size()), argv.data(), rules_of(c.rules), &args);
  EXPECT_EQ(scan.result, c.result);
  EXPECT_STREQ(scan.word, c.word);
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(Rules, RwScanTable, testing::Values(
    // The options argument may start with a dash only for the wrappers.
    ScanCase{Rules::kWrapper, {"-p", "x", "-t 2", "s"}, RwScanResult::kOk, nullptr},
    ScanCase{Rules::kPainter, {"-p", "x", "-t 2", "s"}, RwScanResult::kUnknown, "-t 2"},
    // -n0 and -n+4: a count for the wrappers, digits for the others.
    ScanCase{Rules::kWrapper, {"-p", "x", "-n0", "s"}, RwScanResult::kUnknown, "-n0"},
    ScanCase{Rules::kStamp, {"-p", "x", "-n0", "s"}, RwScanResult::kOk, nullptr},
    ScanCase{Rules::kWrapper, {"-p", "x", "-n+4", "s"}, RwScanResult::kOk, nullptr},
    ScanCase{Rules::kPainter, {"-p", "x", "-n+4", "s"}, RwScanResult::kUnknown, "-n+4"},
    ScanCase{Rules::kPainter, {"-p", "x", "-n", "s"}, RwScanResult::kUnknown, "-n"},
    // A step of 0 is refused by the wrappers only.
    ScanCase{Rules::kWrapper, {"-p", "x", "-b", "0", "s"}, RwScanResult::kBadValue, "-b"},
    ScanCase{Rules::kPainter, {"-p", "x", "-b", "0", "s"}, RwScanResult::kOk, nullptr},
    // "--" and "--help" are long options, which stamp_render never had.
    ScanCase{Rules::kPainter, {"-p", "x", "--", "-s"}, RwScanResult::kOk, nullptr},
    ScanCase{Rules::kStamp, {"-p", "x", "--", "s"}, RwScanResult::kUnknown, "--"},
    ScanCase{Rules::kPainter, {"--help"}, RwScanResult::kHelp, nullptr},
    ScanCase{Rules::kStamp, {"--help"}, RwScanResult::kUnknown, "--help"},
    // The first fault wins, whatever follows it.
    ScanCase{Rules::kWrapper, {"-h", "-x"}, RwScanResult::kHelp, nullptr},
    ScanCase{Rules::kStamp, {"-x", "-h"}, RwScanResult::kUnknown, "-x"},
    ScanCase{Rules::kWrapper, {"-pp", "x", "s"}, RwScanResult::kUnknown, "-pp"},
    ScanCase{Rules::kWrapper, {"-p", "x", "-s"}, RwScanResult::kNoValue, "-s"},
    ScanCase{Rules::kStamp, {"-p", "x", "-s", "1e40", "s"}, RwScanResult::kBadValue, "-s"},
    ScanCase{Rules::kPainter, {"-p", "x", "-E", "33", "s"}, RwScanResult::kBadValue, "-E"},
    ScanCase{Rules::kWrapper, {"-p", "x", "-S", "2.5", "s"}, RwScanResult::kBadValue, "-S"},
    // The words that are not options: the scene, after the options argument.
    ScanCase{Rules::kWrapper, {"-p", "x"}, RwScanResult::kNoScene, nullptr},
    ScanCase{Rules::kWrapper, {"-p", "x", "a", "b", "c"}, RwScanResult::kTooMany, nullptr},
    ScanCase{Rules::kStamp, {"s"}, RwScanResult::kNoPix, nullptr},
    ScanCase{Rules::kStamp, {"-", "s"}, RwScanResult::kNoPix, nullptr}));
// clang-format on

TEST(RwScan, KeepsWhatWasGivenAndWhatWasNot) {
  Words all = {"prog", "-A", "-s", "2", "-b",  "0.5",       "-S",   "7",
               "-m",   "m",  "-p", "p", "-n3", "fail_at=2", "scene"};
  std::vector<char*> argv;
  for (std::string& w : all) argv.push_back(w.data());
  RwArgs a;
  ASSERT_EQ(Rw_scan(static_cast<int>(argv.size()), argv.data(), RwScanRules{}, &a).result,
            RwScanResult::kOk);
  EXPECT_EQ(a.pix, "p");
  EXPECT_EQ(a.matte, "m");
  EXPECT_EQ(a.scene, "scene");
  EXPECT_EQ(a.options, "fail_at=2");
  EXPECT_TRUE(a.animate && a.have_by && a.have_first_ext);
  EXPECT_FALSE(a.have_end || a.have_ext_size);
  EXPECT_EQ(a.end, 1.0f);  // no end is made up: each program has its own
  EXPECT_EQ(a.processors, 3);
}

}  // namespace
