// The render programs' shared argument scanner: what each program's rules
// accept and where each stops, without starting a process.

#include "tools/render_wrap/render_wrap.h"

#include <gtest/gtest.h>

namespace {

using Words = std::vector<std::string>;

// The programs' results for "prog" and `words`; `args` gets the wrappers' reading.
std::string scan(Words words, RwArgs* args = nullptr) {
  static const char* const kNames[] = {"ok",        "help",     "unknown",  "no value",
                                       "bad value", "no scene", "too many", "no pix"};
  words.insert(words.begin(), "prog");
  std::vector<char*> argv;
  for (std::string& w : words) argv.push_back(w.data());
  argv.push_back(nullptr);
  std::string out;
  for (const RwScanRules& rules : {RwScanRules{}, Rw_first_rules(true), Rw_first_rules(false)}) {
    RwArgs read;
    const RwScan s = Rw_scan(static_cast<int>(words.size()), argv.data(), rules, &read);
    if (out.empty() && args != nullptr) *args = read;
    out += kNames[static_cast<int>(s.result)] + (s.word ? std::string(" ") + s.word : "") + " | ";
  }
  return out.substr(0, out.size() - 3);
}

// Wrappers | frame_painter | stamp_render.  Only the wrappers let the options argument
// start with a dash, read -nN as a count and refuse a step of 0; stamp_render never had
// "--" and "--help".  The first fault wins, whatever follows it.
TEST(RwScan, StopsWhereEachProgramsRulesSay) {
  const std::vector<std::pair<Words, std::string>> cases = {
      {{"-p", "x", "-t 2", "s"}, "ok | unknown -t 2 | unknown -t 2"},
      {{"-p", "x", "-n0", "s"}, "unknown -n0 | ok | ok"},
      {{"-p", "x", "-n+4", "s"}, "ok | unknown -n+4 | unknown -n+4"},
      {{"-p", "x", "-b", "0", "s"}, "bad value -b | ok | ok"},
      {{"-p", "x", "--", "-s"}, "ok | ok | unknown --"},
      {{"--help"}, "help | help | unknown --help"},
      {{"-p", "x", "-n", "s"}, "unknown -n | unknown -n | unknown -n"},
      {{"-h", "-x"}, "help | help | help"},
      {{"-x", "-h"}, "unknown -x | unknown -x | unknown -x"},
      {{"-pp", "x", "s"}, "unknown -pp | unknown -pp | unknown -pp"},
      {{"-p", "x", "-s"}, "no value -s | no value -s | no value -s"},
      {{"-p", "x", "-s", "1e40", "s"}, "bad value -s | bad value -s | bad value -s"},
      {{"-p", "x", "-E", "33", "s"}, "bad value -E | bad value -E | bad value -E"},
      {{"-p", "x", "-S", "2.5", "s"}, "bad value -S | bad value -S | bad value -S"},
      {{"-p", "x"}, "no scene | no scene | no scene"},
      {{"-p", "x", "a", "b", "c"}, "too many | too many | too many"},
      {{"s"}, "no pix | no pix | no pix"},
      {{"-", "s"}, "no pix | no pix | no pix"},
  };
  for (const auto& [words, want] : cases)
    EXPECT_EQ(scan(words), want) << testing::PrintToString(words);
}

TEST(RwScan, KeepsWhatWasGivenAndWhatWasNot) {
  const Words given = {"-A", "-s", "2",  "-b", "0.5", "-S",        "7",
                       "-m", "m",  "-p", "p",  "-n3", "fail_at=2", "scene"};
  RwArgs a;
  ASSERT_EQ(scan(given, &a), "ok | ok | ok");
  EXPECT_EQ(Words({a.pix, a.matte, a.scene, a.options}), Words({"p", "m", "scene", "fail_at=2"}));
  EXPECT_TRUE(a.animate && a.have_by && a.have_first_ext && !a.have_end && !a.have_ext_size);
  EXPECT_EQ(a.end, 1.0f);  // no end is made up: each program has its own
  EXPECT_EQ(a.processors, 3);
}

}  // namespace
