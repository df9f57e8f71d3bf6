// Port lists of firewall sections: "80", "55536-55899", "8080-" items
// separated by ",".
#ifndef ZARK_PLATFORM_FIREWALL_PORT_LIST_H
#define ZARK_PLATFORM_FIREWALL_PORT_LIST_H

#include <string>
#include <string_view>
#include <vector>

namespace zark::fw {

inline constexpr int kMaxPort = 65535;

struct PortListParse {
  bool ok = false;
  // The items, blanks around each removed, in text order. Empty for an
  // empty (or all-blank) text.
  std::vector<std::string> items;
  // Why the text was refused (empty when ok).
  std::string problem;
};

// Reads a port list. Each item is "a" (one port), "a-b" (a to b, a <= b) or
// "a-" (the port a), with a and b decimal port numbers 0..65535 of at most
// five digits; blanks around an item are allowed, inside it they are not.
// An empty text is an empty list. An empty item ("80,,90", "80,") or any
// other text refuses the whole list.
[[nodiscard]] PortListParse ParsePortList(std::string_view text);

} // namespace zark::fw

#endif
