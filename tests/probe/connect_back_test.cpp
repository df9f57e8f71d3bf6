// The checks themselves, against listeners on loopback standing in for the
// requester's ports. Timeouts are short so that the tests stay quick; no
// test asserts on how long anything took.
#include "connect_back.h"

#include "probe_test_support.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstring>

namespace zark::probe {
namespace {

using test::Behaviour;
using test::TestListener;
using test::UnusedPort;

sockaddr_storage Requester(const char *address, uint16_t port,
                           socklen_t &length) {
  sockaddr_in v4{};
  v4.sin_family = AF_INET;
  v4.sin_port = htons(port);
  ::inet_pton(AF_INET, address, &v4.sin_addr);
  sockaddr_storage out{};
  std::memcpy(&out, &v4, sizeof(v4));
  length = sizeof(v4);
  return out;
}

Request Check(Transport transport, uint16_t port, std::string token = "") {
  Request request;
  request.transport = transport;
  request.port = port;
  request.token = std::move(token);
  return request;
}

class ProbeConnectBack : public testing::Test {
protected:
  Verdict Run(Transport transport, uint16_t port, std::string token = "") {
    socklen_t length = 0;
    // The requester's own source port plays no part.
    sockaddr_storage requester = Requester("127.0.0.1", 54321, length);
    return mCheck.Check(requester, length, Check(transport, port, token));
  }

