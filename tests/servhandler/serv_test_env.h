// Set-up and checks shared by the RouterRuleServHandler tests: saved rules,
// string lists, and the handler's log lines.
#ifndef ZARK_TESTS_SERVHANDLER_SERV_TEST_ENV_H
#define ZARK_TESTS_SERVHANDLER_SERV_TEST_ENV_H

#include "RouterRuleConf.h"
#include "firewall_test_files.h"

#include <string>
#include <vector>

namespace zark::test {

// A rule as the rule store keeps it.
RouterRule Rule(const std::string &id, bool enable, const std::string &router,
                const std::string &local, const std::string &protocol,
                const std::string &serviceId = "");

// Saves rules as the current rule set (ZARK_PORTMAP_RULE_CONF), through the
// real rule store.
void SaveRules(const std::vector<RouterRule> &rules);

// "id|enabled|router|local|protocol|serviceId|serviceName" per rule, for
// comparisons with readable failures.
std::vector<std::string> Describe(const std::vector<RouterRule> &rules);

// True when the handler logged, at error priority, a line
// "src/RouterRuleServHandler.cpp:<line> " followed by text matching
// pattern (a regular expression matched against the whole rest).
bool HasServLog(const std::string &pattern);
// The number of such lines.
int CountServLogs(const std::string &pattern);

// Pattern of the platform error state "[0x%04X %s:%d]".
inline const std::string kErrState = R"(\[0x[0-9A-F]{4} [^ ]*:\d+\])";

} // namespace zark::test

#endif
