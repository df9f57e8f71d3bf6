#include "module_test.h"

#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <chrono>
#include <cstring>
#include <regex>
#include <sstream>
#include <thread>

namespace zark::moduletest {
namespace {

// Groups that tests put tasks in.
const char *const kTestGroups[] = {"admin", "other"};

// Most waits of a Gate, and the pause between two looks.
constexpr int kGateMaxWaits = 2000;
constexpr int kGatePauseMs = 5;

void Pause(int ms) {
  std::this_thread::sleep_for(std::chrono::milliseconds(ms));
}

} // namespace

ZARK_API_HANDLER FindHandler(const std::string &api,
                             const std::string &method) {
  for (const ZARK_API_TABLE *row = GetAPITable(); row->szAPI; ++row) {
    if (api == row->szAPI && method == row->szMethod) {
      return row->handler;
    }
  }
  return nullptr;
}

void CallMethod(const std::string &api, const std::string &method,
                ZARK::APIRequest *request, ZARK::APIResponse *response) {
  ZARK_API_HANDLER handler = FindHandler(api, method);
  if (!handler) {
    ADD_FAILURE() << "no table row for " << api << " " << method;
    return;
  }
  handler(request, response);
}

Answer AnswerOf(const ZARK::APIResponse &response) {
  Answer answer;
  answer.state = response.GetState();
  answer.data = response.GetData();
  answer.code = response.GetErrorCode();
  answer.errorData = response.GetErrorData();
  return answer;
}

Answer Invoke(const std::string &api, const std::string &method,
              const Json::Value &params) {
  ZARK::APIRequest request(params);
  ZARK::APIResponse response;
  CallMethod(api, method, &request, &response);
  return AnswerOf(response);
}

std::string StartTask(const std::string &api, const std::string &method,
                      const Json::Value &params) {
  Answer answer = Invoke(api, method, params);
  if (answer.state != ZARK::APIResponse::State::Success ||
      !answer.data["task_id"].isString()) {
    ADD_FAILURE() << api << " " << method << " did not start a task: code "
                  << answer.code << " data " << answer.data.toStyledString();
    return "";
  }
  return answer.data["task_id"].asString();
}

bool TaskExists(const std::string &taskId) {
  ZARK::APIPolling polling;
  Json::Value record;
  return polling.Status(taskId, record);
}

bool WaitTaskFinished(const std::string &taskId) {
  for (int i = 0; i < kMaxPolls; ++i) {
    ZARK::APIPolling polling;
    Json::Value record;
    if (!polling.Status(taskId, record)) {
      return false;
    }
    if (record["finish"].isBool() && record["finish"].asBool()) {
      return true;
    }
    Pause(kPollPauseMs);
  }
  return false;
}

Answer PollOnce(const std::string &api, const std::string &method,
                const std::string &taskId) {
  Json::Value params(Json::objectValue);
  params["task_id"] = taskId;
  return Invoke(api, method, params);
}

Answer PollUntilSwept(const std::string &api, const std::string &method,
                      const std::string &taskId) {
  for (int i = 0; i < kMaxPolls; ++i) {
    Answer answer = PollOnce(api, method, taskId);
    if (!TaskExists(taskId)) {
      return answer;
    }
    Pause(kPollPauseMs);
  }
  ADD_FAILURE() << "task " << taskId << " still held after " << kMaxPolls
                << " polls of " << api << " " << method;
  return Answer();
}

std::vector<std::string> ListTasks(const std::string &prefix,
                                   const std::string &group) {
  ZARK::APIPolling polling;
  Json::Value groups(Json::arrayValue);
  groups.append(group);
  Json::Value result;
  std::vector<std::string> ids;
  if (!polling.List(prefix, groups, result)) {
    ADD_FAILURE() << "List failed";
    return ids;
  }
  for (const auto &id : result[group]) {
    ids.push_back(id.asString());
  }
  return ids;
}

void RemoveAllTasks() {
  for (const char *group : kTestGroups) {
    for (const std::string &id : ListTasks("", group)) {
      ZARK::APIPolling polling;
      polling.Stop(id, true);
    }
  }
  ZARK::APIPolling::JoinAll();
}

void Gate::Wait() {
  mReached = true;
  for (int i = 0; i < kGateMaxWaits && !mOpen.load(); ++i) {
    Pause(kGatePauseMs);
  }
}

bool Gate::WaitReached() {
  for (int i = 0; i < kGateMaxWaits && !mReached.load(); ++i) {
    Pause(kGatePauseMs);
  }
  return mReached.load();
}

void Gate::Open() {
  mOpen = true;
}

std::string StartRawTask(const std::string &prefix, const std::string &group,
                         ZARK::APIPollingCallback callback, void *argument) {
  ZARK::APIRequest request;
  ZARK::APIResponse response;
  ZARK::APIPolling polling;
  polling.SetRequest(&request);
  polling.SetGroupAttr(group);
  polling.SetRemoveAttr(false);
  polling.SetPrefixAttr(prefix);
  if (!polling.Start(&response, callback, argument) ||
      !response.GetData()["task_id"].isString()) {
    ADD_FAILURE() << "could not start a task named " << prefix;
    return "";
  }
  return response.GetData()["task_id"].asString();
}

void AnswerRecorder::OnSuccess(const Json::Value &data) {
  std::lock_guard lock(mMutex);
  mEvents.push_back({true, 0, data});
}

void AnswerRecorder::OnError(int code, const Json::Value &errors) {
  std::lock_guard lock(mMutex);
  mEvents.push_back({false, code, errors});
}

std::vector<AnswerRecorder::Event> AnswerRecorder::Events() const {
  std::lock_guard lock(mMutex);
  return mEvents;
}

} // namespace zark::moduletest
