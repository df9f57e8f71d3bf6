// The method table of the module and one entry function per row. Each entry
// builds the request's objects (a StatusReportor on the heap, owned by a
// PortForwarding on the stack), runs one operation and answers. Background
// methods start a polling task of the host; status methods read its record
// back through one common handler that also removes finished tasks.
#include "ZARK.Core.PortForwarding.h"

#include "PortForwarding.h"
#include "RouterRuleServHandler.h"
#include "StatusReportor.h"
#include "klibc.h"

#include <json/json.h>
#include <stdio.h>
#include <string.h>
#include <syslog.h>

#include <string>

using ZARK::APIPolling;
using ZARK::APIRequest;
using ZARK::APIResponse;

namespace {

// API names of the table.
const char kApiPortForwarding[] = "ZARK.Core.PortForwarding";
const char kApiRouterConf[] = "ZARK.Core.PortForwarding.RouterConf";
const char kApiRouterList[] = "ZARK.Core.PortForwarding.RouterList";
const char kApiRules[] = "ZARK.Core.PortForwarding.Rules";
const char kApiRulesServ[] = "ZARK.Core.PortForwarding.Rules.Serv";
const char kApiCompatibility[] = "ZARK.Core.PortForwarding.Compatibility";

// Task names (prefixes of the task ids). Every one starts with the module's
// own API name, which the status handler looks for in a task id.
const char kTaskDetect[] = "ZARK.Core.PortForwarding.detect";
const char kTaskTestRules[] = "ZARK.Core.PortForwarding.test_rules";
const char kTaskTestServ[] = "ZARK.Core.PortForwarding.test_serv";
const char kTaskTestCompatibility[] =
    "ZARK.Core.PortForwarding.test_compatibility";
const char kTaskSaveRules[] = "ZARK.Core.PortForwarding.save_rules";
const char kTaskSaveRulesSuffixed[] = ".save_rules.";

// Tasks of this module run in this group of the polling facility.
const char kTaskGroup[] = "admin";

// Answer codes of the frame.
const int kErrBadRequest = 114;    // missing request/response, bad parameter
const int kErrListTasks = 117;     // the task sweep could not list tasks
const int kErrDefault = 1500;      // failure without a particular code
const int kErrServCheck = 9999;    // the service status check was refused
const int kDefaultRouterPort = 80; // "router_port" when absent or not an int

// Recorded once when the module is loaded and consulted by no operation: it
// tells whether a debug archive of the UPnP test was left on the device. A
// failed check (-1) counts as present.
[[maybe_unused]] const bool gDbgTestArchivePresent =
    KLIBCFileExist("/etc/portforward/dbg_test.tgz") != 0;

// A reporter with the defaults of a request: code 1500, empty section and
// key, null append data, neither success nor finished. The PortForwarding
// object that receives it deletes it.
StatusReportor *NewStatusReportor(APIResponse *response) {
  return new StatusReportor(kErrDefault, "", "", response, Json::Value(), false,
                            false);
}

// The text of a string parameter, or "" when it is absent or not a string.
std::string StringParam(const APIRequest *request, const char *name) {
  Json::Value value = request->GetParam(name, Json::Value());
  return value.isString() ? value.asString() : std::string();
}

// ---------------------------------------------------------------------------
// Task sweep and common status handler.

// Stops and removes every task of group "admin" whose id matches prefix.
// When the tasks cannot be listed, answers 117 on response and removes none.
void StopPollingTasks(APIRequest *request, APIResponse *response,
                      const std::string &prefix) {
  APIPolling polling(request);
  Json::Value groups(Json::arrayValue);
  groups.append(kTaskGroup);
  Json::Value result;

  if (!polling.List(prefix, groups, result)) {
    if (NULL != response) {
      response->SetError(kErrListTasks, Json::Value());
    }
    return;
  }
  // result: {group: [task id, ...], ...}; anything else in it is skipped.
  for (Json::Value::const_iterator group = result.begin();
       group != result.end(); ++group) {
    if (!group->isArray()) {
      continue;
    }
    for (Json::Value::const_iterator id = group->begin(); id != group->end();
         ++id) {
      if (id->isString()) {
        polling.Stop(id->asString(), true);
      }
    }
  }
}

// Status operations of the five status methods, one row per method.
enum StatusOperationRow {
  kStatusCompatibilityTest = 0, // Compatibility test_status
  kStatusServTest,              // Rules.Serv test_status
  kStatusRulesTest,             // Rules test_status
  kStatusRulesSave,             // Rules save_status
  kStatusDetect,                // detect_status
};
const PortForwardingStatusFunc kStatusOperations[] = {
    &PortForwarding::UPnPTestStartStatus,
    &PortForwarding::TestPortConnectionStatus,
    &PortForwarding::TestPortConnectionStatus,
    &PortForwarding::StartPortForwardingStatus,
    &PortForwarding::DetectStatus,
};

// Answers a status request from the record of the task named by "task_id".
// A finished task is removed by the same poll that first sees it finished,
// and that poll still answers from the record it read.
void HandleTaskStatus(APIRequest *request, APIResponse *response,
                      PortForwardingStatusFunc statusOperation) {
  std::string taskId;
  if (NULL != request) {
    Json::Value value = request->GetParam("task_id", "");
    // Objects and arrays have no text; they count as no id at all.
    if (value.isConvertibleTo(Json::stringValue)) {
      taskId = value.asString();
    }
  }

  // The object the status operation runs on.
  PortForwarding portForwarding(NewStatusReportor(response));
  APIPolling polling(request);
  // Reads the record and answers from it.
  StatusReportor recordReportor(kErrDefault, "", "", response, Json::Value(),
                                false, false);
  Json::Value record;
  Json::Value answer;
  Json::Value errorData;

  if (taskId.empty()) {
    syslog(LOG_ERR, "%s:%d task id is empty", __FILE__, __LINE__);
    goto END;
  }
  if (!polling.Status(taskId, record)) {
    syslog(LOG_ERR, "%s:%d can not get polling status", __FILE__, __LINE__);
    goto END;
  }

  // A record without a proper "finish" is still answered; it is only not
  // swept.
  if (recordReportor.LoadFinished(record) && recordReportor.IsFinished()) {
    std::string::size_type start = taskId.find(kApiPortForwarding);
    if (std::string::npos != start) {
      StopPollingTasks(request, response, taskId.substr(start));
    } else {
      // Not a task of this module: leave it to whoever started it.
      syslog(LOG_ERR, "%s:%d task id=%s is not of this module, not swept",
             __FILE__, __LINE__, taskId.c_str());
    }
  }

  if (!recordReportor.LoadSuccess(record)) {
    syslog(LOG_ERR, "%s:%d load success failed", __FILE__, __LINE__);
    goto END;
  }

  if (recordReportor.GetSuccess()) {
    if (!(portForwarding.*statusOperation)(answer, record)) {
      // No answer at all on this path; the host sees the method end
      // without one.
      syslog(LOG_ERR, "%s:%d get pf callback func status failed", __FILE__,
             __LINE__);
      return;
    }
    if (!recordReportor.ReportStatus(answer)) {
      syslog(LOG_ERR, "%s:%d report status failed", __FILE__, __LINE__);
      goto END;
    }
    return;
  }

  // The task ended in error: pass its code and append data on.
  if (!recordReportor.LoadError(record)) {
    syslog(LOG_ERR, "%s:%d load status reportor failed", __FILE__, __LINE__);
    goto END;
  }
  if (!recordReportor.ReportError()) {
    syslog(LOG_ERR, "%s:%d report error failed", __FILE__, __LINE__);
    goto END;
  }
  return;

END:
  if (NULL != response) {
    response->SetError(kErrDefault, errorData);
  }
}

// Entry of a status method.
void RunStatusEntry(APIRequest *request, APIResponse *response,
                    StatusOperationRow row) {
  if (NULL == request || NULL == response) {
    syslog(LOG_ERR, "%s:%d req or resp is not valid", __FILE__, __LINE__);
    if (NULL != response) {
      response->SetError(kErrBadRequest, Json::Value());
    }
    return;
  }
  HandleTaskStatus(request, response, kStatusOperations[row]);
}

// ---------------------------------------------------------------------------
// Background starts.

// Starts callback as a task of group "admin" named prefix, keeping its record
// after it ends. The host answers the start request with the task id.
void StartPollingTask(APIRequest *request, APIResponse *response,
                      const std::string &prefix,
                      ZARK::APIPollingCallback callback) {
  APIPolling polling;
  polling.SetRequest(request);
  polling.SetGroupAttr(kTaskGroup);
  polling.SetRemoveAttr(false);
  polling.SetPrefixAttr(prefix);
  polling.Start(response, callback, NULL);
}

// True when both objects are present; otherwise logs and answers 114 where
// there is a response to answer on.
bool CheckStartRequest(APIRequest *request, APIResponse *response) {
  if (NULL == request || NULL == response) {
    syslog(LOG_ERR, "%s:%d req or resp is not valid", __FILE__, __LINE__);
    if (NULL != response) {
      response->SetError(kErrBadRequest, Json::Value());
    }
    return false;
  }
  return true;
}

// The task name of a rule save. A caller may run and poll a save under its
// own name with "task_id_suffix"; a suffix that is not a string leaves the
// name with its trailing point.
std::string SaveRulesTaskName(const APIRequest *request) {
  if (!request->HasParam("task_id_suffix")) {
    return kTaskSaveRules;
  }
  Json::Value suffix = request->GetParam("task_id_suffix", Json::Value());
  char name[1024];
  memset(name, 0, sizeof(name));
  snprintf(name, sizeof(name), "%s%s%s", kApiPortForwarding,
           kTaskSaveRulesSuffixed, suffix.isString() ? suffix.asCString() : "");
  return name;
}

// ---------------------------------------------------------------------------
// Task callbacks. Each runs on a task thread with a copy of the start request
// and the task's own response; progress and outcome reach the task record
// only through the task's reporter.

void DetectTask(APIRequest *request, APIResponse *response, void *) {
  PortForwarding portForwarding(NewStatusReportor(response));
  if (NULL == request || NULL == response) {
    syslog(LOG_ERR, "%s:%d req or resp is not valid", __FILE__, __LINE__);
    return;
  }
  Json::Value autoSave = request->GetParam("auto_save", false);
  Json::Value result;
  portForwarding.Detect(result, autoSave.isBool() ? autoSave.asBool() : false);
}

void SaveRulesTask(APIRequest *request, APIResponse *response, void *) {
  PortForwarding portForwarding(NewStatusReportor(response));
  if (NULL == request || NULL == response) {
    syslog(LOG_ERR, "%s:%d req or resp is not valid", __FILE__, __LINE__);
    return;
  }
  if (!request->HasParam("rules") && !request->HasParam("pf_policy")) {
    syslog(LOG_ERR, "%s:%d must input rules or pf_policy", __FILE__, __LINE__);
    StatusReportor *reportor = portForwarding.GetStatusReportor();
    reportor->mErrorCode = kErrBadRequest;
    reportor->ReportError();
    return;
  }
  Json::Value params(Json::objectValue);
  if (request->HasParam("rules")) {
    params["rules"] = request->GetParam("rules", Json::Value());
  }
  if (request->HasParam("pf_policy")) {
    params["pf_policy"] = request->GetParam("pf_policy", Json::Value());
  }
  Json::Value data;
  portForwarding.StartPortForwarding(params, data);
}

void TestRulesTask(APIRequest *request, APIResponse *response, void *) {
  PortForwarding portForwarding(NewStatusReportor(response));
  if (NULL == request || NULL == response) {
    syslog(LOG_ERR, "%s:%d req or resp is not valid", __FILE__, __LINE__);
    return;
  }
  Json::Value selection = request->GetParam("selection", "");
  if (!selection.isString()) {
    StatusReportor *reportor = portForwarding.GetStatusReportor();
    reportor->mErrorCode = kErrBadRequest;
    reportor->ReportError();
    return;
  }
  Json::Value params(Json::objectValue);
  params["selection"] = selection;
  portForwarding.TestPortConnection(params);
}

void TestServTask(APIRequest *request, APIResponse *response, void *) {
  PortForwarding portForwarding(NewStatusReportor(response));
  if (NULL == request || NULL == response) {
    syslog(LOG_ERR, "%s:%d req or resp is not valid", __FILE__, __LINE__);
    return;
  }
  Json::Value params(Json::objectValue);
  params["service_id"] = request->GetParam("service_id", Json::Value());
  portForwarding.TestPortConnection(params);
}

void TestCompatibilityTask(APIRequest *request, APIResponse *response, void *) {
  PortForwarding portForwarding(NewStatusReportor(response));
  if (NULL == request || NULL == response) {
    syslog(LOG_ERR, "%s:%d req or resp is not valid", __FILE__, __LINE__);
    return;
  }
  portForwarding.UPnPTestStart();
}

// ---------------------------------------------------------------------------
// Synchronous entries.

// The synchronous pattern: run the middle step, answer its result as
// success, or as error data with the code the operation left in the reporter
// (1500 when it left none). A missing request or response is answered like a
// failed operation, on whatever response there is. The middle step is
// middle(portForwarding, request, response, result) and returns whether the
// operation succeeded; it runs only with both objects present.
template <typename MiddleStep>
void RunSyncFrame(APIRequest *request, APIResponse *response,
                  MiddleStep middle) {
  PortForwarding portForwarding(NewStatusReportor(response));
  Json::Value result;
  bool done = false;

  if (NULL != request && NULL != response) {
    done = middle(portForwarding, request, response, result);
    if (done) {
      response->SetSuccess(result);
    }
  } else {
    syslog(LOG_ERR, "%s:%d req or resp is not valid", __FILE__, __LINE__);
  }
  if (!done) {
    int code = portForwarding.GetErrorCode();
    if (NULL != response) {
      response->SetError(code, result);
    }
  }
}

typedef bool (PortForwarding::*SyncOperation)(Json::Value &);

// The frame around one operation that takes only the result.
void RunSyncEntry(APIRequest *request, APIResponse *response,
                  SyncOperation operation) {
  RunSyncFrame(request, response,
               [operation](PortForwarding &portForwarding, APIRequest *,
                           APIResponse *, Json::Value &result) {
                 return (portForwarding.*operation)(result);
               });
}

void GetCurrentProcessEntry(APIRequest *request, APIResponse *response) {
  RunSyncEntry(request, response, &PortForwarding::GetCurrentProcess);
}

void RouterConfGetEntry(APIRequest *request, APIResponse *response) {
  RunSyncEntry(request, response, &PortForwarding::GetRouterConf);
}

void RouterListGetEntry(APIRequest *request, APIResponse *response) {
  RunSyncEntry(request, response, &PortForwarding::GetRouterDesc);
}

void RouterListListEntry(APIRequest *request, APIResponse *response) {
  RunSyncEntry(request, response, &PortForwarding::ListRouterList);
}

void RouterListUpdateEntry(APIRequest *request, APIResponse *response) {
  RunSyncEntry(request, response, &PortForwarding::UpdateRouterList);
}

void RulesLoadEntry(APIRequest *request, APIResponse *response) {
  RunSyncEntry(request, response, &PortForwarding::LoadPortForwardingRules);
}

void CompatibilityUploadEntry(APIRequest *request, APIResponse *response) {
  RunSyncEntry(request, response, &PortForwarding::UploadUPnPTestStartResult);
}

// "set" of the router configuration: the synchronous frame around
// SetRouterConf, with the request's parameters as its texts.
void RouterConfSetEntry(APIRequest *request, APIResponse *response) {
  RunSyncFrame(
      request, response,
      [](PortForwarding &portForwarding, APIRequest *request, APIResponse *,
         Json::Value &result) {
        Json::Value account =
            request->GetParam("router_account", Json::Value());
        bool hasAccount = account.isString();
        Json::Value port = request->GetParam("router_port", kDefaultRouterPort);
        char connPort[32];
        snprintf(connPort, sizeof(connPort), "%d",
                 port.isInt() ? port.asInt() : kDefaultRouterPort);
        return portForwarding.SetRouterConf(
            result, StringParam(request, "router_brand"),
            StringParam(request, "router_model"),
            StringParam(request, "router_version"),
            StringParam(request, "router_protocol"), connPort, hasAccount,
            hasAccount ? account.asString() : std::string(),
            StringParam(request, "router_pass"),
            StringParam(request, "support_upnp"),
            StringParam(request, "support_natpmp"));
      });
}

// "stop" of the compatibility test: stops the library's test, then removes
// the module's test tasks whatever the stop gave, then answers by the stop
// alone. A failed listing has answered 117 by then; the answer below
// replaces it.
void CompatibilityStopEntry(APIRequest *request, APIResponse *response) {
  RunSyncFrame(request, response,
               [](PortForwarding &portForwarding, APIRequest *request,
                  APIResponse *response, Json::Value &result) {
                 bool stopped = portForwarding.UPnPTestStop(result);
                 StopPollingTasks(request, response, kTaskTestCompatibility);
                 return stopped;
               });
}

// "check" of the service rules: whether the router forwards every port of
// each service. Answers {"service_status": [...]} or 9999.
void RulesServCheckEntry(APIRequest *request, APIResponse *response) {
  if (NULL == request || NULL == response) {
    syslog(LOG_ERR, "%s:%d req or resp is not valid", __FILE__, __LINE__);
    if (NULL != response) {
      response->SetError(kErrServCheck, Json::Value());
    }
    return;
  }
  // No identifiers: every service of the device.
  Json::Value serviceIds(Json::arrayValue);
  if (request->HasParam("service_id")) {
    serviceIds = request->GetParam("service_id", Json::Value());
    if (!serviceIds.isArray()) {
      syslog(LOG_ERR, "%s:%d service_id should be array", __FILE__, __LINE__);
      response->SetError(kErrServCheck, Json::Value());
      return;
    }
  }
  RouterRuleServHandler handler;
  Json::Value result(Json::objectValue);
  result["service_status"] = Json::Value(Json::arrayValue);
  if (handler.GetServPfStatus(serviceIds, result["service_status"]) < 0) {
    syslog(LOG_ERR, "%s:%d GetServPfStatus falied", __FILE__, __LINE__);
    response->SetError(kErrServCheck, Json::Value());
    return;
  }
  response->SetSuccess(result);
}

// ---------------------------------------------------------------------------
// Background and status entries.

void DetectEntry(APIRequest *request, APIResponse *response) {
  if (CheckStartRequest(request, response)) {
    StartPollingTask(request, response, kTaskDetect, DetectTask);
  }
}

void DetectStatusEntry(APIRequest *request, APIResponse *response) {
  RunStatusEntry(request, response, kStatusDetect);
}

void RulesSaveEntry(APIRequest *request, APIResponse *response) {
  if (CheckStartRequest(request, response)) {
    StartPollingTask(request, response, SaveRulesTaskName(request),
                     SaveRulesTask);
  }
}

void RulesSaveStatusEntry(APIRequest *request, APIResponse *response) {
  RunStatusEntry(request, response, kStatusRulesSave);
}

void RulesTestEntry(APIRequest *request, APIResponse *response) {
  if (CheckStartRequest(request, response)) {
    StartPollingTask(request, response, kTaskTestRules, TestRulesTask);
  }
}

void RulesTestStatusEntry(APIRequest *request, APIResponse *response) {
  RunStatusEntry(request, response, kStatusRulesTest);
}

void CompatibilityTestEntry(APIRequest *request, APIResponse *response) {
  if (CheckStartRequest(request, response)) {
    StartPollingTask(request, response, kTaskTestCompatibility,
                     TestCompatibilityTask);
  }
}

// The service test needs the services to test, as an array or one string.
void RulesServTestEntry(APIRequest *request, APIResponse *response) {
  if (!CheckStartRequest(request, response)) {
    return;
  }
  Json::Value serviceId = request->GetParam("service_id", Json::Value());
  if (!serviceId.isArray() && !serviceId.isString()) {
    response->SetError(kErrBadRequest, Json::Value());
    return;
  }
  StartPollingTask(request, response, kTaskTestServ, TestServTask);
}

void RulesServTestStatusEntry(APIRequest *request, APIResponse *response) {
  RunStatusEntry(request, response, kStatusServTest);
}

void CompatibilityTestStatusEntry(APIRequest *request, APIResponse *response) {
  RunStatusEntry(request, response, kStatusCompatibilityTest);
}

} // namespace

