// The real probes on loopback: TCP connections, the UDP hop prober's error
// queue, the DNS client against a fake name server, the SSDP search against
// a fake device, and the router probes against the fake IGD and NAT-PMP
// routers.
#include "detect_fakes.h"
#include "dns_answer.h"
#include "fake_igd.h"
#include "fake_natpmp.h"
#include "net/igd_description.h"
#include "net/ssdp_search.h"
#include "udp_responder.h"

#include "syslog_capture.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

namespace zark::test {
namespace {

using namespace zark::portmap;
using std::chrono::milliseconds;

// A TCP listener on 127.0.0.1 (connections complete in the kernel's
// backlog; nothing needs to accept them).
class Listener {
public:
  Listener() {
    mFd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof(address);
    if (::bind(mFd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) ==
            0 &&
        ::listen(mFd, 8) == 0 &&
        ::getsockname(mFd, reinterpret_cast<sockaddr *>(&address), &length) ==
            0) {
      mPort = ntohs(address.sin_port);
    }
  }
  ~Listener() { ::close(mFd); }
  uint16_t Port() const { return mPort; }

private:
  int mFd = -1;
  uint16_t mPort = 0;
};

// A loopback port that nothing listens on (bound, then closed).
uint16_t ClosedPort(int type) {
  int fd = ::socket(AF_INET, type | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof(address);
  ::bind(fd, reinterpret_cast<sockaddr *>(&address), sizeof(address));
  ::getsockname(fd, reinterpret_cast<sockaddr *>(&address), &length);
  ::close(fd);
  return ntohs(address.sin_port);
}

const std::vector<Ipv4Network> kLoopback = {{Ip("127.0.0.0"), Ip("255.0.0.0")}};

// --- TCP
// -----------------------------------------------------------------------

TEST(DetectProbeTcp, TheFirstEndpointThatConnectsIsReached) {
  Listener listener;
  ASSERT_NE(0, listener.Port());
  const uint16_t closed = ClosedPort(SOCK_STREAM);
  std::unique_ptr<TcpConnector> connector = MakeSystemTcpConnector();
  const std::vector<Ipv4Endpoint> endpoints = {
      {Ip("127.0.0.1"), closed}, {Ip("127.0.0.1"), listener.Port()}};
  ConnectOutcome outcome = connector->ConnectAny(endpoints, milliseconds(2000));
  ASSERT_TRUE(outcome.reached.has_value());
  EXPECT_EQ(listener.Port(), outcome.reached->port);
}

TEST(DetectProbeTcp, RefusedEndpointsFailWithTheReason) {
  const uint16_t closed = ClosedPort(SOCK_STREAM);
  std::unique_ptr<TcpConnector> connector = MakeSystemTcpConnector();
  const std::vector<Ipv4Endpoint> endpoints = {{Ip("127.0.0.1"), closed}};
  ConnectOutcome outcome = connector->ConnectAny(endpoints, milliseconds(2000));
  EXPECT_FALSE(outcome.reached.has_value());
  ASSERT_EQ(1u, outcome.failures.size());
  EXPECT_EQ("127.0.0.1:" + std::to_string(closed) + " Connection refused",
            outcome.failures[0]);
  EXPECT_FALSE(connector->ConnectAny({}, milliseconds(10)).reached.has_value());
}

TEST(DetectProbeTcp, CheckWanConnectsToALiteralHost) {
  Listener listener;
  std::unique_ptr<TcpConnector> connector = MakeSystemTcpConnector();
  const std::vector<WanProbeHost> hosts = {{"127.0.0.1", listener.Port()}};
  int resolved = 0;
  WanCheck check = CheckWan(
      hosts,
      [&](std::string_view, milliseconds) {
        ++resolved;
        return std::vector<uint32_t>{};
      },
      *connector, milliseconds(2000));
  EXPECT_TRUE(check.ok) << check.why;
  EXPECT_EQ(0, resolved);
  EXPECT_EQ((Ipv4Endpoint{Ip("127.0.0.1"), listener.Port()}), check.reached);
}

// --- Hops
// ----------------------------------------------------------------------

TEST(DetectProbeHops, TheErrorQueueTellsWhoAnsweredWhichTtl) {
  std::unique_ptr<HopProber> prober = MakeUdpHopProber();
  HopLimits limits;
  limits.maxTtl = 3;
  limits.basePort = ClosedPort(SOCK_DGRAM) - 1;
  std::vector<HopReply> replies = prober->Probe(Ip("127.0.0.1"), limits);
  // Loopback is one hop: the first probe reaches the destination, whose
  // "port unreachable" comes back; then the answers settle the count.
  ASSERT_FALSE(replies.empty());
  EXPECT_EQ((HopReply{1, Ip("127.0.0.1"), true}), replies.front());
  EXPECT_TRUE(HopsSettled(replies));
  HopsFinding finding = InterpretHops(replies, limits.maxTtl);
  EXPECT_FALSE(finding.known); // loopback is not a public address
}

// --- DNS
// -----------------------------------------------------------------------

DnsClientOptions DnsOptions(uint16_t port) {
  DnsClientOptions options;
  options.port = port;
  options.resendAfter = milliseconds(100);
  return options;
}

// What one lookup of name by c-ares gets from a fake name server on
// loopback that answers with handler.
DnsLookup LookupFrom(const UdpResponder::Handler &handler,
                     std::string_view name,
                     milliseconds budget = milliseconds(2000)) {
  UdpResponder server(handler);
  std::unique_ptr<DnsClient> client =
      MakeUdpDnsClient(DnsOptions(server.Port()));
  const std::vector<std::string> servers = {"127.0.0.1"};
  return client->Lookup(servers, name, budget);
}

// The reply of the fake name server to request (answering name with
// address), changed by edit.
UdpResponder::Handler
EditedAnswer(std::function<void(UdpResponder::Bytes &reply)> edit) {
  return [edit](const UdpResponder::Bytes &request) {
    uint8_t reply[512];
    const std::size_t length =
        BuildDnsAnswer(request.data(), request.size(), "probe.zark.test",
                       Ip("1.2.3.2"), reply, sizeof(reply));
    UdpResponder::Bytes edited(reply, reply + length);
    edit(edited);
    return std::vector<UdpResponder::Bytes>{edited};
  };
}

TEST(DetectProbeDns, AServerThatAnswersGivesTheAddress) {
  UdpResponder server(DnsServer("probe.zark.test", Ip("1.2.3.2")));
  std::unique_ptr<DnsClient> client =
      MakeUdpDnsClient(DnsOptions(server.Port()));
  const std::vector<std::string> servers = {"127.0.0.1"};
  DnsLookup lookup =
      client->Lookup(servers, "probe.zark.test", milliseconds(2000));
  EXPECT_EQ(DnsOutcome::kAnswered, lookup.outcome) << lookup.why;
  EXPECT_EQ(std::vector<uint32_t>{Ip("1.2.3.2")}, lookup.addresses);
  EXPECT_EQ("127.0.0.1 answered 1.2.3.2", lookup.why);
  EXPECT_EQ("127.0.0.1", lookup.server);
  EXPECT_EQ(kDnsNoError, lookup.rcode);
  ASSERT_EQ(1, server.Received());
}

TEST(DetectProbeDns, TheQueryIsTheStandardOneForTheARecord) {
  UdpResponder server(DnsServer("example.com", Ip("1.2.3.2")));
  std::unique_ptr<DnsClient> client =
      MakeUdpDnsClient(DnsOptions(server.Port()));
  const std::vector<std::string> servers = {"127.0.0.1"};
  for (const char *name : {"example.com", "example.com."}) {
    EXPECT_EQ(DnsOutcome::kAnswered,
              client->Lookup(servers, name, milliseconds(2000)).outcome)
        << name;
  }
  // A standard query, recursion desired, one question, no other record:
  // the A record of example.com, class IN; only the id is c-ares's choice.
  const std::vector<UdpResponder::Bytes> queries = server.Requests();
  ASSERT_EQ(2u, queries.size());
  for (const UdpResponder::Bytes &query : queries) {
    const UdpResponder::Bytes expected = {
        query[0], query[1], 0x01, 0x00, 0,   1,   0,   0,   0,   0,
        0,        0,        7,    'e',  'x', 'a', 'm', 'p', 'l', 'e',
        3,        'c',      'o',  'm',  0,   0,   1,   0,   1};
    EXPECT_EQ(expected, query);
  }
}

TEST(DetectProbeDns, NoSuchNameIsAnAnswerWithoutAddress) {
  UdpResponder server(DnsServer("probe.zark.test", Ip("1.2.3.2")));
  std::unique_ptr<DnsClient> client =
      MakeUdpDnsClient(DnsOptions(server.Port()));
  const std::vector<std::string> servers = {"127.0.0.1"};
  DnsLookup lookup =
      client->Lookup(servers, "other.zark.test", milliseconds(2000));
  EXPECT_EQ(DnsOutcome::kNameError, lookup.outcome);
  EXPECT_EQ(kDnsNameError, lookup.rcode);
  EXPECT_TRUE(lookup.addresses.empty());
  EXPECT_EQ("127.0.0.1 answered that the name does not exist", lookup.why);
  EXPECT_EQ(1, server.Received());
}

TEST(DetectProbeDns, ASilentServerIsAskedTwiceThenGivenUpOn) {
  UdpResponder server([](const UdpResponder::Bytes &) {
    return std::vector<UdpResponder::Bytes>{};
  });
  std::unique_ptr<DnsClient> client =
      MakeUdpDnsClient(DnsOptions(server.Port()));
  const std::vector<std::string> servers = {"127.0.0.1"};
  const auto start = std::chrono::steady_clock::now();
  DnsLookup lookup =
      client->Lookup(servers, "probe.zark.test", milliseconds(1000));
  EXPECT_LT(std::chrono::steady_clock::now() - start, milliseconds(1500));
  EXPECT_EQ(DnsOutcome::kNoAnswer, lookup.outcome);
  EXPECT_EQ("no name server answered within 1000 ms", lookup.why);
  EXPECT_EQ(2, server.Received());
}

TEST(DetectProbeDns, TheBudgetEndsTheLookupBeforeCAresGivesUp) {
  UdpResponder server([](const UdpResponder::Bytes &) {
    return std::vector<UdpResponder::Bytes>{};
  });
  DnsClientOptions options = DnsOptions(server.Port());
  options.resendAfter = milliseconds(5000);
  std::unique_ptr<DnsClient> client = MakeUdpDnsClient(options);
  const std::vector<std::string> servers = {"127.0.0.1"};
  const auto start = std::chrono::steady_clock::now();
  DnsLookup lookup =
      client->Lookup(servers, "probe.zark.test", milliseconds(200));
  const auto took = std::chrono::steady_clock::now() - start;
  EXPECT_GE(took, milliseconds(200));
  EXPECT_LT(took, milliseconds(1000));
  EXPECT_EQ(DnsOutcome::kNoAnswer, lookup.outcome);
  EXPECT_EQ("no name server answered within 200 ms", lookup.why);
  EXPECT_EQ(1, server.Received());
}

TEST(DetectProbeDns, ForeignDatagramsAreIgnoredUntilTheRealReply) {
  UdpResponder server([](const UdpResponder::Bytes &request) {
    UdpResponder::Bytes wrongId = request;
    wrongId[0] ^= 0xFF;
    uint8_t reply[512];
    std::vector<UdpResponder::Bytes> replies = {Bytes("garbage")};
    std::size_t length =
        BuildDnsAnswer(wrongId.data(), wrongId.size(), "probe.zark.test",
                       Ip("9.9.9.9"), reply, sizeof(reply));
    replies.emplace_back(reply, reply + length);
    // The same id for another question.
    UdpResponder::Bytes otherName = request;
    otherName[13] = 'q';
    length =
        BuildDnsAnswer(otherName.data(), otherName.size(), "qrobe.zark.test",
                       Ip("9.9.9.8"), reply, sizeof(reply));
    replies.emplace_back(reply, reply + length);
    // The real reply cut anywhere inside its header or question.
    length = BuildDnsAnswer(request.data(), request.size(), "probe.zark.test",
                            Ip("1.2.3.2"), reply, sizeof(reply));
    for (std::size_t cut = 1; cut < request.size(); ++cut) {
      replies.emplace_back(reply, reply + cut);
    }
    replies.emplace_back(reply, reply + length);
    return replies;
  });
  std::unique_ptr<DnsClient> client =
      MakeUdpDnsClient(DnsOptions(server.Port()));
  const std::vector<std::string> servers = {"127.0.0.1"};
  DnsLookup lookup =
      client->Lookup(servers, "probe.zark.test", milliseconds(2000));
  EXPECT_EQ(DnsOutcome::kAnswered, lookup.outcome) << lookup.why;
  EXPECT_EQ(std::vector<uint32_t>{Ip("1.2.3.2")}, lookup.addresses);
}

TEST(DetectProbeDns, AnAnswerCutShortHasNoAddress) {
  DnsLookup lookup = LookupFrom(EditedAnswer([](UdpResponder::Bytes &reply) {
                                  reply.resize(reply.size() - 2);
                                }),
                                "probe.zark.test");
  EXPECT_EQ(DnsOutcome::kNoAddress, lookup.outcome) << lookup.why;
  EXPECT_TRUE(lookup.addresses.empty());
  EXPECT_EQ("127.0.0.1 answered without an address (Misformatted DNS reply)",
            lookup.why);
}

TEST(DetectProbeDns, ACnameChainLeadsToTheAddress) {
  // probe.zark.test -> CNAME zark.test (compressed) -> A 203.0.113.80.
  DnsLookup lookup = LookupFrom(
      EditedAnswer([](UdpResponder::Bytes &reply) {
        reply.resize(reply.size() - 16); // the fake's own A record
        reply[7] = 2;
        const UdpResponder::Bytes records = {
            0xC0, 12, 0, 5, 0, 1, 0, 0, 0, 60, 0, 2, 0xC0, 18, // CNAME
            0xC0, 18, 0, 1, 0, 1, 0, 0, 0, 60, 0, 4, 203,  0,  113, 80};
        reply.insert(reply.end(), records.begin(), records.end());
      }),
      "probe.zark.test");
  EXPECT_EQ(DnsOutcome::kAnswered, lookup.outcome) << lookup.why;
  EXPECT_EQ(std::vector<uint32_t>{Ip("203.0.113.80")}, lookup.addresses);
}

TEST(DetectProbeDns, ALoopingCompressionPointerIsNoAddress) {
  // An answer whose name points at itself.
  DnsLookup lookup = LookupFrom(EditedAnswer([](UdpResponder::Bytes &reply) {
                                  const std::size_t at = reply.size() - 16;
                                  reply[at] = 0xC0;
                                  reply[at + 1] = static_cast<uint8_t>(at);
                                }),
                                "probe.zark.test");
  EXPECT_EQ(DnsOutcome::kNoAddress, lookup.outcome) << lookup.why;
  EXPECT_TRUE(lookup.addresses.empty());
}

TEST(DetectProbeDns, AnErrorAnswerIsAServerErrorWithItsCode) {
  for (const uint8_t rcode :
       {uint8_t{kDnsServerFailure}, uint8_t{kDnsRefused}, uint8_t{9}}) {
    DnsLookup lookup =
        LookupFrom(EditedAnswer([rcode](UdpResponder::Bytes &reply) {
                     reply[3] = static_cast<uint8_t>(0x80 | rcode);
                   }),
                   "probe.zark.test");
    EXPECT_EQ(DnsOutcome::kServerError, lookup.outcome) << lookup.why;
    EXPECT_EQ(rcode, lookup.rcode);
    EXPECT_EQ("127.0.0.1 answered with error " + std::to_string(rcode),
              lookup.why);
  }
  // No error, no record.
  DnsLookup lookup = LookupFrom(EditedAnswer([](UdpResponder::Bytes &reply) {
                                  reply.resize(reply.size() - 16);
                                  reply[7] = 0;
                                }),
                                "probe.zark.test");
  EXPECT_EQ(DnsOutcome::kNoAddress, lookup.outcome);
  EXPECT_EQ("127.0.0.1 answered without an address", lookup.why);
}

TEST(DetectProbeDns, AServerWhereNothingListensIsRefusedAndTheOtherAnswers) {
  const uint16_t closed = ClosedPort(SOCK_DGRAM);
  std::unique_ptr<DnsClient> client = MakeUdpDnsClient(DnsOptions(closed));
  const std::vector<std::string> servers = {"127.0.0.1"};
  DnsLookup lookup =
      client->Lookup(servers, "probe.zark.test", milliseconds(2000));
  EXPECT_EQ(DnsOutcome::kServerError, lookup.outcome);
  EXPECT_EQ("127.0.0.1: Connection refused", lookup.why);

  // Two servers on one port: 127.0.0.2 has nobody, 127.0.0.1 answers.
  UdpResponder server(DnsServer("probe.zark.test", Ip("1.2.3.2")));
  client = MakeUdpDnsClient(DnsOptions(server.Port()));
  const std::vector<std::string> two = {"127.0.0.2", "127.0.0.1"};
  lookup = client->Lookup(two, "probe.zark.test", milliseconds(2000));
  EXPECT_EQ(DnsOutcome::kAnswered, lookup.outcome);
  EXPECT_EQ("127.0.0.1", lookup.server);
}

TEST(DetectProbeDns, NothingToAskFails) {
  std::unique_ptr<DnsClient> client = MakeUdpDnsClient();
  EXPECT_EQ(DnsOutcome::kFailed,
            client->Lookup({}, "probe.zark.test", milliseconds(100)).outcome);
  const std::vector<std::string> servers = {"127.0.0.1"};
  ClearLogs();
  EXPECT_EQ(DnsOutcome::kFailed,
            client->Lookup(servers, "bad name", milliseconds(100)).outcome);
  EXPECT_TRUE(HasLogContaining("DNS probe: \"bad name\" is not a valid name"));
  ClearLogs();
  const std::vector<std::string> notAddress = {"ns.example"};
  EXPECT_EQ(
      DnsOutcome::kFailed,
      client->Lookup(notAddress, "probe.zark.test", milliseconds(100)).outcome);
  EXPECT_TRUE(HasLogContaining(
      "DNS probe: name server \"ns.example\" is not an address"));
}

// --- SSDP
// ----------------------------------------------------------------------

SsdpSearchOptions Search(uint16_t port, milliseconds wait) {
  SsdpSearchOptions options;
  options.gateway = "127.0.0.1";
  options.port = port;
  options.multicast = false;
  options.wait = wait;
  return options;
}

TEST(DetectProbeSsdp, TheGatewaysAnswerEndsTheSearch) {
  UdpResponder device(SsdpDevice("http://127.0.0.1:5000/rootDesc.xml"));
  // A long wait that the gateway's answer cuts short.
  std::vector<std::string> found =
      SearchIgds(Search(device.Port(), milliseconds(30000)));
  EXPECT_EQ(std::vector<std::string>{"http://127.0.0.1:5000/rootDesc.xml"},
            found);
  // IGD:1 and IGD:2 were asked, straight to the gateway.
  std::vector<UdpResponder::Bytes> searches = device.Requests();
  ASSERT_GE(searches.size(), 1u);
  EXPECT_EQ(BuildMSearch(kIgdSearchTargetV1, 1), Text(searches[0]));
}

TEST(DetectProbeSsdp, OtherDevicesAreKeptUntilTheWaitEnds) {
  UdpResponder device(SsdpDevice("http://192.0.2.10:80/desc.xml"));
  std::vector<std::string> found =
      SearchIgds(Search(device.Port(), milliseconds(1000)));
  EXPECT_EQ(std::vector<std::string>{"http://192.0.2.10:80/desc.xml"}, found);
  EXPECT_EQ(2, device.Received());
}

TEST(DetectProbeSsdp, SilenceGivesNothing) {
  UdpResponder device([](const UdpResponder::Bytes &) {
    return std::vector<UdpResponder::Bytes>{};
  });
  EXPECT_TRUE(SearchIgds(Search(device.Port(), milliseconds(100))).empty());
}

// --- Router probes
// ---------------------------------------------------------------

// wait: how long the SSDP search listens. A gateway's answer ends it at
// once, so tests that expect one give a long wait that costs nothing.
RouterProbeOptions ProbeOptions(uint16_t ssdpPort, uint16_t natpmpPort,
                                milliseconds wait = milliseconds(300)) {
  RouterProbeOptions options;
  options.ssdpPort = ssdpPort;
  options.ssdpMulticast = false;
  options.ssdpWait = wait;
  options.localNetworks = kLoopback;
  options.natpmpPort = natpmpPort;
  options.natpmpFirstWait = milliseconds(100);
  options.natpmpTries = 2;
  return options;
}

TEST(DetectProbeRouter, FindsTheFakeIgdThroughSsdpAndTheFakeNatPmp) {
  FakeIgd igd;
  FakeNatPmp natpmp;
  UdpResponder device(SsdpDevice(igd.RootDescUrl()));
  std::unique_ptr<RouterProbes> probes = MakeRouterProbes(
      ProbeOptions(device.Port(), natpmp.Port(), milliseconds(10000)));
  RouterFindings findings = ProbeRouter(*probes, "127.0.0.1");
  EXPECT_EQ(ProtocolSupport::kYes, findings.upnp.support) << findings.upnp.why;
  EXPECT_EQ(igd.RootDescUrl(), findings.upnp.location);
  EXPECT_EQ("198.51.100.7", findings.upnp.externalAddress);
  EXPECT_EQ((IgdIdentity{"Test", "Fake IGD", ""}), findings.upnp.identity);
  EXPECT_EQ(ProtocolSupport::kYes, findings.natpmp.support)
      << findings.natpmp.why;
  EXPECT_EQ("198.51.100.7", findings.natpmp.publicAddress);
  EXPECT_EQ(1, igd.Count("GetExternalIPAddress"));
  EXPECT_EQ(1, natpmp.Requests());

  RouterCheck check = CheckRouter(findings);
  EXPECT_TRUE(check.ok);
  EXPECT_EQ("Test: Fake IGD", check.name.pfpath);
  EXPECT_FALSE(check.doubleNat);
}

TEST(DetectProbeRouter, NatPmpOnlyWhenNoUpnpDeviceAnswers) {
  FakeNatPmp natpmp;
  UdpResponder silent([](const UdpResponder::Bytes &) {
    return std::vector<UdpResponder::Bytes>{};
  });
  std::unique_ptr<RouterProbes> probes =
      MakeRouterProbes(ProbeOptions(silent.Port(), natpmp.Port()));
  RouterFindings findings = ProbeRouter(*probes, "127.0.0.1");
  EXPECT_EQ(ProtocolSupport::kNo, findings.upnp.support);
  EXPECT_NE(std::string::npos,
            findings.upnp.why.find("no UPnP device answered at 127.0.0.1"));
  EXPECT_EQ(ProtocolSupport::kYes, findings.natpmp.support);
  EXPECT_TRUE(CheckRouter(findings).ok);
}

TEST(DetectProbeRouter, UpnpOnlyWhenNatPmpStaysSilent) {
  FakeIgd igd;
  FakeNatPmp natpmp;
  natpmp.SetSilent(true);
  UdpResponder device(SsdpDevice(igd.RootDescUrl()));
  std::unique_ptr<RouterProbes> probes = MakeRouterProbes(
      ProbeOptions(device.Port(), natpmp.Port(), milliseconds(10000)));
  RouterFindings findings = ProbeRouter(*probes, "127.0.0.1");
  EXPECT_EQ(ProtocolSupport::kYes, findings.upnp.support);
  EXPECT_EQ(ProtocolSupport::kNo, findings.natpmp.support);
  // Two tries: 100 ms, then 200 ms.
  EXPECT_EQ(2, natpmp.Requests());
}

TEST(DetectProbeRouter, NeitherProtocolFailsTheCheck) {
  FakeNatPmp natpmp;
  natpmp.SetSilent(true);
  UdpResponder silent([](const UdpResponder::Bytes &) {
    return std::vector<UdpResponder::Bytes>{};
  });
  std::unique_ptr<RouterProbes> probes =
      MakeRouterProbes(ProbeOptions(silent.Port(), natpmp.Port()));
  RouterCheck check = CheckRouter(ProbeRouter(*probes, "127.0.0.1"));
  EXPECT_FALSE(check.ok);
  EXPECT_EQ(ProtocolSupport::kNo, check.upnp);
  EXPECT_EQ(ProtocolSupport::kNo, check.natpmp);
}

TEST(DetectProbeRouter, ADeviceOffTheLocalNetworkIsRefused) {
  FakeNatPmp natpmp;
  natpmp.SetSilent(true);
  UdpResponder device(SsdpDevice("http://203.0.113.5:80/rootDesc.xml"));
  std::unique_ptr<RouterProbes> probes = MakeRouterProbes(
      ProbeOptions(device.Port(), natpmp.Port(), milliseconds(1000)));
  ClearLogs();
  RouterFindings findings = ProbeRouter(*probes, "127.0.0.1");
  EXPECT_EQ(ProtocolSupport::kNo, findings.upnp.support);
  EXPECT_TRUE(HasLogContaining("refusing the UPnP device at "
                               "http://203.0.113.5:80/rootDesc.xml"));
}

TEST(DetectProbeRouter, ADeviceWithoutAWanConnectionIsNotAnIgd) {
  FakeIgd igd;
  igd.SetRootDescription("<?xml version=\"1.0\"?><root><device><deviceType>"
                         "urn:schemas-upnp-org:device:MediaServer:1"
                         "</deviceType><manufacturer>Media</manufacturer>"
                         "<modelName>Box</modelName></device></root>");
  FakeNatPmp natpmp;
  natpmp.SetSilent(true);
  UdpResponder device(SsdpDevice(igd.RootDescUrl()));
  std::unique_ptr<RouterProbes> probes = MakeRouterProbes(
      ProbeOptions(device.Port(), natpmp.Port(), milliseconds(10000)));
  RouterFindings findings = ProbeRouter(*probes, "127.0.0.1");
  EXPECT_EQ(ProtocolSupport::kNo, findings.upnp.support);
  EXPECT_EQ(IgdIdentity{}, findings.upnp.identity);
}

TEST(DetectProbeRouter, DescriptionFetchIsBounded) {
  FakeIgd igd;
  std::optional<std::string> description =
      FetchRootDescription(igd.RootDescUrl(), milliseconds(2000));
  ASSERT_TRUE(description.has_value());
  EXPECT_NE(std::string::npos,
            description->find("<modelName>Fake IGD</modelName>"));

  const uint16_t closed = ClosedPort(SOCK_STREAM);
  EXPECT_FALSE(
      FetchRootDescription("http://127.0.0.1:" + std::to_string(closed) +
                               "/rootDesc.xml",
                           milliseconds(500))
          .has_value());

  igd.SetRootDescription(std::string(kMaxRootDescriptionBytes + 1, 'x'));
  EXPECT_FALSE(
      FetchRootDescription(igd.RootDescUrl(), milliseconds(2000)).has_value());
}

} // namespace
} // namespace zark::test
