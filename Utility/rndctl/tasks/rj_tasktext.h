/// Text of the task file and the status files, in memory (rj_tasktext):
/// a token scanner over a whole file read into a buffer (or over a stream,
/// as far as one group), and a growable buffer with "%d" and "%f" of a
/// float formatted into it as the C library would, only cheaper.  For the
/// task-file units only (rj_taskfile, rj_tskio); no control-block fields.
///
/// A damaged file (cut short, garbled, hand-edited) must never take a daemon
/// down: every number is checked as it is scanned, and a caller stops where
/// the text stops making sense.
#pragma once

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

namespace rj_tasktext {

// The blanks of the C library's "C" locale, as a table: the reader asks
// about every character of a file of some megabytes.
inline constexpr struct SpaceTable {
  bool is[257] = {};
  constexpr SpaceTable() {
    for (int c : {' ', '\t', '\n', '\v', '\f', '\r'}) is[c + 1] = true;
  }
} kSpace;

// c is a character as getc returns it: unsigned char value or EOF.
inline bool is_space(int c) { return kSpace.is[c + 1]; }

// Where a token in a buffer may end: a blank, or the NUL that ends the
// buffer (a NUL inside the text is part of the token).
inline constexpr struct TokenEndTable {
  bool is[256] = {};
  constexpr TokenEndTable() {
    for (int c : {'\0', ' ', '\t', '\n', '\v', '\f', '\r'}) is[c] = true;
  }
} kTokenEnd;

// Whitespace-separated tokens, either from a buffer that the source may
// write into (each token is NUL-terminated in place) or straight from a
// stream (only as far as needed, so that a caller may go on reading the
// stream after one group).  Over-long tokens in stream mode are consumed
// whole but kept only up to kMaxToken characters: no field of these files is
// legitimately longer.
class TokenSource {
 public:
  static constexpr size_t kMaxToken = 4096;

  explicit TokenSource(FILE* fp) : fp_(fp) {}
  /// text[length] must be a NUL: the scans stop on it instead of counting.
  TokenSource(char* text, size_t length) : p_(text), end_(text + length) {}

  /// The first character of the next token, or EOF; consumes only whitespace.
  int peek() {
    if (fp_ != nullptr) {
      int c;
      do c = getc_unlocked(fp_);
      while (c != EOF && is_space(c));
      if (c != EOF) ungetc(c, fp_);
      return c;
    }
    while (is_space(static_cast<unsigned char>(*p_))) ++p_;  // the NUL at end_ stops it
    return p_ < end_ ? static_cast<unsigned char>(*p_) : EOF;
  }

  /// The next token, NUL-terminated, or null at the end of the input.
  const char* next() {
    if (peek() == EOF) return nullptr;
    if (fp_ != nullptr) {
      token_.clear();
      int c;
      while ((c = getc_unlocked(fp_)) != EOF && !is_space(c)) {
        if (token_.size() < kMaxToken) token_.push_back(static_cast<char>(c));
      }
      return token_.c_str();
    }
    char* start = p_;
    for (;;) {
      while (!kTokenEnd.is[static_cast<unsigned char>(*p_)]) ++p_;
      if (*p_ != '\0' || p_ >= end_) break;
      ++p_;
    }
    // The buffer has one spare byte past its end, so the last token can be
    // terminated too.
    *p_ = '\0';
    if (p_ < end_) ++p_;
    return start;
  }

  // The numbers of a buffer are converted where they stand, without finding
  // the end of the token first; whatever the quick look does not take is
  // read the long way below.
  bool next_int(int* out) {
    if (fp_ == nullptr && peek() != EOF) {
      const char* t = p_;
      const char* d = t + (*t == '-' || *t == '+');
      int digits = 0;
      int v9 = 0;
      while (d[digits] >= '0' && d[digits] <= '9' && digits < 10)
        v9 = v9 * 10 + (d[digits++] - '0');
      if (digits > 0 && digits < 10 && take_token_ending_at(p_ + (d - t) + digits)) {
        *out = *t == '-' ? -v9 : v9;
        return true;
      }
    }
    const char* t = next();
    if (t == nullptr) return false;
    // Plain decimal numbers of up to nine digits cannot overflow: done here.
    const char* d = t + (*t == '-' || *t == '+');
    int digits = 0;
    int v9 = 0;
    while (d[digits] >= '0' && d[digits] <= '9' && digits < 10) v9 = v9 * 10 + (d[digits++] - '0');
    if (digits > 0 && digits < 10 && d[digits] == '\0') {
      *out = *t == '-' ? -v9 : v9;
      return true;
    }
    char* stop = nullptr;
    errno = 0;
    long v = strtol(t, &stop, 10);
    if (stop == t || *stop != '\0' || errno != 0 || v < INT_MIN || v > INT_MAX) return false;
    *out = static_cast<int>(v);
    return true;
  }

