#include "catalog/router_conf_store.h"

#include "base/conf_file.h"
#include "base/portmap_log.h"
#include "base/strict_json.h"

#include <arpa/inet.h>
#include <json/json.h>

#include <array>
#include <cstring>
#include <exception>
#include <memory>

namespace zark::portmap {
namespace {

constexpr const char *kKeyFormat = "format";
constexpr const char *kKeyGateway = "gateway";
constexpr const char *kKeyRouter = "router";
// A configuration file is a few kilobytes at most (ten fields of 1023
// bytes, escaped); anything far larger is not one of ours.
constexpr std::size_t kMaxRouterConfBytes = 256u * 1024u;

// The JSON member of every record field, in record order (FieldOf).
constexpr std::array<const char *, 10> kFieldKeys = {
    "brand",   "model",    "version",   "support_upnp", "support_natpmp",
    "account", "password", "conn_type", "conn_port",    "max_rule"};

char *FieldOf(ZARK_ROUTER_CONF &conf, std::size_t index) {
  std::array<char *, 10> fields = {
      conf.brand,          conf.model,   conf.version,  conf.support_upnp,
      conf.support_natpmp, conf.account, conf.password, conf.conn_type,
      conf.conn_port,      conf.max_rule};
  // Pointers into the record's own arrays, not integers.
  // cppcheck-suppress CastIntegerToAddressAtReturn
  return fields[index];
}

const char *FieldOf(const ZARK_ROUTER_CONF &conf, std::size_t index) {
  return FieldOf(const_cast<ZARK_ROUTER_CONF &>(conf), index);
}

bool ParseDocument(std::string_view text, ZARK_ROUTER_CONF &conf,
                   std::string &why) {
  if (text.size() > kMaxRouterConfBytes) {
    why = "larger than " + std::to_string(kMaxRouterConfBytes) + " bytes";
    return false;
  }
  Json::Value parsed;
  if (!ParseStrictJsonOrThrow(text, parsed, why, 16)) {
    return false;
  }
  const Json::Value &root = parsed;
  if (!root.isObject()) {
    why = "top level is not an object";
    return false;
  }
  const Json::Value &format = root[kKeyFormat];
  if (!format.isInt() || format.asInt() != kRouterConfFormat) {
    why = "\"format\" missing or not 1";
    return false;
  }
  const Json::Value &router = root[kKeyRouter];
  if (!router.isObject()) {
    why = "\"router\" missing or not an object";
    return false;
  }
  ZARK_ROUTER_CONF result{};
  for (std::size_t i = 0; i < kFieldKeys.size(); ++i) {
    const Json::Value &value = router[kFieldKeys[i]];
    if (!value.isString()) {
      why = std::string("\"") + kFieldKeys[i] + "\" missing or not a string";
      return false;
    }
    const char *begin = nullptr;
    const char *end = nullptr;
    value.getString(&begin, &end);
    std::string_view field(begin, static_cast<std::size_t>(end - begin));
    if (field.size() >= ZARK_PORTMAP_TEXT_SIZE ||
        field.find('\0') != std::string_view::npos) {
      why = std::string("\"") + kFieldKeys[i] +
            "\" longer than 1023 bytes or holds a NUL byte";
      return false;
    }
    std::memcpy(FieldOf(result, i), field.data(), field.size());
  }
  conf = result;
  return true;
}

bool FieldsTerminated(const ZARK_ROUTER_CONF &conf, const char *&badKey) {
  for (std::size_t i = 0; i < kFieldKeys.size(); ++i) {
    if (::strnlen(FieldOf(conf, i), ZARK_PORTMAP_TEXT_SIZE) ==
        ZARK_PORTMAP_TEXT_SIZE) {
      badKey = kFieldKeys[i];
      return false;
    }
  }
  return true;
}

} // namespace

std::optional<std::string> CanonicalGatewayAddress(std::string_view gateway) {
  if (gateway.empty() || gateway.size() > 15) {
    return std::nullopt;
  }
  const std::string text(gateway);
  in_addr address{};
  // inet_pton takes dotted quads only: no names, no octal, no short forms.
  if (::inet_pton(AF_INET, text.c_str(), &address) != 1) {
    return std::nullopt;
  }
  char canonical[INET_ADDRSTRLEN] = {};
  if (::inet_ntop(AF_INET, &address, canonical, sizeof(canonical)) == nullptr) {
    return std::nullopt;
  }
  // "192.168.001.001" parses but is not how anyone names the gateway; one
  // spelling per address keeps one file per gateway.
  if (text != canonical) {
    return std::nullopt;
  }
  return text;
}

std::string RouterConfPath(std::string_view canonicalGateway) {
  return std::string(kRouterConfDir) + "/" + std::string(canonicalGateway) +
         ".conf";
}

std::string SerializeRouterConf(std::string_view gateway,
                                const ZARK_ROUTER_CONF &conf) {
  Json::Value root(Json::objectValue);
  root[kKeyFormat] = kRouterConfFormat;
  root[kKeyGateway] = std::string(gateway);
  Json::Value router(Json::objectValue);
  for (std::size_t i = 0; i < kFieldKeys.size(); ++i) {
    const char *field = FieldOf(conf, i);
    router[kFieldKeys[i]] =
        Json::Value(field, field + ::strnlen(field, ZARK_PORTMAP_TEXT_SIZE));
  }
  root[kKeyRouter] = std::move(router);
  return WriteJsonText(root);
}

bool ParseRouterConf(std::string_view text, ZARK_ROUTER_CONF &conf,
                     std::string &why) noexcept {
  try {
    return ParseDocument(text, conf, why);
  } catch (const std::exception &e) {
    try {
      why = std::string("parser gave up: ") + e.what();
    } catch (...) {
    }
    return false;
  } catch (...) {
    return false;
  }
}

namespace {

// The gateway's canonical dotted quad; nothing, logged and err set to
// ZARK_PORTMAP_ERR_BAD_PARAMETER, when it is not an IPv4 address.
std::optional<std::string> CanonicalGatewayOrLog(const std::string &gateway,
                                                 int &err) {
  std::optional<std::string> canonical = CanonicalGatewayAddress(gateway);
  if (!canonical) {
    ZARK_PM_LOG_ERROR("gateway \"%.64s\" is not an IPv4 address",
                      gateway.c_str());
    err = ZARK_PORTMAP_ERR_BAD_PARAMETER;
  }
  return canonical;
}

} // namespace

bool LoadRouterConfForGateway(const std::string &gateway,
                              ZARK_ROUTER_CONF &conf, int &err) {
  std::optional<std::string> canonical = CanonicalGatewayOrLog(gateway, err);
  if (!canonical) {
    return false;
  }
  const std::string path = RouterConfPath(*canonical);
  ReadResult read = ReadSmallFile(path, kMaxRouterConfBytes);
  switch (read.status) {
  case ReadStatus::kRead:
    break;
  case ReadStatus::kMissing:
    // Not a failure of the library: nobody configured this router yet.
    err = ZARK_PORTMAP_ERR_NOT_CONFIGURED;
    return false;
  case ReadStatus::kTooLarge:
  case ReadStatus::kFailed:
    // ReadSmallFile has logged why.
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  std::string why;
  if (!ParseRouterConf(read.content, conf, why)) {
    ZARK_PM_LOG_ERROR("%s is not a router configuration: %s", path.c_str(),
                      why.c_str());
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  err = ZARK_PORTMAP_ERR_NONE;
  return true;
}

bool StoreRouterConfForGateway(const std::string &gateway,
                               const ZARK_ROUTER_CONF &conf, int &err) {
  std::optional<std::string> canonical = CanonicalGatewayOrLog(gateway, err);
  if (!canonical) {
    return false;
  }
  const char *badKey = nullptr;
  if (!FieldsTerminated(conf, badKey)) {
    ZARK_PM_LOG_ERROR("router configuration field \"%s\" is not "
                      "NUL-terminated",
                      badKey);
    err = ZARK_PORTMAP_ERR_BAD_PARAMETER;
    return false;
  }
  // The folder is private to root: the files in it hold router passwords.
  if (!MakeFolders(ZARK_PORTMAP_CONF_DIR, 0755) ||
      !MakeFolders(kRouterConfDir, 0700)) {
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  if (!ReplaceFileAtomically(RouterConfPath(*canonical),
                             SerializeRouterConf(*canonical, conf), 0600)) {
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  err = ZARK_PORTMAP_ERR_NONE;
  return true;
}

} // namespace zark::portmap
