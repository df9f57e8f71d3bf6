// The pure parts of the reachability test: the probe service address and
// answers, how rules become port checks and their results a line of the
// status file, the UDP listener's answer.
#include "reach/probe_client.h"
#include "reach/reachability_test.h"
#include "reach/token_listener.h"

#include "porttest_support.h"

#include <gtest/gtest.h>

#include <cstring>

namespace zark::portmap {
namespace {

using porttest::Rule;

TEST(PortTestProbeAddress, HostAndPort) {
  EXPECT_EQ((ProbeEndpoint{"probe.example.org", 7777}),
            ParseProbeServiceAddress("probe.example.org:7777"));
  EXPECT_EQ((ProbeEndpoint{"1.2.3.2", 1}),
            ParseProbeServiceAddress("1.2.3.2:1"));
  EXPECT_EQ((ProbeEndpoint{"2001:db8::1", 65535}),
            ParseProbeServiceAddress("[2001:db8::1]:65535"));
  for (const char *bad :
       {"", "probe.example.org", "probe.example.org:", ":7777", "1.2.3.2:0",
        "1.2.3.2:65536", "1.2.3.2:77x", "2001:db8::1:7777", "[2001:db8::1]7777",
        "[not-v6]:7777", " 1.2.3.2:7777", "1.2.3.2:7777 ", "1.2.3.2:+7"}) {
    EXPECT_FALSE(ParseProbeServiceAddress(bad).has_value()) << bad;
  }
}

TEST(PortTestProbeAnswer, EveryKindOfAnswer) {
  std::optional<ProbeAnswer> answer = ParseProbeAnswer(
      R"({"result":"reachable","reason":"token","protocol":"tcp","port":8080})");
  ASSERT_TRUE(answer);
  EXPECT_EQ(ProbeStatus::kReachable, answer->status);
  EXPECT_EQ("token", answer->reason);

  answer = ParseProbeAnswer(
      R"({"result":"unreachable","reason":"refused","protocol":"udp","port":1})");
  ASSERT_TRUE(answer);
  EXPECT_EQ(ProbeStatus::kUnreachable, answer->status);

  answer = ParseProbeAnswer(R"({"result":"unknown","reason":"no-answer"})");
  ASSERT_TRUE(answer);
  EXPECT_EQ(ProbeStatus::kUnknown, answer->status);

  answer = ParseProbeAnswer(R"({"result":"address","address":"203.0.113.5"})");
  ASSERT_TRUE(answer);
  EXPECT_EQ(ProbeStatus::kAddress, answer->status);
  EXPECT_EQ("203.0.113.5", answer->address);

  answer = ParseProbeAnswer(
      R"({"result":"error","reason":"rate-limited","retry_after_ms":250})");
  ASSERT_TRUE(answer);
  EXPECT_EQ(ProbeStatus::kRateLimited, answer->status);
  EXPECT_EQ(250, answer->retryAfterMs);

  answer = ParseProbeAnswer(
      R"({"result":"error","reason":"bad-request","detail":"bad-port"})");
  ASSERT_TRUE(answer);
  EXPECT_EQ(ProbeStatus::kRefused, answer->status);
  EXPECT_EQ("bad-request: bad-port", answer->reason);
}

TEST(PortTestProbeAnswer, WhatIsNotAnAnswer) {
  for (const char *bad : {
           "",
           "reachable",
           "{}",
           "[]",
           R"({"result":"open"})",
           R"({"result":1})",
           R"({"result":"address"})",
           R"({"result":"address","address":5})",
           R"({"result":"error"})",
           R"({"result":"error","reason":"rate-limited","retry_after_ms":-1})",
           R"({"result":"error","reason":"rate-limited","retry_after_ms":"1"})",
           R"({"result":"reachable","reason":7})",
           R"({"result":"reachable"} trailing)",
           R"({"result":"reachable","result":"unreachable"})",
           R"({"result":"reachable",})",
           R"({"a":{"b":{"c":{"d":{"e":1}}}},"result":"reachable"})",
       }) {
    EXPECT_FALSE(ParseProbeAnswer(bad).has_value()) << bad;
  }
  EXPECT_FALSE(ParseProbeAnswer(std::string(600, ' ')).has_value());
}

TEST(PortTestProbeAnswer, RequestLines) {
  EXPECT_EQ("check tcp 8080 abc\n",
            ProbeCheckRequest(IpProtocol::kTcp, 8080, "abc"));
  EXPECT_EQ("check udp 53\n", ProbeCheckRequest(IpProtocol::kUdp, 53, ""));
}

TEST(PortTestPlan, PairsPortsAsSavingDoes) {
  RuleChecks planned = PlanRuleChecks(Rule("web", "tcp", "8080", "80"));
  EXPECT_EQ("web", planned.ruleId);
  EXPECT_EQ("", planned.refusal);
  EXPECT_EQ((std::vector<PortCheck>{{IpProtocol::kTcp, 8080, 80}}),
            planned.checks);

  planned = PlanRuleChecks(Rule("r", "udp", "9000-9002", "7000-7002"));
  EXPECT_EQ((std::vector<PortCheck>{{IpProtocol::kUdp, 9000, 7000},
                                    {IpProtocol::kUdp, 9001, 7001},
                                    {IpProtocol::kUdp, 9002, 7002}}),
            planned.checks);

  // An empty router port text means the local ports, and both protocols.
  planned = PlanRuleChecks(Rule("b", "both", "", "53"));
  EXPECT_EQ((std::vector<PortCheck>{{IpProtocol::kTcp, 53, 53},
                                    {IpProtocol::kUdp, 53, 53}}),
            planned.checks);

  planned = PlanRuleChecks(Rule("c", "tcp", "81,81", "80,80"));
  EXPECT_EQ((std::vector<PortCheck>{{IpProtocol::kTcp, 81, 80}}),
            planned.checks);
}

TEST(PortTestPlan, RulesSavingWouldRefuse) {
  EXPECT_EQ("bad rule: unknown protocol \"sctp\"",
            PlanRuleChecks(Rule("x", "sctp", "80", "80")).refusal);
  EXPECT_EQ("bad rule: port text \"80x\"",
            PlanRuleChecks(Rule("x", "tcp", "80x", "80")).refusal);
  EXPECT_EQ("bad rule: router and local ports do not pair up",
            PlanRuleChecks(Rule("x", "tcp", "80-81", "80")).refusal);
  EXPECT_EQ("bad rule: a port above 65535 in \"70000\"",
            PlanRuleChecks(Rule("x", "tcp", "70000", "80")).refusal);
  EXPECT_EQ("bad rule: a range longer than 100 ports",
            PlanRuleChecks(Rule("x", "tcp", "1000-1200", "1000-1200")).refusal);
  EXPECT_EQ("bad rule: no port",
            PlanRuleChecks(Rule("x", "tcp", "", " ")).refusal);
}

TEST(PortTestResult, WhatARuleSays) {
  auto text = [](std::vector<CheckResult> results) {
    return RuleResultText(results);
  };
  const CheckResult yes{CheckOutcome::kReachable, ""};
  const CheckResult no{CheckOutcome::kUnreachable, ""};
  const CheckResult unknown{CheckOutcome::kUnknown, "unknown: silent"};
  const CheckResult error{CheckOutcome::kError, "probe service not reachable"};
  EXPECT_EQ("reachable", text({yes, yes}));
  EXPECT_EQ("unreachable", text({no, no}));
  EXPECT_EQ("partly reachable (1 of 3 ports)", text({yes, no, unknown}));
  EXPECT_EQ("unknown: silent", text({unknown}));
  EXPECT_EQ("unreachable", text({unknown, no}));
  EXPECT_EQ("probe service not reachable", text({yes, error}));
  EXPECT_EQ("not tested: no port", text({}));
}

TEST(PortTestResult, ProbeAnswersBecomeCheckResults) {
  const PortCheck udp{IpProtocol::kUdp, 5353, 53};
  ProbeAnswer answer;
  answer.status = ProbeStatus::kUnknown;
  answer.reason = "no-answer";
  EXPECT_EQ("unknown: a service listens on udp port 53 and does not answer "
            "the probe",
            CheckResultOf(udp, answer, false).text);
  answer.status = ProbeStatus::kServiceUnavailable;
  EXPECT_EQ(CheckOutcome::kError, CheckResultOf(udp, answer, true).outcome);
  EXPECT_EQ("probe service not reachable",
            CheckResultOf(udp, answer, true).text);
  answer.status = ProbeStatus::kRateLimited;
  EXPECT_EQ("the probe service refused: too many requests",
            CheckResultOf(udp, answer, true).text);
  answer.status = ProbeStatus::kReachable;
  EXPECT_EQ(CheckOutcome::kReachable, CheckResultOf(udp, answer, true).outcome);
}

TEST(PortTestResult, StatusLinesAreOneLineEach) {
  EXPECT_EQ("web=reachable\n", StatusLine("web", "reachable"));
  EXPECT_EQ("web=\n", StatusLine("web", ""));
  EXPECT_EQ("a b=c d\n", StatusLine("a\nb", "c\rd"));
}

TEST(PortTestListener, UdpAnswersOnlyProbes) {
  EXPECT_EQ("tok 0123abcd\n",
            UdpListenerAnswer("tok", "zark-probe 0123abcd\n"));
  EXPECT_EQ("", UdpListenerAnswer("tok", "zark-probe 0123abcd"));
  EXPECT_EQ("", UdpListenerAnswer("tok", "zark-probe \n"));
  EXPECT_EQ("", UdpListenerAnswer("tok", "zark-probe a.b\n"));
  EXPECT_EQ("", UdpListenerAnswer("tok", "hello\n"));
  EXPECT_EQ("", UdpListenerAnswer("tok", ""));
  EXPECT_EQ("", UdpListenerAnswer("tok",
                                  "zark-probe " + std::string(65, 'a') + "\n"));
}

TEST(PortTestListener, TokensAreFreshHex) {
  const std::string first = NewProbeToken();
  const std::string second = NewProbeToken();
  EXPECT_EQ(32u, first.size());
  EXPECT_EQ(std::string::npos, first.find_first_not_of("0123456789abcdef"));
  EXPECT_NE(first, second);
}

} // namespace
} // namespace zark::portmap
