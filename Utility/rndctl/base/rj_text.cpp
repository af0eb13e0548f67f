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
