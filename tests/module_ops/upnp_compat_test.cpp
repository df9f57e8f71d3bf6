// UPnP compatibility test: the run, its progress callback, the status read
// from the library's progress file, stop and upload.
#include "ops_test_support.h"

#include <cstring>

namespace zark::ops {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::MatchesRegex;
using zark::fake::Fake;

const char *kProgressFile = "/tmp/upnp_test.progress";

class ModuleOpsUpnpTest : public OpsTest {
protected:
  void SetUp() override {
    OpsTest::SetUp();
    Trace(Fake().KLibTestUpnpCompatibility, "TestUpnp");
    Trace(Fake().KLibWriteRecordIntoUpnpDB, "WriteRecord");
  }

  void FailTest(int error) {
    Fake().KLibTestUpnpCompatibility =
        [error](int, ZARK_ROUTER_TEST_COMPATIBILITY_RESULT *result,
                ZARK_TEST_COMPATIBILITY_PROGRESS_CB, void *, bool) {
          result->error = error;
          return 1;
        };
    Trace(Fake().KLibTestUpnpCompatibility, "TestUpnp");
  }
};

TEST_F(ModuleOpsUpnpTest, PassedTestReportsProgressAndStoresTheRouter) {
  void *seenArg = nullptr;
  Fake().KLibTestUpnpCompatibility =
      [&seenArg](int, ZARK_ROUTER_TEST_COMPATIBILITY_RESULT *result,
                 ZARK_TEST_COMPATIBILITY_PROGRESS_CB callback, void *arg,
                 bool) {
        seenArg = arg;
        EXPECT_EQ(0, result->progress);
        EXPECT_EQ(0, result->error);
        for (int progress : {10, 55}) {
          result->progress = progress;
          callback(result, arg);
        }
        std::strcpy(result->record.brand, "Netco");
        result->record.max_mappings = 12;
        return 0;
      };
  Trace(Fake().KLibTestUpnpCompatibility, "TestUpnp");
  Fake().KLibWriteRecordIntoUpnpDB = [](const ZARK_ROUTER_RECORD *record) {
    EXPECT_STREQ("Netco", record->brand);
    EXPECT_EQ(12, record->max_mappings);
    return 0;
  };
  Trace(Fake().KLibWriteRecordIntoUpnpDB, "WriteRecord");

  pf->UPnPTestStart();
  EXPECT_THAT(timeline.Entries(),
              ElementsAre("TestUpnp", "status processing 10",
                          "status processing 55", "WriteRecord",
                          "status success 0"));
  EXPECT_EQ(static_cast<void *>(Reporter()), seenArg);
  EXPECT_THAT(zark::fake::Calls()[0].args, ElementsAre("60", "true"));
  EXPECT_EQ(ParseJson(R"({"status": "success", "percentage": 0})"),
            response.GetData());
  EXPECT_THAT(PfLogs(), IsEmpty());
}

TEST_F(ModuleOpsUpnpTest, RecordThatCannotBeStoredIsLoggedOnly) {
  Fake().KLibWriteRecordIntoUpnpDB = [](const ZARK_ROUTER_RECORD *) {
    return -1;
  };
  pf->UPnPTestStart();
  EXPECT_THAT(PfLogs(), ElementsAre("KLibWriteRecordIntoUpnpDB() failed"));
  EXPECT_THAT(listener->Names(), ElementsAre("status success 0"));
}

TEST_F(ModuleOpsUpnpTest, ErrorTwoKeeps1501ButStillEndsWithSuccess) {
  FailTest(2);
  pf->UPnPTestStart();
  EXPECT_EQ(1501, pf->GetErrorCode());
  EXPECT_THAT(timeline.Entries(), ElementsAre("TestUpnp", "status success 0"));
  EXPECT_EQ(ZARK::APIResponse::State::Success, response.GetState());
  EXPECT_THAT(PfLogs(), IsEmpty());
}

class ModuleOpsUpnpTestQuiet : public ModuleOpsUpnpTest,
                               public ::testing::WithParamInterface<int> {};

TEST_P(ModuleOpsUpnpTestQuiet, KnownFailureIsSilent) {
  FailTest(GetParam());
  pf->UPnPTestStart();
  EXPECT_THAT(PfLogs(), IsEmpty());
  EXPECT_EQ(1500, pf->GetErrorCode());
  EXPECT_THAT(timeline.Entries(), ElementsAre("TestUpnp", "status success 0"));
}

INSTANTIATE_TEST_SUITE_P(ModuleOpsErrors, ModuleOpsUpnpTestQuiet,
                         ::testing::Range(13, 21));

class ModuleOpsUpnpTestUnknown : public ModuleOpsUpnpTest,
                                 public ::testing::WithParamInterface<int> {};

TEST_P(ModuleOpsUpnpTestUnknown, UnknownFailureIsLogged) {
  FailTest(GetParam());
  pf->UPnPTestStart();
  EXPECT_THAT(PfLogs(), ElementsAre("Unknown compatibility test err=" +
                                    std::to_string(GetParam())));
  EXPECT_EQ(1500, pf->GetErrorCode());
  EXPECT_THAT(timeline.Entries(), ElementsAre("TestUpnp", "status success 0"));
}

INSTANTIATE_TEST_SUITE_P(ModuleOpsErrors, ModuleOpsUpnpTestUnknown,
                         ::testing::Values(-5, 0, 1, 3, 12, 21, 100));

TEST_F(ModuleOpsUpnpTest, NoReporterLogsAndRunsNothing) {
  PortForwarding bare(nullptr);
  bare.UPnPTestStart();
  EXPECT_THAT(PfLogs(), ElementsAre("status reportor is NULL"));
  EXPECT_THAT(zark::fake::CallNames(), IsEmpty());
}

TEST_F(ModuleOpsUpnpTest, ProgressCallbackReportsProcessing) {
  ZARK_ROUTER_TEST_COMPATIBILITY_RESULT result{};
  result.progress = 33;
  testUpnpCompatibilityProgressCB(&result, Reporter());
  EXPECT_THAT(listener->Names(), ElementsAre("status processing 33"));
}

TEST_F(ModuleOpsUpnpTest, ProgressCallbackWithoutReporterLogs) {
  ZARK_ROUTER_TEST_COMPATIBILITY_RESULT result{};
  testUpnpCompatibilityProgressCB(&result, nullptr);
  EXPECT_THAT(PfLogs(), ElementsAre("statusReportor is NULL"));
}

TEST_F(ModuleOpsUpnpTest, ProgressCallbackWithoutResultLogs) {
  testUpnpCompatibilityProgressCB(nullptr, Reporter());
  EXPECT_THAT(PfLogs(), ElementsAre("pCompatibilityResult is NULL"));
  EXPECT_TRUE(listener->Answers().empty());
}

// --- test_status: the progress file ----------------------------------------

class ModuleOpsUpnpStatus : public OpsTest {
protected:
  Json::Value Status(const std::string &content) {
    zark::test::WriteFile(kProgressFile, content);
    return Status();
  }
  Json::Value Status() {
    Json::Value answer(Json::objectValue);
    EXPECT_TRUE(pf->UPnPTestStartStatus(answer, Json::Value("ignored")));
    return answer;
  }
};

TEST_F(ModuleOpsUpnpStatus, MissingFileShowsNothingTestedYet) {
  Json::Value answer = Status();
  EXPECT_EQ(ParseJson(R"({"status": "processing", "percentage": 0, "test": [
      {"test_item": "add", "status": "not_test"},
      {"test_item": "max", "status": "unknown"},
      {"test_item": "del", "status": "unknown"},
      {"test_item": "readd", "status": "unknown"},
      {"test_item": "con_s", "status": "unknown"}]})"),
            answer);
  auto logs = PfLogs();
  ASSERT_EQ(1u, logs.size());
  EXPECT_THAT(logs[0],
              MatchesRegex(R"(init empty\[0x0[0-9A-F]{3} .*:[0-9]+\])"));
  EXPECT_NE(std::string::npos, logs[0].find("[0x0403 ")) << logs[0];
}

