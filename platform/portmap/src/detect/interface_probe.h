// The first two checks of router detection: the network interface of the
// default route is usable, and the default gateway is set and looks right.
// Both are decisions over two facts of the machine, the kernel's routing
// table and the interfaces' state; NetworkInfoSource supplies those facts
// so that tests can give any.
#ifndef ZARK_PORTMAP_INTERFACE_PROBE_H
#define ZARK_PORTMAP_INTERFACE_PROBE_H

#include "base/local_network.h"
#include "base/route_table.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

// One network interface as getifaddrs describes it.
struct InterfaceInfo {
  std::string name;
  bool up = false;      // IFF_UP: configured up
  bool running = false; // IFF_RUNNING: the link is there
  bool loopback = false;
  std::vector<Ipv4Network> addresses; // address and mask, host byte order
};

// The machine's facts, for the two checks.
class NetworkInfoSource {
public:
  virtual ~NetworkInfoSource() = default;
  // The text of /proc/net/route; nothing (logged) when it cannot be read.
  [[nodiscard]] virtual std::optional<std::string> RouteTable() = 0;
  // Every interface with its IPv4 addresses; nothing (logged) when they
  // cannot be listed.
  [[nodiscard]] virtual std::optional<std::vector<InterfaceInfo>>
  Interfaces() = 0;
};

// The machine's own: /proc/net/route and getifaddrs.
[[nodiscard]] std::unique_ptr<NetworkInfoSource> MakeSystemNetworkInfo();

struct InterfaceCheck {
  bool ok = false;
  // The interface looked at: the default route's, or without a default
  // route the first usable one; empty when there was none to look at.
  std::string interface;
  Ipv4Network address; // its first IPv4 address when ok
  std::string why;     // one line: what was found or what is wrong
};

// The interface of the first default route must be up, running and have an
// IPv4 address. Without a default route, the first interface (loopback
// left out) that is up, running and has an IPv4 address passes: that the
// gateway is missing is the next check's finding. Pure.
[[nodiscard]] InterfaceCheck
CheckInterface(const std::vector<DefaultRoute> &routes,
               const std::vector<InterfaceInfo> &interfaces);

struct GatewayCheck {
  bool ok = false;
  uint32_t gateway = 0; // host byte order, when ok
  bool warning = false; // set, but it looks wrong (see why)
  std::string why;
};

// A default route must exist; its gateway is the first route's. Warning
// when the gateway is not on a subnet of the interface, is the interface's
// own address, or when several default routes lead to different gateways
// or interfaces (which one the traffic takes then depends on metrics that
// are easily changed by accident). Pure.
[[nodiscard]] GatewayCheck
CheckGateway(const std::vector<DefaultRoute> &routes,
             const std::vector<InterfaceInfo> &interfaces);

} // namespace zark::portmap

#endif
