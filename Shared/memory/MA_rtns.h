/// The checking allocator: every heap block of the queue code is taken and
/// given back here, with the caller's source line and unit, so that a leaked,
/// damaged or doubly freed block can be traced to the line that made it.
///
/// For now the blocks come straight from the C heap; the call shape is final.
///
/// Calling order: MA_init() once at start-up (later calls do nothing), then
/// any number of MA_malloc/MA_calloc/MA_realloc/MA_free.  MA_malloc returns
/// null when memory is exhausted; MA_free(nullptr, ...) does nothing.
/// None of these is safe inside a signal handler.
#pragma once

#include <cstddef>
#include <new>
#include <utility>

void MA_init();
[[nodiscard]] void* MA_malloc(size_t size, int line, const char* unit, int flag);
[[nodiscard]] void* MA_calloc(size_t count, size_t size, int line, const char* unit);
[[nodiscard]] void* MA_realloc(void* pointer, size_t size, int line, const char* unit);
void MA_free(void* pointer, int line, const char* unit);

/// Heap copy of a NUL-terminated text through the allocator; null for null.
[[nodiscard]] char* MA_strdup(const char* text, int line, const char* unit);

/// Allocates and constructs one record; null when memory is exhausted.
template <class T, class... Args>
[[nodiscard]] T* MA_new(int line, const char* unit, Args&&... args) {
  void* p = MA_malloc(sizeof(T), line, unit, 1);
  if (p == nullptr) return nullptr;
  return new (p) T(std::forward<Args>(args)...);
}

/// Destroys and releases a record made by MA_new; null does nothing.
template <class T>
void MA_delete(T* record, int line, const char* unit) {
  if (record == nullptr) return;
  record->~T();
  MA_free(record, line, unit);
}
