#include "detect/wan_probe.h"

#include "base/local_network.h"
#include "base/portmap_log.h"
#include "base/unique_fd.h"

#include "klibc_text.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstring>

namespace zark::portmap {
namespace {

using Clock = std::chrono::steady_clock;

std::string ErrnoText(int error) {
  char buffer[128];
  // The GNU strerror_r returns the text, which may or may not be in buffer.
  return strerror_r(error, buffer, sizeof(buffer));
}

// One connection under way.
struct Attempt {
  Ipv4Endpoint endpoint;
  UniqueFd fd;
  bool pending = false;
};

enum class Started { kConnected, kPending, kFailed };

// Opens a non-blocking socket in attempt.fd and starts connecting it to
// attempt.endpoint; a failure is added to outcome.
Started StartConnect(Attempt &attempt, ConnectOutcome &outcome) {
  const Ipv4Endpoint &endpoint = attempt.endpoint;
  attempt.fd = UniqueFd(
      ::socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
  if (!attempt.fd.Valid()) {
    const int saved = errno;
    ZARK_PM_LOG_CALL("socket", -1, saved);
    outcome.failures.push_back(EndpointText(endpoint) + " " + ErrnoText(saved));
    return Started::kFailed;
  }
  sockaddr_in target{};
  target.sin_family = AF_INET;
  target.sin_port = htons(endpoint.port);
  target.sin_addr.s_addr = htonl(endpoint.address);
  if (::connect(attempt.fd.Get(), reinterpret_cast<sockaddr *>(&target),
                sizeof(target)) == 0) {
    return Started::kConnected;
  }
  if (errno != EINPROGRESS) {
    outcome.failures.push_back(EndpointText(endpoint) + " " + ErrnoText(errno));
    return Started::kFailed;
  }
  attempt.pending = true;
  return Started::kPending;
}

// The attempt's socket became writable: true when it connected; otherwise
// its error is added to outcome.
bool FinishConnect(Attempt &attempt, ConnectOutcome &outcome) {
  attempt.pending = false;
  int error = 0;
  socklen_t length = sizeof(error);
  if (::getsockopt(attempt.fd.Get(), SOL_SOCKET, SO_ERROR, &error, &length) !=
      0) {
    error = errno;
  }
  if (error == 0) {
    return true;
  }
  outcome.failures.push_back(EndpointText(attempt.endpoint) + " " +
                             ErrnoText(error));
  return false;
}

// Waits until deadline for the first pending attempt to connect and sets
// outcome.reached to it; every attempt that fails or is still pending at
// the deadline is added to outcome.failures.
void AwaitFirstConnect(std::vector<Attempt> &attempts,
                       Clock::time_point deadline,
                       std::chrono::milliseconds budget,
                       ConnectOutcome &outcome) {
  for (;;) {
    std::vector<pollfd> watched;
    std::vector<Attempt *> owners;
    for (Attempt &attempt : attempts) {
      if (attempt.pending) {
        watched.push_back({attempt.fd.Get(), POLLOUT, 0});
        owners.push_back(&attempt);
      }
    }
    if (watched.empty()) {
      return;
    }
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - Clock::now());
    if (left.count() <= 0) {
      for (const Attempt *attempt : owners) {
        outcome.failures.push_back(EndpointText(attempt->endpoint) +
                                   " no answer within " +
                                   std::to_string(budget.count()) + " ms");
      }
      return;
    }
    const int ready = ::poll(watched.data(), watched.size(),
                             static_cast<int>(left.count()) + 1);
    if (ready < 0) {
      if (errno == EINTR) {
        continue;
      }
      ZARK_PM_LOG_CALL("poll", ready, errno, "(WAN probe)");
      outcome.failures.push_back("poll failed");
      return;
    }
    for (std::size_t i = 0; i < watched.size(); ++i) {
      if (watched[i].revents != 0 && FinishConnect(*owners[i], outcome)) {
        outcome.reached = owners[i]->endpoint;
        return;
      }
    }
  }
}

class SystemTcpConnector final : public TcpConnector {
public:
  ConnectOutcome ConnectAny(std::span<const Ipv4Endpoint> endpoints,
                            std::chrono::milliseconds budget) override {
    ConnectOutcome outcome;
    const Clock::time_point deadline = Clock::now() + budget;
    std::vector<Attempt> attempts;
    for (const Ipv4Endpoint &endpoint : endpoints) {
      Attempt attempt{endpoint, UniqueFd(), false};
      switch (StartConnect(attempt, outcome)) {
      case Started::kConnected:
        outcome.reached = endpoint;
        return outcome;
      case Started::kPending:
        attempts.push_back(std::move(attempt));
        break;
      case Started::kFailed:
        break;
      }
    }
    AwaitFirstConnect(attempts, deadline, budget, outcome);
    return outcome;
  }
};

} // namespace

std::unique_ptr<TcpConnector> MakeSystemTcpConnector() {
  return std::make_unique<SystemTcpConnector>();
}

std::string EndpointText(const Ipv4Endpoint &endpoint) {
  return FormatIpv4(endpoint.address) + ":" + std::to_string(endpoint.port);
}

std::vector<WanProbeHost> ParseWanProbeHosts(std::string_view text) {
  std::vector<WanProbeHost> hosts;
  while (!text.empty()) {
    const std::size_t comma = text.find(',');
    std::string_view item =
        klibc::Trim(text.substr(0, comma), klibc::kSpaceAndTab);
    text.remove_prefix(comma == std::string_view::npos ? text.size()
                                                       : comma + 1);
    if (item.empty()) {
      continue;
    }
    WanProbeHost host;
    std::string_view name = item;
    const std::size_t colon = item.rfind(':');
    bool ok = true;
    if (colon != std::string_view::npos) {
      name = item.substr(0, colon);
      std::string_view portText = item.substr(colon + 1);
      unsigned port = 0;
      auto [end, ec] = std::from_chars(portText.data(),
                                       portText.data() + portText.size(), port);
      ok = ec == std::errc() && end == portText.data() + portText.size() &&
           port >= 1 && port <= 65535;
      host.port = static_cast<uint16_t>(port);
    }
    if (ok) {
      ok = !name.empty() &&
           name.find_first_of(" \t:/[]") == std::string_view::npos &&
           std::none_of(name.begin(), name.end(), [](char c) {
             return static_cast<unsigned char>(c) < 0x21 ||
                    static_cast<unsigned char>(c) > 0x7E;
           });
    }
    if (!ok) {
      ZARK_PM_LOG_ERROR("wan_probe_hosts: \"%.*s\" is not host[:port]; "
                        "skipped",
                        static_cast<int>(item.size()), item.data());
      continue;
    }
    if (hosts.size() == kMaxWanProbeHosts) {
      ZARK_PM_LOG_ERROR("wan_probe_hosts: more than %zu hosts; the rest is "
                        "ignored",
                        kMaxWanProbeHosts);
      break;
    }
    host.host = std::string(name);
    hosts.push_back(std::move(host));
  }
  return hosts;
}

WanCheck CheckWan(std::span<const WanProbeHost> hosts,
                  const NameResolver &resolve, TcpConnector &connector,
                  std::chrono::milliseconds budget) {
  WanCheck check;
  if (hosts.empty()) {
    check.why = "no WAN probe host is configured";
    return check;
  }
  const Clock::time_point start = Clock::now();
  std::vector<Ipv4Endpoint> endpoints;
  std::vector<std::string> unresolved;
  for (const WanProbeHost &host : hosts) {
    if (std::optional<uint32_t> address = ParseIpv4(host.host)) {
      endpoints.push_back({*address, host.port});
      continue;
    }
    std::vector<uint32_t> addresses =
        resolve ? resolve(host.host, budget / 3) : std::vector<uint32_t>{};
    if (addresses.empty()) {
      unresolved.push_back(host.host);
      continue;
    }
    // One address per name is enough to tell whether the WAN answers.
    endpoints.push_back({addresses.front(), host.port});
  }
  if (endpoints.empty()) {
    check.why = "no WAN probe host could be resolved";
    return check;
  }
  const auto used = std::chrono::duration_cast<std::chrono::milliseconds>(
      Clock::now() - start);
  const std::chrono::milliseconds left =
      std::max(budget - used, std::chrono::milliseconds(budget / 3));
  ConnectOutcome outcome = connector.ConnectAny(endpoints, left);
  std::string failures;
  for (const std::string &failure : outcome.failures) {
    failures += (failures.empty() ? "" : ", ") + failure;
  }
  for (const std::string &name : unresolved) {
    failures += (failures.empty() ? "" : ", ") + name + " not resolved";
  }
  if (!outcome.reached) {
    check.why = "no WAN probe host answered: " + failures;
    return check;
  }
  check.ok = true;
  check.reached = *outcome.reached;
  check.why = "connected to " + EndpointText(*outcome.reached);
  if (!failures.empty()) {
    check.why += " (" + failures + ")";
  }
  return check;
}

} // namespace zark::portmap
