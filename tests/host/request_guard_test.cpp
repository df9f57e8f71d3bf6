// The request guard's checks: Host names, same-origin, control characters.
#include "request_guard.h"

#include <gtest/gtest.h>

namespace zark::host {
namespace {

const std::vector<std::string> kNames = {"localhost", "router", "router.local"};

TEST(HostRequestGuard, AddressLiteralsAndOwnNamesAreThisHost) {
  for (const char *host : {"", "127.0.0.1", "192.0.2.1:5000", "[::1]",
                           "[::1]:5000", "[fe80::1]:80", "localhost",
                           "LocalHost:5000", "router.", "router.local:1"}) {
    EXPECT_TRUE(IsAllowedHost(host, kNames)) << host;
  }
}

TEST(HostRequestGuard, OtherNamesAndMalformedHostsAreNot) {
  for (const char *host :
       {"evil.example", "evil.example:5000", "127.0.0.1.evil.example",
        "localhost.evil.example", "[::1", "[::1]x", "[evil]:80", "::1",
        "localhost:http", ":5000", "router:5000:1"}) {
    EXPECT_FALSE(IsAllowedHost(host, kNames)) << host;
  }
}

TEST(HostRequestGuard, SameOriginIsSchemeAndTheRequestsHost) {
  EXPECT_TRUE(IsSameOrigin("http://127.0.0.1:5000", "127.0.0.1:5000"));
  EXPECT_TRUE(IsSameOrigin("HTTPS://Router", "router"));
  EXPECT_FALSE(IsSameOrigin("http://evil.example", "127.0.0.1:5000"));
  EXPECT_FALSE(IsSameOrigin("http://127.0.0.1:5001", "127.0.0.1:5000"));
  EXPECT_FALSE(IsSameOrigin("null", "127.0.0.1:5000"));
  EXPECT_FALSE(IsSameOrigin("ftp://127.0.0.1:5000", "127.0.0.1:5000"));
  EXPECT_FALSE(IsSameOrigin("http://", ""));
}

TEST(HostRequestGuard, ControlCharactersInPaths) {
  EXPECT_TRUE(HasControlCharacter(std::string("/index.html\0.png", 16)));
  EXPECT_TRUE(HasControlCharacter("/a\nb"));
  EXPECT_TRUE(HasControlCharacter("/a\x7f"));
  EXPECT_FALSE(HasControlCharacter("/index.html"));
  EXPECT_FALSE(HasControlCharacter("/caf\xc3\xa9"));
}

TEST(HostRequestGuard, LocalNamesIncludeLocalhost) {
  std::vector<std::string> names = LocalHostNames();
  ASSERT_FALSE(names.empty());
  EXPECT_EQ(names.front(), "localhost");
}

} // namespace
} // namespace zark::host
