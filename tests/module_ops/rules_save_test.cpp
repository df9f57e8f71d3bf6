// Saving rules under the port-map lock, with progress, and the readers of
// the apply progress and of task records.
#include "ops_test_support.h"

#include <sys/stat.h>

#include <climits>
#include <cstring>

namespace zark::ops {
namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using zark::fake::Fake;

Json::Value Rule(const std::string &id, const std::string &proto,
                 const std::string &routerPort, const std::string &dsPort) {
  Json::Value rule(Json::objectValue);
  rule["rule_id"] = id;
  rule["enable"] = true;
  rule["router_protocol"] = proto;
  rule["router_port"] = routerPort;
  rule["ds_port"] = dsPort;
  rule["serviceid"] = "";
  rule["service_name"] = "";
  return rule;
}

Json::Value RulesParams(std::initializer_list<Json::Value> rules) {
  Json::Value params(Json::objectValue);
  params["rules"] = Json::Value(Json::arrayValue);
  for (const auto &rule : rules) {
    params["rules"].append(rule);
  }
  return params;
}

class ModuleOpsRulesSave : public OpsTest {
protected:
  void SetUp() override {
    OpsTest::SetUp();
    Trace(Fake().KLibZarkPortMapLock, "Lock");
    Trace(Fake().KLibZarkPortMapUnLock, "UnLock");
    Trace(Fake().KLibGetGatewayIP, "GetGatewayIP");
    Trace(Fake().KLibSaveRules, "SaveRules");
  }

  // Makes KLibSaveRules fail with the given error type; fill sets detail.
  void FailSave(uint32_t errType,
                std::function<void(ZARK_ROUTER_SAVE_RULE_RESULT *)> fill = {}) {
    Fake().KLibSaveRules = [errType, fill](const char *, int,
                                           ZARK_ROUTER_RULE *, bool,
                                           ZARK_ROUTER_SAVE_RULE_RESULT *result,
                                           ZARK_SAVE_RULE_PROGRESS_CB, void *) {
      result->errType = errType;
      if (fill) {
        fill(result);
      }
      return -1;
    };
    Trace(Fake().KLibSaveRules, "SaveRules");
  }

