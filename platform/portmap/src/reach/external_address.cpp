#include "reach/external_address.h"

#include "base/detect_log.h"
#include "base/ipv4_class.h"
#include "base/library_config.h"
#include "base/local_network.h"
#include "base/portmap_log.h"
#include "catalog/mapping_state.h"
#include "catalog/router_conf_store.h"
#include "drivers/driver_choice.h"
#include "net/ssdp_search.h"
#include "reach/probe_client.h"
#include "zarknet.h"

#include <arpa/inet.h>

#include <exception>
#include <mutex>

namespace zark::portmap {
namespace {

std::mutex gFactoryMutex;
std::function<ExternalAddressEnvironment()> gFactory;

// An address the internet can see, from what a router reported; nothing
// (logged) for anything else.
std::optional<uint32_t> Usable(const std::string &reported,
                               const char *source) {
  std::optional<uint32_t> address = ParseIpv4(reported);
  if (!address) {
    return std::nullopt;
  }
  if (ClassifyIpv4(*address) != Ipv4Class::kPublic) {
    ZARK_DETECT_WARNING("external address: %s reports %s, a %s address: the "
                        "router is behind another NAT",
                        source, reported.c_str(),
                        Ipv4ClassName(ClassifyIpv4(*address)));
    return std::nullopt;
  }
  return address;
}

std::optional<uint32_t> FromConfiguredRouter(ExternalAddressEnvironment &env,
                                             const std::string &gateway) {
  std::optional<ZARK_ROUTER_CONF> conf = env.storedConf(gateway);
  if (!conf) {
    return std::nullopt;
  }
  std::optional<RouterProtocol> protocol = ProtocolOfRouterConf(*conf);
  if (!protocol) {
    return std::nullopt; // driven through its pages: no protocol to ask
  }
  std::unique_ptr<RouterDriver> router = env.makeRouter(*protocol, gateway);
  if (!router) {
    return std::nullopt;
  }
  const std::string protocolName(RouterProtocolName(*protocol));
  std::string reported;
  RouterResult asked = router->GetExternalAddress(reported);
  if (!asked.Ok()) {
    ZARK_PM_LOG_ERROR("external address: the configured router (%s at %s) "
                      "did not tell: %s",
                      protocolName.c_str(), gateway.c_str(),
                      asked.message.c_str());
    return std::nullopt;
  }
  return Usable(reported,
                ("the configured router (" + protocolName + ")").c_str());
}

std::optional<uint32_t> FromProbedRouter(ExternalAddressEnvironment &env,
                                         const std::string &gateway) {
  if (!env.probes) {
    return std::nullopt;
  }
  RouterFindings findings = ProbeRouter(*env.probes, gateway);
  if (std::optional<uint32_t> address =
          Usable(findings.upnp.externalAddress, "the router (UPnP)")) {
    return address;
  }
  if (std::optional<uint32_t> address =
          Usable(findings.natpmp.publicAddress, "the router (NAT-PMP)")) {
    return address;
  }
  if (findings.upnp.externalAddress.empty() &&
      findings.natpmp.publicAddress.empty()) {
    ZARK_PM_LOG_ERROR("external address: the router at %s does not tell: "
                      "%s; %s",
                      gateway.c_str(), findings.upnp.why.c_str(),
                      findings.natpmp.why.c_str());
  }
  return std::nullopt;
}

} // namespace

ExternalAddressEnvironment MakeSystemExternalAddressEnvironment() {
  ExternalAddressEnvironment environment;
  environment.gateway = []() -> std::optional<std::string> {
    char buffer[ZARK_PORTMAP_TEXT_SIZE] = {};
    if (KLibGetGatewayIP(buffer, sizeof(buffer)) < 0) {
      return std::nullopt;
    }
    return std::string(buffer);
  };
  environment.storedConf =
      [](const std::string &gateway) -> std::optional<ZARK_ROUTER_CONF> {
    ZARK_ROUTER_CONF conf{};
    int err = ZARK_PORTMAP_ERR_NONE;
    if (!LoadRouterConfForGateway(gateway, conf, err)) {
      return std::nullopt;
    }
    return conf;
  };
  environment.makeRouter = [](RouterProtocol protocol,
                              const std::string &gateway) {
    // Start where the last job found the router; without that, find a UPnP
    // router with the quick search aimed at the gateway rather than the
    // driver's full discovery, which waits out its listening time.
    MappingState state;
    RouterRecord memo;
    if (LoadMappingState(kMappingStatePath, state)) {
      if (const RouterRecord *found = state.Find(gateway, protocol)) {
        memo = *found;
      }
    }
    if (protocol == RouterProtocol::kUpnp && memo.location.empty()) {
      SsdpSearchOptions search;
      search.gateway = gateway;
      std::vector<std::string> found = SearchIgds(search);
      if (!found.empty()) {
        memo.location = found.front();
      }
    }
    return MakeRouter(protocol, gateway, &memo);
  };
  environment.probes = MakeRouterProbes(RouterProbeOptions{});
  environment.config = [](std::string_view key, std::string_view fallback) {
    return GetLibraryConfig(key, fallback);
  };
  environment.probeService = ExternalAddressFromProbeService;
  return environment;
}

std::optional<uint32_t> FindExternalAddress(ExternalAddressEnvironment &env) {
  std::optional<std::string> gateway = env.gateway();
  if (!gateway) {
    ZARK_PM_LOG_ERROR("external address: no default gateway, so no router to "
                      "ask");
  } else {
    if (std::optional<uint32_t> address = FromConfiguredRouter(env, *gateway)) {
      return address;
    }
    if (std::optional<uint32_t> address = FromProbedRouter(env, *gateway)) {
      return address;
    }
  }
  const std::string service = env.config(config_key::kProbeServiceAddress, "");
  if (service.empty()) {
    ZARK_PM_LOG_ERROR("external address: unknown (the router does not tell "
                      "and no probe service is configured)");
    return std::nullopt;
  }
  if (!env.probeService) {
    ZARK_PM_LOG_ERROR("external address: unknown (the router does not tell; "
                      "no way to ask the probe service %s)",
                      service.c_str());
    return std::nullopt;
  }
  return env.probeService(service);
}

void SetExternalAddressEnvironmentFactoryForTesting(
    std::function<ExternalAddressEnvironment()> factory) {
  std::lock_guard<std::mutex> lock(gFactoryMutex);
  gFactory = std::move(factory);
}

} // namespace zark::portmap

extern "C" uint32_t ZARKIGetExternalIP(void) {
  using namespace zark::portmap;
  try {
    std::function<ExternalAddressEnvironment()> factory;
    {
      std::lock_guard<std::mutex> lock(gFactoryMutex);
      factory = gFactory;
    }
    ExternalAddressEnvironment environment =
        factory ? factory() : MakeSystemExternalAddressEnvironment();
    std::optional<uint32_t> address = FindExternalAddress(environment);
    return address ? htonl(*address) : 0;
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("ZARKIGetExternalIP: %s", e.what());
    return 0;
  }
}
