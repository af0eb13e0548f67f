// Feeds arbitrary bytes to the preferences reader as a preferences file.
// Nothing may crash or overrun, and each name must read as the last line
// that defines it says, by the line format the reader documents: blanks,
// NAME, blanks, then the text between the first and the last double quote;
// lines of 4095 characters or more are skipped.  The lookup that expands
// "~" and "$VAR" in values must find exactly those names.
#include <algorithm>
#include <cctype>
#include <map>

#include "General/pst/pst.h"
#include "Utility/rndctl/base/rj_text.h"
#include "tests/fuzz/fuzz_support.h"

namespace {

bool name_char(char c) { return isalnum(static_cast<unsigned char>(c)) != 0 || c == '_'; }

// What the file defines, by its documented format.
std::map<std::string, std::string> defined(const std::string& text) {
  std::map<std::string, std::string> out;
  for (const std::string& line : Text_lines(text)) {
    size_t p = line.find_first_not_of(" \t");
    if (line.size() >= 4095 || p == std::string::npos || !name_char(line[p])) continue;
    size_t name_end = std::find_if_not(line.begin() + p, line.end(), name_char) - line.begin();
    size_t q = line.find_first_not_of(" \t", name_end), last = line.rfind('"');
    if (q == std::string::npos || line[q] != '"' || last == q) continue;
    out[line.substr(p, name_end - p)] = line.substr(q + 1, last - q - 1);
  }
  return out;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const std::string dir = [] {
    std::string d = fuzz::scratch_dir("prefs_fuzz");
    setenv("ZARNO_LOCATION", d.c_str(), 1);
    setenv("HOME", d.c_str(), 1);
    return d;
  }();
  const std::string text(reinterpret_cast<const char*>(data), size);
  const std::string path = dir + "/.ZarnoPrefs";
  if (text.find('\0') != std::string::npos) return 0;  // not a text file
  FILE* fp = fopen(path.c_str(), "w");
  fuzz::require(
      fp != nullptr && fwrite(text.data(), 1, text.size(), fp) == text.size() && fclose(fp) == 0,
      "the preferences file was not written");

  const std::map<std::string, std::string> expected = defined(text);
  TpstTable* table = Tpst_read(path.c_str());
  fuzz::require(table != nullptr, "the preferences file was not read");
  for (const auto& [name, value] : expected) {
    const char* got = Tpst_get_value(table, name.c_str(), 0);
    if (got == nullptr || value != got)
      fuzz::require(false, (name + " = \"" + value + "\" read as " + (got ? got : "none")).c_str());
  }
  const bool absent = expected.count("NOT_IN_THE_FILE_") == 0;
  fuzz::require(!absent || Tpst_get_value(table, "NOT_IN_THE_FILE_", 0) == nullptr,
                "a name not in the file was found");
  Tpst_delete(table);

  pst_reset_cache();
  for (const auto& [name, value] : expected) (void)get_zarno_variable(name.c_str());
  fuzz::require(!absent || get_zarno_variable("NOT_IN_THE_FILE_") == nullptr,
                "the expanding lookup found a name not in the file");
  return 0;
}