  Json::Value LastErrorData() { return response.GetErrorData(); }
};

TEST_F(ModuleOpsRulesSave, SuccessReportsInOrderAndSavesTheRules) {
  Json::Value rule = Rule("3", "tcp", "8080", "80");
  rule["serviceid"] = "web";
  rule["service_name"] = "Web";
  Json::Value data;
  pf->StartPortForwarding(RulesParams({rule}), data);

  EXPECT_THAT(timeline.Entries(),
              ElementsAre("status processing 1", "Lock", "GetGatewayIP",
                          "status processing 5", "SaveRules", "UnLock",
                          "status success 100"));
  EXPECT_EQ(ZARK::APIResponse::State::Success, response.GetState());
  EXPECT_EQ(ParseJson(R"({"status": "success", "percentage": 100})"),
            response.GetData());

  ASSERT_EQ(1u, Fake().lastSavedRules.size());
  const ZARK_ROUTER_RULE &saved = Fake().lastSavedRules[0];
  EXPECT_STREQ("3", saved.rule_id);
  EXPECT_EQ(1, saved.enable);
  EXPECT_STREQ("tcp", saved.router_protocol);
  EXPECT_STREQ("8080", saved.router_port);
  EXPECT_STREQ("80", saved.ds_port);
  EXPECT_STREQ("web", saved.serviceid);
  EXPECT_STREQ("Web", saved.service_name);
  EXPECT_THAT(PfLogs(), IsEmpty());
}

TEST_F(ModuleOpsRulesSave, SaveCallGetsGatewayCountAndFlagAndArrayIsFreed) {
  Json::Value data;
  pf->StartPortForwarding(
      RulesParams({Rule("1", "tcp", "80", "80"), Rule("2", "udp", "53", "53")}),
      data);
  std::vector<std::string> names;
  for (const auto &call : zark::fake::Calls()) {
    names.push_back(call.name);
    if (call.name == "KLibSaveRules") {
      EXPECT_THAT(call.args, ElementsAre("192.168.1.1", "2", "false"));
    }
    if (call.name == "KLibGetGatewayIP") {
      EXPECT_THAT(call.args, ElementsAre("1024"));
    }
  }
  EXPECT_THAT(names, ElementsAre("KLibZarkPortMapLock", "KLibGetGatewayIP",
                                 "KLibSaveRules", "KLibFreeRulesArr",
                                 "KLibZarkPortMapUnLock"));
}

TEST_F(ModuleOpsRulesSave, LibraryProgressIsReportedAsProcessing) {
  void *seenArg = nullptr;
  Fake().KLibSaveRules = [&seenArg](const char *, int, ZARK_ROUTER_RULE *, bool,
                                    ZARK_ROUTER_SAVE_RULE_RESULT *result,
                                    ZARK_SAVE_RULE_PROGRESS_CB callback,
                                    void *arg) {
    seenArg = arg;
    for (int percentage : {20, 60, 90}) {
      result->percentage = percentage;
      callback(result, arg);
    }
    return 0;
  };
  Json::Value data;
  pf->StartPortForwarding(RulesParams({Rule("1", "tcp", "80", "80")}), data);
  EXPECT_EQ(static_cast<void *>(Reporter()), seenArg);
  EXPECT_THAT(listener->Names(),
              ElementsAre("status processing 1", "status processing 5",
                          "status processing 20", "status processing 60",
                          "status processing 90", "status success 100"));
}

TEST_F(ModuleOpsRulesSave, FailedLockReportsTwiceAroundAnUnlock) {
  Fake().KLibZarkPortMapLock = [] { return -1; };
  Trace(Fake().KLibZarkPortMapLock, "Lock");
  Json::Value data;
  pf->StartPortForwarding(RulesParams({Rule("1", "tcp", "80", "80")}), data);

  EXPECT_THAT(timeline.Entries(),
              ElementsAre("status processing 1", "Lock", "error 1501", "UnLock",
                          "error 1501"));
  EXPECT_THAT(zark::fake::CallNames(),
              ElementsAre("KLibZarkPortMapLock", "KLibZarkPortMapUnLock"));
  EXPECT_EQ(1501, response.GetErrorCode());
  EXPECT_EQ(ParseJson(R"({"sec": "", "key": "", "append": null})"),
            response.GetErrorData());
  EXPECT_THAT(PfLogs(), IsEmpty());
}

TEST_F(ModuleOpsRulesSave, RulesThatAreNotAnArrayFail) {
  Json::Value params(Json::objectValue);
  params["rules"] = ParseJson(R"({"rule_id": "1"})");
  Json::Value data;
  pf->StartPortForwarding(params, data);
  EXPECT_THAT(PfLogs(), ElementsAre("parameter: rules shall be array type"));
  EXPECT_THAT(timeline.Entries(), ElementsAre("status processing 1", "Lock",
                                              "UnLock", "error 1500"));
  EXPECT_EQ(1500, response.GetErrorCode());
}

TEST_F(ModuleOpsRulesSave, RuleWithProtocolAndBothPortsEmptyFails) {
  Json::Value rule(Json::objectValue);
  rule["rule_id"] = "1";
  rule["enable"] = true;
  Json::Value data;
  pf->StartPortForwarding(RulesParams({Rule("0", "tcp", "80", "80"), rule}),
                          data);
  EXPECT_THAT(PfLogs(), ElementsAre("protocol, and port should not be empty"));
  EXPECT_EQ(1500, response.GetErrorCode());
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibGetGatewayIP"));
  EXPECT_EQ(1u, zark::fake::CountCalls("KLibZarkPortMapUnLock"));
}

TEST_F(ModuleOpsRulesSave, PortsAndProtocolGivenAsNumbersCountAsEmpty) {
  Json::Value rule = ParseJson(R"({"rule_id": "1", "enable": true,
      "router_protocol": 6, "router_port": 8080, "ds_port": 80})");
  Json::Value data;
  pf->StartPortForwarding(RulesParams({rule}), data);
  EXPECT_THAT(PfLogs(), ElementsAre("protocol, and port should not be empty"));
  EXPECT_EQ(ZARK::APIResponse::State::Error, response.GetState());
  EXPECT_EQ(1500, response.GetErrorCode());
}

TEST_F(ModuleOpsRulesSave, RuleWithOnlyOneFieldSetIsPassedOn) {
  Json::Value rule = ParseJson(R"({"router_protocol": "tcp"})");
  Json::Value data;
  pf->StartPortForwarding(RulesParams({rule}), data);
  EXPECT_EQ(ZARK::APIResponse::State::Success, response.GetState());
  ASSERT_EQ(1u, Fake().lastSavedRules.size());
  EXPECT_STREQ("tcp", Fake().lastSavedRules[0].router_protocol);
  EXPECT_STREQ("", Fake().lastSavedRules[0].router_port);
  EXPECT_STREQ("", Fake().lastSavedRules[0].ds_port);
}

