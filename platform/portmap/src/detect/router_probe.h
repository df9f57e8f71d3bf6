// The sixth check of router detection: what the router at the default
// gateway is and how it can be driven. UPnP IGD and NAT-PMP are asked at
// the same time (NAT-PMP on a second thread, joined before the check
// returns):
//   UPnP:    an SSDP search aimed at the gateway (ssdp_search.h), the first
//            device whose description holds a usable WAN connection service
//            (upnp.h), its outside address, and its manufacturer, model
//            name and model number (igd_description.h);
//   NAT-PMP: a public address request to the gateway (natpmp.h).
// The two probes sit behind RouterProbes so that tests can replace them;
// what the findings mean (CheckRouter, NameRouter) is pure.
#ifndef ZARK_PORTMAP_ROUTER_PROBE_H
#define ZARK_PORTMAP_ROUTER_PROBE_H

#include "base/local_network.h"
#include "net/igd_description.h"

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

// Whether the router speaks a protocol; the detection record's coding.
enum class ProtocolSupport : int32_t {
  kNo = 0,      // nothing answered
  kYes = 1,     // it answered as that protocol
  kUnknown = 2, // the probe itself failed (a local error)
};

struct UpnpFinding {
  ProtocolSupport support = ProtocolSupport::kNo;
  std::string location;        // the root description URL used
  std::string externalAddress; // empty when the router would not tell
  IgdIdentity identity;
  std::string why;
};

struct NatPmpFinding {
  ProtocolSupport support = ProtocolSupport::kNo;
  std::string publicAddress; // empty when the router would not tell
  std::string why;
};

class RouterProbes {
public:
  virtual ~RouterProbes() = default;
  // Each is bounded in time by the options it was made with.
  [[nodiscard]] virtual UpnpFinding ProbeUpnp(const std::string &gateway) = 0;
  [[nodiscard]] virtual NatPmpFinding
  ProbeNatPmp(const std::string &gateway) = 0;
};

struct RouterProbeOptions {
  // UPnP: root description URLs tried before searching (where the last job
  // found the router; tests' fake routers); then the SSDP search.
  std::vector<std::string> knownRootDescUrls;
  bool search = true;
  uint16_t ssdpPort = 1900;
  bool ssdpMulticast = true;
  std::chrono::milliseconds ssdpWait{300};
  // Networks whose hosts may serve descriptions and control URLs; none:
  // the interfaces' own (see local_network.h).
  std::optional<std::vector<Ipv4Network>> localNetworks;
  std::chrono::milliseconds descriptionBudget{1000};
  // NAT-PMP: tries at firstWait, doubling: 125 + 250 + 500 ms by default.
  uint16_t natpmpPort = 5351;
  std::chrono::milliseconds natpmpFirstWait{125};
  int natpmpTries = 3;
};

// The real probes over miniupnpc, libnatpmp and the SSDP search.
[[nodiscard]] std::unique_ptr<RouterProbes>
MakeRouterProbes(RouterProbeOptions options);

struct RouterFindings {
  UpnpFinding upnp;
  NatPmpFinding natpmp;
};

// Runs both probes at once. Never throws: a probe that fails with an
// exception is reported as kUnknown with the reason.
[[nodiscard]] RouterFindings ProbeRouter(RouterProbes &probes,
                                         const std::string &gateway);

// The router's names as the record and the router configuration keep them:
// brand from the manufacturer, model from the model name, version from the
// model number, and "upnp pfpath", the name under which the router
// configuration later splits them again: "<brand>: <model>" followed by
// "(<version>)" when the version is known, no blank before "(".
// To keep that split exact, control characters and blanks runs become one
// blank, "/" becomes "-" (the names are folder names of the router
// database), ":" in the brand becomes "-", and "(" and ")" in the model
// become "[" and "]". pfpath is empty when brand or model is. Pure.
struct RouterName {
  std::string brand;
  std::string model;
  std::string version;
  std::string pfpath;
  friend bool operator==(const RouterName &, const RouterName &) = default;
};
[[nodiscard]] RouterName NameRouter(const IgdIdentity &identity);

struct RouterCheck {
  bool ok = false; // UPnP or NAT-PMP answered
  ProtocolSupport upnp = ProtocolSupport::kNo;
  ProtocolSupport natpmp = ProtocolSupport::kNo;
  RouterName name; // from the UPnP description, when UPnP answered
  // The router's outside address as it reported it (UPnP first), host
  // byte order.
  std::optional<uint32_t> outsideAddress;
  // That address sits behind another NAT (RFC 1918 or 100.64/10): the
  // router is behind another router or a carrier's NAT.
  bool doubleNat = false;
  std::string why;
};

// What the findings say. Fails when neither protocol answered. Pure.
[[nodiscard]] RouterCheck CheckRouter(const RouterFindings &findings);

} // namespace zark::portmap

#endif
