// The library's side of the probe service (probe/README.md): an outside host
// that connects back to us on a port and tells whether it answered. Its
// address is the library configuration's "probe_service_address"
// ("host:port", "[v6]:port").
//
// One request per TCP connection:
//   -> "check tcp 8080 4f1c0d2a9b7e4d11\n"
//   <- {"result":"reachable","reason":"token","protocol":"tcp","port":8080}
//   -> "address\n"
//   <- {"result":"address","address":"203.0.113.5"}
//
// Every wait is bounded (ProbeClientOptions), and may be cut short by a
// cancellation check polled every 100 ms.
#ifndef ZARK_PORTMAP_PROBE_CLIENT_H
#define ZARK_PORTMAP_PROBE_CLIENT_H

#include "base/port_mapping.h"

#include <sys/socket.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace zark::portmap {

struct ProbeEndpoint {
  std::string host; // a name, an IPv4 or an IPv6 address (without brackets)
  uint16_t port = 0;
  friend bool operator==(const ProbeEndpoint &,
                         const ProbeEndpoint &) = default;
};

// "host:port" or "[v6]:port", port 1..65535. Nothing for anything else
// (blanks, no port, an empty host). Pure.
[[nodiscard]] std::optional<ProbeEndpoint>
ParseProbeServiceAddress(std::string_view text);

enum class ProbeStatus {
  kReachable,          // the service reached the port (and read the token)
  kUnreachable,        // it did not: refused, silent, someone else answered
  kUnknown,            // it cannot tell (UDP without a token, no reply)
  kAddress,            // the answer to AskAddress
  kRateLimited,        // the service refused: too many requests from us
  kRefused,            // the service refused the request (bad-request, busy)
  kServiceUnavailable, // no answer from the service within the bounds
  kBadAnswer,          // an answer that is not the protocol's
  kCancelled,          // the cancellation check said stop
};

[[nodiscard]] const char *ProbeStatusName(ProbeStatus status);

struct ProbeAnswer {
  ProbeStatus status = ProbeStatus::kServiceUnavailable;
  // The service's reason word ("refused", "token", "rate-limited" ...), or
  // for the statuses the client decides on itself, why.
  std::string reason;
  std::string address;   // kAddress
  int retryAfterMs = -1; // kRateLimited, when the service said
};

// Parses one answer line of the probe service (without its "\n"). Nothing
// when the line is not one of the protocol's answers. Pure; never throws.
[[nodiscard]] std::optional<ProbeAnswer>
ParseProbeAnswer(std::string_view line) noexcept;

// The request line of a check ("check udp 5353\n" without a token). The
// token must be 1..64 characters of [A-Za-z0-9_-] or empty.
[[nodiscard]] std::string ProbeCheckRequest(IpProtocol protocol, uint16_t port,
                                            std::string_view token);

// What the port tests ask of an outside vantage point; the seam that lets
// unit tests put a fake or a service on loopback in its place.
class OutsideProbe {
public:
  OutsideProbe() = default;
  OutsideProbe(const OutsideProbe &) = delete;
  OutsideProbe &operator=(const OutsideProbe &) = delete;
  virtual ~OutsideProbe() = default;

  // Asks whether port answers from outside, with the token a listener of
  // ours writes there (empty: a service of the server listens; any answer
  // counts). Safe to call from several threads at once.
  [[nodiscard]] virtual ProbeAnswer Check(IpProtocol protocol, uint16_t port,
                                          std::string_view token) = 0;
};

struct ProbeClientOptions {
  std::chrono::milliseconds connectTimeout{3000};
  // From the request to the answer: the service's own bounds (3 s to
  // connect back, 2 s for the token) and some slack.
  std::chrono::milliseconds answerTimeout{10000};
  // A "rate-limited" answer is retried after the wait the service names
  // (at most maxRetryWait), this many times.
  int rateLimitRetries = 3;
  std::chrono::milliseconds maxRetryWait{5000};
  // Polled every 100 ms during every wait; true ends the call with
  // kCancelled. May be empty.
  std::function<bool()> cancelled;
};

class ProbeClient final : public OutsideProbe {
public:
  // Resolves endpoint.host (getaddrinfo, the system resolver's bounds)
  // once, here. Usable() says whether that worked.
  explicit ProbeClient(ProbeEndpoint endpoint, ProbeClientOptions options = {});

  [[nodiscard]] bool Usable() const { return mResolved; }
  [[nodiscard]] const ProbeEndpoint &Endpoint() const { return mEndpoint; }

  [[nodiscard]] ProbeAnswer Check(IpProtocol protocol, uint16_t port,
                                  std::string_view token) override;
  // Our address as the service sees it (the outside address behind a NAT
  // router): status kAddress with address set.
  [[nodiscard]] ProbeAnswer AskAddress();

private:
  [[nodiscard]] ProbeAnswer Exchange(const std::string &line);
  [[nodiscard]] ProbeAnswer ExchangeOnce(const std::string &line);
  [[nodiscard]] bool Cancelled() const;

  ProbeEndpoint mEndpoint;
  ProbeClientOptions mOptions;
  bool mResolved = false;
  sockaddr_storage mAddress{};
  socklen_t mAddressLength = 0;
};

// The probe service of the library configuration. Null, with why set ("no
// probe service configured", "probe service address ... is not host:port",
// "cannot resolve ..."), when there is none to use.
[[nodiscard]] std::unique_ptr<ProbeClient>
ConfiguredProbeClient(std::string &why, ProbeClientOptions options = {});

// Our outside address as the probe service at serviceAddress ("host:port")
// sees it, in host byte order; nothing (logged) when the address does not
// parse, the service does not answer, or it sees us over IPv6. Router
// detection's external address falls back on it (external_address.h).
[[nodiscard]] std::optional<uint32_t>
ExternalAddressFromProbeService(const std::string &serviceAddress);

// The text reported for a rule or a test step when the probe service is not
// configured.
inline constexpr const char *kNoProbeServiceText =
    "no probe service configured";

} // namespace zark::portmap

#endif