TEST_F(ModuleOpsRulesSave, NonStringTextsBecomeEmptyAndNonBoolEnableFalse) {
  Json::Value rule = ParseJson(R"({"rule_id": 5, "enable": 1,
      "router_protocol": "udp", "router_port": "53", "ds_port": 53,
      "serviceid": ["x"], "service_name": null})");
  Json::Value data;
  pf->StartPortForwarding(RulesParams({rule}), data);
  ASSERT_EQ(1u, Fake().lastSavedRules.size());
  const ZARK_ROUTER_RULE &saved = Fake().lastSavedRules[0];
  EXPECT_STREQ("", saved.rule_id);
  EXPECT_EQ(0, saved.enable);
  EXPECT_STREQ("udp", saved.router_protocol);
  EXPECT_STREQ("53", saved.router_port);
  EXPECT_STREQ("", saved.ds_port);
  EXPECT_STREQ("", saved.serviceid);
  EXPECT_STREQ("", saved.service_name);
}

TEST_F(ModuleOpsRulesSave, RuleElementThatIsNoObjectCountsAsEmpty) {
  Json::Value params = RulesParams({});
  params["rules"].append(42);
  Json::Value data;
  pf->StartPortForwarding(params, data);
  EXPECT_THAT(PfLogs(), ElementsAre("protocol, and port should not be empty"));
  EXPECT_EQ(1500, response.GetErrorCode());
}

TEST_F(ModuleOpsRulesSave, RuleRefusedByWriterFails) {
  // The rule store takes at most 1023 bytes per field.
  Json::Value data;
  pf->StartPortForwarding(
      RulesParams({Rule(std::string(1100, '7'), "tcp", "80", "80")}), data);
  EXPECT_THAT(PfLogs(), ElementsAre("add rule failed"));
  EXPECT_EQ(1500, response.GetErrorCode());
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibSaveRules"));
}

TEST_F(ModuleOpsRulesSave, EmptyRulesArrayGoesOnToGatewayAndSave) {
  Json::Value data;
  pf->StartPortForwarding(RulesParams({}), data);
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("status processing 1", "Lock", "GetGatewayIP",
                          "status processing 5", "SaveRules", "UnLock",
                          "status success 100"));
  for (const auto &call : zark::fake::Calls()) {
    if (call.name == "KLibSaveRules") {
      EXPECT_EQ("0", call.args[1]);
    }
  }
  // ToArray hands out no array for no rule: nothing to free.
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibFreeRulesArr"));
}

TEST_F(ModuleOpsRulesSave, RulesWinOverPfPolicyWhenBothAreGiven) {
  Json::Value params = RulesParams({Rule("1", "tcp", "21", "21")});
  params["pf_policy"] = "not a policy";
  Json::Value data;
  pf->StartPortForwarding(params, data);
  EXPECT_EQ(ZARK::APIResponse::State::Success, response.GetState());
  ASSERT_EQ(1u, Fake().lastSavedRules.size());
  EXPECT_STREQ("21", Fake().lastSavedRules[0].router_port);
}

TEST_F(ModuleOpsRulesSave, NullRulesWithoutPolicyIsStrange) {
  Json::Value params(Json::objectValue);
  params["rules"] = Json::Value();
  Json::Value data;
  pf->StartPortForwarding(params, data);
  EXPECT_THAT(PfLogs(), ElementsAre("strange json value"));
  EXPECT_THAT(timeline.Entries(), ElementsAre("status processing 1", "Lock",
                                              "UnLock", "error 1500"));
}

TEST_F(ModuleOpsRulesSave, NeitherRulesNorPolicyIsStrange) {
  Json::Value data;
  pf->StartPortForwarding(Json::Value(Json::objectValue), data);
  EXPECT_THAT(PfLogs(), ElementsAre("strange json value"));
  EXPECT_EQ(1500, response.GetErrorCode());
}

TEST_F(ModuleOpsRulesSave, NullPolicyIsStrange) {
  Json::Value params(Json::objectValue);
  params["pf_policy"] = Json::Value();
  Json::Value data;
  pf->StartPortForwarding(params, data);
  EXPECT_THAT(PfLogs(), ElementsAre("strange json value"));
}

