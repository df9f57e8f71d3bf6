// The protocols the library can drive a router by, as one typed value.
// The router database, the stored mapping state and the drivers all name a
// router's protocol; they name it with this enum and spell it with
// RouterProtocolName where it is written to a file or a log.
#ifndef ZARK_PORTMAP_BASE_ROUTER_PROTOCOL_H
#define ZARK_PORTMAP_BASE_ROUTER_PROTOCOL_H

#include <optional>
#include <string_view>

namespace zark::portmap {

enum class RouterProtocol {
  kUpnp,     // UPnP IGD
  kNatPmp,   // NAT-PMP
  kWebPages, // the router's own administration pages
};

// "upnp", "natpmp", "web": the protocol's name in the library's files.
[[nodiscard]] std::string_view RouterProtocolName(RouterProtocol protocol);

// The protocol named by text, exactly as RouterProtocolName spells it;
// nothing for any other text. Pure.
[[nodiscard]] std::optional<RouterProtocol>
ParseRouterProtocol(std::string_view text);

} // namespace zark::portmap

#endif
