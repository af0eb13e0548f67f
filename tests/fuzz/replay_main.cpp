// Runs a fuzzer's property over the files of its seed corpus, without
// libFuzzer, so that the normal test run checks every seed: the fuzzer
// aborts on a broken property, and no seed at all is a failure too.
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

int main(int argc, char** argv) {
  int seeds = 0;
  for (int i = 1; i < argc; ++i) {
    std::error_code error;
    for (const auto& seed : std::filesystem::directory_iterator(argv[i], error)) {
      if (seed.path().filename().string()[0] == '.') continue;
      std::ifstream in(seed.path(), std::ios::binary);
      if (!in) return 2;
      const std::string bytes{std::istreambuf_iterator<char>(in), {}};
      LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size());
      ++seeds;
    }
    if (error) return 2;
  }
  printf("%d seeds\n", seeds);
  return seeds > 0 ? 0 : 1;
}
