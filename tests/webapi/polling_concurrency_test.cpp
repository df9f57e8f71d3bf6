// Several host threads starting, polling, listing and stopping tasks at
// once, as request threads of the host do. Meant for the thread sanitizer
// as much as for its own checks.
#include "task_test_support.h"
#include "webapi.h"

#include <gtest/gtest.h>

#include <atomic>
#include <random>
#include <string>
#include <thread>
#include <vector>

namespace {

using ZARK::APIPolling;
using ZARK::APIRequest;
using ZARK::APIResponse;

struct Counters {
  std::atomic<int> begun = 0;
  std::atomic<int> returned = 0;
};

// Reports progress a few times and stops early when asked.
void ProgressTask(APIRequest *request, APIResponse *response, void *argument) {
  auto *counters = static_cast<Counters *>(argument);
  ++counters->begun;
  const int steps = request->GetParam("steps", 1).asInt();
  for (int step = 0; step < steps; ++step) {
    if (APIPolling::IsStopRequested(response)) {
      break;
    }
    Json::Value progress(Json::objectValue);
    progress["percentage"] = step;
    response->SetSuccess(progress);
    std::this_thread::yield();
  }
  if (request->GetParam("fail", false).asBool()) {
    response->SetError(1500);
  }
  ++counters->returned;
}

using WebAPIPollingConcurrency = zark::test::WebAPITaskTest;

TEST_F(WebAPIPollingConcurrency, StartPollListAndStopFromSeveralThreads) {
  constexpr int kThreads = 4;
  constexpr int kIterations = 60;
  Counters counters;
  std::atomic<int> started = 0;
  std::atomic<int> startFailures = 0;

  auto worker = [&](int seed) {
    std::mt19937 random(seed);
    std::vector<std::string> mine;
    APIPolling lister;
    Json::Value admin(Json::arrayValue);
    admin.append("admin");
    for (int i = 0; i < kIterations; ++i) {
      Json::Value params(Json::objectValue);
      params["steps"] = static_cast<int>(random() % 20);
      params["fail"] = random() % 3 == 0;
      APIRequest request(params);
      APIPolling polling(&request);
      polling.SetGroupAttr("admin");
      polling.SetPrefixAttr("T.stress.w" + std::to_string(seed));
      polling.SetRemoveAttr(random() % 2 == 0);
      APIResponse response;
      if (polling.Start(&response, ProgressTask, &counters)) {
        ++started;
        mine.push_back(response.GetData()["task_id"].asString());
      } else {
        ++startFailures;
      }

      Json::Value record;
      const std::string &pick = mine[random() % mine.size()];
      if (lister.Status(pick, record)) {
        EXPECT_TRUE(record["finish"].isBool());
        EXPECT_TRUE(record["success"].isBool());
      }
      Json::Value result;
      EXPECT_TRUE(lister.List(random() % 2 ? "T.stress" : "", admin, result));
      EXPECT_TRUE(result["admin"].isArray());
      switch (random() % 3) {
      case 0:
        lister.Stop(pick, false);
        break;
      case 1:
        lister.Stop(pick, true);
        break;
      default:
        break;
      }
    }
  };

  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back(worker, t + 1);
  }
  for (auto &thread : threads) {
    thread.join();
  }
  APIPolling::JoinAll();

  EXPECT_EQ(startFailures, 0);
  EXPECT_EQ(started, kThreads * kIterations);
  EXPECT_EQ(counters.begun, started.load());
  EXPECT_EQ(counters.returned, started.load());

  // Every record left is of an ended task.
  APIPolling polling;
  Json::Value result;
  Json::Value admin(Json::arrayValue);
  admin.append("admin");
  ASSERT_TRUE(polling.List("T.stress", admin, result));
  for (const auto &id : result["admin"]) {
    Json::Value record;
    ASSERT_TRUE(polling.Status(id.asString(), record));
    EXPECT_TRUE(record["finish"].asBool()) << id.asString();
  }
}

} // namespace
