// The method table as linked into a process, and the synchronous entries:
// their frame, the router configuration "set", the compatibility "stop",
// the service "check" and the rule "load" answers.
#include "StatusReportor.h"
#include "alloc_tracker.h"
#include "file_exist_probe.h"
#include "module_fixture.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <set>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace {

using namespace zark::moduletest;
using zark::fake::CallNames;
using zark::fake::CountCalls;
using zark::fake::Fake;
using State = ZARK::APIResponse::State;

// The 20 methods in table order.
const std::pair<const char *, const char *> kExpectedRows[] = {
    {"ZARK.Core.PortForwarding", "detect"},
    {"ZARK.Core.PortForwarding", "detect_status"},
    {"ZARK.Core.PortForwarding", "get_current_process"},
    {"ZARK.Core.PortForwarding.RouterConf", "set"},
    {"ZARK.Core.PortForwarding.RouterConf", "get"},
    {"ZARK.Core.PortForwarding.RouterList", "get"},
    {"ZARK.Core.PortForwarding.RouterList", "list"},
    {"ZARK.Core.PortForwarding.RouterList", "update"},
    {"ZARK.Core.PortForwarding.Rules", "save"},
    {"ZARK.Core.PortForwarding.Rules", "save_status"},
    {"ZARK.Core.PortForwarding.Rules", "load"},
    {"ZARK.Core.PortForwarding.Rules", "test"},
    {"ZARK.Core.PortForwarding.Rules", "test_status"},
    {"ZARK.Core.PortForwarding.Compatibility", "test"},
    {"ZARK.Core.PortForwarding.Rules.Serv", "check"},
    {"ZARK.Core.PortForwarding.Rules.Serv", "test"},
    {"ZARK.Core.PortForwarding.Rules.Serv", "test_status"},
    {"ZARK.Core.PortForwarding.Compatibility", "test_status"},
    {"ZARK.Core.PortForwarding.Compatibility", "stop"},
    {"ZARK.Core.PortForwarding.Compatibility", "upload"},
};

// Rows of the synchronous frame (their failure answers the reporter's code).
const std::pair<const char *, const char *> kSyncRows[] = {
    {"ZARK.Core.PortForwarding", "get_current_process"},
    {"ZARK.Core.PortForwarding.RouterConf", "set"},
    {"ZARK.Core.PortForwarding.RouterConf", "get"},
    {"ZARK.Core.PortForwarding.RouterList", "get"},
    {"ZARK.Core.PortForwarding.RouterList", "list"},
    {"ZARK.Core.PortForwarding.RouterList", "update"},
    {"ZARK.Core.PortForwarding.Rules", "load"},
    {"ZARK.Core.PortForwarding.Compatibility", "stop"},
    {"ZARK.Core.PortForwarding.Compatibility", "upload"},
};

// --- Method table -----------------------------------------------------------

TEST(ModuleTable, TwentyRowsInOrderThenAllZeroRow) {
  const ZARK_API_TABLE *table = GetAPITable();
  ASSERT_EQ(table, &gTable[0]);
  int rows = 0;
  while (rows <= 20 && table[rows].szAPI != nullptr) {
    ++rows;
  }
  ASSERT_EQ(rows, 20);
  for (int i = 0; i < 20; ++i) {
    EXPECT_STREQ(table[i].szAPI, kExpectedRows[i].first) << "row " << i + 1;
    EXPECT_STREQ(table[i].szMethod, kExpectedRows[i].second) << "row " << i + 1;
    EXPECT_EQ(table[i].version, 1) << "row " << i + 1;
    EXPECT_NE(table[i].handler, nullptr) << "row " << i + 1;
  }
  const ZARK_API_TABLE &end = table[20];
  EXPECT_EQ(end.szAPI, nullptr);
  EXPECT_EQ(end.version, 0);
  EXPECT_EQ(end.szMethod, nullptr);
  EXPECT_EQ(end.handler, nullptr);
}

