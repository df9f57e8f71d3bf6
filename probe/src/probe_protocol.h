// The probe service's wire protocol (see probe/README.md): request lines the
// client sends and the one-line JSON answers the service writes back. Pure:
// no sockets, no clock, so every byte sequence can be fed to the parser.
//
//   check tcp 8080 4f1c0d2a9b7e4d11
//   check udp 5353
//   address
//
// A request never names an address: the service connects back only to the
// address the request came from. Tokens are limited to letters, digits, "-"
// and "_", so "1.2.3.4" or "::1" cannot be smuggled in as one.
#ifndef ZARK_PROBE_PROBE_PROTOCOL_H
#define ZARK_PROBE_PROBE_PROTOCOL_H

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace zark::probe {

// The longest request line, its "\n" included. Longer lines are refused
// without being read to the end.
inline constexpr std::size_t kMaxRequestLine = 200;
inline constexpr std::size_t kMaxTokenLength = 64;
// The longest line a checked port may send back as its token (token + "\n"
// and some slack; anything longer is a wrong answer).
inline constexpr std::size_t kMaxTokenLine = 128;

enum class Transport : uint8_t { kTcp, kUdp };

[[nodiscard]] const char *TransportName(Transport transport);

struct Request {
  enum class Kind : uint8_t { kCheck, kAddress };
  Kind kind = Kind::kCheck;
  Transport transport = Transport::kTcp;
  uint16_t port = 0;
  std::string token; // empty: none given

  friend bool operator==(const Request &, const Request &) = default;
};

// Why a line is not a request. Each has a fixed name (ParseErrorName).
enum class ParseError : uint8_t {
  kNone,
  kEmpty,          // nothing but blanks
  kBadCharacter,   // a byte outside printable ASCII (a final "\r" is fine)
  kUnknownCommand, // neither "check" nor "address"
  kBadTransport,   // not "tcp" or "udp"
  kBadPort,        // not a decimal 1..65535 without leading zeros
  kBadToken,       // empty, too long, or a character other than [A-Za-z0-9_-]
  kMissingField,   // "check" without transport or port
  kExtraField,     // more fields than the command takes
};

[[nodiscard]] const char *ParseErrorName(ParseError error);

struct ParsedRequest {
  ParseError error = ParseError::kNone;
  Request request;
};

// Parses one request line, without its "\n" (a final "\r" is dropped).
// Fields are separated by one or more spaces or tabs; blanks around the line
// are ignored. Never throws.
[[nodiscard]] ParsedRequest ParseRequestLine(std::string_view line) noexcept;

// The canonical line of a request, "\n" included; ParseRequestLine gives the
// request back.
[[nodiscard]] std::string FormatRequest(const Request &request);

// True for a valid token: 1..kMaxTokenLength characters of [A-Za-z0-9_-].
[[nodiscard]] bool IsValidToken(std::string_view token) noexcept;

// The result of one check.
enum class Result : uint8_t {
  kReachable,   // the port answered (with the token, when one was given)
  kUnreachable, // refused, silent, closed, or answered by something else
  kUnknown,     // UDP without a token and no reply: cannot tell
};

[[nodiscard]] const char *ResultName(Result result);

// Reasons, the fixed words of the "reason" member.
namespace reason {
inline constexpr const char *kConnected = "connected"; // TCP, no token
inline constexpr const char *kTokenMatched = "token";  // token read back
inline constexpr const char *kReplied = "replied";     // UDP, no token
inline constexpr const char *kRefused = "refused";     // RST / ICMP
inline constexpr const char *kTimeout = "timeout";     // nothing at all
inline constexpr const char *kNoRoute = "no-route";    // ICMP unreachable
inline constexpr const char *kClosed = "closed";       // EOF before token
inline constexpr const char *kSilent = "silent";       // connected, no token
inline constexpr const char *kWrongAnswer = "wrong-answer"; // other bytes
inline constexpr const char *kNoAnswer = "no-answer";       // UDP, no token
inline constexpr const char *kLocalError = "local-error";   // our socket failed
// Errors of a request.
inline constexpr const char *kRateLimited = "rate-limited";
inline constexpr const char *kBusy = "busy";
inline constexpr const char *kLineTooLong = "line-too-long";
} // namespace reason

struct Verdict {
  Result result = Result::kUnknown;
  const char *reason = reason::kLocalError; // one of reason::*
};

// {"result":"reachable","reason":"token","protocol":"tcp","port":8080}
[[nodiscard]] std::string FormatCheckAnswer(const Request &request,
                                            const Verdict &verdict);
// {"result":"address","address":"203.0.113.5"}
[[nodiscard]] std::string FormatAddressAnswer(std::string_view address);
// {"result":"error","reason":"bad-request","detail":"bad-port"}
[[nodiscard]] std::string FormatBadRequestAnswer(ParseError error);
// {"result":"error","reason":"rate-limited","retry_after_ms":500}
// (retry_after_ms left out when retryAfterMs is negative)
[[nodiscard]] std::string FormatErrorAnswer(const char *reason,
                                            long long retryAfterMs = -1);

} // namespace zark::probe

#endif
