#include "base/router_protocol.h"

namespace zark::portmap {

std::string_view RouterProtocolName(RouterProtocol protocol) {
  switch (protocol) {
  case RouterProtocol::kUpnp:
    return "upnp";
  case RouterProtocol::kNatPmp:
    return "natpmp";
  case RouterProtocol::kWebPages:
    return "web";
  }
  return "unknown";
}

std::optional<RouterProtocol> ParseRouterProtocol(std::string_view text) {
  for (RouterProtocol protocol :
       {RouterProtocol::kUpnp, RouterProtocol::kNatPmp,
        RouterProtocol::kWebPages}) {
    if (text == RouterProtocolName(protocol)) {
      return protocol;
    }
  }
  return std::nullopt;
}

} // namespace zark::portmap
