// The checking allocator, by explicit calls (this binary keeps the C
// library's malloc).  Debug-mode faults are provoked in death tests: each
// fatal path must name what it found and who made or freed the block.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <unistd.h>

#include <cstdint>
#include <cstring>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "Shared/memory/MA_rtns.h"
#include "tests/support/test_support.h"

namespace {

constexpr const char* kUnit = "tests/ma_test";

TEST(MaBuckets, RequestsGoToTheFirstBucketThatHoldsThemRoundedToEight) {
  // Bucket -1: refused.
  for (auto [request, bucket] : std::initializer_list<std::pair<size_t, int>>{{0, 0},
                                                                              {8, 0},
                                                                              {9, 1},
                                                                              {1024, 13},
                                                                              {1025, 14},
                                                                              {262201, 25},
                                                                              {268435460, 45},
                                                                              {268435461, -1},
                                                                              {SIZE_MAX, -1}}) {
    EXPECT_EQ(MA_bucket_of(request), bucket) << request;
    EXPECT_TRUE(bucket < 0 || MA_bucket_size(bucket) >= request) << request;
  }
}

TEST(MaBuckets, ARequestBeyondTheLastBucketIsRefusedWithItsCaller) {
  testing::internal::CaptureStderr();
  EXPECT_EQ(MA_malloc(268435461, 41, kUnit, 1), nullptr);
  EXPECT_EQ(testing::internal::GetCapturedStderr(),
            "Bucket request of 268435461 too large! in tests/ma_test line 41\n");
}

TEST(MaNormal, BlocksAreAlignedReusedLastInFirstOutAndKeepTheirBytes) {
  std::vector<char*> blocks;
  for (size_t n : {1, 24, 100, 1000, 5000, 70000}) {
    char* p = static_cast<char*>(MA_malloc(n, __LINE__, kUnit, 1));
    ASSERT_NE(p, nullptr);
    EXPECT_EQ(reinterpret_cast<uintptr_t>(p) % 16, 0u) << n;
    EXPECT_GE(MA_usable_size(p), n);
    memset(p, 'a' + static_cast<int>(n % 26), n);
    blocks.push_back(p);
  }
  void* again = MA_malloc(24, __LINE__, kUnit, 1);
  MA_free(again, __LINE__, kUnit);
  EXPECT_EQ(MA_malloc(20, __LINE__, kUnit, 1), again);
  MA_free(again, __LINE__, kUnit);

  char* grown = static_cast<char*>(MA_realloc(blocks[1], 3000, __LINE__, kUnit));
  ASSERT_NE(grown, nullptr);
  EXPECT_EQ(std::string(grown, 24), std::string(24, 'a' + 24 % 26));
  blocks[1] = grown;
  for (char* p : blocks) MA_free(p, __LINE__, kUnit);

  unsigned char* zero = static_cast<unsigned char*>(MA_calloc(10, 30, __LINE__, kUnit));
  ASSERT_NE(zero, nullptr);
  for (int i = 0; i < 300; ++i) ASSERT_EQ(zero[i], 0) << i;
  MA_free(zero, __LINE__, kUnit);
  EXPECT_EQ(MA_calloc(SIZE_MAX / 2, 4, __LINE__, kUnit), nullptr);
}

TEST(MaNormal, ThreadsAllocatingTogetherNeverShareABlock) {
  auto work = [](unsigned seed) {
    std::mt19937 rng(seed);
    std::vector<std::pair<unsigned char*, size_t>> held;
    for (int i = 0; i < 20000; ++i) {
      if (held.size() < 64 && rng() % 3 != 0) {
        size_t n = 8 + rng() % 1017;
        auto* p = static_cast<unsigned char*>(MA_malloc(n, __LINE__, kUnit, 1));
        ASSERT_NE(p, nullptr);
        memset(p, static_cast<int>(seed), n);
        held.emplace_back(p, n);
      } else if (!held.empty()) {
        auto [p, n] = held.back();
        held.pop_back();
        for (size_t k = 0; k < n; ++k) ASSERT_EQ(p[k], static_cast<unsigned char>(seed));
        MA_free(p, __LINE__, kUnit);
      }
    }
    for (auto [p, n] : held) MA_free(p, __LINE__, kUnit);
  };
  std::vector<std::thread> threads;
  for (unsigned t = 1; t <= 4; ++t) threads.emplace_back(work, t);
  for (std::thread& t : threads) t.join();
}

// Debug mode for one test; blocks keep the layout they were made with, so
// switching back afterwards is safe.
class MaDebug : public testing::Test {
 protected:
  void SetUp() override {
    MA_init();  // reads the environment once; the settings below must win
    ma_debug = ma_chkfree = ma_stomp = 1;
  }
  void TearDown() override { ma_debug = ma_chkfree = ma_stomp = 0; }
};

TEST_F(MaDebug, SoundBlocksPassEveryCheckAndTheirOwnerIsListed) {
  char* p = static_cast<char*>(MA_malloc(40, 77, kUnit, 1));
  ASSERT_NE(p, nullptr);
  EXPECT_EQ(reinterpret_cast<uintptr_t>(p) % 16, 0u);
  EXPECT_EQ(static_cast<unsigned char>(p[0]), 0x01);  // the fill of a new block
  memset(p, 'x', 40);
  EXPECT_EQ(MA_checkit(p), 1);
  MA_allcheck(__LINE__, kUnit);
  FILE* dump = tmpfile();
  ASSERT_NE(dump, nullptr);
  MA_dump_alloc_list(fileno(dump));
  std::string listing(8192, '\0');
  listing.resize(pread(fileno(dump), listing.data(), listing.size(), 0));
  fclose(dump);
  char line[128];
  snprintf(line, sizeof line, "alloc   0x%08lx 40     77   tests/ma_test\n",
           static_cast<unsigned long>(reinterpret_cast<uintptr_t>(p)));
  EXPECT_NE(listing.find(line), std::string::npos) << listing;
  MA_free(p, __LINE__, kUnit);
}

struct Fault {
  const char* name;
  void (*provoke)();
  const char* says;
};
class MaFault : public MaDebug, public testing::WithParamInterface<Fault> {};

TEST_P(MaFault, EndsTheProcessSayingWhatWasFound) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(GetParam().provoke(), GetParam().says);
}

