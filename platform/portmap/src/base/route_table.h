// Finding the default IPv4 gateway in the kernel's routing table.
#ifndef ZARK_PORTMAP_BASE_ROUTE_TABLE_H
#define ZARK_PORTMAP_BASE_ROUTE_TABLE_H

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace zark::portmap {

inline constexpr const char *kRouteTablePath = "/proc/net/route";

// Picks the default gateway from the text of /proc/net/route:
//
//   Iface  Destination  Gateway   Flags  RefCnt  Use  Metric  Mask      ...
//   eth0   00000000     0101A8C0  0003   0       0    100     00000000  ...
//
// A default route has destination 0, mask 0, the flags RTF_UP and
// RTF_GATEWAY, and a non-zero gateway. Of several, the one with the lowest
// metric wins; on equal metrics the first listed. The first line (the
// column titles) and every line that does not parse are skipped. The result
// is the address in network byte order (the kernel prints the raw 32-bit
// value in hexadecimal); nullopt when there is no default route.
[[nodiscard]] std::optional<uint32_t>
ParseDefaultGateway(std::string_view routeTable);

// Dotted-quad text of an address in network byte order.
[[nodiscard]] std::string FormatIPv4(uint32_t networkOrder);

} // namespace zark::portmap

#endif
