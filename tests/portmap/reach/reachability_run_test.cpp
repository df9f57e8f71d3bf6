// The reachability test of rules through KLibTestRulesInit / KLibTestRules,
// with the probe service running in this process on 127.0.0.1. On loopback
// there is no router: the probe connects back to 127.0.0.1 on the rule's
// router port, so a rule whose router port equals its local port is
// "forwarded" and one whose router port has nothing behind it is not.
// HERMETIC: /tmp/pfStatusRule and /etc/portforward/portmap.conf.
#include "reach/reachability_test.h"

#include "base/library_config.h"
#include "hermetic.h"
#include "porttest_support.h"
#include "syslog_capture.h"

#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <mutex>
#include <thread>

namespace zark::portmap {
namespace {

using porttest::FreePort;
using porttest::LoopbackProbe;
using porttest::Rule;
using porttest::SetLibraryConfig;

const std::string kProbeKey(config_key::kProbeServiceAddress);

std::string Status() {
  return test::ReadFile(ZARK_PORTMAP_TEST_STATUS);
}

// A service of the server on a port: TCP accepts and says nothing; UDP
// answers every datagram, or none.
class Service {
public:
  Service(bool tcp, uint16_t port, bool answers = true)
      : mTcp(tcp), mAnswers(answers) {
    mFd = ::socket(AF_INET, (tcp ? SOCK_STREAM : SOCK_DGRAM) | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(port);
    if (::bind(mFd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) !=
            0 ||
        (tcp && ::listen(mFd, 8) != 0)) {
      ADD_FAILURE() << "cannot listen on " << port;
      return;
    }
    if (!tcp && answers) {
      mThread = std::thread([this] { Serve(); });
    }
  }
  ~Service() {
    mStop = true;
    ::shutdown(mFd, SHUT_RDWR);
    if (mThread.joinable()) {
      mThread.join();
    }
    ::close(mFd);
  }

private:
  void Serve() {
    while (!mStop) {
      char buffer[256];
      sockaddr_in from{};
      socklen_t length = sizeof(from);
      ssize_t n = ::recvfrom(mFd, buffer, sizeof(buffer), 0,
                             reinterpret_cast<sockaddr *>(&from), &length);
      if (n <= 0) {
        return;
      }
      ::sendto(mFd, "pong\n", 5, 0, reinterpret_cast<sockaddr *>(&from),
               length);
    }
  }
  bool mTcp;
  bool mAnswers;
  int mFd = -1;
  std::atomic<bool> mStop{false};
  std::thread mThread;
};

class PortTestRules : public testing::Test {
protected:
  void SetUp() override {
    test::ResetFixedPaths();
    test::ClearLogs();
  }

