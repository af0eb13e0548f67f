// The checking allocator, by explicit calls (this binary keeps the C
// library's malloc).  Debug-mode faults are provoked in death tests: each
// fatal path must name what it found and who made or freed the block.
#include <gmock/gmock.h>
#include <stdlib.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <string>
#include <tuple>
#include <vector>

#include "Shared/memory/MA_rtns.h"
#include "tests/support/test_support.h"

namespace {

constexpr const char* kUnit = "tests/ma_test";

char* block(size_t n, int line, const char* unit = kUnit) {
  return static_cast<char*>(MA_malloc(n, line, unit, 1));
}

// Bucket -1: refused, and the caller named.
TEST(MaBuckets, RequestsGoToTheFirstBucketThatHoldsThem) {
  for (size_t request : {size_t{0}, size_t{9}, size_t{1025}, size_t{262201}, size_t{268435460}}) {
    const int b = MA_bucket_of(request);
    EXPECT_TRUE(b >= 0 && MA_bucket_size(b) >= request &&
                (b == 0 || MA_bucket_size(b - 1) < request))
        << request;
  }
  EXPECT_EQ(std::pair(MA_bucket_of(268435461), MA_bucket_of(SIZE_MAX)), std::pair(-1, -1));
  testing::internal::CaptureStderr();
  EXPECT_EQ(block(268435461, 41), nullptr);
  EXPECT_EQ(testing::internal::GetCapturedStderr(),
            "Bucket request of 268435461 too large! in tests/ma_test line 41\n");
}

TEST(MaNormal, BlocksAreAlignedAndReusedLastInFirstOut) {
  std::vector<char*> blocks;
  for (size_t n : {1, 24, 100, 1000, 5000, 70000}) {
    char* p = block(n, __LINE__);
    ASSERT_TRUE(p != nullptr && reinterpret_cast<uintptr_t>(p) % 16 == 0) << n;
    EXPECT_GE(MA_usable_size(p), n);
    blocks.push_back(p);
  }
  void* again = block(24, __LINE__);
  MA_free(again, __LINE__, kUnit);
  EXPECT_EQ(block(20, __LINE__), again);
  MA_free(again, __LINE__, kUnit);
  for (char* p : blocks) MA_free(p, __LINE__, kUnit);
}

// Debug mode for one test; blocks keep the layout they were made with, so
// switching back afterwards is safe.
class MaDebug : public testing::Test {
 protected:
  // MA_init reads the environment once: the settings after it must win.
  void SetUp() override { MA_init(), ma_debug = ma_chkfree = ma_stomp = 1; }
  void TearDown() override { ma_debug = ma_chkfree = ma_stomp = 0; }
};

TEST_F(MaDebug, SoundBlocksPassEveryCheckAndTheirOwnerIsListed) {
  char* p = block(40, 77);
  ASSERT_TRUE(p != nullptr && reinterpret_cast<uintptr_t>(p) % 16 == 0);
  EXPECT_EQ(p[0], 0x01);  // the fill of a new block
  memset(p, 'x', 40);
  EXPECT_EQ(MA_checkit(p), 1);
  MA_allcheck(__LINE__, kUnit);
  FILE* dump = tmpfile();
  MA_dump_alloc_list(fileno(dump));
  std::string listing(8192, '\0'), line(128, '\0');
  listing.resize(std::max<ssize_t>(pread(fileno(dump), listing.data(), listing.size(), 0), 0));
  fclose(dump);
  line.resize(snprintf(line.data(), line.size(), "alloc   0x%08lx 40     77   tests/ma_test\n",
                       static_cast<unsigned long>(reinterpret_cast<uintptr_t>(p))));
  EXPECT_THAT(listing, testing::HasSubstr(line));
  MA_free(p, __LINE__, kUnit);
}

// Each fault names what it found and where (the trailer: one word past the end).
using Fault = std::tuple<const char*, void (*)(), const char*>;  // name, provoke, says
class MaFault : public MaDebug, public testing::WithParamInterface<Fault> {};

TEST_P(MaFault, EndsTheProcessSayingWhatWasFound) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(std::get<1>(GetParam())(), std::get<2>(GetParam()));
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(Release, MaFault, testing::Values(
    Fault{"DoubleFree", [] { char* p = block(16, 10); MA_free(p, 11, kUnit); MA_free(p, 12, "second_caller"); }, "Freeing memory twice in second_caller line 12\n"},
    Fault{"Garbage", [] { static char not_ours[64]; MA_free(not_ours + 32, 20, "garbage_caller"); }, "Free of garbage pointer 0x[0-9a-f]+ in garbage_caller line 20\n"},
    Fault{"HeaderMagic", [] { char* p = block(16, 30); memset(p - 16, 0x55, 4); MA_free(p, 31, "magic_caller"); }, "Magic number in freed memory is incorect. magic_caller line 31\n"},
    Fault{"HeaderBounds", [] { char* p = block(16, 40); memset(p - 8, 0x55, 8); MA_free(p, 41, "bounds_caller"); }, "Freeing damaged memory in bounds_caller line 41\n"},
    Fault{"Trailer", [] { char* p = block(24, 50, "owner_unit"); memset(p, 0, 32); MA_free(p, 51, "freeing_unit"); }, "Trailer damage\nMemory allocated from owner_unit line 50\nMemory check failed in 'freeing_unit' line 51\n"},
    Fault{"StompedReuse", [] { char* p = block(64, 60); MA_free(p, 61, kUnit); p[8] = 'x'; MA_allcheck(62, "checking_unit"); }, "base 0x[0-9a-f]+: offset=8\nFree block reused at\n0x[0-9a-f]+: '0x[0-9a-f]+.*Memory check failed in 'checking_unit' line 62\n"},
    Fault{"NullStrict", [] { ma_chkfree = 2; MA_free(nullptr, 70, "null_caller"); }, "Free of NULL in null_caller line 70\n"}),
    [](const testing::TestParamInfo<Fault>& info) { return std::string(std::get<0>(info.param)); });
// clang-format on

// Settings come from the environment; a child reads them, so the trace file
// and the trap stay out of this process.
using MaSettings = ControlDirTest;

TEST_F(MaSettings, TheTraceFileGetsOneLinePerOperationAndTheChosenLineTraps) {
  const std::pair<const char*, const char*> settings[] = {
      {"HOME", dir_.c_str()}, {"MA_DEBUG", "1"},  {"MA_TRACE", "1"},
      {"MA_TSTART", ""},      {"MA_LINE", "205"}, {"MA_FILE", "trap_unit"}};
  EXPECT_EXIT(
      {
        for (auto [name, value] : settings) setenv(name, value, 1);
        MA_read_settings();
        MA_free(block(20, 201), 202, kUnit);
        MA_free(block(8, 205, "other_unit"), 205, "trap_unit");
        MA_exit();
        _exit(0);
      },
      testing::ExitedWithCode(0), "^MA_trap called\n");
  EXPECT_THAT(read_file("trace"),
              testing::ContainsRegex("^alloc   0x[0-9a-f]{8,} 20     201  tests/ma_test\n"
                                     "free    0x[0-9a-f]{8,} 24     202  tests/ma_test\n"
                                     "alloc   0x[0-9a-f]{8,} 8      205  other_unit\n"
                                     "free    0x[0-9a-f]{8,} 8      205  trap_unit\n"
                                     "Bucket Allocs(.|\n)*Leak Report \\{\n\\}\n"));
}

}  // namespace
