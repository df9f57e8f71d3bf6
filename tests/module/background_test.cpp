// Background methods end to end through the host's polling facility: the
// start answers, the task bodies, and the status methods with their sweep.
#include "module_fixture.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <string>
#include <thread>
#include <vector>

namespace {

using namespace zark::moduletest;
using zark::fake::Calls;
using zark::fake::CountCalls;
using zark::fake::Fake;
using State = ZARK::APIResponse::State;

struct Method {
  const char *api;
  const char *method;
};

// Start methods with the parameters each needs and the task name it uses.
struct StartRow {
  Method start;
  const char *params;
  const char *prefix;
};
const StartRow kStarts[] = {
    {{"ZARK.Core.PortForwarding", "detect"},
     "{}",
     "ZARK.Core.PortForwarding.detect"},
    {{"ZARK.Core.PortForwarding.Rules", "save"},
     R"({"rules": []})",
     "ZARK.Core.PortForwarding.save_rules"},
    {{"ZARK.Core.PortForwarding.Rules", "test"},
     "{}",
     "ZARK.Core.PortForwarding.test_rules"},
    {{"ZARK.Core.PortForwarding.Compatibility", "test"},
     "{}",
     "ZARK.Core.PortForwarding.test_compatibility"},
    {{"ZARK.Core.PortForwarding.Rules.Serv", "test"},
     R"({"service_id": ["web"]})",
     "ZARK.Core.PortForwarding.test_serv"},
};

const Method kStatusMethods[] = {
    {"ZARK.Core.PortForwarding", "detect_status"},
    {"ZARK.Core.PortForwarding.Rules", "save_status"},
    {"ZARK.Core.PortForwarding.Rules", "test_status"},
    {"ZARK.Core.PortForwarding.Rules.Serv", "test_status"},
    {"ZARK.Core.PortForwarding.Compatibility", "test_status"},
};

bool StartsWith(const std::string &text, const std::string &prefix) {
  return text.compare(0, prefix.size(), prefix) == 0;
}

// The task id is the name, "#", then 16 hex digits.
void ExpectTaskIdNamed(const std::string &id, const std::string &name) {
  ASSERT_EQ(id.size(), name.size() + 17) << id;
  EXPECT_TRUE(StartsWith(id, name + "#")) << id << " is not named " << name;
}

// --- Starting ---------------------------------------------------------------

class ModuleTaskStart : public ModuleFixture {};

TEST_F(ModuleTaskStart, EachStartAnswersATaskIdOfItsName) {
  for (const StartRow &row : kStarts) {
    std::string id =
        StartTask(row.start.api, row.start.method, ParseJson(row.params));
    ExpectTaskIdNamed(id, row.prefix);
    // Group "admin", and kept after it ends until it is swept.
    std::vector<std::string> listed = ListTasks(row.prefix);
    EXPECT_NE(std::find(listed.begin(), listed.end(), id), listed.end())
        << row.prefix;
    EXPECT_TRUE(ListTasks(row.prefix, "other").empty());
    EXPECT_TRUE(WaitTaskFinished(id)) << id;
    EXPECT_TRUE(TaskExists(id)) << "record kept after the task ended";
  }
}

TEST_F(ModuleTaskStart, NullRequestOrResponseAnswers114) {
  for (const StartRow &row : kStarts) {
    zark::test::ClearLogs();
    ZARK::APIResponse response;
    CallMethod(row.start.api, row.start.method, nullptr, &response);
    EXPECT_EQ(response.GetState(), State::Error) << row.prefix;
    EXPECT_EQ(response.GetErrorCode(), 114) << row.prefix;
    EXPECT_TRUE(response.GetErrorData().isNull()) << row.prefix;
    ZARK::APIRequest request(ParseJson(row.params));
    CallMethod(row.start.api, row.start.method, &request, nullptr);
    EXPECT_EQ(CountLogs(kModuleFile, "req or resp is not valid"), 2)
        << row.prefix << "\n"
        << DumpLogs();
  }
  EXPECT_TRUE(ListTasks("").empty()) << "no task was started";
}

TEST_F(ModuleTaskStart, SaveWithoutSuffixIsNamedSaveRules) {
  std::string id = StartTask(kApiRules, "save", ParseJson(R"({"rules": []})"));
  ExpectTaskIdNamed(id, "ZARK.Core.PortForwarding.save_rules");
}

TEST_F(ModuleTaskStart, SaveWithStringSuffixAppendsIt) {
  std::string id =
      StartTask(kApiRules, "save",
                ParseJson(R"({"rules": [], "task_id_suffix": "wizard"})"));
  ExpectTaskIdNamed(id, "ZARK.Core.PortForwarding.save_rules.wizard");
}

TEST_F(ModuleTaskStart, SaveWithNumberSuffixKeepsTrailingPoint) {
  std::string id = StartTask(
      kApiRules, "save", ParseJson(R"({"rules": [], "task_id_suffix": 5})"));
  ExpectTaskIdNamed(id, "ZARK.Core.PortForwarding.save_rules.");
}

TEST_F(ModuleTaskStart, SaveWithNullSuffixKeepsTrailingPoint) {
  std::string id = StartTask(
      kApiRules, "save", ParseJson(R"({"rules": [], "task_id_suffix": null})"));
  ExpectTaskIdNamed(id, "ZARK.Core.PortForwarding.save_rules.");
}

TEST_F(ModuleTaskStart, SaveWithLongSuffixIsCutTo1023Characters) {
  Json::Value params = ParseJson(R"({"rules": []})");
  params["task_id_suffix"] = std::string(2000, 'x');
  std::string id = StartTask(kApiRules, "save", params);
  std::string name = "ZARK.Core.PortForwarding.save_rules.";
  name += std::string(1023 - name.size(), 'x');
  ExpectTaskIdNamed(id, name);
}

TEST_F(ModuleTaskStart, ServiceTestNeedsServiceIdArrayOrString) {
  for (const char *params :
       {"{}", R"({"service_id": 5})", R"({"service_id": {"a": 1}})",
        R"({"service_id": null})", R"({"service_id": true})"}) {
    Answer answer = Invoke(kApiRulesServ, "test", ParseJson(params));
    EXPECT_EQ(answer.state, State::Error) << params;
    EXPECT_EQ(answer.code, 114) << params;
    EXPECT_TRUE(answer.errorData.isNull()) << params;
  }
  EXPECT_TRUE(ListTasks("").empty());
  for (const char *params :
       {R"({"service_id": ["web"]})", R"({"service_id": "web"})"}) {
    std::string id = StartTask(kApiRulesServ, "test", ParseJson(params));
    ExpectTaskIdNamed(id, "ZARK.Core.PortForwarding.test_serv");
  }
}

// --- Task bodies ------------------------------------------------------------

class ModuleTaskBody : public ModuleFixture {};

TEST_F(ModuleTaskBody, SaveWithoutRulesOrPolicyEndsWith114) {
  std::string id = StartTask(kApiRules, "save", ParseJson("{}"));
  Answer answer = PollUntilSwept(kApiRules, "save_status", id);
  EXPECT_EQ(answer.state, State::Error);
  EXPECT_EQ(answer.code, 114);
  EXPECT_EQ(answer.errorData,
            ParseJson(R"({"sec": "", "key": "", "append": null})"));
  EXPECT_EQ(CountLogs(kModuleFile, "must input rules or pf_policy"), 1)
      << DumpLogs();
  EXPECT_EQ(CountCalls("KLibZarkPortMapLock"), 0u) << "nothing was saved";
}

TEST_F(ModuleTaskBody, SaveRunsWithTheRulesToSuccess) {
  std::string id = StartTask(kApiRules, "save", ParseJson(R"({"rules": [
      {"enable": true, "rule_id": "1", "router_protocol": "tcp",
       "router_port": "8080", "ds_port": "80"}]})"));
  Answer answer = PollUntilSwept(kApiRules, "save_status", id);
  ASSERT_EQ(answer.state, State::Success) << answer.code << DumpLogs();
  EXPECT_EQ(answer.data, ParseJson(R"({"status": "success",
                                       "percentage": 100})"));
  ASSERT_EQ(Fake().lastSavedRules.size(), 1u);
  EXPECT_STREQ(Fake().lastSavedRules[0].router_port, "8080");
}