TEST(ModuleTable, EveryRowHasItsOwnEntryFunction) {
  std::set<ZARK_API_HANDLER> handlers;
  for (const ZARK_API_TABLE *row = GetAPITable(); row->szAPI; ++row) {
    EXPECT_TRUE(handlers.insert(row->handler).second)
        << row->szAPI << " " << row->szMethod << " shares its entry";
  }
  EXPECT_EQ(handlers.size(), 20u);
}

// The module asks once, while it is loaded, whether the UPnP test's debug
// archive is on the device; no request asks again.
TEST(ModuleLoadFlag, DebugArchiveIsCheckedOnceAtLoad) {
  std::vector<FileExistCall> calls = FileExistCalls();
  int atLoad = 0;
  for (const FileExistCall &call : calls) {
    if (call.path == "/etc/portforward/dbg_test.tgz") {
      ++atLoad;
      EXPECT_TRUE(call.beforeNamespace) << "asked while loading, before main";
    }
  }
  EXPECT_EQ(atLoad, 1);

  ClearFileExistCalls();
  zark::fake::Reset();
  ZARK::APIRequest request;
  for (const char *method : {"upload", "stop"}) {
    ZARK::APIResponse response;
    CallMethod(kApiCompatibility, method, &request, &response);
  }
  for (const FileExistCall &call : FileExistCalls()) {
    EXPECT_NE(call.path, "/etc/portforward/dbg_test.tgz");
  }
  RemoveAllTasks();
}

// --- The synchronous frame --------------------------------------------------

class ModuleSyncEntry : public ModuleFixture {};

TEST_F(ModuleSyncEntry, NullRequestAnswers1500AndCallsNothing) {
  for (const auto &[api, method] : kSyncRows) {
    zark::fake::Reset();
    zark::test::ClearLogs();
    ZARK::APIResponse response;
    CallMethod(api, method, nullptr, &response);
    EXPECT_EQ(response.GetState(), State::Error) << api << " " << method;
    EXPECT_EQ(response.GetErrorCode(), 1500) << api << " " << method;
    EXPECT_TRUE(response.GetErrorData().isNull()) << api << " " << method;
    EXPECT_EQ(CountLogs(kModuleFile, "req or resp is not valid"), 1)
        << api << " " << method << "\n"
        << DumpLogs();
    EXPECT_TRUE(CallNames().empty()) << api << " " << method;
  }
}

TEST_F(ModuleSyncEntry, NullResponseOnlyLogs) {
  for (const auto &[api, method] : kSyncRows) {
    zark::fake::Reset();
    zark::test::ClearLogs();
    ZARK::APIRequest request;
    CallMethod(api, method, &request, nullptr);
    EXPECT_EQ(CountLogs(kModuleFile, "req or resp is not valid"), 1)
        << api << " " << method << "\n"
        << DumpLogs();
    EXPECT_TRUE(CallNames().empty()) << api << " " << method;
  }
}

TEST_F(ModuleSyncEntry, BothNullOnlyLogs) {
  for (const auto &[api, method] : kSyncRows) {
    zark::test::ClearLogs();
    CallMethod(api, method, nullptr, nullptr);
    EXPECT_EQ(CountLogs(kModuleFile, "req or resp is not valid"), 1)
        << api << " " << method << "\n"
        << DumpLogs();
  }
  EXPECT_TRUE(CallNames().empty());
}

TEST_F(ModuleSyncEntry, SuccessAnswersTheOperationResult) {
  Fake().KLibGetLibZarkPortMapRunningTask = [](ZARK_LIBZARKPORTMAP_TASK *task) {
    task->task = 2;
    return 0;
  };
  Answer answer =
      Invoke(kApiPortForwarding, "get_current_process", Json::Value());
  EXPECT_EQ(answer.state, State::Success);
  EXPECT_EQ(answer.data, ParseJson(R"({"process": "portforwarding"})"));
}

