// KLibApplySavedRules and KLibRepairSavedRules: applying the saved rules as
// they are (the zarkportforward tool's apply and renewal jobs, a repair).
#include "zarkportforward.h"

#include "api/saved_rules_access.h"
#include "apply/save_rules.h"
#include "base/portmap_log.h"

#include <exception>
#include <memory>
#include <span>

namespace zark::portmap {
namespace {

// Applies the saved rule configuration as it is: the router is asked about
// every mapping believed held, what it lost is added again, and leases
// about to end are refreshed. The results of KLibApplySavedRules.
int ApplySavedRules(const char *function, const char *gatewayIP,
                    ApplyOptions options, ZARK_PORTMAP_APPLY_SUMMARY *summary,
                    ZARK_ROUTER_SAVE_RULE_RESULT *result,
                    ZARK_SAVE_RULE_PROGRESS_CB callback, void *arg) {
  ZARK_ROUTER_SAVE_RULE_RESULT local{};
  ZARK_ROUTER_SAVE_RULE_RESULT *const target =
      result != nullptr ? result : &local;
  ZARK_ROUTER_SAVE_RULE_RESULT &out = *target;
  out = ZARK_ROUTER_SAVE_RULE_RESULT{};
  if (summary != nullptr) {
    *summary = ZARK_PORTMAP_APPLY_SUMMARY{};
  }
  if (gatewayIP == nullptr) {
    ZARK_PM_LOG_ERROR("%s: no gateway given", function);
    out.errType = kSaveErrBadParameter;
    return -1;
  }
  SavedRuleArray saved;
  if (!ReadSavedRules(saved)) {
    return ZARK_APPLY_SAVED_RULES_UNREADABLE;
  }
  try {
    options.verifyUnchanged = true;
    options.refreshLeases = true;
    options.writeRuleConf = false;
    ApplySummary done;
    const int rc =
        ApplyRules(gatewayIP, saved.Span(), options, DefaultApplyEnvironment(),
                   out, callback, arg, &done);
    CopySummary(done, summary);
    return rc;
  } catch (const std::exception &e) {
    // Nothing may cross the C boundary.
    ZARK_PM_LOG_ERROR("%s: %s", function, e.what());
    out.errType = kSaveErrGeneric;
    return -1;
  }
}

} // namespace
} // namespace zark::portmap

extern "C" int KLibApplySavedRules(const char *gatewayIP, bool renew,
                                   ZARK_PORTMAP_APPLY_SUMMARY *summary,
                                   ZARK_ROUTER_SAVE_RULE_RESULT *result) {
  zark::portmap::ApplyOptions options;
  options.reportProgress = !renew;
  options.jobKind = renew ? "renew" : "save";
  return zark::portmap::ApplySavedRules("KLibApplySavedRules", gatewayIP,
                                        options, summary, result, nullptr,
                                        nullptr);
}

extern "C" int KLibRepairSavedRules(const char *gatewayIP,
                                    ZARK_PORTMAP_APPLY_SUMMARY *summary,
                                    ZARK_ROUTER_SAVE_RULE_RESULT *result,
                                    ZARK_SAVE_RULE_PROGRESS_CB callback,
                                    void *arg) {
  zark::portmap::ApplyOptions options;
  options.reportProgress = true;
  options.jobKind = "repair";
  options.askExternalAddress = true;
  return zark::portmap::ApplySavedRules("KLibRepairSavedRules", gatewayIP,
                                        options, summary, result, callback,
                                        arg);
}
