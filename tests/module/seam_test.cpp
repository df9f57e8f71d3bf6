// Paths that the real polling facility cannot produce on its own: a task
// listing that fails (the sweep answers 117), and task callbacks called with
// null request or response objects.
#include "module_fixture.h"
#include "polling_seam.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

namespace {

using namespace zark::moduletest;
using zark::fake::CallNames;
using zark::fake::CountCalls;
using zark::fake::Fake;
using State = ZARK::APIResponse::State;

class ModuleSeamFixture : public ModuleFixture {
protected:
  void SetUp() override {
    ModuleFixture::SetUp();
    ResetPollingSeam();
  }
  void TearDown() override {
    ResetPollingSeam();
    ModuleFixture::TearDown();
  }
};

// --- A failing task listing -------------------------------------------------

class ModuleSweepFailure : public ModuleSeamFixture {};

// The stop of the library's test works but the tasks cannot be listed: the
// sweep answers 117 first, then the stop's success replaces it.
TEST_F(ModuleSweepFailure, CompatibilityStopAnswers117ThenSuccess) {
  SetListFails(true);
  ZARK::APIRequest request;
  ZARK::APIResponse response;
  auto recorder = std::make_shared<AnswerRecorder>();
  response.SetListener(recorder);

  CallMethod(kApiCompatibility, "stop", &request, &response);

  std::vector<AnswerRecorder::Event> events = recorder->Events();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_FALSE(events[0].success);
  EXPECT_EQ(events[0].code, 117);
  EXPECT_TRUE(events[0].data.isNull());
  EXPECT_TRUE(events[1].success);
  EXPECT_TRUE(events[1].data.isNull());
  EXPECT_EQ(response.GetState(), State::Success);
  EXPECT_EQ(CountCalls("KLibStopTestUpnpCompatibility"), 1u);
}

TEST_F(ModuleSweepFailure, FailedStopAndListingAnswers117Then1500) {
  SetListFails(true);
  Fake().KLibStopTestUpnpCompatibility = [] { return -1; };
  ZARK::APIRequest request;
  ZARK::APIResponse response;
  auto recorder = std::make_shared<AnswerRecorder>();
  response.SetListener(recorder);

  CallMethod(kApiCompatibility, "stop", &request, &response);

  std::vector<AnswerRecorder::Event> events = recorder->Events();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0].code, 117);
  EXPECT_FALSE(events[1].success);
  EXPECT_EQ(events[1].code, 1500);
  EXPECT_EQ(response.GetErrorCode(), 1500);
}

TEST_F(ModuleSweepFailure, ListingFailureKeepsTheTasks) {
  SetListFails(false);
  std::string id = StartTask(kApiCompatibility, "test", ParseJson("{}"));
  ASSERT_TRUE(WaitTaskFinished(id));
  SetListFails(true);
  Answer answer = Invoke(kApiCompatibility, "stop", Json::Value());
  EXPECT_EQ(answer.state, State::Success);
  SetListFails(false);
  EXPECT_TRUE(TaskExists(id)) << "nothing was listed, so nothing stopped";
}

// The poll that sees a finished task cannot sweep it: the 117 of the sweep
// comes first, then the poll's own answer replaces it, and the task stays.
void AnswerProcessing(ZARK::APIRequest *, ZARK::APIResponse *response, void *) {
  response->SetSuccess(
      ParseJson(R"({"status": "processing", "percentage": 20})"));
}

TEST_F(ModuleSweepFailure, StatusPollAnswers117ThenTheRecord) {
  std::string id = StartRawTask("ZARK.Core.PortForwarding.detect", "admin",
                                AnswerProcessing, nullptr);
  ASSERT_TRUE(WaitTaskFinished(id));
  SetListFails(true);

  ZARK::APIRequest request;
  request.SetParam("task_id", id);
  ZARK::APIResponse response;
  auto recorder = std::make_shared<AnswerRecorder>();
  response.SetListener(recorder);
  CallMethod(kApiPortForwarding, "detect_status", &request, &response);

  std::vector<AnswerRecorder::Event> events = recorder->Events();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0].code, 117);
  EXPECT_TRUE(events[1].success);
  EXPECT_EQ(events[1].data["percentage"], 20);
  SetListFails(false);
  EXPECT_TRUE(TaskExists(id));
}

