// Calling the module the way the host does: the row of gTable for an API
// and method, with a request and a response of the real framework.
#ifndef ZARK_TESTS_INTEGRATION_MODULE_INVOKE_H
#define ZARK_TESTS_INTEGRATION_MODULE_INVOKE_H

#include <json/json.h>

#include <chrono>
#include <memory>
#include <string>

namespace zark::integration {

inline constexpr char kApiRouterConf[] = "ZARK.Core.PortForwarding.RouterConf";
inline constexpr char kApiRouterList[] = "ZARK.Core.PortForwarding.RouterList";
inline constexpr char kApiRules[] = "ZARK.Core.PortForwarding.Rules";

struct Answer {
  bool answered = false;
  bool success = false;
  Json::Value data;   // success data
  int errorCode = 0;  // when not success
  Json::Value errors; // error data
};

// Runs the entry function of (api, method) with params. An API or method
// that gTable lacks fails the calling test.
Answer Invoke(const std::string &api, const std::string &method,
              const Json::Value &params = Json::Value(Json::objectValue));

Json::Value ParseJson(const std::string &text);

// Polls statusMethod of api with {"task_id": id} until the answer says
// finished (success with status "success", or an error), at most timeout.
// Every answer seen is appended to history. The first poll waits until the
// task has reported its first status.
Answer PollUntilFinished(const std::string &api,
                         const std::string &statusMethod,
                         const std::string &taskId,
                         std::chrono::milliseconds timeout,
                         Json::Value &history);

} // namespace zark::integration

#endif
