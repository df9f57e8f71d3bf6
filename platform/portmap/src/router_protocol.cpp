#include "router_protocol.h"

#include <strings.h>

namespace zark::portmap {

const char *UpnpProtocolName(IpProtocol protocol) {
  return protocol == IpProtocol::kTcp ? "TCP" : "UDP";
}

const char *ProtocolText(IpProtocol protocol) {
  return protocol == IpProtocol::kTcp ? "tcp" : "udp";
}

std::optional<IpProtocol> ParseProtocolText(std::string_view text) {
  if (text.size() != 3) {
    return std::nullopt;
  }
  if (strncasecmp(text.data(), "tcp", 3) == 0) {
    return IpProtocol::kTcp;
  }
  if (strncasecmp(text.data(), "udp", 3) == 0) {
    return IpProtocol::kUdp;
  }
  return std::nullopt;
}

const char *RouterOutcomeName(RouterOutcome outcome) {
  switch (outcome) {
  case RouterOutcome::kOk:
    return "ok";
  case RouterOutcome::kNotFound:
    return "not found";
  case RouterOutcome::kConflict:
    return "conflict";
  case RouterOutcome::kNotHeld:
    return "not held";
  case RouterOutcome::kRefused:
    return "refused";
  case RouterOutcome::kNoAnswer:
    return "no answer";
  case RouterOutcome::kBadReply:
    return "bad reply";
  case RouterOutcome::kUnsupported:
    return "unsupported";
  case RouterOutcome::kNoRouter:
    return "no router";
  case RouterOutcome::kFailed:
    return "failed";
  }
  return "unknown";
}

} // namespace zark::portmap
