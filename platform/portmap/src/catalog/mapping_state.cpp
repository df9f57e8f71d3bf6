#include "catalog/mapping_state.h"

#include "base/conf_file.h"
#include "base/local_network.h"
#include "base/portmap_log.h"
#include "base/strict_json.h"

#include <json/json.h>

#include <algorithm>
#include <exception>
#include <memory>

namespace zark::portmap {
namespace {

constexpr std::size_t kMaxStateBytes = 16u << 20;
constexpr Json::ArrayIndex kMaxRouters = 64;
constexpr Json::ArrayIndex kMaxMappings = 65536;

bool Fail(std::string &why, std::string text) {
  why = std::move(text);
  return false;
}

bool ReadString(const Json::Value &object, const char *key, std::string &out,
                std::string &why) {
  const Json::Value &value = object[key];
  if (!value.isString()) {
    return Fail(why, std::string("\"") + key + "\" is not a string");
  }
  out = value.asString();
  return true;
}

bool ReadBool(const Json::Value &object, const char *key, bool &out,
              std::string &why) {
  const Json::Value &value = object[key];
  if (!value.isBool()) {
    return Fail(why, std::string("\"") + key + "\" is not a boolean");
  }
  out = value.asBool();
  return true;
}

bool ReadInteger(const Json::Value &object, const char *key, int64_t min,
                 int64_t max, int64_t &out, std::string &why) {
  const Json::Value &value = object[key];
  if (!value.isInt64()) {
    return Fail(why, std::string("\"") + key + "\" is not an integer");
  }
  int64_t number = value.asInt64();
  if (number < min || number > max) {
    return Fail(why, std::string("\"") + key + "\" is out of range");
  }
  out = number;
  return true;
}

bool ReadMapping(const Json::Value &value, RecordedMapping &mapping,
                 std::string &why) {
  if (!value.isObject()) {
    return Fail(why, "a mapping is not an object");
  }
  std::string protocol;
  int64_t external = 0;
  int64_t internal = 0;
  int64_t lease = 0;
  if (!ReadString(value, "protocol", protocol, why) ||
      !ReadInteger(value, "external_port", 1, 65535, external, why) ||
      !ReadInteger(value, "internal_port", 1, 65535, internal, why) ||
      !ReadString(value, "internal_client", mapping.internalClient, why) ||
      !ReadInteger(value, "lease", 0, UINT32_MAX, lease, why) ||
      !ReadInteger(value, "expires", 0, INT64_MAX, mapping.expires, why) ||
      !ReadBool(value, "held", mapping.held, why) ||
      !ReadString(value, "rule_id", mapping.ruleId, why)) {
    return false;
  }
  std::optional<IpProtocol> parsed = ParseProtocolText(protocol);
  if (!parsed || protocol != ProtocolText(*parsed)) {
    return Fail(why, "unknown protocol \"" + protocol + "\"");
  }
  if (!ParseIpv4(mapping.internalClient)) {
    return Fail(why, "\"internal_client\" is not an IPv4 address");
  }
  mapping.protocol = *parsed;
  mapping.externalPort = static_cast<uint16_t>(external);
  mapping.internalPort = static_cast<uint16_t>(internal);
  mapping.leaseSeconds = static_cast<uint32_t>(lease);
  return true;
}

bool ReadRouter(const Json::Value &value, RouterRecord &router,
                std::string &why) {
  if (!value.isObject()) {
    return Fail(why, "a router is not an object");
  }
  std::string protocol;
  if (!ReadString(value, "gateway", router.gateway, why) ||
      !ReadString(value, "protocol", protocol, why) ||
      !ReadString(value, "location", router.location, why) ||
      !ReadBool(value, "finite_leases", router.finiteLeases, why)) {
    return false;
  }
  if (!ParseIpv4(router.gateway)) {
    return Fail(why, "\"gateway\" is not an IPv4 address");
  }
  std::optional<RouterProtocol> parsed = ParseRouterProtocol(protocol);
  if (!parsed) {
    return Fail(why, "\"protocol\" names no router protocol");
  }
  router.protocol = *parsed;
  const Json::Value &mappings = value["mappings"];
  if (!mappings.isArray()) {
    return Fail(why, "\"mappings\" is not an array");
  }
  if (mappings.size() > kMaxMappings) {
    return Fail(why, "too many mappings");
  }
  for (Json::ArrayIndex i = 0; i < mappings.size(); ++i) {
    RecordedMapping mapping;
    if (!ReadMapping(mappings[i], mapping, why)) {
      return false;
    }
    if (router.Find(mapping.protocol, mapping.externalPort) != nullptr) {
      return Fail(why, "a mapping is listed twice");
    }
    router.mappings.push_back(std::move(mapping));
  }
  return true;
}

bool ParseMappingStateOrThrow(std::string_view text, MappingState &state,
                              std::string &why) {
  Json::Value root;
  std::string parseWhy;
  if (!ParseStrictJsonOrThrow(text, root, parseWhy, 16)) {
    return Fail(why, parseWhy);
  }
  if (!root.isObject()) {
    return Fail(why, "not a JSON object");
  }
  const Json::Value &version = root["version"];
  if (!version.isInt() || version.asInt() != kMappingStateVersion) {
    return Fail(why, "unknown version");
  }
  const Json::Value &routers = root["routers"];
  if (!routers.isArray()) {
    return Fail(why, "\"routers\" is not an array");
  }
  if (routers.size() > kMaxRouters) {
    return Fail(why, "too many routers");
  }
  MappingState parsed;
  for (Json::ArrayIndex i = 0; i < routers.size(); ++i) {
    RouterRecord router;
    if (!ReadRouter(routers[i], router, why)) {
      return false;
    }
    if (parsed.Find(router.gateway, router.protocol) != nullptr) {
      return Fail(why, "a router is listed twice");
    }
    parsed.routers.push_back(std::move(router));
  }
  state = std::move(parsed);
  return true;
}

} // namespace

RecordedMapping *RouterRecord::Find(IpProtocol protocol,
                                    uint16_t externalPort) {
  for (RecordedMapping &mapping : mappings) {
    if (mapping.protocol == protocol && mapping.externalPort == externalPort) {
      return &mapping;
    }
  }
  return nullptr;
}

const RecordedMapping *RouterRecord::Find(IpProtocol protocol,
                                          uint16_t externalPort) const {
  return const_cast<RouterRecord *>(this)->Find(protocol, externalPort);
}

void RouterRecord::Put(const RecordedMapping &mapping) {
  if (RecordedMapping *existing =
          Find(mapping.protocol, mapping.externalPort)) {
    *existing = mapping;
  } else {
    mappings.push_back(mapping);
  }
}

void RouterRecord::Remove(IpProtocol protocol, uint16_t externalPort) {
  std::erase_if(mappings, [&](const RecordedMapping &mapping) {
    return mapping.protocol == protocol && mapping.externalPort == externalPort;
  });
}

RouterRecord *MappingState::Find(std::string_view gateway,
                                 RouterProtocol protocol) {
  for (RouterRecord &router : routers) {
    if (router.gateway == gateway && router.protocol == protocol) {
      return &router;
    }
  }
  return nullptr;
}

RouterRecord &MappingState::FindOrAdd(std::string_view gateway,
                                      RouterProtocol protocol) {
  if (RouterRecord *found = Find(gateway, protocol)) {
    return *found;
  }
  RouterRecord &added = routers.emplace_back();
  added.gateway = gateway;
  added.protocol = protocol;
  return added;
}

void MappingState::DropEmpty() {
  std::erase_if(routers, [](const RouterRecord &router) {
    return router.mappings.empty() && router.location.empty();
  });
}

std::string SerializeMappingState(const MappingState &state) {
  Json::Value root(Json::objectValue);
  root["version"] = kMappingStateVersion;
  Json::Value &routers = root["routers"] = Json::Value(Json::arrayValue);
  for (const RouterRecord &router : state.routers) {
    Json::Value item(Json::objectValue);
    item["gateway"] = router.gateway;
    item["protocol"] = std::string(RouterProtocolName(router.protocol));
    item["location"] = router.location;
    item["finite_leases"] = router.finiteLeases;
    Json::Value &mappings = item["mappings"] = Json::Value(Json::arrayValue);
    for (const RecordedMapping &mapping : router.mappings) {
      Json::Value entry(Json::objectValue);
      entry["protocol"] = ProtocolText(mapping.protocol);
      entry["external_port"] = mapping.externalPort;
      entry["internal_port"] = mapping.internalPort;
      entry["internal_client"] = mapping.internalClient;
      entry["lease"] = Json::Value::UInt64(mapping.leaseSeconds);
      entry["expires"] = Json::Value::Int64(mapping.expires);
      entry["held"] = mapping.held;
      entry["rule_id"] = mapping.ruleId;
      mappings.append(std::move(entry));
    }
    routers.append(std::move(item));
  }
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "  ";
  builder["emitUTF8"] = true;
  return Json::writeString(builder, root) + "\n";
}

bool ParseMappingState(std::string_view text, MappingState &state,
                       std::string &why) noexcept {
  try {
    return ParseMappingStateOrThrow(text, state, why);
  } catch (const std::exception &e) {
    why = std::string("not readable: ") + e.what();
    return false;
  }
}

bool LoadMappingState(const std::string &path, MappingState &state) {
  state = MappingState();
  ReadResult read = ReadSmallFile(path, kMaxStateBytes);
  if (read.status == ReadStatus::kMissing) {
    return true;
  }
  if (read.status != ReadStatus::kRead) {
    return false; // ReadSmallFile has logged why
  }
  std::string why;
  if (!ParseMappingState(read.content, state, why)) {
    ZARK_PM_LOG_ERROR("%s is refused: %s", path.c_str(), why.c_str());
    state = MappingState();
    return false;
  }
  return true;
}

bool SaveMappingState(const std::string &path, const MappingState &state) {
  std::string text;
  try {
    text = SerializeMappingState(state);
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("cannot write %s: %s", path.c_str(), e.what());
    return false;
  }
  return ReplaceFileAtomically(path, text, 0600);
}

} // namespace zark::portmap
