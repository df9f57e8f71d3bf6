#include "protocol_inference.h"

#include "detect_result_store.h"
#include "router_db.h"

#include <cstring>

namespace zark::portmap {
namespace {

std::string_view Field(const char (&field)[ZARK_PORTMAP_TEXT_SIZE]) {
  return std::string_view(field, strnlen(field, ZARK_PORTMAP_TEXT_SIZE));
}

// The protocol a router database entry names, when the library drives it
// ("upnp", "natpmp"; a router driven through its pages gives nothing).
std::optional<std::string> DriverProtocol(const RouterDbEntry &entry) {
  if (entry.protocol == RouterProtocol::kWebPages) {
    return std::nullopt;
  }
  return std::string(RouterProtocolName(entry.protocol));
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
std::optional<std::string> DetectedProtocol(std::string_view brand,
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
    return std::string(RouterProtocolName(RouterProtocol::kUpnp));
  }
  if (record.support_natpmp == 1) {
    return std::string(RouterProtocolName(RouterProtocol::kNatPmp));
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
    if (std::optional<std::string> protocol = DriverProtocol(*entry)) {
      return InferredProtocol{*protocol, ProtocolSource::kRouterDb};
    }
  }
  if (std::optional<std::string> protocol =
          DetectedProtocol(brand, model, version)) {
    return InferredProtocol{*protocol, ProtocolSource::kDetectResult};
  }
  return std::nullopt;
}

} // namespace zark::portmap
