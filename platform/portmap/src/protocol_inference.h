// The protocol of a stored router configuration whose support_upnp and
// support_natpmp are not "yes": the module stores such a configuration for a
// router that detection found by UPnP (under the name detection gave it)
// before it runs the zarkportforward tool, so the router's protocol must
// come from what the library knows of that router.
//
// Kept apart from router_driver.h because the router database's
// RouterProtocol (an enum) and the driver interface's RouterProtocol share a
// name.
#ifndef ZARK_PORTMAP_PROTOCOL_INFERENCE_H
#define ZARK_PORTMAP_PROTOCOL_INFERENCE_H

#include "libzarkportmap.h"

#include <optional>
#include <string>
#include <string_view>

namespace zark::portmap {

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
  std::string protocol; // "upnp" or "natpmp"
  ProtocolSource source = ProtocolSource::kRouterDb;
};
[[nodiscard]] std::optional<InferredProtocol>
InferProtocolOfRouter(const ZARK_ROUTER_CONF &conf);

} // namespace zark::portmap

#endif