TEST_F(ModuleSyncEntry, FailureWithoutCodeAnswers1500) {
  Fake().KLibUploadTestUpnpCompatibilityFailResult = [] { return -1; };
  Answer answer = Invoke(kApiCompatibility, "upload", Json::Value());
  EXPECT_EQ(answer.state, State::Error);
  EXPECT_EQ(answer.code, 1500);
  EXPECT_TRUE(answer.errorData.isNull());
  EXPECT_EQ(CountCalls("KLibUploadTestUpnpCompatibilityFailResult"), 1u);
}

TEST_F(ModuleSyncEntry, FailedCurrentProcessAnswers1500WithoutProcess) {
  Fake().KLibGetLibZarkPortMapRunningTask = [](ZARK_LIBZARKPORTMAP_TASK *) {
    return -1;
  };
  Answer answer =
      Invoke(kApiPortForwarding, "get_current_process", Json::Value());
  EXPECT_EQ(answer.state, State::Error);
  EXPECT_EQ(answer.code, 1500);
  EXPECT_FALSE(answer.errorData.isMember("process"));
}

TEST_F(ModuleSyncEntry, FailureAnswersTheCodeTheOperationLeft) {
  Fake().KLibGetGatewayIP = [](char *, int) { return -1; };
  Answer answer = Invoke(kApiRouterConf, "get", Json::Value());
  EXPECT_EQ(answer.state, State::Error);
  EXPECT_EQ(answer.code, 1503);
}

TEST_F(ModuleSyncEntry, ExceptionPassesThroughAndReleasesTheReporter) {
  TrackAllocationsOfSize(sizeof(StatusReportor));
  Fake().KLibGetRulesArrFromRuleConf = [](int *, ZARK_ROUTER_RULE **, char *,
                                          bool,
                                          ZARK_LIBZARKPORTMAP_ERR *) -> int {
    throw std::out_of_range("bitset::test");
  };
  ZARK::APIRequest request;
  ZARK::APIResponse response;
  EXPECT_THROW(CallMethod(kApiRules, "load", &request, &response),
               std::out_of_range);
  EXPECT_GE(TrackedAllocations(), 1) << "the request's reporter was made";
  EXPECT_EQ(LiveTrackedBlocks(), 0) << "and deleted while the exception passed";
  EXPECT_FALSE(response.IsAnswered());
}

TEST_F(ModuleSyncEntry, ReporterIsReleasedOnEveryAnsweredPath) {
  TrackAllocationsOfSize(sizeof(StatusReportor));
  ZARK::APIRequest request;
  {
    ZARK::APIResponse response;
    CallMethod(kApiRules, "load", &request, &response);
    EXPECT_EQ(response.GetState(), State::Success);
  }
  Fake().KLibUploadTestUpnpCompatibilityFailResult = [] { return -1; };
  {
    ZARK::APIResponse response;
    CallMethod(kApiCompatibility, "upload", &request, &response);
    EXPECT_EQ(response.GetState(), State::Error);
  }
  {
    ZARK::APIResponse response;
    CallMethod(kApiCompatibility, "upload", nullptr, &response);
  }
  EXPECT_GE(TrackedAllocations(), 3);
  EXPECT_EQ(LiveTrackedBlocks(), 0);
}

// --- Rules load, end to end -------------------------------------------------

class ModuleRulesLoad : public ModuleFixture {};

TEST_F(ModuleRulesLoad, AnswersSavedRulesAsArray) {
  Fake().savedRules = {
      zark::fake::MakeRule("1", true, "tcp", "8080", "80", "web", "Web"),
      zark::fake::MakeRule("2", false, "udp", "1000-1010", "2000-2010"),
  };
  Answer answer = Invoke(kApiRules, "load", Json::Value());
  ASSERT_EQ(answer.state, State::Success);
  EXPECT_EQ(answer.data, ParseJson(R"([
      {"enable": true, "rule_id": "1", "router_protocol": "tcp",
       "router_port": "8080", "ds_port": "80", "serviceid": "web",
       "service_name": "Web"},
      {"enable": false, "rule_id": "2", "router_protocol": "udp",
       "router_port": "1000-1010", "ds_port": "2000-2010", "serviceid": "",
       "service_name": ""}])"));
  EXPECT_EQ(CountCalls("KLibFreeRulesArr"), 1u);
}

