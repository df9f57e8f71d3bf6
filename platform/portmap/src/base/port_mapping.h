// A port mapping as the library asks a router for it and as a router
// reports it, and the IP protocol it forwards. Shared by the router drivers,
// the mapping state, rule planning and the reachability test, none of which
// needs the driver interface for these.
#ifndef ZARK_PORTMAP_BASE_PORT_MAPPING_H
#define ZARK_PORTMAP_BASE_PORT_MAPPING_H

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace zark::portmap {

enum class IpProtocol : uint8_t { kTcp, kUdp };

// "TCP" / "UDP", as UPnP spells them on the wire.
[[nodiscard]] const char *UpnpProtocolName(IpProtocol protocol);
// "tcp" / "udp", as the library writes them in its own files and logs.
[[nodiscard]] const char *ProtocolText(IpProtocol protocol);
// The protocol of "tcp" or "udp" (any case), nothing for anything else.
[[nodiscard]] std::optional<IpProtocol>
ParseProtocolText(std::string_view text);

// One mapping as we ask a router for it: the router forwards
// externalPort/protocol to internalClient:internalPort.
struct PortMapping {
  IpProtocol protocol = IpProtocol::kTcp;
  uint16_t externalPort = 0;
  uint16_t internalPort = 0;
  std::string internalClient; // dotted quad
  std::string description;    // shown in the router's table
};

// One mapping as a router reports it.
struct RouterMapping {
  IpProtocol protocol = IpProtocol::kTcp;
  uint16_t externalPort = 0;
  uint16_t internalPort = 0;
  std::string internalClient;
  std::string description;
  uint32_t leaseSeconds = 0; // 0: permanent
  bool enabled = true;
};

} // namespace zark::portmap

#endif
