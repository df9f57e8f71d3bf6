// Fuzz target of the rule configuration reader (ParseRuleConf), the text of
// /etc/portforward's rule files. Besides not crashing:
// - a refusal has a reason and no rule;
// - an accepted text is within the bounds, every field fits a rule record;
// - writing the accepted rules (SerializeRuleConf) gives a text that reads
//   back to the same rules, field by field, and writes the same text again.
#include "fuzz_support.h"
#include "rules/rule_conf_format.h"
#include "syslog_capture.h"

#include <cstddef>
#include <cstdint>
#include <string>

namespace {

using zark::fuzz::Require;
using namespace zark::portmap;

bool SameRule(const RouterRule &a, const RouterRule &b) {
  return a.ruleId == b.ruleId && a.enable == b.enable &&
         a.routerPort == b.routerPort && a.dsPort == b.dsPort &&
         a.protocol == b.protocol && a.serviceId == b.serviceId &&
         a.serviceName == b.serviceName;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  // Log lines are captured (tests/support/syslog_capture.h); keep only
  // this input's.
  zark::test::ClearLogs();
  const std::string_view text = zark::fuzz::AsText(data, size);
  const ParsedRuleConf parsed = ParseRuleConf(text);
  if (!parsed.ok) {
    Require(parsed.rules.empty(), "a refused text gave rules");
    Require(!parsed.error.empty(), "a refusal without a reason");
    return 0;
  }
  Require(text.size() <= kMaxRuleConfBytes, "a text beyond the size bound");
  Require(parsed.rules.size() <= kMaxRuleConfRules, "rules beyond the bound");
  for (const RouterRule &rule : parsed.rules) {
    Require(FitsRuleField(rule.ruleId) && FitsRuleField(rule.routerPort) &&
                FitsRuleField(rule.dsPort) && FitsRuleField(rule.protocol) &&
                FitsRuleField(rule.serviceId) &&
                FitsRuleField(rule.serviceName),
            "an accepted field does not fit a rule record");
  }
  const std::string written = SerializeRuleConf(parsed.rules);
  const ParsedRuleConf again = ParseRuleConf(written);
  Require(again.ok, "written rules do not read back: " + again.error);
  Require(again.rules.size() == parsed.rules.size(),
          "written rules read back as another count");
  for (std::size_t i = 0; i < again.rules.size(); ++i) {
    Require(SameRule(again.rules[i], parsed.rules[i]),
            "rule " + std::to_string(i) + " reads back different");
  }
  Require(SerializeRuleConf(again.rules) == written, "writing is not stable");
  return 0;
}