TEST_F(ModuleOpsUpnpStatus, AddFinishedWithMaxShowsTwoPassed) {
  Json::Value answer = Status("upnp_add=finished\nupnp_max=12\n");
  EXPECT_EQ(ParseJson(R"({"status": "processing", "percentage": 36, "test": [
      {"test_item": "add", "status": "success"},
      {"test_item": "max", "status": "12"},
      {"test_item": "del", "status": "processing"},
      {"test_item": "readd", "status": "unknown"},
      {"test_item": "con_s", "status": "unknown"}]})"),
            answer);
  EXPECT_THAT(PfLogs(), IsEmpty());
  EXPECT_EQ(2, ParseUPnPTestProgress(answer));
}

TEST_F(ModuleOpsUpnpStatus, FailedInitInCapitalsEndsAtTheFirstItem) {
  Json::Value answer = Status("upnp_init=FAILED\nupnp_add=processing\n");
  EXPECT_EQ(ParseJson(R"({"status": "failed", "percentage": -1, "test": [
      {"test_item": "add", "status": "failed"}]})"),
            answer);
  EXPECT_EQ(-1, ParseUPnPTestProgress(answer));
}

TEST_F(ModuleOpsUpnpStatus, AllFiveStagesPassedIsSuccess) {
  Json::Value answer = Status("upnp_init=success\n"
                              "upnp_add=Finished\n"
                              "upnp_max=8\n"
                              "upnp_delete=FINISHED\n"
                              "upnp_connection_failed=success\n"
                              "upnp_readd1=Success\n"
                              "upnp_readd2=finished\n"
                              "upnp_connection_success=Success\n"
                              "upnp_terminal=finished\n");
  // The con_s state is the file's own text.
  EXPECT_EQ(ParseJson(R"({"status": "success", "percentage": 100, "test": [
      {"test_item": "add", "status": "success"},
      {"test_item": "max", "status": "8"},
      {"test_item": "del", "status": "success"},
      {"test_item": "readd", "status": "success"},
      {"test_item": "con_s", "status": "Success"}]})"),
            answer);
  EXPECT_EQ(5, ParseUPnPTestProgress(answer));
}

