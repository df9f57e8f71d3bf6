#include "router_driver.h"

#include "detect_log.h"
#include "natpmp.h"
#include "portmap_log.h"
#include "router_conf_store.h"
#include "rule_validation.h"
#include "upnp.h"

#include <cstring>
#include <mutex>

namespace zark::portmap {
namespace {

std::mutex gOverridesMutex;
std::optional<RouterOverrides> gOverrides;

std::optional<RouterOverrides> Overrides() {
  std::lock_guard<std::mutex> lock(gOverridesMutex);
  return gOverrides;
}

std::string_view Field(const char (&field)[ZARK_PORTMAP_TEXT_SIZE]) {
  return std::string_view(field, strnlen(field, ZARK_PORTMAP_TEXT_SIZE));
}

} // namespace

std::optional<std::string> ProtocolOfRouterConf(const ZARK_ROUTER_CONF &conf) {
  if (Field(conf.support_upnp) == "yes") {
    return std::string(kProtocolUpnp);
  }
  if (Field(conf.support_natpmp) == "yes") {
    return std::string(kProtocolNatPmp);
  }
  return std::nullopt;
}

bool ChooseRouter(const std::string &gateway, RouterChoice &choice, int &err) {
  ZARK_ROUTER_CONF conf{};
  if (!LoadRouterConfForGateway(gateway, conf, err)) {
    if (err == ZARK_PORTMAP_ERR_NOT_CONFIGURED) {
      ZARK_PM_LOG_ERROR("no router is configured for gateway %s",
                        gateway.c_str());
    }
    return false;
  }
  std::optional<std::string> protocol = ProtocolOfRouterConf(conf);
  if (!protocol) {
    if (std::optional<InferredProtocol> inferred =
            InferProtocolOfRouter(conf)) {
      ZARK_DETECT_INFO(
          "the router configured for gateway %s (%.*s %.*s %.*s) has no "
          "protocol flag set; driving it by %s, as %s says",
          gateway.c_str(), static_cast<int>(Field(conf.brand).size()),
          Field(conf.brand).data(), static_cast<int>(Field(conf.model).size()),
          Field(conf.model).data(),
          static_cast<int>(Field(conf.version).size()),
          Field(conf.version).data(),
          inferred->protocol == kProtocolUpnp ? "UPnP" : "NAT-PMP",
          inferred->source == ProtocolSource::kRouterDb
              ? "its router database entry"
              : "the kept detection record");
      protocol = inferred->protocol;
    }
  }
  if (!protocol) {
    ZARK_PM_LOG_ERROR(
        "the router configured for gateway %s (%.*s %.*s) is driven through "
        "its web pages (\"%.*s\"); drivers for router pages do not exist yet",
        gateway.c_str(), static_cast<int>(Field(conf.brand).size()),
        Field(conf.brand).data(), static_cast<int>(Field(conf.model).size()),
        Field(conf.model).data(),
        static_cast<int>(Field(conf.conn_type).size()),
        Field(conf.conn_type).data());
    err = ZARK_PORTMAP_ERR_NOT_CONFIGURED;
    return false;
  }
  choice.protocol = *protocol;
  choice.maxRouterEntries = MaxRouterEntries(Field(conf.max_rule));
  err = ZARK_PORTMAP_ERR_NONE;
  return true;
}

std::unique_ptr<RouterProtocol> MakeRouter(std::string_view protocol,
                                           const std::string &gateway,
                                           const RouterRecord *memo) {
  std::optional<RouterOverrides> overrides = Overrides();
  if (protocol == kProtocolUpnp) {
    UpnpOptions options;
    options.gateway = gateway;
    if (memo != nullptr && !memo->location.empty()) {
      options.knownRootDescUrls.push_back(memo->location);
    }
    if (memo != nullptr && memo->finiteLeases) {
      options.firstLease = LeaseKind::kFinite;
    }
    if (overrides) {
      for (const std::string &url : overrides->upnpRootDescUrls) {
        options.knownRootDescUrls.push_back(url);
      }
      options.discover = overrides->upnpDiscover;
      options.localNetworks = overrides->localNetworks;
    }
    return std::make_unique<UpnpRouter>(std::move(options));
  }
  if (protocol == kProtocolNatPmp) {
    NatPmpOptions options;
    options.gateway = gateway;
    if (overrides) {
      options.port = overrides->natpmpPort;
      options.firstWait = overrides->natpmpFirstWait;
      options.tries = overrides->natpmpTries;
    }
    return std::make_unique<NatPmpRouter>(std::move(options));
  }
  ZARK_PM_LOG_ERROR("unknown router protocol \"%.*s\"",
                    static_cast<int>(protocol.size()), protocol.data());
  return nullptr;
}

void SetRouterOverridesForTesting(std::optional<RouterOverrides> overrides) {
  std::lock_guard<std::mutex> lock(gOverridesMutex);
  gOverrides = std::move(overrides);
}

} // namespace zark::portmap
