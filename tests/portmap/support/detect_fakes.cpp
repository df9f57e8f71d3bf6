#include "detect_fakes.h"

#include <arpa/inet.h>

#include <algorithm>
#include <cstdio>

namespace zark::test {

using namespace zark::portmap;

uint32_t Ip(const std::string &dotted) {
  in_addr address{};
  ::inet_pton(AF_INET, dotted.c_str(), &address);
  return ntohl(address.s_addr);
}

std::string RouteLine(const std::string &interface, const std::string &gateway,
                      unsigned metric, bool defaultRoute) {
  in_addr address{};
  ::inet_pton(AF_INET, gateway.c_str(), &address);
  char line[256];
  // The kernel prints the raw 32-bit values of network-order addresses.
  std::snprintf(line, sizeof(line),
                "%s\t%08X\t%08X\t0003\t0\t0\t%u\t%08X\t0\t0\t0",
                interface.c_str(), defaultRoute ? 0u : 0x0001A8C0u,
                address.s_addr, metric, defaultRoute ? 0u : 0x00FFFFFFu);
  return line;
}

std::string RouteTable(const std::vector<std::string> &lines) {
  std::string table = "Iface\tDestination\tGateway \tFlags\tRefCnt\tUse\t"
                      "Metric\tMask\t\tMTU\tWindow\tIRTT\n";
  for (const std::string &line : lines) {
    table += line + "\n";
  }
  return table;
}

ConnectOutcome
FakeConnector::ConnectAny(std::span<const Ipv4Endpoint> endpoints,
                          std::chrono::milliseconds budget) {
  calls.emplace_back(endpoints.begin(), endpoints.end());
  budgets.push_back(budget);
  ConnectOutcome outcome;
  for (const Ipv4Endpoint &endpoint : endpoints) {
    if (std::find(answering.begin(), answering.end(), endpoint) !=
        answering.end()) {
      outcome.reached = endpoint;
      return outcome;
    }
    outcome.failures.push_back(EndpointText(endpoint) + " refused");
  }
  return outcome;
}

DnsLookup FakeDnsClient::Lookup(std::span<const std::string> servers,
                                std::string_view name,
                                std::chrono::milliseconds) {
  calls.push_back({{servers.begin(), servers.end()}, std::string(name)});
  DnsLookup lookup;
  if (servers.empty()) {
    lookup.outcome = DnsOutcome::kFailed;
    lookup.why = "no server";
    return lookup;
  }
  lookup.server = servers.front();
  for (const auto &[known, address] : names) {
    if (known == name) {
      lookup.outcome = DnsOutcome::kAnswered;
      lookup.addresses = {address};
      lookup.why = lookup.server + " answered " + FormatIpv4(address);
      return lookup;
    }
  }
  lookup.outcome = DnsOutcome::kNameError;
  lookup.rcode = kDnsNameError;
  lookup.why = lookup.server + " answered that the name does not exist";
  return lookup;
}

UpnpFinding FakeRouterProbes::ProbeUpnp(const std::string &gateway) {
  std::lock_guard<std::mutex> lock(mMutex);
  upnpAsked.push_back(gateway);
  return upnp;
}

NatPmpFinding FakeRouterProbes::ProbeNatPmp(const std::string &gateway) {
  std::lock_guard<std::mutex> lock(mMutex);
  natpmpAsked.push_back(gateway);
  return natpmp;
}

DetectEnvironment MakeFakeEnvironment(Scene &scene) {
  DetectEnvironment environment;

  auto network = std::make_unique<FakeNetworkInfo>();
  network->routeTable = RouteTable({RouteLine("eth0", "192.168.1.1", 100),
                                    RouteLine("eth0", "0.0.0.0", 100, false)});
  InterfaceInfo loopback{
      "lo", true, true, true, {{Ip("127.0.0.1"), Ip("255.0.0.0")}}};
  InterfaceInfo eth0{
      "eth0", true, true, false, {{Ip("192.168.1.10"), Ip("255.255.255.0")}}};
  network->interfaces = std::vector<InterfaceInfo>{loopback, eth0};
  scene.network = network.get();
  environment.network = std::move(network);

  auto connector = std::make_unique<FakeConnector>();
  connector->answering = {{Ip("1.1.1.1"), 443}};
  scene.connector = connector.get();
  environment.connector = std::move(connector);

  auto hops = std::make_unique<FakeHopProber>();
  hops->replies = {{1, Ip("192.168.1.1"), false},
                   {2, Ip("203.0.113.1"), false}};
  scene.hops = hops.get();
  environment.hopProber = std::move(hops);

  auto dns = std::make_unique<FakeDnsClient>();
  dns->names = {{"example.com", Ip("93.184.216.34")}};
  scene.dns = dns.get();
  environment.dns = std::move(dns);

  auto router = std::make_unique<FakeRouterProbes>();
  router->upnp.support = ProtocolSupport::kYes;
  router->upnp.location = "http://192.168.1.1:5000/rootDesc.xml";
  router->upnp.externalAddress = "198.51.100.7";
  router->upnp.identity = {"Acme", "R1", "2.0"};
  router->upnp.why = "UPnP IGD at http://192.168.1.1:5000/rootDesc.xml";
  router->natpmp.support = ProtocolSupport::kYes;
  router->natpmp.publicAddress = "198.51.100.7";
  router->natpmp.why = "NAT-PMP answered";
  scene.router = router.get();
  environment.router = std::move(router);

  environment.config = [&scene](std::string_view key,
                                std::string_view fallback) {
    for (const auto &[known, value] : scene.config) {
      if (known == key) {
        return value;
      }
    }
    return std::string(fallback);
  };
  environment.resolvConf = [&scene] { return scene.resolvConf; };
  environment.maxRules = [&scene](const RouterName &name) {
    scene.maxRulesAsked.push_back(name);
    return scene.maxRules;
  };
  environment.userSettingName = [&scene](const std::string &gateway) {
    scene.userSettingAsked.push_back(gateway);
    return scene.userSettingName;
  };
  environment.now = [&scene] {
    scene.clock += scene.tick;
    return scene.clock;
  };
  return environment;
}

} // namespace zark::test
