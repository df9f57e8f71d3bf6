// Writing rules for services: the saved rules give way to the ports of the
// services being added or removed, and each added service's sections get
// rules of their own; and the test rules of the service connection test.
// Real rule store, core library and firewall platform over files written
// in the private namespace.
#include "RouterRuleServHandler.h"
#include "hermetic.h"
#include "libzarkportmap.h"
#include "serv_test_env.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <filesystem>

namespace {

using namespace zark::test;
using Lines = std::vector<std::string>;

Json::Value Parse(const std::string &text) {
  Json::Value value;
  Json::Reader reader;
  EXPECT_TRUE(reader.parse(text, value)) << text;
  return value;
}

// Every even port of 2..1000, as a port list: too long for a rule field
// once it is written out whole, or once it is taken out of 1-1000.
std::string EvenPorts() {
  std::string ports;
  for (int port = 2; port <= 1000; port += 2) {
    ports += (ports.empty() ? "" : ",") + std::to_string(port);
  }
  return ports;
}

class ServHandlerRules : public ::testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    ClearLogs();
    WriteSystemService("web", Section("web_http", "tcp", "8080"));
    WriteSystemService("lan80", Section("lan80", "tcp", "80"));
    WriteSystemService("multi", Section("m_a", "tcp", "100-102") +
                                    Section("m_b", "tcp", "102-104"));
    WriteSystemService("dns", Section("dns", "both", "53"));
    WriteSystemService("ftp", Section("ftp", "tcp", "21") +
                                  Section("ftp_passive", "tcp", "55536-55899"));
    WriteSystemService("lanonly", Section("lanonly", "tcp", "445", false));
    WritePackageFile("shared.sc", Section("shared", "udp", "9000-9001"));
    WriteFile(ZARK_FW_SERVICE_MAPPING_TABLE, "# packages\np1=shared\n"
                                             "p2=shared\nghostly=nosuch\n");
  }

  // SetServPfRules with the policy text; result gets its result.
  Lines Apply(const std::string &policy, int &result) {
    RouterRuleServHandler handler;
    RouterRuleConfWriter writer;
    result = handler.SetServPfRules(Parse(policy), writer);
    return Describe(writer.Rules());
  }

  Lines ApplyOk(const std::string &policy) {
    int result = -1;
    Lines lines = Apply(policy, result);
    EXPECT_EQ(result, 0) << policy;
    return lines;
  }

  static Lines TestRules() {
    RouterRuleConfReader reader(true);
    EXPECT_TRUE(reader.IsValid());
    return Describe(reader.Rules());
  }
};

TEST_F(ServHandlerRules, UserRuleOnAServicePortGivesWayToTheService) {
  SaveRules({Rule("7", true, "8080", "8080", "tcp", "mine")});
  EXPECT_EQ(ApplyOk(R"({"add": ["web"]})"),
            (Lines{"0|1|8080|8080|tcp|web_http|"}));
}

TEST_F(ServHandlerRules, UserRangeIsCutAroundAServicePort) {
  SaveRules({Rule("7", true, "8000-8100", "8000-8100", "tcp", "mine")});
  EXPECT_EQ(ApplyOk(R"({"add": ["web"]})"),
            (Lines{"0|1|8000-8079,8081-8100|8000-8079,8081-8100|tcp|mine|",
                   "1|1|8080|8080|tcp|web_http|"}));
}

TEST_F(ServHandlerRules, SinglePortMappingToATakenLocalPortIsKeptDisabled) {
  SaveRules({Rule("7", true, "8080", "80", "tcp", "mine")});
  EXPECT_EQ(ApplyOk(R"({"add": ["lan80"]})"),
            (Lines{"0|0|8080|80|tcp|mine|", "1|1|80|80|tcp|lan80|"}));
}

TEST_F(ServHandlerRules, RangeMappingToATakenLocalPortFailsTheWholeRewrite) {
  SaveRules({Rule("1", true, "22", "22", "tcp", "kept"),
             Rule("2", true, "8080-8081", "80-81", "tcp", "mine"),
             Rule("3", true, "23", "23", "tcp", "after")});
  int result = 0;
  // The rules written before the failure stay in the writer.
  EXPECT_EQ(Apply(R"({"add": ["lan80"]})", result),
            (Lines{"0|1|22|22|tcp|kept|"}));
  EXPECT_EQ(result, -1);
}

TEST_F(ServHandlerRules, MultiItemMappingToATakenLocalPortFails) {
  SaveRules({Rule("2", true, "8080,8090", "80,90", "tcp", "mine")});
  int result = 0;
  Apply(R"({"add": ["lan80"]})", result);
  EXPECT_EQ(result, -1);
}

