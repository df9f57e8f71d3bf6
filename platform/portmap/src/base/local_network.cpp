#include "base/local_network.h"

#include "base/portmap_log.h"
#include "base/unique_fd.h"

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <cerrno>
#include <memory>

namespace zark::portmap {

std::optional<uint32_t> ParseIpv4(std::string_view text) {
  // inet_pton takes exactly four decimal parts without leading zeros or
  // blanks; copy first, the view need not be NUL-terminated.
  if (text.empty() || text.size() > 15) {
    return std::nullopt;
  }
  std::string copy(text);
  in_addr address{};
  if (inet_pton(AF_INET, copy.c_str(), &address) != 1) {
    return std::nullopt;
  }
  return ntohl(address.s_addr);
}

std::string FormatIpv4(uint32_t address) {
  in_addr raw{};
  raw.s_addr = htonl(address);
  char text[INET_ADDRSTRLEN] = {};
  inet_ntop(AF_INET, &raw, text, sizeof(text));
  return text;
}

std::optional<std::string> UrlHost(std::string_view url) {
  constexpr std::string_view kScheme = "http://";
  if (url.substr(0, kScheme.size()) != kScheme) {
    return std::nullopt;
  }
  std::string_view rest = url.substr(kScheme.size());
  if (!rest.empty() && rest.front() == '[') {
    return std::nullopt;
  }
  std::size_t slash = rest.find('/');
  if (slash == std::string_view::npos) {
    return std::nullopt;
  }
  std::size_t colon = rest.find(':');
  std::size_t end =
      (colon != std::string_view::npos && colon < slash) ? colon : slash;
  return std::string(rest.substr(0, end));
}

bool IsOnLocalNetwork(std::string_view host,
                      std::span<const Ipv4Network> networks,
                      std::optional<uint32_t> gateway) {
  std::optional<uint32_t> address = ParseIpv4(host);
  if (!address) {
    return false;
  }
  if (gateway && *address == *gateway) {
    return true;
  }
  for (const Ipv4Network &network : networks) {
    if (network.mask == 0) {
      continue;
    }
    if ((*address & network.mask) == (network.address & network.mask)) {
      return true;
    }
  }
  return false;
}

bool IsUrlOnLocalNetwork(std::string_view url,
                         std::span<const Ipv4Network> networks,
                         std::optional<uint32_t> gateway) {
  std::optional<std::string> host = UrlHost(url);
  return host && IsOnLocalNetwork(*host, networks, gateway);
}

std::vector<Ipv4Network> InterfaceNetworks() {
  std::vector<Ipv4Network> networks;
  ifaddrs *raw = nullptr;
  if (getifaddrs(&raw) != 0) {
    ZARK_PM_LOG_CALL("getifaddrs", -1, errno);
    return networks;
  }
  std::unique_ptr<ifaddrs, decltype(&freeifaddrs)> list(raw, &freeifaddrs);
  for (const ifaddrs *entry = list.get(); entry != nullptr;
       entry = entry->ifa_next) {
    if (entry->ifa_addr == nullptr || entry->ifa_netmask == nullptr ||
        entry->ifa_addr->sa_family != AF_INET) {
      continue;
    }
    if ((entry->ifa_flags & IFF_UP) == 0 ||
        (entry->ifa_flags & IFF_LOOPBACK) != 0) {
      continue;
    }
    const auto *address =
        reinterpret_cast<const sockaddr_in *>(entry->ifa_addr);
    const auto *mask =
        reinterpret_cast<const sockaddr_in *>(entry->ifa_netmask);
    networks.push_back(
        {ntohl(address->sin_addr.s_addr), ntohl(mask->sin_addr.s_addr)});
  }
  return networks;
}

std::optional<std::string> LocalAddressTowards(std::string_view destination) {
  std::optional<uint32_t> target = ParseIpv4(destination);
  if (!target) {
    ZARK_PM_LOG_ERROR("\"%.*s\" is not an IPv4 address",
                      static_cast<int>(destination.size()), destination.data());
    return std::nullopt;
  }
  UniqueFd fd(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  if (!fd.Valid()) {
    ZARK_PM_LOG_CALL("socket", -1, errno);
    return std::nullopt;
  }
  sockaddr_in remote{};
  remote.sin_family = AF_INET;
  // Any port will do: connect() on a UDP socket only picks the route.
  remote.sin_port = htons(9);
  remote.sin_addr.s_addr = htonl(*target);
  if (::connect(fd.Get(), reinterpret_cast<const sockaddr *>(&remote),
                sizeof(remote)) != 0) {
    std::string detail = "towards " + FormatIpv4(*target);
    ZARK_PM_LOG_CALL("connect", -1, errno, detail.c_str());
    return std::nullopt;
  }
  sockaddr_in local{};
  socklen_t length = sizeof(local);
  if (::getsockname(fd.Get(), reinterpret_cast<sockaddr *>(&local), &length) !=
      0) {
    ZARK_PM_LOG_CALL("getsockname", -1, errno);
    return std::nullopt;
  }
  return FormatIpv4(ntohl(local.sin_addr.s_addr));
}

} // namespace zark::portmap
