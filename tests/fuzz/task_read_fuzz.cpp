// Feeds arbitrary bytes to the task file reader.  Nothing may crash or read
// out of bounds, whatever the file holds.  What was understood is written
// back; that text must read completely, and since each read reverses the
// order of the groups, reading and writing it twice more must give the same
// text again.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "Utility/rndctl/rndctl.h"

namespace {

void make_records() {
  rndctl.host.set("alpha");
  for (int i = 1; i <= 3; ++i) {
    char name[32];
    snprintf(name, sizeof name, "job%d.sdl", i);
    Add_a_job(nullptr, name, i);
    snprintf(name, sizeof name, "render%d", i);
    Dev* dev = Add_a_dev(nullptr, name, i);
    if (dev != nullptr) dev->host_name.set(i == 1 ? "alpha" : "beta");
  }
}

std::string read_and_write(const std::string& text) {
  TaskGroup* groups = nullptr;
  if (!text.empty()) {
    FILE* in = fmemopen(const_cast<char*>(text.data()), text.size(), "r");
    if (in == nullptr) abort();
    groups = Task_read(in);
    fclose(in);
  }
  char* buffer = nullptr;
  size_t length = 0;
  FILE* out = open_memstream(&buffer, &length);
  if (out == nullptr) abort();
  if (Task_write(out, groups) != 0) abort();
  // The status lookups and searches walk what was read.
  Task_find(groups, "beta");
  for (TaskGroup* g = groups; g != nullptr; g = g->next) {
    for (TaskRec* r = g->tasks; r != nullptr; r = r->next) {
      if (GetTaskStatusStr(r->status) == nullptr) abort();
    }
  }
  fclose(out);
  std::string written(buffer, length);
  free(buffer);
  TaskGroup_free_all(&groups);
  return written;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static bool ready = false;
  if (!ready) {
    make_records();
    ready = true;
  }
  std::string input(reinterpret_cast<const char*>(data), size);
  std::string once = read_and_write(input);
  std::string twice = read_and_write(once);
  std::string thrice = read_and_write(twice);
  if (thrice != once) abort();
  return 0;
}
