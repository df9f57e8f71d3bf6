// Checking a rule set before anything is sent to a router, and turning it
// into the single-port mappings it asks for. Pure: no file, no network.
//
// A rule's ports are a text of items separated by ",": "a" (one port),
// "a-b" (a to b), "a-" (the port a, as the module writes it). Blanks around
// items are ignored. The router ports and the local ports of a rule expand
// to two lists of the same length, paired in order: "8000-8002" to
// "80-82" maps 8000->80, 8001->81, 8002->82. An empty router port text
// means "the same as the local ports", and the other way round.
//
// Protocol texts (blanks around and letter case ignored): "tcp" maps TCP,
// "udp" maps UDP, and "both", "all", "tcp,udp", "udp,tcp", "tcp/udp",
// "udp/tcp" map both. Anything else is refused (ZARK_SAVE_ERR_BAD_PROTOCOL)
// rather than guessed: the module's own rules only ever say "tcp" or "udp".
// (The module's service check reads any text but "tcp" as UDP; a rule saved
// as "both" is applied to TCP and UDP here.)
//
// Disabled rules map nothing and are not checked: they are kept as written.
//
// Refusals, checked rule by rule in order, the first one found wins:
//   ZARK_SAVE_ERR_BAD_PROTOCOL (9)   unknown protocol text; text = it
//   ZARK_SAVE_ERR_BAD_PORT_TEXT (8)  a port text that does not parse (empty
//                                    item, not a number, port 0, a range
//                                    that runs backwards, both texts empty),
//                                    router and local lists of different
//                                    lengths, or a router port that two
//                                    rules send to different local ports;
//                                    text = the offending port text
//   ZARK_SAVE_ERR_PORT_TOO_HIGH (10) a port above kHighestPort;
//                                    maxPort = kHighestPort
//   ZARK_SAVE_ERR_RANGE_TOO_LONG (12) one range longer than
//                                    kMaxRangeLength ports;
//                                    maxPort = kHighestPort,
//                                    maxRange = kMaxRangeLength
//   ZARK_SAVE_ERR_TOO_MANY_PORTS (11) one rule with more than
//                                    kMaxPortsPerRule ports;
//                                    maxPort = kMaxPortsPerRule
//   ZARK_SAVE_ERR_TOO_MANY_RULES (7) the whole set needs more router
//                                    entries (one per port and protocol)
//                                    than the router takes;
//                                    maxPort = that limit
#ifndef ZARK_PORTMAP_RULE_VALIDATION_H
#define ZARK_PORTMAP_RULE_VALIDATION_H

#include "base/port_mapping.h"
#include "libzarkportmap.h"

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

inline constexpr int kHighestPort = 65535;
inline constexpr int kMaxRangeLength = 100;
inline constexpr int kMaxPortsPerRule = 100;
// Router entries a rule set may need when the router configuration gives
// no limit ("max_rule" empty or not a positive number).
inline constexpr int kDefaultMaxRouterEntries = 256;

// One single-port mapping a rule set asks for.
struct WantedMapping {
  IpProtocol protocol = IpProtocol::kTcp;
  uint16_t externalPort = 0;
  uint16_t internalPort = 0;
  std::string ruleId;

  friend bool operator==(const WantedMapping &,
                         const WantedMapping &) = default;
};

// Why a rule set was refused, in the terms of ZARK_ROUTER_SAVE_RULE_RESULT.
struct RuleRefusal {
  uint32_t errType = ZARK_SAVE_ERR_NONE;
  int32_t maxPort = 0;  // types 7, 10, 11, 12
  int32_t maxRange = 0; // type 12
  std::string text;     // types 8, 9
  std::string reason;   // one line for the log
};

enum class PortTextError { kNone, kBadText, kTooHigh, kRangeTooLong };

// Expands a port text into its ports, in order. On an error, ports holds
// what was read before it.
[[nodiscard]] PortTextError ExpandPortText(std::string_view text,
                                           std::vector<uint16_t> &ports);

// The protocols a protocol text maps, nothing when the text is unknown.
[[nodiscard]] std::optional<std::vector<IpProtocol>>
RuleProtocols(std::string_view text);

// The router entry limit that a router configuration's "max_rule" text
// gives: its value when it is a positive decimal number, otherwise
// kDefaultMaxRouterEntries.
[[nodiscard]] int MaxRouterEntries(std::string_view maxRuleText);

// Checks rules and fills wanted with their mappings (duplicates merged, in
// rule order). errType ZARK_SAVE_ERR_NONE when the set is accepted.
[[nodiscard]] RuleRefusal
PlanWantedMappings(std::span<const ZARK_ROUTER_RULE> rules,
                   int maxRouterEntries, std::vector<WantedMapping> &wanted);

} // namespace zark::portmap

#endif
