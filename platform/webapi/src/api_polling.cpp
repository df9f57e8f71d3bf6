// APIPolling: the attributes of one task to start, and the operations on the
// process-wide task registry.
#include "webapi.h"

#include "task_registry.h"

#include <syslog.h>

namespace ZARK {

using webapi_internal::TaskRegistry;

namespace {

void AnswerStartFailure(APIResponse &response, const char *reason) {
  Json::Value errors(Json::objectValue);
  errors["reason"] = reason;
  response.SetError(WEBAPI_ERR_TASK_START, errors);
}

} // namespace

APIPolling::APIPolling() = default;

APIPolling::APIPolling(APIRequest *request) : mRequest(request) {}

APIPolling::~APIPolling() = default;

void APIPolling::SetRequest(APIRequest *request) {
  mRequest = request;
}

void APIPolling::SetGroupAttr(const std::string &group) {
  mGroup = group;
}

void APIPolling::SetPrefixAttr(const std::string &prefix) {
  mPrefix = prefix;
}

void APIPolling::SetRemoveAttr(bool remove) {
  mRemove = remove;
}

bool APIPolling::Start(APIResponse *response, APIPollingCallback callback,
                       void *argument) {
  if (response == nullptr) {
    syslog(LOG_ERR, "%s:%d task not started: no response to answer", __FILE__,
           __LINE__);
    return false;
  }
  if (mPrefix.empty()) {
    syslog(LOG_ERR, "%s:%d task not started: no prefix set", __FILE__,
           __LINE__);
    AnswerStartFailure(*response, "no prefix set");
    return false;
  }
  if (callback == nullptr) {
    syslog(LOG_ERR, "%s:%d task %s not started: no callback", __FILE__,
           __LINE__, mPrefix.c_str());
    AnswerStartFailure(*response, "no callback");
    return false;
  }
  TaskRegistry &registry = TaskRegistry::Instance();
  registry.JoinEnded();
  bool full = false;
  const std::string taskId = registry.Start({.group = mGroup,
                                             .prefix = mPrefix,
                                             .removeWhenEnded = mRemove,
                                             .request = mRequest,
                                             .callback = callback,
                                             .argument = argument},
                                            full);
  if (full) {
    Json::Value errors(Json::objectValue);
    errors["reason"] = "too many tasks running";
    errors["max"] = static_cast<Json::UInt64>(kMaxTasks);
    response->SetError(WEBAPI_ERR_TASK_START, errors);
    return false;
  }
  if (taskId.empty()) {
    // The registry logged why.
    AnswerStartFailure(*response, "task could not be started");
    return false;
  }
  Json::Value answer(Json::objectValue);
  answer["task_id"] = taskId;
  response->SetSuccess(answer);
  return true;
}

bool APIPolling::Status(const std::string &taskId, Json::Value &record) {
  TaskRegistry &registry = TaskRegistry::Instance();
  registry.JoinEnded();
  return registry.Status(taskId, record);
}

bool APIPolling::List(const std::string &prefix, const Json::Value &groups,
                      Json::Value &result) {
  TaskRegistry &registry = TaskRegistry::Instance();
  registry.JoinEnded();
  return registry.List(prefix, groups, result);
}

bool APIPolling::Stop(const std::string &taskId, bool remove) {
  TaskRegistry &registry = TaskRegistry::Instance();
  registry.JoinEnded();
  return registry.Stop(taskId, remove);
}

bool APIPolling::IsStopRequested(const APIResponse *response) {
  return response != nullptr &&
         TaskRegistry::Instance().IsStopRequested(response);
}

void APIPolling::SetFinishedRecordLifetime(std::chrono::milliseconds lifetime) {
  TaskRegistry::Instance().SetFinishedRecordLifetime(lifetime);
}

void APIPolling::JoinAll() {
  TaskRegistry::Instance().JoinAll();
}

} // namespace ZARK
