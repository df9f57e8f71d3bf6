// The probe service cannot be pointed at a third party. The real zark-probed
// executable listens on loopback (IPv4 and IPv6, one port); requesters
// connect from chosen loopback addresses, decoy listeners wait on the same
// port at the addresses a request tries to name, and must see nothing.
//
// tests/probe already proves, against the server in-process, that a TCP
// check goes to the requester and nowhere else
// (ProbeServerTest.ChecksGoToTheRequesterAndNowhereElse) and that a few
// lines naming an address are refused (ProbeProtocol.NoAddressCanBeNamed,
// ProbeServerTest.RequestsNamingAnAddressAreRefusedUnchecked). Added here,
// against the executable: many more ways of naming another host (port
// lists, numeric and mapped forms, proxy and HTTP lines), a token that is a
// host name, UDP checks, an IPv6 requester and an IPv4-mapped IPv6
// requester.
#include "security_support.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstring>
#include <fstream>
#include <sstream>

namespace zark::security {
namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

// A socket address of a textual IPv4 or IPv6 address.
bool SocketAddress(const std::string &text, uint16_t port,
                   sockaddr_storage &address, socklen_t &length) {
  address = sockaddr_storage{};
  sockaddr_in v4{};
  if (::inet_pton(AF_INET, text.c_str(), &v4.sin_addr) == 1) {
    v4.sin_family = AF_INET;
    v4.sin_port = htons(port);
    std::memcpy(&address, &v4, sizeof(v4));
    length = sizeof(v4);
    return true;
  }
  sockaddr_in6 v6{};
  if (::inet_pton(AF_INET6, text.c_str(), &v6.sin6_addr) == 1) {
    v6.sin6_family = AF_INET6;
    v6.sin6_port = htons(port);
    std::memcpy(&address, &v6, sizeof(v6));
    length = sizeof(v6);
    return true;
  }
  return false;
}

// A TCP connection from `from` to `to`:port (both of one family; an
// IPv4-mapped IPv6 pair goes over an IPv6 socket to the IPv4 listener).
int ConnectFrom(const std::string &from, const std::string &to, uint16_t port) {
  sockaddr_storage local{};
  sockaddr_storage remote{};
  socklen_t localLength = 0;
  socklen_t remoteLength = 0;
  if (!SocketAddress(from, 0, local, localLength) ||
      !SocketAddress(to, port, remote, remoteLength)) {
    return -1;
  }
  int fd = ::socket(remote.ss_family, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    return -1;
  }
  if (remote.ss_family == AF_INET6) {
    const int off = 0;
    ::setsockopt(fd, IPPROTO_IPV6, IPV6_V6ONLY, &off, sizeof(off));
  }
  if (::bind(fd, reinterpret_cast<sockaddr *>(&local), localLength) != 0 ||
      ::connect(fd, reinterpret_cast<sockaddr *>(&remote), remoteLength) != 0) {
    ::close(fd);
    return -1;
  }
  return fd;
}

// Sends one request line from `from` and reads the answer line (at most
// 10 s); "<no connection>", "<eof>" or "<timeout>" otherwise.
std::string Ask(const std::string &from, const std::string &to, uint16_t port,
                const std::string &line) {
  int fd = ConnectFrom(from, to, port);
  if (fd < 0) {
    return "<no connection>";
  }
  (void)!::send(fd, line.data(), line.size(), MSG_NOSIGNAL);
  std::string answer;
  const Clock::time_point deadline = Clock::now() + 10s;
  for (;;) {
    std::size_t newline = answer.find('\n');
    if (newline != std::string::npos) {
      answer.resize(newline);
      break;
    }
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - Clock::now());
    pollfd watched{fd, POLLIN, 0};
    if (left.count() <= 0 ||
        ::poll(&watched, 1, static_cast<int>(left.count())) <= 0) {
      answer = "<timeout>";
      break;
    }
    char buffer[512];
    ssize_t n = ::recv(fd, buffer, sizeof(buffer), 0);
    if (n <= 0) {
      answer = answer.empty() ? "<eof>" : answer;
      break;
    }
    answer.append(buffer, static_cast<std::size_t>(n));
  }
  ::close(fd);
  return answer;
}