  bool next_float(float* out) {
    if (fp_ == nullptr && peek() != EOF) {
      float v = 0;
      const char* stop = scan_decimal(p_, &v);
      if (stop != nullptr && take_token_ending_at(p_ + (stop - p_))) {
        *out = v;
        return true;
      }
    }
    const char* t = next();
    if (t == nullptr) return false;
    if (fast_decimal(t, out)) return true;
    char* stop = nullptr;
    errno = 0;
    float v = strtof(t, &stop);
    // Infinities and NaNs are not frame numbers; a file holding them is
    // damaged, and letting them through would poison every later division.
    if (stop == t || *stop != '\0' || !std::isfinite(v)) return false;
    *out = v;
    return true;
  }

 private:
  // Buffer mode, p_ at the start of a token: when `stop` is where next()
  // would end that token (a blank, or the NUL that closes the buffer), takes
  // it as next() would and returns true.
  bool take_token_ending_at(char* stop) {
    unsigned char c = static_cast<unsigned char>(*stop);
    if (!kTokenEnd.is[c] || (c == '\0' && stop < end_)) return false;
    *stop = '\0';
    p_ = stop < end_ ? stop + 1 : stop;
    return true;
  }

  static bool fast_decimal(const char* t, float* out) {
    float v = 0;
    const char* stop = scan_decimal(t, &v);
    if (stop == nullptr || *stop != '\0') return false;
    *out = v;
    return true;
  }

  // "[-]d{1,7}[.d{0,6}]" is all the writer ever produces for sensible frame
  // numbers.  Such a value is m / 10^k with m < 10^13: both are exact
  // doubles, so the quotient is correctly rounded, and it lies too far from
  // any float rounding midpoint for the second rounding to float to differ
  // from strtof's.
  // Reads such a number from the start of t; returns where it stopped, or
  // null when t does not start with one.
  static const char* scan_decimal(const char* t, float* out) {
    const char* s = t;
    bool negative = false;
    if (*s == '-') {
      negative = true;
      ++s;
    }
    int64_t m = 0;
    int int_digits = 0;
    while (*s >= '0' && *s <= '9') {
      if (++int_digits > 7) return nullptr;
      m = m * 10 + (*s++ - '0');
    }
    if (int_digits == 0) return nullptr;
    int frac_digits = 0;
    if (*s == '.') {
      ++s;
      while (*s >= '0' && *s <= '9') {
        if (++frac_digits > 6) return nullptr;
        m = m * 10 + (*s++ - '0');
      }
    }
    static const double kPow10[] = {1e0, 1e1, 1e2, 1e3, 1e4, 1e5, 1e6};
    double v = static_cast<double>(m) / kPow10[frac_digits];
    *out = static_cast<float>(negative ? -v : v);
    return s;
  }

  FILE* fp_ = nullptr;
  std::string token_;
  char* p_ = nullptr;
  char* end_ = nullptr;
};

// ---------------------------------------------------------------------------
// Formatting into a buffer, with the exact output of "%d" and of "%f" of a
// float promoted to double.

// A growable text buffer written through a pointer: the writer formats
// every number of a file of many thousand records, and appending character
// by character to a std::string costs a capacity check each.
class TextOut {
 public:
  /// Room for at least `n` more characters; write them, then commit().
  char* room(size_t n) {
    if (used_ + n > capacity_) grow(used_ + n);
    return text_.get() + used_;
  }
  void commit(char* end) { used_ = static_cast<size_t>(end - text_.get()); }
  void put(const char* s) {
    size_t n = strlen(s);
    char* p = room(n);
    memcpy(p, s, n);
    commit(p + n);
  }
  /// Makes room for `n` characters in all, to save growing step by step.
  void reserve(size_t n) {
    if (n > capacity_) grow(n);
  }
  /// Empties the text and keeps the room.
  void clear() { used_ = 0; }
  const char* data() const { return text_.get(); }
  char* data() { return text_.get(); }
  size_t size() const { return used_; }

