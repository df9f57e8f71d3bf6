// The port connection test under the port-map lock, and its status answer
// read from the per-rule results file.
#include "ops_test_support.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>

namespace zark::ops {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using zark::fake::Fake;
using zark::fake::MakeRule;

Json::Value Selection(const std::string &text) {
  Json::Value params(Json::objectValue);
  params["selection"] = text;
  return params;
}

class ModuleOpsPortTest : public OpsTest {
protected:
  void SetUp() override {
    OpsTest::SetUp();
    Trace(Fake().KLibZarkPortMapLock, "Lock");
    Trace(Fake().KLibZarkPortMapUnLock, "UnLock");
    Trace(Fake().KLibGetRulesArrFromRuleConf, "GetRules");
    Trace(Fake().KLibGetRulesArrFromTestRuleConf, "GetTestRules");
    Trace(Fake().KLibGetGatewayIP, "GetGatewayIP");
    Trace(Fake().ZARKIGetExternalIP, "GetExternalIP");
    Trace(Fake().KLibTestRulesInit, "TestRulesInit");
    Trace(Fake().KLibTestRules, "TestRules");
    Fake().savedRules = {MakeRule("1", true, "tcp", "80", "80"),
                         MakeRule("2", true, "udp", "53", "53")};
  }

  // Replaces a fake call and keeps it on the timeline.
  template <typename R, typename... A, typename F>
  void Replace(std::function<R(A...)> &fn, const std::string &name, F f) {
    fn = f;
    Trace(fn, name);
  }
};

TEST_F(ModuleOpsPortTest, SavedRulesAreTestedInOrder) {
  pf->TestPortConnection(Selection(""));
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("Lock", "status prepare 0", "GetRules",
                          "GetGatewayIP", "GetExternalIP", "TestRulesInit",
                          "status begin 0", "TestRules", "status finish 0",
                          "UnLock"));
  EXPECT_EQ(ZARK::APIResponse::State::Success, response.GetState());
  EXPECT_EQ(ParseJson(R"({"status": "finish", "percentage": 0})"),
            response.GetData());
  EXPECT_THAT(PfLogs(), IsEmpty());
}

TEST_F(ModuleOpsPortTest, LibraryCallsGetTheirArguments) {
  pf->TestPortConnection(Selection(""));
  for (const auto &call : zark::fake::Calls()) {
    if (call.name == "KLibGetRulesArrFromRuleConf") {
      EXPECT_THAT(call.args, ElementsAre("(null)", "false", "(null)"));
    } else if (call.name == "KLibTestRules") {
      EXPECT_THAT(call.args, ElementsAre("2", "false"));
    } else if (call.name == "KLibGetGatewayIP") {
      EXPECT_THAT(call.args, ElementsAre("1024"));
    }
  }
  EXPECT_EQ(1u, zark::fake::CountCalls("KLibFreeRulesArr"));
}

TEST_F(ModuleOpsPortTest, SelectionNamesTheConfigurationToTest) {
  pf->TestPortConnection(Selection("/etc/portforward/other.conf"));
  auto calls = zark::fake::Calls();
  ASSERT_GE(calls.size(), 2u);
  EXPECT_EQ("KLibGetRulesArrFromRuleConf", calls[1].name);
  EXPECT_EQ("/etc/portforward/other.conf", calls[1].args[0]);
}

TEST_F(ModuleOpsPortTest, SelectionLongerThan1023CharactersIsCut) {
  std::string selection = "/tmp/" + std::string(1500, 'r');
  pf->TestPortConnection(Selection(selection));
  auto calls = zark::fake::Calls();
  ASSERT_GE(calls.size(), 2u);
  EXPECT_EQ(selection.substr(0, 1023), calls[1].args[0]);
}

