// The C interface to rule configurations: reading one into a record array,
// and freeing such an array.
#include "libzarkportmap.h"

#include "RouterRuleConf.h"
#include "base/portmap_log.h"
#include "rules/rule_store_internal.h"

#include <cstdlib>
#include <string>

namespace {

void SetErr(ZARK_LIBZARKPORTMAP_ERR *err, int32_t code) {
  if (err != nullptr) {
    err->err = code;
  }
}

int RulesArrFromConf(const char *call, const char *path, int *count,
                     ZARK_ROUTER_RULE **rules, ZARK_LIBZARKPORTMAP_ERR *err) {
  if (count == nullptr || rules == nullptr) {
    ZARK_PM_LOG_ERROR("%s: count and rules must not be NULL", call);
    SetErr(err, ZARK_PORTMAP_ERR_BAD_PARAMETER);
    return -1;
  }
  *count = 0;
  *rules = nullptr;
  try {
    RouterRuleConfReader reader{std::string(path)};
    if (!reader.IsValid()) {
      // The reader has logged why.
      SetErr(err, ZARK_PORTMAP_ERR_IO);
      return -1;
    }
    if (!zark::portmap::RulesToArray(reader.Rules(), count, rules)) {
      SetErr(err, ZARK_PORTMAP_ERR_GENERIC);
      return -1;
    }
  } catch (const std::exception &e) {
    // Out of memory while reading; nothing may cross the C boundary.
    ZARK_PM_LOG_ERROR("%s: %s", call, e.what());
    SetErr(err, ZARK_PORTMAP_ERR_GENERIC);
    return -1;
  }
  SetErr(err, ZARK_PORTMAP_ERR_NONE);
  return 0;
}

} // namespace

extern "C" {

int KLibGetRulesArrFromRuleConf(int *count, ZARK_ROUTER_RULE **rules,
                                char *confPath, bool /*flag*/,
                                ZARK_LIBZARKPORTMAP_ERR *err) {
  return RulesArrFromConf("KLibGetRulesArrFromRuleConf",
                          confPath != nullptr ? confPath
                                              : ZARK_PORTMAP_RULE_CONF,
                          count, rules, err);
}

int KLibGetRulesArrFromTestRuleConf(int *count, ZARK_ROUTER_RULE **rules,
                                    char *confPath, bool /*flag*/,
                                    ZARK_LIBZARKPORTMAP_ERR *err) {
  return RulesArrFromConf("KLibGetRulesArrFromTestRuleConf",
                          confPath != nullptr ? confPath
                                              : ZARK_PORTMAP_TEST_RULE_CONF,
                          count, rules, err);
}

void KLibFreeRulesArr(ZARK_ROUTER_RULE *rules) {
  std::free(rules);
}

} // extern "C"
