#include "module_invoke.h"

#include "ZARK.Core.PortForwarding.h"
#include "webapi.h"

#include <gtest/gtest.h>

#include <thread>

namespace zark::integration {

Answer Invoke(const std::string &api, const std::string &method,
              const Json::Value &params) {
  Answer answer;
  for (const ZARK_API_TABLE *row = GetAPITable(); row->szAPI != nullptr;
       ++row) {
    if (api == row->szAPI && method == row->szMethod) {
      ZARK::APIRequest request(params);
      ZARK::APIResponse response;
      row->handler(&request, &response);
      answer.answered = response.IsAnswered();
      answer.success = response.IsSuccess();
      answer.data = response.GetData();
      answer.errorCode = response.GetErrorCode();
      answer.errors = response.GetErrorData();
      return answer;
    }
  }
  ADD_FAILURE() << "gTable has no row " << api << " / " << method;
  return answer;
}

Json::Value ParseJson(const std::string &text) {
  Json::Value value;
  Json::CharReaderBuilder builder;
  std::string errors;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  EXPECT_TRUE(
      reader->parse(text.data(), text.data() + text.size(), &value, &errors))
      << errors;
  return value;
}

Answer PollUntilFinished(const std::string &api,
                         const std::string &statusMethod,
                         const std::string &taskId,
                         std::chrono::milliseconds timeout,
                         Json::Value &history) {
  Json::Value params(Json::objectValue);
  params["task_id"] = taskId;
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  // A status method polled before its task reported anything answers an
  // error (the record has no status yet), as a browser polling that early
  // would see; wait for the first report in the framework's record first.
  for (;;) {
    ZARK::APIPolling polling;
    Json::Value record;
    if (polling.Status(taskId, record) && record["data"].isObject() &&
        record["data"].isMember("status")) {
      break;
    }
    if (std::chrono::steady_clock::now() >= deadline) {
      ADD_FAILURE() << taskId << " reported nothing within " << timeout.count()
                    << " ms";
      return Answer{};
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  Answer answer;
  while (std::chrono::steady_clock::now() < deadline) {
    answer = Invoke(api, statusMethod, params);
    if (!answer.answered) {
      ADD_FAILURE() << statusMethod << " of " << taskId << " did not answer";
      return answer;
    }
    Json::Value seen(Json::objectValue);
    seen["success"] = answer.success;
    seen["data"] = answer.data;
    seen["code"] = answer.errorCode;
    seen["errors"] = answer.errors;
    history.append(seen);
    if (!answer.success ||
        answer.data.get("status", "").asString() == "success") {
      return answer;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  ADD_FAILURE() << statusMethod << " of " << taskId << " did not finish within "
                << timeout.count() << " ms";
  return answer;
}

} // namespace zark::integration
