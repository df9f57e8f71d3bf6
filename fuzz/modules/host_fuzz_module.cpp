// The module the host fuzz targets load: one method for each way a method
// can answer (echo, error, nothing, std::out_of_range as the port bitsets
// throw it, another exception) and a background task that ends at once,
// with its status method. Quick on purpose: the targets measure the host's
// reading of requests, not the methods.
#include "ZARK.Core.PortForwarding.h"

#include <stdexcept>

using ZARK::APIPolling;
using ZARK::APIRequest;
using ZARK::APIResponse;

namespace {

// Module codes it answers; the host passes them through unchanged.
constexpr int kErrFuzzFailure = 1599;
constexpr int kErrFuzzNoTask = 1598;

void Echo(APIRequest *request, APIResponse *response) {
  Json::Value data(Json::objectValue);
  data["params"] = request->GetParams();
  data["user"] = request->GetUser();
  response->SetSuccess(data);
}

void Fail(APIRequest *request, APIResponse *response) {
  response->SetError(kErrFuzzFailure, request->GetParams());
}

void Silent(APIRequest *, APIResponse *) {}

void ThrowOutOfRange(APIRequest *, APIResponse *) {
  throw std::out_of_range("bitset::set");
}

void ThrowOther(APIRequest *, APIResponse *) {
  throw std::runtime_error("fuzz module failure");
}

void QuickTask(APIRequest *request, APIResponse *response, void *) {
  Json::Value data(Json::objectValue);
  data["params"] = request->GetParams();
  response->SetSuccess(data);
}

void StartTask(APIRequest *request, APIResponse *response) {
  APIPolling polling;
  polling.SetRequest(request);
  polling.SetGroupAttr("admin");
  polling.SetRemoveAttr(false);
  polling.SetPrefixAttr("Fuzz.Task.quick");
  polling.Start(response, QuickTask, nullptr);
}

void TaskStatus(APIRequest *request, APIResponse *response) {
  const Json::Value id = request->GetParam("task_id", "");
  APIPolling polling(request);
  Json::Value record;
  if (!id.isString() || !polling.Status(id.asString(), record)) {
    response->SetError(kErrFuzzNoTask);
    return;
  }
  if (record["finish"].isBool() && record["finish"].asBool()) {
    polling.Stop(id.asString(), true);
  }
  response->SetSuccess(record);
}

const ZARK_API_TABLE kTable[] = {
    {"Fuzz.Echo", 1, "echo", Echo},
    {"Fuzz.Echo", 2, "echo", Echo},
    {"Fuzz.Echo", 1, "fail", Fail},
    {"Fuzz.Echo", 1, "silent", Silent},
    {"Fuzz.Echo", 1, "throw_range", ThrowOutOfRange},
    {"Fuzz.Echo", 1, "throw_other", ThrowOther},
    {"Fuzz.Task", 1, "start", StartTask},
    {"Fuzz.Task", 1, "status", TaskStatus},
    {nullptr, 0, nullptr, nullptr},
};

} // namespace

extern "C" const ZARK_API_TABLE *GetAPITable(void) {
  return kTable;
}
