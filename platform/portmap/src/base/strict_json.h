// Reading and writing the library's JSON documents (the rule file, the
// router configuration, the detection result, the mapping state, the probe
// service's answers, the port tests' files) the same strict way: RFC 8259 only
// (no comments, no trailing commas, no duplicate keys, nothing after the
// document), bounded nesting.
#ifndef ZARK_PORTMAP_STRICT_JSON_H
#define ZARK_PORTMAP_STRICT_JSON_H

#include <json/json.h>

#include <string>
#include <string_view>

namespace zark::portmap {

// Parses text into root. False, with why set to "not valid JSON: " and the
// reader's errors, for anything that is not one strict JSON document.
// Throws what the reader throws: std::bad_alloc, and Json::Exception for a
// document nested deeper than depth, for callers that report those apart.
[[nodiscard]] bool ParseStrictJsonOrThrow(std::string_view text,
                                          Json::Value &root, std::string &why,
                                          int depth);

// ParseStrictJsonOrThrow, with a thrown exception turned into false and why
// "not valid JSON: " and its text. Never throws.
[[nodiscard]] bool ParseStrictJson(std::string_view text, Json::Value &root,
                                   std::string &why, int depth = 16) noexcept;

// The text of value: members sorted by name, two-space indentation, a final
// newline; bytes 0x80 and above written as they are.
[[nodiscard]] std::string WriteJsonText(const Json::Value &value);

// The member key of object as a string: false (why set) when it is missing
// or not a string, or longer than maxBytes.
[[nodiscard]] bool ReadJsonString(const Json::Value &object, const char *key,
                                  std::string &out, std::string &why,
                                  std::size_t maxBytes = 1023);
// The member key of object as an int in min..max: false (why set) when it
// is missing, not an integer or out of range.
[[nodiscard]] bool ReadJsonInt(const Json::Value &object, const char *key,
                               long long min, long long max, long long &out,
                               std::string &why);

} // namespace zark::portmap

#endif