TEST_F(ModuleRulesLoad, EmptyConfigurationAnswersEmptyArray) {
  Answer answer = Invoke(kApiRules, "load", Json::Value());
  ASSERT_EQ(answer.state, State::Success);
  EXPECT_TRUE(answer.data.isArray());
  EXPECT_EQ(answer.data.size(), 0u);
}

TEST_F(ModuleRulesLoad, LibraryErrorTwoAnswers1501WithEmptyArray) {
  Fake().KLibGetRulesArrFromRuleConf = [](int *, ZARK_ROUTER_RULE **rules,
                                          char *, bool,
                                          ZARK_LIBZARKPORTMAP_ERR *err) {
    *rules = nullptr;
    if (err) {
      err->err = 2;
    }
    return -1;
  };
  Answer answer = Invoke(kApiRules, "load", Json::Value());
  ASSERT_EQ(answer.state, State::Error);
  EXPECT_EQ(answer.code, 1501);
  EXPECT_TRUE(answer.errorData.isArray());
  EXPECT_EQ(answer.errorData.size(), 0u);
  EXPECT_EQ(CountLogs(kPortForwardingFile, "KLibGetRulesByRuleConf() failed"),
            1)
      << DumpLogs();
}

TEST_F(ModuleRulesLoad, OtherLibraryErrorAnswers1500WithEmptyArray) {
  Fake().KLibGetRulesArrFromRuleConf = [](int *, ZARK_ROUTER_RULE **rules,
                                          char *, bool,
                                          ZARK_LIBZARKPORTMAP_ERR *err) {
    *rules = nullptr;
    if (err) {
      err->err = 4;
    }
    return -1;
  };
  Answer answer = Invoke(kApiRules, "load", Json::Value());
  ASSERT_EQ(answer.state, State::Error);
  EXPECT_EQ(answer.code, 1500);
  EXPECT_TRUE(answer.errorData.isArray());
  EXPECT_EQ(answer.errorData.size(), 0u);
}

TEST_F(ModuleRulesLoad, NullRequestAnswers1500WithoutLoading) {
  ZARK::APIResponse response;
  CallMethod(kApiRules, "load", nullptr, &response);
  EXPECT_EQ(response.GetErrorCode(), 1500);
  EXPECT_EQ(CountCalls("KLibGetRulesArrFromRuleConf"), 0u);
  EXPECT_EQ(CountLogs(kModuleFile, "req or resp is not valid"), 1)
      << DumpLogs();
}

// --- Router configuration "set" ---------------------------------------------

class ModuleRouterConfSet : public ModuleFixture {
protected:
  // The one configuration stored by the call, or a failed test.
  ZARK_ROUTER_CONF StoredConf() {
    EXPECT_EQ(Fake().storedConfs.size(), 1u);
    return Fake().storedConfs.empty() ? ZARK_ROUTER_CONF{}
                                      : Fake().storedConfs.front();
  }
};

TEST_F(ModuleRouterConfSet, ParametersBecomeConfigurationFields) {
  Answer answer = Invoke(kApiRouterConf, "set", ParseJson(R"({
      "router_brand": "Acme", "router_model": "R1", "router_version": "2.0",
      "router_protocol": "https", "router_port": 8443,
      "router_account": "admin", "router_pass": "secret",
      "support_upnp": "no", "support_natpmp": "no"})"));
  ASSERT_EQ(answer.state, State::Success) << answer.code << "\n" << DumpLogs();
  ZARK_ROUTER_CONF conf = StoredConf();
  EXPECT_STREQ(conf.brand, "Acme");
  EXPECT_STREQ(conf.model, "R1");
  EXPECT_STREQ(conf.version, "2.0");
  EXPECT_STREQ(conf.conn_type, "https");
  EXPECT_STREQ(conf.conn_port, "8443");
  EXPECT_STREQ(conf.account, "admin");
  EXPECT_STREQ(conf.password, "secret");
  EXPECT_STREQ(conf.support_upnp, "no");
  EXPECT_STREQ(conf.support_natpmp, "no");
}