TEST_F(ModuleTaskBody, SaveWithRulesAndPolicyUsesTheRules) {
  std::string id = StartTask(kApiRules, "save", ParseJson(R"({
      "rules": [{"enable": true, "rule_id": "1", "router_protocol": "udp",
                 "router_port": "53", "ds_port": "53"}],
      "pf_policy": {"anything": 1}})"));
  Answer answer = PollUntilSwept(kApiRules, "save_status", id);
  ASSERT_EQ(answer.state, State::Success) << answer.code << DumpLogs();
  ASSERT_EQ(Fake().lastSavedRules.size(), 1u);
  EXPECT_STREQ(Fake().lastSavedRules[0].router_protocol, "udp");
}

TEST_F(ModuleTaskBody, RulesTestSelectionThatIsNotAStringEndsWith114) {
  for (const char *params : {R"({"selection": 5})", R"({"selection": null})",
                             R"({"selection": ["a"]})"}) {
    zark::fake::Reset();
    std::string id = StartTask(kApiRules, "test", ParseJson(params));
    Answer answer = PollUntilSwept(kApiRules, "test_status", id);
    EXPECT_EQ(answer.state, State::Error) << params;
    EXPECT_EQ(answer.code, 114) << params;
    EXPECT_EQ(answer.errorData,
              ParseJson(R"({"sec": "", "key": "", "append": null})"));
    EXPECT_EQ(CountCalls("KLibZarkPortMapLock"), 0u) << params;
  }
}

