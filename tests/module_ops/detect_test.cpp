// Router detection: the run and its per-step progress, the status answer,
// and the port-map library's running job.
#include "ops_test_support.h"

#include <cstring>

namespace zark::ops {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using zark::fake::Fake;

void SetText(char *field, const std::string &text) {
  std::snprintf(field, ZARK_PORTMAP_TEXT_SIZE, "%s", text.c_str());
}

ZARK_ROUTER_DETECT_RESULT SampleRecord() {
  ZARK_ROUTER_DETECT_RESULT record{};
  record.hops = 1;
  SetText(record.gateway_ip, "192.168.1.1");
  SetText(record.network_interface, "eth0");
  record.support_upnp = 1;
  record.support_natpmp = 0;
  SetText(record.router_brand, "Netco");
  SetText(record.router_model, "NX-300");
  SetText(record.router_version, "2.0");
  SetText(record.upnp_pfpath, "Netco: NX-300(2.0)");
  SetText(record.router_user_setting_name, "home");
  record.router_max_rule = 32;
  return record;
}

// The progress object of a callback report at this stage, as JSON text.
const char *kInitialSteps = R"({
  "check_interface_enable_step": {"check_id": 1, "status": "initial"},
  "check_gateway_setting_step": {"check_id": 2, "status": "initial"},
  "check_connect_wan_step": {"check_id": 3, "status": "initial"},
  "check_hops_lan2wan_step": {"check_id": 4, "status": "initial"},
  "check_dns_setting_step": {"check_id": 5, "status": "initial"},
  "detect_router_step": {"check_id": 6, "status": "initial"}})";

class ModuleOpsDetect : public OpsTest {
protected:
  void SetUp() override {
    OpsTest::SetUp();
    Fake().detectResult = SampleRecord();
  }

  // Makes the library stop at stage with a negative result.
  void StopAt(int stage, int rc = -1) {
    Fake().KLibDetectRouter = [stage, rc](ZARK_ROUTER_DETECT_RESULT *result,
                                          ZARK_DETECT_PROGRESS_CB, void *,
                                          bool) {
      *result = Fake().detectResult;
      result->enProgress = stage;
      return rc;
    };
  }

  // The progress object of the callback report at this stage.
  Json::Value ProgressAt(int stage, uint32_t warning = 0) {
    ZARK_ROUTER_DETECT_RESULT record = SampleRecord();
    record.enProgress = stage;
    record.warning = warning;
    DetectProgressCB(&record, Reporter());
    auto answers = listener->Answers();
    EXPECT_FALSE(answers.empty());
    if (answers.empty()) {
      return Json::Value();
    }
    EXPECT_EQ(stage, answers.back().data["percentage"].asInt());
    EXPECT_EQ("processing", answers.back().data["status"].asString());
    return answers.back().data["progress"];
  }
};

TEST_F(ModuleOpsDetect, RunReportsEveryStageThenTheRouter) {
  Json::Value result(Json::objectValue);
  pf->Detect(result, false);
  // The hops stage (70) comes before the DNS stage (50).
  EXPECT_THAT(listener->Names(),
              ElementsAre("status processing 10", "status processing 20",
                          "status processing 30", "status processing 40",
                          "status processing 70", "status processing 50",
                          "status processing 80", "status processing 100",
                          "status success 100"));
  Json::Value expected = ParseJson(R"js({
    "status": "success", "percentage": 100,
    "support_natpmp": "no", "support_upnp": "yes",
    "router_brand": "Netco", "router_model": "NX-300",
    "router_version": "2.0", "upnp_pfpath": "Netco: NX-300(2.0)",
    "router_user_setting_name": "home", "router_max_rule": 32,
    "progress": {
      "check_interface_enable_step": {"status": "success",
                                      "network_interface": "eth0"},
      "check_gateway_setting_step": {"status": "success",
                                     "gateway_ip": "192.168.1.1"},
      "check_connect_wan_step": {"status": "success"},
      "check_hops_lan2wan_step": {"status": "success", "hops_number": 1},
      "check_dns_setting_step": {"status": "success"},
      "detect_router_step": {"status": "success"}}})js");
  EXPECT_EQ(expected, response.GetData());
  EXPECT_THAT(PfLogs(), IsEmpty());
}

