// Feeds arbitrary bytes to the preferences reader as a preferences file.
// Nothing may crash or overrun, and each name must read as the last line
// that defines it says, by the line format the reader documents: blanks,
// NAME, blanks, then the text between the first and the last double quote;
// lines of 4095 characters or more are skipped.  The lookup that expands
// "~" and "$VAR" in values must find exactly those names.
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <string>

#include "General/pst/pst.h"
#include "Utility/rndctl/base/rj_text.h"

namespace {

bool name_char(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_';
}

// What the file defines, by its documented format.
std::map<std::string, std::string> defined(const std::string& text) {
  std::map<std::string, std::string> out;
  for (const std::string& line : Text_lines(text)) {
    if (line.size() >= 4095) continue;
    size_t p = line.find_first_not_of(" \t");
    if (p == std::string::npos || !name_char(line[p])) continue;
    size_t name_end = p;
    while (name_end < line.size() && name_char(line[name_end])) name_end++;
    size_t q = line.find_first_not_of(" \t", name_end);
    if (q == std::string::npos || line[q] != '"') continue;
    size_t last = line.rfind('"');
    if (last == q) continue;
    out[line.substr(p, name_end - p)] = line.substr(q + 1, last - q - 1);
  }
  return out;
}

std::string dir;

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (dir.empty()) {
    char tmpl[] = "/tmp/prefs_fuzz_XXXXXX";
    if (mkdtemp(tmpl) == nullptr) abort();
    dir = tmpl;
    setenv("ZARNO_LOCATION", dir.c_str(), 1);
    setenv("HOME", dir.c_str(), 1);
  }
  std::string text(reinterpret_cast<const char*>(data), size);
  if (text.find('\0') != std::string::npos) return 0;  // not a text file
  std::string path = dir + "/.ZarnoPrefs";
  FILE* fp = fopen(path.c_str(), "w");
  if (fp == nullptr || fwrite(text.data(), 1, text.size(), fp) != text.size() || fclose(fp) != 0)
    abort();

  std::map<std::string, std::string> expected = defined(text);
  TpstTable* table = Tpst_read(path.c_str());
  if (table == nullptr) abort();
  for (const auto& [name, value] : expected) {
    const char* got = Tpst_get_value(table, name.c_str(), 0);
    if (got == nullptr || value != got) {
      fprintf(stderr, "%s: \"%s\" read as \"%s\"\n", name.c_str(), value.c_str(),
              got != nullptr ? got : "(none)");
      abort();
    }
  }
  if (Tpst_get_value(table, "NOT_IN_THE_FILE_", 0) != nullptr &&
      expected.count("NOT_IN_THE_FILE_") == 0)
    abort();
  Tpst_delete(table);

  pst_reset_cache();
  for (const auto& [name, value] : expected) (void)get_zarno_variable(name.c_str());
  if (get_zarno_variable("NOT_IN_THE_FILE_") != nullptr && expected.count("NOT_IN_THE_FILE_") == 0)
    abort();
  return 0;
}
