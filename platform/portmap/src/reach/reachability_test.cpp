#include "reach/reachability_test.h"

#include "base/conf_file.h"
#include "base/portmap_log.h"
#include "base/record_text.h"
#include "reach/token_listener.h"
#include "rules/rule_validation.h"

#include <syslog.h>

#include <algorithm>
#include <atomic>
#include <cstring>
#include <exception>
#include <map>
#include <mutex>
#include <thread>

namespace zark::portmap {
namespace {

using Clock = std::chrono::steady_clock;

std::string OneLine(std::string_view text) {
  std::string line(text);
  std::replace_if(
      line.begin(), line.end(), [](char c) { return c == '\n' || c == '\r'; },
      ' ');
  return line;
}

std::string PortText(IpProtocol protocol, uint16_t port) {
  return std::string(ProtocolText(protocol)) + " port " + std::to_string(port);
}

// The status file of one test, rewritten whole at each update.
class StatusFile {
public:
  StatusFile(std::string path, const std::vector<std::string> &ids)
      : mPath(std::move(path)) {
    for (const std::string &id : ids) {
      mLines.push_back({id, ""});
    }
  }

  void Set(std::size_t index, std::string result) {
    std::lock_guard<std::mutex> lock(mMutex);
    mLines[index].second = std::move(result);
    mWriteFailed |= !WriteLocked();
  }

  [[nodiscard]] bool Write() {
    std::lock_guard<std::mutex> lock(mMutex);
    return WriteLocked();
  }

  [[nodiscard]] bool WriteFailed() const {
    std::lock_guard<std::mutex> lock(mMutex);
    return mWriteFailed;
  }

  [[nodiscard]] const std::string &Result(std::size_t index) const {
    return mLines[index].second;
  }

private:
  bool WriteLocked() {
    std::string text;
    for (const auto &[id, result] : mLines) {
      text += StatusLine(id, result);
    }
    return ReplaceFileAtomically(mPath, text, 0644);
  }