TEST_F(ModuleOpsDetect, LibraryGetsTheReporterAndFlagTrue) {
  void *seenArg = nullptr;
  Fake().KLibDetectRouter = [&seenArg](ZARK_ROUTER_DETECT_RESULT *result,
                                       ZARK_DETECT_PROGRESS_CB callback,
                                       void *arg, bool) {
    seenArg = arg;
    EXPECT_EQ(&DetectProgressCB, callback);
    for (size_t i = 0; i < sizeof(*result); i++) {
      EXPECT_EQ(0, reinterpret_cast<unsigned char *>(result)[i]);
      if (reinterpret_cast<unsigned char *>(result)[i] != 0) {
        break;
      }
    }
    *result = Fake().detectResult;
    return 0;
  };
  Json::Value result(Json::objectValue);
  pf->Detect(result, false);
  EXPECT_EQ(static_cast<void *>(Reporter()), seenArg);
  EXPECT_THAT(zark::fake::Calls()[0].args, ElementsAre("true"));
}

TEST_F(ModuleOpsDetect, ProgressAtStartMarksOnlyTheInterfaceStep) {
  Json::Value expected = ParseJson(kInitialSteps);
  expected["check_interface_enable_step"]["status"] = "processing";
  EXPECT_EQ(expected, ProgressAt(10));
  EXPECT_EQ(expected, ProgressAt(20));
}

TEST_F(ModuleOpsDetect, ProgressAtHopsStageFinishesThreeSteps) {
  Json::Value expected = ParseJson(R"({
    "check_interface_enable_step": {"check_id": 1, "status": "success",
                                    "network_interface": "eth0"},
    "check_gateway_setting_step": {"check_id": 2, "status": "success",
                                   "gateway_ip": "192.168.1.1"},
    "check_connect_wan_step": {"check_id": 3, "status": "success"},
    "check_hops_lan2wan_step": {"check_id": 4, "status": "processing"},
    "check_dns_setting_step": {"check_id": 5, "status": "initial"},
    "detect_router_step": {"check_id": 6, "status": "initial"}})");
  EXPECT_EQ(expected, ProgressAt(70));
}

TEST_F(ModuleOpsDetect, ProgressAtDnsStageFinishesTheHopsStep) {
  Json::Value progress = ProgressAt(50);
  EXPECT_EQ(
      ParseJson(R"({"check_id": 4, "status": "success", "hops_number": 1})"),
      progress["check_hops_lan2wan_step"]);
  EXPECT_EQ("processing", progress["check_dns_setting_step"]["status"]);
  EXPECT_EQ("initial", progress["detect_router_step"]["status"]);
}

TEST_F(ModuleOpsDetect, ProgressAtEachStageMarksItsStep) {
  EXPECT_EQ("processing",
            ProgressAt(30)["check_gateway_setting_step"]["status"].asString());
  EXPECT_EQ("processing",
            ProgressAt(40)["check_connect_wan_step"]["status"].asString());
  Json::Value at80 = ProgressAt(80);
  EXPECT_EQ("success", at80["check_dns_setting_step"]["status"].asString());
  EXPECT_EQ("processing", at80["detect_router_step"]["status"].asString());
}

TEST_F(ModuleOpsDetect, ProgressAtDoneShowsAllStepsFinishedWithCheckIds) {
  Json::Value expected = ParseJson(R"({
    "check_interface_enable_step": {"check_id": 1, "status": "success",
                                    "network_interface": "eth0"},
    "check_gateway_setting_step": {"check_id": 2, "status": "success",
                                   "gateway_ip": "192.168.1.1"},
    "check_connect_wan_step": {"check_id": 3, "status": "success"},
    "check_hops_lan2wan_step": {"check_id": 4, "status": "success",
                                "hops_number": 1},
    "check_dns_setting_step": {"check_id": 5, "status": "success"},
    "detect_router_step": {"check_id": 6, "status": "success"}})");
  EXPECT_EQ(expected, ProgressAt(100));
}

