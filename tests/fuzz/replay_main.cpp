// Runs a fuzzer's property over the files of its seed corpus, without
// libFuzzer, so that the normal test run checks every seed: the fuzzer
// aborts on a broken property, and no seed at all is a failure too.
#include <dirent.h>

#include <cstdint>
#include <cstdio>
#include <string>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

int main(int argc, char** argv) {
  int seeds = 0;
  for (int i = 1; i < argc; ++i) {
    DIR* dir = opendir(argv[i]);
    if (dir == nullptr) return 2;
    while (dirent* e = readdir(dir)) {
      if (e->d_name[0] == '.') continue;
      std::string path = std::string(argv[i]) + "/" + e->d_name;
      FILE* fp = fopen(path.c_str(), "rb");
      if (fp == nullptr) return 2;
      std::string bytes;
      char buf[4096];
      for (size_t n; (n = fread(buf, 1, sizeof buf, fp)) > 0;) bytes.append(buf, n);
      fclose(fp);
      LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size());
      ++seeds;
    }
    closedir(dir);
  }
  printf("%d seeds\n", seeds);
  return seeds > 0 ? 0 : 1;
}