TEST_F(ServHandlerRules, RemovingAServiceTakesItsPortsOutAndAddsNoRule) {
  SaveRules({Rule("0", true, "8000-8100", "8000-8100", "tcp", "mine"),
             Rule("1", true, "8080", "8080", "tcp", "web_http"),
             Rule("2", true, "8080", "8080", "udp", "other")});
  EXPECT_EQ(ApplyOk(R"({"remove": ["web"]})"),
            (Lines{"0|1|8000-8079,8081-8100|8000-8079,8081-8100|tcp|mine|",
                   "1|1|8080|8080|udp|other|"}));
}

TEST_F(ServHandlerRules, TwoSectionsSharingAPortSplitIt) {
  EXPECT_EQ(
      ApplyOk(R"({"add": ["multi"]})"),
      (Lines{"0|1|100-102|100-102|tcp|m_a|", "1|1|103-104|103-104|tcp|m_b|"}));
}

TEST_F(ServHandlerRules, SectionNamedByTwoServicesIsWrittenOnce) {
  EXPECT_EQ(ApplyOk(R"({"add": ["p1", "p2"]})"),
            (Lines{"0|1|9000-9001|9000-9001|udp|shared|"}));
}

TEST_F(ServHandlerRules, UntouchedEightyDashEightyIsRewrittenAsEighty) {
  SaveRules({Rule("5", true, "80-80", "80-80", "tcp", "mine")});
  EXPECT_EQ(ApplyOk("{}"), (Lines{"0|1|80|80|tcp|mine|"}));
}

TEST_F(ServHandlerRules, UntouchedRulesAreCopiedWithFreshIdentifiers) {
  SaveRules({Rule("a", false, "2222", "22", "tcp", "ssh-alt"),
             Rule("b", true, "5000-5010", "5000-5010", "udp", "game"),
             Rule("c", true, "8080", "8080", "udp", "")});
  EXPECT_EQ(
      ApplyOk(R"({"add": ["web"], "remove": []})"),
      (Lines{"0|0|2222|22|tcp|ssh-alt|", "1|1|5000-5010|5000-5010|udp|game|",
             "2|1|8080|8080|udp||", "3|1|8080|8080|tcp|web_http|"}));
}

TEST_F(ServHandlerRules, RuleWhosePortsAreAllTakenIsDropped) {
  SaveRules({Rule("0", false, "8080", "8080", "tcp", "mine"),
             Rule("1", true, "22", "22", "tcp", "ssh")});
  EXPECT_EQ(ApplyOk(R"({"remove": ["web"]})"), (Lines{"0|1|22|22|tcp|ssh|"}));
}

TEST_F(ServHandlerRules, ReducedRuleKeepsItsEnabledState) {
  SaveRules({Rule("0", false, "8079-8081", "8079-8081", "tcp", "mine")});
  EXPECT_EQ(ApplyOk(R"({"remove": ["web"]})"),
            (Lines{"0|0|8079,8081|8079,8081|tcp|mine|"}));
}

TEST_F(ServHandlerRules, BothProtocolSectionGetsTwoRules) {
  SaveRules({Rule("0", true, "53", "53", "udp", "mine")});
  EXPECT_EQ(ApplyOk(R"({"add": ["dns"]})"),
            (Lines{"0|1|53|53|tcp|dns|", "1|1|53|53|udp|dns|"}));
}

TEST_F(ServHandlerRules, UnusableSectionsNeitherTakePortsNorGetRules) {
  SaveRules({Rule("0", true, "445", "445", "tcp", "mine")});
  EXPECT_EQ(ApplyOk(R"({"add": ["lanonly", "nosuch", "ghostly"]})"),
            (Lines{"0|1|445|445|tcp|mine|"}));
}

TEST_F(ServHandlerRules, NoSavedRulesGivesOnlyServiceRules) {
  EXPECT_EQ(ApplyOk(R"({"add": ["ftp", "web"]})"),
            (Lines{"0|1|21|21|tcp|ftp|",
                   "1|1|55536-55899|55536-55899|tcp|ftp_passive|",
                   "2|1|8080|8080|tcp|web_http|"}));
  EXPECT_TRUE(CapturedLogs().empty())
      << ::testing::PrintToString(CapturedMessages());
}

