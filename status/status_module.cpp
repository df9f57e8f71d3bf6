// ZARK.Core.PortForwarding.Status: the status module. It tells what the
// router really holds and what became of each saved rule, deletes one of
// our mappings, repairs on request, and runs the keeper (the renewal
// service) from the host's start of the module to its stop. Every method
// is served to administrators only, as every module method is (the host
// refuses other accounts with 105).
#include "ZARK.Core.PortForwarding.h"
#include "keeper.h"
#include "module_lifecycle.h"
#include "router_status.h"

#include <syslog.h>

#include <cstddef>
#include <string>

using ZARK::APIPolling;
using ZARK::APIRequest;
using ZARK::APIResponse;

namespace zark::status {
namespace {

const char kApiStatus[] = "ZARK.Core.PortForwarding.Status";
// Repair tasks are named "<kTaskRepair>#<16 hex digits>".
const char kTaskRepair[] = "ZARK.Core.PortForwarding.Status.repair";
// The polling facility's group of administrators' tasks.
const char kTaskGroup[] = "admin";

void Reply(APIResponse *response, const Answer &answer) {
  if (answer.ok) {
    response->SetSuccess(answer.data);
  } else {
    response->SetError(answer.code, answer.errors);
  }
}

void RouterMappingsEntry(APIRequest *, APIResponse *response) {
  Reply(response, ListRouterMappings());
}

void DeleteMappingEntry(APIRequest *request, APIResponse *response) {
  Reply(response,
        DeleteOurMapping(request->GetParam("protocol", Json::Value()),
                         request->GetParam("external_port", Json::Value())));
}

void RuleStatusEntry(APIRequest *, APIResponse *response) {
  Reply(response, RuleStatus());
}

void KeeperStatusEntry(APIRequest *, APIResponse *response) {
  response->SetSuccess(TheKeeper().Describe());
}

// The repair task: progress records {"percentage": N} as the library
// reports it, then the repair's answer.
void RepairTask(APIRequest *, APIResponse *response, void *) {
  Json::Value start(Json::objectValue);
  start["percentage"] = 0;
  response->SetSuccess(start);
  Answer answer = Repair([response](int percentage) {
    Json::Value progress(Json::objectValue);
    progress["percentage"] = percentage;
    response->SetSuccess(progress);
  });
  Reply(response, answer);
}

void RepairEntry(APIRequest *request, APIResponse *response) {
  APIPolling polling;
  polling.SetRequest(request);
  polling.SetGroupAttr(kTaskGroup);
  polling.SetRemoveAttr(false);
  polling.SetPrefixAttr(kTaskRepair);
  // Answers {"task_id": ...}, or 111 when no task can be started.
  polling.Start(response, RepairTask, nullptr);
}

// Answers a repair task's record: {"finish", "percentage", ...} while it
// runs and after it succeeded, its error once it failed. The poll that
// first sees the task finished drops its record.
void RepairStatusEntry(APIRequest *request, APIResponse *response) {
  Json::Value id = request->GetParam("task_id", Json::Value());
  const std::string prefix = std::string(kTaskRepair) + "#";
  if (!id.isString() || id.asString().rfind(prefix, 0) != 0) {
    Json::Value errors(Json::objectValue);
    errors["field"] = "task_id";
    Reply(response,
          Answer::Failure(kErrBadParameter,
                          "task_id must be the id that repair answered.",
                          errors));
    return;
  }
  APIPolling polling(request);
  Json::Value record;
  if (!polling.Status(id.asString(), record)) {
    Reply(response,
          Answer::Failure(kErrNoTask, "No repair task of this id is known; "
                                      "it ended and was read already, or the "
                                      "server was restarted."));
    return;
  }
  const bool finished = record["finish"].asBool();
  if (finished) {
    polling.Stop(id.asString(), true);
  }
  if (record["success"].asBool()) {
    Json::Value data = record["data"].isObject()
                           ? record["data"]
                           : Json::Value(Json::objectValue);
    data["finish"] = finished;
    response->SetSuccess(data);
    return;
  }
  response->SetError(record["error"]["code"].asInt(),
                     record["error"]["errors"]);
}

} // namespace
} // namespace zark::status

using namespace zark::status;

// The host walks this table up to the all-zero row.
extern "C" const ZARK_API_TABLE gTable[] = {
    {kApiStatus, 1, "router_mappings", RouterMappingsEntry},
    {kApiStatus, 1, "delete_mapping", DeleteMappingEntry},
    {kApiStatus, 1, "rule_status", RuleStatusEntry},
    {kApiStatus, 1, "repair", RepairEntry},
    {kApiStatus, 1, "repair_status", RepairStatusEntry},
    {kApiStatus, 1, "keeper_status", KeeperStatusEntry},
    {nullptr, 0, nullptr, nullptr},
};

extern "C" const ZARK_API_TABLE *GetAPITable(void) {
  return &gTable[0];
}

// The host's start: the keeper begins its rounds.
extern "C" int ZarkModuleStart(const ZARK_MODULE_SETTINGS *settings) {
  int interval = ZARK_DEFAULT_KEEPER_INTERVAL_SECONDS;
  if (settings != nullptr &&
      settings->size >=
          offsetof(ZARK_MODULE_SETTINGS, keeper_interval_seconds) +
              sizeof(settings->keeper_interval_seconds) &&
      settings->keeper_interval_seconds >= 1) {
    interval = settings->keeper_interval_seconds;
  }
  return TheKeeper().Start(interval) ? 0 : -1;
}

// The host's stop, before it unloads the module: the keeper's thread ends.
extern "C" void ZarkModuleStop(void) {
  TheKeeper().Stop();
}
