#include "base/strict_json.h"

#include <exception>
#include <memory>

namespace zark::portmap {

bool ParseStrictJsonOrThrow(std::string_view text, Json::Value &root,
                            std::string &why, int depth) {
  Json::CharReaderBuilder builder;
  // RFC 8259 only: no comments, no trailing content, no duplicate keys, and
  // a nesting limit so that hostile input cannot exhaust the stack.
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  builder.settings_["stackLimit"] = depth;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  std::string errors;
  Json::Value parsed;
  if (!reader->parse(text.data(), text.data() + text.size(), &parsed,
                     &errors)) {
    why = "not valid JSON: " + errors;
    return false;
  }
  root = std::move(parsed);
  return true;
}

bool ParseStrictJson(std::string_view text, Json::Value &root, std::string &why,
                     int depth) noexcept {
  try {
    return ParseStrictJsonOrThrow(text, root, why, depth);
  } catch (const std::exception &e) {
    why = std::string("not valid JSON: ") + e.what();
    return false;
  }
}

std::string WriteJsonText(const Json::Value &value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "  ";
  builder["emitUTF8"] = true;
  return Json::writeString(builder, value) + "\n";
}

bool ReadJsonString(const Json::Value &object, const char *key,
                    std::string &out, std::string &why, std::size_t maxBytes) {
  const Json::Value &value = object[key];
  if (!value.isString()) {
    why = std::string("\"") + key + "\" is missing or not a string";
    return false;
  }
  std::string text = value.asString();
  if (text.size() > maxBytes || text.find('\0') != std::string::npos) {
    why = std::string("\"") + key + "\" is too long or holds NUL";
    return false;
  }
  out = std::move(text);
  return true;
}

bool ReadJsonInt(const Json::Value &object, const char *key, long long min,
                 long long max, long long &out, std::string &why) {
  const Json::Value &value = object[key];
  if (!value.isInt64() || value.asInt64() < min || value.asInt64() > max) {
    why = std::string("\"") + key + "\" is missing or not an integer in " +
          std::to_string(min) + ".." + std::to_string(max);
    return false;
  }
  out = value.asInt64();
  return true;
}

} // namespace zark::portmap
