// The reachability test of rules from outside (KLibTestRulesInit,
// KLibTestRules): for every enabled rule, every router port it maps (as
// KLibSaveRules maps it: rule_validation.h) is checked by the probe service
// (probe_client.h), which connects back to our outside address.
//
// Where nothing of this server listens on the rule's local port, a
// temporary listener (token_listener.h) is opened there with a one-time
// token, so that "reachable" means the path ends at this server; where a
// service already listens, the probe is asked without a token (TCP: a
// completed connection counts; UDP: any reply, silence is "unknown").
//
// Results go to the status file (/tmp/pfStatusRule), one line per enabled
// rule in rule order: "<rule id>=" while it is being tested, then
// "<rule id>=<result>", the whole file replaced atomically at each update so
// that a reader never sees half a line. Results:
//   "reachable"                      every port answered
//   "unreachable"                    no port answered
//   "partly reachable (k of n ports)"
//   "unknown: ..."                   a UDP service that does not reply
//   "no probe service configured"    and other reasons the test could not
//   "probe service not reachable"    run for the rule ("bad rule: ...",
//   "not tested: ...")               "cannot listen on tcp port 80" ...)
// Line breaks in a rule id are written as blanks.
//
// Bounded: checks run on at most `workers` threads (owned, joined), each
// bounded by the probe client's timeouts; checks not started before the
// deadline are reported "not tested: time limit reached".
#ifndef ZARK_PORTMAP_REACH_REACHABILITY_TEST_H
#define ZARK_PORTMAP_REACH_REACHABILITY_TEST_H

#include "base/port_mapping.h"
#include "libzarkportmap.h"
#include "reach/probe_client.h"

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

// One port of a rule to check: the router port the probe knocks on and the
// local port the router forwards it to.
struct PortCheck {
  IpProtocol protocol = IpProtocol::kTcp;
  uint16_t routerPort = 0;
  uint16_t localPort = 0;
  friend bool operator==(const PortCheck &, const PortCheck &) = default;
};

struct RuleChecks {
  std::string ruleId;
  std::vector<PortCheck> checks;
  std::string refusal; // not empty: the rule cannot be tested, and why
};

// The checks of one enabled rule, paired as KLibSaveRules pairs router and
// local ports. A rule that KLibSaveRules would refuse gets refusal set. Pure.
[[nodiscard]] RuleChecks PlanRuleChecks(const ZARK_ROUTER_RULE &rule);

enum class CheckOutcome { kReachable, kUnreachable, kUnknown, kError };

struct CheckResult {
  CheckOutcome outcome = CheckOutcome::kError;
  std::string text; // kUnknown, kError: the text reported for the rule
};

// What a probe answer means for one check (token empty: asked without
// one). Pure.
[[nodiscard]] CheckResult CheckResultOf(const PortCheck &check,
                                        const ProbeAnswer &answer,
                                        bool withToken);

// The result text of a rule from its checks' results (see the top of this
// file). Pure.
[[nodiscard]] std::string RuleResultText(std::span<const CheckResult> results);

// "<rule id>=<result>\n", line breaks in either written as blanks. Pure.
[[nodiscard]] std::string StatusLine(std::string_view ruleId,
                                     std::string_view result);

struct PortTestEnvironment {
  std::string statusPath = ZARK_PORTMAP_TEST_STATUS;
  // The outside probe; null, with why set, when there is none to use.
  std::function<std::unique_ptr<OutsideProbe>(std::string &why)> makeProbe;
  // Checks under way at once; below the probe service's limit of
  // connections from one address (8), so that checks are not refused busy.
  int workers = 4;
  std::chrono::seconds deadline{300};
  // At most this many ports are checked in one test; rules beyond are
  // reported "not tested".
  int maxChecks = 1024;
};

// The configured probe service, the library's status file.
[[nodiscard]] PortTestEnvironment DefaultPortTestEnvironment();

// Replaces the status file with an empty one, atomically. False, logged,
// when it cannot be written.
[[nodiscard]] bool ResetPortTestStatus(const std::string &path);

struct PortTestSummary {
  int rules = 0;       // enabled rules
  int checks = 0;      // ports checked
  int reachable = 0;   // checks answered "reachable"
  int unreachable = 0; // checks answered "unreachable"
  int noVerdict = 0;   // checks without a verdict (errors, unknown)
  int answered = 0;    // checks the probe service answered (any verdict)
  int listeners = 0;   // temporary listeners opened
  // Why the test could not run (-1): ZARK_PORTMAP_ERR_IO (status file),
  // ZARK_PORTMAP_ERR_PROBE_SERVICE (none configured, or it answered no
  // check), ZARK_PORTMAP_ERR_GENERIC; ZARK_PORTMAP_ERR_NONE on 0.
  int error = ZARK_PORTMAP_ERR_NONE;
};

// Tests rules; see the top of this file. 0 when the test ran (whatever the
// rules' results), -1 when it could not: the status file cannot be written,
// no probe service is configured or usable, or no check got an answer from
// it (summary->error says which). The status file says why for every rule
// either way.
[[nodiscard]] int RunPortTest(std::span<const ZARK_ROUTER_RULE> rules,
                              const PortTestEnvironment &environment,
                              PortTestSummary *summary = nullptr);

} // namespace zark::portmap

#endif