TEST_F(ModuleTaskBody, RulesTestWithoutSelectionTestsSavedRules) {
  Fake().savedRules = {zark::fake::MakeRule("1", true, "tcp", "80", "80")};
  Fake().KLibTestRules = [](int, ZARK_ROUTER_RULE *, ZARK_LIBZARKPORTMAP_ERR *,
                            bool) {
    zark::test::WriteFile("/tmp/pfStatusRule", "1=ok\n");
    return 0;
  };
  std::string id = StartTask(kApiRules, "test", ParseJson("{}"));
  Answer answer = PollUntilSwept(kApiRules, "test_status", id);
  ASSERT_EQ(answer.state, State::Success) << answer.code << DumpLogs();
  EXPECT_EQ(answer.data,
            ParseJson(R"({"status": "success", "rules": {"1": "ok"}})"));
  bool loadedSaved = false;
  for (const auto &call : Calls()) {
    if (call.name == "KLibGetRulesArrFromRuleConf") {
      loadedSaved = call.args.at(0) == "(null)";
    }
  }
  EXPECT_TRUE(loadedSaved) << "the saved configuration (no path) was tested";
}

TEST_F(ModuleTaskBody, RulesTestWithSelectionTestsThatConfiguration) {
  std::string id =
      StartTask(kApiRules, "test",
                ParseJson(R"({"selection": "/etc/portforward/other.conf"})"));
  ASSERT_TRUE(WaitTaskFinished(id));
  std::vector<std::string> paths;
  for (const auto &call : Calls()) {
    if (call.name == "KLibGetRulesArrFromRuleConf") {
      paths.push_back(call.args.at(0));
    }
  }
  EXPECT_EQ(paths, std::vector<std::string>{"/etc/portforward/other.conf"});
}

TEST_F(ModuleTaskBody, ServiceTestRunsTheConnectionTest) {
  std::string id =
      StartTask(kApiRulesServ, "test", ParseJson(R"({"service_id": "web"})"));
  ASSERT_TRUE(WaitTaskFinished(id));
  EXPECT_EQ(CountCalls("KLibZarkPortMapLock"), 1u);
  EXPECT_EQ(CountCalls("KLibGetRulesArrFromRuleConf"), 0u)
      << "the service test never reads a rule selection";
  PollUntilSwept(kApiRulesServ, "test_status", id);
}

TEST_F(ModuleTaskBody, DetectRunsWhateverAutoSaveSays) {
  for (const char *params :
       {"{}", R"({"auto_save": true})", R"({"auto_save": "yes"})",
        R"({"auto_save": 1})"}) {
    zark::fake::Reset();
    std::string id = StartTask(kApiPortForwarding, "detect", ParseJson(params));
    Answer answer = PollUntilSwept(kApiPortForwarding, "detect_status", id);
    ASSERT_EQ(answer.state, State::Success) << params << DumpLogs();
    EXPECT_EQ(answer.data["status"], "success") << params;
    EXPECT_EQ(answer.data["percentage"], 100) << params;
    EXPECT_EQ(CountCalls("KLibDetectRouter"), 1u) << params;
    EXPECT_EQ(CountCalls("KLibSetRouterConf"), 0u)
        << "detection never stores a configuration";
  }
}