TEST_F(ModuleRouterConfSet, AbsentPortStores80) {
  Answer answer = Invoke(kApiRouterConf, "set", ParseJson(R"({
      "router_protocol": "http", "support_upnp": "no",
      "support_natpmp": "no"})"));
  ASSERT_EQ(answer.state, State::Success) << DumpLogs();
  EXPECT_STREQ(StoredConf().conn_port, "80");
}

TEST_F(ModuleRouterConfSet, PortThatIsNotAnIntegerStores80) {
  for (const char *port : {R"("8080")", "true", "[8080]", "8080.5"}) {
    zark::fake::Reset();
    Json::Value params = ParseJson(R"({
        "router_protocol": "http", "support_upnp": "no",
        "support_natpmp": "no"})");
    params["router_port"] = ParseJson(port);
    Answer answer = Invoke(kApiRouterConf, "set", params);
    ASSERT_EQ(answer.state, State::Success) << port << "\n" << DumpLogs();
    EXPECT_STREQ(StoredConf().conn_port, "80") << port;
  }
}

TEST_F(ModuleRouterConfSet, NegativePortIsWrittenAsDecimal) {
  Answer answer = Invoke(kApiRouterConf, "set", ParseJson(R"({
      "router_protocol": "http", "router_port": -1, "support_upnp": "no",
      "support_natpmp": "no"})"));
  ASSERT_EQ(answer.state, State::Success) << DumpLogs();
  EXPECT_STREQ(StoredConf().conn_port, "-1");
}

TEST_F(ModuleRouterConfSet, TextsOfOtherTypesAreEmpty) {
  Answer answer = Invoke(kApiRouterConf, "set", ParseJson(R"({
      "router_brand": 5, "router_model": null, "router_version": ["2"],
      "router_protocol": "http", "support_upnp": true,
      "support_natpmp": {"x": "yes"}})"));
  ASSERT_EQ(answer.state, State::Success) << DumpLogs();
  ZARK_ROUTER_CONF conf = StoredConf();
  EXPECT_STREQ(conf.brand, "");
  EXPECT_STREQ(conf.model, "");
  EXPECT_STREQ(conf.version, "");
  EXPECT_STREQ(conf.support_upnp, "");
  EXPECT_STREQ(conf.support_natpmp, "");
  EXPECT_STREQ(conf.conn_type, "http");
}

// An account given as a string, even empty, takes the has-account path:
// an empty account drops the password.
TEST_F(ModuleRouterConfSet, EmptyAccountStringDropsThePassword) {
  Answer answer = Invoke(kApiRouterConf, "set", ParseJson(R"({
      "router_protocol": "http", "router_account": "",
      "router_pass": "secret", "support_upnp": "no",
      "support_natpmp": "no"})"));
  ASSERT_EQ(answer.state, State::Success) << DumpLogs();
  ZARK_ROUTER_CONF conf = StoredConf();
  EXPECT_STREQ(conf.account, "");
  EXPECT_STREQ(conf.password, "");
}

// Without an account string there is no has-account path: nothing of the
// login is written, whatever the password says.
TEST_F(ModuleRouterConfSet, AccountThatIsNotAStringWritesNoLogin) {
  for (const char *account :
       {"", R"("router_account": 7,)", R"("router_account": null,)"}) {
    zark::fake::Reset();
    std::string params = std::string("{") + account +
                         R"("router_protocol": "http",
        "router_pass": "secret", "support_upnp": "no",
        "support_natpmp": "no"})";
    Answer answer = Invoke(kApiRouterConf, "set", ParseJson(params));
    ASSERT_EQ(answer.state, State::Success) << params << "\n" << DumpLogs();
    ZARK_ROUTER_CONF conf = StoredConf();
    EXPECT_STREQ(conf.account, "") << params;
    EXPECT_STREQ(conf.password, "") << params;
  }
}