// The requester's side of a UDP check with a token:
// "zark-probe <nonce>\n" is answered "<token> <nonce>\n".
std::string AnswerProbeDatagram(const std::string &datagram,
                                const std::string &token) {
  static const std::string kPrefix = "zark-probe ";
  if (datagram.rfind(kPrefix, 0) != 0 || token.empty()) {
    return "";
  }
  std::string nonce = datagram.substr(kPrefix.size());
  while (!nonce.empty() && (nonce.back() == '\n' || nonce.back() == '\r')) {
    nonce.pop_back();
  }
  return token + " " + nonce + "\n";
}

class SecurityProbeTarget : public testing::Test {
protected:
  void SetUp() override {
    // One port for the service's IPv4 and IPv6 listeners, and one for the
    // checked listeners, free on both families.
    for (int attempt = 0; attempt < 20 && (mPort == 0 || mChecked == 0);
         ++attempt) {
      mPort = PortFreeOnBoth();
      mChecked = PortFreeOnBoth();
      if (mPort == mChecked) {
        mChecked = 0;
      }
    }
    ASSERT_NE(0, mPort);
    ASSERT_NE(0, mChecked);
    std::string why;
    LaunchOptions options;
    options.args = {kProbed,
                    "--listen",
                    "127.0.0.1:" + std::to_string(mPort),
                    "--listen",
                    "[::1]:" + std::to_string(mPort),
                    "--connect-timeout",
                    "1000",
                    "--answer-timeout",
                    "1000"};
    mOutput = kWorkDir + "/probed." + std::to_string(mPort) + ".out";
    options.outputFile = mOutput;
    mPid = Launch(options, why);
    ASSERT_GT(mPid, 0) << why;
    bool up = false;
    for (int i = 0; i < 500 && !up; ++i) {
      int fd = ConnectFrom("127.0.0.1", "127.0.0.1", mPort);
      up = fd >= 0;
      if (fd >= 0) {
        ::close(fd);
      } else {
        std::this_thread::sleep_for(10ms);
      }
    }
    ASSERT_TRUE(up) << "zark-probed does not listen";
  }

  void TearDown() override {
    if (mPid > 0) {
      ::kill(mPid, SIGTERM);
      const int status = WaitForExit(mPid, 10s);
      EXPECT_TRUE(status != -1 && WIFEXITED(status) && WEXITSTATUS(status) == 0)
          << "zark-probed did not stop cleanly: " << status << "\n"
          << Output();
    }
  }

  static uint16_t PortFreeOnBoth() {
    int fd = BoundSocket(SOCK_STREAM, "127.0.0.1", 0);
    if (fd < 0) {
      return 0;
    }
    uint16_t port = BoundPort(fd);
    ::close(fd);
    for (const char *address : {"127.0.0.1", "::1"}) {
      for (int type : {SOCK_STREAM, SOCK_DGRAM}) {
        int probe = BoundSocket(type, address, port);
        if (probe < 0) {
          return 0;
        }
        ::close(probe);
      }
    }
    return port;
  }

  // What the service logged.
  std::string Output() const {
    std::ifstream in(mOutput);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
  }

  // Decoys on mChecked at every address a request might name.
  struct Decoys {
    std::vector<std::unique_ptr<CountingListener>> listeners;
    int Seen() const {
      int seen = 0;
      for (const auto &listener : listeners) {
        seen += listener->Seen();
      }
      return seen;
    }
  };
  Decoys MakeDecoys(const std::vector<std::string> &addresses) const {
    Decoys decoys;
    for (const std::string &address : addresses) {
      for (int type : {SOCK_STREAM, SOCK_DGRAM}) {
        decoys.listeners.push_back(std::make_unique<CountingListener>(
            BoundSocket(type, address, mChecked), "decoy",
            &AnswerProbeDatagram));
        EXPECT_TRUE(decoys.listeners.back()->Ok()) << address;
      }
    }
    return decoys;
  }

