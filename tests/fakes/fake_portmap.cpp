#include "fake_portmap.h"

#include <arpa/inet.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>

namespace zark::fake {
namespace {

std::mutex gMutex;
std::vector<Call> gCalls;

void Record(const std::string &name, std::vector<std::string> args = {}) {
  std::lock_guard lock(gMutex);
  gCalls.push_back({name, std::move(args)});
}

std::string Text(const char *text) {
  return text ? text : "(null)";
}

void CopyText(char *field, const std::string &text) {
  std::strncpy(field, text.c_str(), ZARK_PORTMAP_TEXT_SIZE - 1);
  field[ZARK_PORTMAP_TEXT_SIZE - 1] = '\0';
}

int HandOutRules(const std::vector<ZARK_ROUTER_RULE> &source, int *count,
                 ZARK_ROUTER_RULE **rules) {
  *count = static_cast<int>(source.size());
  *rules = nullptr;
  if (source.empty()) {
    return 0;
  }
  auto *array = static_cast<ZARK_ROUTER_RULE *>(
      std::calloc(source.size(), sizeof(ZARK_ROUTER_RULE)));
  std::memcpy(array, source.data(), source.size() * sizeof(ZARK_ROUTER_RULE));
  *rules = array;
  return 0;
}

PortMap MakeDefaults() {
  PortMap fake;
  fake.KLibZarkPortMapLock = [] { return 0; };
  fake.KLibZarkPortMapUnLock = [] { return 0; };
  fake.KLibGetRulesArrFromRuleConf = [](int *count, ZARK_ROUTER_RULE **rules,
                                        char *, bool,
                                        ZARK_LIBZARKPORTMAP_ERR *) {
    return HandOutRules(Fake().savedRules, count, rules);
  };
  fake.KLibGetRulesArrFromTestRuleConf = [](int *count,
                                            ZARK_ROUTER_RULE **rules, char *,
                                            bool, ZARK_LIBZARKPORTMAP_ERR *) {
    return HandOutRules(Fake().testRules, count, rules);
  };
  fake.KLibSaveRules = [](const char *, int count, ZARK_ROUTER_RULE *rules,
                          bool, ZARK_ROUTER_SAVE_RULE_RESULT *,
                          ZARK_SAVE_RULE_PROGRESS_CB, void *) {
    Fake().lastSavedRules.assign(rules, rules + (rules ? count : 0));
    return 0;
  };
  fake.KLibGetLibZarkPortMapRunningTask = [](ZARK_LIBZARKPORTMAP_TASK *task) {
    task->task = ZARK_PORTMAP_TASK_NONE;
    return 0;
  };
  fake.KLibTestRulesInit = [] { return 0; };
  fake.KLibTestRules = [](int, ZARK_ROUTER_RULE *, ZARK_LIBZARKPORTMAP_ERR *,
                          bool) { return 0; };
  fake.KLibGetGatewayIP = [](char *buf, int size) {
    std::snprintf(buf, size, "%s", "192.168.1.1");
    return 0;
  };
  fake.KLibGetRouterDBList = [](ZARK_ROUTERDB_LIST **list) {
    *list = nullptr;
    const auto &nodes = Fake().routerDB;
    ZARK_ROUTERDB_LIST **tail = list;
    for (const auto &node : nodes) {
      auto *copy = static_cast<ZARK_ROUTERDB_LIST *>(
          std::calloc(1, sizeof(ZARK_ROUTERDB_LIST)));
      *copy = node;
      copy->next = nullptr;
      *tail = copy;
      tail = &copy->next;
    }
    return 0;
  };
  fake.KLibUpdateRouterDBList = [](int *version) {
    *version = 1;
    return 0;
  };
  fake.KLibGetRouterDesc = [](const char *, ZARK_ROUTER_DESC *desc,
                              ZARK_LIBZARKPORTMAP_ERR *, bool) {
    desc->support_change_port = true;
    return 0;
  };
  fake.KLibGetRouterConf = [](const char *, ZARK_ROUTER_CONF *conf,
                              ZARK_LIBZARKPORTMAP_ERR *, bool) {
    *conf = Fake().routerConf;
    return 0;
  };
  fake.KLibSetRouterConf = [](const char *, const ZARK_ROUTER_CONF *conf,
                              ZARK_LIBZARKPORTMAP_ERR *, bool) {
    Fake().storedConfs.push_back(*conf);
    return 0;
  };
  fake.KLibDetectRouter = [](ZARK_ROUTER_DETECT_RESULT *result,
                             ZARK_DETECT_PROGRESS_CB callback, void *arg,
                             bool) {
    static const int kStages[] = {10, 20, 30, 40, 70, 50, 80, 100};
    for (int stage : kStages) {
      *result = Fake().detectResult;
      result->enProgress = stage;
      if (callback) {
        callback(result, arg);
      }
    }
    return 0;
  };
  fake.KLibGetRouterDetectResult = [](ZARK_ROUTER_DETECT_RESULT *result) {
    *result = Fake().detectResult;
    return 0;
  };
  fake.KLibTestUpnpCompatibility =
      [](int, ZARK_ROUTER_TEST_COMPATIBILITY_RESULT *,
         ZARK_TEST_COMPATIBILITY_PROGRESS_CB, void *, bool) { return 0; };
  fake.KLibWriteRecordIntoUpnpDB = [](const ZARK_ROUTER_RECORD *) { return 0; };
  fake.KLibStopTestUpnpCompatibility = [] { return 0; };
  fake.KLibUploadTestUpnpCompatibilityFailResult = [] { return 0; };
  fake.ZARKIGetExternalIP = [] { return htonl(0xCB007107u); }; // 203.0.113.7
  fake.portMapStatus =
      R"({"gateway": "192.168.1.1", "protocol": "upnp", )"
      R"("external_address": "203.0.113.7", "last_job": null, "rules": []})";
  fake.KLibListRouterMappings = [](const char *, ZARK_ROUTER_MAPPINGS *out,
                                   ZARK_LIBZARKPORTMAP_ERR *) {
    const std::vector<ZARK_ROUTER_MAPPING> &source = Fake().routerMappings;
    std::strcpy(out->router_protocol, "upnp");
    std::strcpy(out->location, "http://192.168.1.1:5000/rootDesc.xml");
    out->count = static_cast<int32_t>(source.size());
    if (!source.empty()) {
      out->mappings = static_cast<ZARK_ROUTER_MAPPING *>(
          std::calloc(source.size(), sizeof(ZARK_ROUTER_MAPPING)));
      std::memcpy(out->mappings, source.data(),
                  source.size() * sizeof(ZARK_ROUTER_MAPPING));
    }
    return 0;
  };
  fake.KLibGetPortMapStatus = [](const char *, char **json,
                                 ZARK_LIBZARKPORTMAP_ERR *) {
    *json = strdup(Fake().portMapStatus.c_str());
    return 0;
  };
  fake.KLibRepairSavedRules =
      [](const char *, ZARK_PORTMAP_APPLY_SUMMARY *summary,
         ZARK_ROUTER_SAVE_RULE_RESULT *result,
         ZARK_SAVE_RULE_PROGRESS_CB callback, void *arg) {
        for (int percentage : {50, 100}) {
          result->percentage = percentage;
          if (callback != nullptr) {
            callback(result, arg);
          }
        }
        summary->added = Fake().repairRestored;
        summary->repaired = Fake().repairRestored;
        return 0;
      };
  fake.KLibKeepRouter = [](const char *, int interval, int *nextSeconds,
                           ZARK_PORTMAP_APPLY_SUMMARY *,
                           ZARK_ROUTER_SAVE_RULE_RESULT *) {
    *nextSeconds = interval;
    return 0;
  };
  fake.KLibDeleteOurMapping = [](const char *, const char *, uint16_t, char *,
                                 size_t,
                                 ZARK_LIBZARKPORTMAP_ERR *) { return 0; };
  return fake;
}

} // namespace

PortMap &Fake() {
  static PortMap fake = MakeDefaults();
  return fake;
}

void Reset() {
  Fake() = MakeDefaults();
  std::lock_guard lock(gMutex);
  gCalls.clear();
}

std::vector<Call> Calls() {
  std::lock_guard lock(gMutex);
  return gCalls;
}

std::vector<std::string> CallNames() {
  std::vector<std::string> names;
  for (const auto &call : Calls()) {
    names.push_back(call.name);
  }
  return names;
}

size_t CountCalls(const std::string &name) {
  size_t n = 0;
  for (const auto &call : Calls()) {
    n += call.name == name;
  }
  return n;
}

ZARK_ROUTER_RULE
MakeRule(const std::string &ruleId, bool enable, const std::string &protocol,
         const std::string &routerPort, const std::string &dsPort,
         const std::string &serviceId, const std::string &serviceName) {
  ZARK_ROUTER_RULE rule{};
  CopyText(rule.rule_id, ruleId);
  rule.enable = enable ? 1 : 0;
  CopyText(rule.router_protocol, protocol);
  CopyText(rule.router_port, routerPort);
  CopyText(rule.ds_port, dsPort);
  CopyText(rule.serviceid, serviceId);
  CopyText(rule.service_name, serviceName);
  return rule;
}

ZARK_ROUTER_MAPPING
MakeMapping(const std::string &protocol, uint16_t externalPort,
            const std::string &internalClient, uint16_t internalPort,
            const std::string &description, uint32_t leaseSeconds, bool ours,
            const std::string &ruleId) {
  ZARK_ROUTER_MAPPING mapping{};
  std::snprintf(mapping.protocol, sizeof(mapping.protocol), "%s",
                protocol.c_str());
  mapping.external_port = externalPort;
  mapping.internal_port = internalPort;
  std::snprintf(mapping.internal_client, sizeof(mapping.internal_client), "%s",
                internalClient.c_str());
  mapping.lease_seconds = leaseSeconds;
  mapping.ours = ours ? 1 : 0;
  mapping.held = ours ? 1 : 0;
  mapping.enabled = 1;
  CopyText(mapping.description, description);
  CopyText(mapping.rule_id, ruleId);
  return mapping;
}

ZARK_ROUTERDB_LIST MakeRouterDBNode(const std::string &brand,
                                    const std::string &model,
                                    const std::string &version, bool generic) {
  ZARK_ROUTERDB_LIST node{};
  CopyText(node.brand, brand);
  CopyText(node.model, model);
  CopyText(node.version, version);
  node.generic = generic;
  return node;
}

} // namespace zark::fake

