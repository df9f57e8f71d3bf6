// Helpers for tests of background tasks: a gate that a task callback waits
// on, bounded waits, and a fixture that leaves the process-wide registry
// empty and every task thread joined after each test.
#ifndef ZARK_TESTS_WEBAPI_TASK_TEST_SUPPORT_H
#define ZARK_TESTS_WEBAPI_TASK_TEST_SUPPORT_H

#include "webapi.h"

#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <deque>
#include <functional>
#include <mutex>
#include <string>
#include <thread>

namespace zark::test {

// Upper bound of every wait in these tests; reached only when a test fails.
inline constexpr std::chrono::seconds kWaitBound{30};

// One-shot signal between a test and its task callbacks.
class Gate {
public:
  void Open() {
    std::lock_guard lock(mMutex);
    mOpen = true;
    mChanged.notify_all();
  }
  // True once opened; false when the bound passed first.
  bool Wait() {
    std::unique_lock lock(mMutex);
    return mChanged.wait_for(lock, kWaitBound, [this] { return mOpen; });
  }

private:
  std::mutex mMutex;
  std::condition_variable mChanged;
  bool mOpen = false;
};

// Polls condition until it holds or the bound passes.
inline bool WaitUntil(const std::function<bool()> &condition) {
  const auto deadline = std::chrono::steady_clock::now() + kWaitBound;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) {
      return false;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return true;
}

using TaskBody = std::function<void(ZARK::APIRequest *, ZARK::APIResponse *)>;

// The task callback of these tests: runs the TaskBody its argument points to.
inline void RunTaskBody(ZARK::APIRequest *request, ZARK::APIResponse *response,
                        void *argument) {
  (*static_cast<TaskBody *>(argument))(request, response);
}

class WebAPITaskTest : public ::testing::Test {
protected:
  // Groups the tests use; TearDown sweeps them.
  static Json::Value AllGroups() {
    Json::Value groups(Json::arrayValue);
    for (const char *group : {"admin", "user", "other", ""}) {
      groups.append(group);
    }
    return groups;
  }

  void SetUp() override {
    Json::Value result;
    ZARK::APIPolling polling;
    ASSERT_TRUE(polling.List("", AllGroups(), result));
    for (const auto &group : result) {
      ASSERT_EQ(group.size(), 0u) << "a task of an earlier test is left";
    }
  }

  // Lets every waiting callback go, drops every record and joins every
  // thread, also when the test failed half-way.
  void TearDown() override {
    mRelease.Open();
    ZARK::APIPolling polling;
    Json::Value result;
    ASSERT_TRUE(polling.List("", AllGroups(), result));
    for (const auto &group : result) {
      for (const auto &id : group) {
        EXPECT_TRUE(polling.Stop(id.asString(), true));
      }
    }
    ZARK::APIPolling::JoinAll();
  }

  // Keeps body alive until the fixture ends (after TearDown's JoinAll) and
  // returns the argument to pass to Start with RunTaskBody.
  void *Body(TaskBody body) {
    std::lock_guard lock(mBodiesMutex);
    mBodies.push_back(std::move(body));
    return &mBodies.back();
  }

  // Starts body as a task; returns its id ("" when Start failed).
  std::string StartTask(TaskBody body, const std::string &prefix = "T.task",
                        const std::string &group = "admin", bool remove = false,
                        ZARK::APIRequest *request = nullptr) {
    ZARK::APIPolling polling(request);
    polling.SetGroupAttr(group);
    polling.SetPrefixAttr(prefix);
    polling.SetRemoveAttr(remove);
    ZARK::APIResponse response;
    if (!polling.Start(&response, RunTaskBody, Body(std::move(body)))) {
      return "";
    }
    return response.GetData()["task_id"].asString();
  }

  // A task that waits for mRelease, then returns.
  std::string StartWaitingTask(const std::string &prefix = "T.task",
                               const std::string &group = "admin",
                               bool remove = false) {
    return StartTask(
        [this](ZARK::APIRequest *, ZARK::APIResponse *) { mRelease.Wait(); },
        prefix, group, remove);
  }

  static Json::Value Record(const std::string &id) {
    Json::Value record;
    ZARK::APIPolling polling;
    EXPECT_TRUE(polling.Status(id, record)) << id;
    return record;
  }

  static bool IsFinished(const std::string &id) {
    Json::Value record;
    ZARK::APIPolling polling;
    return polling.Status(id, record) && record["finish"].asBool();
  }

  static bool Exists(const std::string &id) {
    Json::Value record;
    ZARK::APIPolling polling;
    return polling.Status(id, record);
  }

  Gate mRelease;

private:
  std::mutex mBodiesMutex;
  std::deque<TaskBody> mBodies; // deque: pointers stay valid as it grows
};

} // namespace zark::test

#endif
