// The lines of the task file, built the way the daemon writes them, for
// tests that compare whole files.
#pragma once

#include <cstdio>
#include <sstream>
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

/// The records written as rows "id start end current dev retries STATUS", each ended by a comma
/// but the last; their number in `*count` when given.
inline std::string rec_lines(const std::string& rows, int* count = nullptr) {
  std::istringstream in(rows);
  std::string out, status;
  int id, dev, retries, n = 0;
  float start, end, current;
  for (; in >> id >> start >> end >> current >> dev >> retries >> status; ++n) {
    if (status.back() == ',') status.pop_back();
    out += rec_line(id, start, end, current, dev, retries, status);
  }
  if (count != nullptr) *count = n;
  return out;
}