TEST_F(ServHandlerRules, PolicyMembersMustBeArrays) {
  for (const char *policy : {R"({"add": "web"})", R"({"remove": {}})",
                             R"({"add": [], "remove": 1})"}) {
    ClearLogs();
    int result = 0;
    EXPECT_TRUE(Apply(policy, result).empty());
    EXPECT_EQ(result, -1) << policy;
    EXPECT_TRUE(HasServLog("wrong parameter, should be array")) << policy;
  }
}

TEST_F(ServHandlerRules, PolicyMustBeAnObject) {
  int result = 0;
  Apply(R"(["web"])", result);
  EXPECT_EQ(result, -1);
  EXPECT_TRUE(HasServLog("wrong parameter, policy should be object"));
}

TEST_F(ServHandlerRules, FailsWithoutFirewallSections) {
  ResetFixedPaths();
  std::filesystem::create_directories(ZARK_FW_SYSTEM_SERVICE_DIR);
  SaveRules({Rule("0", true, "22", "22", "tcp", "ssh")});
  int result = 0;
  EXPECT_TRUE(Apply(R"({"add": ["web"]})", result).empty());
  EXPECT_EQ(result, -1);
  EXPECT_TRUE(HasServLog("Failed to enum firewall section, " + kErrState));
}

TEST_F(ServHandlerRules, FailsWhenServicesCannotBeListed) {
  std::filesystem::remove_all(ZARK_FW_SYSTEM_SERVICE_DIR);
  int result = 0;
  EXPECT_TRUE(Apply(R"({"add": ["p1"]})", result).empty());
  EXPECT_EQ(result, -1);
  EXPECT_TRUE(HasServLog("Failed to enum service, " + kErrState));
}

TEST_F(ServHandlerRules, ReducedRuleTooLongForTheStoreFails) {
  WriteSystemService("evens", Section("evens", "tcp", EvenPorts()));
  SaveRules({Rule("0", true, "1-1000", "1-1000", "tcp", "mine")});
  int result = 0;
  EXPECT_TRUE(Apply(R"({"add": ["evens"]})", result).empty());
  EXPECT_EQ(result, -1);
  EXPECT_TRUE(HasServLog("add rule failed"));
}

TEST_F(ServHandlerRules, SectionRuleTooLongForTheStoreFails) {
  WriteSystemService("evens", Section("evens", "tcp", EvenPorts()));
  SaveRules({Rule("0", true, "1001", "1001", "tcp", "odd")});
  int result = 0;
  EXPECT_EQ(Apply(R"({"add": ["evens"]})", result),
            (Lines{"0|1|1001|1001|tcp|odd|"}));
  EXPECT_EQ(result, -1);
}

TEST_F(ServHandlerRules, SectionWithoutPortListFailsThePolicy) {
  WriteSystemService("odd", "[odd]\nprotocol=tcp\n");
  int result = 0;
  Apply(R"({"add": ["odd"]})", result);
  EXPECT_EQ(result, -1);
  EXPECT_TRUE(HasServLog("pslPorts should not be null"));
}

TEST_F(ServHandlerRules, RulePortsPastThePortSpaceThrow) {
  SaveRules({Rule("0", true, "70000", "70000", "tcp", "mine")});
  RouterRuleServHandler handler;
  RouterRuleConfWriter writer;
  EXPECT_THROW(handler.SetServPfRules(Parse(R"({"add": ["web"]})"), writer),
               std::out_of_range);
}

TEST_F(ServHandlerRules, WriteOrgPfRulesContinuesTheCounter) {
  SaveRules(
      {Rule("x", true, "1", "1", "tcp"), Rule("y", true, "2", "2", "udp")});
  RouterRuleServHandler handler;
  RouterRuleConfWriter writer;
  int counter = 40;
  EXPECT_EQ(handler.WriteOrgPfRules(writer, &counter), 0);
  EXPECT_EQ(counter, 42);
  EXPECT_EQ(Describe(writer.Rules()),
            (Lines{"40|1|1|1|tcp||", "41|1|2|2|udp||"}));
}

TEST_F(ServHandlerRules, AddPfRuleByFwSctionSkipsUnknownSections) {
  RouterRuleServHandler handler;
  ASSERT_EQ(handler.FwSectionEnum(), 0);
  RouterRuleConfWriter writer;
  SzList sections = NewList({"ghost", "lan80", "dns"});
  int counter = 3;
  EXPECT_EQ(handler.AddPfRuleByFwSction(writer, sections.get(), &counter), 0);
  EXPECT_EQ(counter, 6);
  EXPECT_EQ(Describe(writer.Rules()),
            (Lines{"3|1|80|80|tcp|lan80|", "4|1|53|53|tcp|dns|",
                   "5|1|53|53|udp|dns|"}));
  // What was written is now taken.
  EXPECT_EQ(handler.CheckPort("tcp", 80), 1);
  EXPECT_EQ(handler.CheckPort("udp", 53), 1);
}