char* block(size_t n, int line, const char* unit = kUnit) {
  return static_cast<char*>(MA_malloc(n, line, unit, 1));
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(Release, MaFault, testing::Values(
    Fault{"DoubleFree", [] { char* p = block(16, 10); MA_free(p, 11, kUnit); MA_free(p, 12, "second_caller"); },
          "Freeing memory twice in second_caller line 12\n"},
    Fault{"Garbage", [] { static char not_ours[64]; MA_free(not_ours + 32, 20, "garbage_caller"); },
          "Free of garbage pointer 0x[0-9a-f]+ in garbage_caller line 20\n"},
    Fault{"HeaderMagic", [] { char* p = block(16, 30); memset(p - 16, 0x55, 4); MA_free(p, 31, "magic_caller"); },
          "Magic number in freed memory is incorect. magic_caller line 31\n"},
    Fault{"HeaderBounds", [] { char* p = block(16, 40); memset(p - 8, 0x55, 8); MA_free(p, 41, "bounds_caller"); },
          "Freeing damaged memory in bounds_caller line 41\n"},
    // One word past the end.
    Fault{"Trailer", [] { char* p = block(24, 50, "owner_unit"); memset(p, 0, 32); MA_free(p, 51, "freeing_unit"); },
          "Trailer damage\nMemory allocated from owner_unit line 50\nMemory check failed in 'freeing_unit' line 51\n"},
    Fault{"StompedReuse", [] { char* p = block(64, 60); MA_free(p, 61, kUnit); p[8] = 'x'; MA_allcheck(62, "checking_unit"); },
          "base 0x[0-9a-f]+: offset=8\nFree block reused at\n0x[0-9a-f]+: '0x[0-9a-f]+.*Memory check failed in 'checking_unit' line 62\n"},
    Fault{"NullStrict", [] { ma_chkfree = 2; MA_free(nullptr, 70, "null_caller"); },
          "Free of NULL in null_caller line 70\n"}),
    [](const testing::TestParamInfo<Fault>& info) { return std::string(info.param.name); });
// clang-format on

// Settings come from the environment; a child reads them, so the trace file
// and the trap stay out of this process.
using MaSettings = ControlDirTest;

TEST_F(MaSettings, TheTraceFileGetsOneLinePerOperationAndTheChosenLineTraps) {
  EXPECT_EXIT(
      {
        for (auto [name, value] : {std::pair{"HOME", dir_.c_str()},
                                   {"MA_DEBUG", "1"},
                                   {"MA_TRACE", "1"},
                                   {"MA_TSTART", ""},
                                   {"MA_LINE", "205"},
                                   {"MA_FILE", "trap_unit"}})
          setenv(name, value, 1);
        MA_read_settings();
        void* p = MA_malloc(20, 201, kUnit, 1);
        MA_free(p, 202, kUnit);
        void* q = MA_malloc(8, 205, "other_unit", 1);
        MA_free(q, 205, "trap_unit");
        MA_exit();
        _exit(0);
      },
      testing::ExitedWithCode(0), "^MA_trap called\n");
  const std::string trace = read_file("trace");
  EXPECT_THAT(trace, testing::ContainsRegex("^alloc   0x[0-9a-f]{8,} 20     201  tests/ma_test\n"
                                            "free    0x[0-9a-f]{8,} 24     202  tests/ma_test\n"
                                            "alloc   0x[0-9a-f]{8,} 8      205  other_unit\n"
                                            "free    0x[0-9a-f]{8,} 8      205  trap_unit\n"
                                            "Bucket Allocs"));
  EXPECT_NE(trace.find("Leak Report {\n}\n"), std::string::npos) << trace;
}

}  // namespace
