// The text of a rule configuration file, and nothing else: turning rules
// into that text and back. No file access here, so the parser can be fed
// any bytes (tests, fuzzing).
//
// The text is one JSON document:
//   {
//     "version": 1,
//     "rules": [
//       {"rule_id": "0", "enable": true, "router_protocol": "tcp",
//        "router_port": "8080", "ds_port": "80", "serviceid": "web",
//        "service_name": ""}
//     ]
//   }
#ifndef ZARK_PORTMAP_RULE_CONF_FORMAT_H
#define ZARK_PORTMAP_RULE_CONF_FORMAT_H

#include "RouterRuleConf.h"

#include <cstddef>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

inline constexpr int kRuleConfVersion = 1;
// Bounds of one rule configuration: larger files or more rules are refused
// on reading and never written.
inline constexpr std::size_t kMaxRuleConfBytes = 16u * 1024u * 1024u;
inline constexpr std::size_t kMaxRuleConfRules = 65536;
// Longest text of one rule field: a record field keeps a terminating NUL.
inline constexpr std::size_t kMaxRuleFieldBytes = ZARK_PORTMAP_TEXT_SIZE - 1;

// True when text fits a rule record field: at most kMaxRuleFieldBytes bytes
// and no NUL byte (a record field ends at its first NUL).
[[nodiscard]] bool FitsRuleField(std::string_view text);

struct ParsedRuleConf {
  bool ok = false;
  std::vector<RouterRule> rules; // empty unless ok
  std::string error;             // why not ok, for the log
};

// Reads a rule configuration text. Anything but a well-formed document of
// the version above is refused as a whole (ok false, no rule): bad JSON,
// trailing content, duplicate keys, another version, a missing or mistyped
// field, a field that does not fit a record, more than kMaxRuleConfRules
// rules, text larger than kMaxRuleConfBytes. Members it does not know are
// ignored. Never throws.
[[nodiscard]] ParsedRuleConf ParseRuleConf(std::string_view text) noexcept;

// Writes rules as a rule configuration text that ParseRuleConf reads back
// unchanged, byte for byte in every field. Texts are written as JSON
// strings; bytes of 0x80 and above are kept as they are (so a text that is
// not UTF-8 stays exactly what it was).
[[nodiscard]] std::string SerializeRuleConf(std::span<const RouterRule> rules);

} // namespace zark::portmap

#endif
