// Feeds arbitrary bytes to the daemon's reading of a render program's output
// stream.  The first four bytes shape the task (animation or still, step,
// start, length), the rest is what the program wrote.  Nothing may crash or
// overrun; the frame reached stays inside the task; a second look at a
// stream with nothing new on it changes nothing.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "Utility/rndctl/rndctl.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static Job* job = Add_a_job(nullptr, "fuzz.sdl", 1);
  static Dev* dev = Add_a_dev(nullptr, "render1", 1);
  if (job == nullptr || dev == nullptr) abort();
  if (size < 4) return 0;
  job->animate = data[0] & 1;
  job->extension = (data[0] & 2) != 0 ? 291 : 0;
  job->ext_start = 100;
  job->ext_by = 10;
  job->frames[0] = 1.0f;
  job->frames[2] = 0.5f * static_cast<float>(1 + data[1] % 4);
  TaskRec rec;
  rec.start = static_cast<float>(data[2] % 50);
  rec.end = rec.start + job->frames[2] * static_cast<float>(data[3] % 20);
  rec.current = rec.start;
  rec.dev = dev;
  job->frames[1] = rec.end + 10.0f;

  std::string text(reinterpret_cast<const char*>(data) + 4, size - 4);
  TASK entry;
  entry.job = job;
  entry.rec = &rec;
  entry.stream = fmemopen(text.data(), text.size() + 1, "r");  // +1: empty text
  if (entry.stream == nullptr) abort();
  int changed = set_image_percentage_done(&entry);
  if (changed != 0 && changed != 1) abort();
  if (rec.current < rec.start || rec.current > rec.end) abort();
  if (set_image_percentage_done(&entry) != 0) abort();
  fclose(entry.stream);
  entry.stream = nullptr;
  entry.rec = nullptr;
  return 0;
}
