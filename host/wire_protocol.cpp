#include "wire_protocol.h"

#include <charconv>
#include <cstdint>
#include <exception>
#include <limits>
#include <memory>
#include <set>

namespace zark::host {
namespace {

constexpr const char *kApiField = "api";
constexpr const char *kMethodField = "method";
constexpr const char *kVersionField = "version";

int HexDigit(char c) {
  if (c >= '0' && c <= '9') {
    return c - '0';
  }
  if (c >= 'a' && c <= 'f') {
    return c - 'a' + 10;
  }
  if (c >= 'A' && c <= 'F') {
    return c - 'A' + 10;
  }
  return -1;
}

// Decodes one name or value: "+" is a space, "%XY" the byte 0xXY.
bool DecodeComponent(std::string_view text, std::string &out) {
  out.clear();
  out.reserve(text.size());
  for (std::size_t i = 0; i < text.size(); ++i) {
    char c = text[i];
    if (c == '+') {
      out.push_back(' ');
    } else if (c == '%') {
      if (i + 2 >= text.size()) {
        return false;
      }
      int high = HexDigit(text[i + 1]);
      int low = HexDigit(text[i + 2]);
      if (high < 0 || low < 0) {
        return false;
      }
      out.push_back(static_cast<char>(high * 16 + low));
      i += 2;
    } else {
      out.push_back(c);
    }
  }
  return true;
}

const Json::CharReaderBuilder &StrictReaderBuilder() {
  static const Json::CharReaderBuilder builder = [] {
    Json::CharReaderBuilder b;
    Json::CharReaderBuilder::strictMode(&b.settings_);
    // Parameters are often plain numbers, booleans or strings.
    b.settings_["strictRoot"] = false;
    b.settings_["stackLimit"] = 100;
    return b;
  }();
  return builder;
}

WireError MissingField(const char *name) {
  WireError error;
  error.code = ZARK::WEBAPI_ERR_BAD_REQUEST;
  error.errors["field"] = name;
  return error;
}

} // namespace

FormResult DecodeForm(std::string_view text, std::size_t maxFields,
                      FormFields &fields) {
  std::size_t start = 0;
  while (start <= text.size()) {
    std::size_t end = text.find('&', start);
    if (end == std::string_view::npos) {
      end = text.size();
    }
    std::string_view piece = text.substr(start, end - start);
    start = end + 1;
    if (piece.empty()) {
      continue;
    }
    if (fields.size() >= maxFields) {
      return FormResult::TooManyFields;
    }
    std::size_t equals = piece.find('=');
    std::string_view name = piece.substr(0, equals);
    std::string_view value = equals == std::string_view::npos
                                 ? std::string_view()
                                 : piece.substr(equals + 1);
    FormField field;
    if (!DecodeComponent(name, field.name) || field.name.empty() ||
        !DecodeComponent(value, field.value)) {
      return FormResult::BadEncoding;
    }
    fields.push_back(std::move(field));
  }
  return FormResult::Ok;
}

Json::Value ParamValue(std::string_view text) {
  std::unique_ptr<Json::CharReader> reader(
      StrictReaderBuilder().newCharReader());
  Json::Value value;
  std::string errors;
  bool parsed = false;
  // The reader throws, rather than fails, beyond its nesting limit.
  try {
    parsed =
        !text.empty() &&
        reader->parse(text.data(), text.data() + text.size(), &value, &errors);
  } catch (const std::exception &) {
    parsed = false;
  }
  if (parsed) {
    return value;
  }
  return Json::Value(std::string(text));
}

std::optional<int> ParseVersion(std::string_view text) {
  if (text.empty() || text.size() > 10) {
    return std::nullopt;
  }
  for (char c : text) {
    if (c < '0' || c > '9') {
      return std::nullopt;
    }
  }
  std::int64_t value = 0;
  auto [end, status] =
      std::from_chars(text.data(), text.data() + text.size(), value);
  if (status != std::errc() || end != text.data() + text.size() || value < 1 ||
      value > std::numeric_limits<std::int32_t>::max()) {
    return std::nullopt;
  }
  return static_cast<int>(value);
}

bool ParseApiCall(const FormFields &fields, std::size_t maxParams,
                  ApiCall &call, WireError &error) {
  std::set<std::string_view> seen;
  const std::string *api = nullptr;
  const std::string *method = nullptr;
  const std::string *version = nullptr;
  Json::Value params(Json::objectValue);
  std::size_t paramCount = 0;
  for (const FormField &field : fields) {
    if (!seen.insert(field.name).second) {
      error = WireError{ZARK::WEBAPI_ERR_BAD_REQUEST, Json::Value()};
      error.errors["field"] = field.name;
      error.errors["reason"] = "repeated";
      return false;
    }
    if (field.name == kApiField) {
      api = &field.value;
    } else if (field.name == kMethodField) {
      method = &field.value;
    } else if (field.name == kVersionField) {
      version = &field.value;
    } else {
      if (++paramCount > maxParams) {
        error = WireError{ZARK::WEBAPI_ERR_TOO_LARGE, Json::Value()};
        error.errors["limit"] = "parameters";
        error.errors["max"] = static_cast<Json::UInt64>(maxParams);
        return false;
      }
      params[field.name] = ParamValue(field.value);
    }
  }
  if (api == nullptr || api->empty()) {
    error = MissingField(kApiField);
    return false;
  }
  if (method == nullptr || method->empty()) {
    error = MissingField(kMethodField);
    return false;
  }
  std::optional<int> versionNumber;
  if (version != nullptr) {
    versionNumber = ParseVersion(*version);
  }
  if (!versionNumber) {
    error = MissingField(kVersionField);
    return false;
  }
  call.api = *api;
  call.method = *method;
  call.version = *versionNumber;
  call.params = std::move(params);
  return true;
}

Json::Value SuccessAnswer(const Json::Value &data) {
  Json::Value answer(Json::objectValue);
  answer["success"] = true;
  if (!data.isNull()) {
    answer["data"] = data;
  }
  return answer;
}

Json::Value ErrorAnswer(int code, const Json::Value &errors) {
  Json::Value answer(Json::objectValue);
  answer["success"] = false;
  Json::Value error(Json::objectValue);
  error["code"] = code;
  if (!errors.isNull()) {
    error["errors"] = errors;
  }
  answer["error"] = error;
  return answer;
}

Json::Value ErrorAnswer(const WireError &error) {
  return ErrorAnswer(error.code, error.errors);
}

Json::Value AnswerFromResponse(const ZARK::APIResponse &response) {
  switch (response.GetState()) {
  case ZARK::APIResponse::State::Success:
    return SuccessAnswer(response.GetData());
  case ZARK::APIResponse::State::Error:
    return ErrorAnswer(response.GetErrorCode(), response.GetErrorData());
  case ZARK::APIResponse::State::None:
    break;
  }
  return ErrorAnswer(ZARK::WEBAPI_ERR_NO_ANSWER);
}

std::string SerializeAnswer(const Json::Value &answer) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  return Json::writeString(builder, answer);
}

} // namespace zark::host
