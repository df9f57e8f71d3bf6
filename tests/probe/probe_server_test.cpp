// The probe server on loopback: every check goes to the address the request
// came from and nowhere else; requests per address are limited; every wait
// is bounded; everything it starts is joined.
//
// Loopback has the whole of 127.0.0.0/8: a client bound to 127.0.0.2 is,
// to the server, another host than one bound to 127.0.0.1.
#include "probe_server.h"

#include "probe_test_support.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <mutex>
#include <string>
#include <vector>

namespace zark::probe {
namespace {

using test::Ask;
using test::Behaviour;
using test::ConnectFrom;
using test::ReadLine;
using test::SendAll;
using test::TestListener;
using test::UnusedPort;
using Clock = std::chrono::steady_clock;

// Records where each check was sent and answers "refused".
class RecordingConnectBack final : public ConnectBack {
public:
  Verdict Check(const sockaddr_storage &requester, socklen_t length,
                const Request &request) override {
    Target target;
    EXPECT_TRUE(MakeTarget(requester, length, request.port, target));
    std::lock_guard<std::mutex> lock(mMutex);
    mTargets.push_back(AddressText(target.address, target.length) + ":" +
                       std::to_string(request.port) + " " +
                       TransportName(request.transport) + " " + request.token);
    return {Result::kUnreachable, reason::kRefused};
  }
  std::vector<std::string> Targets() const {
    std::lock_guard<std::mutex> lock(mMutex);
    return mTargets;
  }

private:
  mutable std::mutex mMutex;
  std::vector<std::string> mTargets;
};

// A clock that only moves when the test says so.
class FakeClock {
public:
  Clock::time_point Now() const {
    std::lock_guard<std::mutex> lock(mMutex);
    return mNow;
  }
  void Advance(std::chrono::milliseconds by) {
    std::lock_guard<std::mutex> lock(mMutex);
    mNow += by;
  }

private:
  mutable std::mutex mMutex;
  Clock::time_point mNow = Clock::time_point() + std::chrono::hours(1);
};

ServerOptions LoopbackOptions() {
  ServerOptions options;
  options.listen = {"127.0.0.1:0"};
  options.idleTimeout = std::chrono::milliseconds(3000);
  return options;
}

class ProbeServerTest : public testing::Test {
protected:
  void Start(ServerOptions options, ConnectBack &connectBack) {
    mServer = std::make_unique<ProbeServer>(std::move(options), connectBack,
                                            [this] { return mClock.Now(); });
    std::string error;
    ASSERT_TRUE(mServer->Start(error)) << error;
    ASSERT_EQ(1u, mServer->Ports().size());
    mPort = mServer->Ports()[0];
    ASSERT_NE(0, mPort);
  }
  void TearDown() override { mServer.reset(); }

