#include "catalog/detect_result_store.h"

#include "base/conf_file.h"
#include "base/portmap_log.h"
#include "base/strict_json.h"

#include <json/json.h>

#include <array>
#include <cstring>
#include <exception>
#include <memory>

namespace zark::portmap {
namespace {

// Seven texts of 1023 bytes, escaped, and a few numbers: far below this.
constexpr std::size_t kMaxDetectResultBytes = 64u * 1024u;

constexpr const char *kKeyFormat = "format";

// The record's text fields by JSON member name.
std::array<std::pair<const char *, char *>, 7>
TextFields(ZARK_ROUTER_DETECT_RESULT &result) {
  return {{{"gateway_ip", result.gateway_ip},
           {"network_interface", result.network_interface},
           {"router_brand", result.router_brand},
           {"router_model", result.router_model},
           {"router_version", result.router_version},
           {"upnp_pfpath", result.upnp_pfpath},
           {"router_user_setting_name", result.router_user_setting_name}}};
}

// The record's signed integer fields by JSON member name.
std::array<std::pair<const char *, int32_t *>, 6>
IntFields(ZARK_ROUTER_DETECT_RESULT &result) {
  return {{{"en_progress", &result.enProgress},
           {"reserved", &result.reserved},
           {"hops", &result.hops},
           {"support_upnp", &result.support_upnp},
           {"support_natpmp", &result.support_natpmp},
           {"router_max_rule", &result.router_max_rule}}};
}

bool ParseDocument(std::string_view text, ZARK_ROUTER_DETECT_RESULT &out,
                   std::string &why) {
  if (text.size() > kMaxDetectResultBytes) {
    why = "larger than " + std::to_string(kMaxDetectResultBytes) + " bytes";
    return false;
  }
  Json::Value root;
  if (!ParseStrictJsonOrThrow(text, root, why, 8)) {
    return false;
  }
  if (!root.isObject()) {
    why = "top level is not an object";
    return false;
  }
  if (!root[kKeyFormat].isInt() ||
      root[kKeyFormat].asInt() != kDetectResultFormat) {
    why = "\"format\" missing or not 1";
    return false;
  }
  ZARK_ROUTER_DETECT_RESULT result{};
  for (auto [key, field] : IntFields(result)) {
    const Json::Value &value = root[key];
    if (!value.isInt()) {
      why = std::string("\"") + key + "\" missing or not a 32-bit integer";
      return false;
    }
    *field = value.asInt();
  }
  const Json::Value &warning = root["warning"];
  if (!warning.isUInt()) {
    why = "\"warning\" missing or not an unsigned 32-bit integer";
    return false;
  }
  result.warning = warning.asUInt();
  for (auto [key, field] : TextFields(result)) {
    const Json::Value &value = root[key];
    if (!value.isString()) {
      why = std::string("\"") + key + "\" missing or not a string";
      return false;
    }
    const char *begin = nullptr;
    const char *end = nullptr;
    value.getString(&begin, &end);
    std::string_view textValue(begin, static_cast<std::size_t>(end - begin));
    if (textValue.size() >= ZARK_PORTMAP_TEXT_SIZE ||
        textValue.find('\0') != std::string_view::npos) {
      why = std::string("\"") + key +
            "\" longer than 1023 bytes or holds a NUL byte";
      return false;
    }
    std::memcpy(field, textValue.data(), textValue.size());
  }
  out = result;
  return true;
}

} // namespace

std::string SerializeDetectResult(const ZARK_ROUTER_DETECT_RESULT &result) {
  ZARK_ROUTER_DETECT_RESULT copy = result;
  Json::Value root(Json::objectValue);
  root[kKeyFormat] = kDetectResultFormat;
  for (auto [key, field] : IntFields(copy)) {
    root[key] = *field;
  }
  root["warning"] = copy.warning;
  for (auto [key, field] : TextFields(copy)) {
    root[key] =
        Json::Value(field, field + ::strnlen(field, ZARK_PORTMAP_TEXT_SIZE));
  }
  return WriteJsonText(root);
}

bool ParseDetectResult(std::string_view text, ZARK_ROUTER_DETECT_RESULT &result,
                       std::string &why) noexcept {
  try {
    return ParseDocument(text, result, why);
  } catch (const std::exception &e) {
    why = e.what();
    return false;
  }
}

bool StoreDetectResult(const std::string &path,
                       const ZARK_ROUTER_DETECT_RESULT &result) {
  return ReplaceFileAtomically(path, SerializeDetectResult(result), 0644);
}

DetectResultLoad LoadDetectResult(const std::string &path,
                                  ZARK_ROUTER_DETECT_RESULT &result) {
  ReadResult read = ReadSmallFile(path, kMaxDetectResultBytes);
  if (read.status == ReadStatus::kMissing) {
    return DetectResultLoad::kNone;
  }
  if (read.status != ReadStatus::kRead) {
    ZARK_PM_LOG_ERROR("cannot read the detection result %s", path.c_str());
    return DetectResultLoad::kBroken;
  }
  std::string why;
  if (!ParseDetectResult(read.content, result, why)) {
    ZARK_PM_LOG_ERROR("the detection result %s is not understood: %s",
                      path.c_str(), why.c_str());
    return DetectResultLoad::kBroken;
  }
  return DetectResultLoad::kLoaded;
}

} // namespace zark::portmap
