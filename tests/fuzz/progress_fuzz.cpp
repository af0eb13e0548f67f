// Feeds arbitrary bytes to the daemon's reading of a render program's output
// stream.  The first four bytes shape the task (animation or still, step,
// start, length), the rest is what the program wrote.  Nothing may crash or
// overrun; the frame reached stays inside the task; a second look at a
// stream with nothing new on it changes nothing.
#include "Utility/rndctl/rndctl.h"
#include "tests/fuzz/fuzz_support.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static Job* job = Add_a_job(nullptr, "fuzz.sdl", 1);
  static Dev* dev = Add_a_dev(nullptr, "render1", 1);
  fuzz::require(job != nullptr && dev != nullptr, "no records");
  if (size < 4) return 0;
  job->animate = data[0] & 1;
  job->extension = (data[0] & 2) != 0 ? 291 : 0;
  job->ext_start = 100;
  job->ext_by = 10;
  job->frames[0] = 1.0f;
  job->frames[2] = 0.5f * static_cast<float>(1 + data[1] % 4);
  TaskRec rec;
  rec.current = rec.start = static_cast<float>(data[2] % 50);
  rec.end = rec.start + job->frames[2] * static_cast<float>(data[3] % 20);
  rec.dev = dev;
  job->frames[1] = rec.end + 10.0f;

  std::string text(reinterpret_cast<const char*>(data) + 4, size - 4);
  TASK entry;
  entry.job = job;
  entry.rec = &rec;
  entry.stream = fmemopen(text.data(), text.size() + 1, "r");  // +1: empty text
  fuzz::require(entry.stream != nullptr, "fmemopen failed");
  const int changed = set_image_percentage_done(&entry);
  fuzz::require(changed == 0 || changed == 1, "not a yes or no");
  fuzz::require(rec.current >= rec.start && rec.current <= rec.end, "the frame left the task");
  fuzz::require(set_image_percentage_done(&entry) == 0, "a second look changed the task");
  fclose(entry.stream);
  return 0;
}