// ---------------------------------------------------------------------------
// Test rules of the service connection test
// ---------------------------------------------------------------------------

TEST_F(ServHandlerRules, TestRulesOfOneIdentifierArePerProtocol) {
  SaveRules({Rule("0", true, "53", "53", "udp", "mine")});
  RouterRuleServHandler handler;
  EXPECT_EQ(handler.SetServPfTestRules(Json::Value("dns")), 0);
  EXPECT_EQ(TestRules(),
            (Lines{"dns.tcp|1|53|53|tcp|dns|", "dns.udp|1|53|53|udp|dns|"}));
}

TEST_F(ServHandlerRules, TestRulesJoinTheSectionsOfEachService) {
  RouterRuleServHandler handler;
  EXPECT_EQ(handler.SetServPfTestRules(
                Parse(R"(["ftp", "multi", "p1", "lanonly", "nosuch"])")),
            0);
  // No conflict removal: shared ports stay in both sections' texts.
  EXPECT_EQ(TestRules(),
            (Lines{"ftp.tcp|1|21,55536-55899|21,55536-55899|tcp|ftp|",
                   "multi.tcp|1|100-102,102-104|100-102,102-104|tcp|multi|",
                   "p1.udp|1|9000-9001|9000-9001|udp|p1|"}));
}

TEST_F(ServHandlerRules, TestRulesOfAServiceWithAnUnknownSectionAreNone) {
  RouterRuleServHandler handler;
  SzList sections = NewList({"lan80", "ghost", "dns"});
  ASSERT_EQ(handler.FwSectionEnum(), 0);
  RouterRuleConfWriter writer;
  EXPECT_EQ(handler.AddPfRuleByFwSction("svc", sections.get(), writer), 0);
  EXPECT_TRUE(writer.Rules().empty());
}

TEST_F(ServHandlerRules, TestRulesReplaceTheTestRuleFile) {
  RouterRuleServHandler first;
  ASSERT_EQ(first.SetServPfTestRules(Parse(R"(["web", "dns"])")), 0);
  RouterRuleServHandler second;
  ASSERT_EQ(second.SetServPfTestRules(Parse("[]")), 0);
  EXPECT_TRUE(TestRules().empty());
  // The saved rules are not touched.
  EXPECT_FALSE(std::filesystem::exists(ZARK_PORTMAP_RULE_CONF));
}

TEST_F(ServHandlerRules, TestRulesRefuseOtherTypes) {
  for (const char *text : {"{}", "7", "null", "true"}) {
    ClearLogs();
    RouterRuleServHandler handler;
    EXPECT_EQ(handler.SetServPfTestRules(Parse(text)), -1) << text;
    EXPECT_TRUE(HasServLog("wrong parameter, should be array or string"))
        << text;
  }
  EXPECT_FALSE(std::filesystem::exists(ZARK_PORTMAP_TEST_RULE_CONF));
}

TEST_F(ServHandlerRules, TestRulesFailWithoutFirewallSections) {
  ResetFixedPaths();
  std::filesystem::create_directories(ZARK_FW_SYSTEM_SERVICE_DIR);
  RouterRuleServHandler handler;
  EXPECT_EQ(handler.SetServPfTestRules(Json::Value("web")), -1);
  EXPECT_FALSE(std::filesystem::exists(ZARK_PORTMAP_TEST_RULE_CONF));
}

TEST_F(ServHandlerRules, TestRulesFailWhenServicesCannotBeListed) {
  std::filesystem::remove_all(ZARK_FW_SYSTEM_SERVICE_DIR);
  RouterRuleServHandler handler;
  EXPECT_EQ(handler.SetServPfTestRules(Json::Value("p1")), -1);
  EXPECT_TRUE(HasServLog("Failed to enum service, " + kErrState));
}

TEST_F(ServHandlerRules, TestRulesTooLongForTheStoreFail) {
  WriteSystemService("evens", Section("evens", "tcp", EvenPorts()));
  RouterRuleServHandler handler;
  EXPECT_EQ(handler.SetServPfTestRules(Json::Value("evens")), -1);
  EXPECT_FALSE(std::filesystem::exists(ZARK_PORTMAP_TEST_RULE_CONF));
}

} // namespace
