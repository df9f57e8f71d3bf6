// Loading the saved rules as a JSON array.
#include "ops_test_support.h"

namespace zark::ops {
namespace {

using ::testing::ElementsAre;
using zark::fake::Fake;
using zark::fake::MakeRule;

class ModuleOpsRulesLoad : public OpsTest {};

TEST_F(ModuleOpsRulesLoad, EmptyConfigurationGivesSuccessWithEmptyArray) {
  Json::Value out = "junk";
  EXPECT_TRUE(pf->LoadPortForwardingRules(out));
  ASSERT_TRUE(out.isArray());
  EXPECT_EQ(0u, out.size());
  // No array came back, so there is nothing to free.
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibFreeRulesArr"));
  EXPECT_TRUE(PfLogs().empty());
}

TEST_F(ModuleOpsRulesLoad, CallsLibraryForSavedConfigurationWithErrorRecord) {
  Json::Value out;
  pf->LoadPortForwardingRules(out);
  auto calls = zark::fake::Calls();
  ASSERT_EQ(1u, calls.size());
  EXPECT_EQ("KLibGetRulesArrFromRuleConf", calls[0].name);
  EXPECT_THAT(calls[0].args, ElementsAre("(null)", "false", "err"));
}

TEST_F(ModuleOpsRulesLoad, RulesConvertedInOrderWithAllSevenKeys) {
  Fake().savedRules = {
      MakeRule("1", true, "tcp", "8080", "80", "web", "Web Station"),
      MakeRule("2", false, "udp", "1000-1010", "2000-2010"),
  };
  Json::Value out;
  ASSERT_TRUE(pf->LoadPortForwardingRules(out));
  ASSERT_EQ(2u, out.size());
  EXPECT_EQ(ParseJson(R"({"enable": true, "rule_id": "1",
      "router_protocol": "tcp", "router_port": "8080", "ds_port": "80",
      "serviceid": "web", "service_name": "Web Station"})"),
            out[0]);
  EXPECT_EQ(ParseJson(R"({"enable": false, "rule_id": "2",
      "router_protocol": "udp", "router_port": "1000-1010",
      "ds_port": "2000-2010", "serviceid": "", "service_name": ""})"),
            out[1]);
  EXPECT_EQ(1u, zark::fake::CountCalls("KLibFreeRulesArr"));
}

TEST_F(ModuleOpsRulesLoad, AnyNonZeroEnableByteShownAsTrue) {
  ZARK_ROUTER_RULE rule = MakeRule("1", true, "tcp", "80", "80");
  rule.enable = 0x7F;
  Fake().savedRules = {rule};
  Json::Value out;
  ASSERT_TRUE(pf->LoadPortForwardingRules(out));
  ASSERT_TRUE(out[0]["enable"].isBool());
  EXPECT_TRUE(out[0]["enable"].asBool());
}

TEST_F(ModuleOpsRulesLoad, EmptyServiceFieldsShownAsEmptyText) {
  Fake().savedRules = {MakeRule("7", true, "tcp", "22", "22")};
  Json::Value out;
  ASSERT_TRUE(pf->LoadPortForwardingRules(out));
  ASSERT_TRUE(out[0]["serviceid"].isString());
  ASSERT_TRUE(out[0]["service_name"].isString());
  EXPECT_EQ("", out[0]["serviceid"].asString());
  EXPECT_EQ("", out[0]["service_name"].asString());
}

TEST_F(ModuleOpsRulesLoad, PortsStayText) {
  Fake().savedRules = {MakeRule("1", true, "tcp", "443", "8443")};
  Json::Value out;
  ASSERT_TRUE(pf->LoadPortForwardingRules(out));
  EXPECT_TRUE(out[0]["router_port"].isString());
  EXPECT_TRUE(out[0]["ds_port"].isString());
}

TEST_F(ModuleOpsRulesLoad, LibraryErrorTwoSets1501AndGivesEmptyArray) {
  Fake().KLibGetRulesArrFromRuleConf = [](int *, ZARK_ROUTER_RULE **, char *,
                                          bool, ZARK_LIBZARKPORTMAP_ERR *err) {
    err->err = ZARK_PORTMAP_ERR_NOT_CONFIGURED;
    return -1;
  };
  Json::Value out = "junk";
  EXPECT_FALSE(pf->LoadPortForwardingRules(out));
  EXPECT_EQ(1501, pf->GetErrorCode());
  ASSERT_TRUE(out.isArray());
  EXPECT_EQ(0u, out.size());
  EXPECT_THAT(PfLogs(), ElementsAre("KLibGetRulesByRuleConf() failed"));
}

TEST_F(ModuleOpsRulesLoad, LibraryOtherErrorKeeps1500AndGivesEmptyArray) {
  Fake().KLibGetRulesArrFromRuleConf = [](int *, ZARK_ROUTER_RULE **, char *,
                                          bool, ZARK_LIBZARKPORTMAP_ERR *err) {
    err->err = ZARK_PORTMAP_ERR_IO;
    return -1;
  };
  Json::Value out;
  EXPECT_FALSE(pf->LoadPortForwardingRules(out));
  EXPECT_EQ(1500, pf->GetErrorCode());
  ASSERT_TRUE(out.isArray());
  EXPECT_EQ(0u, out.size());
  EXPECT_THAT(PfLogs(), ElementsAre("KLibGetRulesByRuleConf() failed"));
}

TEST_F(ModuleOpsRulesLoad, ArrayHandedOutWithFailureIsStillFreed) {
  Fake().KLibGetRulesArrFromRuleConf = [](int *count, ZARK_ROUTER_RULE **rules,
                                          char *, bool,
                                          ZARK_LIBZARKPORTMAP_ERR *) {
    *count = 1;
    *rules =
        static_cast<ZARK_ROUTER_RULE *>(calloc(1, sizeof(ZARK_ROUTER_RULE)));
    return -1;
  };
  Json::Value out;
  EXPECT_FALSE(pf->LoadPortForwardingRules(out));
  EXPECT_EQ(0u, out.size());
  EXPECT_EQ(1u, zark::fake::CountCalls("KLibFreeRulesArr"));
}

TEST_F(ModuleOpsRulesLoad, NoReporterLogsAndGivesEmptyArray) {
  PortForwarding bare(nullptr);
  Fake().savedRules = {MakeRule("1", true, "tcp", "80", "80")};
  Json::Value out = "junk";
  EXPECT_FALSE(bare.LoadPortForwardingRules(out));
  ASSERT_TRUE(out.isArray());
  EXPECT_EQ(0u, out.size());
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibGetRulesArrFromRuleConf"));
  EXPECT_THAT(PfLogs(), ElementsAre("status reportor shall not be NULL"));
}

TEST_F(ModuleOpsRulesLoad, LoadReportsNothingThroughTheReporter) {
  Fake().savedRules = {MakeRule("1", true, "tcp", "80", "80")};
  Json::Value out;
  ASSERT_TRUE(pf->LoadPortForwardingRules(out));
  // The entry answers; the operation only fills the result.
  EXPECT_TRUE(listener->Answers().empty());
}

} // namespace
} // namespace zark::ops
