// The host's wire protocol: form fields in, JSON answers out.
//
// A call is a GET query or an application/x-www-form-urlencoded POST body:
//   api=ZARK.Core.PortForwarding.Rules&version=1&method=save
//     &rules=%5B%7B%22enable%22%3Atrue%7D%5D&task_id_suffix=web
// "api", "version" and "method" address the method; every other field is
// one request parameter whose value is read as JSON text, or taken as a
// plain string when it is not valid JSON. Answers:
//   {"success": true, "data": ...}
//   {"success": false, "error": {"code": N, "errors": ...}}
// with "data" and "errors" left out when null.
#ifndef ZARK_HOST_WIRE_PROTOCOL_H
#define ZARK_HOST_WIRE_PROTOCOL_H

#include "webapi.h"

#include <json/json.h>

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zark::host {

// One decoded field of a form, in the order of the text.
struct FormField {
  std::string name;
  std::string value;
};
using FormFields = std::vector<FormField>;

enum class FormResult {
  Ok,
  BadEncoding,   // "%" without two hex digits after it, or an empty name
  TooManyFields, // more than maxFields fields in all
};

// Decodes application/x-www-form-urlencoded text ("a=1&b=%7B%7D", "+" for a
// space) and appends its fields to fields. Empty pieces ("a=1&&b=2") are
// skipped; a piece without "=" is a field with an empty value. maxFields
// bounds the size of fields after the call, fields already in it included.
// On failure fields may hold part of the text's fields.
[[nodiscard]] FormResult DecodeForm(std::string_view text,
                                    std::size_t maxFields, FormFields &fields);

// A parameter's value: the JSON value of text under JsonCpp's strict reader
// (no comments, no trailing text, no repeated keys, no NaN, at most 100
// levels deep), except that the root may be any value ("5", "true",
// "\"text\""); when text is not such JSON, the string text itself.
[[nodiscard]] Json::Value ParamValue(std::string_view text);

// A version field: decimal digits only, 1 to 2147483647.
[[nodiscard]] std::optional<int> ParseVersion(std::string_view text);

// A method call read from its fields.
struct ApiCall {
  std::string api;
  std::string method;
  int version = 0;
  Json::Value params{Json::objectValue}; // one member per parameter
};

// A host-level failure: one of the framework's codes and its error data.
struct WireError {
  int code = ZARK::WEBAPI_ERR_UNKNOWN;
  Json::Value errors;
};

// Splits fields into the call and its parameters. False with error set:
//   101 {"field": "api" | "method" | "version"}: the field is missing or
//       empty, or the version is not a version (ParseVersion);
//   101 {"field": name, "reason": "repeated"}: a field appears twice;
//   108 {"limit": "parameters", "max": maxParams}: too many parameters.
[[nodiscard]] bool ParseApiCall(const FormFields &fields, std::size_t maxParams,
                                ApiCall &call, WireError &error);

// Answer shapes.
[[nodiscard]] Json::Value SuccessAnswer(const Json::Value &data);
[[nodiscard]] Json::Value
ErrorAnswer(int code, const Json::Value &errors = Json::Value());
[[nodiscard]] Json::Value ErrorAnswer(const WireError &error);

// The answer an entry function left in response: its success data or its
// error code and data, passed on unchanged; 109 when it set nothing.
[[nodiscard]] Json::Value AnswerFromResponse(const ZARK::APIResponse &response);

// Compact JSON text of an answer. Non-ASCII text is escaped as \uXXXX.
[[nodiscard]] std::string SerializeAnswer(const Json::Value &answer);

} // namespace zark::host

#endif
