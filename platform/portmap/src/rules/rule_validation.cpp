#include "rules/rule_validation.h"

#include "base/record_text.h"
#include "klibc_text.h"

#include <algorithm>
#include <cctype>
#include <cstring>
#include <map>
#include <utility>

namespace zark::portmap {
namespace {

std::string Lower(std::string_view text) {
  std::string lower(text);
  for (char &c : lower) {
    c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  }
  return lower;
}

// A port number: decimal digits only. Values above the highest port are
// reported as too high, not as bad text; very long digit runs too.
PortTextError ParsePort(std::string_view text, long &port) {
  if (text.empty()) {
    return PortTextError::kBadText;
  }
  long value = 0;
  for (char c : text) {
    if (c < '0' || c > '9') {
      return PortTextError::kBadText;
    }
    if (value <= kHighestPort) {
      value = value * 10 + (c - '0');
    }
  }
  if (value > kHighestPort) {
    return PortTextError::kTooHigh;
  }
  if (value == 0) {
    return PortTextError::kBadText;
  }
  port = value;
  return PortTextError::kNone;
}

RuleRefusal Refuse(uint32_t type, std::string reason) {
  RuleRefusal refusal;
  refusal.errType = type;
  refusal.reason = std::move(reason);
  return refusal;
}

RuleRefusal RefusePortText(PortTextError error, std::string_view text,
                           std::string_view ruleId) {
  std::string rule = "rule \"" + std::string(ruleId) + "\": ";
  switch (error) {
  case PortTextError::kTooHigh: {
    RuleRefusal refusal =
        Refuse(ZARK_SAVE_ERR_PORT_TOO_HIGH,
               rule + "port above " + std::to_string(kHighestPort) + " in \"" +
                   std::string(text) + "\"");
    refusal.maxPort = kHighestPort;
    return refusal;
  }
  case PortTextError::kRangeTooLong: {
    RuleRefusal refusal =
        Refuse(ZARK_SAVE_ERR_RANGE_TOO_LONG,
               rule + "a range longer than " + std::to_string(kMaxRangeLength) +
                   " ports in \"" + std::string(text) + "\"");
    refusal.maxPort = kHighestPort;
    refusal.maxRange = kMaxRangeLength;
    return refusal;
  }
  case PortTextError::kBadText:
  case PortTextError::kNone:
    break;
  }
  RuleRefusal refusal =
      Refuse(ZARK_SAVE_ERR_BAD_PORT_TEXT,
             rule + "bad port text \"" + std::string(text) + "\"");
  refusal.text = std::string(text);
  return refusal;
}

} // namespace

PortTextError ExpandPortText(std::string_view text,
                             std::vector<uint16_t> &ports) {
  ports.clear();
  std::string_view rest = text;
  for (;;) {
    std::size_t comma = rest.find(',');
    std::string_view item =
        klibc::Trim(rest.substr(0, comma), klibc::kSpaceAndTab);
    std::size_t dash = item.find('-');
    long first = 0;
    long last = 0;
    PortTextError error = ParsePort(
        klibc::Trim(item.substr(0, dash), klibc::kSpaceAndTab), first);
    if (error != PortTextError::kNone) {
      return error;
    }
    last = first;
    if (dash != std::string_view::npos) {
      std::string_view end =
          klibc::Trim(item.substr(dash + 1), klibc::kSpaceAndTab);
      // "a-" is the port a, as the module writes it.
      if (!end.empty()) {
        error = ParsePort(end, last);
        if (error != PortTextError::kNone) {
          return error;
        }
      }
    }
    if (last < first) {
      return PortTextError::kBadText;
    }
    if (last - first + 1 > kMaxRangeLength) {
      return PortTextError::kRangeTooLong;
    }
    for (long port = first; port <= last; ++port) {
      ports.push_back(static_cast<uint16_t>(port));
    }
    if (comma == std::string_view::npos) {
      return PortTextError::kNone;
    }
    rest.remove_prefix(comma + 1);
  }
}

std::optional<std::vector<IpProtocol>> RuleProtocols(std::string_view text) {
  std::string lower = Lower(klibc::Trim(text, klibc::kSpaceAndTab));
  if (lower == "tcp") {
    return std::vector<IpProtocol>{IpProtocol::kTcp};
  }
  if (lower == "udp") {
    return std::vector<IpProtocol>{IpProtocol::kUdp};
  }
  static const char *const kBoth[] = {"both",    "all",     "tcp,udp",
                                      "udp,tcp", "tcp/udp", "udp/tcp"};
  for (const char *both : kBoth) {
    if (lower == both) {
      return std::vector<IpProtocol>{IpProtocol::kTcp, IpProtocol::kUdp};
    }
  }
  return std::nullopt;
}

int MaxRouterEntries(std::string_view maxRuleText) {
  std::string_view text = klibc::Trim(maxRuleText, klibc::kSpaceAndTab);
  if (text.empty() || text.size() > 9) {
    return kDefaultMaxRouterEntries;
  }
  int value = 0;
  for (char c : text) {
    if (c < '0' || c > '9') {
      return kDefaultMaxRouterEntries;
    }
    value = value * 10 + (c - '0');
  }
  return value > 0 ? value : kDefaultMaxRouterEntries;
}

namespace {

// The ports of one rule, pairwise: router port i goes to local port i.
struct RulePorts {
  std::vector<IpProtocol> protocols;
  std::string_view routerText;
  std::vector<uint16_t> routerPorts;
  std::vector<uint16_t> localPorts;
};

// Reads the protocol and port texts of rule into ports (an empty side takes
// the other's text); a refusal when a text is bad or the sides differ.
RuleRefusal ReadRulePorts(const ZARK_ROUTER_RULE &rule, RulePorts &ports) {
  const std::string_view ruleId = Field(rule.rule_id);
  const std::string_view protocolText = Field(rule.router_protocol);
  std::string_view routerText = Field(rule.router_port);
  std::string_view localText = Field(rule.ds_port);

  std::optional<std::vector<IpProtocol>> protocols =
      RuleProtocols(protocolText);
  if (!protocols) {
    RuleRefusal refusal =
        Refuse(ZARK_SAVE_ERR_BAD_PROTOCOL,
               "rule \"" + std::string(ruleId) + "\": unknown protocol \"" +
                   std::string(protocolText) + "\"");
    refusal.text = std::string(protocolText);
    return refusal;
  }
  ports.protocols = std::move(*protocols);
  if (klibc::Trim(routerText, klibc::kSpaceAndTab).empty()) {
    routerText = localText;
  }
  if (klibc::Trim(localText, klibc::kSpaceAndTab).empty()) {
    localText = routerText;
  }
  ports.routerText = routerText;
  PortTextError error = ExpandPortText(routerText, ports.routerPorts);
  if (error != PortTextError::kNone) {
    return RefusePortText(error, routerText, ruleId);
  }
  error = ExpandPortText(localText, ports.localPorts);
  if (error != PortTextError::kNone) {
    return RefusePortText(error, localText, ruleId);
  }
  if (ports.routerPorts.size() > static_cast<std::size_t>(kMaxPortsPerRule) ||
      ports.localPorts.size() > static_cast<std::size_t>(kMaxPortsPerRule)) {
    RuleRefusal refusal =
        Refuse(ZARK_SAVE_ERR_TOO_MANY_PORTS,
               "rule \"" + std::string(ruleId) + "\": more than " +
                   std::to_string(kMaxPortsPerRule) + " ports in one rule");
    refusal.maxPort = kMaxPortsPerRule;
    return refusal;
  }
  if (ports.routerPorts.size() != ports.localPorts.size()) {
    RuleRefusal refusal =
        Refuse(ZARK_SAVE_ERR_BAD_PORT_TEXT,
               "rule \"" + std::string(ruleId) +
                   "\": " + std::to_string(ports.routerPorts.size()) +
                   " router port(s) \"" + std::string(routerText) + "\" but " +
                   std::to_string(ports.localPorts.size()) +
                   " local port(s) \"" + std::string(localText) + "\"");
    refusal.text = std::string(localText);
    return refusal;
  }
  return RuleRefusal{};
}

} // namespace

RuleRefusal PlanWantedMappings(std::span<const ZARK_ROUTER_RULE> rules,
                               int maxRouterEntries,
                               std::vector<WantedMapping> &wanted) {
  wanted.clear();
  // (protocol, router port) -> index in wanted, to merge and to catch two
  // rules sending one router port to different local ports.
  std::map<std::pair<IpProtocol, uint16_t>, std::size_t> byRouterPort;
  RulePorts ports;
  for (const ZARK_ROUTER_RULE &rule : rules) {
    if (rule.enable == 0) {
      continue;
    }
    RuleRefusal refusal = ReadRulePorts(rule, ports);
    if (refusal.errType != ZARK_SAVE_ERR_NONE) {
      return refusal;
    }
    const std::string_view ruleId = Field(rule.rule_id);
    for (IpProtocol protocol : ports.protocols) {
      for (std::size_t i = 0; i < ports.routerPorts.size(); ++i) {
        auto key = std::make_pair(protocol, ports.routerPorts[i]);
        auto found = byRouterPort.find(key);
        if (found != byRouterPort.end()) {
          const WantedMapping &earlier = wanted[found->second];
          if (earlier.internalPort == ports.localPorts[i]) {
            continue; // the same mapping twice
          }
          RuleRefusal clash = Refuse(
              ZARK_SAVE_ERR_BAD_PORT_TEXT,
              "rules \"" + earlier.ruleId + "\" and \"" + std::string(ruleId) +
                  "\" both use router port " + ProtocolText(protocol) + " " +
                  std::to_string(ports.routerPorts[i]));
          clash.text = std::string(ports.routerText);
          return clash;
        }
        byRouterPort.emplace(key, wanted.size());
        wanted.push_back({protocol, ports.routerPorts[i], ports.localPorts[i],
                          std::string(ruleId)});
      }
    }
  }
  if (wanted.size() > static_cast<std::size_t>(maxRouterEntries)) {
    RuleRefusal refusal =
        Refuse(ZARK_SAVE_ERR_TOO_MANY_RULES,
               "the rules need " + std::to_string(wanted.size()) +
                   " router entries; the router takes " +
                   std::to_string(maxRouterEntries));
    refusal.maxPort = maxRouterEntries;
    return refusal;
  }
  return RuleRefusal{};
}

} // namespace zark::portmap
