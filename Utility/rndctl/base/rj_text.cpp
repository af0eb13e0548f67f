#include "Utility/rndctl/base/rj_text.h"

#include "Shared/memory/MA_rtns.h"

void Text::set(const char* text, int line, const char* unit) {
  // Copy first: `text` may point into the value being replaced.
  char* copy = MA_strdup(text, line, unit);
  reset();
  p_ = copy;
}

void Text::adopt(char* block) {
  if (block == p_) return;
  reset();
  p_ = block;
}

void Text::reset() {
  if (p_ != nullptr) MA_free(p_, __LINE__, "Utility/rndctl/rj_text");
  p_ = nullptr;
}

std::vector<std::string> Text_lines(const std::string& text) {
  std::vector<std::string> lines;
  size_t at = 0;
  while (at < text.size()) {
    size_t end = text.find('\n', at);
    if (end == std::string::npos) end = text.size();
    lines.push_back(text.substr(at, end - at));
    at = end + 1;
  }
  return lines;
}
