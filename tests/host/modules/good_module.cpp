// A well-formed test module. "Test.Echo" answers in every way a method can
// (echo, error, nothing, exception); "Test.Task" runs a slow background
// task and reports it through a status method.
#include "ZARK.Core.PortForwarding.h"

#include <chrono>
#include <stdexcept>
#include <thread>

using ZARK::APIPolling;
using ZARK::APIRequest;
using ZARK::APIResponse;

namespace {

// Answers the parameters it got and who sent them.
void Echo(APIRequest *request, APIResponse *response) {
  Json::Value data(Json::objectValue);
  data["params"] = request->GetParams();
  data["user"] = request->GetUser();
  response->SetSuccess(data);
}

void EchoV2(APIRequest *request, APIResponse *response) {
  Json::Value data(Json::objectValue);
  data["version"] = 2;
  data["params"] = request->GetParams();
  response->SetSuccess(data);
}

// Success without data.
void Empty(APIRequest *, APIResponse *response) {
  response->SetSuccess();
}

// A module error code with data, and one without.
void Fail(APIRequest *, APIResponse *response) {
  Json::Value errors(Json::objectValue);
  errors["sec"] = "rule";
  errors["key"] = "port";
  errors["append"] = "70000";
  response->SetError(1521, errors);
}

void FailBare(APIRequest *, APIResponse *response) {
  response->SetError(1500);
}

// Sets nothing on the response.
void Silent(APIRequest *, APIResponse *) {}

// What the port bitsets of the real module throw on a port beyond 65535.
void Throw(APIRequest *, APIResponse *) {
  throw std::out_of_range("bitset::set");
}

void ThrowInt(APIRequest *, APIResponse *) {
  throw 42;
}

// The background task: "steps" steps (1 to 50, default 3) of 20 ms, each
// reported, then a last report with "done".
void CountTask(APIRequest *request, APIResponse *response, void *) {
  Json::Value stepsParam = request->GetParam("steps", 3);
  int steps = stepsParam.isInt() ? stepsParam.asInt() : 3;
  if (steps < 1 || steps > 50) {
    steps = 3;
  }
  Json::Value data(Json::objectValue);
  data["steps"] = steps;
  for (int step = 1; step <= steps; ++step) {
    if (APIPolling::IsStopRequested(response)) {
      response->SetError(1599, data);
      return;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    data["step"] = step;
    response->SetSuccess(data);
  }
  data["done"] = true;
  response->SetSuccess(data);
}

void StartCount(APIRequest *request, APIResponse *response) {
  APIPolling polling;
  polling.SetRequest(request);
  polling.SetGroupAttr("admin");
  polling.SetRemoveAttr(false);
  polling.SetPrefixAttr("Test.Task.count");
  polling.Start(response, CountTask, nullptr);
}

// Answers the task's record; removes the task once it is finished.
void CountStatus(APIRequest *request, APIResponse *response) {
  Json::Value id = request->GetParam("task_id", "");
  if (!id.isString() || id.asString().empty()) {
    response->SetError(1500);
    return;
  }
  APIPolling polling(request);
  Json::Value record;
  if (!polling.Status(id.asString(), record)) {
    response->SetError(1500);
    return;
  }
  if (record["finish"].asBool()) {
    polling.Stop(id.asString(), true);
  }
  response->SetSuccess(record);
}

const ZARK_API_TABLE kTable[] = {
    {"Test.Echo", 1, "echo", Echo},
    {"Test.Echo", 2, "echo", EchoV2},
    {"Test.Echo", 1, "empty", Empty},
    {"Test.Echo", 1, "fail", Fail},
    {"Test.Echo", 1, "fail_bare", FailBare},
    {"Test.Echo", 1, "silent", Silent},
    {"Test.Echo", 1, "throw", Throw},
    {"Test.Echo", 1, "throw_int", ThrowInt},
    {"Test.Task", 1, "start", StartCount},
    {"Test.Task", 1, "status", CountStatus},
    {nullptr, 0, nullptr, nullptr},
};

} // namespace

extern "C" const ZARK_API_TABLE *GetAPITable(void) {
  return kTable;
}