  uint16_t mPort = 0;
  uint16_t mChecked = 0;
  pid_t mPid = -1;
  std::string mOutput;
};

TEST_F(SecurityProbeTarget, LinesNamingAnotherHostAreRefusedUnchecked) {
  Decoys decoys = MakeDecoys({"127.0.0.1", "127.0.0.3", "127.0.0.2", "::1"});
  const std::string port = std::to_string(mChecked);
  const std::string next = std::to_string(mChecked + 1);
  const std::vector<std::string> lines = {
      "check tcp 127.0.0.3:" + port,
      "check tcp 127.0.0.3 " + port,
      "check udp " + port + " 127.0.0.3",
      "check tcp " + port + " ::ffff:127.0.0.3",
      "check tcp ::ffff:127.0.0.3 " + port,
      "check tcp [::ffff:127.0.0.3]:" + port,
      "check tcp [::1]:" + port,
      "check tcp " + port + " [::1]",
      "check tcp " + port + ",127.0.0.3:" + port,
      "check tcp " + port + "," + next,
      "check tcp " + port + "-" + next,
      "check tcp " + port + " " + next + " token",
      "check udp " + port + "/127.0.0.3",
      "check tcp +" + port,
      "check tcp 0x" + std::to_string(mChecked),
      "check tcp 2130706435",
      "check tcp " + port + " token@127.0.0.3",
      "check tcp " + port + " token%40127.0.0.3",
      "check tcp " + port + " token.127.0.0.3",
      "check tcp " + port + " probe.example.org",
      "check tcp " + port + " token 127.0.0.3",
      "check 127.0.0.3 tcp " + port,
      "check tcp\t" + port + "\t127.0.0.3",
      "connect 127.0.0.3 " + port,
      "PROXY TCP4 127.0.0.3 127.0.0.1 " + port + " " + std::to_string(mPort),
      "GET http://127.0.0.3:" + port + "/ HTTP/1.1",
      "check tcp " + port + std::string(1, '\0') + "127.0.0.3",
  };
  for (std::string line : lines) {
    line += "\n";
    const std::string answer = Ask("127.0.0.2", "127.0.0.1", mPort, line);
    EXPECT_NE(std::string::npos, answer.find("\"result\":\"error\""))
        << line << " -> " << answer;
  }
  EXPECT_EQ(0, decoys.Seen());
  // The service checked nothing at all.
  EXPECT_EQ(std::string::npos, Output().find(": reachable"));
  EXPECT_EQ(std::string::npos, Output().find(": unreachable"));
}

// "localhost" and the like are valid tokens: letters only. A token is what
// the requester's listener must send back; it never says where to connect.
TEST_F(SecurityProbeTarget, HostNameAsTokenIsOnlyAToken) {
  Decoys decoys = MakeDecoys({"127.0.0.1", "::1", "127.0.0.3"});
  CountingListener ownTcp(BoundSocket(SOCK_STREAM, "127.0.0.2", mChecked),
                          "localhost");
  CountingListener ownUdp(BoundSocket(SOCK_DGRAM, "127.0.0.2", mChecked),
                          "localhost", &AnswerProbeDatagram);
  ASSERT_TRUE(ownTcp.Ok() && ownUdp.Ok());
  const std::string port = std::to_string(mChecked);

  EXPECT_EQ("{\"result\":\"reachable\",\"reason\":\"token\",\"protocol\":"
            "\"tcp\",\"port\":" +
                port + "}",
            Ask("127.0.0.2", "127.0.0.1", mPort,
                "check tcp " + port + " localhost\n"));
  EXPECT_EQ("{\"result\":\"reachable\",\"reason\":\"token\",\"protocol\":"
            "\"udp\",\"port\":" +
                port + "}",
            Ask("127.0.0.2", "127.0.0.1", mPort,
                "check udp " + port + " localhost\n"));
  EXPECT_EQ(1, ownTcp.Seen());
  EXPECT_GE(ownUdp.Seen(), 1);
  EXPECT_EQ(0, decoys.Seen());
}

