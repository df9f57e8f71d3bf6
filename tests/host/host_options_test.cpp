// The host's command line.
#include "host_options.h"
#include "request_guard.h"

#include <gtest/gtest.h>

#include <vector>

namespace zark::host {
namespace {

using namespace std::chrono_literals;

struct Parsed {
  OptionsResult result;
  HostOptions options;
  std::string error;
};

Parsed Parse(std::vector<std::string> args) {
  Parsed parsed;
  parsed.result = ParseHostOptions(args, parsed.options, parsed.error);
  return parsed;
}

TEST(HostOptions, DefaultsListenOnLoopbackPort5000) {
  Parsed parsed = Parse({});
  ASSERT_EQ(parsed.result, OptionsResult::Run);
  EXPECT_EQ(parsed.options.http.address, "127.0.0.1");
  EXPECT_EQ(parsed.options.http.port, 5000);
  EXPECT_EQ(parsed.options.modulesFolder, DefaultModulesFolder());
  EXPECT_EQ(parsed.options.accountsFile, DefaultAccountsFile());
  EXPECT_EQ(parsed.options.http.wwwFolder, DefaultWwwFolder());
  EXPECT_EQ(parsed.options.sessions.idleTimeout, 30min);
  EXPECT_EQ(parsed.options.sessions.maxLifetime, 12h);
  EXPECT_FALSE(parsed.options.secureCookie);
  EXPECT_EQ(parsed.options.modules.keeper_interval_seconds, 300);
  EXPECT_EQ(parsed.options.modules.size, sizeof(ZARK_MODULE_SETTINGS));
}

TEST(HostOptions, EveryOptionTakesItsValue) {
  Parsed parsed = Parse({"--listen", "[::1]:8080", "--modules=/m", "--accounts",
                         "/a", "--www", "/w", "--threads", "3",
                         "--session-idle", "60", "--session-max=3600",
                         "--secure-cookie", "--keeper-interval", "5"});
  ASSERT_EQ(parsed.result, OptionsResult::Run) << parsed.error;
  EXPECT_EQ(parsed.options.http.address, "::1");
  EXPECT_EQ(parsed.options.http.port, 8080);
  EXPECT_EQ(parsed.options.modulesFolder, "/m");
  EXPECT_EQ(parsed.options.accountsFile, "/a");
  EXPECT_EQ(parsed.options.http.wwwFolder, "/w");
  EXPECT_EQ(parsed.options.http.threads, 3u);
  EXPECT_EQ(parsed.options.sessions.idleTimeout, 60s);
  EXPECT_EQ(parsed.options.sessions.maxLifetime, 1h);
  EXPECT_TRUE(parsed.options.secureCookie);
  EXPECT_EQ(parsed.options.modules.keeper_interval_seconds, 5);
}

TEST(HostOptions, HostNamesAddToTheMachinesOwn) {
  Parsed none = Parse({});
  ASSERT_EQ(none.result, OptionsResult::Run);
  EXPECT_TRUE(none.options.http.hostNames.empty());

  Parsed parsed =
      Parse({"--host-name", "nas.example.net", "--host-name=proxy"});
  ASSERT_EQ(parsed.result, OptionsResult::Run) << parsed.error;
  std::vector<std::string> expected = LocalHostNames();
  expected.push_back("nas.example.net");
  expected.push_back("proxy");
  EXPECT_EQ(parsed.options.http.hostNames, expected);
  EXPECT_TRUE(
      IsAllowedHost("nas.example.net:5000", parsed.options.http.hostNames));
  EXPECT_TRUE(IsAllowedHost("localhost:5000", parsed.options.http.hostNames));
  EXPECT_FALSE(
      IsAllowedHost("rebind.example.org", parsed.options.http.hostNames));

  Parsed empty = Parse({"--host-name", ""});
  EXPECT_EQ(empty.result, OptionsResult::Error);
  EXPECT_EQ(empty.error, "--host-name takes a name");
}

TEST(HostOptions, BadValuesAreErrors) {
  for (std::vector<std::string> args :
       {std::vector<std::string>{"--listen", "localhost:5000"},
        {"--listen", "127.0.0.1"},
        {"--listen", "127.0.0.1:0"},
        {"--listen", "127.0.0.1:65536"},
        {"--listen", "::1:5000"},
        {"--threads", "0"},
        {"--threads", "many"},
        {"--session-idle", "0"},
        {"--session-idle"},
        {"--keeper-interval", "0"},
        {"--keeper-interval", "86401"},
        {"--keeper-interval", "5m"},
        {"--bogus"},
        {"-x"},
        {"stray"}}) {
    Parsed parsed = Parse(args);
    EXPECT_EQ(parsed.result, OptionsResult::Error) << args[0];
    EXPECT_FALSE(parsed.error.empty());
  }
}

TEST(HostOptions, HelpIsAsked) {
  EXPECT_EQ(Parse({"--help"}).result, OptionsResult::Help);
  EXPECT_EQ(Parse({"-h"}).result, OptionsResult::Help);
  EXPECT_NE(HostUsage("zark-webapid").find("--listen"), std::string::npos);
}

TEST(HostOptions, ListenTakesIPv4AndBracketedIPv6) {
  std::string address;
  int port = 0;
  EXPECT_TRUE(ParseListen("0.0.0.0:1", address, port));
  EXPECT_EQ(address, "0.0.0.0");
  EXPECT_EQ(port, 1);
  EXPECT_TRUE(ParseListen("[fe80::1]:65535", address, port));
  EXPECT_EQ(address, "fe80::1");
  EXPECT_EQ(port, 65535);
  EXPECT_FALSE(ParseListen("[]:80", address, port));
  EXPECT_FALSE(ParseListen(":80", address, port));
}

} // namespace
} // namespace zark::host
