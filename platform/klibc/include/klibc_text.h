// Small text helpers shared by the platform libraries, the host and the
// probe (C++ only).
#ifndef ZARK_PLATFORM_KLIBC_TEXT_H
#define ZARK_PLATFORM_KLIBC_TEXT_H

#include <cstddef>
#include <string_view>

namespace zark::klibc {

// Sets of blanks for Trim. Each reader trims exactly the set its format
// allows, so they are kept apart:
// space and tab: items of lists, HTTP header values and cookies;
inline constexpr std::string_view kSpaceAndTab = " \t";
// space, tab and CR: lines of a datagram whose lines may end in CRLF;
inline constexpr std::string_view kSpaceTabAndCr = " \t\r";
// all white space but the line feed: lines of a key/value file, already
// split at line feeds;
inline constexpr std::string_view kBlanksButLineFeed = " \t\r\f\v";
// all white space (space, tab, CR, LF, VT, FF).
inline constexpr std::string_view kWhiteSpace = " \t\r\n\v\f";

// text without the characters of blanks at both ends; empty when text holds
// nothing else. The result points into text.
[[nodiscard]] constexpr std::string_view Trim(std::string_view text,
                                              std::string_view blanks) {
  const std::size_t first = text.find_first_not_of(blanks);
  if (first == std::string_view::npos) {
    return {};
  }
  const std::size_t last = text.find_last_not_of(blanks);
  return text.substr(first, last - first + 1);
}

// True when a and b hold the same text but for the case of ASCII letters
// (protocol tokens: HTTP header names, SSDP search targets).
[[nodiscard]] constexpr bool EqualsIgnoringCase(std::string_view a,
                                                std::string_view b) {
  if (a.size() != b.size()) {
    return false;
  }
  for (std::size_t i = 0; i < a.size(); ++i) {
    char x = a[i];
    char y = b[i];
    if (x >= 'A' && x <= 'Z') {
      x = static_cast<char>(x - 'A' + 'a');
    }
    if (y >= 'A' && y <= 'Z') {
      y = static_cast<char>(y - 'A' + 'a');
    }
    if (x != y) {
      return false;
    }
  }
  return true;
}

} // namespace zark::klibc

#endif
