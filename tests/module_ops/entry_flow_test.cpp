// The operations reached the way the host reaches them: through the method
// table, with request and response objects, and for background work through
// the polling facility (start, let the task run, poll its status).
#include "ZARK.Core.PortForwarding.h"
#include "ops_test_support.h"

#include <cstring>

namespace zark::ops {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using zark::fake::Fake;
using zark::fake::MakeRule;

ZARK_API_HANDLER Handler(const std::string &api, const std::string &method) {
  for (const ZARK_API_TABLE *row = GetAPITable(); row->szAPI != nullptr;
       ++row) {
    if (api == row->szAPI && method == row->szMethod) {
      return row->handler;
    }
  }
  ADD_FAILURE() << "no method " << api << " " << method;
  return nullptr;
}

class ModuleOpsEntry : public OpsTest {
protected:
  void TearDown() override {
    ZARK::APIPolling::JoinAll();
    OpsTest::TearDown();
  }

  // Runs one method; answer holds what it answered.
  void Call(const std::string &api, const std::string &method,
            const Json::Value &params, ZARK::APIResponse &answer) {
    ZARK_API_HANDLER handler = Handler(api, method);
    ASSERT_NE(nullptr, handler);
    ZARK::APIRequest request(params);
    handler(&request, &answer);
  }

  // Starts a background method, waits for its task to end and polls its
  // status method once; returns the status answer.
  void StartAndPoll(const std::string &api, const std::string &start,
                    const std::string &status, const Json::Value &params,
                    ZARK::APIResponse &answer) {
    ZARK::APIResponse started;
    Call(api, start, params, started);
    ASSERT_TRUE(started.IsSuccess());
    std::string taskId = started.GetData()["task_id"].asString();
    ASSERT_FALSE(taskId.empty());
    ZARK::APIPolling::JoinAll();
    Json::Value poll(Json::objectValue);
    poll["task_id"] = taskId;
    Call(api, status, poll, answer);
  }

  void SetConfText(char *field, const std::string &text) {
    std::snprintf(field, ZARK_PORTMAP_TEXT_SIZE, "%s", text.c_str());
  }
};

TEST_F(ModuleOpsEntry, LoadAnswersTheSavedRules) {
  Fake().savedRules = {MakeRule("1", true, "tcp", "80", "8080")};
  ZARK::APIResponse answer;
  Call("ZARK.Core.PortForwarding.Rules", "load", Json::Value(), answer);
  ASSERT_TRUE(answer.IsSuccess());
  EXPECT_EQ("8080", answer.GetData()[0]["ds_port"].asString());
}

TEST_F(ModuleOpsEntry, FailedLoadAnswers1501WithEmptyArray) {
  Fake().KLibGetRulesArrFromRuleConf = [](int *, ZARK_ROUTER_RULE **, char *,
                                          bool, ZARK_LIBZARKPORTMAP_ERR *err) {
    err->err = ZARK_PORTMAP_ERR_NOT_CONFIGURED;
    return -1;
  };
  ZARK::APIResponse answer;
  Call("ZARK.Core.PortForwarding.Rules", "load", Json::Value(), answer);
  EXPECT_EQ(1501, answer.GetErrorCode());
  EXPECT_EQ(Json::Value(Json::arrayValue), answer.GetErrorData());
}

TEST_F(ModuleOpsEntry, FailedLoadAnswers1500WithEmptyArray) {
  Fake().KLibGetRulesArrFromRuleConf = [](int *, ZARK_ROUTER_RULE **, char *,
                                          bool, ZARK_LIBZARKPORTMAP_ERR *err) {
    err->err = ZARK_PORTMAP_ERR_IO;
    return -1;
  };
  ZARK::APIResponse answer;
  Call("ZARK.Core.PortForwarding.Rules", "load", Json::Value(), answer);
  EXPECT_EQ(1500, answer.GetErrorCode());
  EXPECT_EQ(Json::Value(Json::arrayValue), answer.GetErrorData());
}

TEST_F(ModuleOpsEntry, EmptyRouterDatabaseAnswersError1500) {
  ZARK::APIResponse answer;
  Call("ZARK.Core.PortForwarding.RouterList", "list", Json::Value(), answer);
  EXPECT_EQ(ZARK::APIResponse::State::Error, answer.GetState());
  EXPECT_EQ(1500, answer.GetErrorCode());
}

TEST_F(ModuleOpsEntry, RouterConfSetWithoutPortStoresPort80) {
  Json::Value params = ParseJson(R"({"router_protocol": "http",
      "router_brand": "Acme", "support_upnp": "no", "support_natpmp": "no"})");
  ZARK::APIResponse answer;
  Call("ZARK.Core.PortForwarding.RouterConf", "set", params, answer);
  ASSERT_TRUE(answer.IsSuccess());
  ASSERT_EQ(1u, Fake().storedConfs.size());
  EXPECT_STREQ("80", Fake().storedConfs[0].conn_port);
  EXPECT_STREQ("http", Fake().storedConfs[0].conn_type);
}

