#include "detect/interface_probe.h"

#include "base/conf_file.h"
#include "base/portmap_log.h"

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <netinet/in.h>

#include <algorithm>
#include <cerrno>

namespace zark::portmap {
namespace {

const InterfaceInfo *FindInterface(const std::vector<InterfaceInfo> &interfaces,
                                   std::string_view name) {
  auto found = std::find_if(
      interfaces.begin(), interfaces.end(),
      [&](const InterfaceInfo &candidate) { return candidate.name == name; });
  return found == interfaces.end() ? nullptr : &*found;
}

bool Usable(const InterfaceInfo &info) {
  return info.up && info.running && !info.addresses.empty();
}

int PrefixLength(uint32_t mask) {
  int length = 0;
  while (length < 32 && (mask & (uint32_t{1} << (31 - length))) != 0) {
    ++length;
  }
  return length;
}

std::string NetworkText(const Ipv4Network &network) {
  return FormatIpv4(network.address) + "/" +
         std::to_string(PrefixLength(network.mask));
}

class SystemNetworkInfo final : public NetworkInfoSource {
public:
  std::optional<std::string> RouteTable() override {
    ReadResult read = ReadSmallFile(kRouteTablePath, kMaxRouteTableBytes);
    if (read.status != ReadStatus::kRead) {
      ZARK_PM_LOG_ERROR("cannot read %s: no routes to look at",
                        kRouteTablePath);
      return std::nullopt;
    }
    return std::move(read.content);
  }

  std::optional<std::vector<InterfaceInfo>> Interfaces() override {
    ifaddrs *raw = nullptr;
    if (::getifaddrs(&raw) != 0) {
      ZARK_PM_LOG_CALL("getifaddrs", -1, errno);
      return std::nullopt;
    }
    std::unique_ptr<ifaddrs, decltype(&::freeifaddrs)> list(raw,
                                                            &::freeifaddrs);
    std::vector<InterfaceInfo> interfaces;
    for (const ifaddrs *entry = list.get(); entry != nullptr;
         entry = entry->ifa_next) {
      if (entry->ifa_name == nullptr) {
        continue;
      }
      std::string name(entry->ifa_name);
      auto found = std::find_if(
          interfaces.begin(), interfaces.end(),
          [&](const InterfaceInfo &info) { return info.name == name; });
      if (found == interfaces.end()) {
        InterfaceInfo info;
        info.name = name;
        interfaces.push_back(std::move(info));
        found = interfaces.end() - 1;
      }
      // Every entry of an interface carries its flags.
      found->up = (entry->ifa_flags & IFF_UP) != 0;
      found->running = (entry->ifa_flags & IFF_RUNNING) != 0;
      found->loopback = (entry->ifa_flags & IFF_LOOPBACK) != 0;
      if (entry->ifa_addr != nullptr && entry->ifa_addr->sa_family == AF_INET &&
          entry->ifa_netmask != nullptr) {
        const auto *address =
            reinterpret_cast<const sockaddr_in *>(entry->ifa_addr);
        const auto *mask =
            reinterpret_cast<const sockaddr_in *>(entry->ifa_netmask);
        found->addresses.push_back(
            {ntohl(address->sin_addr.s_addr), ntohl(mask->sin_addr.s_addr)});
      }
    }
    return interfaces;
  }
};

} // namespace

std::unique_ptr<NetworkInfoSource> MakeSystemNetworkInfo() {
  return std::make_unique<SystemNetworkInfo>();
}

InterfaceCheck CheckInterface(const std::vector<DefaultRoute> &routes,
                              const std::vector<InterfaceInfo> &interfaces) {
  InterfaceCheck check;
  if (routes.empty()) {
    for (const InterfaceInfo &info : interfaces) {
      if (!info.loopback && Usable(info)) {
        check.ok = true;
        check.interface = info.name;
        check.address = info.addresses.front();
        check.why = "no default route; interface " + info.name + " (" +
                    NetworkText(check.address) + ") is up";
        return check;
      }
    }
    check.why = "no default route and no interface is up with an IPv4 "
                "address";
    return check;
  }
  const DefaultRoute &route = routes.front();
  check.interface = route.interface;
  const InterfaceInfo *info = FindInterface(interfaces, route.interface);
  if (info == nullptr) {
    check.why =
        "the default route's interface " + route.interface + " does not exist";
    return check;
  }
  if (!info->up) {
    check.why = "interface " + info->name + " is down";
    return check;
  }
  if (!info->running) {
    check.why = "interface " + info->name + " has no link";
    return check;
  }
  if (info->addresses.empty()) {
    check.why = "interface " + info->name + " has no IPv4 address";
    return check;
  }
  check.ok = true;
  check.address = info->addresses.front();
  check.why =
      "interface " + info->name + " is up with " + NetworkText(check.address);
  return check;
}

GatewayCheck CheckGateway(const std::vector<DefaultRoute> &routes,
                          const std::vector<InterfaceInfo> &interfaces) {
  GatewayCheck check;
  if (routes.empty()) {
    check.why = "no default gateway is set";
    return check;
  }
  const DefaultRoute &route = routes.front();
  check.ok = true;
  check.gateway = route.gateway;
  check.why =
      "default gateway " + FormatIpv4(route.gateway) + " on " + route.interface;

  std::vector<std::string> concerns;
  const InterfaceInfo *info = FindInterface(interfaces, route.interface);
  if (info != nullptr && !info->addresses.empty()) {
    bool onSubnet = false;
    for (const Ipv4Network &network : info->addresses) {
      if (network.address == route.gateway) {
        concerns.push_back("it is the interface's own address");
      }
      // A /31 or /32 address reaches its gateway through an on-link route
      // of its own (point-to-point links, some hosting providers): only a
      // real subnet can be checked.
      if (PrefixLength(network.mask) >= 31 ||
          (network.address & network.mask) == (route.gateway & network.mask)) {
        onSubnet = true;
      }
    }
    if (!onSubnet) {
      std::string subnets;
      for (const Ipv4Network &network : info->addresses) {
        const Ipv4Network subnet{network.address & network.mask, network.mask};
        subnets += (subnets.empty() ? "" : ", ") + NetworkText(subnet);
      }
      concerns.push_back("it is outside the interface's subnet (" + subnets +
                         ")");
    }
  }
  for (std::size_t i = 1; i < routes.size(); ++i) {
    if (routes[i].gateway != route.gateway ||
        routes[i].interface != route.interface) {
      concerns.push_back(std::to_string(routes.size()) +
                         " default routes lead to different gateways (also " +
                         FormatIpv4(routes[i].gateway) + " on " +
                         routes[i].interface + ")");
      break;
    }
  }
  if (!concerns.empty()) {
    check.warning = true;
    for (const std::string &concern : concerns) {
      check.why += "; " + concern;
    }
  }
  return check;
}

} // namespace zark::portmap
