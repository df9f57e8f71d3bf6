// The default IPv4 routes and gateway in the kernel's routing table.
#ifndef ZARK_PORTMAP_BASE_ROUTE_TABLE_H
#define ZARK_PORTMAP_BASE_ROUTE_TABLE_H

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

inline constexpr const char *kRouteTablePath = "/proc/net/route";
// The routing table is a few lines per interface; this is far above it.
inline constexpr std::size_t kMaxRouteTableBytes = 1024 * 1024;

// One default route of the kernel's IPv4 routing table.
struct DefaultRoute {
  std::string interface;
  uint32_t gateway = 0; // host byte order
  unsigned long metric = 0;
  friend bool operator==(const DefaultRoute &, const DefaultRoute &) = default;
};

// Every default route in the text of /proc/net/route:
//
//   Iface  Destination  Gateway   Flags  RefCnt  Use  Metric  Mask      ...
//   eth0   00000000     0101A8C0  0003   0       0    100     00000000  ...
//
// A default route has destination 0, mask 0, the flags RTF_UP and
// RTF_GATEWAY, and a non-zero gateway (the kernel prints the raw 32-bit
// value in hexadecimal). Lowest metric first, equal metrics in the order
// listed: the first one is the route the kernel uses and the gateway
// KLibGetGatewayIP answers. The first line (the column titles) and every
// line that does not parse are skipped. Pure.
[[nodiscard]] std::vector<DefaultRoute>
ParseDefaultRoutes(std::string_view routeTable);

// Picks the default gateway from the text of /proc/net/route: the gateway
// of the first route ParseDefaultRoutes gives, in network byte order;
// nullopt when there is no default route.
[[nodiscard]] std::optional<uint32_t>
ParseDefaultGateway(std::string_view routeTable);

} // namespace zark::portmap

#endif