TEST_F(ModuleOpsDetect, GatewayWarningMarksOnlyTheGatewayStep) {
  Json::Value progress = ProgressAt(100, ZARK_DETECT_WARN_GATEWAY);
  EXPECT_EQ(ParseJson(R"({"check_id": 2, "status": "warning",
                          "gateway_ip": "192.168.1.1"})"),
            progress["check_gateway_setting_step"]);
  EXPECT_EQ("success", progress["check_hops_lan2wan_step"]["status"]);
  EXPECT_EQ("success", progress["check_interface_enable_step"]["status"]);
}

TEST_F(ModuleOpsDetect, HopsUnknownWinsOverHopsOverOne) {
  Json::Value progress = ProgressAt(100, ZARK_DETECT_WARN_HOPS_UNKNOWN |
                                             ZARK_DETECT_WARN_HOPS_OVER_ONE);
  EXPECT_EQ(ParseJson(R"({"check_id": 4, "status": "warning",
                          "warning_type": "get_hops_fail", "hops_number": 1})"),
            progress["check_hops_lan2wan_step"]);
  EXPECT_EQ("success", progress["check_gateway_setting_step"]["status"]);
}

TEST_F(ModuleOpsDetect, HopsOverOneWarning) {
  Json::Value progress = ProgressAt(50, ZARK_DETECT_WARN_HOPS_OVER_ONE);
  EXPECT_EQ("warning", progress["check_hops_lan2wan_step"]["status"]);
  EXPECT_EQ("hops_over_one",
            progress["check_hops_lan2wan_step"]["warning_type"]);
}

TEST_F(ModuleOpsDetect, CallbackAtUnknownStageLogsAndReportsInitialSteps) {
  EXPECT_EQ(ParseJson(kInitialSteps), ProgressAt(60));
  EXPECT_THAT(PfLogs(), ElementsAre("non spport detect progress type=60"));
}

TEST_F(ModuleOpsDetect, CallbackWithoutReporterLogs) {
  ZARK_ROUTER_DETECT_RESULT record = SampleRecord();
  DetectProgressCB(&record, nullptr);
  EXPECT_THAT(PfLogs(), ElementsAre("statusReportor is NULL"));
}

TEST_F(ModuleOpsDetect, CallbackWithoutRecordLogsAndReportsNothing) {
  DetectProgressCB(nullptr, Reporter());
  EXPECT_THAT(PfLogs(), ElementsAre("detectResult is NULL"));
  EXPECT_TRUE(listener->Answers().empty());
}

TEST_F(ModuleOpsDetect, StopAtHopsStageEndsAsSuccessWithFailedHopsStep) {
  StopAt(70);
  Json::Value result(Json::objectValue);
  pf->Detect(result, false);
  Json::Value progress = ParseJson(R"({
    "check_interface_enable_step": {"status": "success",
                                    "network_interface": "eth0"},
    "check_gateway_setting_step": {"status": "success",
                                   "gateway_ip": "192.168.1.1"},
    "check_connect_wan_step": {"status": "success"},
    "check_hops_lan2wan_step": {"status": "failed"},
    "check_dns_setting_step": {"status": "stop"},
    "detect_router_step": {"status": "stop"}})");
  Json::Value expected(Json::objectValue);
  expected["progress"] = progress;
  expected["status"] = "success";
  expected["percentage"] = 100;
  EXPECT_THAT(listener->Names(), ElementsAre("status success 100"));
  EXPECT_EQ(expected, response.GetData());
  EXPECT_THAT(PfLogs(), IsEmpty());
}

