// Trimming of blanks, shared by the parsers of the firewall library.
#ifndef ZARK_PLATFORM_FIREWALL_TRIM_H
#define ZARK_PLATFORM_FIREWALL_TRIM_H

#include <string_view>

namespace zark::fw {

// text without the blanks (space, tab, CR, LF, VT, FF) at both ends.
[[nodiscard]] inline std::string_view Trim(std::string_view text) {
  constexpr std::string_view kBlanks = " \t\r\n\v\f";
  size_t begin = text.find_first_not_of(kBlanks);
  if (begin == std::string_view::npos) {
    return {};
  }
  size_t end = text.find_last_not_of(kBlanks);
  return text.substr(begin, end - begin + 1);
}

} // namespace zark::fw

#endif