TEST_F(ModuleOpsPortTest, FailedLockReportsTwiceAndStillUnlocks) {
  Replace(Fake().KLibZarkPortMapLock, "Lock", [] { return -1; });
  pf->TestPortConnection(Selection(""));
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("Lock", "error 1501", "error 1501", "UnLock"));
  EXPECT_THAT(zark::fake::CallNames(),
              ElementsAre("KLibZarkPortMapLock", "KLibZarkPortMapUnLock"));
  EXPECT_EQ(1501, response.GetErrorCode());
  EXPECT_THAT(PfLogs(), IsEmpty());
}

TEST_F(ModuleOpsPortTest, NoReporterStillUnlocks) {
  PortForwarding bare(nullptr);
  bare.TestPortConnection(Selection(""));
  EXPECT_THAT(PfLogs(), ElementsAre("status reportor shall not be NULL"));
  EXPECT_THAT(zark::fake::CallNames(), ElementsAre("KLibZarkPortMapUnLock"));
}

TEST_F(ModuleOpsPortTest, RuleConfigurationUnreadableFails) {
  Replace(Fake().KLibGetRulesArrFromRuleConf, "GetRules",
          [](int *, ZARK_ROUTER_RULE **, char *, bool,
             ZARK_LIBZARKPORTMAP_ERR *) { return -1; });
  pf->TestPortConnection(Selection(""));
  EXPECT_THAT(PfLogs(), ElementsAre("GetRulesFromRuleConf() failed"));
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("Lock", "status prepare 0", "GetRules", "error 1500",
                          "UnLock"));
}

TEST_F(ModuleOpsPortTest, NoRulesFinishesWithoutAddresses) {
  Fake().savedRules.clear();
  pf->TestPortConnection(Selection(""));
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("Lock", "status prepare 0", "GetRules",
                          "status finish 0", "UnLock"));
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibGetGatewayIP"));
  EXPECT_EQ(0u, zark::fake::CountCalls("ZARKIGetExternalIP"));
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibFreeRulesArr"));
}

TEST_F(ModuleOpsPortTest, UnknownGatewayAnswers1503) {
  Replace(Fake().KLibGetGatewayIP, "GetGatewayIP",
          [](char *, int) { return -1; });
  pf->TestPortConnection(Selection(""));
  EXPECT_THAT(PfLogs(), ElementsAre("unable to get gateway ip"));
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("Lock", "status prepare 0", "GetRules",
                          "GetGatewayIP", "error 1503", "UnLock"));
  EXPECT_EQ(1u, zark::fake::CountCalls("KLibFreeRulesArr"));
}

TEST_F(ModuleOpsPortTest, UnknownExternalAddressAnswers1502) {
  Replace(Fake().ZARKIGetExternalIP, "GetExternalIP",
          []() -> uint32_t { return 0; });
  pf->TestPortConnection(Selection(""));
  EXPECT_THAT(PfLogs(), ElementsAre("unable to get external ip"));
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("Lock", "status prepare 0", "GetRules",
                          "GetGatewayIP", "GetExternalIP", "error 1502",
                          "UnLock"));
}

TEST_F(ModuleOpsPortTest, TestInitFailureAnswers1500) {
  Replace(Fake().KLibTestRulesInit, "TestRulesInit", [] { return -1; });
  pf->TestPortConnection(Selection(""));
  EXPECT_THAT(PfLogs(), ElementsAre("KLibTestRulesInit() failed"));
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("Lock", "status prepare 0", "GetRules",
                          "GetGatewayIP", "GetExternalIP", "TestRulesInit",
                          "error 1500", "UnLock"));
}

TEST_F(ModuleOpsPortTest, TestFailureAnswers1500AfterBegin) {
  Replace(Fake().KLibTestRules, "TestRules",
          [](int, ZARK_ROUTER_RULE *, ZARK_LIBZARKPORTMAP_ERR *, bool) {
            return -1;
          });
  pf->TestPortConnection(Selection(""));
  EXPECT_THAT(PfLogs(), ElementsAre("KLibTestRules() failed"));
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("Lock", "status prepare 0", "GetRules",
                          "GetGatewayIP", "GetExternalIP", "TestRulesInit",
                          "status begin 0", "TestRules", "error 1500",
                          "UnLock"));
  EXPECT_EQ(1500, response.GetErrorCode());
}