TEST_F(ModuleOpsDetect, StopAtDnsStageShowsHopsFinishedAndDnsFailed) {
  StopAt(50);
  Json::Value result(Json::objectValue);
  pf->Detect(result, false);
  Json::Value progress = response.GetData()["progress"];
  EXPECT_EQ(ParseJson(R"({"status": "success", "hops_number": 1})"),
            progress["check_hops_lan2wan_step"]);
  EXPECT_EQ(ParseJson(R"({"status": "failed"})"),
            progress["check_dns_setting_step"]);
  EXPECT_EQ(ParseJson(R"({"status": "stop"})"), progress["detect_router_step"]);
}

struct StopCase {
  int stage;
  const char *failedStep;
};

class ModuleOpsDetectStop : public ModuleOpsDetect,
                            public ::testing::WithParamInterface<StopCase> {};

TEST_P(ModuleOpsDetectStop, StoppedStepFailsLaterStepsStop) {
  StopAt(GetParam().stage);
  Json::Value result(Json::objectValue);
  pf->Detect(result, false);
  EXPECT_EQ(ZARK::APIResponse::State::Success, response.GetState());
  Json::Value progress = response.GetData()["progress"];
  static const char *const kSteps[] = {
      "check_interface_enable_step", "check_gateway_setting_step",
      "check_connect_wan_step",      "check_hops_lan2wan_step",
      "check_dns_setting_step",      "detect_router_step"};
  bool reached = false;
  for (const char *step : kSteps) {
    std::string status = progress[step]["status"].asString();
    EXPECT_FALSE(progress[step].isMember("check_id")) << step;
    if (std::string(step) == GetParam().failedStep) {
      EXPECT_EQ("failed", status) << step;
      reached = true;
    } else if (reached) {
      EXPECT_EQ("stop", status) << step;
    } else {
      EXPECT_EQ("success", status) << step;
    }
  }
  EXPECT_EQ(result["progress"], progress);
}

INSTANTIATE_TEST_SUITE_P(
    ModuleOpsStages, ModuleOpsDetectStop,
    ::testing::Values(StopCase{20, "check_interface_enable_step"},
                      StopCase{30, "check_gateway_setting_step"},
                      StopCase{40, "check_connect_wan_step"},
                      StopCase{70, "check_hops_lan2wan_step"},
                      StopCase{50, "check_dns_setting_step"},
                      StopCase{80, "detect_router_step"}));

TEST_F(ModuleOpsDetect, StopAtStartAnswers1501) {
  StopAt(10);
  Json::Value result(Json::objectValue);
  pf->Detect(result, false);
  EXPECT_THAT(listener->Names(), ElementsAre("error 1501"));
  EXPECT_THAT(PfLogs(), IsEmpty());
}

TEST_F(ModuleOpsDetect, StopAtUnknownStageAnswers1500) {
  StopAt(60);
  Json::Value result(Json::objectValue);
  pf->Detect(result, false);
  EXPECT_THAT(listener->Names(), ElementsAre("error 1500"));
  EXPECT_THAT(PfLogs(), ElementsAre("non spport detect progress type=60",
                                    "Err detectResult.enProgress=60"));
}

TEST_F(ModuleOpsDetect, StopAtDoneStageAnswers1500) {
  StopAt(100);
  Json::Value result(Json::objectValue);
  pf->Detect(result, false);
  EXPECT_THAT(listener->Names(), ElementsAre("error 1500"));
  EXPECT_THAT(PfLogs(), ElementsAre("Err detectResult.enProgress=100"));
}

TEST_F(ModuleOpsDetect, PositiveResultIsImpossible) {
  StopAt(100, 1);
  Json::Value result(Json::objectValue);
  pf->Detect(result, false);
  EXPECT_THAT(listener->Names(), ElementsAre("error 1500"));
  EXPECT_THAT(PfLogs(), ElementsAre("impossible here"));
}

TEST_F(ModuleOpsDetect, NoReporterLogsAndDetectsNothing) {
  PortForwarding bare(nullptr);
  Json::Value result(Json::objectValue);
  bare.Detect(result, false);
  EXPECT_THAT(PfLogs(), ElementsAre("statusReportor is NULL"));
  EXPECT_THAT(zark::fake::CallNames(), IsEmpty());
}