  std::string mPath;
  mutable std::mutex mMutex;
  std::vector<std::pair<std::string, std::string>> mLines;
  bool mWriteFailed = false;
};

// The ports of one local port and protocol: checked one after the other
// behind one listener.
struct LocalPortGroup {
  IpProtocol protocol = IpProtocol::kTcp;
  uint16_t localPort = 0;
  // (rule index, check index)
  std::vector<std::pair<std::size_t, std::size_t>> checks;
};

} // namespace

RuleChecks PlanRuleChecks(const ZARK_ROUTER_RULE &rule) {
  RuleChecks planned;
  planned.ruleId = std::string(Field(rule.rule_id));
  const std::string_view protocolText = Field(rule.router_protocol);
  std::optional<std::vector<IpProtocol>> protocols =
      RuleProtocols(protocolText);
  if (!protocols) {
    planned.refusal =
        "bad rule: unknown protocol \"" + std::string(protocolText) + "\"";
    return planned;
  }
  std::string_view routerText = Field(rule.router_port);
  std::string_view localText = Field(rule.ds_port);
  if (routerText.find_first_not_of(" \t") == std::string_view::npos) {
    routerText = localText;
  }
  if (localText.find_first_not_of(" \t") == std::string_view::npos) {
    localText = routerText;
  }
  if (routerText.find_first_not_of(" \t") == std::string_view::npos) {
    planned.refusal = "bad rule: no port";
    return planned;
  }
  std::vector<uint16_t> routerPorts;
  std::vector<uint16_t> localPorts;
  for (auto [text, ports] : {std::pair{routerText, &routerPorts},
                             std::pair{localText, &localPorts}}) {
    switch (ExpandPortText(text, *ports)) {
    case PortTextError::kNone:
      break;
    case PortTextError::kBadText:
      planned.refusal = "bad rule: port text \"" + std::string(text) + "\"";
      return planned;
    case PortTextError::kTooHigh:
      planned.refusal = "bad rule: a port above " +
                        std::to_string(kHighestPort) + " in \"" +
                        std::string(text) + "\"";
      return planned;
    case PortTextError::kRangeTooLong:
      planned.refusal = "bad rule: a range longer than " +
                        std::to_string(kMaxRangeLength) + " ports";
      return planned;
    }
  }
  if (routerPorts.empty() || routerPorts.size() != localPorts.size()) {
    planned.refusal = "bad rule: router and local ports do not pair up";
    return planned;
  }
  if (routerPorts.size() > static_cast<std::size_t>(kMaxPortsPerRule)) {
    planned.refusal =
        "bad rule: more than " + std::to_string(kMaxPortsPerRule) + " ports";
    return planned;
  }
  for (IpProtocol protocol : *protocols) {
    for (std::size_t i = 0; i < routerPorts.size(); ++i) {
      PortCheck check{protocol, routerPorts[i], localPorts[i]};
      if (std::find(planned.checks.begin(), planned.checks.end(), check) ==
          planned.checks.end()) {
        planned.checks.push_back(check);
      }
    }
  }
  return planned;
}

CheckResult CheckResultOf(const PortCheck &check, const ProbeAnswer &answer,
                          bool withToken) {
  switch (answer.status) {
  case ProbeStatus::kReachable:
    return {CheckOutcome::kReachable, ""};
  case ProbeStatus::kUnreachable:
    return {CheckOutcome::kUnreachable, ""};
  case ProbeStatus::kUnknown:
    if (!withToken && check.protocol == IpProtocol::kUdp) {
      return {CheckOutcome::kUnknown,
              "unknown: a service listens on " +
                  PortText(check.protocol, check.localPort) +
                  " and does not answer the probe"};
    }
    return {CheckOutcome::kUnknown, "unknown: " + answer.reason};
  case ProbeStatus::kRateLimited:
    return {CheckOutcome::kError,
            "the probe service refused: too many requests"};
  case ProbeStatus::kRefused:
    return {CheckOutcome::kError,
            "the probe service refused the request (" + answer.reason + ")"};
  case ProbeStatus::kServiceUnavailable:
    return {CheckOutcome::kError, "probe service not reachable"};
  case ProbeStatus::kBadAnswer:
    return {CheckOutcome::kError, "probe service answer not understood"};
  case ProbeStatus::kAddress:
    return {CheckOutcome::kError, "probe service answer not understood"};
  case ProbeStatus::kCancelled:
    return {CheckOutcome::kError, "not tested: cancelled"};
  }
  return {CheckOutcome::kError, "probe service answer not understood"};
}

std::string RuleResultText(std::span<const CheckResult> results) {
  int reachable = 0;
  int unreachable = 0;
  const CheckResult *unknown = nullptr;
  for (const CheckResult &result : results) {
    switch (result.outcome) {
    case CheckOutcome::kError:
      return result.text;
    case CheckOutcome::kReachable:
      ++reachable;
      break;
    case CheckOutcome::kUnreachable:
      ++unreachable;
      break;
    case CheckOutcome::kUnknown:
      if (unknown == nullptr) {
        unknown = &result;
      }
      break;
    }
  }
  const int total = static_cast<int>(results.size());
  if (total == 0) {
    return "not tested: no port";
  }
  if (reachable == total) {
    return "reachable";
  }
  if (reachable > 0) {
    return "partly reachable (" + std::to_string(reachable) + " of " +
           std::to_string(total) + " ports)";
  }
  if (unknown != nullptr && unreachable == 0) {
    return unknown->text;
  }
  return "unreachable";
}

std::string StatusLine(std::string_view ruleId, std::string_view result) {
  return OneLine(ruleId) + "=" + OneLine(result) + "\n";
}

bool ResetPortTestStatus(const std::string &path) {
  return ReplaceFileAtomically(path, "", 0644);
}

PortTestEnvironment DefaultPortTestEnvironment() {
  PortTestEnvironment environment;
  environment.makeProbe =
      [](std::string &why) -> std::unique_ptr<OutsideProbe> {
    return ConfiguredProbeClient(why);
  };
  return environment;
}

namespace {

// The plans of the enabled rules, in the order of the rule list.
std::vector<RuleChecks>
PlanEnabledRules(std::span<const ZARK_ROUTER_RULE> rules) {
  std::vector<RuleChecks> plans;
  for (const ZARK_ROUTER_RULE &rule : rules) {
    if (rule.enable != 0) {
      plans.push_back(PlanRuleChecks(rule));
    }
  }
  return plans;
}

std::vector<std::string> RuleIdsOf(const std::vector<RuleChecks> &plans) {
  std::vector<std::string> ids;
  ids.reserve(plans.size());
  for (const RuleChecks &plan : plans) {
    ids.push_back(plan.ruleId);
  }
  return ids;
}

// One port test: the plans of its rules, their results as checks finish,
// the status file and the counts of the summary.
class PortTestRun {
public:
  PortTestRun(std::vector<RuleChecks> plans,
              const PortTestEnvironment &environment, PortTestSummary &counts)
      : mEnvironment(environment), mCounts(counts), mPlans(std::move(plans)),
        mStatus(environment.statusPath, RuleIdsOf(mPlans)),
        mResults(mPlans.size()), mPending(mPlans.size()) {}

