// Helpers of the rule store shared with the library's C interface.
#ifndef ZARK_PORTMAP_RULE_STORE_INTERNAL_H
#define ZARK_PORTMAP_RULE_STORE_INTERNAL_H

#include "RouterRuleConf.h"

#include <span>

namespace zark::portmap {

// Copies rules into a new calloc'd array of records (texts NUL-terminated,
// enable 1 or 0) for KLibFreeRulesArr. No rule: *rules NULL, *count 0.
// False when count or rules is NULL, a text does not fit a record field, or
// the allocation fails; *count and *rules are then 0 and NULL (when given).
[[nodiscard]] bool RulesToArray(std::span<const RouterRule> source, int *count,
                                ZARK_ROUTER_RULE **rules);

} // namespace zark::portmap

#endif
