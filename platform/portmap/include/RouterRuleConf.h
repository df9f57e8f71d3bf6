// Rule configurations of the port-map library: collecting rules and writing
// them out (RouterRuleConfWriter), and walking the rules of a stored
// configuration (RouterRuleConfReader).
#ifndef ZARK_PLATFORM_ROUTERRULECONF_H
#define ZARK_PLATFORM_ROUTERRULECONF_H

#include "libzarkportmap.h"

#include <string>
#include <vector>

// One rule as the rule store keeps it.
struct RouterRule {
  std::string ruleId;
  bool enable = false;
  std::string routerPort;
  std::string dsPort;
  std::string protocol;
  std::string serviceId;
  std::string serviceName;
};

// Collects rules in the order they are added.
class RouterRuleConfWriter {
public:
  RouterRuleConfWriter();
  ~RouterRuleConfWriter();

  // Adds a rule; the int overload uses the decimal text of ruleId. Every
  // text must fit a rule record field (at most 1023 bytes, no NUL byte): a
  // text that does not is refused with false (logged) and nothing is added.
  // Any other bytes are kept exactly.
  bool AddRule(int ruleId, bool enable, const std::string &routerPort,
               const std::string &dsPort, const std::string &protocol,
               const std::string &serviceId, const std::string &serviceName);
  bool AddRule(const std::string &ruleId, bool enable,
               const std::string &routerPort, const std::string &dsPort,
               const std::string &protocol, const std::string &serviceId,
               const std::string &serviceName);

  // Hands out the collected rules as a new array for KLibFreeRulesArr
  // (*rules is NULL and *count 0 when there is none). False on a null
  // argument or a failed allocation.
  bool ToArray(int *count, ZARK_ROUTER_RULE **rules) const;

  // Writes the collected rules as the rule configuration at path,
  // atomically (temporary file ".<name>.XXXXXX" in the same folder, fsync,
  // rename, fsync of the folder), mode 0600; a missing folder is created
  // with mode 0755. The format is described in platform/portmap/README.md.
  // False, logged, with the old file left whole and no temporary file left
  // behind, when anything fails, and when there are more than 65536 rules
  // (which no reader would take).
  bool Sync(const std::string &path) const;

  const std::vector<RouterRule> &Rules() const { return mRules; }

private:
  std::vector<RouterRule> mRules;
};

// Walks the rules of a stored rule configuration. The configuration is read
// once, at construction: testRules false reads the saved rule configuration
// (ZARK_PORTMAP_RULE_CONF), true the test rule configuration
// (ZARK_PORTMAP_TEST_RULE_CONF). A missing file holds no rule; an unreadable
// or malformed one (also an empty one, or one over 16 MiB or 65536 rules)
// makes IsValid() false, holds no rule and is logged once to syslog.
//
// Walking: StartNextRule(), then GetRuleInfo() for the current rule and
// NextRule() to move on, until NextRule() returns false.
class RouterRuleConfReader {
public:
  explicit RouterRuleConfReader(bool testRules = false);
  // Reads the configuration at path.
  explicit RouterRuleConfReader(const std::string &path);
  ~RouterRuleConfReader();

  bool IsValid() const { return mValid; }

  // Moves to the first rule; false when there is none.
  bool StartNextRule();
  // Moves to the next rule; false when the last one was passed.
  bool NextRule();

  // Fields of the current rule; false when there is no current rule.
  bool GetRuleInfo(bool &enable, std::string &routerPort, std::string &dsPort,
                   std::string &protocol, std::string &serviceId) const;
  bool GetRuleInfo(RouterRule &rule) const;

  const std::vector<RouterRule> &Rules() const { return mRules; }

private:
  std::vector<RouterRule> mRules;
  size_t mCurrent = 0;
  bool mValid = true;
};

#endif