// Through RouterRuleServHandler::SetServPfRules: a policy whose "add" is
// not an array is refused by it.
TEST_F(ModuleOpsRulesSave, PolicyThatCannotBeWrittenAnswers1527) {
  Json::Value params(Json::objectValue);
  params["pf_policy"] = ParseJson(R"({"add": "web"})");
  Json::Value data;
  pf->StartPortForwarding(params, data);
  EXPECT_THAT(PfLogs(), ElementsAre("write rules failed"));
  EXPECT_THAT(timeline.Entries(), ElementsAre("status processing 1", "Lock",
                                              "UnLock", "error 1527"));
  EXPECT_EQ(1527, response.GetErrorCode());
}

// Through RouterRuleServHandler::SetServPfRules and the firewall service
// table: an empty policy over an empty rule configuration writes no rule.
TEST_F(ModuleOpsRulesSave, EmptyPolicySavesThroughTheServiceHandler) {
  WriteSystemService();
  Json::Value params(Json::objectValue);
  params["pf_policy"] = ParseJson(R"({"add": [], "remove": []})");
  Json::Value data;
  pf->StartPortForwarding(params, data);
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("status processing 1", "Lock", "GetGatewayIP",
                          "status processing 5", "SaveRules", "UnLock",
                          "status success 100"));
  EXPECT_TRUE(Fake().lastSavedRules.empty());
}

// Through RouterRuleServHandler::SetServPfRules: the service's section gets
// its own rule in what is saved.
TEST_F(ModuleOpsRulesSave, PolicyAddingAServiceSavesItsSectionRule) {
  WriteSystemService();
  Json::Value params(Json::objectValue);
  params["pf_policy"] = ParseJson(R"({"add": ["svc"]})");
  Json::Value data;
  pf->StartPortForwarding(params, data);
  EXPECT_EQ(ZARK::APIResponse::State::Success, response.GetState());
  ASSERT_EQ(1u, Fake().lastSavedRules.size());
  EXPECT_STREQ("5000", Fake().lastSavedRules[0].router_port);
  EXPECT_STREQ("tcp", Fake().lastSavedRules[0].router_protocol);
  EXPECT_STREQ("svc_web", Fake().lastSavedRules[0].serviceid);
}

TEST_F(ModuleOpsRulesSave, UnknownGatewayAnswers1503BeforeProgressFive) {
  Fake().KLibGetGatewayIP = [](char *, int) { return -1; };
  Trace(Fake().KLibGetGatewayIP, "GetGatewayIP");
  Json::Value data;
  pf->StartPortForwarding(RulesParams({Rule("1", "tcp", "80", "80")}), data);
  EXPECT_THAT(PfLogs(), ElementsAre("unable to get gateway ip"));
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("status processing 1", "Lock", "GetGatewayIP",
                          "UnLock", "error 1503"));
  EXPECT_EQ(1503, response.GetErrorCode());
}

TEST_F(ModuleOpsRulesSave, NoReporterLogsAndCallsNothing) {
  PortForwarding bare(nullptr);
  Json::Value data;
  bare.StartPortForwarding(RulesParams({Rule("1", "tcp", "80", "80")}), data);
  EXPECT_THAT(PfLogs(), ElementsAre("status reportor shall not be NULL"));
  EXPECT_THAT(zark::fake::CallNames(), IsEmpty());
}

TEST_F(ModuleOpsRulesSave, NotConfiguredErrorTypeAnswers1501WithoutData) {
  FailSave(ZARK_SAVE_ERR_NOT_CONFIGURED);
  Json::Value data;
  pf->StartPortForwarding(RulesParams({Rule("1", "tcp", "80", "80")}), data);
  EXPECT_EQ(1501, response.GetErrorCode());
  EXPECT_TRUE(LastErrorData()["append"].isNull());
  EXPECT_TRUE(data.isNull());
  EXPECT_THAT(PfLogs(), IsEmpty());
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("status processing 1", "Lock", "GetGatewayIP",
                          "status processing 5", "SaveRules", "UnLock",
                          "error 1501"));
}

struct LimitCase {
  uint32_t errType;
  int code;
  const char *append;
};

class ModuleOpsRulesSaveLimit
    : public ModuleOpsRulesSave,
      public ::testing::WithParamInterface<LimitCase> {};

TEST_P(ModuleOpsRulesSaveLimit, LimitErrorTypesAnswerTheirCodeAndLimits) {
  const LimitCase &c = GetParam();
  FailSave(c.errType, [](ZARK_ROUTER_SAVE_RULE_RESULT *result) {
    result->detail.limit.maxPort = 32;
    result->detail.limit.maxRange = 100;
  });
  Json::Value data;
  pf->StartPortForwarding(RulesParams({Rule("1", "tcp", "80", "80")}), data);
  EXPECT_EQ(c.code, response.GetErrorCode());
  EXPECT_EQ(ParseJson(c.append), LastErrorData()["append"]);
  EXPECT_EQ(ParseJson(c.append), data);
  EXPECT_THAT(PfLogs(), IsEmpty());
  EXPECT_EQ(1u, zark::fake::CountCalls("KLibZarkPortMapUnLock"));
}