TEST_F(ModuleTaskBody, CompatibilityTestRunsTheLibraryTest) {
  std::string id = StartTask(kApiCompatibility, "test", ParseJson("{}"));
  Answer answer = PollUntilSwept(kApiCompatibility, "test_status", id);
  ASSERT_EQ(answer.state, State::Success) << DumpLogs();
  EXPECT_TRUE(answer.data["test"].isArray());
  ASSERT_EQ(CountCalls("KLibTestUpnpCompatibility"), 1u);
  for (const auto &call : Calls()) {
    if (call.name == "KLibTestUpnpCompatibility") {
      EXPECT_EQ(call.args, (std::vector<std::string>{"60", "true"}));
    }
  }
}

// --- Status polling ---------------------------------------------------------

class ModuleStatusPoll : public ModuleFixture {};

TEST_F(ModuleStatusPoll, WithoutTaskIdAnswers1500) {
  for (const Method &status : kStatusMethods) {
    zark::test::ClearLogs();
    Answer answer = Invoke(status.api, status.method, ParseJson("{}"));
    EXPECT_EQ(answer.state, State::Error) << status.api << status.method;
    EXPECT_EQ(answer.code, 1500);
    EXPECT_TRUE(answer.errorData.isNull());
    EXPECT_EQ(CountLogs(kModuleFile, "task id is empty"), 1)
        << status.api << " " << status.method << "\n"
        << DumpLogs();
  }
}

TEST_F(ModuleStatusPoll, TaskIdWithoutTextAnswers1500AsEmpty) {
  for (const char *params : {R"({"task_id": ""})", R"({"task_id": [1]})",
                             R"({"task_id": {"a": "b"}})"}) {
    zark::test::ClearLogs();
    Answer answer =
        Invoke(kApiPortForwarding, "detect_status", ParseJson(params));
    EXPECT_EQ(answer.code, 1500) << params;
    EXPECT_EQ(CountLogs(kModuleFile, "task id is empty"), 1) << params << "\n"
                                                             << DumpLogs();
  }
}

TEST_F(ModuleStatusPoll, UnknownTaskAnswers1500) {
  Answer answer =
      PollOnce(kApiRules, "save_status",
               "ZARK.Core.PortForwarding.save_rules#0000000000000000");
  EXPECT_EQ(answer.state, State::Error);
  EXPECT_EQ(answer.code, 1500);
  EXPECT_TRUE(answer.errorData.isNull());
  EXPECT_EQ(CountLogs(kModuleFile, "can not get polling status"), 1)
      << DumpLogs();
}

TEST_F(ModuleStatusPoll, NumericTaskIdIsReadAsText) {
  Answer answer =
      Invoke(kApiRules, "save_status", ParseJson(R"({"task_id": 5})"));
  EXPECT_EQ(answer.code, 1500);
  EXPECT_EQ(CountLogs(kModuleFile, "can not get polling status"), 1)
      << DumpLogs();
}

TEST_F(ModuleStatusPoll, NullRequestOrResponseAnswers114) {
  for (const Method &status : kStatusMethods) {
    zark::test::ClearLogs();
    ZARK::APIResponse response;
    CallMethod(status.api, status.method, nullptr, &response);
    EXPECT_EQ(response.GetErrorCode(), 114) << status.api << status.method;
    EXPECT_TRUE(response.GetErrorData().isNull());
    ZARK::APIRequest request(ParseJson(R"({"task_id": "x"})"));
    CallMethod(status.api, status.method, &request, nullptr);
    EXPECT_EQ(CountLogs(kModuleFile, "req or resp is not valid"), 2)
        << DumpLogs();
  }
}

// A running rule test (held inside the library while it reads the rules):
// the answer is the status operation's, and the task stays.
TEST_F(ModuleStatusPoll, RunningTaskIsAnsweredAndNotSwept) {
  Gate *gate = &mGate;
  Fake().KLibGetRulesArrFromRuleConf = [gate](int *count,
                                              ZARK_ROUTER_RULE **rules, char *,
                                              bool, ZARK_LIBZARKPORTMAP_ERR *) {
    gate->Wait();
    *count = 0;
    *rules = nullptr;
    return 0;
  };
  std::string id = StartTask(kApiRules, "test", ParseJson("{}"));
  ASSERT_TRUE(mGate.WaitReached());

  for (int i = 0; i < 2; ++i) {
    Answer answer = PollOnce(kApiRules, "test_status", id);
    ASSERT_EQ(answer.state, State::Success) << answer.code << DumpLogs();
    EXPECT_EQ(answer.data, ParseJson(R"({"status": "wait"})"));
    EXPECT_TRUE(TaskExists(id)) << "a running task is not swept";
  }

  zark::test::WriteFile("/tmp/pfStatusRule", "1=ok\n");
  mGate.Open();
  Answer last = PollUntilSwept(kApiRules, "test_status", id);
  ASSERT_EQ(last.state, State::Success) << DumpLogs();
  EXPECT_EQ(last.data,
            ParseJson(R"({"status": "success", "rules": {"1": "ok"}})"));
}