  int Run() {
    // Every rule "being tested" first, so that a reader sees the whole list.
    if (!mStatus.Write()) {
      ZARK_PM_LOG_ERROR("port test: cannot write %s",
                        mEnvironment.statusPath.c_str());
      mCounts.error = ZARK_PORTMAP_ERR_IO;
      return -1;
    }
    if (mPlans.empty()) {
      return 0;
    }
    AdmitRules();
    std::unique_ptr<OutsideProbe> probe = MakeProbe();
    if (probe == nullptr) {
      return -1;
    }
    CheckGroupsInWorkers(GroupChecksByLocalPort(), *probe);
    const bool unfinished = MarkUnfinishedRules();
    LogSummary();
    return Conclude(unfinished);
  }

private:
  // Reports the rules that cannot be tested or that go beyond the limit of
  // checks, and readies the results of the others.
  void AdmitRules() {
    for (std::size_t i = 0; i < mPlans.size(); ++i) {
      if (!mPlans[i].refusal.empty()) {
        ZARK_PM_LOG_ERROR("port test: rule \"%s\" cannot be tested: %s",
                          mPlans[i].ruleId.c_str(), mPlans[i].refusal.c_str());
        mStatus.Set(i, mPlans[i].refusal);
        continue;
      }
      const int checks = static_cast<int>(mPlans[i].checks.size());
      if (mToCheck + checks > mEnvironment.maxChecks) {
        mStatus.Set(i, "not tested: more than " +
                           std::to_string(mEnvironment.maxChecks) +
                           " ports in one test");
        mPlans[i].checks.clear();
        continue;
      }
      mToCheck += checks;
      mResults[i].resize(mPlans[i].checks.size());
      mPending[i] = mPlans[i].checks.size();
    }
  }

  // The outside probe; null, with every pending rule told why, when there
  // is none.
  std::unique_ptr<OutsideProbe> MakeProbe() {
    std::string why;
    std::unique_ptr<OutsideProbe> probe =
        mEnvironment.makeProbe ? mEnvironment.makeProbe(why) : nullptr;
    if (probe != nullptr) {
      return probe;
    }
    if (why.empty()) {
      why = kNoProbeServiceText;
    }
    ZARK_PM_LOG_ERROR("port test: %s; no rule can be tested", why.c_str());
    for (std::size_t i = 0; i < mPlans.size(); ++i) {
      if (mPending[i] > 0) {
        mStatus.Set(i, why);
      }
    }
    mCounts.error = ZARK_PORTMAP_ERR_PROBE_SERVICE;
    return nullptr;
  }

  // The pending checks, grouped by local port and protocol.
  std::vector<LocalPortGroup> GroupChecksByLocalPort() const {
    std::map<std::pair<IpProtocol, uint16_t>, LocalPortGroup> byLocalPort;
    for (std::size_t i = 0; i < mPlans.size(); ++i) {
      if (mPending[i] == 0) {
        continue;
      }
      for (std::size_t c = 0; c < mPlans[i].checks.size(); ++c) {
        const PortCheck &check = mPlans[i].checks[c];
        LocalPortGroup &group = byLocalPort[{check.protocol, check.localPort}];
        group.protocol = check.protocol;
        group.localPort = check.localPort;
        group.checks.push_back({i, c});
      }
    }
    std::vector<LocalPortGroup> groups;
    groups.reserve(byLocalPort.size());
    for (auto &[key, group] : byLocalPort) {
      groups.push_back(std::move(group));
    }
    return groups;
  }

