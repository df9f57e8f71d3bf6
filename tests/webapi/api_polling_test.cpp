#include "syslog_capture.h"
#include "task_test_support.h"
#include "webapi.h"

#include <gtest/gtest.h>

#include <syslog.h>

#include <atomic>
#include <chrono>
#include <regex>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

namespace {

using ZARK::APIPolling;
using ZARK::APIRequest;
using ZARK::APIResponse;
using zark::test::Gate;
using zark::test::WaitUntil;
using zark::test::WebAPITaskTest;

Json::Value Strings(std::initializer_list<std::string> items) {
  Json::Value array(Json::arrayValue);
  for (const auto &item : items) {
    array.append(item);
  }
  return array;
}

Json::Value Object(const std::string &key, const Json::Value &value) {
  Json::Value object(Json::objectValue);
  object[key] = value;
  return object;
}

Json::Value RunningRecord() {
  Json::Value record(Json::objectValue);
  record["finish"] = false;
  record["success"] = true;
  record["data"] = Json::Value(Json::objectValue);
  return record;
}

void DoNothing(APIRequest *, APIResponse *, void *) {}

using WebAPIPolling = WebAPITaskTest;

// Start

TEST_F(WebAPIPolling, StartAnswersTaskIdBuiltFromPrefix) {
  APIPolling polling;
  polling.SetGroupAttr("admin");
  polling.SetPrefixAttr("ZARK.Core.PortForwarding.detect");
  APIResponse response;
  ASSERT_TRUE(polling.Start(&response, DoNothing, nullptr));
  ASSERT_TRUE(response.IsSuccess());
  const Json::Value data = response.GetData();
  ASSERT_TRUE(data.isObject());
  EXPECT_EQ(data.size(), 1u);
  ASSERT_TRUE(data["task_id"].isString());
  EXPECT_TRUE(std::regex_match(
      data["task_id"].asString(),
      std::regex(R"(ZARK\.Core\.PortForwarding\.detect#[0-9a-f]{16})")))
      << data["task_id"].asString();
}

TEST_F(WebAPIPolling, TaskIdsDiffer) {
  const std::string first = StartWaitingTask();
  const std::string second = StartWaitingTask();
  ASSERT_FALSE(first.empty());
  ASSERT_FALSE(second.empty());
  EXPECT_NE(first, second);
}

TEST_F(WebAPIPolling, StartWithoutPrefixFails) {
  zark::test::ClearLogs();
  APIPolling polling;
  polling.SetGroupAttr("admin");
  APIResponse response;
  EXPECT_FALSE(polling.Start(&response, DoNothing, nullptr));
  EXPECT_EQ(response.GetState(), APIResponse::State::Error);
  EXPECT_EQ(response.GetErrorCode(), ZARK::WEBAPI_ERR_TASK_START);
  EXPECT_TRUE(zark::test::HasLogContaining("no prefix set"));
  Json::Value result;
  ASSERT_TRUE(polling.List("", Strings({"admin"}), result));
  EXPECT_EQ(result["admin"].size(), 0u);
}

TEST_F(WebAPIPolling, StartWithoutCallbackFails) {
  APIPolling polling;
  polling.SetPrefixAttr("T.task");
  APIResponse response;
  EXPECT_FALSE(polling.Start(&response, nullptr, nullptr));
  EXPECT_EQ(response.GetErrorCode(), ZARK::WEBAPI_ERR_TASK_START);
}

TEST_F(WebAPIPolling, StartWithoutResponseFails) {
  APIPolling polling;
  polling.SetPrefixAttr("T.task");
  EXPECT_FALSE(polling.Start(nullptr, DoNothing, nullptr));
  Json::Value result;
  ASSERT_TRUE(polling.List("", Strings({""}), result));
  EXPECT_EQ(result[""].size(), 0u);
}

TEST_F(WebAPIPolling, CallbackGetsACopyOfTheRequestAndTheArgument) {
  APIRequest request(Object("rules", "r1"));
  const APIRequest *seen = nullptr;
  Json::Value seenRules;
  Gate started;
  const std::string id = StartTask(
      [&](APIRequest *taskRequest, APIResponse *) {
        seen = taskRequest;
        started.Open();
        mRelease.Wait();
        seenRules = taskRequest->GetParam("rules", Json::Value());
      },
      "T.task", "admin", false, &request);
  ASSERT_FALSE(id.empty());
  ASSERT_TRUE(started.Wait());
  request.SetParam("rules", "changed after start");
  mRelease.Open();
  ASSERT_TRUE(WaitUntil([&] { return IsFinished(id); }));
  EXPECT_NE(seen, &request);
  EXPECT_EQ(seenRules.asString(), "r1");
}

TEST_F(WebAPIPolling, CallbackWithoutRequestGetsAnEmptyOne) {
  bool gotRequest = false;
  bool gotResponse = false;
  bool empty = false;
  const std::string id =
      StartTask([&](APIRequest *request, APIResponse *response) {
        gotRequest = request != nullptr;
        gotResponse = response != nullptr;
        empty = request != nullptr && request->GetParams().isObject() &&
                request->GetParams().empty();
      });
  ASSERT_TRUE(WaitUntil([&] { return IsFinished(id); }));
  EXPECT_TRUE(gotRequest);
  EXPECT_TRUE(gotResponse);
  EXPECT_TRUE(empty);
}

// Records

// Copied after the bounded wait for a first answer that never comes.
TEST_F(WebAPIPolling, RecordOfARunningTaskThatHasNotAnswered) {
  const std::string id = StartWaitingTask();
  ASSERT_FALSE(id.empty());
  EXPECT_EQ(Record(id), RunningRecord());
}

// A poll that comes before the task's thread has answered (here: held back
// by a gate that another thread opens a moment later) waits for the first
// answer instead of copying the empty record.
TEST_F(WebAPIPolling, StatusWaitsForTheFirstAnswerOfATaskThatHasNotAnswered) {
  Gate start;
  Json::Value progress(Json::objectValue);
  progress["status"] = "processing";
  progress["percentage"] = 1;
  const std::string id = StartTask([&](APIRequest *, APIResponse *response) {
    start.Wait();
    response->SetSuccess(progress);
    mRelease.Wait();
  });
  ASSERT_FALSE(id.empty());
  std::thread opener([&] {
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    start.Open();
  });
  const Json::Value record = Record(id);
  opener.join();
  Json::Value expected = RunningRecord();
  expected["data"] = progress;
  EXPECT_EQ(record, expected);
  mRelease.Open();
}

TEST_F(WebAPIPolling, RecordFollowsSuccessWhileRunningAndAfterFinish) {
  Gate reported;
  Json::Value progress(Json::objectValue);
  progress["status"] = "processing";
  progress["percentage"] = 40;
  const std::string id = StartTask([&](APIRequest *, APIResponse *response) {
    response->SetSuccess(progress);
    reported.Open();
    mRelease.Wait();
  });
  ASSERT_TRUE(reported.Wait());

  Json::Value expected = RunningRecord();
  expected["data"] = progress;
  EXPECT_EQ(Record(id), expected);

  mRelease.Open();
  ASSERT_TRUE(WaitUntil([&] { return IsFinished(id); }));
  expected["finish"] = true;
  EXPECT_EQ(Record(id), expected);
}

TEST_F(WebAPIPolling, TaskThatNeverAnswersFinishesWithEmptyData) {
  const std::string id = StartTask([](APIRequest *, APIResponse *) {});
  ASSERT_TRUE(WaitUntil([&] { return IsFinished(id); }));
  Json::Value expected = RunningRecord();
  expected["finish"] = true;
  EXPECT_EQ(Record(id), expected);
}

TEST_F(WebAPIPolling, SetErrorInTaskKeepsDataAndAddsError) {
  Json::Value errors(Json::objectValue);
  errors["sec"] = "error";
  errors["key"] = "port_conflict";
  errors["append"] = Object("port", "80");
  const std::string id = StartTask([&](APIRequest *, APIResponse *response) {
    response->SetSuccess(Object("percentage", 5));
    response->SetError(1521, errors);
  });
  ASSERT_TRUE(WaitUntil([&] { return IsFinished(id); }));

  const Json::Value record = Record(id);
  EXPECT_TRUE(record["finish"].asBool());
  ASSERT_TRUE(record["success"].isBool());
  EXPECT_FALSE(record["success"].asBool());
  EXPECT_EQ(record["data"], Object("percentage", 5));
  ASSERT_TRUE(record["error"].isObject());
  EXPECT_EQ(record["error"].size(), 2u);
  ASSERT_TRUE(record["error"]["code"].isInt());
  EXPECT_EQ(record["error"]["code"].asInt(), 1521);
  EXPECT_EQ(record["error"]["errors"], errors);
}

TEST_F(WebAPIPolling, SuccessAfterErrorDropsTheError) {
  const std::string id = StartTask([](APIRequest *, APIResponse *response) {
    response->SetError(1500);
    response->SetSuccess(Object("status", "success"));
  });
  ASSERT_TRUE(WaitUntil([&] { return IsFinished(id); }));
  const Json::Value record = Record(id);
  EXPECT_TRUE(record["success"].asBool());
  EXPECT_FALSE(record.isMember("error"));
  EXPECT_EQ(record["data"], Object("status", "success"));
}

TEST_F(WebAPIPolling, ThrowingCallbackEndsTaskWithErrorAndProcessGoesOn) {
  zark::test::ClearLogs();
  const std::string id = StartTask([](APIRequest *, APIResponse *response) {
    response->SetSuccess(Object("percentage", 10));
    throw std::runtime_error("bitset::test");
  });
  ASSERT_TRUE(WaitUntil([&] { return IsFinished(id); }));
  const Json::Value record = Record(id);
  EXPECT_TRUE(record["finish"].asBool());
  EXPECT_FALSE(record["success"].asBool());
  EXPECT_EQ(record["error"]["code"].asInt(), ZARK::WEBAPI_ERR_TASK_EXCEPTION);
  EXPECT_EQ(record["error"]["code"].asInt(), 110);
  EXPECT_EQ(record["error"]["errors"], Object("reason", "bitset::test"));
  EXPECT_EQ(record["data"], Object("percentage", 10));

  bool logged = false;
  for (const auto &line : zark::test::CapturedLogs()) {
    if (line.priority == LOG_ERR &&
        line.message.find(id) != std::string::npos &&
        line.message.find("bitset::test") != std::string::npos) {
      logged = true;
    }
  }
  EXPECT_TRUE(logged);

  // The framework still works.
  const std::string next = StartTask([](APIRequest *, APIResponse *) {});
  ASSERT_FALSE(next.empty());
  EXPECT_TRUE(WaitUntil([&] { return IsFinished(next); }));
}

TEST_F(WebAPIPolling, CallbackThrowingANonExceptionEndsTaskWithError) {
  const std::string id =
      StartTask([](APIRequest *, APIResponse *) { throw 42; });
  ASSERT_TRUE(WaitUntil([&] { return IsFinished(id); }));
  const Json::Value record = Record(id);
  EXPECT_FALSE(record["success"].asBool());
  EXPECT_EQ(record["error"]["code"].asInt(), ZARK::WEBAPI_ERR_TASK_EXCEPTION);
  EXPECT_EQ(record["error"]["errors"]["reason"].asString(),
            "unknown exception");
}

TEST_F(WebAPIPolling, RemoveAttrDropsTheRecordWhenTheTaskEnds) {
  const std::string id = StartWaitingTask("T.task", "admin", true);
  ASSERT_FALSE(id.empty());
  EXPECT_EQ(Record(id), RunningRecord());
  mRelease.Open();
  EXPECT_TRUE(WaitUntil([&] { return !Exists(id); }));
  Json::Value result;
  APIPolling polling;
  ASSERT_TRUE(polling.List("T.task", Strings({"admin"}), result));
  EXPECT_EQ(result["admin"].size(), 0u);
  APIPolling::JoinAll();
}

TEST_F(WebAPIPolling, StatusOfUnknownIdFails) {
  APIPolling polling;
  Json::Value record = "untouched";
  EXPECT_FALSE(polling.Status("T.task#0000000000000000", record));
  EXPECT_FALSE(polling.Status("", record));
  EXPECT_EQ(record, Json::Value("untouched"));
}

// List

TEST_F(WebAPIPolling, ListMatchesPrefixUpToADotOrHash) {
  const std::string exact = StartWaitingTask("A.b");
  const std::string child = StartWaitingTask("A.b.c");
  const std::string longer = StartWaitingTask("A.bc");
  const std::string parent = StartWaitingTask("A");
  APIPolling polling;
  Json::Value result;

  ASSERT_TRUE(polling.List("A.b", Strings({"admin"}), result));
  EXPECT_EQ(result, Object("admin", Strings({exact, child})));

  ASSERT_TRUE(polling.List("A.b.c", Strings({"admin"}), result));
  EXPECT_EQ(result, Object("admin", Strings({child})));

  ASSERT_TRUE(polling.List("A", Strings({"admin"}), result));
  EXPECT_EQ(result, Object("admin", Strings({exact, child, longer, parent})));

  // A leading part that does not end at "." or "#" selects nothing.
  ASSERT_TRUE(polling.List("A.", Strings({"admin"}), result));
  EXPECT_EQ(result, Object("admin", Strings({})));
  ASSERT_TRUE(polling.List("A.b.", Strings({"admin"}), result));
  EXPECT_EQ(result, Object("admin", Strings({})));
}

TEST_F(WebAPIPolling, ListWithPrefixEndingInADot) {
  // The rule-saving task with a non-string suffix has a trailing dot.
  const std::string dotted =
      StartWaitingTask("ZARK.Core.PortForwarding.save_rules.");
  const std::string plain =
      StartWaitingTask("ZARK.Core.PortForwarding.save_rules");
  APIPolling polling;
  Json::Value result;
  ASSERT_TRUE(polling.List("ZARK.Core.PortForwarding.save_rules.",
                           Strings({"admin"}), result));
  EXPECT_EQ(result, Object("admin", Strings({dotted})));
  ASSERT_TRUE(polling.List("ZARK.Core.PortForwarding.save_rules",
                           Strings({"admin"}), result));
  EXPECT_EQ(result, Object("admin", Strings({dotted, plain})));
}

TEST_F(WebAPIPolling, ListWithEmptyPrefixMatchesEveryTaskOfTheGroups) {
  const std::string first = StartWaitingTask("X.one");
  const std::string second = StartWaitingTask("Y.two");
  const std::string other = StartWaitingTask("Z.three", "user");
  APIPolling polling;
  Json::Value result;
  ASSERT_TRUE(polling.List("", Strings({"admin"}), result));
  EXPECT_EQ(result, Object("admin", Strings({first, second})));
  ASSERT_TRUE(polling.List("", Strings({"user"}), result));
  EXPECT_EQ(result, Object("user", Strings({other})));
}

TEST_F(WebAPIPolling, ListSeveralGroups) {
  const std::string admin1 = StartWaitingTask("G.task", "admin");
  const std::string user1 = StartWaitingTask("G.task", "user");
  const std::string admin2 = StartWaitingTask("G.task", "admin");
  const std::string other = StartWaitingTask("G.task", "other");
  APIPolling polling;
  Json::Value result;
  ASSERT_TRUE(
      polling.List("G.task", Strings({"admin", "user", "nobody"}), result));
  Json::Value expected(Json::objectValue);
  expected["admin"] = Strings({admin1, admin2});
  expected["user"] = Strings({user1});
  expected["nobody"] = Strings({}); // requested, no task: empty
  EXPECT_EQ(result, expected) << result.toStyledString();
  (void)other;

  // A group named twice appears once.
  ASSERT_TRUE(polling.List("G.task", Strings({"user", "user"}), result));
  EXPECT_EQ(result, Object("user", Strings({user1})));

  // No group asked: nothing listed.
  ASSERT_TRUE(polling.List("G.task", Json::Value(Json::arrayValue), result));
  EXPECT_EQ(result, Json::Value(Json::objectValue));
}

TEST_F(WebAPIPolling, ListRefusesGroupsThatAreNotAnArrayOfStrings) {
  StartWaitingTask();
  APIPolling polling;
  Json::Value groups(Json::arrayValue);
  groups.append("admin");
  groups.append(5);
  for (const Json::Value &bad :
       {Json::Value("admin"), Object("admin", true), Json::Value(), groups}) {
    Json::Value result = "untouched";
    EXPECT_FALSE(polling.List("", bad, result)) << bad.toStyledString();
    EXPECT_EQ(result, Json::Value("untouched"));
  }
}

TEST_F(WebAPIPolling, ListFullIdSelectsExactlyThatTask) {
  const std::string first = StartWaitingTask("ZARK.Core.PortForwarding.detect");
  const std::string second =
      StartWaitingTask("ZARK.Core.PortForwarding.detect");
  APIPolling polling;
  Json::Value result;
  ASSERT_TRUE(polling.List(second, Strings({"admin"}), result));
  EXPECT_EQ(result, Object("admin", Strings({second})));
  ASSERT_TRUE(polling.List(first, Strings({"admin"}), result));
  EXPECT_EQ(result, Object("admin", Strings({first})));
}

// Stop

TEST_F(WebAPIPolling, StopWithoutRemoveKeepsRecordAndAsksTaskToStop) {
  Gate started;
  std::atomic<bool> stopBeforeStop = true;
  const std::string id = StartTask([&](APIRequest *, APIResponse *response) {
    stopBeforeStop = APIPolling::IsStopRequested(response);
    started.Open();
    const bool seen =
        WaitUntil([&] { return APIPolling::IsStopRequested(response); });
    response->SetSuccess(Object("stopped", seen));
  });
  ASSERT_TRUE(started.Wait());
  EXPECT_FALSE(stopBeforeStop);
  APIPolling polling;
  ASSERT_TRUE(polling.Stop(id, false));
  ASSERT_TRUE(WaitUntil([&] { return IsFinished(id); }));
  const Json::Value record = Record(id);
  EXPECT_TRUE(record["success"].asBool());
  EXPECT_EQ(record["data"], Object("stopped", true));
}

TEST_F(WebAPIPolling, IsStopRequestedIsFalseForOtherResponses) {
  const std::string id = StartWaitingTask();
  APIPolling polling;
  ASSERT_TRUE(polling.Stop(id, false));
  const APIResponse unrelated;
  EXPECT_FALSE(APIPolling::IsStopRequested(&unrelated));
  EXPECT_FALSE(APIPolling::IsStopRequested(nullptr));
}

TEST_F(WebAPIPolling, StopWithRemoveDropsARunningTaskWhichIsStillJoined) {
  Gate started;
  std::atomic<bool> stopSeen = false;
  std::atomic<bool> returned = false;
  const std::string id = StartTask([&](APIRequest *, APIResponse *response) {
    started.Open();
    mRelease.Wait();
    stopSeen = APIPolling::IsStopRequested(response);
    // Answers after the record is gone go nowhere, harmlessly.
    response->SetSuccess(Object("late", true));
    response->SetError(1500, Object("late", true));
    returned = true;
  });
  ASSERT_TRUE(started.Wait());
  APIPolling polling;
  ASSERT_TRUE(polling.Stop(id, true));
  EXPECT_FALSE(Exists(id));
  Json::Value result;
  ASSERT_TRUE(polling.List("T.task", Strings({"admin"}), result));
  EXPECT_EQ(result["admin"].size(), 0u);
  EXPECT_FALSE(polling.Stop(id, true));
  EXPECT_FALSE(returned);

  mRelease.Open();
  APIPolling::JoinAll();
  EXPECT_TRUE(returned);
  EXPECT_TRUE(stopSeen);
  EXPECT_FALSE(Exists(id));
}

TEST_F(WebAPIPolling, StopOfUnknownIdFails) {
  APIPolling polling;
  EXPECT_FALSE(polling.Stop("T.task#0123456789abcdef", false));
  EXPECT_FALSE(polling.Stop("", true));
}

TEST_F(WebAPIPolling, StopWithRemoveOfAFinishedTask) {
  const std::string id = StartTask([](APIRequest *, APIResponse *) {});
  ASSERT_TRUE(WaitUntil([&] { return IsFinished(id); }));
  APIPolling polling;
  EXPECT_TRUE(polling.Stop(id, true));
  EXPECT_FALSE(Exists(id));
}

// The sweep of a module: list the tasks of a name and stop and remove each.
void Sweep(const std::string &prefix) {
  APIPolling polling;
  Json::Value result;
  ASSERT_TRUE(polling.List(prefix, Strings({"admin"}), result));
  for (const auto &group : result) {
    for (const auto &id : group) {
      polling.Stop(id.asString(), true);
    }
  }
}

TEST_F(WebAPIPolling, SweepByBarePrefixRemovesExactlyThoseTasks) {
  const std::string save1 =
      StartWaitingTask("ZARK.Core.PortForwarding.save_rules");
  const std::string save2 =
      StartWaitingTask("ZARK.Core.PortForwarding.save_rules");
  const std::string saveSuffix =
      StartWaitingTask("ZARK.Core.PortForwarding.save_rules.tab1");
  const std::string saveLonger =
      StartWaitingTask("ZARK.Core.PortForwarding.save_rulesX");
  const std::string detect =
      StartWaitingTask("ZARK.Core.PortForwarding.detect");
  const std::string userSave =
      StartWaitingTask("ZARK.Core.PortForwarding.save_rules", "user");

  Sweep("ZARK.Core.PortForwarding.save_rules");

  EXPECT_FALSE(Exists(save1));
  EXPECT_FALSE(Exists(save2));
  EXPECT_FALSE(Exists(saveSuffix));
  EXPECT_TRUE(Exists(saveLonger));
  EXPECT_TRUE(Exists(detect));
  EXPECT_TRUE(Exists(userSave)); // other group
}

TEST_F(WebAPIPolling, SweepByFullIdRemovesOnlyThatTask) {
  const std::string first = StartTask([](APIRequest *, APIResponse *) {},
                                      "ZARK.Core.PortForwarding.test_rules");
  const std::string second =
      StartWaitingTask("ZARK.Core.PortForwarding.test_rules");
  ASSERT_TRUE(WaitUntil([&] { return IsFinished(first); }));

  // As a status poll does once it sees the task finished: the part of the
  // id from the module's name on.
  const std::string fromName =
      first.substr(first.find("ZARK.Core.PortForwarding"));
  Sweep(fromName);
  EXPECT_FALSE(Exists(first));
  EXPECT_TRUE(Exists(second));
}

// Bound and nesting

TEST_F(WebAPIPolling, StartFailsWhenTheRegistryIsFullOfRunningTasks) {
  Gate release;
  auto waitForRelease = [&release](APIRequest *, APIResponse *) {
    release.Wait();
  };
  std::vector<std::string> ids;
  for (std::size_t i = 0; i < APIPolling::kMaxTasks; ++i) {
    std::string id = StartTask(waitForRelease, "T.bound");
    ASSERT_FALSE(id.empty()) << i;
    ids.push_back(id);
  }
  zark::test::ClearLogs();
  APIPolling polling;
  polling.SetGroupAttr("admin");
  polling.SetPrefixAttr("T.bound");
  APIResponse response;
  EXPECT_FALSE(polling.Start(&response, DoNothing, nullptr));
  EXPECT_EQ(response.GetErrorCode(), ZARK::WEBAPI_ERR_TASK_START);
  EXPECT_EQ(response.GetErrorData()["reason"].asString(),
            "too many tasks running");
  EXPECT_EQ(response.GetErrorData()["max"].asUInt64(), APIPolling::kMaxTasks);
  EXPECT_TRUE(zark::test::HasLogContaining("T.bound not started"));

  // Dropping one record of a running task does not make room: the task
  // still runs.
  ASSERT_TRUE(polling.Stop(ids.front(), true));
  APIResponse stillFull;
  EXPECT_FALSE(polling.Start(&stillFull, DoNothing, nullptr));

  // Once the tasks end, the registry makes room by itself.
  release.Open();
  APIPolling::JoinAll();
  APIResponse again;
  EXPECT_TRUE(polling.Start(&again, DoNothing, nullptr));
}

TEST_F(WebAPIPolling, FinishedTasksNobodyPolledNeverFillTheRegistry) {
  // Every browser tab closed in the middle of a job leaves a finished task
  // that nobody polls.
  std::vector<std::string> ids;
  for (std::size_t i = 0; i < APIPolling::kMaxTasks + 200; ++i) {
    APIPolling polling;
    polling.SetGroupAttr("admin");
    polling.SetPrefixAttr("T.unpolled");
    APIResponse response;
    ASSERT_TRUE(polling.Start(&response, DoNothing, nullptr))
        << i << ": " << response.GetErrorData();
    ids.push_back(response.GetData()["task_id"].asString());
    if (i + 1 == APIPolling::kMaxTasks) {
      APIPolling::JoinAll(); // every one of them has finished
    }
  }
  APIPolling::JoinAll();
  // The newest records are still there for their pollers; the oldest made
  // room.
  Json::Value record;
  EXPECT_TRUE(APIPolling().Status(ids.back(), record));
  EXPECT_TRUE(record["finish"].asBool());
  EXPECT_FALSE(APIPolling().Status(ids.front(), record));
}

TEST_F(WebAPIPolling,
       FinishedRecordsNobodyAsksForAreDroppedAfterTheirLifetime) {
  struct LifetimeForThisTest {
    LifetimeForThisTest() {
      APIPolling::SetFinishedRecordLifetime(std::chrono::milliseconds(1000));
    }
    ~LifetimeForThisTest() {
      APIPolling::SetFinishedRecordLifetime(
          APIPolling::kDefaultFinishedRecordLifetime);
    }
  } lifetime;
  const std::string asked = StartTask([](APIRequest *, APIResponse *) {});
  const std::string forgotten = StartTask([](APIRequest *, APIResponse *) {});
  APIPolling::JoinAll();
  Json::Value record;
  // Asking keeps a record: each Status starts its lifetime again.
  for (int i = 0; i < 8; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    EXPECT_TRUE(APIPolling().Status(asked, record)) << i;
  }
  EXPECT_FALSE(APIPolling().Status(forgotten, record));
  Json::Value lists;
  ASSERT_TRUE(APIPolling().List("T.task", Strings({"admin"}), lists));
  EXPECT_EQ(lists["admin"], Strings({asked}));
  std::this_thread::sleep_for(std::chrono::milliseconds(1200));
  EXPECT_FALSE(APIPolling().Status(asked, record));
}

TEST_F(WebAPIPolling, TaskCanStartAndPollAnotherTask) {
  std::string innerId;
  Json::Value innerRecord;
  const std::string outer = StartTask([&](APIRequest *, APIResponse *) {
    innerId = StartTask(
        [](APIRequest *, APIResponse *response) {
          response->SetSuccess(Object("inner", true));
        },
        "T.inner");
    WaitUntil([&] { return IsFinished(innerId); });
    APIPolling polling;
    polling.Status(innerId, innerRecord);
  });
  ASSERT_TRUE(WaitUntil([&] { return IsFinished(outer); }));
  EXPECT_FALSE(innerId.empty());
  EXPECT_EQ(innerRecord["data"], Object("inner", true));
}

TEST_F(WebAPIPolling, JoinAllFromATaskWaitsForNoRunningTask) {
  zark::test::ClearLogs();
  const std::string waiting = StartWaitingTask();
  // Both call JoinAll: neither may wait for the other, nor for "waiting".
  const std::string first = StartTask([](APIRequest *, APIResponse *response) {
    APIPolling::JoinAll();
    response->SetSuccess(Object("joined", true));
  });
  const std::string second =
      StartTask([](APIRequest *, APIResponse *) { APIPolling::JoinAll(); });
  ASSERT_TRUE(WaitUntil([&] { return IsFinished(first); }));
  ASSERT_TRUE(WaitUntil([&] { return IsFinished(second); }));
  EXPECT_EQ(Record(first)["data"], Object("joined", true));
  EXPECT_FALSE(IsFinished(waiting));
  EXPECT_TRUE(zark::test::HasLogContaining(
      "JoinAll called from a task: joining ended tasks only"));
  mRelease.Open();
  APIPolling::JoinAll();
  EXPECT_TRUE(IsFinished(waiting));
}

} // namespace
