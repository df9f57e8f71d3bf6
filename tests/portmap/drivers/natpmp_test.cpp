// The NAT-PMP driver against the fake UDP responder on loopback: public
// address, map, unmap, a port taken by another device, router errors, the
// bounded retry schedule, and recorded replies (tests/data/natpmp).
#include "drivers/natpmp.h"

#include "fake_natpmp.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <vector>

namespace zark::portmap {
namespace {

using test::FakeNatPmp;
using test::NatPmpRequest;

NatPmpOptions OptionsFor(const FakeNatPmp &fake) {
  NatPmpOptions options;
  options.gateway = "127.0.0.1";
  options.port = fake.Port();
  // Short waits keep the silent-router cases quick; the schedule's shape
  // (tries, doubling) is what the tests count.
  options.firstWait = std::chrono::milliseconds(20);
  return options;
}

PortMapping Tcp(uint16_t external, uint16_t internal) {
  return {IpProtocol::kTcp, external, internal, "127.0.0.1", ""};
}

TEST(PortMapRouterNatPmp, ReadsThePublicAddress) {
  FakeNatPmp fake;
  NatPmpRouter router(OptionsFor(fake));
  std::string address;

  RouterResult result = router.GetExternalAddress(address);

  ASSERT_TRUE(result.Ok()) << result.message;
  EXPECT_EQ("198.51.100.7", address);
  EXPECT_EQ(1, fake.Requests());
  EXPECT_EQ("127.0.0.1", router.Location());
}

TEST(PortMapRouterNatPmp, MapsAndUnmaps) {
  FakeNatPmp fake;
  NatPmpRouter router(OptionsFor(fake));

  RouterResult mapped = router.AddPortMapping(Tcp(8080, 80));
  ASSERT_TRUE(mapped.Ok()) << mapped.message;
  EXPECT_EQ(7200u, mapped.leaseSeconds);
  EXPECT_EQ((std::vector<FakeNatPmp::Mapping>{{2, 80, 8080, 7200}}),
            fake.Table());

  RouterResult unmapped = router.DeletePortMapping(Tcp(8080, 80));
  ASSERT_TRUE(unmapped.Ok()) << unmapped.message;
  EXPECT_TRUE(fake.Table().empty());

  std::vector<NatPmpRequest> requests = fake.ReceivedRequests();
  ASSERT_EQ(2u, requests.size());
  EXPECT_EQ(2, requests[0].opcode);
  EXPECT_EQ(80, requests[0].privatePort);
  EXPECT_EQ(8080, requests[0].publicPort);
  EXPECT_EQ(7200u, requests[0].lifetime);
  EXPECT_EQ(2, requests[1].opcode);
  EXPECT_EQ(80, requests[1].privatePort);
  EXPECT_EQ(0, requests[1].publicPort);
  EXPECT_EQ(0u, requests[1].lifetime);
}

TEST(PortMapRouterNatPmp, MapsUdpWithItsOwnOpcode) {
  FakeNatPmp fake;
  NatPmpRouter router(OptionsFor(fake));
  PortMapping udp{IpProtocol::kUdp, 5000, 5000, "127.0.0.1", ""};

  ASSERT_TRUE(router.AddPortMapping(udp).Ok());

  EXPECT_EQ((std::vector<FakeNatPmp::Mapping>{{1, 5000, 5000, 7200}}),
            fake.Table());
}

TEST(PortMapRouterNatPmp, AnotherPortGrantedIsAConflictWithThatPort) {
  FakeNatPmp fake;
  fake.TakePublicPort(2, 8080);
  NatPmpRouter router(OptionsFor(fake));

  RouterResult mapped = router.AddPortMapping(Tcp(8080, 80));

  EXPECT_EQ(RouterOutcome::kConflict, mapped.outcome);
  EXPECT_EQ(8081, mapped.grantedExternalPort);
  EXPECT_NE(std::string::npos, mapped.message.find("8081 instead of 8080"));
  EXPECT_EQ(1, fake.Requests());
}

TEST(PortMapRouterNatPmp, RouterErrorIsRefused) {
  FakeNatPmp fake;
  fake.SetHandler([](const NatPmpRequest &request) {
    // Result 2: not authorized.
    return std::optional<std::vector<uint8_t>>(
        FakeNatPmp::MappingReply(request.opcode, 2, request.privatePort, 0, 0));
  });
  NatPmpRouter router(OptionsFor(fake));

  RouterResult mapped = router.AddPortMapping(Tcp(8080, 80));

  EXPECT_EQ(RouterOutcome::kRefused, mapped.outcome);
  EXPECT_EQ(1, fake.Requests());
}

TEST(PortMapRouterNatPmp, SilentRouterGetsFourTriesAndNoMore) {
  FakeNatPmp fake;
  fake.SetSilent(true);
  NatPmpRouter router(OptionsFor(fake));
  test::ClearLogs();

  RouterResult mapped = router.AddPortMapping(Tcp(8080, 80));

  EXPECT_EQ(RouterOutcome::kNoAnswer, mapped.outcome);
  EXPECT_EQ(4, fake.Requests());
  for (const NatPmpRequest &request : fake.ReceivedRequests()) {
    EXPECT_EQ(8080, request.publicPort);
  }
  EXPECT_TRUE(test::HasLogContaining(
      "sendnewportmappingrequest failed: rc=-100 (no reply before the "
      "deadline) TCP 8080->80 lifetime 7200 (4 tries)"));
}

TEST(PortMapRouterNatPmp, TriesAreCountedByTheOptions) {
  FakeNatPmp fake;
  fake.SetSilent(true);
  NatPmpOptions options = OptionsFor(fake);
  options.tries = 2;
  NatPmpRouter router(options);
  std::string address;

  EXPECT_EQ(RouterOutcome::kNoAnswer,
            router.GetExternalAddress(address).outcome);
  EXPECT_EQ(2, fake.Requests());
}

TEST(PortMapRouterNatPmp, LateReplyOfAnotherKindIsIgnored) {
  // The first try's reply comes back for the wrong protocol (as a late
  // answer to an earlier request would); the driver waits for its own.
  FakeNatPmp fake;
  int calls = 0;
  fake.SetHandler([&calls](const NatPmpRequest &request)
                      -> std::optional<std::vector<uint8_t>> {
    if (++calls == 1) {
      return FakeNatPmp::MappingReply(1, 0, request.privatePort,
                                      request.publicPort, 7200);
    }
    return std::nullopt;
  });
  NatPmpRouter router(OptionsFor(fake));

  RouterResult mapped = router.AddPortMapping(Tcp(8080, 80));

  ASSERT_TRUE(mapped.Ok()) << mapped.message;
  EXPECT_EQ(2, fake.Requests());
}

TEST(PortMapRouterNatPmp, NothingListeningIsNoAnswerAtOnce) {
  // A closed UDP port answers "port unreachable": no need to wait.
  int probe = ::socket(AF_INET, SOCK_DGRAM, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof(address);
  ASSERT_EQ(0, ::bind(probe, reinterpret_cast<sockaddr *>(&address),
                      sizeof(address)));
  ASSERT_EQ(
      0, ::getsockname(probe, reinterpret_cast<sockaddr *>(&address), &length));
  ::close(probe); // the port is now closed
  NatPmpOptions options;
  options.gateway = "127.0.0.1";
  options.port = ntohs(address.sin_port);
  NatPmpRouter router(options);

  RouterResult mapped = router.AddPortMapping(Tcp(8080, 80));

  EXPECT_EQ(RouterOutcome::kNoAnswer, mapped.outcome);
  EXPECT_EQ(-7, mapped.code); // NATPMP_ERR_NOGATEWAYSUPPORT
}

TEST(PortMapRouterNatPmp, CannotReadTheRoutersTable) {
  FakeNatPmp fake;
  NatPmpRouter router(OptionsFor(fake));
  RouterMapping entry;
  std::vector<RouterMapping> entries;

  EXPECT_EQ(
      RouterOutcome::kUnsupported,
      router.GetSpecificPortMapping(IpProtocol::kTcp, 8080, entry).outcome);
  EXPECT_EQ(RouterOutcome::kUnsupported, router.ListMappings(entries).outcome);
  EXPECT_TRUE(router.FiniteLeases());
  EXPECT_EQ(0, fake.Requests());
}

// Recorded replies: the responder sends the recorded datagram.
class PortMapRouterNatPmpRecorded : public testing::TestWithParam<std::string> {
};

std::map<std::string, std::string> ReadExpect(const std::string &path) {
  std::map<std::string, std::string> expect;
  std::ifstream in(path);
  std::string line;
  while (std::getline(in, line)) {
    if (!line.empty() && line[0] != '#' &&
        line.find('=') != std::string::npos) {
      expect[line.substr(0, line.find('='))] = line.substr(line.find('=') + 1);
    }
  }
  return expect;
}

TEST_P(PortMapRouterNatPmpRecorded, IsReadAsExpected) {
  const std::string base =
      std::string(ZARK_TEST_DATA_DIR) + "/natpmp/" + GetParam();
  std::ifstream in(base + ".bin", std::ios::binary);
  std::vector<uint8_t> reply((std::istreambuf_iterator<char>(in)),
                             std::istreambuf_iterator<char>());
  ASSERT_FALSE(reply.empty());
  std::map<std::string, std::string> expect = ReadExpect(base + ".expect");
  ASSERT_FALSE(expect["seen"].empty());
  FakeNatPmp fake;
  fake.SetHandler([reply](const NatPmpRequest &) {
    return std::optional<std::vector<uint8_t>>(reply);
  });
  NatPmpRouter router(OptionsFor(fake));

  RouterResult result;
  const std::string operation = expect["operation"];
  if (operation == "public_address") {
    std::string address;
    result = router.GetExternalAddress(address);
    EXPECT_EQ(expect["address"], address);
  } else if (operation == "map_tcp") {
    uint16_t port = static_cast<uint16_t>(std::stoi(expect["private_port"]));
    result = router.AddPortMapping(
        Tcp(static_cast<uint16_t>(std::stoi(expect["public_port"])), port));
    EXPECT_EQ(expect["lease"], std::to_string(result.leaseSeconds));
  } else if (operation == "unmap_tcp") {
    uint16_t port = static_cast<uint16_t>(std::stoi(expect["private_port"]));
    result = router.DeletePortMapping(Tcp(port, port));
  } else {
    FAIL() << "unknown operation " << operation;
  }
  EXPECT_EQ(expect["outcome"] == "ok", result.Ok()) << result.message;
  EXPECT_EQ(1, fake.Requests());
}

INSTANTIATE_TEST_SUITE_P(Files, PortMapRouterNatPmpRecorded,
                         testing::Values("public_address_miniupnpd",
                                         "map_tcp_miniupnpd",
                                         "unmap_tcp_miniupnpd"),
                         [](const testing::TestParamInfo<std::string> &info) {
                           return info.param;
                         });

} // namespace
} // namespace zark::portmap