TEST_F(ModuleOpsEntry, RouterConfSetEmptyAccountDropsPassword) {
  Json::Value params = ParseJson(R"({"router_protocol": "http",
      "router_port": 8080, "router_account": "", "router_pass": "pw",
      "support_upnp": "no", "support_natpmp": "no"})");
  ZARK::APIResponse answer;
  Call("ZARK.Core.PortForwarding.RouterConf", "set", params, answer);
  ASSERT_TRUE(answer.IsSuccess());
  EXPECT_STREQ("", Fake().storedConfs.at(0).account);
  EXPECT_STREQ("", Fake().storedConfs.at(0).password);
  EXPECT_STREQ("8080", Fake().storedConfs.at(0).conn_port);
}

TEST_F(ModuleOpsEntry, RouterConfSetAbsentAccountLeavesLoginEmpty) {
  Json::Value params = ParseJson(R"({"router_protocol": "http",
      "router_pass": "pw", "support_upnp": "no", "support_natpmp": "no"})");
  ZARK::APIResponse answer;
  Call("ZARK.Core.PortForwarding.RouterConf", "set", params, answer);
  ASSERT_TRUE(answer.IsSuccess());
  EXPECT_STREQ("", Fake().storedConfs.at(0).account);
  EXPECT_STREQ("", Fake().storedConfs.at(0).password);
}

TEST_F(ModuleOpsEntry, RouterConfSetUpnpWithoutProtocolSucceeds) {
  Json::Value params = ParseJson(R"({"router_brand": "Acme",
      "support_upnp": "yes", "support_natpmp": "no"})");
  ZARK::APIResponse answer;
  Call("ZARK.Core.PortForwarding.RouterConf", "set", params, answer);
  ASSERT_TRUE(answer.IsSuccess());
  ASSERT_EQ(1u, Fake().storedConfs.size());
  EXPECT_STREQ("", Fake().storedConfs[0].conn_type);
  EXPECT_STREQ("", Fake().storedConfs[0].conn_port);
}

TEST_F(ModuleOpsEntry, RouterConfSetWithoutProtocolFails1500) {
  Json::Value params =
      ParseJson(R"({"support_upnp": "no", "support_natpmp": "no"})");
  ZARK::APIResponse answer;
  Call("ZARK.Core.PortForwarding.RouterConf", "set", params, answer);
  EXPECT_EQ(1500, answer.GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("conntype shall not be empty",
                                    "set router conf failed"));
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibSetRouterConf"));
}

TEST_F(ModuleOpsEntry, RouterConfGetAnswersPortAndMaxRuleAsStrings) {
  SetConfText(Fake().routerConf.conn_port, "80");
  SetConfText(Fake().routerConf.max_rule, "16");
  ZARK::APIResponse answer;
  Call("ZARK.Core.PortForwarding.RouterConf", "get", Json::Value(), answer);
  ASSERT_TRUE(answer.IsSuccess());
  EXPECT_EQ(Json::Value("80"), answer.GetData()["router_port"]);
  EXPECT_EQ(Json::Value("16"), answer.GetData()["router_max_rule"]);
}

TEST_F(ModuleOpsEntry, RouterConfGetNotConfiguredAnswers1501Silently) {
  Fake().KLibGetRouterConf = [](const char *, ZARK_ROUTER_CONF *,
                                ZARK_LIBZARKPORTMAP_ERR *err, bool) {
    err->err = ZARK_PORTMAP_ERR_NOT_CONFIGURED;
    return -1;
  };
  ZARK::APIResponse answer;
  Call("ZARK.Core.PortForwarding.RouterConf", "get", Json::Value(), answer);
  EXPECT_EQ(1501, answer.GetErrorCode());
  EXPECT_THAT(PfLogs(), IsEmpty());
}

TEST_F(ModuleOpsEntry, CurrentProcessAnswersNoneForUnknownTask) {
  Fake().KLibGetLibZarkPortMapRunningTask = [](ZARK_LIBZARKPORTMAP_TASK *t) {
    t->task = 3;
    return 0;
  };
  ZARK::APIResponse answer;
  Call("ZARK.Core.PortForwarding", "get_current_process", Json::Value(),
       answer);
  ASSERT_TRUE(answer.IsSuccess());
  EXPECT_EQ(ParseJson(R"({"process": "none"})"), answer.GetData());
}

TEST_F(ModuleOpsEntry, UploadFailureAnswers1500) {
  Fake().KLibUploadTestUpnpCompatibilityFailResult = [] { return -1; };
  ZARK::APIResponse answer;
  Call("ZARK.Core.PortForwarding.Compatibility", "upload", Json::Value(),
       answer);
  EXPECT_EQ(1500, answer.GetErrorCode());
}

// --- Background work through the polling facility ----------------------------