INSTANTIATE_TEST_SUITE_P(
    ModuleOpsTypes, ModuleOpsRulesSaveLimit,
    ::testing::Values(
        LimitCase{ZARK_SAVE_ERR_TOO_MANY_RULES, 1524, R"({"max_port": 32})"},
        LimitCase{ZARK_SAVE_ERR_PORT_TOO_HIGH, 1521, R"({"max_port": 32})"},
        LimitCase{ZARK_SAVE_ERR_TOO_MANY_PORTS, 1522, R"({"max_port": 32})"},
        LimitCase{ZARK_SAVE_ERR_RANGE_TOO_LONG, 1523,
                  R"({"max_port": 32, "max_range": 100})"}));

TEST_F(ModuleOpsRulesSave, BadPortTextAnswers1525WithTheTextAsData) {
  FailSave(ZARK_SAVE_ERR_BAD_PORT_TEXT, [](ZARK_ROUTER_SAVE_RULE_RESULT *r) {
    std::strcpy(r->detail.text, "80-x");
  });
  Json::Value data;
  pf->StartPortForwarding(RulesParams({Rule("1", "tcp", "80-x", "80")}), data);
  EXPECT_EQ(1525, response.GetErrorCode());
  EXPECT_EQ(Json::Value("80-x"), LastErrorData()["append"]);
  EXPECT_EQ(Json::Value("80-x"), data);
}

TEST_F(ModuleOpsRulesSave, BadProtocolAnswers1526WithTheTextAsData) {
  FailSave(ZARK_SAVE_ERR_BAD_PROTOCOL, [](ZARK_ROUTER_SAVE_RULE_RESULT *r) {
    std::strcpy(r->detail.text, "sctp");
  });
  Json::Value data;
  pf->StartPortForwarding(RulesParams({Rule("1", "sctp", "80", "80")}), data);
  EXPECT_EQ(1526, response.GetErrorCode());
  EXPECT_EQ(Json::Value("sctp"), LastErrorData()["append"]);
}

TEST_F(ModuleOpsRulesSave, DetailTextFillingItsWholeFieldStaysInBounds) {
  FailSave(ZARK_SAVE_ERR_BAD_PORT_TEXT, [](ZARK_ROUTER_SAVE_RULE_RESULT *r) {
    std::memset(r->detail.text, 'p', sizeof(r->detail.text));
  });
  Json::Value data;
  pf->StartPortForwarding(RulesParams({Rule("1", "tcp", "80", "80")}), data);
  EXPECT_EQ(std::string(ZARK_PORTMAP_TEXT_SIZE, 'p'),
            LastErrorData()["append"].asString());
}

class ModuleOpsRulesSaveUnknown
    : public ModuleOpsRulesSave,
      public ::testing::WithParamInterface<uint32_t> {};

TEST_P(ModuleOpsRulesSaveUnknown, UnknownErrorTypeLogsAndAnswers1500) {
  FailSave(GetParam());
  Json::Value data;
  pf->StartPortForwarding(RulesParams({Rule("1", "tcp", "80", "80")}), data);
  EXPECT_THAT(PfLogs(), ElementsAre("unknown err enum type"));
  EXPECT_EQ(1500, response.GetErrorCode());
  EXPECT_TRUE(LastErrorData()["append"].isNull());
}

INSTANTIATE_TEST_SUITE_P(ModuleOpsTypes, ModuleOpsRulesSaveUnknown,
                         ::testing::Values(0u, 1u, 3u, 4u, 5u, 6u, 13u,
                                           0xFFFFFFFFu));

// --- saveRuleProgressCB ----------------------------------------------------

TEST_F(ModuleOpsRulesSave, ProgressCallbackReportsProcessing) {
  ZARK_ROUTER_SAVE_RULE_RESULT result{};
  result.percentage = 42;
  saveRuleProgressCB(&result, Reporter());
  EXPECT_THAT(listener->Names(), ElementsAre("status processing 42"));
}

TEST_F(ModuleOpsRulesSave, ProgressCallbackWithoutReporterLogs) {
  ZARK_ROUTER_SAVE_RULE_RESULT result{};
  saveRuleProgressCB(&result, nullptr);
  EXPECT_THAT(PfLogs(), ElementsAre("statusReportor is NULL"));
}