 private:
  // Grown without clearing: every character is written before it is read.
  void grow(size_t need) {
    size_t capacity = std::max(capacity_ * 2, need + 4096);
    std::unique_ptr<char[]> text = std::make_unique_for_overwrite<char[]>(capacity);
    if (used_ > 0) memcpy(text.get(), text_.get(), used_);
    text_ = std::move(text);
    capacity_ = capacity;
  }

  std::unique_ptr<char[]> text_;
  size_t capacity_ = 0;
  size_t used_ = 0;
};

// "%d" into p (room for 11 characters); returns the end.
inline char* put_int(char* p, int value) {
  char digits[16];
  int n = 0;
  unsigned u = value < 0 ? 0u - static_cast<unsigned>(value) : static_cast<unsigned>(value);
  do {
    digits[n++] = static_cast<char>('0' + u % 10);
    u /= 10;
  } while (u != 0);
  if (value < 0) *p++ = '-';
  while (n > 0) *p++ = digits[--n];
  return p;
}

// "00" "01" ... "99": the six decimals go out two at a time.
inline constexpr struct DigitPairs {
  char text[201] = {};
  constexpr DigitPairs() {
    for (int i = 0; i < 100; ++i) {
      text[2 * i] = static_cast<char>('0' + i / 10);
      text[2 * i + 1] = static_cast<char>('0' + i % 10);
    }
  }
} kDigitPairsTable;
inline constexpr const char* kDigitPairs = kDigitPairsTable.text;

// "%f" of value into p, which has room for kFloatRoom characters.  Exact
// when value * 10^6 is a whole number below 2^50: the product is then
// computed exactly (or within a rounding error far below the last printed
// digit), which covers every frame number with at most six decimals.  For
// anything else returns null and the caller asks the C library.
inline char* put_fixed6_fast(char* p, double value) {
  double scaled = value * 1e6;
  if (!(std::fabs(scaled) < 1125899906842624.0)) return nullptr;
  // Below 2^50 the conversion is exact for whole numbers, so this is the
  // test for one.
  int64_t signed_scaled = static_cast<int64_t>(scaled);
  if (static_cast<double>(signed_scaled) != scaled) return nullptr;
  uint64_t s = static_cast<uint64_t>(signed_scaled < 0 ? -signed_scaled : signed_scaled);
  if (std::signbit(value)) *p++ = '-';
  uint64_t whole = s / 1000000;
  uint32_t frac = static_cast<uint32_t>(s - whole * 1000000);
  char digits[24];
  int n = 0;
  do {
    digits[n++] = static_cast<char>('0' + whole % 10);
    whole /= 10;
  } while (whole != 0);
  while (n > 0) *p++ = digits[--n];
  *p++ = '.';
  uint32_t high = frac / 10000;
  uint32_t low = frac % 10000;
  memcpy(p, kDigitPairs + 2 * high, 2);
  memcpy(p + 2, kDigitPairs + 2 * (low / 100), 2);
  memcpy(p + 4, kDigitPairs + 2 * (low % 100), 2);
  return p + 6;
}

// "%f" of a float promoted to double is at most 47 characters (sign, 39
// digits, point, six decimals), "-nan" and "-inf" fewer.
inline constexpr size_t kFloatRoom = 64;

// "%f" of value into p, which has room for kFloatRoom characters.
inline char* put_fixed6(char* p, double value) {
  if (char* end = put_fixed6_fast(p, value)) return end;
  int n = snprintf(p, kFloatRoom, "%f", value);
  if (n < 0) return p;
  return p + std::min(static_cast<size_t>(n), kFloatRoom - 1);
}

inline void put_literal(TextOut& out, const char* s, size_t n) {
  char* p = out.room(n);
  memcpy(p, s, n);
  out.commit(p + n);
}

}  // namespace rj_tasktext
