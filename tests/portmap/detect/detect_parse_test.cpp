// The pure parts of detection: address classes, routes and interfaces,
// WAN host lists, hop counts, resolv.conf and DNS messages, SSDP answers,
// router names, and the kept result's file format.
#include "base/ipv4_class.h"
#include "catalog/detect_result_store.h"
#include "detect_fakes.h"
#include "dns_answer.h"
#include "net/ssdp_search.h"

#include "syslog_capture.h"

#include <ares.h>
#include <gtest/gtest.h>

#include <cstring>

namespace zark::test {
namespace {

using namespace zark::portmap;
using Bytes = std::vector<uint8_t>;

// --- Address classes
// ----------------------------------------------------------

TEST(DetectParseIpv4Class, ClassifiesTheRangesDetectionCaresAbout) {
  const std::vector<std::pair<std::string, Ipv4Class>> cases = {
      {"10.0.0.1", Ipv4Class::kPrivate},
      {"10.255.255.255", Ipv4Class::kPrivate},
      {"172.16.0.1", Ipv4Class::kPrivate},
      {"172.31.255.254", Ipv4Class::kPrivate},
      {"172.32.0.1", Ipv4Class::kPublic},
      {"172.15.255.255", Ipv4Class::kPublic},
      {"192.168.77.1", Ipv4Class::kPrivate},
      {"192.169.0.1", Ipv4Class::kPublic},
      {"100.64.0.0", Ipv4Class::kSharedCgn},
      {"100.127.255.255", Ipv4Class::kSharedCgn},
      {"100.128.0.0", Ipv4Class::kPublic},
      {"100.63.255.255", Ipv4Class::kPublic},
      {"127.0.0.1", Ipv4Class::kLoopback},
      {"169.254.1.1", Ipv4Class::kLinkLocal},
      {"0.0.0.0", Ipv4Class::kSpecial},
      {"224.0.0.1", Ipv4Class::kSpecial},
      {"255.255.255.255", Ipv4Class::kSpecial},
      {"1.2.3.2", Ipv4Class::kPublic},
      {"203.0.113.1", Ipv4Class::kPublic},
  };
  for (const auto &[address, kind] : cases) {
    EXPECT_EQ(kind, ClassifyIpv4(Ip(address))) << address;
  }
  EXPECT_TRUE(IsBehindNat(Ip("100.64.1.1")));
  EXPECT_TRUE(IsBehindNat(Ip("192.168.1.1")));
  EXPECT_FALSE(IsBehindNat(Ip("127.0.0.1")));
  EXPECT_FALSE(IsBehindNat(Ip("8.8.8.8")));
  EXPECT_STREQ("carrier-grade NAT", Ipv4ClassName(Ipv4Class::kSharedCgn));
}

// --- Routes and interfaces ---------------------------------------------------

TEST(DetectParseRoutes, DefaultRoutesLowestMetricFirstOthersSkipped) {
  const std::string table = RouteTable({
      RouteLine("wlan0", "10.0.0.1", 600),
      RouteLine("eth0", "0.0.0.0", 100, false),
      RouteLine("eth0", "192.168.1.1", 100),
      RouteLine("eth1", "192.168.2.1", 100),
      "garbage line",
      "eth9\t00000000\tZZZZ\t0003\t0\t0\t1\t00000000\t0\t0\t0",
      // A default route without RTF_GATEWAY (a point-to-point link).
      "ppp0\t00000000\t00000000\t0001\t0\t0\t50\t00000000\t0\t0\t0",
  });
  EXPECT_EQ((std::vector<DefaultRoute>{{"eth0", Ip("192.168.1.1"), 100},
                                       {"eth1", Ip("192.168.2.1"), 100},
                                       {"wlan0", Ip("10.0.0.1"), 600}}),
            ParseDefaultRoutes(table));
  EXPECT_TRUE(ParseDefaultRoutes("").empty());
  EXPECT_TRUE(ParseDefaultRoutes(RouteTable({})).empty());
}

InterfaceInfo Interface(const std::string &name, const std::string &address,
                        const std::string &mask, bool up = true,
                        bool running = true) {
  InterfaceInfo info;
  info.name = name;
  info.up = up;
  info.running = running;
  if (!address.empty()) {
    info.addresses.push_back({Ip(address), Ip(mask)});
  }
  return info;
}

TEST(DetectParseInterface, TheDefaultRoutesInterfaceMustBeUsable) {
  const std::vector<DefaultRoute> routes = {{"eth0", Ip("192.168.1.1"), 0}};
  InterfaceCheck check = CheckInterface(
      routes, {Interface("eth0", "192.168.1.10", "255.255.255.0")});
  EXPECT_TRUE(check.ok);
  EXPECT_EQ("eth0", check.interface);
  EXPECT_EQ("interface eth0 is up with 192.168.1.10/24", check.why);

  check = CheckInterface(routes, {Interface("eth1", "10.0.0.2", "255.0.0.0")});
  EXPECT_FALSE(check.ok);
  EXPECT_EQ("eth0", check.interface);
  EXPECT_EQ("the default route's interface eth0 does not exist", check.why);

  check = CheckInterface(
      routes, {Interface("eth0", "192.168.1.10", "255.255.255.0", false)});
  EXPECT_FALSE(check.ok);
  EXPECT_EQ("interface eth0 is down", check.why);
}

TEST(DetectParseInterface, WithoutDefaultRouteTheFirstUsableNonLoopbackOne) {
  InterfaceInfo loopback = Interface("lo", "127.0.0.1", "255.0.0.0");
  loopback.loopback = true;
  InterfaceCheck check = CheckInterface(
      {}, {loopback, Interface("eth0", "", ""),
           Interface("eth1", "10.1.1.5", "255.255.0.0", true, false),
           Interface("eth2", "10.2.2.5", "255.255.255.0")});
  EXPECT_TRUE(check.ok);
  EXPECT_EQ("eth2", check.interface);
  EXPECT_EQ("no default route; interface eth2 (10.2.2.5/24) is up", check.why);

  check = CheckInterface({}, {loopback});
  EXPECT_FALSE(check.ok);
  EXPECT_EQ("", check.interface);
}

TEST(DetectParseGateway, WarnsOnlyWhenTheSettingLooksWrong) {
  const std::vector<InterfaceInfo> interfaces = {
      Interface("eth0", "192.168.1.10", "255.255.255.0")};
  GatewayCheck check =
      CheckGateway({{"eth0", Ip("192.168.1.1"), 0}}, interfaces);
  EXPECT_TRUE(check.ok);
  EXPECT_FALSE(check.warning);
  EXPECT_EQ(Ip("192.168.1.1"), check.gateway);

  // The same gateway twice (two tables' worth of the same route) is fine.
  check = CheckGateway(
      {{"eth0", Ip("192.168.1.1"), 0}, {"eth0", Ip("192.168.1.1"), 10}},
      interfaces);
  EXPECT_FALSE(check.warning);

  check = CheckGateway({{"eth0", Ip("192.168.1.10"), 0}}, interfaces);
  EXPECT_TRUE(check.warning);
  EXPECT_EQ("default gateway 192.168.1.10 on eth0; it is the interface's own "
            "address",
            check.why);

  check = CheckGateway(
      {{"eth0", Ip("192.168.1.1"), 0}, {"eth1", Ip("192.168.1.1"), 10}},
      interfaces);
  EXPECT_TRUE(check.warning);

  // A /32 address reaches its gateway on a route of its own: not checked.
  check = CheckGateway({{"eth0", Ip("10.0.0.1"), 0}},
                       {Interface("eth0", "203.0.113.5", "255.255.255.255")});
  EXPECT_FALSE(check.warning);

  check = CheckGateway({}, interfaces);
  EXPECT_FALSE(check.ok);
}

// --- WAN hosts ---------------------------------------------------------------

TEST(DetectParseWanHosts, HostPortListsWithDefaultsAndBadItemsSkipped) {
  ClearLogs();
  EXPECT_EQ((std::vector<WanProbeHost>{
                {"1.2.3.2", 443}, {"probe.example", 8080}, {"10.0.0.1", 443}}),
            ParseWanProbeHosts(" 1.2.3.2:443,probe.example:8080 ,,10.0.0.1"));
  EXPECT_TRUE(ParseWanProbeHosts("").empty());
  EXPECT_TRUE(
      ParseWanProbeHosts(":80,host:0,host:65536,host:x,a b:1,[::1]:5").empty());
  EXPECT_TRUE(HasLogContaining("wan_probe_hosts: \"host:65536\" is not "
                               "host[:port]; skipped"));
  EXPECT_EQ(3u, ParseWanProbeHosts(kDefaultWanProbeHosts).size());

  std::string many;
  for (int i = 0; i < 12; ++i) {
    many += "10.0.0." + std::to_string(i + 1) + ":1,";
  }
  EXPECT_EQ(kMaxWanProbeHosts, ParseWanProbeHosts(many).size());
}

// --- Hops --------------------------------------------------------------------

TEST(DetectParseHops, CountsHopsBeforeTheFirstPublicAddress) {
  HopsFinding finding =
      InterpretHops(std::vector<HopReply>{{2, Ip("1.2.3.2"), true},
                                          {1, Ip("192.168.77.1"), false}},
                    8);
  EXPECT_TRUE(finding.known);
  EXPECT_EQ(1, finding.hops);
  EXPECT_FALSE(finding.carrierGradeNat);
  EXPECT_EQ("1 192.168.77.1, 2 1.2.3.2 (destination)", finding.path);

  // A public first hop: the server is on the internet itself.
  finding =
      InterpretHops(std::vector<HopReply>{{1, Ip("203.0.113.1"), false}}, 8);
  EXPECT_EQ(0, finding.hops);

  // Repeated answers of a TTL (a resend) count once, the first one.
  finding = InterpretHops(std::vector<HopReply>{{1, Ip("192.168.1.1"), false},
                                                {1, Ip("203.0.113.1"), false},
                                                {2, Ip("203.0.113.2"), false}},
                          8);
  EXPECT_EQ(1, finding.hops);
}

TEST(DetectParseHops, UnknownWithoutAPublicAnswer) {
  HopsFinding finding = InterpretHops(std::vector<HopReply>{}, 8);
  EXPECT_FALSE(finding.known);
  EXPECT_EQ("no hop answered within 8 hops", finding.why);
  EXPECT_EQ("1 *, 2 *, 3 *, 4 *, 5 *, 6 *, 7 *, 8 *", finding.path);

  // The destination itself is private: no public address on the way.
  finding = InterpretHops(std::vector<HopReply>{{1, Ip("192.168.1.1"), false},
                                                {2, Ip("10.20.0.1"), true}},
                          3);
  EXPECT_FALSE(finding.known);
  EXPECT_EQ("no public address answered within 3 hops", finding.why);
  EXPECT_EQ("1 192.168.1.1, 2 10.20.0.1 (destination), 3 *", finding.path);
}

TEST(DetectParseHops, SettledOnceEveryHopBelowTheEndAnswered) {
  EXPECT_FALSE(HopsSettled(std::vector<HopReply>{}));
  EXPECT_FALSE(
      HopsSettled(std::vector<HopReply>{{1, Ip("192.168.1.1"), false}}));
  EXPECT_FALSE(HopsSettled(std::vector<HopReply>{{2, Ip("1.2.3.2"), true}}));
  EXPECT_TRUE(HopsSettled(std::vector<HopReply>{
      {2, Ip("1.2.3.2"), true}, {1, Ip("192.168.1.1"), false}}));
  // The private destination answered and everything before it did.
  EXPECT_TRUE(HopsSettled(std::vector<HopReply>{{1, Ip("127.0.0.1"), true}}));
  EXPECT_TRUE(HopsSettled(std::vector<HopReply>{{1, Ip("8.8.8.8"), false}}));
}

// --- resolv.conf and DNS -----------------------------------------------------

TEST(DetectParseResolvConf, NameServerLinesAtMostThree) {
  EXPECT_EQ((std::vector<std::string>{"10.0.0.53", "2001:db8::1", "1.1.1.1"}),
            ParseResolvConf("# comment\n; other\nsearch lan\n"
                            "nameserver 10.0.0.53\n"
                            "nameserver\t2001:db8::1 # trailing\n"
                            "nameservers 9.9.9.9\n"
                            "nameserver fe80::1%eth0\n"
                            "nameserver not-an-address\n"
                            "  nameserver 1.1.1.1\r\n"
                            "nameserver 8.8.8.8\n"));
  EXPECT_TRUE(ParseResolvConf("").empty());
  EXPECT_TRUE(ParseResolvConf("nameserver\n").empty());
}

TEST(DetectParseDns, NamesThatMayBeLookedUp) {
  EXPECT_TRUE(IsValidDnsName("example.com"));
  EXPECT_TRUE(IsValidDnsName("example.com."));
  EXPECT_TRUE(IsValidDnsName("localhost"));
  EXPECT_FALSE(IsValidDnsName(""));
  EXPECT_FALSE(IsValidDnsName("."));
  EXPECT_FALSE(IsValidDnsName("a..b"));
  EXPECT_FALSE(IsValidDnsName("a b.c"));
  EXPECT_FALSE(IsValidDnsName("a\x7f.c"));
  EXPECT_FALSE(IsValidDnsName(std::string(64, 'a') + ".com"));
  EXPECT_TRUE(IsValidDnsName(std::string(63, 'a') + ".com"));
  std::string longName;
  while (longName.size() < 260) {
    longName += "abcdefghi.";
  }
  EXPECT_FALSE(IsValidDnsName(longName));
}

// The standard query for the A record of example.com (id 0xBEEF), as c-ares
// sends it (DetectProbeDns.TheQueryIsTheStandardOneForTheARecord).
const Bytes kExampleComQuery = {
    0xBE, 0xEF, 0x01, 0x00, 0,   1, 0,   0,   0,   0, 0, 0, 7, 'e', 'x',
    'a',  'm',  'p',  'l',  'e', 3, 'c', 'o', 'm', 0, 0, 1, 0, 1};

Bytes Answer(const Bytes &query, const std::string &name, uint32_t address) {
  uint8_t reply[512];
  std::size_t length = BuildDnsAnswer(query.data(), query.size(), name.c_str(),
                                      address, reply, sizeof(reply));
  return Bytes(reply, reply + length);
}

TEST(DetectParseDns, ReadsTheAddressOfAReply) {
  const Bytes reply = Answer(kExampleComQuery, "example.com", Ip("1.2.3.2"));
  ASSERT_FALSE(reply.empty());
  DnsLookup heard = ReadDnsAnswer("10.0.0.53", ARES_SUCCESS, reply);
  EXPECT_EQ(DnsOutcome::kAnswered, heard.outcome);
  EXPECT_EQ(kDnsNoError, heard.rcode);
  EXPECT_EQ("10.0.0.53", heard.server);
  EXPECT_EQ(std::vector<uint32_t>{Ip("1.2.3.2")}, heard.addresses);
  EXPECT_EQ("10.0.0.53 answered 1.2.3.2", heard.why);

  // Cut inside the answer: a reply without a readable address.
  heard = ReadDnsAnswer("10.0.0.53", ARES_SUCCESS,
                        Bytes(reply.begin(), reply.end() - 2));
  EXPECT_EQ(DnsOutcome::kNoAddress, heard.outcome);
  EXPECT_TRUE(heard.addresses.empty());
  // Cut anywhere: never an address, never a crash.
  for (std::size_t cut = 0; cut < reply.size(); ++cut) {
    heard = ReadDnsAnswer("10.0.0.53", ARES_SUCCESS,
                          Bytes(reply.begin(), reply.begin() + cut));
    EXPECT_NE(DnsOutcome::kAnswered, heard.outcome) << cut;
    EXPECT_TRUE(heard.addresses.empty()) << cut;
  }
}

TEST(DetectParseDns, EachCAresStatusHasItsOutcome) {
  const Bytes nxdomain = Answer(kExampleComQuery, "other.example", 1);
  DnsLookup heard = ReadDnsAnswer("10.0.0.53", ARES_ENOTFOUND, nxdomain);
  EXPECT_EQ(DnsOutcome::kNameError, heard.outcome);
  EXPECT_EQ(kDnsNameError, heard.rcode);
  EXPECT_EQ("10.0.0.53 answered that the name does not exist", heard.why);

  Bytes refused = nxdomain;
  refused[3] = 0x80 | kDnsRefused;
  heard = ReadDnsAnswer("10.0.0.53", ARES_EREFUSED, refused);
  EXPECT_EQ(DnsOutcome::kServerError, heard.outcome);
  EXPECT_EQ(kDnsRefused, heard.rcode);
  EXPECT_EQ("10.0.0.53 answered with error 5", heard.why);
  // Without the reply, the code comes from the status.
  heard = ReadDnsAnswer("10.0.0.53", ARES_ESERVFAIL, {});
  EXPECT_EQ(DnsOutcome::kServerError, heard.outcome);
  EXPECT_EQ(kDnsServerFailure, heard.rcode);

  Bytes noRecord = nxdomain;
  noRecord[3] = 0x80;
  heard = ReadDnsAnswer("10.0.0.53", ARES_ENODATA, noRecord);
  EXPECT_EQ(DnsOutcome::kNoAddress, heard.outcome);
  EXPECT_EQ("10.0.0.53 answered without an address", heard.why);

  heard = ReadDnsAnswer("10.0.0.53", ARES_ECONNREFUSED, {});
  EXPECT_EQ(DnsOutcome::kServerError, heard.outcome);
  EXPECT_EQ("10.0.0.53: Connection refused", heard.why);
  EXPECT_EQ(DnsOutcome::kNoAnswer,
            ReadDnsAnswer("10.0.0.53", ARES_ETIMEOUT, {}).outcome);
  EXPECT_EQ(DnsOutcome::kNoAnswer,
            ReadDnsAnswer("10.0.0.53", ARES_ECANCELLED, {}).outcome);
  heard = ReadDnsAnswer("10.0.0.53", ARES_ENOMEM, {});
  EXPECT_EQ(DnsOutcome::kFailed, heard.outcome);
  EXPECT_EQ("10.0.0.53: Out of memory", heard.why);
}

TEST(DetectParseDns, FollowsCnameChainsAndRefusesLoopingPointers) {
  // www.example -> CNAME example (compressed) -> A 203.0.113.80.
  Bytes reply = {0,   9,   0x81, 0x80, 0,   1,   0, 2,   0,   0,
                 0,   0,   3,    'w',  'w', 'w', 7, 'e', 'x', 'a',
                 'm', 'p', 'l',  'e',  0,   0,   1, 0,   1};
  const Bytes records = {
      0xC0, 12, 0, 5, 0, 1, 0, 0, 0, 60, 0, 2, 0xC0, 16, // CNAME -> example
      0xC0, 16, 0, 1, 0, 1, 0, 0, 0, 60, 0, 4, 203,  0,  113, 80};
  reply.insert(reply.end(), records.begin(), records.end());
  DnsLookup heard = ReadDnsAnswer("10.0.0.53", ARES_SUCCESS, reply);
  EXPECT_EQ(DnsOutcome::kAnswered, heard.outcome) << heard.why;
  EXPECT_EQ(std::vector<uint32_t>{Ip("203.0.113.80")}, heard.addresses);

  // An answer whose name points at itself.
  Bytes looping = kExampleComQuery;
  looping[2] = 0x81;
  looping[7] = 1;
  const std::size_t at = looping.size();
  looping.push_back(0xC0);
  looping.push_back(static_cast<uint8_t>(at));
  const Bytes rest = {0, 1, 0, 1, 0, 0, 0, 60, 0, 4, 1, 2, 3, 4};
  looping.insert(looping.end(), rest.begin(), rest.end());
  heard = ReadDnsAnswer("10.0.0.53", ARES_SUCCESS, looping);
  EXPECT_EQ(DnsOutcome::kNoAddress, heard.outcome);
  EXPECT_TRUE(heard.addresses.empty());
}

// --- SSDP --------------------------------------------------------------------

TEST(DetectParseSsdp, MSearchIsTheStandardRequest) {
  EXPECT_EQ("M-SEARCH * HTTP/1.1\r\n"
            "HOST: 239.255.255.250:1900\r\n"
            "MAN: \"ssdp:discover\"\r\n"
            "MX: 1\r\n"
            "ST: urn:schemas-upnp-org:device:InternetGatewayDevice:1\r\n\r\n",
            BuildMSearch(kIgdSearchTargetV1, 1));
  EXPECT_NE(std::string::npos, BuildMSearch("x", 0).find("MX: 1\r\n"));
  EXPECT_NE(std::string::npos, BuildMSearch("x", 9).find("MX: 5\r\n"));
}

TEST(DetectParseSsdp, RefusesAnythingButA200WithAnHttpLocation) {
  EXPECT_FALSE(ParseSsdpReply("").has_value());
  EXPECT_FALSE(ParseSsdpReply("HTTP/1.1 404 Not Found\r\nLOCATION: "
                              "http://10.0.0.1/d.xml\r\n\r\n")
                   .has_value());
  EXPECT_FALSE(ParseSsdpReply("NOTIFY * HTTP/1.1\r\nLOCATION: "
                              "http://10.0.0.1/d.xml\r\n\r\n")
                   .has_value());
  EXPECT_FALSE(
      ParseSsdpReply(
          "HTTP/1.1 200 OK\r\nLOCATION: https://10.0.0.1/d.xml\r\n\r\n")
          .has_value());
  EXPECT_FALSE(ParseSsdpReply("HTTP/1.1 200 OK\r\nST: x\r\n\r\n").has_value());
  EXPECT_FALSE(ParseSsdpReply("HTTP/1.1 200 OK\r\nLOCATION: http://10.0.0.1/a "
                              "b.xml\r\n\r\n")
                   .has_value());
  EXPECT_FALSE(ParseSsdpReply("HTTP/1.1 200 OK\r\nLOCATION: http://10.0.0.1/" +
                              std::string(600, 'a') + "\r\n\r\n")
                   .has_value());
  // Headers after the blank line are the body, not headers.
  EXPECT_FALSE(ParseSsdpReply("HTTP/1.1 200 OK\r\n\r\nLOCATION: "
                              "http://10.0.0.1/d.xml\r\n")
                   .has_value());
}

// --- Router names and findings -----------------------------------------------

TEST(DetectParseRouterName, PfpathIsBrandColonModelAndVersionInParentheses) {
  EXPECT_EQ((RouterName{"ZarkTest", "TestIGD", "1", "ZarkTest: TestIGD(1)"}),
            NameRouter({"ZarkTest", "TestIGD", "1"}));
  EXPECT_EQ((RouterName{"ZarkTest", "TestIGD", "", "ZarkTest: TestIGD"}),
            NameRouter({"ZarkTest", "TestIGD", ""}));
  EXPECT_EQ((RouterName{"", "TestIGD", "1", ""}),
            NameRouter({"", "TestIGD", "1"}));
  EXPECT_EQ((RouterName{"ZarkTest", "", "1", ""}),
            NameRouter({"ZarkTest", "", "1"}));
  EXPECT_EQ((RouterName{"A-B Corp", "X-1 [v2]", "3", "A-B Corp: X-1 [v2](3)"}),
            NameRouter({"  A:B \t Corp ", "X/1 (v2)", "\n3\n"}));
  const RouterName longName =
      NameRouter({std::string(400, 'b'), std::string(300, 'm'), "1"});
  EXPECT_EQ(kMaxIdentityText, longName.brand.size());
  EXPECT_EQ(kMaxIdentityText, longName.model.size());
  EXPECT_LT(longName.pfpath.size(), std::size_t{ZARK_PORTMAP_TEXT_SIZE});
}

TEST(DetectParseRouterCheck, EitherProtocolPassesAndPrivateOutsideIsDoubleNat) {
  RouterFindings findings;
  EXPECT_FALSE(CheckRouter(findings).ok);

  findings.natpmp.support = ProtocolSupport::kYes;
  findings.natpmp.publicAddress = "198.51.100.7";
  RouterCheck check = CheckRouter(findings);
  EXPECT_TRUE(check.ok);
  EXPECT_EQ(ProtocolSupport::kNo, check.upnp);
  EXPECT_EQ(RouterName{}, check.name);
  EXPECT_EQ(Ip("198.51.100.7"), check.outsideAddress);
  EXPECT_FALSE(check.doubleNat);

  findings.upnp.support = ProtocolSupport::kYes;
  findings.upnp.identity = {"B", "M", ""};
  findings.upnp.externalAddress = "192.168.0.2";
  check = CheckRouter(findings);
  EXPECT_EQ("B: M", check.name.pfpath);
  // UPnP's answer comes first.
  EXPECT_EQ(Ip("192.168.0.2"), check.outsideAddress);
  EXPECT_TRUE(check.doubleNat);

  findings.upnp.externalAddress = "not an address";
  check = CheckRouter(findings);
  EXPECT_EQ(Ip("198.51.100.7"), check.outsideAddress);

  // Names only come from a router that answered UPnP.
  findings.upnp.support = ProtocolSupport::kUnknown;
  EXPECT_EQ("", CheckRouter(findings).name.pfpath);
}

// --- The kept result ---------------------------------------------------------

ZARK_ROUTER_DETECT_RESULT FullResult() {
  ZARK_ROUTER_DETECT_RESULT result{};
  result.enProgress = 100;
  result.reserved = -7;
  result.warning = 0xFFFFFFFFu;
  result.hops = 3;
  std::strcpy(result.gateway_ip, "192.168.77.1");
  std::strcpy(result.network_interface, "eth0");
  result.support_upnp = 1;
  result.support_natpmp = 2;
  std::strcpy(result.router_brand, "Brand \"quoted\" \\ \xC3\xA9");
  std::strcpy(result.router_model, "Model");
  std::strcpy(result.router_version, "1");
  std::strcpy(result.upnp_pfpath, "Brand: Model(1)");
  std::memset(result.router_user_setting_name, 'x',
              sizeof(result.router_user_setting_name) - 1);
  result.router_max_rule = 128;
  return result;
}

TEST(DetectParseResultFile, RoundTripsEveryField) {
  const ZARK_ROUTER_DETECT_RESULT result = FullResult();
  ZARK_ROUTER_DETECT_RESULT parsed;
  std::memset(&parsed, 0x77, sizeof(parsed));
  std::string why;
  ASSERT_TRUE(ParseDetectResult(SerializeDetectResult(result), parsed, why))
      << why;
  EXPECT_EQ(0, std::memcmp(&result, &parsed, sizeof(result)));
}

TEST(DetectParseResultFile, RefusesAnythingElse) {
  const std::string good = SerializeDetectResult(FullResult());
  ZARK_ROUTER_DETECT_RESULT parsed{};
  parsed.hops = 42;
  std::string why;
  auto refused = [&](const std::string &text, const std::string &reason) {
    why.clear();
    EXPECT_FALSE(ParseDetectResult(text, parsed, why)) << text;
    EXPECT_NE(std::string::npos, why.find(reason)) << why;
  };
  auto replaced = [&](const std::string &from, const std::string &to) {
    std::string text = good;
    const std::size_t at = text.find(from);
    EXPECT_NE(std::string::npos, at) << from;
    return text.replace(at, from.size(), to);
  };
  refused("", "not valid JSON");
  refused("[]", "top level is not an object");
  refused(replaced("\"format\" : 1", "\"format\" : 2"), "\"format\"");
  refused(replaced("\"hops\" : 3", "\"hops\" : 3.5"), "\"hops\"");
  refused(replaced("\"hops\" : 3", "\"hops\" : 4294967296"), "\"hops\"");
  refused(replaced("\"warning\" : 4294967295", "\"warning\" : -1"),
          "\"warning\"");
  refused(
      replaced("\"upnp_pfpath\" : \"Brand: Model(1)\"", "\"upnp_pfpath\" : 5"),
      "\"upnp_pfpath\"");
  refused(replaced("\"router_model\" : \"Model\"",
                   "\"router_model\" : \"Mo\\u0000del\""),
          "\"router_model\"");
  refused(replaced("\"router_model\" : \"Model\"",
                   "\"router_model\" : \"" + std::string(1024, 'm') + "\""),
          "longer than 1023 bytes");
  refused(good + "{}", "not valid JSON");
  refused(std::string(70000, ' ') + good, "larger than");
  EXPECT_EQ(42, parsed.hops); // untouched by every refusal
}

} // namespace
} // namespace zark::test
