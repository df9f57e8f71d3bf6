#include "drivers/driver_choice.h"

#include "base/detect_log.h"
#include "base/portmap_log.h"
#include "base/record_text.h"
#include "catalog/detect_result_store.h"
#include "catalog/router_conf_store.h"
#include "catalog/router_db.h"
#include "drivers/natpmp.h"
#include "drivers/upnp.h"
#include "rules/rule_validation.h"

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

// The protocol a router database entry names, when the library drives it
// (UPnP, NAT-PMP; a router driven through its pages gives nothing).
std::optional<RouterProtocol> DriverProtocol(const RouterDbEntry &entry) {
  if (entry.protocol == RouterProtocol::kWebPages) {
    return std::nullopt;
  }
  return entry.protocol;
}

// The entry of brand/model/version in the installed database, else the
// model's generic entry.
std::optional<RouterDbEntry> RouterDbEntryOf(std::string_view brand,
                                             std::string_view model,
                                             std::string_view version) {
  RouterDbEntry entry;
  int err = ZARK_PORTMAP_ERR_NONE;
  if (FindRouterDbEntry(brand, model, version, entry, err)) {
    return entry;
  }
  if (err != ZARK_PORTMAP_ERR_NOT_CONFIGURED) {
    return std::nullopt; // the database cannot be read (logged by its reader)
  }
  RouterDb db;
  if (!ReadRouterDb(db, err)) {
    return std::nullopt;
  }
  for (const RouterDbEntry &candidate : db.entries) {
    if (candidate.generic && candidate.brand == brand &&
        candidate.model == model) {
      return candidate;
    }
  }
  return std::nullopt;
}

// What the kept detection record says of the router brand/model/version:
// only when its upnp_pfpath names that router (the version too, when the
// name carries one).
std::optional<RouterProtocol> DetectedProtocol(std::string_view brand,
                                               std::string_view model,
                                               std::string_view version) {
  ZARK_ROUTER_DETECT_RESULT record{};
  if (LoadDetectResult(kDetectResultPath, record) !=
      DetectResultLoad::kLoaded) {
    return std::nullopt;
  }
  std::optional<DetectedRouterName> name =
      SplitDetectedRouterName(std::string_view(
          record.upnp_pfpath,
          strnlen(record.upnp_pfpath, sizeof(record.upnp_pfpath))));
  if (!name || name->brand != brand || name->model != model ||
      (name->version && *name->version != version)) {
    return std::nullopt;
  }
  if (record.support_upnp == 1) {
    return RouterProtocol::kUpnp;
  }
  if (record.support_natpmp == 1) {
    return RouterProtocol::kNatPmp;
  }
  return std::nullopt;
}

} // namespace

std::optional<DetectedRouterName>
SplitDetectedRouterName(std::string_view pfpath) {
  constexpr std::string_view kSeparator = ": ";
  const std::size_t colon = pfpath.find(kSeparator);
  if (colon == std::string_view::npos) {
    return std::nullopt;
  }
  DetectedRouterName name;
  name.brand = std::string(pfpath.substr(0, colon));
  const std::size_t modelStart = colon + kSeparator.size();
  const std::size_t paren = pfpath.find('(', colon);
  if (paren == std::string_view::npos) {
    name.model = std::string(pfpath.substr(modelStart));
    return name;
  }
  name.model = paren > modelStart
                   ? std::string(pfpath.substr(modelStart, paren - modelStart))
                   : std::string();
  std::string_view version = pfpath.substr(paren + 1);
  const std::size_t close = version.rfind(')');
  if (close != std::string_view::npos) {
    version = version.substr(0, close);
  }
  name.version = std::string(version);
  return name;
}

std::optional<InferredProtocol>
InferProtocolOfRouter(const ZARK_ROUTER_CONF &conf) {
  const std::string_view brand = Field(conf.brand);
  const std::string_view model = Field(conf.model);
  const std::string_view version = Field(conf.version);
  if (std::optional<RouterDbEntry> entry =
          RouterDbEntryOf(brand, model, version)) {
    if (std::optional<RouterProtocol> protocol = DriverProtocol(*entry)) {
      return InferredProtocol{*protocol, ProtocolSource::kRouterDb};
    }
  }
  if (std::optional<RouterProtocol> protocol =
          DetectedProtocol(brand, model, version)) {
    return InferredProtocol{*protocol, ProtocolSource::kDetectResult};
  }
  return std::nullopt;
}

std::optional<RouterProtocol>
ProtocolOfRouterConf(const ZARK_ROUTER_CONF &conf) {
  if (Field(conf.support_upnp) == "yes") {
    return RouterProtocol::kUpnp;
  }
  if (Field(conf.support_natpmp) == "yes") {
    return RouterProtocol::kNatPmp;
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
  std::optional<RouterProtocol> protocol = ProtocolOfRouterConf(conf);
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
          inferred->protocol == RouterProtocol::kUpnp ? "UPnP" : "NAT-PMP",
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

std::unique_ptr<RouterDriver> MakeRouter(RouterProtocol protocol,
                                         const std::string &gateway,
                                         const RouterRecord *memo) {
  std::optional<RouterOverrides> overrides = Overrides();
  if (protocol == RouterProtocol::kUpnp) {
    UpnpOptions options;
    options.gateway = gateway;
    if (memo != nullptr && !memo->location.empty()) {
      options.knownRootDescUrls.push_back(memo->location);
      options.knownControlUrl = memo->controlUrl;
      options.knownServiceType = memo->serviceType;
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
  if (protocol == RouterProtocol::kNatPmp) {
    NatPmpOptions options;
    options.gateway = gateway;
    if (overrides) {
      options.port = overrides->natpmpPort;
      options.firstWait = overrides->natpmpFirstWait;
      options.tries = overrides->natpmpTries;
    }
    return std::make_unique<NatPmpRouter>(std::move(options));
  }
  const std::string_view name = RouterProtocolName(protocol);
  ZARK_PM_LOG_ERROR("no driver for router protocol \"%.*s\"",
                    static_cast<int>(name.size()), name.data());
  return nullptr;
}

void SetRouterOverridesForTesting(std::optional<RouterOverrides> overrides) {
  std::lock_guard<std::mutex> lock(gOverridesMutex);
  gOverrides = std::move(overrides);
}

} // namespace zark::portmap