TEST_F(ModuleOpsRulesSave, ProgressCallbackWithoutResultLogs) {
  saveRuleProgressCB(nullptr, Reporter());
  EXPECT_THAT(PfLogs(), ElementsAre("saveResult is NULL"));
  EXPECT_TRUE(listener->Answers().empty());
}

// --- GetPortfwdApplyStatus -------------------------------------------------

struct ApplyCase {
  const char *content;
  const char *stage;
  int percentage;
};

class ModuleOpsApplyStatus : public OpsTest,
                             public ::testing::WithParamInterface<ApplyCase> {};

TEST_P(ModuleOpsApplyStatus, ParsesTheLastLine) {
  const ApplyCase &c = GetParam();
  zark::test::WriteFile("/tmp/pfProgress", c.content);
  std::string stage = "unset";
  int percentage = -7;
  ASSERT_TRUE(pf->GetPortfwdApplyStatus(stage, percentage));
  EXPECT_EQ(c.stage, stage);
  EXPECT_EQ(c.percentage, percentage);
}

INSTANTIATE_TEST_SUITE_P(
    ModuleOpsLines, ModuleOpsApplyStatus,
    ::testing::Values(
        ApplyCase{"del=3/6", "del", 25}, ApplyCase{"add=3/6", "add", 75},
        ApplyCase{"add=9/6", "add", 100}, ApplyCase{"add=1/0", "add", 50},
        ApplyCase{"del=0/0", "del", 0}, ApplyCase{"del=6/6\n", "del", 50},
        ApplyCase{"del=1/3", "del", 16}, ApplyCase{"add=6/6", "add", 100},
        // "=" without "/": no total, read as total 0.
        ApplyCase{"add=4", "add", 50}, ApplyCase{"del=4", "del", 0},
        // No "=" at all, or nothing: the start of the work.
        ApplyCase{"add", "del", 0}, ApplyCase{"", "del", 0},
        // Several lines: the last one counts.
        ApplyCase{"del=1/2\ndel=2/2\nadd=1/2\n", "add", 75},
        ApplyCase{"add=1/2\n\n", "del", 0},
        // Counts the library never writes follow the same formula:
        // negative counts give negative percentages, truncated toward zero.
        ApplyCase{"del=-3/6", "del", -25}, ApplyCase{"add=-3/6", "add", 25},
        ApplyCase{"add=-9/6", "add", -25}, ApplyCase{"del=-1/3", "del", -16},
        ApplyCase{"del=3/-6", "del", -25}, ApplyCase{"del=-6/-6", "del", 50},
        ApplyCase{"add=-1/0", "add", 50},
        // Counts beyond any int: capped at 100 above, the lowest int below.
        ApplyCase{"add=99999999999999999999/1", "add", 100},
        ApplyCase{"del=-9223372036854775808/1", "del", INT_MIN},
        ApplyCase{"del=99999999999999999999/-1", "del", INT_MIN},
        ApplyCase{"del=-99999999999999999999/3", "del", INT_MIN}));

TEST_F(ModuleOpsRulesSave, ApplyStatusLineLongerThanBufferUsesLastPiece) {
  // A line longer than the 128-byte buffer is taken in pieces of 127
  // characters; the last piece read is what is parsed. Here the line is
  // 144 characters: the second piece is 10 "x" and "del=1/2".
  std::string line = "add=1/2" + std::string(130, 'x') + "del=1/2";
  ASSERT_EQ(144u, line.size());
  zark::test::WriteFile("/tmp/pfProgress", line);
  std::string stage;
  int percentage = 0;
  ASSERT_TRUE(pf->GetPortfwdApplyStatus(stage, percentage));
  EXPECT_EQ(std::string(10, 'x') + "del", stage);
  EXPECT_EQ(25, percentage);
}

TEST_F(ModuleOpsRulesSave, ApplyStatusWithoutFileFails) {
  std::string stage;
  int percentage = 0;
  EXPECT_FALSE(pf->GetPortfwdApplyStatus(stage, percentage));
}

// --- StartPortForwardingStatus ---------------------------------------------

class ModuleOpsSaveStatus : public OpsTest {};

TEST_F(ModuleOpsSaveStatus, FinishedTaskNeverReadsTheProgressFile) {
  zark::test::WriteFile("/tmp/pfProgress", "del=3/6\n");
  Json::Value out;
  ASSERT_TRUE(pf->StartPortForwardingStatus(
      out, TaskRecord(ParseJson(R"({"status": "success", "percentage": 100})"),
                      true)));
  EXPECT_EQ(ParseJson(R"({"status": "success", "percentage": 100})"), out);
}

