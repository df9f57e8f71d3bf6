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

bool SameTextIgnoringCase(std::string_view a, std::string_view b) {
  return a.size() == b.size() &&
         std::equal(a.begin(), a.end(), b.begin(), [](char x, char y) {
           return std::tolower(static_cast<unsigned char>(x)) ==
                  std::tolower(static_cast<unsigned char>(y));
         });
}

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
    if (SameTextIgnoringCase(name, "LOCATION")) {
      reply.location = std::string(value);
    } else if (SameTextIgnoringCase(name, "ST")) {
      reply.searchTarget = std::string(value);
    } else if (SameTextIgnoringCase(name, "SERVER")) {
      reply.server = std::string(value.substr(0, 200));
    }
  }
  if (!reply.location.starts_with("http://") ||
      reply.location.size() > kMaxLocation || !Printable(reply.location)) {
    return std::nullopt;
  }
  return reply;
}

std::vector<std::string> SearchIgds(const SsdpSearchOptions &options) {
  std::vector<std::string> found;
  const std::optional<uint32_t> gateway = ParseIpv4(options.gateway);
  UniqueFd fd(::socket(AF_INET, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
  if (!fd.Valid()) {
    ZARK_PM_LOG_CALL("socket", -1, errno, "(SSDP search)");
    return found;
  }
  // SSDP's own advice: multicast searches go no further than a couple of
  // routers.
  const int ttl = 2;
  (void)::setsockopt(fd.Get(), IPPROTO_IP, IP_MULTICAST_TTL, &ttl, sizeof(ttl));

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
  bool sentAny = false;
  for (const sockaddr_in &target : targets) {
    for (const std::string &searchTarget : options.searchTargets) {
      sentAny =
          SendTo(fd.Get(), BuildMSearch(searchTarget, 1), target) || sentAny;
    }
  }
  if (!sentAny) {
    return found;
  }

  auto isGateways = [&](const std::string &url) {
    std::optional<std::string> host = UrlHost(url);
    return gateway && host && ParseIpv4(*host) == gateway;
  };
  const Clock::time_point deadline = Clock::now() + options.wait;
  for (;;) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - Clock::now());
    if (left.count() <= 0) {
      break;
    }
    pollfd watched{fd.Get(), POLLIN, 0};
    const int ready = ::poll(&watched, 1, static_cast<int>(left.count()) + 1);
    if (ready < 0) {
      if (errno == EINTR) {
        continue;
      }
      ZARK_PM_LOG_CALL("poll", ready, errno, "(SSDP search)");
      break;
    }
    if (ready == 0) {
      continue;
    }
    char buffer[kMaxDatagram];
    const ssize_t got = ::recv(fd.Get(), buffer, sizeof(buffer), 0);
    if (got < 0) {
      if (errno == EAGAIN || errno == EINTR) {
        continue;
      }
      ZARK_PM_LOG_CALL("recv", got, errno, "(SSDP search)");
      break;
    }
    std::optional<SsdpReply> reply =
        ParseSsdpReply(std::string_view(buffer, static_cast<std::size_t>(got)));
    if (!reply) {
      continue;
    }
    if (std::find(found.begin(), found.end(), reply->location) == found.end() &&
        found.size() < kMaxSsdpDevices) {
      ZARK_DETECT_INFO("SSDP: %s answered %s (%s)", reply->location.c_str(),
                       reply->searchTarget.c_str(), reply->server.c_str());
      found.push_back(reply->location);
    }
    if (isGateways(reply->location)) {
      break;
    }
  }
  std::stable_partition(found.begin(), found.end(), isGateways);
  return found;
}

} // namespace zark::portmap
