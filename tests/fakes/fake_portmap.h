// A scriptable stand-in for the port-map library's C interface and the
// network call, for module tests. Every call is recorded, in order, with its
// arguments as text; what each call does is a std::function that a test can
// replace. Reset() restores the defaults, which succeed:
//   lock/unlock 0; rule arrays from savedRules / testRules; gateway
//   "192.168.1.1"; router database from routerDB; router configuration
//   from routerConf (KLibSetRouterConf appends to storedConfs); detection
//   calls the callback at 10, 20, 30, 40, 70, 50, 80, 100 with detectResult
//   and returns 0; running task 0; external address 203.0.113.7; the
//   router's table from routerMappings; the port-map status is the text
//   portMapStatus; a repair calls the callback at 50 and 100 and counts
//   repairRestored as added and repaired; a keeper round sets nextSeconds to
//   the check interval; failure kind names are the library's; every other call
//   0.
// The rule store classes (RouterRuleConfWriter/Reader) are the real ones.
#ifndef ZARK_TESTS_FAKE_PORTMAP_H
#define ZARK_TESTS_FAKE_PORTMAP_H

#include "libzarkportmap.h"
#include "zarknet.h"
#include "zarkportforward.h"

#include <functional>
#include <string>
#include <vector>

namespace zark::fake {

struct Call {
  std::string name;
  std::vector<std::string> args;
};

struct PortMap {
  // Data the default behaviours use.
  std::vector<ZARK_ROUTER_RULE> savedRules;
  std::vector<ZARK_ROUTER_RULE> testRules;
  std::vector<ZARK_ROUTERDB_LIST> routerDB; // next pointers are ignored
  ZARK_ROUTER_CONF routerConf{};
  std::vector<ZARK_ROUTER_CONF> storedConfs;
  ZARK_ROUTER_DETECT_RESULT detectResult{};
  std::vector<ZARK_ROUTER_RULE> lastSavedRules; // rules given to KLibSaveRules
  std::vector<ZARK_ROUTER_MAPPING> routerMappings;
  std::string portMapStatus;
  int32_t repairRestored = 0;

  std::function<int()> KLibZarkPortMapLock;
  std::function<int()> KLibZarkPortMapUnLock;
  std::function<int(int *, ZARK_ROUTER_RULE **, char *, bool,
                    ZARK_LIBZARKPORTMAP_ERR *)>
      KLibGetRulesArrFromRuleConf;
  std::function<int(int *, ZARK_ROUTER_RULE **, char *, bool,
                    ZARK_LIBZARKPORTMAP_ERR *)>
      KLibGetRulesArrFromTestRuleConf;
  std::function<int(const char *, int, ZARK_ROUTER_RULE *, bool,
                    ZARK_ROUTER_SAVE_RULE_RESULT *, ZARK_SAVE_RULE_PROGRESS_CB,
                    void *)>
      KLibSaveRules;
  std::function<int(ZARK_LIBZARKPORTMAP_TASK *)>
      KLibGetLibZarkPortMapRunningTask;
  std::function<int()> KLibTestRulesInit;
  std::function<int(int, ZARK_ROUTER_RULE *, ZARK_LIBZARKPORTMAP_ERR *, bool)>
      KLibTestRules;
  std::function<int(char *, int)> KLibGetGatewayIP;
  std::function<int(ZARK_ROUTERDB_LIST **)> KLibGetRouterDBList;
  std::function<int(int *)> KLibUpdateRouterDBList;
  std::function<int(const char *, ZARK_ROUTER_DESC *, ZARK_LIBZARKPORTMAP_ERR *,
                    bool)>
      KLibGetRouterDesc;
  std::function<int(const char *, ZARK_ROUTER_CONF *, ZARK_LIBZARKPORTMAP_ERR *,
                    bool)>
      KLibGetRouterConf;
  std::function<int(const char *, const ZARK_ROUTER_CONF *,
                    ZARK_LIBZARKPORTMAP_ERR *, bool)>
      KLibSetRouterConf;
  std::function<int(ZARK_ROUTER_DETECT_RESULT *, ZARK_DETECT_PROGRESS_CB,
                    void *, bool)>
      KLibDetectRouter;
  std::function<int(ZARK_ROUTER_DETECT_RESULT *)> KLibGetRouterDetectResult;
  std::function<int(int, ZARK_ROUTER_TEST_COMPATIBILITY_RESULT *,
                    ZARK_TEST_COMPATIBILITY_PROGRESS_CB, void *, bool)>
      KLibTestUpnpCompatibility;
  std::function<int(const ZARK_ROUTER_RECORD *)> KLibWriteRecordIntoUpnpDB;
  std::function<int()> KLibStopTestUpnpCompatibility;
  std::function<int()> KLibUploadTestUpnpCompatibilityFailResult;
  std::function<uint32_t()> ZARKIGetExternalIP;
  std::function<int(const char *, ZARK_ROUTER_MAPPINGS *,
                    ZARK_LIBZARKPORTMAP_ERR *)>
      KLibListRouterMappings;
  std::function<int(const char *, char **, ZARK_LIBZARKPORTMAP_ERR *)>
      KLibGetPortMapStatus;
  std::function<int(const char *, ZARK_PORTMAP_APPLY_SUMMARY *,
                    ZARK_ROUTER_SAVE_RULE_RESULT *, ZARK_SAVE_RULE_PROGRESS_CB,
                    void *)>
      KLibRepairSavedRules;
  std::function<int(const char *, int, int *, ZARK_PORTMAP_APPLY_SUMMARY *,
                    ZARK_ROUTER_SAVE_RULE_RESULT *)>
      KLibKeepRouter;
  std::function<int(const char *, const char *, uint16_t, char *, size_t,
                    ZARK_LIBZARKPORTMAP_ERR *)>
      KLibDeleteOurMapping;
};

// The process's one fake. Replace members before the code under test runs.
PortMap &Fake();

// Restores every default and clears the data and the call record.
void Reset();

// Every call so far, in order.
std::vector<Call> Calls();
std::vector<std::string> CallNames();
size_t CountCalls(const std::string &name);

// Builds a rule record (texts cut to fit).
ZARK_ROUTER_RULE MakeRule(const std::string &ruleId, bool enable,
                          const std::string &protocol,
                          const std::string &routerPort,
                          const std::string &dsPort,
                          const std::string &serviceId = "",
                          const std::string &serviceName = "");

// Builds a mapping of the router's table (texts cut to fit).
ZARK_ROUTER_MAPPING
MakeMapping(const std::string &protocol, uint16_t externalPort,
            const std::string &internalClient, uint16_t internalPort,
            const std::string &description, uint32_t leaseSeconds, bool ours,
            const std::string &ruleId = "");

// Builds a router database node.
ZARK_ROUTERDB_LIST MakeRouterDBNode(const std::string &brand,
                                    const std::string &model,
                                    const std::string &version, bool generic);

} // namespace zark::fake

#endif