TEST_F(ModuleStatusPoll, TaskEndedInErrorAnswersItsCodeAndAppendAndIsSwept) {
  Fake().KLibSaveRules = [](const char *, int, ZARK_ROUTER_RULE *, bool,
                            ZARK_ROUTER_SAVE_RULE_RESULT *result,
                            ZARK_SAVE_RULE_PROGRESS_CB, void *) {
    result->errType = 10;
    result->detail.limit.maxPort = 1024;
    return -1;
  };
  std::string id = StartTask(kApiRules, "save", ParseJson(R"({"rules": [
      {"enable": true, "rule_id": "1", "router_protocol": "tcp",
       "router_port": "8080", "ds_port": "80"}]})"));
  ASSERT_TRUE(WaitTaskFinished(id));

  Answer answer = PollOnce(kApiRules, "save_status", id);
  EXPECT_EQ(answer.state, State::Error);
  EXPECT_EQ(answer.code, 1521);
  EXPECT_EQ(answer.errorData, ParseJson(R"({"sec": "", "key": "",
                                            "append": {"max_port": 1024}})"));
  EXPECT_FALSE(TaskExists(id)) << "the poll that saw it finished swept it";

  zark::test::ClearLogs();
  Answer later = PollOnce(kApiRules, "save_status", id);
  EXPECT_EQ(later.code, 1500);
  EXPECT_EQ(CountLogs(kModuleFile, "can not get polling status"), 1)
      << DumpLogs();
}

TEST_F(ModuleStatusPoll, FinishedTaskIsAnsweredThenLaterPollAnswers1500) {
  std::string id = StartTask(kApiPortForwarding, "detect", ParseJson("{}"));
  Answer answer = PollUntilSwept(kApiPortForwarding, "detect_status", id);
  EXPECT_EQ(answer.state, State::Success);
  Answer later = PollOnce(kApiPortForwarding, "detect_status", id);
  EXPECT_EQ(later.state, State::Error);
  EXPECT_EQ(later.code, 1500);
  EXPECT_TRUE(later.errorData.isNull());
}

// Tasks shaped by the test, to give the status handler records that the
// module's own tasks do not produce.
void AnswerWithoutPercentage(ZARK::APIRequest *, ZARK::APIResponse *response,
                             void *) {
  response->SetSuccess(ParseJson(R"({"status": "processing"})"));
}

void AnswerErrorWithTextData(ZARK::APIRequest *, ZARK::APIResponse *response,
                             void *) {
  response->SetError(1503, Json::Value("no append here"));
}

void AnswerRunning(ZARK::APIRequest *, ZARK::APIResponse *response,
                   void *argument) {
  response->SetSuccess(
      ParseJson(R"({"status": "processing", "percentage": 30})"));
  static_cast<Gate *>(argument)->Wait();
}

void AnswerFinishedDetection(ZARK::APIRequest *, ZARK::APIResponse *response,
                             void *) {
  response->SetSuccess(
      ParseJson(R"({"status": "processing", "percentage": 40})"));
}

// When the status operation fails, the poll answers nothing at all; the
// finished task is still swept.
TEST_F(ModuleStatusPoll, FailingStatusOperationAnswersNothing) {
  std::string id = StartRawTask("ZARK.Core.PortForwarding.detect", "admin",
                                AnswerWithoutPercentage, nullptr);
  ASSERT_TRUE(WaitTaskFinished(id));
  ZARK::APIRequest request(ParseJson("{}"));
  request.SetParam("task_id", id);
  ZARK::APIResponse response;
  CallMethod(kApiPortForwarding, "detect_status", &request, &response);
  EXPECT_FALSE(response.IsAnswered());
  EXPECT_EQ(CountLogs(kModuleFile, "get pf callback func status failed"), 1)
      << DumpLogs();
  EXPECT_FALSE(TaskExists(id));
}

