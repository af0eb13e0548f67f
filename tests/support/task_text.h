// The lines of the task file, built the way the daemon writes them, for
// tests that compare whole files.
#pragma once

#include <cstdio>
#include <string>

inline std::string group_line(const std::string& name, int index, int numrecs, int next_id) {
  char b[256];
  snprintf(b, sizeof b, "\t %d\t %d\t %d\n", index, numrecs, next_id);
  return "\n" + name + b;
}

inline std::string rec_line(int id, float start, float end, float current, int dev, int retries,
                            const std::string& status) {
  char b[512];
  snprintf(b, sizeof b, "\t%d\t %f\t %f\t %f  %d\t %d\t", id, start, end, current, dev, retries);
  return b + status + "\n";
}
