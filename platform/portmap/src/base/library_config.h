// The library's own configuration file, "/etc/portforward/portmap.conf":
// key/value lines read with the core library's reader (see the README's
// "Library configuration" for the keys). A missing file or key means the
// built-in default.
#ifndef ZARK_PORTMAP_LIBRARY_CONFIG_H
#define ZARK_PORTMAP_LIBRARY_CONFIG_H

#include "libzarkportmap.h"

#include <string>
#include <string_view>

namespace zark::portmap {

inline constexpr const char *kLibraryConfigPath =
    ZARK_PORTMAP_CONF_DIR "/portmap.conf";

// Keys of the library configuration.
namespace config_key {
// Where KLibUpdateRouterDBList fetches a router database archive: an
// absolute local path, or an "http://" or "https://" URL.
inline constexpr std::string_view kRouterDbUpdateSource =
    "routerdb_update_source";
// Hosts that router detection probes to tell whether the WAN is reachable:
// a comma-separated list of names or addresses.
inline constexpr std::string_view kWanProbeHosts = "wan_probe_hosts";
// The outside service that port tests ask to connect back: "host:port".
inline constexpr std::string_view kProbeServiceAddress =
    "probe_service_address";
// Where failed UPnP compatibility test results are uploaded: an "http://"
// URL.
inline constexpr std::string_view kReportAddress = "report_address";
// The name router detection looks up to tell whether the configured name
// servers answer.
inline constexpr std::string_view kDnsProbeName = "dns_probe_name";
// The first router port the UPnP compatibility test maps (decimal,
// 1024..65000); it fills the router's table from there upwards, skipping
// ports in use. Default 30500.
inline constexpr std::string_view kUpnpTestFirstPort = "upnp_test_first_port";
} // namespace config_key

// The value of key in the library configuration, or fallback when the file
// or the key is missing or the value is empty. A file that exists but cannot
// be read is logged and also gives fallback.
[[nodiscard]] std::string GetLibraryConfig(std::string_view key,
                                           std::string_view fallback);

} // namespace zark::portmap

#endif
