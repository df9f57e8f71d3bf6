// Picks the router protocol for a gateway from its stored router
// configuration and makes the driver for it.
//
//   support_upnp "yes"                -> UPnP IGD (upnp.h)
//   otherwise support_natpmp "yes"    -> NAT-PMP (natpmp.h)
//   otherwise, by the router it names:
//     its router database entry (brand, model, version; else the model's
//     generic entry) when that says upnp or natpmp,
//     else the kept detection record when it found the same router
//     (support_upnp 1 -> UPnP, else support_natpmp 1 -> NAT-PMP)
//   otherwise (the router's own web pages) -> refused with
//     ZARK_PORTMAP_ERR_NOT_CONFIGURED: no driver for router pages exists yet
//   no configuration stored           -> ZARK_PORTMAP_ERR_NOT_CONFIGURED
//
// A configuration without "yes" flags is what the module stores for a router
// that detection found by UPnP ("pfpath" configuration) before it runs the
// zarkportforward tool, so the tool must still find the router's protocol.
#ifndef ZARK_PORTMAP_ROUTER_DRIVER_H
#define ZARK_PORTMAP_ROUTER_DRIVER_H

#include "libzarkportmap.h"
#include "local_network.h"
#include "mapping_state.h"
#include "protocol_inference.h"
#include "router_protocol.h"

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

inline constexpr std::string_view kProtocolUpnp = "upnp";
inline constexpr std::string_view kProtocolNatPmp = "natpmp";

// The protocol a configuration asks for ("upnp", "natpmp"), or nothing when
// it needs the router's web pages. Pure.
[[nodiscard]] std::optional<std::string>
ProtocolOfRouterConf(const ZARK_ROUTER_CONF &conf);

struct RouterChoice {
  std::string protocol;     // "upnp" or "natpmp"
  int maxRouterEntries = 0; // from the configuration's "max_rule"
};

// Reads the configuration stored for gateway and chooses. False with err
// (ZARK_PORTMAP_ERR_*) set and a log line: NOT_CONFIGURED when nothing is
// stored or the configuration needs router pages; what the store answers
// otherwise.
[[nodiscard]] bool ChooseRouter(const std::string &gateway,
                                RouterChoice &choice, int &err);

// A driver for protocol at gateway, starting from what the last job
// remembered (memo may be null). Null for an unknown protocol.
[[nodiscard]] std::unique_ptr<RouterProtocol>
MakeRouter(std::string_view protocol, const std::string &gateway,
           const RouterRecord *memo);

// Test seam: where MakeRouter's drivers look for routers. Loopback tests
// point UPnP at a fake root description without discovery and NAT-PMP at a
// fake responder's port.
struct RouterOverrides {
  std::vector<std::string> upnpRootDescUrls;
  bool upnpDiscover = false;
  std::optional<std::vector<Ipv4Network>> localNetworks;
  uint16_t natpmpPort = 5351;
  std::chrono::milliseconds natpmpFirstWait{250};
  int natpmpTries = 4;
};
void SetRouterOverridesForTesting(std::optional<RouterOverrides> overrides);

} // namespace zark::portmap

#endif
