#include "base/port_mapping.h"

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

} // namespace zark::portmap