// The faked C interface: record, then do what the fake says.
extern "C" {

using zark::fake::Fake;
using zark::fake::Record;
using zark::fake::Text;

int KLibZarkPortMapLock(void) {
  Record("KLibZarkPortMapLock");
  return Fake().KLibZarkPortMapLock();
}

int KLibZarkPortMapUnLock(void) {
  Record("KLibZarkPortMapUnLock");
  return Fake().KLibZarkPortMapUnLock();
}

int KLibGetRulesArrFromRuleConf(int *count, ZARK_ROUTER_RULE **rules,
                                char *confPath, bool flag,
                                ZARK_LIBZARKPORTMAP_ERR *err) {
  Record("KLibGetRulesArrFromRuleConf",
         {Text(confPath), flag ? "true" : "false", err ? "err" : "(null)"});
  return Fake().KLibGetRulesArrFromRuleConf(count, rules, confPath, flag, err);
}

int KLibGetRulesArrFromTestRuleConf(int *count, ZARK_ROUTER_RULE **rules,
                                    char *confPath, bool flag,
                                    ZARK_LIBZARKPORTMAP_ERR *err) {
  Record("KLibGetRulesArrFromTestRuleConf",
         {Text(confPath), flag ? "true" : "false", err ? "err" : "(null)"});
  return Fake().KLibGetRulesArrFromTestRuleConf(count, rules, confPath, flag,
                                                err);
}

void KLibFreeRulesArr(ZARK_ROUTER_RULE *rules) {
  Record("KLibFreeRulesArr", {rules ? "array" : "(null)"});
  std::free(rules);
}

int KLibSaveRules(const char *gatewayIP, int count, ZARK_ROUTER_RULE *rules,
                  bool flag, ZARK_ROUTER_SAVE_RULE_RESULT *result,
                  ZARK_SAVE_RULE_PROGRESS_CB callback, void *arg) {
  Record("KLibSaveRules",
         {Text(gatewayIP), std::to_string(count), flag ? "true" : "false"});
  return Fake().KLibSaveRules(gatewayIP, count, rules, flag, result, callback,
                              arg);
}

int KLibGetLibZarkPortMapRunningTask(ZARK_LIBZARKPORTMAP_TASK *task) {
  Record("KLibGetLibZarkPortMapRunningTask");
  return Fake().KLibGetLibZarkPortMapRunningTask(task);
}

int KLibTestRulesInit(void) {
  Record("KLibTestRulesInit");
  return Fake().KLibTestRulesInit();
}

int KLibTestRules(int count, ZARK_ROUTER_RULE *rules,
                  ZARK_LIBZARKPORTMAP_ERR *err, bool flag) {
  Record("KLibTestRules", {std::to_string(count), flag ? "true" : "false"});
  return Fake().KLibTestRules(count, rules, err, flag);
}

int KLibGetGatewayIP(char *buf, int size) {
  Record("KLibGetGatewayIP", {std::to_string(size)});
  return Fake().KLibGetGatewayIP(buf, size);
}

int KLibGetRouterDBList(ZARK_ROUTERDB_LIST **list) {
  Record("KLibGetRouterDBList");
  return Fake().KLibGetRouterDBList(list);
}

void KLibFreeRouterDBList(ZARK_ROUTERDB_LIST *list) {
  Record("KLibFreeRouterDBList", {list ? "list" : "(null)"});
  while (list) {
    ZARK_ROUTERDB_LIST *next = list->next;
    std::free(list);
    list = next;
  }
}

int KLibUpdateRouterDBList(int *version) {
  Record("KLibUpdateRouterDBList");
  return Fake().KLibUpdateRouterDBList(version);
}

int KLibGetRouterDesc(const char *gatewayIP, ZARK_ROUTER_DESC *desc,
                      ZARK_LIBZARKPORTMAP_ERR *err, bool flag) {
  Record("KLibGetRouterDesc", {Text(gatewayIP), flag ? "true" : "false"});
  return Fake().KLibGetRouterDesc(gatewayIP, desc, err, flag);
}

int KLibGetRouterConf(const char *gatewayIP, ZARK_ROUTER_CONF *conf,
                      ZARK_LIBZARKPORTMAP_ERR *err, bool flag) {
  Record("KLibGetRouterConf", {Text(gatewayIP), flag ? "true" : "false"});
  return Fake().KLibGetRouterConf(gatewayIP, conf, err, flag);
}

int KLibSetRouterConf(const char *gatewayIP, const ZARK_ROUTER_CONF *conf,
                      ZARK_LIBZARKPORTMAP_ERR *err, bool flag) {
  Record("KLibSetRouterConf", {Text(gatewayIP), flag ? "true" : "false"});
  return Fake().KLibSetRouterConf(gatewayIP, conf, err, flag);
}

int KLibDetectRouter(ZARK_ROUTER_DETECT_RESULT *result,
                     ZARK_DETECT_PROGRESS_CB callback, void *arg, bool flag) {
  Record("KLibDetectRouter", {flag ? "true" : "false"});
  return Fake().KLibDetectRouter(result, callback, arg, flag);
}

int KLibGetRouterDetectResult(ZARK_ROUTER_DETECT_RESULT *result) {
  Record("KLibGetRouterDetectResult");
  return Fake().KLibGetRouterDetectResult(result);
}

int KLibTestUpnpCompatibility(int maxMappings,
                              ZARK_ROUTER_TEST_COMPATIBILITY_RESULT *result,
                              ZARK_TEST_COMPATIBILITY_PROGRESS_CB callback,
                              void *arg, bool flag) {
  Record("KLibTestUpnpCompatibility",
         {std::to_string(maxMappings), flag ? "true" : "false"});
  return Fake().KLibTestUpnpCompatibility(maxMappings, result, callback, arg,
                                          flag);
}

int KLibWriteRecordIntoUpnpDB(const ZARK_ROUTER_RECORD *record) {
  Record("KLibWriteRecordIntoUpnpDB");
  return Fake().KLibWriteRecordIntoUpnpDB(record);
}

int KLibStopTestUpnpCompatibility(void) {
  Record("KLibStopTestUpnpCompatibility");
  return Fake().KLibStopTestUpnpCompatibility();
}

int KLibUploadTestUpnpCompatibilityFailResult(void) {
  Record("KLibUploadTestUpnpCompatibilityFailResult");
  return Fake().KLibUploadTestUpnpCompatibilityFailResult();
}

uint32_t ZARKIGetExternalIP(void) {
  Record("ZARKIGetExternalIP");
  return Fake().ZARKIGetExternalIP();
}

int KLibListRouterMappings(const char *gatewayIP,
                           ZARK_ROUTER_MAPPINGS *mappings,
                           ZARK_LIBZARKPORTMAP_ERR *err) {
  Record("KLibListRouterMappings", {Text(gatewayIP)});
  *mappings = ZARK_ROUTER_MAPPINGS{};
  return Fake().KLibListRouterMappings(gatewayIP, mappings, err);
}

void KLibFreeRouterMappings(ZARK_ROUTER_MAPPINGS *mappings) {
  Record("KLibFreeRouterMappings");
  if (mappings != nullptr) {
    std::free(mappings->mappings);
    mappings->mappings = nullptr;
    mappings->count = 0;
  }
}

const char *KLibFailureKindName(ZARK_FAILURE_KIND kind) {
  static const char *const kNames[] = {"",
                                       "router_not_answering",
                                       "conflict",
                                       "port_refused",
                                       "table_full",
                                       "double_nat",
                                       "lease_refused",
                                       "not_configured",
                                       "local",
                                       "other"};
  const int index = static_cast<int>(kind);
  return index >= 0 && index < 10 ? kNames[index] : "";
}

int KLibGetPortMapStatus(const char *gatewayIP, char **json,
                         ZARK_LIBZARKPORTMAP_ERR *err) {
  Record("KLibGetPortMapStatus", {Text(gatewayIP)});
  *json = nullptr;
  return Fake().KLibGetPortMapStatus(gatewayIP, json, err);
}

void KLibFreeText(char *text) {
  Record("KLibFreeText", {text ? "text" : "(null)"});
  std::free(text);
}

int KLibRepairSavedRules(const char *gatewayIP,
                         ZARK_PORTMAP_APPLY_SUMMARY *summary,
                         ZARK_ROUTER_SAVE_RULE_RESULT *result,
                         ZARK_SAVE_RULE_PROGRESS_CB callback, void *arg) {
  Record("KLibRepairSavedRules", {Text(gatewayIP)});
  return Fake().KLibRepairSavedRules(gatewayIP, summary, result, callback, arg);
}

int KLibKeepRouter(const char *gatewayIP, int checkIntervalSeconds,
                   int *nextSeconds, ZARK_PORTMAP_APPLY_SUMMARY *summary,
                   ZARK_ROUTER_SAVE_RULE_RESULT *result) {
  Record("KLibKeepRouter",
         {Text(gatewayIP), std::to_string(checkIntervalSeconds)});
  return Fake().KLibKeepRouter(gatewayIP, checkIntervalSeconds, nextSeconds,
                               summary, result);
}

int KLibDeleteOurMapping(const char *gatewayIP, const char *protocol,
                         uint16_t externalPort, char *message,
                         size_t messageSize, ZARK_LIBZARKPORTMAP_ERR *err) {
  Record("KLibDeleteOurMapping",
         {Text(gatewayIP), Text(protocol), std::to_string(externalPort)});
  return Fake().KLibDeleteOurMapping(gatewayIP, protocol, externalPort, message,
                                     messageSize, err);
}

} // extern "C"
