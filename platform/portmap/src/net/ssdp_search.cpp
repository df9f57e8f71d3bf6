#include "net/ssdp_search.h"

#include "base/detect_log.h"
#include "base/local_network.h"
#include "base/portmap_log.h"
#include "base/unique_fd.h"

#include "klibc_text.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cctype>
#include <cerrno>

namespace zark::portmap {
namespace {

using Clock = std::chrono::steady_clock;

constexpr std::size_t kMaxLocation = 512;
constexpr std::size_t kMaxDatagram = 2048;

bool Printable(std::string_view text) {
  return std::all_of(text.begin(), text.end(), [](char c) {
    return static_cast<unsigned char>(c) > 0x20 &&
           static_cast<unsigned char>(c) < 0x7F;
  });
}

bool SendTo(int fd, const std::string &request, const sockaddr_in &target) {
  const ssize_t sent =
      ::sendto(fd, request.data(), request.size(), 0,
               reinterpret_cast<const sockaddr *>(&target), sizeof(target));
  if (sent != static_cast<ssize_t>(request.size())) {
    char address[INET_ADDRSTRLEN] = {};
    ::inet_ntop(AF_INET, &target.sin_addr, address, sizeof(address));
    ZARK_PM_LOG_CALL("sendto", sent, errno,
                     (std::string("(SSDP search to ") + address + ")").c_str());
    return false;
  }
  return true;
}

} // namespace

std::string BuildMSearch(std::string_view searchTarget, int mxSeconds) {
  return "M-SEARCH * HTTP/1.1\r\n"
         "HOST: 239.255.255.250:1900\r\n"
         "MAN: \"ssdp:discover\"\r\n"
         "MX: " +
         std::to_string(std::clamp(mxSeconds, 1, 5)) +
         "\r\n"
         "ST: " +
         std::string(searchTarget) + "\r\n\r\n";
}

std::optional<SsdpReply> ParseSsdpReply(std::string_view datagram) {
  std::size_t newline = datagram.find('\n');
  std::string_view status =
      klibc::Trim(datagram.substr(0, newline), klibc::kSpaceTabAndCr);
  // "HTTP/1.1 200 OK" (some devices say HTTP/1.0).
  if (!status.starts_with("HTTP/1.") || status.size() < 12 ||
      (status.substr(8, 5) != " 200 " && status.substr(8) != " 200")) {
    return std::nullopt;
  }
  SsdpReply reply;
  while (newline != std::string_view::npos) {
    datagram.remove_prefix(newline + 1);
    newline = datagram.find('\n');
    std::string_view line =
        klibc::Trim(datagram.substr(0, newline), klibc::kSpaceTabAndCr);
    if (line.empty()) {
      break; // the end of the headers
    }
    const std::size_t colon = line.find(':');
    if (colon == std::string_view::npos) {
      continue;
    }
    std::string_view name =
        klibc::Trim(line.substr(0, colon), klibc::kSpaceTabAndCr);
    std::string_view value =
        klibc::Trim(line.substr(colon + 1), klibc::kSpaceTabAndCr);
    if (klibc::EqualsIgnoringCase(name, "LOCATION")) {
      reply.location = std::string(value);
    } else if (klibc::EqualsIgnoringCase(name, "ST")) {
      reply.searchTarget = std::string(value);
    } else if (klibc::EqualsIgnoringCase(name, "SERVER")) {
      reply.server = std::string(value.substr(0, 200));
    }
  }
  if (!reply.location.starts_with("http://") ||
      reply.location.size() > kMaxLocation || !Printable(reply.location)) {
    return std::nullopt;
  }
  return reply;
}

namespace {

// A UDP socket for the search, or an invalid one (logged).
UniqueFd OpenSearchSocket() {
  UniqueFd fd(::socket(AF_INET, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
  if (!fd.Valid()) {
    ZARK_PM_LOG_CALL("socket", -1, errno, "(SSDP search)");
    return fd;
  }
  // SSDP's own advice: multicast searches go no further than a couple of
  // routers.
  const int ttl = 2;
  (void)::setsockopt(fd.Get(), IPPROTO_IP, IP_MULTICAST_TTL, &ttl, sizeof(ttl));
  return fd;
}

// Where the searches go: the gateway itself, when known, then the SSDP
// group when options.multicast.
std::vector<sockaddr_in> SearchDestinations(const SsdpSearchOptions &options,
                                            std::optional<uint32_t> gateway) {
  std::vector<sockaddr_in> targets;
  if (gateway) {
    sockaddr_in direct{};
    direct.sin_family = AF_INET;
    direct.sin_port = htons(options.port);
    direct.sin_addr.s_addr = htonl(*gateway);
    targets.push_back(direct);
  }
  if (options.multicast) {
    sockaddr_in group{};
    group.sin_family = AF_INET;
    group.sin_port = htons(options.port);
    ::inet_pton(AF_INET, kSsdpMulticastGroup, &group.sin_addr);
    targets.push_back(group);
  }
  return targets;
}

// Sends every search target to every destination; true when one went out.
bool SendSearches(int fd, const std::vector<sockaddr_in> &destinations,
                  const std::vector<std::string> &searchTargets) {
  bool sentAny = false;
  for (const sockaddr_in &target : destinations) {
    for (const std::string &searchTarget : searchTargets) {
      sentAny = SendTo(fd, BuildMSearch(searchTarget, 1), target) || sentAny;
    }
  }
  return sentAny;
}

bool IsGatewayUrl(const std::string &url, std::optional<uint32_t> gateway) {
  std::optional<std::string> host = UrlHost(url);
  return gateway && host && ParseIpv4(*host) == gateway;
}

// The next datagram that came before deadline, or nothing when the
// deadline passed or the socket failed (logged).
std::optional<std::string> ReceiveDatagram(int fd, Clock::time_point deadline) {
  for (;;) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - Clock::now());
    if (left.count() <= 0) {
      return std::nullopt;
    }
    pollfd watched{fd, POLLIN, 0};
    const int ready = ::poll(&watched, 1, static_cast<int>(left.count()) + 1);
    if (ready < 0) {
      if (errno == EINTR) {
        continue;
      }
      ZARK_PM_LOG_CALL("poll", ready, errno, "(SSDP search)");
      return std::nullopt;
    }
    if (ready == 0) {
      continue;
    }
    char buffer[kMaxDatagram];
    const ssize_t got = ::recv(fd, buffer, sizeof(buffer), 0);
    if (got < 0) {
      if (errno == EAGAIN || errno == EINTR) {
        continue;
      }
      ZARK_PM_LOG_CALL("recv", got, errno, "(SSDP search)");
      return std::nullopt;
    }
    return std::string(buffer, static_cast<std::size_t>(got));
  }
}

// The locations of the devices that answer before deadline, each once;
// stops early at the gateway's own answer.
std::vector<std::string> CollectLocations(int fd, Clock::time_point deadline,
                                          std::optional<uint32_t> gateway) {
  std::vector<std::string> found;
  while (std::optional<std::string> datagram = ReceiveDatagram(fd, deadline)) {
    std::optional<SsdpReply> reply = ParseSsdpReply(*datagram);
    if (!reply) {
      continue;
    }
    if (std::find(found.begin(), found.end(), reply->location) == found.end() &&
        found.size() < kMaxSsdpDevices) {
      ZARK_DETECT_INFO("SSDP: %s answered %s (%s)", reply->location.c_str(),
                       reply->searchTarget.c_str(), reply->server.c_str());
      found.push_back(reply->location);
    }
    if (IsGatewayUrl(reply->location, gateway)) {
      break;
    }
  }
  return found;
}

} // namespace

std::vector<std::string> SearchIgds(const SsdpSearchOptions &options) {
  const std::optional<uint32_t> gateway = ParseIpv4(options.gateway);
  UniqueFd fd = OpenSearchSocket();
  if (!fd.Valid() ||
      !SendSearches(fd.Get(), SearchDestinations(options, gateway),
                    options.searchTargets)) {
    return {};
  }
  std::vector<std::string> found =
      CollectLocations(fd.Get(), Clock::now() + options.wait, gateway);
  std::stable_partition(
      found.begin(), found.end(),
      [&](const std::string &url) { return IsGatewayUrl(url, gateway); });
  return found;
}

} // namespace zark::portmap