TEST_F(ModuleOpsSaveStatus, RunningTaskTakesStageAndPercentageFromFile) {
  zark::test::WriteFile("/tmp/pfProgress", "del=6/6\nadd=3/6\n");
  Json::Value out;
  ASSERT_TRUE(pf->StartPortForwardingStatus(
      out,
      TaskRecord(ParseJson(R"({"status": "processing", "percentage": 5})"))));
  EXPECT_EQ(
      ParseJson(
          R"({"stage": "add", "status": "processing", "percentage": 75})"),
      out);
}

TEST_F(ModuleOpsSaveStatus, NegativeCountInTheFileGivesANegativePercentage) {
  zark::test::WriteFile("/tmp/pfProgress", "del=-3/6\n");
  Json::Value out;
  ASSERT_TRUE(pf->StartPortForwardingStatus(
      out,
      TaskRecord(ParseJson(R"({"status": "processing", "percentage": 5})"))));
  EXPECT_EQ(
      ParseJson(
          R"({"stage": "del", "status": "processing", "percentage": -25})"),
      out);
}

TEST_F(ModuleOpsSaveStatus, ErrorStatusIsAlsoOverriddenByTheFile) {
  zark::test::WriteFile("/tmp/pfProgress", "del=3/6");
  Json::Value out;
  ASSERT_TRUE(pf->StartPortForwardingStatus(
      out,
      TaskRecord(ParseJson(R"({"status": "success", "percentage": 99})"))));
  EXPECT_EQ(
      ParseJson(
          R"({"stage": "del", "status": "processing", "percentage": 25})"),
      out);
}

TEST_F(ModuleOpsSaveStatus, EmptyProgressFileIsIgnored) {
  zark::test::WriteFile("/tmp/pfProgress", "");
  Json::Value out;
  ASSERT_TRUE(pf->StartPortForwardingStatus(
      out,
      TaskRecord(ParseJson(R"({"status": "processing", "percentage": 1})"))));
  EXPECT_EQ(ParseJson(R"({"status": "processing", "percentage": 1})"), out);
}

TEST_F(ModuleOpsSaveStatus, MissingProgressFileAnswersTheRecord) {
  Json::Value out;
  ASSERT_TRUE(pf->StartPortForwardingStatus(
      out,
      TaskRecord(ParseJson(R"({"status": "processing", "percentage": 5})"))));
  EXPECT_EQ(ParseJson(R"({"status": "processing", "percentage": 5})"), out);
  EXPECT_TRUE(listener->Answers().empty());
}

TEST_F(ModuleOpsSaveStatus, UnreadableProgressFileReportsError) {
  // A folder has a size but gives a read error.
  ASSERT_EQ(0, mkdir("/tmp/pfProgress", 0755));
  zark::test::WriteFile("/tmp/pfProgress/x", "add=1/2");
  Json::Value out;
  EXPECT_FALSE(pf->StartPortForwardingStatus(
      out,
      TaskRecord(ParseJson(R"({"status": "processing", "percentage": 5})"))));
  EXPECT_THAT(PfLogs(), ElementsAre("get pf apply status failed"));
  EXPECT_THAT(listener->Names(), ElementsAre("error 1500"));
}

TEST_F(ModuleOpsSaveStatus, BadRecordLogsAndReportsError) {
  Json::Value out;
  EXPECT_FALSE(pf->StartPortForwardingStatus(
      out, ParseJson(R"({"finish": false, "success": true})")));
  EXPECT_THAT(PfLogs(), ElementsAre("data does not exist",
                                    "get status and percentage failed"));
  EXPECT_THAT(listener->Names(), ElementsAre("error 1500"));
}

TEST_F(ModuleOpsSaveStatus, NoReporterLogsAndFails) {
  PortForwarding bare(nullptr);
  Json::Value out;
  EXPECT_FALSE(bare.StartPortForwardingStatus(
      out,
      TaskRecord(ParseJson(R"({"status": "processing", "percentage": 5})"))));
  EXPECT_THAT(PfLogs(), ElementsAre("mStatusReportor is NULL"));
}

// --- Task-record readers ---------------------------------------------------

struct ReaderCase {
  const char *record;
  const char *message; // "" when the read succeeds
};

class ModuleOpsGetStatus : public OpsTest,
                           public ::testing::WithParamInterface<ReaderCase> {};