TEST_F(ModuleRouterConfSet, EmptyProtocolWithoutUPnPAnswers1500) {
  Answer answer = Invoke(kApiRouterConf, "set", ParseJson(R"({
      "support_upnp": "no", "support_natpmp": "no"})"));
  EXPECT_EQ(answer.state, State::Error);
  EXPECT_EQ(answer.code, 1500);
  EXPECT_EQ(CountCalls("KLibSetRouterConf"), 0u);
  EXPECT_EQ(CountLogs(kPortForwardingFile, "conntype shall not be empty"), 1)
      << DumpLogs();
}

TEST_F(ModuleRouterConfSet, UnknownGatewayAnswers1503) {
  Fake().KLibGetGatewayIP = [](char *, int) { return -1; };
  Answer answer = Invoke(kApiRouterConf, "set", ParseJson(R"({
      "router_protocol": "http"})"));
  EXPECT_EQ(answer.state, State::Error);
  EXPECT_EQ(answer.code, 1503);
}

TEST_F(ModuleRouterConfSet, NullRequestAnswers1500) {
  ZARK::APIResponse response;
  CallMethod(kApiRouterConf, "set", nullptr, &response);
  EXPECT_EQ(response.GetErrorCode(), 1500);
  EXPECT_TRUE(CallNames().empty());
  EXPECT_EQ(CountLogs(kModuleFile, "req or resp is not valid"), 1)
      << DumpLogs();
}

// --- Compatibility "stop" ---------------------------------------------------

// A task that waits until it is asked to stop, then notes how many times the
// library's test had been stopped by then.
struct StopProbe {
  std::atomic<bool> started{false};
  std::atomic<int> libraryStopsSeen{-1};
};