TEST_F(ModuleOpsDetect, SupportFieldsMapToWords) {
  Fake().detectResult.support_upnp = 2;
  Fake().detectResult.support_natpmp = 1;
  Json::Value result(Json::objectValue);
  pf->Detect(result, false);
  EXPECT_EQ("unknown", result["support_upnp"].asString());
  EXPECT_EQ("yes", result["support_natpmp"].asString());

  Fake().detectResult.support_upnp = 0;
  Fake().detectResult.support_natpmp = -1;
  Json::Value again(Json::objectValue);
  pf->Detect(again, false);
  EXPECT_EQ("no", again["support_upnp"].asString());
  EXPECT_EQ("unknown", again["support_natpmp"].asString());
  EXPECT_TRUE(again["router_max_rule"].isInt());
}

TEST_F(ModuleOpsDetect, AutoSaveChangesNothing) {
  Json::Value withSave(Json::objectValue);
  pf->Detect(withSave, true);
  auto callsWithSave = zark::fake::CallNames();
  auto answersWithSave = listener->Names();

  zark::fake::Reset();
  Fake().detectResult = SampleRecord();
  Json::Value withoutSave(Json::objectValue);
  PortForwarding other(
      new StatusReportor(1500, "", "", &response, Json::Value(), false, false));
  other.Detect(withoutSave, false);

  EXPECT_EQ(withSave, withoutSave);
  EXPECT_EQ(callsWithSave, zark::fake::CallNames());
  EXPECT_THAT(callsWithSave, ElementsAre("KLibDetectRouter"));
  EXPECT_EQ(answersWithSave.size() * 2, listener->Names().size());
}

// --- DetectStatus ------------------------------------------------------------

class ModuleOpsDetectStatus : public OpsTest {};

TEST_F(ModuleOpsDetectStatus, RunningRecordAnswersThreeKeys) {
  Json::Value data = ParseJson(R"({"status": "processing", "percentage": 70,
      "progress": {"check_hops_lan2wan_step": {"check_id": 4,
                                               "status": "processing"}},
      "other": 1})");
  Json::Value out;
  ASSERT_TRUE(pf->DetectStatus(out, TaskRecord(data)));
  Json::Value expected = data;
  expected.removeMember("other");
  EXPECT_EQ(expected, out);
}

TEST_F(ModuleOpsDetectStatus, RunningRecordWithoutProgressAnswersNull) {
  Json::Value out;
  ASSERT_TRUE(pf->DetectStatus(
      out,
      TaskRecord(ParseJson(R"({"status": "processing", "percentage": 0})"))));
  ASSERT_TRUE(out.isMember("progress"));
  EXPECT_TRUE(out["progress"].isNull());
  EXPECT_EQ(0, out["percentage"].asInt());
}

TEST_F(ModuleOpsDetectStatus, SuccessInAnyCaseAnswersTheWholeData) {
  Json::Value data = ParseJson(R"({"status": "Success", "percentage": 100,
      "progress": {}, "router_brand": "Netco", "router_max_rule": 32})");
  Json::Value out;
  ASSERT_TRUE(pf->DetectStatus(out, TaskRecord(data, true)));
  EXPECT_EQ(data, out);
}

TEST_F(ModuleOpsDetectStatus, FailedInAnyCaseAnswersTheWholeData) {
  Json::Value data =
      ParseJson(R"({"status": "FAILED", "percentage": 3, "extra": "x"})");
  Json::Value out;
  ASSERT_TRUE(pf->DetectStatus(out, TaskRecord(data, true)));
  EXPECT_EQ(data, out);
}

