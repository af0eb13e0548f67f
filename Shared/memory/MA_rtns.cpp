#include "Shared/memory/MA_rtns.h"

#include <cstdlib>
#include <cstring>

namespace {
bool ma_initialized = false;
}

void MA_init() {
  if (ma_initialized) return;
  ma_initialized = true;
}

void* MA_malloc(size_t size, int /*line*/, const char* /*unit*/, int /*flag*/) {
  return std::malloc(size == 0 ? 1 : size);
}

void* MA_calloc(size_t count, size_t size, int /*line*/, const char* /*unit*/) {
  return std::calloc(count == 0 ? 1 : count, size == 0 ? 1 : size);
}

void* MA_realloc(void* pointer, size_t size, int /*line*/, const char* /*unit*/) {
  return std::realloc(pointer, size == 0 ? 1 : size);
}

void MA_free(void* pointer, int /*line*/, const char* /*unit*/) { std::free(pointer); }

char* MA_strdup(const char* text, int line, const char* unit) {
  if (text == nullptr) return nullptr;
  size_t n = std::strlen(text) + 1;
  char* copy = static_cast<char*>(MA_malloc(n, line, unit, 1));
  if (copy != nullptr) std::memcpy(copy, text, n);
  return copy;
}
