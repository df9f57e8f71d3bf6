// Reading and writing the fixed-size text fields of the library's records
// (char[ZARK_PORTMAP_TEXT_SIZE] and the like).
#ifndef ZARK_PORTMAP_RECORD_TEXT_H
#define ZARK_PORTMAP_RECORD_TEXT_H

#include <algorithm>
#include <cstddef>
#include <cstring>
#include <string_view>

namespace zark::portmap {

// The text of a record field: up to its first NUL, or all N bytes when a
// caller filled it without one. Points into field.
template <std::size_t N>
[[nodiscard]] std::string_view Field(const char (&field)[N]) {
  return std::string_view(field, ::strnlen(field, N));
}

// Writes text into field with a terminating NUL, cut to N - 1 bytes when
// longer. The bytes after the NUL are left as they were.
template <std::size_t N>
void CopyText(char (&field)[N], std::string_view text) {
  static_assert(N > 0);
  const std::size_t length = std::min(text.size(), N - 1);
  std::memcpy(field, text.data(), length);
  field[length] = '\0';
}

// CopyText into a field cleared first: no byte of an earlier value stays
// after the NUL (records handed out whole and compared byte for byte).
template <std::size_t N>
void CopyTextZeroFilled(char (&field)[N], std::string_view text) {
  std::memset(field, 0, N);
  CopyText(field, text);
}

} // namespace zark::portmap

#endif