void WaitUntilStopped(ZARK::APIRequest *, ZARK::APIResponse *response,
                      void *argument) {
  auto *probe = static_cast<StopProbe *>(argument);
  probe->started = true;
  for (int i = 0; i < 2000 && !ZARK::APIPolling::IsStopRequested(response);
       ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  probe->libraryStopsSeen =
      static_cast<int>(CountCalls("KLibStopTestUpnpCompatibility"));
}

// The probes outlive the tasks: the fixture's TearDown stops and joins every
// task before the members go.
class ModuleCompatibilityStop : public ModuleFixture {
protected:
  StopProbe mFirst;
  StopProbe mSecond;
};

TEST_F(ModuleCompatibilityStop, StopsTheLibraryTestThenSweepsTestTasks) {
  std::string compatibilityId =
      StartRawTask("ZARK.Core.PortForwarding.test_compatibility", "admin",
                   WaitUntilStopped, &mFirst);
  std::string rulesId = StartRawTask("ZARK.Core.PortForwarding.test_rules",
                                     "admin", WaitUntilStopped, &mSecond);

  Answer answer = Invoke(kApiCompatibility, "stop", Json::Value());
  EXPECT_EQ(answer.state, State::Success);
  EXPECT_TRUE(answer.data.isNull());
  EXPECT_FALSE(TaskExists(compatibilityId)) << "swept";
  EXPECT_TRUE(TaskExists(rulesId)) << "not a compatibility test task";

  ZARK::APIPolling polling;
  polling.Stop(rulesId, true);
  ZARK::APIPolling::JoinAll();
  EXPECT_EQ(mFirst.libraryStopsSeen.load(), 1)
      << "the library's test was stopped before the task";
}

TEST_F(ModuleCompatibilityStop, FailedLibraryStopAnswers1500AfterTheSweep) {
  Fake().KLibStopTestUpnpCompatibility = [] { return -1; };
  std::string id = StartRawTask("ZARK.Core.PortForwarding.test_compatibility",
                                "admin", WaitUntilStopped, &mFirst);
  Answer answer = Invoke(kApiCompatibility, "stop", Json::Value());
  EXPECT_EQ(answer.state, State::Error);
  EXPECT_EQ(answer.code, 1500);
  EXPECT_TRUE(answer.errorData.isNull());
  EXPECT_FALSE(TaskExists(id)) << "the sweep runs whatever the stop gave";
  EXPECT_EQ(
      CountLogs(kPortForwardingFile, "KLibStopTestUpnpCompatibility() failed"),
      1)
      << DumpLogs();
}

TEST_F(ModuleCompatibilityStop, SweepTakesOnlyTheAdminGroup) {
  std::string adminId =
      StartRawTask("ZARK.Core.PortForwarding.test_compatibility", "admin",
                   WaitUntilStopped, &mFirst);
  std::string otherId =
      StartRawTask("ZARK.Core.PortForwarding.test_compatibility", "other",
                   WaitUntilStopped, &mSecond);
  Answer answer = Invoke(kApiCompatibility, "stop", Json::Value());
  EXPECT_EQ(answer.state, State::Success);
  EXPECT_FALSE(TaskExists(adminId));
  EXPECT_TRUE(TaskExists(otherId));
}

TEST_F(ModuleCompatibilityStop, NullRequestAnswers1500AndSweepsNothing) {
  std::string id = StartRawTask("ZARK.Core.PortForwarding.test_compatibility",
                                "admin", WaitUntilStopped, &mFirst);
  ZARK::APIResponse response;
  CallMethod(kApiCompatibility, "stop", nullptr, &response);
  EXPECT_EQ(response.GetErrorCode(), 1500);
  EXPECT_TRUE(TaskExists(id));
  EXPECT_EQ(CountCalls("KLibStopTestUpnpCompatibility"), 0u);
  EXPECT_EQ(CountLogs(kModuleFile, "req or resp is not valid"), 1)
      << DumpLogs();
}

// --- Service "check" --------------------------------------------------------

class ModuleServCheck : public ModuleFixture {};

TEST_F(ModuleServCheck, NullRequestOrResponseAnswers9999) {
  ZARK::APIResponse response;
  CallMethod(kApiRulesServ, "check", nullptr, &response);
  EXPECT_EQ(response.GetState(), State::Error);
  EXPECT_EQ(response.GetErrorCode(), 9999);
  ZARK::APIRequest request;
  CallMethod(kApiRulesServ, "check", &request, nullptr);
  EXPECT_EQ(CountLogs(kModuleFile, "req or resp is not valid"), 2)
      << DumpLogs();
}

TEST_F(ModuleServCheck, ServiceIdThatIsNotAnArrayAnswers9999) {
  for (const char *ids : {R"("web")", "5", R"({"a": "web"})", "null"}) {
    zark::test::ClearLogs();
    Json::Value params(Json::objectValue);
    params["service_id"] = ParseJson(ids);
    Answer answer = Invoke(kApiRulesServ, "check", params);
    EXPECT_EQ(answer.state, State::Error) << ids;
    EXPECT_EQ(answer.code, 9999) << ids;
    EXPECT_EQ(CountLogs(kModuleFile, "service_id should be array"), 1)
        << ids << "\n"
        << DumpLogs();
  }
}

TEST_F(ModuleServCheck, AnswersServiceStatusArray) {
  for (const char *params : {"{}", R"({"service_id": []})",
                             R"({"service_id": ["no_such_service"]})"}) {
    Answer answer = Invoke(kApiRulesServ, "check", ParseJson(params));
    ASSERT_EQ(answer.state, State::Success) << params << "\n" << DumpLogs();
    EXPECT_EQ(answer.data.getMemberNames(),
              std::vector<std::string>{"service_status"})
        << params;
    EXPECT_TRUE(answer.data["service_status"].isArray()) << params;
  }
}

} // namespace