  int Test(std::vector<ZARK_ROUTER_RULE> rules,
           ZARK_LIBZARKPORTMAP_ERR *err = nullptr) {
    EXPECT_EQ(0, KLibTestRulesInit());
    return KLibTestRules(static_cast<int>(rules.size()), rules.data(), err,
                         false);
  }
};

TEST_F(PortTestRules, InitStartsAnEmptyStatusFile) {
  test::WriteFile(ZARK_PORTMAP_TEST_STATUS, "old=reachable\n");
  ASSERT_EQ(0, KLibTestRulesInit());
  EXPECT_EQ("", Status());
}

TEST_F(PortTestRules, WithoutAProbeServiceTheTestFailsAndSaysWhy) {
  ZARK_LIBZARKPORTMAP_ERR err{0};
  EXPECT_EQ(-1, Test({Rule("web", "tcp", "8080", "80"),
                      Rule("off", "tcp", "81", "81", false),
                      Rule("dns", "udp", "5353", "53")},
                     &err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_PROBE_SERVICE, err.err);
  EXPECT_EQ("web=no probe service configured\n"
            "dns=no probe service configured\n",
            Status());
  EXPECT_TRUE(test::HasLogContaining("no probe service configured"));
}

TEST_F(PortTestRules, ForwardedPortsAreReachableOthersNot) {
  LoopbackProbe probe;
  ASSERT_TRUE(probe.Running());
  SetLibraryConfig(kProbeKey, probe.Address());
  const uint16_t tcp = FreePort();
  const uint16_t udp = FreePort();
  const uint16_t local = FreePort();
  const uint16_t nowhere = FreePort();
  ZARK_LIBZARKPORTMAP_ERR err{-1};
  ASSERT_EQ(
      0,
      Test({Rule("tcp-open", "tcp", std::to_string(tcp), std::to_string(tcp)),
            Rule("udp-open", "udp", std::to_string(udp), std::to_string(udp)),
            Rule("tcp-closed", "tcp", std::to_string(nowhere),
                 std::to_string(local)),
            Rule("udp-closed", "udp", std::to_string(nowhere),
                 std::to_string(local))},
           &err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_NONE, err.err);
  EXPECT_EQ("tcp-open=reachable\n"
            "udp-open=reachable\n"
            "tcp-closed=unreachable\n"
            "udp-closed=unreachable\n",
            Status());
  EXPECT_EQ(4, probe.Counters().checks);
  // The temporary listeners are gone: the ports can be taken again.
  Service again(true, tcp);
  Service againUdp(false, udp, false);
}

// A rule whose local port a service of the server holds: no token then;
// a TCP connection counts, a UDP reply counts, UDP silence cannot tell.
TEST_F(PortTestRules, PortsAServiceHoldsAreCheckedWithoutToken) {
  LoopbackProbe probe;
  SetLibraryConfig(kProbeKey, probe.Address());
  const uint16_t tcp = FreePort();
  const uint16_t udp = FreePort();
  const uint16_t silent = FreePort();
  Service tcpService(true, tcp);
  Service udpService(false, udp, true);
  Service silentService(false, silent, false);
  ASSERT_EQ(0,
            Test({Rule("web", "tcp", std::to_string(tcp), std::to_string(tcp)),
                  Rule("echo", "udp", std::to_string(udp), std::to_string(udp)),
                  Rule("quiet", "udp", std::to_string(silent),
                       std::to_string(silent))}));
  EXPECT_EQ("web=reachable\necho=reachable\nquiet=unknown: a service "
            "listens on udp port " +
                std::to_string(silent) + " and does not answer the probe\n",
            Status());
}

TEST_F(PortTestRules, RangesAndBothProtocols) {
  LoopbackProbe probe;
  SetLibraryConfig(kProbeKey, probe.Address());
  const uint16_t base = porttest::FreePortRun(3);
  const uint16_t other = FreePort();
  const std::string range =
      std::to_string(base) + "-" + std::to_string(base + 2);
  // Router ports base and `other`; `other` forwards to base+1, where the
  // listener is, but on loopback nobody answers at `other` itself.
  ASSERT_EQ(
      0, Test({Rule("range", "tcp", range, range),
               Rule("both", "both", std::to_string(base + 1), ""),
               Rule("half", "tcp",
                    std::to_string(base) + "," + std::to_string(other),
                    std::to_string(base) + "," + std::to_string(base + 1))}));
  EXPECT_EQ("range=reachable\nboth=reachable\nhalf=partly reachable (1 of 2 "
            "ports)\n",
            Status());
  EXPECT_EQ(7, probe.Counters().checks);
}

TEST_F(PortTestRules, DisabledRulesAreLeftOutBadOnesSaySo) {
  LoopbackProbe probe;
  SetLibraryConfig(kProbeKey, probe.Address());
  const uint16_t port = FreePort();
  ASSERT_EQ(
      0, Test({Rule("off", "tcp", "80", "80", false),
               Rule("bad", "tcp", "80x", "80"),
               Rule("ok", "tcp", std::to_string(port), std::to_string(port))}));
  EXPECT_EQ("bad=bad rule: port text \"80x\"\nok=reachable\n", Status());
}

TEST_F(PortTestRules, NoRulesNoLines) {
  ASSERT_EQ(0, Test({}));
  EXPECT_EQ("", Status());
  ASSERT_EQ(0, Test({Rule("off", "tcp", "80", "80", false)}));
  EXPECT_EQ("", Status());
}

TEST_F(PortTestRules, ProbeServiceDown) {
  // Configured, but nothing listens there.
  SetLibraryConfig(kProbeKey, "127.0.0.1:" + std::to_string(FreePort()));
  ZARK_LIBZARKPORTMAP_ERR err{0};
  EXPECT_EQ(-1, Test({Rule("web", "tcp", "8080", "80")}, &err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_PROBE_SERVICE, err.err);
  EXPECT_EQ("web=probe service not reachable\n", Status());
}

TEST_F(PortTestRules, ProbeServiceAddressThatIsNotOne) {
  SetLibraryConfig(kProbeKey, "probe-without-port");
  EXPECT_EQ(-1, Test({Rule("web", "tcp", "8080", "80")}));
  EXPECT_EQ("web=probe service address \"probe-without-port\" is not "
            "host:port\n",
            Status());
}

TEST_F(PortTestRules, BadArguments) {
  ZARK_LIBZARKPORTMAP_ERR err{0};
  EXPECT_EQ(-1, KLibTestRules(-1, nullptr, &err, false));
  EXPECT_EQ(ZARK_PORTMAP_ERR_BAD_PARAMETER, err.err);
  EXPECT_EQ(-1, KLibTestRules(2, nullptr, nullptr, false));
}

// A fake probe that reads the status file at every check, as the module's
// status method would meanwhile.
class ReadingProbe final : public OutsideProbe {
public:
  ProbeAnswer Check(IpProtocol, uint16_t port, std::string_view) override {
    {
      std::lock_guard<std::mutex> lock(mMutex);
      mSeen.push_back(test::ReadFile(ZARK_PORTMAP_TEST_STATUS));
    }
    ProbeAnswer answer;
    answer.status =
        port % 2 == 0 ? ProbeStatus::kReachable : ProbeStatus::kUnreachable;
    return answer;
  }
  std::vector<std::string> Seen() {
    std::lock_guard<std::mutex> lock(mMutex);
    return mSeen;
  }

private:
  std::mutex mMutex;
  std::vector<std::string> mSeen;
};

TEST_F(PortTestRules, ReadersSeeWholeLinesRulesBeingTestedShowEmpty) {
  auto probe = std::make_shared<ReadingProbe>();
  PortTestEnvironment environment;
  environment.workers = 1; // one check at a time: the file is predictable
  environment.makeProbe = [probe](std::string &) {
    struct Forward final : OutsideProbe {
      std::shared_ptr<ReadingProbe> to;
      ProbeAnswer Check(IpProtocol protocol, uint16_t port,
                        std::string_view token) override {
        return to->Check(protocol, port, token);
      }
    };
    auto forward = std::make_unique<Forward>();
    forward->to = probe;
    return std::unique_ptr<OutsideProbe>(std::move(forward));
  };
  std::vector<ZARK_ROUTER_RULE> rules = {Rule("a", "tcp", "40000", "40000"),
                                         Rule("b", "tcp", "40001", "40001"),
                                         Rule("c", "tcp", "40002", "40002")};
  PortTestSummary summary;
  ASSERT_EQ(0, RunPortTest(rules, environment, &summary));
  EXPECT_EQ((std::vector<std::string>{"a=\nb=\nc=\n", "a=reachable\nb=\nc=\n",
                                      "a=reachable\nb=unreachable\nc=\n"}),
            probe->Seen());
  EXPECT_EQ("a=reachable\nb=unreachable\nc=reachable\n", Status());
  EXPECT_EQ(3, summary.checks);
  EXPECT_EQ(2, summary.reachable);
  EXPECT_EQ(1, summary.unreachable);
}

TEST_F(PortTestRules, RateLimitedByTheProbeService) {
  probe::ServerOptions options = LoopbackProbe::DefaultOptions();
  options.ratePerSecond = 0.001; // no refill within the test
  options.burst = 1;
  LoopbackProbe probe(nullptr, options);
  PortTestEnvironment environment;
  environment.workers = 1;
  environment.makeProbe = [&](std::string &) {
    ProbeClientOptions client;
    client.rateLimitRetries = 0;
    return std::unique_ptr<OutsideProbe>(std::make_unique<ProbeClient>(
        ProbeEndpoint{"127.0.0.1", probe.Port()}, client));
  };
  // Checked in port order, one at a time: the lower port goes first.
  const uint16_t one = FreePort();
  const uint16_t two = FreePort();
  const uint16_t first = std::min(one, two);
  const uint16_t second = std::max(one, two);
  ASSERT_EQ(
      0,
      RunPortTest(
          std::vector<ZARK_ROUTER_RULE>{
              Rule("a", "tcp", std::to_string(first), std::to_string(first)),
              Rule("b", "tcp", std::to_string(second), std::to_string(second))},
          environment));
  EXPECT_EQ("a=reachable\nb=the probe service refused: too many requests\n",
            Status());
}

TEST_F(PortTestRules, PastTheDeadlineNothingMoreIsChecked) {
  LoopbackProbe probe;
  PortTestEnvironment environment;
  environment.deadline = std::chrono::seconds(0);
  environment.makeProbe = [&](std::string &) {
    return std::unique_ptr<OutsideProbe>(std::make_unique<ProbeClient>(
        ProbeEndpoint{"127.0.0.1", probe.Port()}));
  };
  PortTestSummary summary;
  EXPECT_EQ(-1, RunPortTest(std::vector<ZARK_ROUTER_RULE>{Rule(
                                "a", "tcp", "40000", "40000")},
                            environment, &summary));
  EXPECT_EQ("a=not tested: time limit reached\n", Status());
  EXPECT_EQ(0, probe.Counters().checks);
  EXPECT_EQ(ZARK_PORTMAP_ERR_PROBE_SERVICE, summary.error);
}

TEST_F(PortTestRules, TwentyRulesInParallel) {
  LoopbackProbe probe;
  SetLibraryConfig(kProbeKey, probe.Address());
  std::vector<ZARK_ROUTER_RULE> rules;
  std::string expected;
  for (int i = 0; i < 20; ++i) {
    const std::string port = std::to_string(FreePort());
    const std::string id = "rule" + std::to_string(i);
    rules.push_back(Rule(id, i % 2 == 0 ? "tcp" : "udp", port, port));
    expected += id + "=reachable\n";
  }
  ASSERT_EQ(0, Test(rules));
  EXPECT_EQ(expected, Status());
  EXPECT_EQ(20, probe.Counters().checks);
}

} // namespace
} // namespace zark::portmap