// --- Task callbacks ---------------------------------------------------------

class ModuleTaskCallback : public ModuleSeamFixture {
protected:
  struct Captured {
    const char *api;
    const char *method;
    CapturedStart start;
  };

  // The callbacks of the five start methods, captured instead of started.
  std::vector<Captured> CaptureAll() {
    struct {
      const char *api;
      const char *method;
      const char *params;
    } starts[] = {
        {kApiPortForwarding, "detect", "{}"},
        {kApiRules, "save", R"({"rules": []})"},
        {kApiRules, "test", "{}"},
        {kApiCompatibility, "test", "{}"},
        {kApiRulesServ, "test", R"({"service_id": "web"})"},
    };
    SetStartCaptures(true);
    std::vector<Captured> captured;
    for (const auto &start : starts) {
      size_t before = CapturedStarts().size();
      Invoke(start.api, start.method, ParseJson(start.params));
      std::vector<CapturedStart> all = CapturedStarts();
      EXPECT_EQ(all.size(), before + 1) << start.api << " " << start.method;
      if (all.size() == before + 1) {
        captured.push_back({start.api, start.method, all.back()});
      }
    }
    SetStartCaptures(false);
    return captured;
  }
};

TEST_F(ModuleTaskCallback, StartsPassNoCallbackArgument) {
  std::vector<Captured> captured = CaptureAll();
  ASSERT_EQ(captured.size(), 5u);
  for (const Captured &c : captured) {
    EXPECT_NE(c.start.callback, nullptr) << c.api << " " << c.method;
    EXPECT_EQ(c.start.argument, nullptr) << c.api << " " << c.method;
  }
}

TEST_F(ModuleTaskCallback, NullRequestOrResponseOnlyLogs) {
  std::vector<Captured> captured = CaptureAll();
  ASSERT_EQ(captured.size(), 5u);
  zark::fake::Reset();
  for (const Captured &c : captured) {
    zark::test::ClearLogs();
    ZARK::APIRequest request(ParseJson(R"({"rules": [], "service_id": "a"})"));
    ZARK::APIResponse response;
    c.start.callback(nullptr, &response, nullptr);
    EXPECT_FALSE(response.IsAnswered()) << c.api << " " << c.method;
    c.start.callback(&request, nullptr, nullptr);
    c.start.callback(nullptr, nullptr, nullptr);
    EXPECT_EQ(CountLogs(kModuleFile, "req or resp is not valid"), 3)
        << c.api << " " << c.method << "\n"
        << DumpLogs();
    EXPECT_EQ(zark::test::CapturedLogs().size(), 3u) << DumpLogs();
  }
  EXPECT_TRUE(CallNames().empty()) << "no operation ran";
}

// Called directly, the save callback runs the save with its own reporter on
// the response it was given.
TEST_F(ModuleTaskCallback, SaveCallbackReportsThroughTheGivenResponse) {
  std::vector<Captured> captured = CaptureAll();
  ASSERT_EQ(captured.size(), 5u);
  const Captured &save = captured[1];
  ASSERT_STREQ(save.method, "save");
  ZARK::APIRequest request(ParseJson(R"({"rules": []})"));
  ZARK::APIResponse response;
  save.start.callback(&request, &response, nullptr);
  EXPECT_EQ(response.GetState(), State::Success) << DumpLogs();
  EXPECT_EQ(response.GetData(),
            ParseJson(R"({"status": "success", "percentage": 100})"));
  EXPECT_EQ(CountCalls("KLibSaveRules"), 1u);
}

TEST_F(ModuleTaskCallback, SaveCallbackWithPolicyOnlyRunsTheSave) {
  std::vector<Captured> captured = CaptureAll();
  ASSERT_EQ(captured.size(), 5u);
  ZARK::APIRequest request(ParseJson(R"({"pf_policy": null})"));
  ZARK::APIResponse response;
  captured[1].start.callback(&request, &response, nullptr);
  // A null policy is present, so the save runs and refuses it itself.
  EXPECT_EQ(CountLogs(kModuleFile, "must input rules or pf_policy"), 0)
      << DumpLogs();
  EXPECT_EQ(CountCalls("KLibZarkPortMapLock"), 1u);
  EXPECT_EQ(response.GetState(), State::Error);
}

} // namespace