TEST_F(ModuleOpsPortTest, NeitherSelectionNorServicesFails) {
  Json::Value params(Json::objectValue);
  params["selection"] = Json::Value();
  pf->TestPortConnection(params);
  EXPECT_THAT(PfLogs(), ElementsAre("JSON::Value in foramt fail"));
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("Lock", "status prepare 0", "error 1500", "UnLock"));
}

// Through RouterRuleServHandler::SetServPfTestRules: a number is neither an
// array nor a string of service ids.
TEST_F(ModuleOpsPortTest, ServicesThatCannotBeWrittenFail) {
  Json::Value params(Json::objectValue);
  params["service_id"] = 5;
  pf->TestPortConnection(params);
  EXPECT_THAT(PfLogs(), ElementsAre("SetServPfTestRules failed"));
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibGetRulesArrFromTestRuleConf"));
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("Lock", "status prepare 0", "error 1500", "UnLock"));
}

// Through RouterRuleServHandler::SetServPfTestRules and the firewall
// service table: the service test rules are written, then read back through
// the library.
TEST_F(ModuleOpsPortTest, ServicesAreTestedFromTheTestRuleConfiguration) {
  WriteSystemService();
  Fake().testRules = {MakeRule("svc.tcp", true, "tcp", "5000", "5000", "svc")};
  Json::Value params(Json::objectValue);
  params["service_id"] = Json::Value(Json::arrayValue);
  params["service_id"].append("svc");
  pf->TestPortConnection(params);
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("Lock", "status prepare 0", "GetTestRules",
                          "GetGatewayIP", "GetExternalIP", "TestRulesInit",
                          "status begin 0", "TestRules", "status finish 0",
                          "UnLock"));
  for (const auto &call : zark::fake::Calls()) {
    if (call.name == "KLibGetRulesArrFromTestRuleConf") {
      EXPECT_THAT(call.args, ElementsAre("(null)", "false", "(null)"));
    }
    if (call.name == "KLibTestRules") {
      EXPECT_EQ("1", call.args[0]);
    }
  }
  // The handler wrote the service's test rule where the library reads it.
  std::string written = zark::test::ReadFile("/etc/portforward/testrule.conf");
  EXPECT_NE(std::string::npos, written.find("svc.tcp")) << written;
}

// Through RouterRuleServHandler::SetServPfTestRules (success path).
TEST_F(ModuleOpsPortTest, TestRuleConfigurationUnreadableFails) {
  WriteSystemService();
  Replace(Fake().KLibGetRulesArrFromTestRuleConf, "GetTestRules",
          [](int *, ZARK_ROUTER_RULE **, char *, bool,
             ZARK_LIBZARKPORTMAP_ERR *) { return -1; });
  Json::Value params(Json::objectValue);
  params["service_id"] = "svc";
  pf->TestPortConnection(params);
  EXPECT_THAT(PfLogs(), ElementsAre("GetRulesFromTestRuleConf() failed"));
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("Lock", "status prepare 0", "GetTestRules",
                          "error 1500", "UnLock"));
}

// --- TestPortConnectionStatus ----------------------------------------------

class ModuleOpsPortTestStatus : public OpsTest {
protected:
  Json::Value Record(const std::string &status) {
    Json::Value data(Json::objectValue);
    data["status"] = status;
    data["percentage"] = 0;
    return TaskRecord(data);
  }
};

TEST_F(ModuleOpsPortTestStatus, ResultsFileLinesBecomeRules) {
  zark::test::WriteFile("/tmp/pfStatusRule", "1=ok\n2=\njunk\n");
  Json::Value out;
  ASSERT_TRUE(pf->TestPortConnectionStatus(out, Record("begin")));
  EXPECT_EQ(
      ParseJson(
          R"({"status": "update", "rules": {"1": "ok", "2": "testing"}})"),
      out);
}

