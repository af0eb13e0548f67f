// Feeds arbitrary bytes to the task file reader.  Nothing may crash or read
// out of bounds, whatever the file holds.  What was understood is written
// back; that text must read completely, and since each read reverses the
// order of the groups, reading and writing it twice more must give the same
// text again.
#include "tests/fuzz/fuzz_support.h"
#include "tests/support/text_records.h"

namespace {

std::string read_and_write(const std::string& text) {
  TaskGroup* groups = nullptr;
  if (!text.empty()) {
    FILE* in = fmemopen(const_cast<char*>(text.data()), text.size(), "r");
    fuzz::require(in != nullptr, "fmemopen failed");
    groups = Task_read(in);
    fclose(in);
  }
  const std::string written = text_records::written(
      [&](FILE* out) { fuzz::require(Task_write(out, groups) == 0, "Task_write failed"); });
  // The status lookups and searches walk what was read.
  Task_find(groups, "beta");
  for (TaskGroup* g = groups; g != nullptr; g = g->next)
    for (TaskRec* r = g->tasks; r != nullptr; r = r->next)
      fuzz::require(GetTaskStatusStr(r->status) != nullptr, "a status without a name");
  TaskGroup_free_all(&groups);
  return written;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  [[maybe_unused]] static const bool ready = [] {
    rndctl.host.set("alpha");
    for (int i = 1; i <= 3; ++i) {
      Add_a_job(nullptr, ("job" + std::to_string(i) + ".sdl").c_str(), i);
      Dev* dev = Add_a_dev(nullptr, ("render" + std::to_string(i)).c_str(), i);
      if (dev != nullptr) dev->host_name.set(i == 1 ? "alpha" : "beta");
    }
    return true;
  }();
  const std::string once = read_and_write(std::string(reinterpret_cast<const char*>(data), size));
  fuzz::require(read_and_write(read_and_write(once)) == once, "the text did not settle");
  return 0;
}