TEST_F(SecurityProbeTarget, UdpChecksGoToTheRequesterOnly) {
  Decoys decoys = MakeDecoys({"127.0.0.1", "127.0.0.3", "::1"});
  CountingListener own(BoundSocket(SOCK_DGRAM, "127.0.0.2", mChecked),
                       "own-token", &AnswerProbeDatagram);
  ASSERT_TRUE(own.Ok());
  const std::string port = std::to_string(mChecked);

  // With the decoys' token: only the requester's listener is asked, and
  // its answer is not the token asked for.
  EXPECT_NE(std::string::npos, Ask("127.0.0.2", "127.0.0.1", mPort,
                                   "check udp " + port + " decoy\n")
                                   .find("\"result\":\"unreachable\""));
  EXPECT_EQ("{\"result\":\"reachable\",\"reason\":\"token\",\"protocol\":"
            "\"udp\",\"port\":" +
                port + "}",
            Ask("127.0.0.2", "127.0.0.1", mPort,
                "check udp " + port + " own-token\n"));
  EXPECT_GE(own.Seen(), 2);
  EXPECT_EQ(0, decoys.Seen());
}

TEST_F(SecurityProbeTarget, Ipv6RequesterIsCheckedAtItsOwnAddress) {
  Decoys decoys = MakeDecoys({"127.0.0.1", "127.0.0.2"});
  CountingListener ownTcp(BoundSocket(SOCK_STREAM, "::1", mChecked), "six");
  CountingListener ownUdp(BoundSocket(SOCK_DGRAM, "::1", mChecked), "six",
                          &AnswerProbeDatagram);
  ASSERT_TRUE(ownTcp.Ok() && ownUdp.Ok());
  const std::string port = std::to_string(mChecked);

  EXPECT_EQ("{\"result\":\"address\",\"address\":\"::1\"}",
            Ask("::1", "::1", mPort, "address\n"));
  EXPECT_NE(std::string::npos,
            Ask("::1", "::1", mPort, "check tcp " + port + " six\n")
                .find("\"result\":\"reachable\""));
  EXPECT_NE(std::string::npos,
            Ask("::1", "::1", mPort, "check udp " + port + " six\n")
                .find("\"result\":\"reachable\""));
  // Naming an IPv4 address from IPv6 is refused like any other name.
  EXPECT_NE(std::string::npos,
            Ask("::1", "::1", mPort, "check tcp " + port + " 127.0.0.2\n")
                .find("\"result\":\"error\""));
  EXPECT_EQ(1, ownTcp.Seen());
  EXPECT_GE(ownUdp.Seen(), 1);
  EXPECT_EQ(0, decoys.Seen());
}

// An IPv6 socket that speaks to the IPv4 listener through IPv4-mapped
// addresses (::ffff:127.0.0.2 -> ::ffff:127.0.0.1) is an IPv4 requester:
// it is checked at 127.0.0.2, not at the IPv6 loopback or elsewhere.
TEST_F(SecurityProbeTarget, Ipv4MappedRequesterIsCheckedAtItsIpv4Address) {
  Decoys decoys = MakeDecoys({"127.0.0.1", "::1", "127.0.0.3"});
  CountingListener own(BoundSocket(SOCK_STREAM, "127.0.0.2", mChecked),
                       "mapped");
  ASSERT_TRUE(own.Ok());
  const std::string port = std::to_string(mChecked);

  EXPECT_EQ("{\"result\":\"address\",\"address\":\"127.0.0.2\"}",
            Ask("::ffff:127.0.0.2", "::ffff:127.0.0.1", mPort, "address\n"));
  EXPECT_NE(std::string::npos, Ask("::ffff:127.0.0.2", "::ffff:127.0.0.1",
                                   mPort, "check tcp " + port + " mapped\n")
                                   .find("\"result\":\"reachable\""));
  EXPECT_EQ(1, own.Seen());
  EXPECT_EQ(0, decoys.Seen());
}

} // namespace
} // namespace zark::security