TEST_F(ModuleOpsDetectStatus, RunStoppedAtAStepAnswersItsFailedStep) {
  // What Detect leaves in the task record after a stop at the hops stage.
  Fake().detectResult = SampleRecord();
  Fake().KLibDetectRouter = [](ZARK_ROUTER_DETECT_RESULT *result,
                               ZARK_DETECT_PROGRESS_CB, void *, bool) {
    *result = Fake().detectResult;
    result->enProgress = 70;
    return -1;
  };
  Json::Value result(Json::objectValue);
  pf->Detect(result, false);
  Json::Value record = TaskRecord(response.GetData(), true);

  Json::Value out;
  ASSERT_TRUE(pf->DetectStatus(out, record));
  EXPECT_EQ("success", out["status"].asString());
  EXPECT_EQ(100, out["percentage"].asInt());
  EXPECT_EQ("failed",
            out["progress"]["check_hops_lan2wan_step"]["status"].asString());
}

TEST_F(ModuleOpsDetectStatus, RecordWithoutPercentageIsRefused) {
  Json::Value out;
  EXPECT_FALSE(pf->DetectStatus(
      out, TaskRecord(ParseJson(R"({"status": "processing"})"))));
  EXPECT_THAT(PfLogs(), ElementsAre("percentage does not exist",
                                    "get status and percentage failed"));
}

TEST_F(ModuleOpsDetectStatus, RecordWithNegativePercentageIsRefused) {
  Json::Value out;
  EXPECT_FALSE(pf->DetectStatus(
      out,
      TaskRecord(ParseJson(R"({"status": "processing", "percentage": -1})"))));
  EXPECT_THAT(PfLogs(), ElementsAre("percentage shall not be negative",
                                    "get status and percentage failed"));
}

TEST_F(ModuleOpsDetectStatus, GetDetectResultCopiesData) {
  Json::Value out = ParseJson(R"({"keep": 1})");
  pf->GetDetectResult(out, TaskRecord(ParseJson(R"({"a": "b"})")));
  EXPECT_EQ(ParseJson(R"({"a": "b"})"), out);
}

TEST_F(ModuleOpsDetectStatus, GetDetectResultWithoutDataLeavesResult) {
  Json::Value out = ParseJson(R"({"keep": 1})");
  pf->GetDetectResult(out, ParseJson(R"({"finish": true})"));
  EXPECT_EQ(ParseJson(R"({"keep": 1})"), out);
  EXPECT_THAT(PfLogs(), ElementsAre("data does not exist"));
}

// --- GetCurrentProcess -----------------------------------------------------

struct ProcessCase {
  int32_t task;
  const char *process;
};

class ModuleOpsCurrentProcess
    : public OpsTest,
      public ::testing::WithParamInterface<ProcessCase> {};

TEST_P(ModuleOpsCurrentProcess, NamesTheRunningJob) {
  int32_t task = GetParam().task;
  Fake().KLibGetLibZarkPortMapRunningTask =
      [task](ZARK_LIBZARKPORTMAP_TASK *record) {
        EXPECT_EQ(0, record->task);
        record->task = task;
        return 0;
      };
  Json::Value result(Json::objectValue);
  ASSERT_TRUE(pf->GetCurrentProcess(result));
  Json::Value expected(Json::objectValue);
  expected["process"] = GetParam().process;
  EXPECT_EQ(expected, result);
}

INSTANTIATE_TEST_SUITE_P(ModuleOpsTasks, ModuleOpsCurrentProcess,
                         ::testing::Values(ProcessCase{1, "autotest"},
                                           ProcessCase{2, "portforwarding"},
                                           ProcessCase{0, "none"},
                                           ProcessCase{3, "none"},
                                           ProcessCase{-1, "none"}));

TEST_F(ModuleOpsCurrentProcess, LibraryFailureAnswersWithoutProcess) {
  Fake().KLibGetLibZarkPortMapRunningTask = [](ZARK_LIBZARKPORTMAP_TASK *) {
    return -1;
  };
  Json::Value result(Json::objectValue);
  EXPECT_FALSE(pf->GetCurrentProcess(result));
  EXPECT_FALSE(result.isMember("process"));
  EXPECT_EQ(1500, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(),
              ElementsAre("KLibGetLibZarkPortMapRunningTask() failed"));
}

} // namespace
} // namespace zark::ops