struct ItemCase {
  const char *name;
  const char *content;
  int passed;             // ParseUPnPTestProgress result
  const char *lastItem;   // item at which evaluation stopped or the last
  const char *lastStatus; // its state
  const char *log;        // "" for none
};

class ModuleOpsUpnpItems : public ModuleOpsUpnpStatus,
                           public ::testing::WithParamInterface<ItemCase> {};

TEST_P(ModuleOpsUpnpItems, EvaluatesItems) {
  const ItemCase &c = GetParam();
  zark::test::WriteFile(kProgressFile, c.content);
  Json::Value answer(Json::objectValue);
  EXPECT_EQ(c.passed, ParseUPnPTestProgress(answer));
  ASSERT_TRUE(answer["test"].isArray());
  ASSERT_GT(answer["test"].size(), 0u);
  const Json::Value &last = answer["test"][answer["test"].size() - 1];
  EXPECT_EQ(c.lastItem, last["test_item"].asString());
  EXPECT_EQ(c.lastStatus, last["status"].asString());
  if (c.passed < 0) {
    EXPECT_EQ(c.lastItem, last["test_item"].asString());
  } else {
    EXPECT_EQ(5u, answer["test"].size());
  }
  if (std::string(c.log).empty()) {
    EXPECT_THAT(PfLogs(), IsEmpty());
  } else {
    auto logs = PfLogs();
    ASSERT_EQ(1u, logs.size());
    EXPECT_THAT(logs[0], MatchesRegex(c.log));
  }
}

