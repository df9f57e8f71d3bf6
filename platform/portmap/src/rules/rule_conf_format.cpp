#include "rules/rule_conf_format.h"
#include "base/strict_json.h"

#include <json/json.h>

#include <exception>
#include <memory>
#include <sstream>

namespace zark::portmap {
namespace {

constexpr const char *kKeyVersion = "version";
constexpr const char *kKeyRules = "rules";
constexpr const char *kKeyRuleId = "rule_id";
constexpr const char *kKeyEnable = "enable";
constexpr const char *kKeyProtocol = "router_protocol";
constexpr const char *kKeyRouterPort = "router_port";
constexpr const char *kKeyDsPort = "ds_port";
constexpr const char *kKeyServiceId = "serviceid";
constexpr const char *kKeyServiceName = "service_name";

ParsedRuleConf Refuse(std::string why) {
  ParsedRuleConf result;
  result.error = std::move(why);
  return result;
}

// Reads one text member of a rule; false (with why set) when it is missing,
// not a string or does not fit a record field.
bool ReadText(const Json::Value &rule, const char *key, std::size_t index,
              std::string &out, std::string &why) {
  const Json::Value &value = rule[key];
  if (!value.isString()) {
    why = "rule " + std::to_string(index) + ": \"" + key +
          "\" missing or not a string";
    return false;
  }
  const char *begin = nullptr;
  const char *end = nullptr;
  value.getString(&begin, &end);
  std::string_view text(begin, static_cast<std::size_t>(end - begin));
  if (!FitsRuleField(text)) {
    why = "rule " + std::to_string(index) + ": \"" + key +
          "\" longer than 1023 bytes or holds a NUL byte";
    return false;
  }
  out.assign(text);
  return true;
}

bool ReadRule(const Json::Value &value, std::size_t index, RouterRule &rule,
              std::string &why) {
  if (!value.isObject()) {
    why = "rule " + std::to_string(index) + " is not an object";
    return false;
  }
  const Json::Value &enable = value[kKeyEnable];
  if (!enable.isBool()) {
    why = "rule " + std::to_string(index) +
          ": \"enable\" missing or not a boolean";
    return false;
  }
  rule.enable = enable.asBool();
  return ReadText(value, kKeyRuleId, index, rule.ruleId, why) &&
         ReadText(value, kKeyProtocol, index, rule.protocol, why) &&
         ReadText(value, kKeyRouterPort, index, rule.routerPort, why) &&
         ReadText(value, kKeyDsPort, index, rule.dsPort, why) &&
         ReadText(value, kKeyServiceId, index, rule.serviceId, why) &&
         ReadText(value, kKeyServiceName, index, rule.serviceName, why);
}

ParsedRuleConf ParseDocument(std::string_view text) {
  if (text.size() > kMaxRuleConfBytes) {
    return Refuse("larger than " + std::to_string(kMaxRuleConfBytes) +
                  " bytes");
  }
  Json::Value parsedRoot;
  std::string why;
  if (!ParseStrictJsonOrThrow(text, parsedRoot, why, 64)) {
    return Refuse(why);
  }
  // Looked at through a const reference: operator[] then never adds members.
  const Json::Value &root = parsedRoot;
  if (!root.isObject()) {
    return Refuse("top level is not an object");
  }
  const Json::Value &version = root[kKeyVersion];
  if (!version.isInt() || version.asInt() != kRuleConfVersion) {
    return Refuse("\"version\" missing or not 1");
  }
  const Json::Value &rules = root[kKeyRules];
  if (!rules.isArray()) {
    return Refuse("\"rules\" missing or not an array");
  }
  if (rules.size() > kMaxRuleConfRules) {
    return Refuse("more than " + std::to_string(kMaxRuleConfRules) + " rules");
  }
  ParsedRuleConf result;
  result.rules.reserve(rules.size());
  for (Json::ArrayIndex i = 0; i < rules.size(); ++i) {
    RouterRule rule;
    if (!ReadRule(rules[i], i, rule, result.error)) {
      return Refuse(std::move(result.error));
    }
    result.rules.push_back(std::move(rule));
  }
  result.ok = true;
  return result;
}

Json::Value TextValue(const std::string &text) {
  // The (begin, end) constructor keeps every byte, whatever the text holds.
  return Json::Value(text.data(), text.data() + text.size());
}

} // namespace

bool FitsRuleField(std::string_view text) {
  return text.size() <= kMaxRuleFieldBytes &&
         text.find('\0') == std::string_view::npos;
}

ParsedRuleConf ParseRuleConf(std::string_view text) noexcept {
  try {
    return ParseDocument(text);
  } catch (const std::exception &e) {
    // JsonCpp throws on some inputs (nesting beyond the stack limit).
    try {
      return Refuse(std::string("parser gave up: ") + e.what());
    } catch (...) {
      return ParsedRuleConf{};
    }
  } catch (...) {
    return ParsedRuleConf{};
  }
}

std::string SerializeRuleConf(std::span<const RouterRule> rules) {
  Json::Value root(Json::objectValue);
  root[kKeyVersion] = kRuleConfVersion;
  Json::Value &array = root[kKeyRules] = Json::Value(Json::arrayValue);
  for (const RouterRule &rule : rules) {
    Json::Value item(Json::objectValue);
    item[kKeyRuleId] = TextValue(rule.ruleId);
    item[kKeyEnable] = rule.enable;
    item[kKeyProtocol] = TextValue(rule.protocol);
    item[kKeyRouterPort] = TextValue(rule.routerPort);
    item[kKeyDsPort] = TextValue(rule.dsPort);
    item[kKeyServiceId] = TextValue(rule.serviceId);
    item[kKeyServiceName] = TextValue(rule.serviceName);
    array.append(std::move(item));
  }
  return WriteJsonText(root);
}

} // namespace zark::portmap
