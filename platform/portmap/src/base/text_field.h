// The fixed-size text fields of the C interface's records.
#ifndef ZARK_PORTMAP_TEXT_FIELD_H
#define ZARK_PORTMAP_TEXT_FIELD_H

#include <algorithm>
#include <cstddef>
#include <cstring>
#include <string_view>

namespace zark::portmap {

// Copies text into field, cut to leave room for the terminating NUL, and
// clears the rest of the field.
template <std::size_t N>
void CopyText(char (&field)[N], std::string_view text) {
  static_assert(N > 0);
  const std::size_t length = std::min(text.size(), N - 1);
  std::memcpy(field, text.data(), length);
  std::memset(field + length, 0, N - length);
}

} // namespace zark::portmap

#endif
