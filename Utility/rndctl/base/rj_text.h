/// Text: the one "string or none" type of the queue records.
///
/// A Text owns a heap copy (taken through the checking allocator, tagged with
/// the line and unit of the caller) or holds none.  c_str() returns null for
/// none, so a Text passes straight into the printf family where the formats
/// say "%s" of a value that is known to be set.  Setting a Text frees the old
/// value first; copying a Text copies the text.
///
/// Text_lines cuts a whole text (a file read at once) into its lines.
#pragma once

#include <cstring>
#include <string>
#include <vector>

class Text {
 public:
  Text() = default;
  explicit Text(const char* text, int line = __builtin_LINE(),
                const char* unit = __builtin_FILE()) {
    set(text, line, unit);
  }
  Text(const Text& other) { set(other.p_); }
  Text(Text&& other) noexcept : p_(other.p_) { other.p_ = nullptr; }
  Text& operator=(const Text& other) {
    if (this != &other) set(other.p_);
    return *this;
  }
  Text& operator=(Text&& other) noexcept {
    if (this != &other) {
      reset();
      p_ = other.p_;
      other.p_ = nullptr;
    }
    return *this;
  }
  ~Text() { reset(); }

  /// Replaces the value with a copy of `text` (none for null).
  /// (The line and unit of the caller tag the copy for the allocator.)
  void set(const char* text, int line = __builtin_LINE(), const char* unit = __builtin_FILE());
  /// Takes over a block made by MA_malloc/MA_strdup (none for null).
  void adopt(char* block);
  /// Gives up the block without freeing it; the caller owns it (MA_free).
  [[nodiscard]] char* release() {
    char* p = p_;
    p_ = nullptr;
    return p;
  }
  void reset();

  const char* c_str() const { return p_; }
  /// Writable access for the few in-place edits (cutting at a character).
  char* data() { return p_; }
  bool none() const { return p_ == nullptr; }
  explicit operator bool() const { return p_ != nullptr; }
  /// The text, or `fallback` when none (for messages: "noname", "null").
  const char* or_else(const char* fallback) const { return p_ ? p_ : fallback; }
  /// True when set and equal to `text` (strcmp); false for none.
  bool is(const char* text) const {
    return p_ != nullptr && text != nullptr && std::strcmp(p_, text) == 0;
  }

 private:
  char* p_ = nullptr;
};

/// The lines of `text` without their '\n'; a last line without one counts
/// too, so "" has no lines and "\n" one empty line.
std::vector<std::string> Text_lines(const std::string& text);
