// The request parser and the answers of the probe service.
#include "probe_protocol.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace zark::probe {
namespace {

Request Check(Transport transport, uint16_t port, std::string token = "") {
  Request request;
  request.kind = Request::Kind::kCheck;
  request.transport = transport;
  request.port = port;
  request.token = std::move(token);
  return request;
}

TEST(ProbeProtocol, ParsesChecksWithAndWithoutToken) {
  ParsedRequest parsed = ParseRequestLine("check tcp 8080 4f1c0d2a9b7e4d11");
  ASSERT_EQ(ParseError::kNone, parsed.error);
  EXPECT_EQ(Check(Transport::kTcp, 8080, "4f1c0d2a9b7e4d11"), parsed.request);

  parsed = ParseRequestLine("check udp 5353");
  ASSERT_EQ(ParseError::kNone, parsed.error);
  EXPECT_EQ(Check(Transport::kUdp, 5353), parsed.request);

  parsed = ParseRequestLine("  check\ttcp   65535  a-B_9 \r");
  ASSERT_EQ(ParseError::kNone, parsed.error);
  EXPECT_EQ(Check(Transport::kTcp, 65535, "a-B_9"), parsed.request);
}

TEST(ProbeProtocol, ParsesAddress) {
  ParsedRequest parsed = ParseRequestLine("address");
  ASSERT_EQ(ParseError::kNone, parsed.error);
  EXPECT_EQ(Request::Kind::kAddress, parsed.request.kind);
  EXPECT_EQ(ParseError::kExtraField, ParseRequestLine("address 1.2.3.4").error);
}

struct Refusal {
  const char *line;
  ParseError error;
};

TEST(ProbeProtocol, RefusesWhatIsNotARequest) {
  const std::vector<Refusal> refusals = {
      {"", ParseError::kEmpty},
      {" \t ", ParseError::kEmpty},
      {"CHECK tcp 80", ParseError::kUnknownCommand},
      {"scan tcp 80", ParseError::kUnknownCommand},
      {"check", ParseError::kMissingField},
      {"check tcp", ParseError::kMissingField},
      {"check sctp 80", ParseError::kBadTransport},
      {"check TCP 80", ParseError::kBadTransport},
      {"check tcp 0", ParseError::kBadPort},
      {"check tcp 65536", ParseError::kBadPort},
      {"check tcp 080", ParseError::kBadPort},
      {"check tcp +80", ParseError::kBadPort},
      {"check tcp 80x", ParseError::kBadPort},
      {"check tcp 123456", ParseError::kBadPort},
      {"check tcp 80 tok*en", ParseError::kBadToken},
      {"check tcp 80 "
       "01234567890123456789012345678901234567890123456789012345678901234",
       ParseError::kBadToken},
      {"check tcp 80 token more", ParseError::kExtraField},
      {"check tcp 80\x01", ParseError::kBadCharacter},
      {"check tcp 80 tok\xc3\xa9n", ParseError::kBadCharacter},
      {"check tcp 80\r\r", ParseError::kBadCharacter},
  };
  for (const Refusal &refusal : refusals) {
    EXPECT_EQ(refusal.error, ParseRequestLine(refusal.line).error)
        << "[" << refusal.line << "]";
  }
}

// A request cannot name where to connect: wherever an address could be
// slipped in, the line is refused.
TEST(ProbeProtocol, NoAddressCanBeNamed) {
  const std::vector<Refusal> refusals = {
      {"check tcp 10.0.0.1:80", ParseError::kBadPort},
      {"check tcp 80 10.0.0.1", ParseError::kBadToken},
      {"check tcp 80 ::1", ParseError::kBadToken},
      {"check tcp 80 [2001:db8::1]", ParseError::kBadToken},
      {"check tcp 80 token 10.0.0.1", ParseError::kExtraField},
      {"check 10.0.0.1 tcp 80", ParseError::kBadTransport},
      {"check tcp 80 example.org", ParseError::kBadToken},
      {"check tcp 80 token@10.0.0.1", ParseError::kBadToken},
  };
  for (const Refusal &refusal : refusals) {
    EXPECT_EQ(refusal.error, ParseRequestLine(refusal.line).error)
        << "[" << refusal.line << "]";
  }
}

TEST(ProbeProtocol, FormatsRequestsThatParseBack) {
  for (const Request &request :
       {Check(Transport::kTcp, 1), Check(Transport::kUdp, 65535, "x"),
        Check(Transport::kTcp, 8080, "abc-DEF_123")}) {
    const std::string line = FormatRequest(request);
    ASSERT_FALSE(line.empty());
    ASSERT_EQ('\n', line.back());
    ParsedRequest parsed = ParseRequestLine(line.substr(0, line.size() - 1));
    EXPECT_EQ(ParseError::kNone, parsed.error) << line;
    EXPECT_EQ(request, parsed.request) << line;
  }
  EXPECT_EQ("check udp 53\n", FormatRequest(Check(Transport::kUdp, 53)));
  Request address;
  address.kind = Request::Kind::kAddress;
  EXPECT_EQ("address\n", FormatRequest(address));
}

TEST(ProbeProtocol, Answers) {
  EXPECT_EQ("{\"result\":\"reachable\",\"reason\":\"token\",\"protocol\":"
            "\"tcp\",\"port\":8080}\n",
            FormatCheckAnswer(Check(Transport::kTcp, 8080, "t"),
                              {Result::kReachable, reason::kTokenMatched}));
  EXPECT_EQ("{\"result\":\"unknown\",\"reason\":\"no-answer\",\"protocol\":"
            "\"udp\",\"port\":53}\n",
            FormatCheckAnswer(Check(Transport::kUdp, 53),
                              {Result::kUnknown, reason::kNoAnswer}));
  EXPECT_EQ("{\"result\":\"address\",\"address\":\"203.0.113.5\"}\n",
            FormatAddressAnswer("203.0.113.5"));
  EXPECT_EQ("{\"result\":\"address\",\"address\":\"a\\\"b\\u000a\"}\n",
            FormatAddressAnswer("a\"b\n"));
  EXPECT_EQ("{\"result\":\"error\",\"reason\":\"bad-request\",\"detail\":"
            "\"bad-port\"}\n",
            FormatBadRequestAnswer(ParseError::kBadPort));
  EXPECT_EQ("{\"result\":\"error\",\"reason\":\"rate-limited\","
            "\"retry_after_ms\":500}\n",
            FormatErrorAnswer(reason::kRateLimited, 500));
  EXPECT_EQ("{\"result\":\"error\",\"reason\":\"busy\"}\n",
            FormatErrorAnswer(reason::kBusy));
}

TEST(ProbeProtocol, Tokens) {
  EXPECT_TRUE(IsValidToken("a"));
  EXPECT_TRUE(IsValidToken(std::string(kMaxTokenLength, 'z')));
  EXPECT_FALSE(IsValidToken(""));
  EXPECT_FALSE(IsValidToken(std::string(kMaxTokenLength + 1, 'z')));
  EXPECT_FALSE(IsValidToken("a.b"));
  EXPECT_FALSE(IsValidToken("a:b"));
  EXPECT_FALSE(IsValidToken("a b"));
}

} // namespace
} // namespace zark::probe
