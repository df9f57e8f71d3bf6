#include "serv_test_env.h"

#include "libzarkportmap.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <syslog.h>

#include <regex>

namespace zark::test {

RouterRule Rule(const std::string &id, bool enable, const std::string &router,
                const std::string &local, const std::string &protocol,
                const std::string &serviceId) {
  RouterRule rule;
  rule.ruleId = id;
  rule.enable = enable;
  rule.routerPort = router;
  rule.dsPort = local;
  rule.protocol = protocol;
  rule.serviceId = serviceId;
  return rule;
}

void SaveRules(const std::vector<RouterRule> &rules) {
  RouterRuleConfWriter writer;
  for (const RouterRule &rule : rules) {
    ASSERT_TRUE(writer.AddRule(rule.ruleId, rule.enable, rule.routerPort,
                               rule.dsPort, rule.protocol, rule.serviceId,
                               rule.serviceName));
  }
  ASSERT_TRUE(writer.Sync(ZARK_PORTMAP_RULE_CONF));
}

std::vector<std::string> Describe(const std::vector<RouterRule> &rules) {
  std::vector<std::string> out;
  for (const RouterRule &rule : rules) {
    out.push_back(rule.ruleId + "|" + (rule.enable ? "1" : "0") + "|" +
                  rule.routerPort + "|" + rule.dsPort + "|" + rule.protocol +
                  "|" + rule.serviceId + "|" + rule.serviceName);
  }
  return out;
}

int CountServLogs(const std::string &pattern) {
  std::regex re("^src/RouterRuleServHandler\\.cpp:\\d+ " + pattern + "$");
  int count = 0;
  for (const LogLine &line : CapturedLogs()) {
    if (line.priority == LOG_ERR && std::regex_match(line.message, re)) {
      ++count;
    }
  }
  return count;
}

bool HasServLog(const std::string &pattern) {
  return CountServLogs(pattern) > 0;
}

} // namespace zark::test