  FakeClock mClock;
  std::unique_ptr<ProbeServer> mServer;
  uint16_t mPort = 0;
};

// The server's one promise: it knocks on the requester's door only.
TEST_F(ProbeServerTest, ChecksGoToTheRequesterAndNowhereElse) {
  SocketConnectBack real(
      {std::chrono::milliseconds(1000), std::chrono::milliseconds(1000)});
  Start(LoopbackOptions(), real);
  const uint16_t port = UnusedPort();
  // The same port on two hosts; only 127.0.0.2 asks.
  TestListener decoy(true, "127.0.0.1", port, Behaviour::kWriteToken, "t1");
  TestListener own(true, "127.0.0.2", port, Behaviour::kWriteToken, "t2");
  ASSERT_TRUE(decoy.Ok() && own.Ok());

  // With the decoy's token: the decoy is never contacted.
  EXPECT_EQ(
      "{\"result\":\"unreachable\",\"reason\":\"wrong-answer\","
      "\"protocol\":\"tcp\",\"port\":" +
          std::to_string(port) + "}",
      Ask("127.0.0.2", mPort, "check tcp " + std::to_string(port) + " t1\n"));
  EXPECT_EQ(0, decoy.Seen());
  EXPECT_EQ(1, own.Seen());

  EXPECT_EQ(
      "{\"result\":\"reachable\",\"reason\":\"token\",\"protocol\":"
      "\"tcp\",\"port\":" +
          std::to_string(port) + "}",
      Ask("127.0.0.2", mPort, "check tcp " + std::to_string(port) + " t2\n"));
  EXPECT_EQ(0, decoy.Seen());
  EXPECT_EQ(2, own.Seen());

  // A host with nothing there gets "refused", even though 127.0.0.1 and
  // 127.0.0.2 listen on that port.
  EXPECT_EQ(
      "{\"result\":\"unreachable\",\"reason\":\"refused\",\"protocol\":"
      "\"tcp\",\"port\":" +
          std::to_string(port) + "}",
      Ask("127.0.0.3", mPort, "check tcp " + std::to_string(port) + " t1\n"));
  EXPECT_EQ(0, decoy.Seen());
  EXPECT_EQ(2, own.Seen());
}

TEST_F(ProbeServerTest, RequestsNamingAnAddressAreRefusedUnchecked) {
  RecordingConnectBack recording;
  Start(LoopbackOptions(), recording);
  for (const char *line :
       {"check tcp 10.0.0.1:80\n", "check tcp 80 10.0.0.1\n",
        "check tcp 80 token 10.0.0.1\n", "check 10.0.0.1 tcp 80\n",
        "check tcp 80 ::1\n", "check tcp 80 example.org\n"}) {
    std::string answer = Ask("127.0.0.1", mPort, line);
    EXPECT_NE(std::string::npos, answer.find("\"reason\":\"bad-request\""))
        << line << " -> " << answer;
  }
  EXPECT_TRUE(recording.Targets().empty());
  EXPECT_EQ(6, mServer->Counters().badRequests);
  EXPECT_EQ(0, mServer->Counters().checks);
}

TEST_F(ProbeServerTest, TheTargetIsThePeerAddressOfEachConnection) {
  RecordingConnectBack recording;
  Start(LoopbackOptions(), recording);
  Ask("127.0.0.2", mPort, "check tcp 8080 abc\n");
  Ask("127.0.0.3", mPort, "check udp 53\n");
  Ask("127.0.0.1", mPort, "check tcp 1\n");
  EXPECT_EQ((std::vector<std::string>{"127.0.0.2:8080 tcp abc",
                                      "127.0.0.3:53 udp ", "127.0.0.1:1 tcp "}),
            recording.Targets());
}

TEST_F(ProbeServerTest, AnswersTheRequestersAddress) {
  RecordingConnectBack recording;
  Start(LoopbackOptions(), recording);
  EXPECT_EQ("{\"result\":\"address\",\"address\":\"127.0.0.5\"}",
            Ask("127.0.0.5", mPort, "address\n"));
  EXPECT_TRUE(recording.Targets().empty());
}

TEST_F(ProbeServerTest, SeveralRequestsOnOneConnection) {
  RecordingConnectBack recording;
  Start(LoopbackOptions(), recording);
  int fd = ConnectFrom("127.0.0.1", mPort);
  ASSERT_GE(fd, 0);
  ASSERT_TRUE(SendAll(fd, "check tcp 10\r\ncheck udp 11 x\naddress\n"));
  EXPECT_NE(std::string::npos, ReadLine(fd).find("\"port\":10}"));
  EXPECT_NE(std::string::npos, ReadLine(fd).find("\"port\":11}"));
  EXPECT_EQ("{\"result\":\"address\",\"address\":\"127.0.0.1\"}", ReadLine(fd));
  ::close(fd);
  EXPECT_EQ(3, mServer->Counters().requests);
  EXPECT_EQ(2, mServer->Counters().checks);
}

TEST_F(ProbeServerTest, RateLimitedPerAddress) {
  RecordingConnectBack recording;
  ServerOptions options = LoopbackOptions();
  options.ratePerSecond = 1.0;
  options.burst = 3.0;
  Start(options, recording);
  for (int i = 0; i < 3; ++i) {
    EXPECT_NE(std::string::npos,
              Ask("127.0.0.2", mPort, "check tcp 80\n").find("unreachable"))
        << i;
  }
  EXPECT_EQ("{\"result\":\"error\",\"reason\":\"rate-limited\","
            "\"retry_after_ms\":1000}",
            Ask("127.0.0.2", mPort, "check tcp 80\n"));
  // Another address has its own bucket.
  EXPECT_NE(std::string::npos,
            Ask("127.0.0.3", mPort, "check tcp 80\n").find("unreachable"));
  // A second later, one more.
  mClock.Advance(std::chrono::milliseconds(1000));
  EXPECT_NE(std::string::npos,
            Ask("127.0.0.2", mPort, "check tcp 80\n").find("unreachable"));
  EXPECT_NE(std::string::npos,
            Ask("127.0.0.2", mPort, "check tcp 80\n").find("rate-limited"));
  EXPECT_EQ(5u, recording.Targets().size());
  EXPECT_EQ(2, mServer->Counters().rateLimited);
}

TEST_F(ProbeServerTest, ConnectionsPerAddressAreLimited) {
  RecordingConnectBack recording;
  ServerOptions options = LoopbackOptions();
  options.maxSessionsPerAddress = 2;
  Start(options, recording);
  // Two sessions, each proven running by an answer.
  int first = ConnectFrom("127.0.0.2", mPort);
  int second = ConnectFrom("127.0.0.2", mPort);
  ASSERT_GE(first, 0);
  ASSERT_GE(second, 0);
  for (int fd : {first, second}) {
    ASSERT_TRUE(SendAll(fd, "address\n"));
    EXPECT_EQ("{\"result\":\"address\",\"address\":\"127.0.0.2\"}",
              ReadLine(fd));
  }
  EXPECT_EQ("{\"result\":\"error\",\"reason\":\"busy\"}",
            Ask("127.0.0.2", mPort, "address\n"));
  // Another address is still served.
  EXPECT_EQ("{\"result\":\"address\",\"address\":\"127.0.0.3\"}",
            Ask("127.0.0.3", mPort, "address\n"));
  ::close(first);
  ::close(second);
  EXPECT_EQ(1, mServer->Counters().busy);
}

TEST_F(ProbeServerTest, SessionsInAllAreLimited) {
  RecordingConnectBack recording;
  ServerOptions options = LoopbackOptions();
  options.maxSessions = 1;
  Start(options, recording);
  int first = ConnectFrom("127.0.0.2", mPort);
  ASSERT_GE(first, 0);
  ASSERT_TRUE(SendAll(first, "address\n"));
  ASSERT_NE("<timeout>", ReadLine(first));
  EXPECT_EQ("{\"result\":\"error\",\"reason\":\"busy\"}",
            Ask("127.0.0.3", mPort, "address\n"));
  ::close(first);
}

// Bounded: a connection that never sends a request is closed after the
// idle timeout.
TEST_F(ProbeServerTest, SilentConnectionIsClosed) {
  RecordingConnectBack recording;
  ServerOptions options = LoopbackOptions();
  options.idleTimeout = std::chrono::milliseconds(100);
  Start(options, recording);
  int fd = ConnectFrom("127.0.0.1", mPort);
  ASSERT_GE(fd, 0);
  EXPECT_EQ("<eof>", ReadLine(fd, std::chrono::milliseconds(10000)));
  ::close(fd);
}

// Bounded: a line that does not end is not read on and on.
TEST_F(ProbeServerTest, OverlongLineIsRefusedAndClosed) {
  RecordingConnectBack recording;
  Start(LoopbackOptions(), recording);
  int fd = ConnectFrom("127.0.0.1", mPort);
  ASSERT_GE(fd, 0);
  ASSERT_TRUE(SendAll(fd, "check tcp 80 " + std::string(300, 'a')));
  EXPECT_EQ("{\"result\":\"error\",\"reason\":\"line-too-long\"}",
            ReadLine(fd));
  EXPECT_EQ("<eof>", ReadLine(fd));
  ::close(fd);
  EXPECT_TRUE(recording.Targets().empty());
}

TEST_F(ProbeServerTest, RequestsPerConnectionAreLimited) {
  RecordingConnectBack recording;
  ServerOptions options = LoopbackOptions();
  options.maxRequestsPerSession = 2;
  Start(options, recording);
  int fd = ConnectFrom("127.0.0.1", mPort);
  ASSERT_GE(fd, 0);
  ASSERT_TRUE(SendAll(fd, "address\naddress\naddress\n"));
  EXPECT_NE("<timeout>", ReadLine(fd));
  EXPECT_NE("<timeout>", ReadLine(fd));
  EXPECT_EQ("{\"result\":\"error\",\"reason\":\"busy\"}", ReadLine(fd));
  EXPECT_EQ("<eof>", ReadLine(fd));
  ::close(fd);
}

TEST_F(ProbeServerTest, BadRequestEndsTheConnection) {
  RecordingConnectBack recording;
  Start(LoopbackOptions(), recording);
  int fd = ConnectFrom("127.0.0.1", mPort);
  ASSERT_GE(fd, 0);
  ASSERT_TRUE(SendAll(fd, "scan 1.2.3.0/24\naddress\n"));
  EXPECT_EQ("{\"result\":\"error\",\"reason\":\"bad-request\",\"detail\":"
            "\"unknown-command\"}",
            ReadLine(fd));
  EXPECT_EQ("<eof>", ReadLine(fd));
  ::close(fd);
}

// Stop ends idle sessions at once and joins every thread.
TEST_F(ProbeServerTest, StopEndsIdleSessions) {
  RecordingConnectBack recording;
  ServerOptions options = LoopbackOptions();
  options.idleTimeout = std::chrono::minutes(10);
  Start(options, recording);
  int fd = ConnectFrom("127.0.0.1", mPort);
  ASSERT_GE(fd, 0);
  ASSERT_TRUE(SendAll(fd, "address\n"));
  ASSERT_NE("<timeout>", ReadLine(fd));
  mServer->Stop();
  EXPECT_EQ("<eof>", ReadLine(fd));
  ::close(fd);
}

TEST(ProbeServerListen, AddressesAndRefusals) {
  sockaddr_storage address{};
  socklen_t length = 0;
  EXPECT_TRUE(ParseListenAddress("0.0.0.0:7777", address, length));
  EXPECT_EQ(AF_INET, address.ss_family);
  EXPECT_TRUE(ParseListenAddress("[::]:7777", address, length));
  EXPECT_EQ(AF_INET6, address.ss_family);
  EXPECT_FALSE(ParseListenAddress("7777", address, length));
  EXPECT_FALSE(ParseListenAddress("example.org:7777", address, length));
  EXPECT_FALSE(ParseListenAddress("1.2.3.4:70000", address, length));
  EXPECT_FALSE(ParseListenAddress("1.2.3.4:", address, length));

  RecordingConnectBack recording;
  ServerOptions options;
  options.listen = {"not-an-address"};
  ProbeServer server(options, recording);
  std::string error;
  EXPECT_FALSE(server.Start(error));
  EXPECT_NE(std::string::npos, error.find("not-an-address"));
}

} // namespace
} // namespace zark::probe
