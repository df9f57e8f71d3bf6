// PortForwarding: the per-request operations object of the module. It owns
// the request's StatusReportor; every operation reports through it.
#ifndef ZARK_CORE_PORTFORWARDING_PORTFORWARDING_H
#define ZARK_CORE_PORTFORWARDING_PORTFORWARDING_H

#include "StatusReportor.h"
#include "libzarkportmap.h"

#include <json/json.h>

#include <string>

class PortForwarding {
public:
  explicit PortForwarding(StatusReportor *statusReportor);
  ~PortForwarding();
  PortForwarding(const PortForwarding &) = delete;
  PortForwarding &operator=(const PortForwarding &) = delete;

  int GetErrorCode();
  StatusReportor *GetStatusReportor() { return mStatusReportor; }

  // Rules.
  bool LoadPortForwardingRules(Json::Value &out);
  void StartPortForwarding(const Json::Value &params, Json::Value &data);
  bool StartPortForwardingStatus(Json::Value &out, const Json::Value &task);
  bool GetPortfwdApplyStatus(std::string &stage, int &percentage);
  bool GetStatus(std::string &status, const Json::Value &task);
  bool GetPercentage(int &percentage, const Json::Value &task);
  bool GetStatusAndPercentage(std::string &status, int &percentage,
                              const Json::Value &task);
  void TestPortConnection(const Json::Value &params);
  bool TestPortConnectionStatus(Json::Value &out, const Json::Value &task);

  // Router database and configuration.
  bool UpdateRouterList(Json::Value &result);
  bool ListRouterList(Json::Value &result);
  bool GetRouterDesc(Json::Value &result);
  bool GetRouterConf(Json::Value &result);
  bool SetRouterConf(Json::Value &result, const std::string &brand,
                     const std::string &model, const std::string &version,
                     const std::string &connType, const std::string &connPort,
                     bool hasAccount, const std::string &account,
                     const std::string &password,
                     const std::string &supportUpnp,
                     const std::string &supportNatpmp);

  // Detection.
  void Detect(Json::Value &result, bool autoSave);
  bool DetectStatus(Json::Value &out, const Json::Value &record);
  void GetDetectResult(Json::Value &out, const Json::Value &record);
  bool GetCurrentProcess(Json::Value &result);

  // UPnP compatibility test.
  void UPnPTestStart();
  bool UPnPTestStartStatus(Json::Value &answer, const Json::Value &record);
  bool UPnPTestStop(Json::Value &result);
  bool UploadUPnPTestStartResult(Json::Value &result);

private:
  StatusReportor *mStatusReportor;
};

// Status operation of a status method: (answer, task record).
typedef bool (PortForwarding::*PortForwardingStatusFunc)(Json::Value &,
                                                         const Json::Value &);

// Progress callbacks handed to the port-map library; arg is the request's
// StatusReportor.
void saveRuleProgressCB(ZARK_ROUTER_SAVE_RULE_RESULT *result, void *arg);
void DetectProgressCB(ZARK_ROUTER_DETECT_RESULT *result, void *arg);
void testUpnpCompatibilityProgressCB(
    const ZARK_ROUTER_TEST_COMPATIBILITY_RESULT *result, void *arg);

// UPnP compatibility test progress file reading.
int ParseUPnPTestProgress(Json::Value &answer);
void SetUPnPTestStatus(Json::Value &answer, const std::string &status,
                       int percentage);

#endif
