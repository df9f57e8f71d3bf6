// Checking rule sets and expanding them into single-port mappings: every
// refusal type with its limit or offending text. Pure.
#include "rules/rule_validation.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

namespace zark::portmap {
namespace {

ZARK_ROUTER_RULE Rule(const std::string &id, const std::string &protocol,
                      const std::string &routerPort, const std::string &dsPort,
                      bool enable = true) {
  ZARK_ROUTER_RULE rule{};
  std::strncpy(rule.rule_id, id.c_str(), sizeof(rule.rule_id) - 1);
  rule.enable = enable ? 1 : 0;
  std::strncpy(rule.router_protocol, protocol.c_str(),
               sizeof(rule.router_protocol) - 1);
  std::strncpy(rule.router_port, routerPort.c_str(),
               sizeof(rule.router_port) - 1);
  std::strncpy(rule.ds_port, dsPort.c_str(), sizeof(rule.ds_port) - 1);
  return rule;
}

RuleRefusal Plan(const std::vector<ZARK_ROUTER_RULE> &rules,
                 std::vector<WantedMapping> &wanted, int max = 256) {
  return PlanWantedMappings(rules, max, wanted);
}

TEST(PortMapRouterRuleValidation, ExpandsPortTexts) {
  std::vector<uint16_t> ports;
  EXPECT_EQ(PortTextError::kNone, ExpandPortText("80", ports));
  EXPECT_EQ((std::vector<uint16_t>{80}), ports);
  EXPECT_EQ(PortTextError::kNone,
            ExpandPortText("8000-8002, 9000 ,22-", ports));
  EXPECT_EQ((std::vector<uint16_t>{8000, 8001, 8002, 9000, 22}), ports);
  EXPECT_EQ(PortTextError::kNone, ExpandPortText("65535", ports));
  EXPECT_EQ(PortTextError::kBadText, ExpandPortText("", ports));
  EXPECT_EQ(PortTextError::kBadText, ExpandPortText("80,", ports));
  EXPECT_EQ(PortTextError::kBadText, ExpandPortText("http", ports));
  EXPECT_EQ(PortTextError::kBadText, ExpandPortText("0", ports));
  EXPECT_EQ(PortTextError::kBadText, ExpandPortText("90-80", ports));
  EXPECT_EQ(PortTextError::kBadText, ExpandPortText("-80", ports));
  EXPECT_EQ(PortTextError::kTooHigh, ExpandPortText("65536", ports));
  EXPECT_EQ(PortTextError::kTooHigh, ExpandPortText("99999999999", ports));
  EXPECT_EQ(PortTextError::kTooHigh, ExpandPortText("65000-70000", ports));
  EXPECT_EQ(PortTextError::kNone, ExpandPortText("1000-1099", ports));
  EXPECT_EQ(100u, ports.size());
  EXPECT_EQ(PortTextError::kRangeTooLong, ExpandPortText("1000-1100", ports));
}

TEST(PortMapRouterRuleValidation, ProtocolTexts) {
  using P = std::vector<IpProtocol>;
  EXPECT_EQ((P{IpProtocol::kTcp}), RuleProtocols("tcp"));
  EXPECT_EQ((P{IpProtocol::kTcp}), RuleProtocols(" TCP "));
  EXPECT_EQ((P{IpProtocol::kUdp}), RuleProtocols("udp"));
  for (const char *both : {"both", "all", "tcp,udp", "udp,tcp", "TCP/UDP"}) {
    EXPECT_EQ((P{IpProtocol::kTcp, IpProtocol::kUdp}), RuleProtocols(both))
        << both;
  }
  EXPECT_FALSE(RuleProtocols(""));
  EXPECT_FALSE(RuleProtocols("tpc"));
  EXPECT_FALSE(RuleProtocols("icmp"));
}

TEST(PortMapRouterRuleValidation, ExpandsRangesPairwiseAndBothProtocols) {
  std::vector<WantedMapping> wanted;
  RuleRefusal refusal = Plan(
      {Rule("1", "tcp", "8000-8002", "80-82"), Rule("2", "both", "5000", ""),
       Rule("3", "udp", "", "53"), Rule("4", "tcp", "9999", "9999", false)},
      wanted);
  ASSERT_EQ(ZARK_SAVE_ERR_NONE, refusal.errType) << refusal.reason;
  EXPECT_EQ((std::vector<WantedMapping>{
                {IpProtocol::kTcp, 8000, 80, "1"},
                {IpProtocol::kTcp, 8001, 81, "1"},
                {IpProtocol::kTcp, 8002, 82, "1"},
                {IpProtocol::kTcp, 5000, 5000, "2"},
                {IpProtocol::kUdp, 5000, 5000, "2"},
                {IpProtocol::kUdp, 53, 53, "3"},
            }),
            wanted);
}

TEST(PortMapRouterRuleValidation, DisabledRulesAreNotChecked) {
  std::vector<WantedMapping> wanted;
  RuleRefusal refusal = Plan({Rule("1", "gopher", "x", "y", false)}, wanted);
  EXPECT_EQ(ZARK_SAVE_ERR_NONE, refusal.errType);
  EXPECT_TRUE(wanted.empty());
}

TEST(PortMapRouterRuleValidation, UnknownProtocolIsType9WithTheText) {
  std::vector<WantedMapping> wanted;
  RuleRefusal refusal = Plan(
      {Rule("1", "tcp", "80", "80"), Rule("2", "sctp", "81", "81")}, wanted);
  EXPECT_EQ(static_cast<uint32_t>(ZARK_SAVE_ERR_BAD_PROTOCOL), refusal.errType);
  EXPECT_EQ("sctp", refusal.text);
}

TEST(PortMapRouterRuleValidation, BadPortTextIsType8WithTheText) {
  std::vector<WantedMapping> wanted;
  RuleRefusal refusal = Plan({Rule("1", "tcp", "80", "8o")}, wanted);
  EXPECT_EQ(static_cast<uint32_t>(ZARK_SAVE_ERR_BAD_PORT_TEXT),
            refusal.errType);
  EXPECT_EQ("8o", refusal.text);

  refusal = Plan({Rule("1", "tcp", "", "")}, wanted);
  EXPECT_EQ(static_cast<uint32_t>(ZARK_SAVE_ERR_BAD_PORT_TEXT),
            refusal.errType);
  EXPECT_EQ("", refusal.text);
}

TEST(PortMapRouterRuleValidation, ListsOfDifferentLengthsAreType8) {
  std::vector<WantedMapping> wanted;
  RuleRefusal refusal = Plan({Rule("1", "tcp", "8000-8002", "80")}, wanted);
  EXPECT_EQ(static_cast<uint32_t>(ZARK_SAVE_ERR_BAD_PORT_TEXT),
            refusal.errType);
  EXPECT_EQ("80", refusal.text);
}

TEST(PortMapRouterRuleValidation, OneRouterPortToTwoLocalPortsIsType8) {
  std::vector<WantedMapping> wanted;
  RuleRefusal refusal =
      Plan({Rule("1", "tcp", "8080", "80"), Rule("2", "both", "8080", "81")},
           wanted);
  EXPECT_EQ(static_cast<uint32_t>(ZARK_SAVE_ERR_BAD_PORT_TEXT),
            refusal.errType);
  EXPECT_EQ("8080", refusal.text);
  EXPECT_NE(std::string::npos, refusal.reason.find("rules \"1\" and \"2\""));
}

TEST(PortMapRouterRuleValidation, TheSameMappingTwiceIsMerged) {
  std::vector<WantedMapping> wanted;
  RuleRefusal refusal = Plan(
      {Rule("1", "tcp", "8080", "80"), Rule("2", "tcp", "8080", "80")}, wanted);
  EXPECT_EQ(ZARK_SAVE_ERR_NONE, refusal.errType);
  EXPECT_EQ(1u, wanted.size());
}

TEST(PortMapRouterRuleValidation, PortAboveTheHighestIsType10WithTheLimit) {
  std::vector<WantedMapping> wanted;
  RuleRefusal refusal = Plan({Rule("1", "tcp", "70000", "80")}, wanted);
  EXPECT_EQ(static_cast<uint32_t>(ZARK_SAVE_ERR_PORT_TOO_HIGH),
            refusal.errType);
  EXPECT_EQ(65535, refusal.maxPort);
}

TEST(PortMapRouterRuleValidation, LongRangeIsType12WithBothLimits) {
  std::vector<WantedMapping> wanted;
  RuleRefusal refusal = Plan({Rule("1", "udp", "2000-2100", "")}, wanted);
  EXPECT_EQ(static_cast<uint32_t>(ZARK_SAVE_ERR_RANGE_TOO_LONG),
            refusal.errType);
  EXPECT_EQ(65535, refusal.maxPort);
  EXPECT_EQ(100, refusal.maxRange);
}

TEST(PortMapRouterRuleValidation, TooManyPortsInOneRuleIsType11) {
  std::vector<WantedMapping> wanted;
  RuleRefusal refusal =
      Plan({Rule("1", "tcp", "1000-1060,2000-2060", "")}, wanted);
  EXPECT_EQ(static_cast<uint32_t>(ZARK_SAVE_ERR_TOO_MANY_PORTS),
            refusal.errType);
  EXPECT_EQ(100, refusal.maxPort);
}

TEST(PortMapRouterRuleValidation, MoreRouterEntriesThanTheRouterTakesIsType7) {
  std::vector<WantedMapping> wanted;
  RuleRefusal refusal =
      Plan({Rule("1", "both", "1000-1002", "")}, wanted, /*max=*/5);
  EXPECT_EQ(static_cast<uint32_t>(ZARK_SAVE_ERR_TOO_MANY_RULES),
            refusal.errType);
  EXPECT_EQ(5, refusal.maxPort);
  refusal = Plan({Rule("1", "both", "1000-1002", "")}, wanted, /*max=*/6);
  EXPECT_EQ(ZARK_SAVE_ERR_NONE, refusal.errType);
}

TEST(PortMapRouterRuleValidation, RouterLimitFromTheConfiguration) {
  EXPECT_EQ(32, MaxRouterEntries("32"));
  EXPECT_EQ(kDefaultMaxRouterEntries, MaxRouterEntries(""));
  EXPECT_EQ(kDefaultMaxRouterEntries, MaxRouterEntries("0"));
  EXPECT_EQ(kDefaultMaxRouterEntries, MaxRouterEntries("lots"));
  EXPECT_EQ(kDefaultMaxRouterEntries, MaxRouterEntries("-4"));
}

TEST(PortMapRouterRuleValidation, FieldWithoutNulIsReadToItsEnd) {
  ZARK_ROUTER_RULE rule = Rule("1", "tcp", "80", "80");
  std::memset(rule.router_protocol, 'x', sizeof(rule.router_protocol));
  std::vector<WantedMapping> wanted;
  RuleRefusal refusal = Plan({rule}, wanted);
  EXPECT_EQ(static_cast<uint32_t>(ZARK_SAVE_ERR_BAD_PROTOCOL), refusal.errType);
  EXPECT_EQ(std::string(1024, 'x'), refusal.text);
}

} // namespace
} // namespace zark::portmap