TEST_F(ModuleOpsPortTestStatus, FinishAnswersSuccessWithRules) {
  zark::test::WriteFile("/tmp/pfStatusRule", "a=open\nb=closed");
  Json::Value out;
  ASSERT_TRUE(pf->TestPortConnectionStatus(out, Record("finish")));
  EXPECT_EQ(
      ParseJson(
          R"({"status": "success", "rules": {"a": "open", "b": "closed"}})"),
      out);
}

TEST_F(ModuleOpsPortTestStatus, PrepareAnswersWaitWithoutRulesDespiteOldFile) {
  zark::test::WriteFile("/tmp/pfStatusRule", "1=ok\n");
  Json::Value out;
  ASSERT_TRUE(pf->TestPortConnectionStatus(out, Record("prepare")));
  EXPECT_EQ(ParseJson(R"({"status": "wait"})"), out);
}

TEST_F(ModuleOpsPortTestStatus, LaterLineWinsAndOnlyTheFirstEqualSplits) {
  zark::test::WriteFile("/tmp/pfStatusRule", "1=first\n1=second\n2=a=b\n");
  Json::Value out;
  ASSERT_TRUE(pf->TestPortConnectionStatus(out, Record("finish")));
  EXPECT_EQ(ParseJson(R"({"1": "second", "2": "a=b"})"), out["rules"]);
}

TEST_F(ModuleOpsPortTestStatus, FileWithoutUsableLineGivesEmptyRules) {
  zark::test::WriteFile("/tmp/pfStatusRule", "junk\n\n");
  Json::Value out;
  ASSERT_TRUE(pf->TestPortConnectionStatus(out, Record("begin")));
  ASSERT_TRUE(out["rules"].isObject());
  EXPECT_EQ(0u, out["rules"].size());
}

TEST_F(ModuleOpsPortTestStatus, UnsupportedStatusIsRefused) {
  zark::test::WriteFile("/tmp/pfStatusRule", "1=ok\n");
  Json::Value out;
  EXPECT_FALSE(pf->TestPortConnectionStatus(out, Record("running")));
  EXPECT_THAT(PfLogs(), ElementsAre("no supported status=running"));
  EXPECT_FALSE(out.isMember("status"));
}

TEST_F(ModuleOpsPortTestStatus, BadRecordIsRefused) {
  Json::Value out;
  EXPECT_FALSE(pf->TestPortConnectionStatus(
      out, ParseJson(R"({"data": {"percentage": 0}})")));
  EXPECT_THAT(PfLogs(), ElementsAre("status does not exist",
                                    "get status and percentage failed"));
}

TEST_F(ModuleOpsPortTestStatus, MissingFileDuringBeginFails) {
  Json::Value out;
  EXPECT_FALSE(pf->TestPortConnectionStatus(out, Record("begin")));
  EXPECT_THAT(PfLogs(),
              ElementsAre("finished but no status file=/tmp/pfStatusRule"));
}

TEST_F(ModuleOpsPortTestStatus, MissingFileAfterFinishFails) {
  Json::Value out;
  EXPECT_FALSE(pf->TestPortConnectionStatus(out, Record("finish")));
  EXPECT_THAT(PfLogs(),
              ElementsAre("finished but no status file=/tmp/pfStatusRule"));
}

TEST_F(ModuleOpsPortTestStatus, FileThatCannotBeOpenedLogsAtInfoPriority) {
  // A socket exists but cannot be opened as a file, even by root.
  int fd = socket(AF_UNIX, SOCK_STREAM, 0);
  ASSERT_GE(fd, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strcpy(addr.sun_path, "/tmp/pfStatusRule");
  ASSERT_EQ(0, bind(fd, reinterpret_cast<sockaddr *>(&addr), sizeof(addr)));
  Json::Value out;
  EXPECT_FALSE(pf->TestPortConnectionStatus(out, Record("finish")));
  close(fd);
  EXPECT_THAT(PfLogs(LOG_INFO),
              ElementsAre("can't open status file=/tmp/pfStatusRule"));
  EXPECT_THAT(PfLogs(LOG_ERR), IsEmpty());
}

} // namespace
} // namespace zark::ops
