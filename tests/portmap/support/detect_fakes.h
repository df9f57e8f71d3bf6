// Recording stand-ins for every outside dependency of router detection
// (DetectEnvironment), and a scene that starts as a healthy home network:
// eth0 192.168.1.10/24, default route via 192.168.1.1, the WAN host
// 1.1.1.1:443 answering, one private hop then 203.0.113.1, a name server
// that answers, and a router that speaks UPnP and NAT-PMP with the outside
// address 198.51.100.7. Tests change what they look at.
#ifndef ZARK_TESTS_DETECT_DETECT_FAKES_H
#define ZARK_TESTS_DETECT_DETECT_FAKES_H

#include "detect/detect_router.h"

#include <chrono>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

namespace zark::test {

// One line of /proc/net/route, as the kernel prints it.
std::string RouteLine(const std::string &interface, const std::string &gateway,
                      unsigned metric, bool defaultRoute = true);
// A whole table: the title line, then lines.
std::string RouteTable(const std::vector<std::string> &lines);

uint32_t Ip(const std::string &dotted); // host byte order

class FakeNetworkInfo final : public zark::portmap::NetworkInfoSource {
public:
  std::optional<std::string> RouteTable() override { return routeTable; }
  std::optional<std::vector<zark::portmap::InterfaceInfo>>
  Interfaces() override {
    return interfaces;
  }
  std::optional<std::string> routeTable;
  std::optional<std::vector<zark::portmap::InterfaceInfo>> interfaces;
};

class FakeConnector final : public zark::portmap::TcpConnector {
public:
  zark::portmap::ConnectOutcome
  ConnectAny(std::span<const zark::portmap::Ipv4Endpoint> endpoints,
             std::chrono::milliseconds budget) override;
  // Endpoints that connect; any other fails with "refused".
  std::vector<zark::portmap::Ipv4Endpoint> answering;
  std::vector<std::vector<zark::portmap::Ipv4Endpoint>> calls;
  std::vector<std::chrono::milliseconds> budgets;
};

class FakeHopProber final : public zark::portmap::HopProber {
public:
  std::vector<zark::portmap::HopReply>
  Probe(uint32_t destination, const zark::portmap::HopLimits &limits) override {
    destinations.push_back(destination);
    maxTtls.push_back(limits.maxTtl);
    return replies;
  }
  std::vector<zark::portmap::HopReply> replies;
  std::vector<uint32_t> destinations;
  std::vector<int> maxTtls;
};

class FakeDnsClient final : public zark::portmap::DnsClient {
public:
  struct Call {
    std::vector<std::string> servers;
    std::string name;
  };
  zark::portmap::DnsLookup Lookup(std::span<const std::string> servers,
                                  std::string_view name,
                                  std::chrono::milliseconds budget) override;
  // Names that resolve, to one address each; others: no such name.
  std::vector<std::pair<std::string, uint32_t>> names;
  std::vector<Call> calls;
};

class FakeRouterProbes final : public zark::portmap::RouterProbes {
public:
  zark::portmap::UpnpFinding ProbeUpnp(const std::string &gateway) override;
  zark::portmap::NatPmpFinding ProbeNatPmp(const std::string &gateway) override;
  zark::portmap::UpnpFinding upnp;
  zark::portmap::NatPmpFinding natpmp;
  // Gateways asked; read after the probe has returned (they run on two
  // threads).
  std::vector<std::string> upnpAsked;
  std::vector<std::string> natpmpAsked;

private:
  std::mutex mMutex;
};

// The fakes of one test, reachable after the environment took ownership.
struct Scene {
  FakeNetworkInfo *network = nullptr;
  FakeConnector *connector = nullptr;
  FakeHopProber *hops = nullptr;
  FakeDnsClient *dns = nullptr;
  FakeRouterProbes *router = nullptr;
  std::vector<std::pair<std::string, std::string>> config; // key, value
  std::optional<std::string> resolvConf =
      std::string("nameserver 192.168.1.1\n");
  int32_t maxRules = 64;
  std::vector<zark::portmap::RouterName> maxRulesAsked;
  std::string userSettingName;
  std::vector<std::string> userSettingAsked;
  // The fake clock: every reading advances it by tick.
  std::chrono::steady_clock::time_point clock{};
  std::chrono::milliseconds tick{5};
};

// An environment over fresh fakes in their healthy state; scene must
// outlive it.
zark::portmap::DetectEnvironment MakeFakeEnvironment(Scene &scene);

} // namespace zark::test

#endif