// Items before the last one in these cases are checked by the full-answer
// tests above; here each case pins one rule.
INSTANTIATE_TEST_SUITE_P(
    ModuleOpsRules, ModuleOpsUpnpItems,
    ::testing::Values(
        ItemCase{"AddFailed", "upnp_add=failed\n", -1, "add", "failed", ""},
        ItemCase{"AddFinishedMaxMinusOne", "upnp_add=finished\nupnp_max=-1\n",
                 -1, "add", "failed", ""},
        ItemCase{"AddFinishedMaxZero",
                 "upnp_add=finished\nupnp_max=0\nupnp_readd1=x\n", 0, "con_s",
                 "unknown", ""},
        ItemCase{"MaxMinusOneWhileAdding", "upnp_add=processing\nupnp_max=-1\n",
                 -1, "max", "failed", ""},
        ItemCase{"DelFailed",
                 "upnp_add=finished\nupnp_max=5\nupnp_delete=failed\n", -1,
                 "del", "failed", ""},
        ItemCase{"ConFFailed",
                 "upnp_add=finished\nupnp_max=5\nupnp_delete=processing\n"
                 "upnp_connection_failed=Failed\n",
                 -1, "del", "failed", ""},
        ItemCase{
            "DelOddPairLogged",
            "upnp_add=finished\nupnp_max=5\nupnp_delete=processing\n"
            "upnp_connection_failed=success\n",
            -1, "del", "failed",
            R"(==del:\[processing\] con_f:\[success\]\[0x[0-9A-F]{4} .*:[0-9]+\])"},
        ItemCase{"ReaddOneFailed", "upnp_readd1=failed\nupnp_readd2=finished\n",
                 -1, "readd", "failed", ""},
        ItemCase{"ReaddTwoFailed", "upnp_readd1=success\nupnp_readd2=FAILED\n",
                 -1, "readd", "failed", ""},
        ItemCase{"ConSFailed", "upnp_connection_success=failed\n", -1, "con_s",
                 "failed", ""},
        ItemCase{"ConSWithoutTerminal", "upnp_connection_success=success\n", 0,
                 "con_s", "processing", ""},
        ItemCase{"ConSPassesOutOfOrder",
                 "upnp_connection_success=success\nupnp_terminal=Finished\n", 1,
                 "con_s", "success", ""}),
    [](const ::testing::TestParamInfo<ItemCase> &info) {
      return std::string(info.param.name);
    });

TEST_F(ModuleOpsUpnpStatus, AddWithoutMaxIsProcessing) {
  Json::Value answer = Status("upnp_init=success\nupnp_add=finished\n");
  EXPECT_EQ("processing", answer["test"][0]["status"].asString());
  EXPECT_EQ("unknown", answer["test"][1]["status"].asString());
  EXPECT_EQ(0, answer["percentage"].asInt());
}

TEST_F(ModuleOpsUpnpStatus, MaxThatIsNoNumberIsProcessing) {
  Json::Value answer = Status("upnp_add=processing\nupnp_max=abc\n");
  EXPECT_EQ("processing", answer["test"][0]["status"].asString());
  EXPECT_EQ("processing", answer["test"][1]["status"].asString());
}

TEST_F(ModuleOpsUpnpStatus, MaxCountsEvenWhenAddHasNotPassed) {
  // n counts every passing item: "max" passes alone, so "del" with nothing
  // yet is "unknown" (n is 1, not 2).
  Json::Value answer = Status("upnp_max=5\n");
  EXPECT_EQ(ParseJson(R"([
      {"test_item": "add", "status": "not_test"},
      {"test_item": "max", "status": "5"},
      {"test_item": "del", "status": "unknown"},
      {"test_item": "readd", "status": "unknown"},
      {"test_item": "con_s", "status": "unknown"}])"),
            answer["test"]);
  EXPECT_EQ(18, answer["percentage"].asInt());
}