TEST_P(ModuleOpsGetStatus, ChecksTheRecord) {
  std::string status;
  bool ok = pf->GetStatus(status, ParseJson(GetParam().record));
  if (std::string(GetParam().message).empty()) {
    EXPECT_TRUE(ok);
    EXPECT_EQ("begin", status);
    EXPECT_THAT(PfLogs(), IsEmpty());
  } else {
    EXPECT_FALSE(ok);
    EXPECT_THAT(PfLogs(), ElementsAre(GetParam().message));
  }
}

INSTANTIATE_TEST_SUITE_P(
    ModuleOpsRecords, ModuleOpsGetStatus,
    ::testing::Values(
        ReaderCase{R"({"finish": true})", "data does not exist"},
        ReaderCase{R"([1, 2])", "data does not exist"},
        ReaderCase{R"({"data": {"percentage": 1}})", "status does not exist"},
        ReaderCase{R"({"data": "begin"})", "status does not exist"},
        ReaderCase{R"({"data": {"status": 3}})", "status is not string type"},
        ReaderCase{R"({"data": {"status": ""}})", "status shall not be empty"},
        ReaderCase{R"({"data": {"status": "begin"}})", ""}));

class ModuleOpsGetPercentage
    : public OpsTest,
      public ::testing::WithParamInterface<ReaderCase> {};

TEST_P(ModuleOpsGetPercentage, ChecksTheRecord) {
  int percentage = 12345;
  bool ok = pf->GetPercentage(percentage, ParseJson(GetParam().record));
  if (std::string(GetParam().message).empty()) {
    EXPECT_TRUE(ok);
    EXPECT_EQ(40, percentage);
  } else {
    EXPECT_FALSE(ok);
    EXPECT_THAT(PfLogs(), ElementsAre(GetParam().message));
  }
}

INSTANTIATE_TEST_SUITE_P(
    ModuleOpsRecords, ModuleOpsGetPercentage,
    ::testing::Values(ReaderCase{R"({})", "data does not exist"},
                      ReaderCase{R"({"data": {"status": "x"}})",
                                 "percentage does not exist"},
                      ReaderCase{R"({"data": {"percentage": "40"}})",
                                 "percentage is not int type"},
                      ReaderCase{R"({"data": {"percentage": -1}})",
                                 "percentage shall not be negative"},
                      ReaderCase{R"({"data": {"percentage": 40}})", ""}));

TEST_F(ModuleOpsGetPercentage, NegativeValueIsStoredBeforeItIsRefused) {
  int percentage = 12345;
  EXPECT_FALSE(pf->GetPercentage(percentage,
                                 ParseJson(R"({"data": {"percentage": -3}})")));
  EXPECT_EQ(-3, percentage);
}

class ModuleOpsGetStatusAndPercentage
    : public OpsTest,
      public ::testing::WithParamInterface<ReaderCase> {};

TEST_P(ModuleOpsGetStatusAndPercentage, ChecksInOrder) {
  std::string status;
  int percentage = 0;
  bool ok = pf->GetStatusAndPercentage(status, percentage,
                                       ParseJson(GetParam().record));
  if (std::string(GetParam().message).empty()) {
    EXPECT_TRUE(ok);
    EXPECT_EQ("processing", status);
    EXPECT_EQ(0, percentage);
  } else {
    EXPECT_FALSE(ok);
    EXPECT_THAT(PfLogs(), ElementsAre(GetParam().message));
  }
}

INSTANTIATE_TEST_SUITE_P(
    ModuleOpsRecords, ModuleOpsGetStatusAndPercentage,
    ::testing::Values(
        ReaderCase{R"({"success": true})", "data does not exist"},
        ReaderCase{R"({"data": {"percentage": "x"}})", "status does not exist"},
        // Presence of both comes before any type check.
        ReaderCase{R"({"data": {"status": 5}})", "percentage does not exist"},
        ReaderCase{R"({"data": {"status": 5, "percentage": "x"}})",
                   "status is not string type"},
        // Types come before the value checks.
        ReaderCase{R"({"data": {"status": "", "percentage": "x"}})",
                   "percentage is not int type"},
        ReaderCase{R"({"data": {"status": "", "percentage": -1}})",
                   "status shall not be empty"},
        ReaderCase{R"({"data": {"status": "a", "percentage": -1}})",
                   "percentage shall not be negative"},
        ReaderCase{R"({"data": {"status": "processing", "percentage": 0}})",
                   ""}));

} // namespace
} // namespace zark::ops