// The host walks this table up to the all-zero row. The order of the rows is
// the one the host has always seen and stays as it is.
extern "C" const ZARK_API_TABLE gTable[] = {
    {kApiPortForwarding, 1, "detect", DetectEntry},
    {kApiPortForwarding, 1, "detect_status", DetectStatusEntry},
    {kApiPortForwarding, 1, "get_current_process", GetCurrentProcessEntry},
    {kApiRouterConf, 1, "set", RouterConfSetEntry},
    {kApiRouterConf, 1, "get", RouterConfGetEntry},
    {kApiRouterList, 1, "get", RouterListGetEntry},
    {kApiRouterList, 1, "list", RouterListListEntry},
    {kApiRouterList, 1, "update", RouterListUpdateEntry},
    {kApiRules, 1, "save", RulesSaveEntry},
    {kApiRules, 1, "save_status", RulesSaveStatusEntry},
    {kApiRules, 1, "load", RulesLoadEntry},
    {kApiRules, 1, "test", RulesTestEntry},
    {kApiRules, 1, "test_status", RulesTestStatusEntry},
    {kApiCompatibility, 1, "test", CompatibilityTestEntry},
    {kApiRulesServ, 1, "check", RulesServCheckEntry},
    {kApiRulesServ, 1, "test", RulesServTestEntry},
    {kApiRulesServ, 1, "test_status", RulesServTestStatusEntry},
    {kApiCompatibility, 1, "test_status", CompatibilityTestStatusEntry},
    {kApiCompatibility, 1, "stop", CompatibilityStopEntry},
    {kApiCompatibility, 1, "upload", CompatibilityUploadEntry},
    {NULL, 0, NULL, NULL},
};

extern "C" const ZARK_API_TABLE *GetAPITable(void) {
  return &gTable[0];
}