TEST_F(ModuleOpsUpnpStatus, DelWaitsForTheConnectionCheck) {
  Json::Value answer =
      Status("upnp_add=finished\nupnp_max=5\nupnp_delete=finished\n");
  EXPECT_EQ("processing", answer["test"][2]["status"].asString());
  answer = Status("upnp_add=finished\nupnp_max=5\nupnp_delete=finished\n"
                  "upnp_connection_failed=Processing\n");
  EXPECT_EQ("processing", answer["test"][2]["status"].asString());
  // Three passed: readd is next and shows processing.
  answer = Status("upnp_add=finished\nupnp_max=5\nupnp_delete=finished\n"
                  "upnp_connection_failed=success\n");
  EXPECT_EQ("success", answer["test"][2]["status"].asString());
  EXPECT_EQ("processing", answer["test"][3]["status"].asString());
  EXPECT_EQ(54, answer["percentage"].asInt());
}

TEST_F(ModuleOpsUpnpStatus, ReaddStates) {
  Json::Value answer = Status("upnp_readd1=success\n");
  EXPECT_EQ("processing", answer["test"][3]["status"].asString());
  answer = Status("upnp_readd1=success\nupnp_readd2=3/10\n");
  EXPECT_EQ("3/10", answer["test"][3]["status"].asString());
  // Finished second half without a successful first half: the text itself.
  answer = Status("upnp_readd1=processing\nupnp_readd2=finished\n");
  EXPECT_EQ("finished", answer["test"][3]["status"].asString());
}

TEST_F(ModuleOpsUpnpStatus, FourPassedShowsConSProcessing) {
  Json::Value answer = Status("upnp_add=finished\nupnp_max=5\n"
                              "upnp_delete=finished\n"
                              "upnp_connection_failed=success\n"
                              "upnp_readd1=success\nupnp_readd2=finished\n");
  EXPECT_EQ("processing", answer["test"][4]["status"].asString());
  EXPECT_EQ("processing", answer["status"].asString());
  EXPECT_EQ(72, answer["percentage"].asInt());
}

TEST_F(ModuleOpsUpnpStatus, SetStatusWritesBothKeys) {
  Json::Value answer = ParseJson(R"({"test": []})");
  SetUPnPTestStatus(answer, "failed", -1);
  EXPECT_EQ(ParseJson(R"({"test": [], "status": "failed", "percentage": -1})"),
            answer);
}

// --- stop and upload ---------------------------------------------------------

class ModuleOpsUpnpControl : public OpsTest {};

TEST_F(ModuleOpsUpnpControl, StopSucceedsWithNullResult) {
  Json::Value result;
  EXPECT_TRUE(pf->UPnPTestStop(result));
  EXPECT_TRUE(result.isNull());
  EXPECT_THAT(zark::fake::CallNames(),
              ElementsAre("KLibStopTestUpnpCompatibility"));
}

TEST_F(ModuleOpsUpnpControl, StopFailureLogsAndAnswers1500) {
  Fake().KLibStopTestUpnpCompatibility = [] { return -1; };
  Json::Value result;
  EXPECT_FALSE(pf->UPnPTestStop(result));
  EXPECT_EQ(1500, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("KLibStopTestUpnpCompatibility() failed"));
}

TEST_F(ModuleOpsUpnpControl, UploadSucceedsOnZeroOrMore) {
  Fake().KLibUploadTestUpnpCompatibilityFailResult = [] { return 3; };
  Json::Value result;
  EXPECT_TRUE(pf->UploadUPnPTestStartResult(result));
  EXPECT_TRUE(result.isNull());
}

TEST_F(ModuleOpsUpnpControl, UploadFailureIsSilentWith1500) {
  Fake().KLibUploadTestUpnpCompatibilityFailResult = [] { return -1; };
  Json::Value result;
  EXPECT_FALSE(pf->UploadUPnPTestStartResult(result));
  EXPECT_TRUE(result.isNull());
  EXPECT_EQ(1500, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), IsEmpty());
}

} // namespace
} // namespace zark::ops
