// What the entry points that work from the saved rules share: reading them
// into an owned array, and handing a job's summary to a C caller.
#ifndef ZARK_PORTMAP_API_SAVED_RULES_ACCESS_H
#define ZARK_PORTMAP_API_SAVED_RULES_ACCESS_H

#include "apply/save_rules.h"
#include "zarkportforward.h"

#include <memory>
#include <span>

namespace zark::portmap {

struct RulesArrayDeleter {
  void operator()(ZARK_ROUTER_RULE *rules) const { KLibFreeRulesArr(rules); }
};

// The saved rule configuration (ZARK_PORTMAP_RULE_CONF).
struct SavedRuleArray {
  std::unique_ptr<ZARK_ROUTER_RULE, RulesArrayDeleter> rules;
  int count = 0;

  [[nodiscard]] std::span<const ZARK_ROUTER_RULE> Span() const {
    return {rules.get(), static_cast<std::size_t>(count)};
  }
};

// Reads the saved rules; false (logged by the reader) when they cannot be
// read.
[[nodiscard]] inline bool ReadSavedRules(SavedRuleArray &saved) {
  ZARK_ROUTER_RULE *raw = nullptr;
  ZARK_LIBZARKPORTMAP_ERR readErr{};
  if (KLibGetRulesArrFromRuleConf(&saved.count, &raw, nullptr, false,
                                  &readErr) < 0) {
    return false;
  }
  saved.rules.reset(raw);
  return true;
}

inline void CopySummary(const ApplySummary &done,
                        ZARK_PORTMAP_APPLY_SUMMARY *summary) {
  if (summary == nullptr) {
    return;
  }
  summary->deleted = done.deleted;
  summary->added = done.added;
  summary->checked = done.checked;
  summary->unchanged = done.unchanged;
  summary->failed = done.failed;
  summary->repaired = done.repaired;
}

} // namespace zark::portmap

#endif