TEST_F(ModuleOpsEntry, SavedRulesTaskEndsSuccessAndStatusSaysSo) {
  Json::Value params = ParseJson(R"({"rules": [{"rule_id": "1",
      "enable": true, "router_protocol": "tcp", "router_port": "80",
      "ds_port": "80"}]})");
  ZARK::APIResponse answer;
  StartAndPoll("ZARK.Core.PortForwarding.Rules", "save", "save_status", params,
               answer);
  ASSERT_TRUE(answer.IsSuccess());
  EXPECT_EQ(ParseJson(R"({"status": "success", "percentage": 100})"),
            answer.GetData());
  EXPECT_EQ(1u, Fake().lastSavedRules.size());
}

TEST_F(ModuleOpsEntry, SaveTaskWithFailedLockIsAnswered1501) {
  Fake().KLibZarkPortMapLock = [] { return -1; };
  Json::Value params = ParseJson(R"({"rules": []})");
  ZARK::APIResponse answer;
  StartAndPoll("ZARK.Core.PortForwarding.Rules", "save", "save_status", params,
               answer);
  EXPECT_EQ(1501, answer.GetErrorCode());
  EXPECT_THAT(zark::fake::CallNames(),
              ElementsAre("KLibZarkPortMapLock", "KLibZarkPortMapUnLock"));
}

TEST_F(ModuleOpsEntry, SaveTaskRefusedByLibraryPassesLimitsOn) {
  Fake().KLibSaveRules = [](const char *, int, ZARK_ROUTER_RULE *, bool,
                            ZARK_ROUTER_SAVE_RULE_RESULT *result,
                            ZARK_SAVE_RULE_PROGRESS_CB, void *) {
    result->errType = ZARK_SAVE_ERR_RANGE_TOO_LONG;
    result->detail.limit.maxPort = 10;
    result->detail.limit.maxRange = 20;
    return -1;
  };
  Json::Value params = ParseJson(R"({"rules": []})");
  ZARK::APIResponse answer;
  StartAndPoll("ZARK.Core.PortForwarding.Rules", "save", "save_status", params,
               answer);
  EXPECT_EQ(1523, answer.GetErrorCode());
  EXPECT_EQ(ParseJson(R"({"sec": "", "key": "",
      "append": {"max_port": 10, "max_range": 20}})"),
            answer.GetErrorData());
}

TEST_F(ModuleOpsEntry, PortTestTaskEndsWithResultsFromTheFile) {
  Fake().savedRules = {MakeRule("1", true, "tcp", "80", "80")};
  Fake().KLibTestRules = [](int, ZARK_ROUTER_RULE *, ZARK_LIBZARKPORTMAP_ERR *,
                            bool) {
    zark::test::WriteFile("/tmp/pfStatusRule", "1=ok\n");
    return 0;
  };
  ZARK::APIResponse answer;
  StartAndPoll("ZARK.Core.PortForwarding.Rules", "test", "test_status",
               Json::Value(Json::objectValue), answer);
  ASSERT_TRUE(answer.IsSuccess());
  EXPECT_EQ(ParseJson(R"({"status": "success", "rules": {"1": "ok"}})"),
            answer.GetData());
}

TEST_F(ModuleOpsEntry, DetectTaskEndsWithTheWholeRecord) {
  std::snprintf(Fake().detectResult.router_brand, ZARK_PORTMAP_TEXT_SIZE, "%s",
                "Netco");
  Fake().detectResult.support_upnp = 1;
  ZARK::APIResponse answer;
  StartAndPoll("ZARK.Core.PortForwarding", "detect", "detect_status",
               Json::Value(Json::objectValue), answer);
  ASSERT_TRUE(answer.IsSuccess());
  Json::Value data = answer.GetData();
  EXPECT_EQ("success", data["status"].asString());
  EXPECT_EQ(100, data["percentage"].asInt());
  EXPECT_EQ("Netco", data["router_brand"].asString());
  EXPECT_EQ("yes", data["support_upnp"].asString());
  EXPECT_EQ("success", data["progress"]["detect_router_step"]["status"]);
}

TEST_F(ModuleOpsEntry, CompatibilityTaskStatusComesFromTheProgressFile) {
  Fake().KLibTestUpnpCompatibility =
      [](int, ZARK_ROUTER_TEST_COMPATIBILITY_RESULT *,
         ZARK_TEST_COMPATIBILITY_PROGRESS_CB, void *, bool) {
        zark::test::WriteFile("/tmp/upnp_test.progress",
                              "upnp_add=finished\nupnp_max=12\n");
        return 0;
      };
  ZARK::APIResponse answer;
  StartAndPoll("ZARK.Core.PortForwarding.Compatibility", "test", "test_status",
               Json::Value(Json::objectValue), answer);
  ASSERT_TRUE(answer.IsSuccess());
  EXPECT_EQ("processing", answer.GetData()["status"].asString());
  EXPECT_EQ(36, answer.GetData()["percentage"].asInt());
  EXPECT_EQ(5u, answer.GetData()["test"].size());
}

} // namespace
} // namespace zark::ops
