// Finding UPnP Internet Gateway Devices fast: an SSDP M-SEARCH (UPnP Device
// Architecture 1.1, section 1.3.2) sent straight to the default gateway
// and to the SSDP multicast group at once. The gateway is the router we
// want, and it answers a unicast search within tens of milliseconds, so
// the search ends as soon as it has answered; other devices' answers are
// only waited for when the gateway stays silent, and never longer than the
// wait given.
#ifndef ZARK_PORTMAP_SSDP_SEARCH_H
#define ZARK_PORTMAP_SSDP_SEARCH_H

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

inline constexpr uint16_t kSsdpPort = 1900;
inline constexpr const char *kSsdpMulticastGroup = "239.255.255.250";
inline constexpr const char *kIgdSearchTargetV1 =
    "urn:schemas-upnp-org:device:InternetGatewayDevice:1";
inline constexpr const char *kIgdSearchTargetV2 =
    "urn:schemas-upnp-org:device:InternetGatewayDevice:2";
// At most this many distinct devices are returned.
inline constexpr std::size_t kMaxSsdpDevices = 8;

// The M-SEARCH request for searchTarget, asking for an answer within
// mxSeconds (1..5). Pure.
[[nodiscard]] std::string BuildMSearch(std::string_view searchTarget,
                                       int mxSeconds);

struct SsdpReply {
  std::string location;     // the root description URL
  std::string searchTarget; // ST
  std::string server;       // SERVER, for the log
};

// Reads an answer to an M-SEARCH:
//
//   HTTP/1.1 200 OK
//   CACHE-CONTROL: max-age=120
//   ST: urn:schemas-upnp-org:device:InternetGatewayDevice:1
//   USN: uuid:...::urn:schemas-upnp-org:device:InternetGatewayDevice:1
//   SERVER: Debian/12 UPnP/1.1 MiniUPnPd/2.3.1
//   LOCATION: http://192.168.1.1:5000/rootDesc.xml
//
// Header names in any case, lines ending in CRLF or LF. Nothing unless the
// status is 200 and LOCATION is an "http://" URL of printable characters
// (at most 512). Pure.
[[nodiscard]] std::optional<SsdpReply>
ParseSsdpReply(std::string_view datagram);

struct SsdpSearchOptions {
  std::string gateway;       // dotted quad; asked directly
  uint16_t port = kSsdpPort; // tests use another
  bool multicast = true;     // also ask the multicast group
  std::chrono::milliseconds wait{300};
  std::vector<std::string> searchTargets{kIgdSearchTargetV1,
                                         kIgdSearchTargetV2};
};

// Searches and returns the distinct root description URLs heard, the
// gateway's first (a URL whose host is the gateway). Returns as soon as the
// gateway answered, otherwise after options.wait. Empty when nothing
// answered or nothing could be sent (logged).
[[nodiscard]] std::vector<std::string>
SearchIgds(const SsdpSearchOptions &options);

} // namespace zark::portmap

#endif