TEST_F(ModuleStatusPoll, ErrorRecordWithoutAppendAnswers1500) {
  std::string id = StartRawTask("ZARK.Core.PortForwarding.test_rules", "admin",
                                AnswerErrorWithTextData, nullptr);
  ASSERT_TRUE(WaitTaskFinished(id));
  Answer answer = PollOnce(kApiRules, "test_status", id);
  EXPECT_EQ(answer.state, State::Error);
  EXPECT_EQ(answer.code, 1500);
  EXPECT_TRUE(answer.errorData.isNull());
  int key = FindLog(kReporterFile, "key does not exist");
  int append = FindLog(kReporterFile, "can not get error append data");
  int load = FindLog(kModuleFile, "load status reportor failed");
  EXPECT_GE(key, 0) << DumpLogs();
  EXPECT_GT(append, key) << DumpLogs();
  EXPECT_GT(load, append) << DumpLogs();
  EXPECT_FALSE(TaskExists(id)) << "finished, so swept before the failure";
}

TEST_F(ModuleStatusPoll, RunningRawTaskIsAnsweredFromItsRecord) {
  std::string id = StartRawTask("ZARK.Core.PortForwarding.detect", "admin",
                                AnswerRunning, &mGate);
  ASSERT_TRUE(mGate.WaitReached());
  Answer answer = PollOnce(kApiPortForwarding, "detect_status", id);
  ASSERT_EQ(answer.state, State::Success) << DumpLogs();
  EXPECT_EQ(answer.data["status"], "processing");
  EXPECT_EQ(answer.data["percentage"], 30);
  EXPECT_TRUE(TaskExists(id));
}

// An id without the module's name belongs to someone else: answered, but
// never swept by this module.
TEST_F(ModuleStatusPoll, TaskOfAnotherModuleIsAnsweredButNotSwept) {
  std::string id = StartRawTask("Other.Module.detect", "admin",
                                AnswerFinishedDetection, nullptr);
  ASSERT_TRUE(WaitTaskFinished(id));
  Answer answer = PollOnce(kApiPortForwarding, "detect_status", id);
  ASSERT_EQ(answer.state, State::Success) << DumpLogs();
  EXPECT_EQ(answer.data["percentage"], 40);
  EXPECT_TRUE(TaskExists(id));
  EXPECT_EQ(CountLogs(kModuleFile,
                      "task id=" + id + " is not of this module, not swept"),
            1)
      << DumpLogs();
}

// The sweep takes the task id from the module's name on, so it removes this
// task and no other finished task.
TEST_F(ModuleStatusPoll, SweepRemovesOnlyThePolledTask) {
  std::string first = StartRawTask("ZARK.Core.PortForwarding.detect", "admin",
                                   AnswerFinishedDetection, nullptr);
  std::string second = StartRawTask("ZARK.Core.PortForwarding.detect", "admin",
                                    AnswerFinishedDetection, nullptr);
  std::string nested = StartRawTask("ZARK.Core.PortForwarding.detect.more",
                                    "admin", AnswerFinishedDetection, nullptr);
  ASSERT_TRUE(WaitTaskFinished(first));
  ASSERT_TRUE(WaitTaskFinished(second));
  ASSERT_TRUE(WaitTaskFinished(nested));
  PollOnce(kApiPortForwarding, "detect_status", first);
  EXPECT_FALSE(TaskExists(first));
  EXPECT_TRUE(TaskExists(second));
  EXPECT_TRUE(TaskExists(nested));
}

TEST_F(ModuleStatusPoll, IdWithTextBeforeTheModuleNameSweepsFromTheName) {
  std::string id = StartRawTask("Host.ZARK.Core.PortForwarding.detect", "admin",
                                AnswerFinishedDetection, nullptr);
  std::string plain = StartRawTask("ZARK.Core.PortForwarding.detect", "admin",
                                   AnswerFinishedDetection, nullptr);
  ASSERT_TRUE(WaitTaskFinished(id));
  ASSERT_TRUE(WaitTaskFinished(plain));
  // The tail "ZARK.Core.PortForwarding.detect#..." names no held task.
  Answer answer = PollOnce(kApiPortForwarding, "detect_status", id);
  EXPECT_EQ(answer.state, State::Success);
  EXPECT_TRUE(TaskExists(id));
  EXPECT_TRUE(TaskExists(plain));
}

} // namespace