  // Checks the groups on up to mEnvironment.workers threads, this one
  // included; returns when all are joined.
  void CheckGroupsInWorkers(const std::vector<LocalPortGroup> &groups,
                            OutsideProbe &probe) {
    const Clock::time_point deadline = Clock::now() + mEnvironment.deadline;
    std::atomic<std::size_t> next{0};
    auto guarded = [&] {
      try {
        CheckNextGroups(groups, next, probe, deadline);
      } catch (const std::exception &e) {
        // Nothing may leave a worker; its unfinished checks stay "testing"
        // and the test fails below.
        ZARK_PM_LOG_ERROR("port test worker: %s", e.what());
      }
    };
    const std::size_t workers =
        std::min<std::size_t>(std::max(mEnvironment.workers, 1), groups.size());
    std::vector<std::jthread> threads;
    for (std::size_t i = 1; i < workers; ++i) {
      threads.emplace_back(guarded);
    }
    guarded();
  } // joined here

  // One worker: takes the groups not yet taken, one at a time.
  void CheckNextGroups(const std::vector<LocalPortGroup> &groups,
                       std::atomic<std::size_t> &next, OutsideProbe &probe,
                       Clock::time_point deadline) {
    for (;;) {
      const std::size_t index = next.fetch_add(1);
      if (index >= groups.size()) {
        return;
      }
      CheckGroup(groups[index], probe, deadline);
    }
  }

  // Checks the ports of one group behind one listener on its local port,
  // which answers the probe's token when it could be opened.
  void CheckGroup(const LocalPortGroup &group, OutsideProbe &probe,
                  Clock::time_point deadline) {
    std::string token = NewProbeToken();
    TokenListener listener;
    TokenListener::OpenResult opened = TokenListener::OpenResult::kFailed;
    if (!token.empty()) {
      opened = listener.Open(group.protocol, group.localPort, token);
    }
    if (opened == TokenListener::OpenResult::kOpen) {
      std::lock_guard<std::mutex> lock(mMutex);
      ++mCounts.listeners;
    } else {
      token.clear();
    }
    for (const auto &[rule, check] : group.checks) {
      const PortCheck &port = mPlans[rule].checks[check];
      if (opened == TokenListener::OpenResult::kFailed) {
        Record(
            rule, check,
            {CheckOutcome::kError,
             "cannot listen on " + PortText(group.protocol, group.localPort)});
        continue;
      }
      if (Clock::now() >= deadline) {
        Record(rule, check,
               {CheckOutcome::kError, "not tested: time limit reached"});
        continue;
      }
      ProbeAnswer answer = probe.Check(port.protocol, port.routerPort, token);
      if (answer.status == ProbeStatus::kUnreachable) {
        syslog(LOG_INFO,
               "%s:%d port test: rule \"%s\" %s does not answer from "
               "outside (%s)",
               __FILE__, __LINE__, mPlans[rule].ruleId.c_str(),
               PortText(port.protocol, port.routerPort).c_str(),
               answer.reason.c_str());
      }
      Record(rule, check, CheckResultOf(port, answer, !token.empty()));
    }
  }

  // Counts one finished check and writes its rule's result once the rule's
  // last check is in.
  void Record(std::size_t rule, std::size_t check, CheckResult result) {
    std::string done;
    {
      std::lock_guard<std::mutex> lock(mMutex);
      CountOutcome(result.outcome);
      mResults[rule][check] = std::move(result);
      if (--mPending[rule] == 0) {
        done = RuleResultText(mResults[rule]);
      }
    }
    if (!done.empty()) {
      mStatus.Set(rule, done);
    }
  }

  // Called with mMutex held.
  void CountOutcome(CheckOutcome outcome) {
    switch (outcome) {
    case CheckOutcome::kReachable:
      ++mCounts.reachable;
      break;
    case CheckOutcome::kUnreachable:
      ++mCounts.unreachable;
      break;
    default:
      ++mCounts.noVerdict;
      break;
    }
    ++mCounts.checks;
    if (outcome != CheckOutcome::kError) {
      ++mCounts.answered;
    }
  }

