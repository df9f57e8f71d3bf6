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
#ifndef ZARK_PORTMAP_DRIVERS_DRIVER_CHOICE_H
#define ZARK_PORTMAP_DRIVERS_DRIVER_CHOICE_H

#include "base/local_network.h"
#include "catalog/mapping_state.h"
#include "drivers/router_driver.h"
#include "libzarkportmap.h"

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

// The protocol a configuration's flags ask for (kUpnp, kNatPmp), or
// nothing when neither flag is "yes". Pure.
[[nodiscard]] std::optional<RouterProtocol>
ProtocolOfRouterConf(const ZARK_ROUTER_CONF &conf);

// A router's name as detection writes it into upnp_pfpath,
//   "<brand>: <model>(<version>)"   or   "<brand>: <model>",
// split as the module splits it: brand before the first ": ", model up to
// the first "(" after it, version after that "(" with the last ")" cut.
// Nothing when there is no ": ". Pure.
struct DetectedRouterName {
  std::string brand;
  std::string model;
  std::optional<std::string> version; // none when the name has no "("
};
[[nodiscard]] std::optional<DetectedRouterName>
SplitDetectedRouterName(std::string_view pfpath);

// The protocol of conf's router (brand, model, version), from, in this
// order: its router database entry (else the model's generic entry) when
// that says upnp or natpmp; the kept detection record when its upnp_pfpath
// names the same router (brand and model, the version too when the name
// carries one) and its support_upnp is 1 (UPnP) or else its support_natpmp
// is 1 (NAT-PMP). Reads the installed router database and the kept
// detection record (kDetectResultPath); their readers log a file they cannot
// read, and that source then tells nothing. Nothing when neither
// tells UPnP or NAT-PMP for the configuration's router.
enum class ProtocolSource { kRouterDb, kDetectResult };
struct InferredProtocol {
  RouterProtocol protocol = RouterProtocol::kUpnp; // kUpnp or kNatPmp
  ProtocolSource source = ProtocolSource::kRouterDb;
};
[[nodiscard]] std::optional<InferredProtocol>
InferProtocolOfRouter(const ZARK_ROUTER_CONF &conf);

struct RouterChoice {
  RouterProtocol protocol = RouterProtocol::kUpnp; // kUpnp or kNatPmp
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
[[nodiscard]] std::unique_ptr<RouterDriver>
MakeRouter(RouterProtocol protocol, const std::string &gateway,
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
