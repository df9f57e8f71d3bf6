// KLibApplySavedRules: the zarkportforward tool's apply and renewal jobs.
#include "zarkportforward.h"

#include "apply/save_rules.h"
#include "base/portmap_log.h"

#include <exception>
#include <memory>
#include <span>

namespace {

struct RulesArrayDeleter {
  void operator()(ZARK_ROUTER_RULE *rules) const { KLibFreeRulesArr(rules); }
};

} // namespace

extern "C" int KLibApplySavedRules(const char *gatewayIP, bool renew,
                                   ZARK_PORTMAP_APPLY_SUMMARY *summary,
                                   ZARK_ROUTER_SAVE_RULE_RESULT *result) {
  using namespace zark::portmap;
  ZARK_ROUTER_SAVE_RULE_RESULT local{};
  ZARK_ROUTER_SAVE_RULE_RESULT *const target =
      result != nullptr ? result : &local;
  ZARK_ROUTER_SAVE_RULE_RESULT &out = *target;
  out = ZARK_ROUTER_SAVE_RULE_RESULT{};
  if (summary != nullptr) {
    *summary = ZARK_PORTMAP_APPLY_SUMMARY{};
  }
  if (gatewayIP == nullptr) {
    ZARK_PM_LOG_ERROR("KLibApplySavedRules: no gateway given");
    out.errType = kSaveErrBadParameter;
    return -1;
  }
  int count = 0;
  ZARK_ROUTER_RULE *raw = nullptr;
  ZARK_LIBZARKPORTMAP_ERR readErr{};
  if (KLibGetRulesArrFromRuleConf(&count, &raw, nullptr, false, &readErr) < 0) {
    return ZARK_APPLY_SAVED_RULES_UNREADABLE;
  }
  std::unique_ptr<ZARK_ROUTER_RULE, RulesArrayDeleter> rules(raw);
  try {
    // The saved rules are applied as they are: the router is asked about
    // every mapping believed held, so that one it lost (a reboot) is added
    // again, and leases about to end are refreshed.
    ApplyOptions options;
    options.verifyUnchanged = true;
    options.refreshLeases = true;
    options.writeRuleConf = false;
    options.reportProgress = !renew;
    ApplySummary done;
    const int rc = ApplyRules(gatewayIP,
                              std::span<const ZARK_ROUTER_RULE>(
                                  rules.get(), static_cast<std::size_t>(count)),
                              options, DefaultApplyEnvironment(), out, nullptr,
                              nullptr, &done);
    if (summary != nullptr) {
      summary->deleted = done.deleted;
      summary->added = done.added;
      summary->checked = done.checked;
      summary->unchanged = done.unchanged;
      summary->failed = done.failed;
    }
    return rc;
  } catch (const std::exception &e) {
    // Nothing may cross the C boundary.
    ZARK_PM_LOG_ERROR("KLibApplySavedRules: %s", e.what());
    out.errType = kSaveErrGeneric;
    return -1;
  }
}