  // Marks the rules whose checks did not all finish; true when there is one.
  bool MarkUnfinishedRules() {
    bool unfinished = false;
    for (std::size_t i = 0; i < mPlans.size(); ++i) {
      if (mPending[i] > 0) {
        unfinished = true;
        mStatus.Set(i, "not tested: internal error");
      }
    }
    return unfinished;
  }

  void LogSummary() const {
    syslog(LOG_INFO,
           "%s:%d port test: %d rule(s), %d port(s) checked: %d reachable, %d "
           "unreachable, %d without a verdict",
           __FILE__, __LINE__, mCounts.rules, mCounts.checks, mCounts.reachable,
           mCounts.unreachable, mCounts.noVerdict);
  }

  // The result of the test once every check is done: -1, with the error
  // set, when the status file could not be kept, a check did not finish or
  // the probe service answered none.
  int Conclude(bool unfinished) {
    if (mStatus.WriteFailed()) {
      ZARK_PM_LOG_ERROR("port test: %s could not be kept up to date",
                        mEnvironment.statusPath.c_str());
      mCounts.error = ZARK_PORTMAP_ERR_IO;
      return -1;
    }
    if (unfinished) {
      mCounts.error = ZARK_PORTMAP_ERR_GENERIC;
      return -1;
    }
    if (mToCheck > 0 && mCounts.answered == 0) {
      ZARK_PM_LOG_ERROR("port test: the probe service answered no check");
      mCounts.error = ZARK_PORTMAP_ERR_PROBE_SERVICE;
      return -1;
    }
    return 0;
  }

  const PortTestEnvironment &mEnvironment;
  PortTestSummary &mCounts;
  std::vector<RuleChecks> mPlans;
  StatusFile mStatus;
  // Results per rule, filled as checks finish; the checks still to finish.
  std::vector<std::vector<CheckResult>> mResults;
  std::vector<std::size_t> mPending;
  int mToCheck = 0;
  std::mutex mMutex; // guards mResults, mPending, mCounts
};

} // namespace

int RunPortTest(std::span<const ZARK_ROUTER_RULE> rules,
                const PortTestEnvironment &environment,
                PortTestSummary *summary) {
  PortTestSummary local;
  PortTestSummary *const target = summary != nullptr ? summary : &local;
  PortTestSummary &counts = *target;
  counts = PortTestSummary{};
  std::vector<RuleChecks> plans = PlanEnabledRules(rules);
  counts.rules = static_cast<int>(plans.size());
  PortTestRun run(std::move(plans), environment, counts);
  return run.Run();
}

} // namespace zark::portmap

extern "C" int KLibTestRulesInit(void) {
  try {
    if (!zark::portmap::ResetPortTestStatus(ZARK_PORTMAP_TEST_STATUS)) {
      ZARK_PM_LOG_ERROR("KLibTestRulesInit: cannot start %s",
                        ZARK_PORTMAP_TEST_STATUS);
      return -1;
    }
    return 0;
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("KLibTestRulesInit: %s", e.what());
    return -1;
  }
}

extern "C" int KLibTestRules(int count, ZARK_ROUTER_RULE *rules,
                             ZARK_LIBZARKPORTMAP_ERR *err, bool flag) {
  using namespace zark::portmap;
  // flag has no meaning for this call; it is accepted and ignored.
  (void)flag;
  if (count < 0 || (count > 0 && rules == nullptr)) {
    ZARK_PM_LOG_ERROR("KLibTestRules: bad arguments (count %d, rules %s)",
                      count, rules != nullptr ? "given" : "NULL");
    if (err != nullptr) {
      err->err = ZARK_PORTMAP_ERR_BAD_PARAMETER;
    }
    return -1;
  }
  try {
    PortTestEnvironment environment = DefaultPortTestEnvironment();
    PortTestSummary summary;
    int rc = RunPortTest(std::span<const ZARK_ROUTER_RULE>(
                             rules, static_cast<std::size_t>(count)),
                         environment, &summary);
    if (err != nullptr) {
      err->err = summary.error;
    }
    return rc;
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("KLibTestRules: %s", e.what());
    if (err != nullptr) {
      err->err = ZARK_PORTMAP_ERR_GENERIC;
    }
    return -1;
  }
}
