#include "catalog/mapping_state.h"

#include "base/conf_file.h"
#include "base/failure_kind.h"
#include "base/local_network.h"
#include "base/portmap_log.h"
#include "base/strict_json.h"

#include <json/json.h>

#include <algorithm>
#include <exception>
#include <memory>

namespace zark::portmap {
namespace {

constexpr Json::ArrayIndex kMaxMappings = kMaxRecordedMappings;
constexpr std::size_t kMaxStateBytes = kMaxMappingStateBytes;
constexpr Json::ArrayIndex kMaxRouters = 64;

constexpr MappingApply kApplyStates[] = {
    MappingApply::kOnRouter, MappingApply::kMissing, MappingApply::kRefused,
    MappingApply::kPending};

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

bool ReadFailure(const Json::Value &object, ZARK_FAILURE_KIND &kind,
                 std::string &reason, std::string &why) {
  std::string word;
  if (!ReadString(object, "failure", word, why) ||
      !ReadString(object, "reason", reason, why)) {
    return false;
  }
  std::optional<ZARK_FAILURE_KIND> parsed = ParseFailureKindWord(word);
  if (!parsed) {
    return Fail(why, "unknown failure \"" + word + "\"");
  }
  kind = *parsed;
  return true;
}

// The members version 2 added to a mapping.
bool ReadMappingApply(const Json::Value &value, RecordedMapping &mapping,
                      std::string &why) {
  std::string state;
  if (!ReadString(value, "state", state, why) ||
      !ReadFailure(value, mapping.failure, mapping.reason, why) ||
      !ReadInteger(value, "verified", 0, INT64_MAX, mapping.verified, why)) {
    return false;
  }
  for (MappingApply apply : kApplyStates) {
    if (state == MappingApplyWord(apply)) {
      mapping.apply = apply;
      return true;
    }
  }
  return Fail(why, "unknown state \"" + state + "\"");
}

bool ReadLastJob(const Json::Value &value, std::optional<LastJob> &job,
                 std::string &why) {
  if (value.isNull()) {
    job.reset();
    return true;
  }
  if (!value.isObject()) {
    return Fail(why, "\"last_job\" is not an object");
  }
  LastJob read;
  int64_t repaired = 0;
  int64_t added = 0;
  int64_t deleted = 0;
  if (!ReadString(value, "kind", read.kind, why) ||
      !ReadInteger(value, "ended", 0, INT64_MAX, read.ended, why) ||
      !ReadBool(value, "ok", read.ok, why) ||
      !ReadInteger(value, "repaired", 0, INT32_MAX, repaired, why) ||
      !ReadInteger(value, "added", 0, INT32_MAX, added, why) ||
      !ReadInteger(value, "deleted", 0, INT32_MAX, deleted, why) ||
      !ReadFailure(value, read.failure, read.reason, why)) {
    return false;
  }
  read.repaired = static_cast<int>(repaired);
  read.added = static_cast<int>(added);
  read.deleted = static_cast<int>(deleted);
  job = std::move(read);
  return true;
}

bool ReadMapping(const Json::Value &value, int version,
                 RecordedMapping &mapping, std::string &why) {
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
  if (version == 1) {
    mapping.apply =
        mapping.held ? MappingApply::kOnRouter : MappingApply::kPending;
    return true;
  }
  return ReadMappingApply(value, mapping, why);
}

bool ReadRouter(const Json::Value &value, int version, RouterRecord &router,
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
  if (version >= 2) {
    if (!ReadString(value, "external_address", router.externalAddress, why) ||
        !ReadString(value, "control_url", router.controlUrl, why) ||
        !ReadString(value, "service_type", router.serviceType, why) ||
        !ReadLastJob(value["last_job"], router.lastJob, why)) {
      return false;
    }
    if (!router.externalAddress.empty() && !ParseIpv4(router.externalAddress)) {
      return Fail(why, "\"external_address\" is not an IPv4 address");
    }
  }
  const Json::Value &mappings = value["mappings"];
  if (!mappings.isArray()) {
    return Fail(why, "\"mappings\" is not an array");
  }
  if (mappings.size() > kMaxMappings) {
    return Fail(why, "too many mappings");
  }
  for (Json::ArrayIndex i = 0; i < mappings.size(); ++i) {
    RecordedMapping mapping;
    if (!ReadMapping(mappings[i], version, mapping, why)) {
      return false;
    }
    if (router.Find(mapping.protocol, mapping.externalPort) != nullptr) {
      return Fail(why, "a mapping is listed twice");
    }
    router.Put(mapping);
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
  if (!version.isInt() || version.asInt() < 1 ||
      version.asInt() > kMappingStateVersion) {
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
    if (!ReadRouter(routers[i], version.asInt(), router, why)) {
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

Json::Value FailureMembers(Json::Value object, ZARK_FAILURE_KIND kind,
                           const std::string &reason) {
  object["failure"] = FailureKindWord(kind);
  object["reason"] = reason;
  return object;
}

} // namespace

const char *MappingApplyWord(MappingApply apply) {
  switch (apply) {
  case MappingApply::kOnRouter:
    return "on_router";
  case MappingApply::kMissing:
    return "missing";
  case MappingApply::kRefused:
    return "refused";
  case MappingApply::kPending:
    break;
  }
  return "pending";
}

namespace {

uint32_t PortKey(IpProtocol protocol, uint16_t externalPort) {
  return (static_cast<uint32_t>(protocol) << 16) | externalPort;
}

} // namespace

std::size_t RouterRecord::IndexOf(IpProtocol protocol,
                                  uint16_t externalPort) const {
  auto matches = [&](std::size_t i) {
    return i < mappings.size() && mappings[i].protocol == protocol &&
           mappings[i].externalPort == externalPort;
  };
  const uint32_t key = PortKey(protocol, externalPort);
  auto found = mIndex.find(key);
  if (found != mIndex.end() && matches(found->second)) {
    return found->second;
  }
  if (found == mIndex.end() && mIndex.size() == mappings.size()) {
    return mappings.size(); // the index covers the list: not there
  }
  mIndex.clear();
  for (std::size_t i = 0; i < mappings.size(); ++i) {
    mIndex.emplace(PortKey(mappings[i].protocol, mappings[i].externalPort), i);
  }
  found = mIndex.find(key);
  return found != mIndex.end() ? found->second : mappings.size();
}

RecordedMapping *RouterRecord::Find(IpProtocol protocol,
                                    uint16_t externalPort) {
  const std::size_t i = IndexOf(protocol, externalPort);
  return i < mappings.size() ? &mappings[i] : nullptr;
}

const RecordedMapping *RouterRecord::Find(IpProtocol protocol,
                                          uint16_t externalPort) const {
  const std::size_t i = IndexOf(protocol, externalPort);
  return i < mappings.size() ? &mappings[i] : nullptr;
}

void RouterRecord::Put(const RecordedMapping &mapping) {
  if (RecordedMapping *existing =
          Find(mapping.protocol, mapping.externalPort)) {
    *existing = mapping;
    return;
  }
  mappings.push_back(mapping);
  if (mIndex.size() + 1 == mappings.size()) {
    mIndex.emplace(PortKey(mapping.protocol, mapping.externalPort),
                   mappings.size() - 1);
  }
}

void RouterRecord::Remove(IpProtocol protocol, uint16_t externalPort) {
  const std::size_t i = IndexOf(protocol, externalPort);
  if (i < mappings.size()) {
    mappings.erase(mappings.begin() + static_cast<std::ptrdiff_t>(i));
    mIndex.clear(); // positions after i moved; rebuilt on the next lookup
  }
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
    item["external_address"] = router.externalAddress;
    item["control_url"] = router.controlUrl;
    item["service_type"] = router.serviceType;
    if (router.lastJob) {
      const LastJob &job = *router.lastJob;
      Json::Value last(Json::objectValue);
      last["kind"] = job.kind;
      last["ended"] = Json::Value::Int64(job.ended);
      last["ok"] = job.ok;
      last["repaired"] = job.repaired;
      last["added"] = job.added;
      last["deleted"] = job.deleted;
      item["last_job"] =
          FailureMembers(std::move(last), job.failure, job.reason);
    } else {
      item["last_job"] = Json::Value(Json::nullValue);
    }
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
      entry["state"] = MappingApplyWord(mapping.apply);
      entry["verified"] = Json::Value::Int64(mapping.verified);
      mappings.append(
          FailureMembers(std::move(entry), mapping.failure, mapping.reason));
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
