// The status reporter: reports into the response it holds, and reads a
// task record back.
#include "StatusReportor.h"

#include "module_test.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

namespace {

using zark::moduletest::CountLogs;
using zark::moduletest::DumpLogs;
using zark::moduletest::FindLog;
using zark::moduletest::kReporterFile;
using zark::moduletest::ParseJson;
using State = ZARK::APIResponse::State;

class ModuleStatusReportor : public testing::Test {
protected:
  void SetUp() override { zark::test::ClearLogs(); }

  // A reporter with the defaults of a request.
  static std::unique_ptr<StatusReportor> Reporter(ZARK::APIResponse *response) {
    return std::make_unique<StatusReportor>(1500, "", "", response,
                                            Json::Value(), false, false);
  }

  ZARK::APIResponse mResponse;
};

TEST_F(ModuleStatusReportor, ConstructorKeepsEveryArgument) {
  Json::Value append = ParseJson(R"({"max_port": 10})");
  StatusReportor reportor(1521, "sec", "key", &mResponse, append, true, true);
  EXPECT_EQ(reportor.mErrorCode, 1521);
  EXPECT_EQ(reportor.mSection, "sec");
  EXPECT_EQ(reportor.mKey, "key");
  EXPECT_EQ(reportor.mResponse, &mResponse);
  EXPECT_EQ(reportor.mAppendData, append);
  EXPECT_TRUE(reportor.GetSuccess());
  EXPECT_TRUE(reportor.IsFinished());
}

TEST_F(ModuleStatusReportor, DefaultsOfARequest) {
  auto reportor = Reporter(&mResponse);
  EXPECT_EQ(reportor->mErrorCode, 1500);
  EXPECT_TRUE(reportor->mSection.empty());
  EXPECT_TRUE(reportor->mKey.empty());
  EXPECT_TRUE(reportor->mAppendData.isNull());
  EXPECT_FALSE(reportor->GetSuccess());
  EXPECT_FALSE(reportor->IsFinished());
}

TEST_F(ModuleStatusReportor, NullResponseFailsEveryReportWithOneLineEach) {
  auto reportor = Reporter(nullptr);
  Json::Value data = ParseJson(R"({"k": 1})");

  EXPECT_FALSE(reportor->ReportStatus(data));
  EXPECT_FALSE(reportor->ReportStatus(40));
  EXPECT_FALSE(reportor->ReportStatus("processing", 40));
  EXPECT_FALSE(reportor->ReportStatus(data, "processing", 40));
  EXPECT_FALSE(reportor->SetAppendErrorData(data));
  EXPECT_FALSE(reportor->ReportError());

  // The data report and the error report say "reponser"; the others say
  // "reportor". One line per call, in call order.
  auto lines = zark::test::CapturedLogs();
  ASSERT_EQ(lines.size(), 6u) << DumpLogs();
  const char *expected[] = {
      "status reponser shall not be NULL", "status reportor shall not be NULL",
      "status reportor shall not be NULL", "status reportor shall not be NULL",
      "status reportor shall not be NULL", "status reponser shall not be NULL",
  };
  int from = 0;
  for (const char *text : expected) {
    int at = FindLog(kReporterFile, text, from);
    EXPECT_EQ(at, from) << text << "\n" << DumpLogs();
    from = at + 1;
  }
  // Nothing was appended through the missing response.
  EXPECT_TRUE(reportor->mAppendData.isNull());
}

TEST_F(ModuleStatusReportor, ReportStatusDataAnswersSuccessWithTheData) {
  auto reportor = Reporter(&mResponse);
  Json::Value data = ParseJson(R"({"status": "begin", "x": [1, 2]})");
  EXPECT_TRUE(reportor->ReportStatus(data));
  EXPECT_EQ(mResponse.GetState(), State::Success);
  EXPECT_EQ(mResponse.GetData(), data);
  EXPECT_TRUE(zark::test::CapturedLogs().empty());
}

TEST_F(ModuleStatusReportor, ReportStatusPercentageAnswersPercentageOnly) {
  auto reportor = Reporter(&mResponse);
  EXPECT_TRUE(reportor->ReportStatus(40));
  EXPECT_EQ(mResponse.GetData(), ParseJson(R"({"percentage": 40})"));
}

TEST_F(ModuleStatusReportor, ReportStatusWordAndPercentage) {
  auto reportor = Reporter(&mResponse);
  EXPECT_TRUE(reportor->ReportStatus("processing", 5));
  EXPECT_EQ(mResponse.GetData(),
            ParseJson(R"({"status": "processing", "percentage": 5})"));
}

TEST_F(ModuleStatusReportor,
       ReportStatusWithDataOverwritesStatusAndPercentage) {
  auto reportor = Reporter(&mResponse);
  Json::Value data = ParseJson(R"({"status": "x", "percentage": 3, "k": 1})");
  Json::Value before = data;
  EXPECT_TRUE(reportor->ReportStatus(data, "processing", 40));
  EXPECT_EQ(mResponse.GetData(),
            ParseJson(R"({"status": "processing", "percentage": 40, "k": 1})"));
  EXPECT_EQ(data, before) << "the caller's data is copied, not changed";
}

TEST_F(ModuleStatusReportor, ReportStatusWithNullDataBuildsAnObject) {
  auto reportor = Reporter(&mResponse);
  EXPECT_TRUE(reportor->ReportStatus(Json::Value(), "success", 100));
  EXPECT_EQ(mResponse.GetData(),
            ParseJson(R"({"status": "success", "percentage": 100})"));
}

TEST_F(ModuleStatusReportor, SetAppendErrorDataReplacesWithACopy) {
  auto reportor = Reporter(&mResponse);
  Json::Value first = ParseJson(R"({"max_port": 1})");
  Json::Value second = ParseJson(R"("bad text")");
  EXPECT_TRUE(reportor->SetAppendErrorData(first));
  EXPECT_TRUE(reportor->SetAppendErrorData(second));
  second = "changed afterwards";
  EXPECT_EQ(reportor->mAppendData, Json::Value("bad text"));
  EXPECT_FALSE(mResponse.IsAnswered()) << "appending answers nothing";
}

TEST_F(ModuleStatusReportor, ReportErrorAnswersCodeSectionKeyAndAppend) {
  auto reportor = Reporter(&mResponse);
  reportor->mErrorCode = 1523;
  reportor->mSection = "rules";
  reportor->mKey = "router_port";
  ASSERT_TRUE(reportor->SetAppendErrorData(
      ParseJson(R"({"max_port": 100, "max_range": 10})")));
  EXPECT_TRUE(reportor->ReportError());
  EXPECT_EQ(mResponse.GetState(), State::Error);
  EXPECT_EQ(mResponse.GetErrorCode(), 1523);
  EXPECT_EQ(mResponse.GetErrorData(), ParseJson(R"({
      "sec": "rules", "key": "router_port",
      "append": {"max_port": 100, "max_range": 10}})"));
}

TEST_F(ModuleStatusReportor, ReportErrorWithDefaultsAnswers1500) {
  auto reportor = Reporter(&mResponse);
  EXPECT_TRUE(reportor->ReportError());
  EXPECT_EQ(mResponse.GetErrorCode(), 1500);
  EXPECT_EQ(mResponse.GetErrorData(),
            ParseJson(R"({"sec": "", "key": "", "append": null})"));
}

TEST_F(ModuleStatusReportor, DestroyingLeavesTheResponseAsItWas) {
  auto reportor = Reporter(&mResponse);
  ASSERT_TRUE(reportor->ReportStatus("processing", 1));
  reportor.reset();
  EXPECT_EQ(mResponse.GetState(), State::Success);
  EXPECT_EQ(mResponse.GetData(),
            ParseJson(R"({"status": "processing", "percentage": 1})"));
}

// --- Reading a task record back -------------------------------------------

TEST_F(ModuleStatusReportor, LoadFinishedStoresTheFlag) {
  auto reportor = Reporter(&mResponse);
  EXPECT_TRUE(reportor->LoadFinished(ParseJson(R"({"finish": true})")));
  EXPECT_TRUE(reportor->IsFinished());
  EXPECT_TRUE(reportor->LoadFinished(ParseJson(R"({"finish": false})")));
  EXPECT_FALSE(reportor->IsFinished());
  EXPECT_TRUE(zark::test::CapturedLogs().empty());
}

TEST_F(ModuleStatusReportor, LoadFinishedMissingIsRefused) {
  auto reportor = Reporter(&mResponse);
  reportor->mFinished = true;
  EXPECT_FALSE(reportor->LoadFinished(ParseJson(R"({"success": true})")));
  EXPECT_TRUE(reportor->IsFinished()) << "unchanged";
  EXPECT_EQ(CountLogs(kReporterFile, "finish does not exist"), 1) << DumpLogs();
}

TEST_F(ModuleStatusReportor, LoadFinishedIntegerOneIsRefused) {
  auto reportor = Reporter(&mResponse);
  EXPECT_FALSE(reportor->LoadFinished(ParseJson(R"({"finish": 1})")));
  EXPECT_FALSE(reportor->IsFinished());
  EXPECT_EQ(CountLogs(kReporterFile, "finish shall be bool type"), 1)
      << DumpLogs();
}

TEST_F(ModuleStatusReportor, LoadSuccessStoresTheFlag) {
  auto reportor = Reporter(&mResponse);
  EXPECT_TRUE(reportor->LoadSuccess(ParseJson(R"({"success": true})")));
  EXPECT_TRUE(reportor->GetSuccess());
  EXPECT_TRUE(reportor->LoadSuccess(ParseJson(R"({"success": false})")));
  EXPECT_FALSE(reportor->GetSuccess());
}

TEST_F(ModuleStatusReportor, LoadSuccessMissingIsRefused) {
  auto reportor = Reporter(&mResponse);
  reportor->mSuccess = true;
  EXPECT_FALSE(reportor->LoadSuccess(ParseJson(R"({"finish": true})")));
  EXPECT_TRUE(reportor->GetSuccess()) << "unchanged";
  EXPECT_EQ(CountLogs(kReporterFile, "success does not exist"), 1)
      << DumpLogs();
}

TEST_F(ModuleStatusReportor, LoadSuccessOfOtherTypeIsRefused) {
  auto reportor = Reporter(&mResponse);
  EXPECT_FALSE(reportor->LoadSuccess(ParseJson(R"({"success": "true"})")));
  EXPECT_FALSE(reportor->GetSuccess());
  EXPECT_EQ(CountLogs(kReporterFile, "success shall be bool type"), 1)
      << DumpLogs();
}

TEST_F(ModuleStatusReportor, LoadErrorCodeStoresTheCode) {
  auto reportor = Reporter(&mResponse);
  EXPECT_TRUE(reportor->LoadErrorCode(
      ParseJson(R"({"error": {"code": 1503, "errors": {}}})")));
  EXPECT_EQ(reportor->mErrorCode, 1503);
}

// Each refusal of LoadErrorCode with its one log line; the code stays.
TEST_F(ModuleStatusReportor, LoadErrorCodeRefusals) {
  struct Case {
    const char *record;
    const char *message;
  } cases[] = {
      {R"({"finish": true})", "error does not exist"},
      {R"({"error": {"errors": {"append": 1}}})", "error code does not exist"},
      {R"({"error": {"code": "1501"}})", "error code shall be int type"},
      {R"({"error": {"code": 1.5}})", "error code shall be int type"},
      {R"({"error": 7})", "error code does not exist"},
  };
  for (const Case &c : cases) {
    zark::test::ClearLogs();
    auto reportor = Reporter(&mResponse);
    reportor->mErrorCode = 42;
    EXPECT_FALSE(reportor->LoadErrorCode(ParseJson(c.record))) << c.record;
    EXPECT_EQ(reportor->mErrorCode, 42) << c.record;
    EXPECT_EQ(CountLogs(kReporterFile, c.message), 1) << c.record << "\n"
                                                      << DumpLogs();
    EXPECT_EQ(zark::test::CapturedLogs().size(), 1u) << DumpLogs();
  }
}

TEST_F(ModuleStatusReportor, LoadErrorAppendDataCopiesAppend) {
  auto reportor = Reporter(&mResponse);
  EXPECT_TRUE(reportor->LoadErrorAppendData(ParseJson(R"(
      {"error": {"code": 1, "errors": {"sec": "s", "key": "k",
                                       "append": {"max_port": 5}}}})")));
  EXPECT_EQ(reportor->mAppendData, ParseJson(R"({"max_port": 5})"));
  EXPECT_TRUE(reportor->mSection.empty()) << "section is not read";
  EXPECT_TRUE(reportor->mKey.empty()) << "key is not read";
}

// A missing "errors" logs the same text as a missing code.
TEST_F(ModuleStatusReportor, LoadErrorAppendDataRefusals) {
  struct Case {
    const char *record;
    const char *message;
  } cases[] = {
      {R"({"success": false})", "error does not exist"},
      {R"({"error": {"code": 1500}})", "error code does not exist"},
      {R"({"error": {"code": 1500, "errors": {"sec": ""}}})",
       "key does not exist"},
      {R"({"error": {"code": 1500, "errors": "text"}})", "key does not exist"},
      {R"({"error": {"code": 1500, "errors": null}})", "key does not exist"},
  };
  for (const Case &c : cases) {
    zark::test::ClearLogs();
    auto reportor = Reporter(&mResponse);
    reportor->mAppendData = "before";
    EXPECT_FALSE(reportor->LoadErrorAppendData(ParseJson(c.record)))
        << c.record;
    EXPECT_EQ(reportor->mAppendData, Json::Value("before")) << c.record;
    EXPECT_EQ(CountLogs(kReporterFile, c.message), 1) << c.record << "\n"
                                                      << DumpLogs();
    EXPECT_EQ(zark::test::CapturedLogs().size(), 1u) << DumpLogs();
  }
}

TEST_F(ModuleStatusReportor, LoadErrorRestoresCodeAndAppendOnly) {
  auto reportor = Reporter(&mResponse);
  reportor->mSection = "mine";
  reportor->mKey = "also mine";
  EXPECT_TRUE(reportor->LoadError(ParseJson(R"(
      {"error": {"code": 1521, "errors": {"sec": "s", "key": "k",
                                          "append": {"max_port": 9}}}})")));
  EXPECT_EQ(reportor->mErrorCode, 1521);
  EXPECT_EQ(reportor->mAppendData, ParseJson(R"({"max_port": 9})"));
  EXPECT_EQ(reportor->mSection, "mine");
  EXPECT_EQ(reportor->mKey, "also mine");
  EXPECT_TRUE(zark::test::CapturedLogs().empty()) << DumpLogs();
}

TEST_F(ModuleStatusReportor, LoadErrorWithoutAppendFailsAfterReplacingCode) {
  auto reportor = Reporter(&mResponse);
  EXPECT_FALSE(reportor->LoadError(ParseJson(
      R"({"error": {"code": 1503, "errors": {"sec": "", "key": ""}}})")));
  EXPECT_EQ(reportor->mErrorCode, 1503) << "the code was replaced first";
  EXPECT_TRUE(reportor->mAppendData.isNull());
  int key = FindLog(kReporterFile, "key does not exist");
  int append = FindLog(kReporterFile, "can not get error append data");
  EXPECT_EQ(key, 0) << DumpLogs();
  EXPECT_EQ(append, 1) << DumpLogs();
  EXPECT_EQ(zark::test::CapturedLogs().size(), 2u) << DumpLogs();
}

TEST_F(ModuleStatusReportor, LoadErrorWithoutCodeStopsAtTheCode) {
  auto reportor = Reporter(&mResponse);
  EXPECT_FALSE(reportor->LoadError(
      ParseJson(R"({"error": {"errors": {"append": {"max_port": 1}}}})")));
  EXPECT_EQ(reportor->mErrorCode, 1500);
  EXPECT_TRUE(reportor->mAppendData.isNull()) << "append data not read";
  EXPECT_EQ(FindLog(kReporterFile, "error code does not exist"), 0)
      << DumpLogs();
  EXPECT_EQ(FindLog(kReporterFile, "can not get error code"), 1) << DumpLogs();
  EXPECT_EQ(zark::test::CapturedLogs().size(), 2u) << DumpLogs();
}

TEST_F(ModuleStatusReportor,
       RecordsThatAreNotObjectsAreRefusedWithoutThrowing) {
  const char *records[] = {"[1, 2]", R"("text")", "null", "17"};
  for (const char *text : records) {
    auto reportor = Reporter(&mResponse);
    Json::Value record = ParseJson(text);
    EXPECT_NO_THROW({
      EXPECT_FALSE(reportor->LoadFinished(record)) << text;
      EXPECT_FALSE(reportor->LoadSuccess(record)) << text;
      EXPECT_FALSE(reportor->LoadErrorCode(record)) << text;
      EXPECT_FALSE(reportor->LoadErrorAppendData(record)) << text;
      EXPECT_FALSE(reportor->LoadError(record)) << text;
    });
    // "error" that is an array is not an error object either.
    EXPECT_NO_THROW(EXPECT_FALSE(reportor->LoadError(
        ParseJson(R"({"error": [1], "finish": [], "success": {}})"))));
  }
}

// A task record as the host keeps it, read back and passed on: the answer
// carries the record's code and append data with empty section and key.
TEST_F(ModuleStatusReportor, ErrorPassedOnFromARecordHasEmptySectionAndKey) {
  ZARK::APIResponse task;
  auto writer = Reporter(&task);
  writer->mErrorCode = 1524;
  writer->mSection = "sec";
  writer->mKey = "key";
  ASSERT_TRUE(writer->SetAppendErrorData(ParseJson(R"({"max_port": 32})")));
  ASSERT_TRUE(writer->ReportError());

  Json::Value record(Json::objectValue);
  record["finish"] = true;
  record["success"] = false;
  record["error"]["code"] = task.GetErrorCode();
  record["error"]["errors"] = task.GetErrorData();

  auto reader = Reporter(&mResponse);
  ASSERT_TRUE(reader->LoadError(record));
  ASSERT_TRUE(reader->ReportError());
  EXPECT_EQ(mResponse.GetErrorCode(), 1524);
  EXPECT_EQ(mResponse.GetErrorData(), ParseJson(R"(
      {"sec": "", "key": "", "append": {"max_port": 32}})"));
}

} // namespace