  SocketConnectBack mCheck{
      {std::chrono::milliseconds(1000), std::chrono::milliseconds(300)}};
};

void ExpectVerdict(Result result, const char *why, const Verdict &verdict) {
  EXPECT_EQ(result, verdict.result) << ResultName(verdict.result);
  EXPECT_STREQ(why, verdict.reason);
}

TEST_F(ProbeConnectBack, TcpTokenComesBack) {
  const uint16_t port = UnusedPort();
  TestListener listener(true, "127.0.0.1", port, Behaviour::kWriteToken,
                        "tok3n");
  ASSERT_TRUE(listener.Ok());
  ExpectVerdict(Result::kReachable, reason::kTokenMatched,
                Run(Transport::kTcp, port, "tok3n"));
  EXPECT_EQ(1, listener.Seen());
}

TEST_F(ProbeConnectBack, TcpWithoutTokenConnectionIsEnough) {
  const uint16_t port = UnusedPort();
  TestListener listener(true, "127.0.0.1", port, Behaviour::kStaySilent);
  ASSERT_TRUE(listener.Ok());
  ExpectVerdict(Result::kReachable, reason::kConnected,
                Run(Transport::kTcp, port));
}

TEST_F(ProbeConnectBack, TcpSomethingElseAnswers) {
  const uint16_t port = UnusedPort();
  TestListener listener(true, "127.0.0.1", port, Behaviour::kWriteOther);
  ASSERT_TRUE(listener.Ok());
  ExpectVerdict(Result::kUnreachable, reason::kWrongAnswer,
                Run(Transport::kTcp, port, "tok3n"));
}

TEST_F(ProbeConnectBack, TcpClosedBeforeAnyByte) {
  const uint16_t port = UnusedPort();
  TestListener listener(true, "127.0.0.1", port, Behaviour::kCloseAtOnce);
  ASSERT_TRUE(listener.Ok());
  ExpectVerdict(Result::kUnreachable, reason::kClosed,
                Run(Transport::kTcp, port, "tok3n"));
}

// Bounded: a port that accepts and never writes is given up after the
// answer timeout.
TEST_F(ProbeConnectBack, TcpSilentAfterConnectingIsGivenUp) {
  const uint16_t port = UnusedPort();
  TestListener listener(true, "127.0.0.1", port, Behaviour::kStaySilent);
  ASSERT_TRUE(listener.Ok());
  ExpectVerdict(Result::kUnreachable, reason::kSilent,
                Run(Transport::kTcp, port, "tok3n"));
}

TEST_F(ProbeConnectBack, TcpNothingListening) {
  ExpectVerdict(Result::kUnreachable, reason::kRefused,
                Run(Transport::kTcp, UnusedPort(), "tok3n"));
}

// Bounded: a connection the other side never completes is given up after
// the connect timeout. A listener whose queue is full drops further SYNs.
TEST_F(ProbeConnectBack, TcpConnectThatNeverCompletesIsGivenUp) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  ASSERT_GE(fd, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof(address);
  ASSERT_EQ(0, ::bind(fd, reinterpret_cast<sockaddr *>(&address), length));
  ASSERT_EQ(0, ::listen(fd, 0));
  ASSERT_EQ(0,
            ::getsockname(fd, reinterpret_cast<sockaddr *>(&address), &length));
  const uint16_t port = ntohs(address.sin_port);
  // Fill the accept queue (never accepted).
  std::vector<int> fillers;
  for (int i = 0; i < 4; ++i) {
    int filler =
        ::socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    ::connect(filler, reinterpret_cast<sockaddr *>(&address), length);
    fillers.push_back(filler);
  }
  Verdict verdict = Run(Transport::kTcp, port, "tok3n");
  // Either the SYN was dropped (timeout), or an earlier filler's place
  // made room and the token never came (silent): both are bounded waits
  // ending "unreachable".
  EXPECT_EQ(Result::kUnreachable, verdict.result);
  EXPECT_TRUE(std::string(verdict.reason) == reason::kTimeout ||
              std::string(verdict.reason) == reason::kSilent)
      << verdict.reason;
  for (int filler : fillers) {
    ::close(filler);
  }
  ::close(fd);
}

TEST_F(ProbeConnectBack, UdpTokenAndNonceComeBack) {
  const uint16_t port = UnusedPort();
  TestListener listener(false, "127.0.0.1", port, Behaviour::kWriteToken,
                        "tok3n");
  ASSERT_TRUE(listener.Ok());
  ExpectVerdict(Result::kReachable, reason::kTokenMatched,
                Run(Transport::kUdp, port, "tok3n"));
}

// An echo service sends our datagram back: it is not the requester's
// listener, which alone knows the token.
TEST_F(ProbeConnectBack, UdpEchoIsNotTheToken) {
  const uint16_t port = UnusedPort();
  TestListener listener(false, "127.0.0.1", port, Behaviour::kEcho);
  ASSERT_TRUE(listener.Ok());
  ExpectVerdict(Result::kUnreachable, reason::kWrongAnswer,
                Run(Transport::kUdp, port, "tok3n"));
}

TEST_F(ProbeConnectBack, UdpWithoutTokenAnyReplyIsEnough) {
  const uint16_t port = UnusedPort();
  TestListener listener(false, "127.0.0.1", port, Behaviour::kEcho);
  ASSERT_TRUE(listener.Ok());
  ExpectVerdict(Result::kReachable, reason::kReplied,
                Run(Transport::kUdp, port));
}

TEST_F(ProbeConnectBack, UdpWithoutTokenSilenceCannotTell) {
  const uint16_t port = UnusedPort();
  TestListener listener(false, "127.0.0.1", port, Behaviour::kStaySilent);
  ASSERT_TRUE(listener.Ok());
  ExpectVerdict(Result::kUnknown, reason::kNoAnswer,
                Run(Transport::kUdp, port));
  // The datagram did go out (it is sent up to four times).
  EXPECT_GE(listener.Seen(), 1);
}

TEST_F(ProbeConnectBack, UdpWithTokenSilenceIsUnreachable) {
  const uint16_t port = UnusedPort();
  TestListener listener(false, "127.0.0.1", port, Behaviour::kStaySilent);
  ASSERT_TRUE(listener.Ok());
  ExpectVerdict(Result::kUnreachable, reason::kTimeout,
                Run(Transport::kUdp, port, "tok3n"));
}

TEST_F(ProbeConnectBack, UdpNothingListeningIsRefused) {
  ExpectVerdict(Result::kUnreachable, reason::kRefused,
                Run(Transport::kUdp, UnusedPort(), "tok3n"));
}

TEST(ProbeTarget, KeepsTheAddressReplacesThePort) {
  socklen_t length = 0;
  sockaddr_storage requester = Requester("203.0.113.9", 40000, length);
  Target target;
  ASSERT_TRUE(MakeTarget(requester, length, 8080, target));
  sockaddr_in v4{};
  std::memcpy(&v4, &target.address, sizeof(v4));
  EXPECT_EQ(8080, ntohs(v4.sin_port));
  EXPECT_EQ("203.0.113.9", AddressText(target.address, target.length));

  sockaddr_storage unknown{};
  unknown.ss_family = AF_UNIX;
  EXPECT_FALSE(MakeTarget(unknown, sizeof(unknown), 80, target));
}

TEST(ProbeTarget, MappedIpv6IsShownAsIpv4) {
  sockaddr_in6 v6{};
  v6.sin6_family = AF_INET6;
  ::inet_pton(AF_INET6, "::ffff:198.51.100.4", &v6.sin6_addr);
  sockaddr_storage address{};
  std::memcpy(&address, &v6, sizeof(v6));
  EXPECT_EQ("198.51.100.4", AddressText(address, sizeof(v6)));
  ::inet_pton(AF_INET6, "2001:db8::7", &v6.sin6_addr);
  std::memcpy(&address, &v6, sizeof(v6));
  EXPECT_EQ("2001:db8::7", AddressText(address, sizeof(v6)));
}

} // namespace
} // namespace zark::probe
