// PortForwarding: the per-request operations object of the module. It owns
// the request's StatusReportor; every operation reports through it.
#ifndef ZARK_CORE_PORTFORWARDING_PORTFORWARDING_H
#define ZARK_CORE_PORTFORWARDING_PORTFORWARDING_H

#include "StatusReportor.h"
#include "libzarkportmap.h"

#include <json/json.h>

#include <string>

// Operations return true on success; on failure they return false and leave
// the code to answer in the reporter (1500 unless a particular code is
// named below). Operations that return nothing run as background tasks and
// leave their outcome in the task record through the reporter.
class PortForwarding {
public:
  // Takes ownership of statusReportor (may be NULL); the destructor deletes
  // it.
  explicit PortForwarding(StatusReportor *statusReportor);
  ~PortForwarding();
  PortForwarding(const PortForwarding &) = delete;
  PortForwarding &operator=(const PortForwarding &) = delete;

  // The reporter's error code; 1500 (logged) without a reporter.
  int GetErrorCode();
  StatusReportor *GetStatusReportor() { return mStatusReportor; }

  // --- Rules ---------------------------------------------------------------

  // out: always a JSON array of rule objects (empty on failure). Failure
  // code 1501 when the library says the router is not configured.
  bool LoadPortForwardingRules(Json::Value &out);
  // params: "rules" (array of rule objects) or else "pf_policy". Reports
  // "processing" 1, 5 and the library's progress, then "success" 100, or an
  // error: 1501 (lock, not configured), 1503 (no gateway), 1521 to 1526
  // (refused by the library; the limits or text also go to data and to the
  // error's "append"), 1527 (policy not writable), else 1500.
  void StartPortForwarding(const Json::Value &params, Json::Value &data);
  // out: {"status", "percentage"} of the task record, or, while rules are
  // being applied, {"stage", "status": "processing", "percentage"} from
  // "/tmp/pfProgress". False (error reported) on a bad record or an
  // unreadable progress file.
  bool StartPortForwardingStatus(Json::Value &out, const Json::Value &task);
  // Stage ("del" or "add") and percentage of the last line of
  // "/tmp/pfProgress": done / total x 0.5 (0 when total is 0), plus 0.5 in
  // the "add" stage, at most 1.0, times 100 truncated toward zero; negative
  // when the file holds a negative count (at least INT_MIN). False when the
  // file cannot be read.
  bool GetPortfwdApplyStatus(std::string &stage, int &percentage);
  // Readers of a task record's "data"; false (logged) when the value is
  // missing, of the wrong type, an empty status or a negative percentage.
  bool GetStatus(std::string &status, const Json::Value &task);
  bool GetPercentage(int &percentage, const Json::Value &task);
  bool GetStatusAndPercentage(std::string &status, int &percentage,
                              const Json::Value &task);
  // params: "selection" (rule configuration path, "" for the saved one) or
  // else "service_id". Reports "prepare" 0, "begin" 0, "finish" 0, or an
  // error: 1501 (lock), 1502 (no external address), 1503 (no gateway),
  // else 1500. Always unlocks at the end.
  void TestPortConnection(const Json::Value &params);
  // out: "status" ("wait", "update" or "success") and, except for "wait",
  // "rules" {rule id: result or "testing"} from "/tmp/pfStatusRule". False
  // on a bad record, an unknown status or a missing/unreadable file.
  bool TestPortConnectionStatus(Json::Value &out, const Json::Value &task);

  // --- Router database and configuration ----------------------------------

  // result: {"router_version": int}. Failure code 1510.
  bool UpdateRouterList(Json::Value &result);
  // result: {"routers": [{"router_brand", "router_model",
  // "router_version", "generic"}...]}. An empty database fails (1500).
  bool ListRouterList(Json::Value &result);
  // result: {"support_change_port": bool}. Failure codes 1503, 1530.
  bool GetRouterDesc(Json::Value &result);
  // result: eight string keys of the stored configuration. Failure codes
  // 1501 (not configured), 1503, 1530.
  bool GetRouterConf(Json::Value &result);
  // Stores the user's router configuration, after one for a UPnP router
  // found by detection when supportUpnp is "yes". result stays as given.
  // Failure codes 1503, 1530, else 1500. The password is never logged.
  bool SetRouterConf(Json::Value &result, const std::string &brand,
                     const std::string &model, const std::string &version,
                     const std::string &connType, const std::string &connPort,
                     bool hasAccount, const std::string &account,
                     const std::string &password,
                     const std::string &supportUpnp,
                     const std::string &supportNatpmp);

