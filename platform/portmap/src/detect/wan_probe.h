// The third check of router detection: the WAN is reachable, told by a TCP
// connection to one of the outside hosts listed in the library
// configuration ("wan_probe_hosts"). All hosts are tried at once; the first
// completed connection answers, so one unreachable host costs nothing when
// another answers.
#ifndef ZARK_PORTMAP_WAN_PROBE_H
#define ZARK_PORTMAP_WAN_PROBE_H

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

// Used when the configuration names no host: public anycast resolvers,
// which accept TCP on port 443 from anywhere.
inline constexpr std::string_view kDefaultWanProbeHosts =
    "1.1.1.1:443,8.8.8.8:443,9.9.9.9:443";
// A host given without a port is probed on this one.
inline constexpr uint16_t kDefaultWanProbePort = 443;
// At most this many hosts are probed; the rest of the list is ignored.
inline constexpr std::size_t kMaxWanProbeHosts = 8;

struct Ipv4Endpoint {
  uint32_t address = 0; // host byte order
  uint16_t port = 0;
  friend bool operator==(const Ipv4Endpoint &, const Ipv4Endpoint &) = default;
};

// "1.2.3.4:443". Pure.
[[nodiscard]] std::string EndpointText(const Ipv4Endpoint &endpoint);

struct WanProbeHost {
  std::string host; // dotted quad or name
  uint16_t port = kDefaultWanProbePort;
  friend bool operator==(const WanProbeHost &, const WanProbeHost &) = default;
};

// Parses "host:port,host:port,...": blanks around items are ignored, a
// missing port means kDefaultWanProbePort. Items that do not parse (empty
// host, a port outside 1..65535, blanks inside) are logged and skipped;
// at most kMaxWanProbeHosts are kept. Pure apart from the log.
[[nodiscard]] std::vector<WanProbeHost>
ParseWanProbeHosts(std::string_view text);

struct ConnectOutcome {
  std::optional<Ipv4Endpoint> reached; // the first endpoint that connected
  // One line per endpoint that failed ("1.2.3.4:443 refused"), for the log.
  std::vector<std::string> failures;
};

// Opens TCP connections; the system one uses non-blocking sockets.
class TcpConnector {
public:
  virtual ~TcpConnector() = default;
  // Connects to every endpoint at once and answers the first that
  // completes within budget; every connection is closed before it returns.
  [[nodiscard]] virtual ConnectOutcome
  ConnectAny(std::span<const Ipv4Endpoint> endpoints,
             std::chrono::milliseconds budget) = 0;
};

[[nodiscard]] std::unique_ptr<TcpConnector> MakeSystemTcpConnector();

// Resolves a host name to IPv4 addresses within budget; empty when it
// cannot.
using NameResolver = std::function<std::vector<uint32_t>(
    std::string_view name, std::chrono::milliseconds budget)>;

struct WanCheck {
  bool ok = false;
  Ipv4Endpoint reached; // when ok: where the hop count is measured towards
  std::string why;
};

// Resolves names among hosts (literal addresses need no lookup; a name
// takes at most a third of budget), then connects to all within what is
// left of budget. Fails when no host is listed, none resolves, or none
// connects.
[[nodiscard]] WanCheck CheckWan(std::span<const WanProbeHost> hosts,
                                const NameResolver &resolve,
                                TcpConnector &connector,
                                std::chrono::milliseconds budget);

} // namespace zark::portmap

#endif
