#include "probe_protocol.h"

#include <array>
#include <charconv>
#include <optional>
#include <vector>

namespace zark::probe {
namespace {

bool IsBlank(char c) {
  return c == ' ' || c == '\t';
}

bool IsTokenCharacter(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') ||
         (c >= '0' && c <= '9') || c == '-' || c == '_';
}

// A JSON string of text. Our texts are fixed words and addresses printed by
// inet_ntop, but nothing here relies on that.
std::string JsonString(std::string_view text) {
  std::string out = "\"";
  for (char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (c == '"' || c == '\\') {
      out += '\\';
      out += c;
    } else if (byte < 0x20 || byte >= 0x7f) {
      static const char kHex[] = "0123456789abcdef";
      out += "\\u00";
      out += kHex[byte >> 4];
      out += kHex[byte & 0xf];
    } else {
      out += c;
    }
  }
  out += '"';
  return out;
}

std::optional<uint16_t> ParsePort(std::string_view text) {
  if (text.empty() || text.size() > 5 || text.front() == '0') {
    return std::nullopt;
  }
  unsigned value = 0;
  auto [end, error] =
      std::from_chars(text.data(), text.data() + text.size(), value);
  if (error != std::errc() || end != text.data() + text.size() || value < 1 ||
      value > 65535) {
    return std::nullopt;
  }
  return static_cast<uint16_t>(value);
}

} // namespace

const char *TransportName(Transport transport) {
  return transport == Transport::kTcp ? "tcp" : "udp";
}

const char *ParseErrorName(ParseError error) {
  switch (error) {
  case ParseError::kNone:
    return "none";
  case ParseError::kEmpty:
    return "empty";
  case ParseError::kBadCharacter:
    return "bad-character";
  case ParseError::kUnknownCommand:
    return "unknown-command";
  case ParseError::kBadTransport:
    return "bad-protocol";
  case ParseError::kBadPort:
    return "bad-port";
  case ParseError::kBadToken:
    return "bad-token";
  case ParseError::kMissingField:
    return "missing-field";
  case ParseError::kExtraField:
    return "extra-field";
  }
  return "unknown";
}

const char *ResultName(Result result) {
  switch (result) {
  case Result::kReachable:
    return "reachable";
  case Result::kUnreachable:
    return "unreachable";
  case Result::kUnknown:
    return "unknown";
  }
  return "unknown";
}

bool IsValidToken(std::string_view token) noexcept {
  if (token.empty() || token.size() > kMaxTokenLength) {
    return false;
  }
  for (char c : token) {
    if (!IsTokenCharacter(c)) {
      return false;
    }
  }
  return true;
}

ParsedRequest ParseRequestLine(std::string_view line) noexcept {
  ParsedRequest parsed;
  if (!line.empty() && line.back() == '\r') {
    line.remove_suffix(1);
  }
  for (char c : line) {
    const auto byte = static_cast<unsigned char>(c);
    if (!IsBlank(c) && (byte < 0x21 || byte > 0x7e)) {
      parsed.error = ParseError::kBadCharacter;
      return parsed;
    }
  }
  // At most four fields are ever valid; a fifth is only counted.
  std::array<std::string_view, 4> fields;
  std::size_t count = 0;
  std::size_t i = 0;
  while (i < line.size()) {
    while (i < line.size() && IsBlank(line[i])) {
      ++i;
    }
    if (i == line.size()) {
      break;
    }
    std::size_t start = i;
    while (i < line.size() && !IsBlank(line[i])) {
      ++i;
    }
    if (count == fields.size()) {
      parsed.error = ParseError::kExtraField;
      return parsed;
    }
    fields[count++] = line.substr(start, i - start);
  }
  if (count == 0) {
    parsed.error = ParseError::kEmpty;
    return parsed;
  }
  if (fields[0] == "address") {
    if (count > 1) {
      parsed.error = ParseError::kExtraField;
      return parsed;
    }
    parsed.request.kind = Request::Kind::kAddress;
    return parsed;
  }
  if (fields[0] != "check") {
    parsed.error = ParseError::kUnknownCommand;
    return parsed;
  }
  if (count < 3) {
    parsed.error = ParseError::kMissingField;
    return parsed;
  }
  parsed.request.kind = Request::Kind::kCheck;
  if (fields[1] == "tcp") {
    parsed.request.transport = Transport::kTcp;
  } else if (fields[1] == "udp") {
    parsed.request.transport = Transport::kUdp;
  } else {
    parsed.error = ParseError::kBadTransport;
    return parsed;
  }
  std::optional<uint16_t> port = ParsePort(fields[2]);
  if (!port) {
    parsed.error = ParseError::kBadPort;
    return parsed;
  }
  parsed.request.port = *port;
  if (count == 4) {
    if (!IsValidToken(fields[3])) {
      parsed.error = ParseError::kBadToken;
      return parsed;
    }
    parsed.request.token = std::string(fields[3]);
  }
  return parsed;
}

std::string FormatRequest(const Request &request) {
  if (request.kind == Request::Kind::kAddress) {
    return "address\n";
  }
  std::string line = "check ";
  line += TransportName(request.transport);
  line += ' ';
  line += std::to_string(request.port);
  if (!request.token.empty()) {
    line += ' ';
    line += request.token;
  }
  line += '\n';
  return line;
}

std::string FormatCheckAnswer(const Request &request, const Verdict &verdict) {
  return "{\"result\":" + JsonString(ResultName(verdict.result)) +
         ",\"reason\":" + JsonString(verdict.reason) +
         ",\"protocol\":" + JsonString(TransportName(request.transport)) +
         ",\"port\":" + std::to_string(request.port) + "}\n";
}

std::string FormatAddressAnswer(std::string_view address) {
  return "{\"result\":\"address\",\"address\":" + JsonString(address) + "}\n";
}

std::string FormatBadRequestAnswer(ParseError error) {
  return "{\"result\":\"error\",\"reason\":\"bad-request\",\"detail\":" +
         JsonString(ParseErrorName(error)) + "}\n";
}

std::string FormatErrorAnswer(const char *reason, long long retryAfterMs) {
  std::string answer = "{\"result\":\"error\",\"reason\":" + JsonString(reason);
  if (retryAfterMs >= 0) {
    answer += ",\"retry_after_ms\":" + std::to_string(retryAfterMs);
  }
  answer += "}\n";
  return answer;
}

} // namespace zark::probe