  // --- Detection -------------------------------------------------------------

  // Runs the six detection steps, reporting "processing" with the stage
  // and the step progress; ends with "success" 100 (the router, or the
  // step at which detection stopped) or an error (1501: could not start,
  // else 1500). autoSave is accepted and not used.
  void Detect(Json::Value &result, bool autoSave);
  // out: "status", "percentage", "progress" of a running detection, or the
  // whole "data" of a finished one. False on a bad record.
  bool DetectStatus(Json::Value &out, const Json::Value &record);
  // out becomes the record's "data" (unchanged, logged, when absent).
  void GetDetectResult(Json::Value &out, const Json::Value &record);
  // result: {"process": "none" | "autotest" | "portforwarding"}.
  bool GetCurrentProcess(Json::Value &result);

  // --- UPnP compatibility test --------------------------------------------

  // Runs the test, reporting "processing" with its progress; always ends
  // with "success" 0 (the outcome is read from the progress file). Leaves
  // 1501 in the reporter when the router is not configured.
  void UPnPTestStart();
  // answer: "test", "status", "percentage" from "/tmp/upnp_test.progress";
  // record is not used. Always true.
  bool UPnPTestStartStatus(Json::Value &answer, const Json::Value &record);
  // Stops the library's test; result stays null.
  bool UPnPTestStop(Json::Value &result);
  // Uploads a failed test's result; result stays null. Not logged.
  bool UploadUPnPTestStartResult(Json::Value &result);

private:
  // Router configuration: fills one configuration record from the texts and
  // stores it for the gateway. False when a router driven through its own
  // pages lacks connection type or port, or when the library refuses it.
  static bool
  ApplyRouterConf(StatusReportor *statusReportor, const std::string &gatewayIP,
                  const std::string &brand, const std::string &model,
                  const std::string &version, const std::string &connType,
                  const std::string &connPort, bool hasAccount,
                  const std::string &account, const std::string &password,
                  const std::string &supportUpnp,
                  const std::string &supportNatpmp);

  // Detection: the final description of a finished run.
  static void SetDetectResult(Json::Value &result,
                              const ZARK_ROUTER_DETECT_RESULT &record);

  // Detection step list: one member per step of the progress object.
  static void InitDetectStep(Json::Value &progress, const char *step,
                             int checkId);
  static void SetDetectStepStatus(Json::Value &progress, const char *step,
                                  const char *status);
  static void FinishDetectStep(Json::Value &progress, const char *step,
                               uint32_t warning);
  static void FinishDetectStepsUpTo(Json::Value &progress,
                                    const ZARK_ROUTER_DETECT_RESULT &record,
                                    const char *lastStep);
  static void ApplyDetectProgress(Json::Value &progress,
                                  const ZARK_ROUTER_DETECT_RESULT &record);

  // The library's detection callback builds the step list too.
  friend void DetectProgressCB(ZARK_ROUTER_DETECT_RESULT *result, void *arg);

  StatusReportor *mStatusReportor;
};

// Status operation of a status method: (answer, task record).
typedef bool (PortForwarding::*PortForwardingStatusFunc)(Json::Value &,
                                                         const Json::Value &);

// Progress callbacks handed to the port-map library; arg is the request's
// StatusReportor. Each reports "processing" with the library's percentage
// (DetectProgressCB: with the step progress); a NULL argument is logged.
void saveRuleProgressCB(ZARK_ROUTER_SAVE_RULE_RESULT *result, void *arg);
void DetectProgressCB(ZARK_ROUTER_DETECT_RESULT *result, void *arg);
void testUpnpCompatibilityProgressCB(
    const ZARK_ROUTER_TEST_COMPATIBILITY_RESULT *result, void *arg);

// UPnP compatibility test progress: answer["test"] gets the test items;
// returns the number of items passed (0 to 5), or -1 once one failed.
// SetUPnPTestStatus sets answer["status"] and answer["percentage"].
int ParseUPnPTestProgress(Json::Value &answer);
void SetUPnPTestStatus(Json::Value &answer, const std::string &status,
                       int percentage);

#endif
