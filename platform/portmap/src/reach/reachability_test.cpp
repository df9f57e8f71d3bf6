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

int RunPortTest(std::span<const ZARK_ROUTER_RULE> rules,
                const PortTestEnvironment &environment,
                PortTestSummary *summary) {
  PortTestSummary local;
  PortTestSummary &counts = summary != nullptr ? *summary : local;
  counts = PortTestSummary{};

  std::vector<RuleChecks> plans;
  for (const ZARK_ROUTER_RULE &rule : rules) {
    if (rule.enable != 0) {
      plans.push_back(PlanRuleChecks(rule));
    }
  }
  counts.rules = static_cast<int>(plans.size());
  std::vector<std::string> ids;
  ids.reserve(plans.size());
  for (const RuleChecks &plan : plans) {
    ids.push_back(plan.ruleId);
  }
  StatusFile status(environment.statusPath, ids);
  // Every rule "being tested" first, so that a reader sees the whole list.
  if (!status.Write()) {
    ZARK_PM_LOG_ERROR("port test: cannot write %s",
                      environment.statusPath.c_str());
    counts.error = ZARK_PORTMAP_ERR_IO;
    return -1;
  }
  if (plans.empty()) {
    return 0;
  }

  // Results per rule, filled as checks finish.
  std::vector<std::vector<CheckResult>> results(plans.size());
  std::vector<std::size_t> pending(plans.size());
  int toCheck = 0;
  for (std::size_t i = 0; i < plans.size(); ++i) {
    if (!plans[i].refusal.empty()) {
      ZARK_PM_LOG_ERROR("port test: rule \"%s\" cannot be tested: %s",
                        plans[i].ruleId.c_str(), plans[i].refusal.c_str());
      status.Set(i, plans[i].refusal);
      continue;
    }
    const int checks = static_cast<int>(plans[i].checks.size());
    if (toCheck + checks > environment.maxChecks) {
      status.Set(i, "not tested: more than " +
                        std::to_string(environment.maxChecks) +
                        " ports in one test");
      plans[i].checks.clear();
      continue;
    }
    toCheck += checks;
    results[i].resize(plans[i].checks.size());
    pending[i] = plans[i].checks.size();
  }

  std::string why;
  std::unique_ptr<OutsideProbe> probe =
      environment.makeProbe ? environment.makeProbe(why) : nullptr;
  if (probe == nullptr) {
    if (why.empty()) {
      why = kNoProbeServiceText;
    }
    ZARK_PM_LOG_ERROR("port test: %s; no rule can be tested", why.c_str());
    for (std::size_t i = 0; i < plans.size(); ++i) {
      if (pending[i] > 0) {
        status.Set(i, why);
      }
    }
    counts.error = ZARK_PORTMAP_ERR_PROBE_SERVICE;
    return -1;
  }

  std::map<std::pair<IpProtocol, uint16_t>, LocalPortGroup> byLocalPort;
  for (std::size_t i = 0; i < plans.size(); ++i) {
    if (pending[i] == 0) {
      continue;
    }
    for (std::size_t c = 0; c < plans[i].checks.size(); ++c) {
      const PortCheck &check = plans[i].checks[c];
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

  const Clock::time_point deadline = Clock::now() + environment.deadline;
  std::mutex mutex; // guards results, pending, counts
  std::atomic<std::size_t> next{0};
  auto record = [&](std::size_t rule, std::size_t check, CheckResult result) {
    std::string done;
    {
      std::lock_guard<std::mutex> lock(mutex);
      switch (result.outcome) {
      case CheckOutcome::kReachable:
        ++counts.reachable;
        break;
      case CheckOutcome::kUnreachable:
        ++counts.unreachable;
        break;
      default:
        ++counts.noVerdict;
        break;
      }
      ++counts.checks;
      if (result.outcome != CheckOutcome::kError) {
        ++counts.answered;
      }
      results[rule][check] = std::move(result);
      if (--pending[rule] == 0) {
        done = RuleResultText(results[rule]);
      }
    }
    if (!done.empty()) {
      status.Set(rule, done);
    }
  };
  auto work = [&] {
    for (;;) {
      const std::size_t index = next.fetch_add(1);
      if (index >= groups.size()) {
        return;
      }
      const LocalPortGroup &group = groups[index];
      std::string token = NewProbeToken();
      TokenListener listener;
      TokenListener::OpenResult opened = TokenListener::OpenResult::kFailed;
      if (!token.empty()) {
        opened = listener.Open(group.protocol, group.localPort, token);
      }
      if (opened == TokenListener::OpenResult::kOpen) {
        std::lock_guard<std::mutex> lock(mutex);
        ++counts.listeners;
      } else {
        token.clear();
      }
      for (const auto &[rule, check] : group.checks) {
        const PortCheck &port = plans[rule].checks[check];
        if (opened == TokenListener::OpenResult::kFailed) {
          record(rule, check,
                 {CheckOutcome::kError,
                  "cannot listen on " +
                      PortText(group.protocol, group.localPort)});
          continue;
        }
        if (Clock::now() >= deadline) {
          record(rule, check,
                 {CheckOutcome::kError, "not tested: time limit reached"});
          continue;
        }
        ProbeAnswer answer =
            probe->Check(port.protocol, port.routerPort, token);
        if (answer.status == ProbeStatus::kUnreachable) {
          syslog(LOG_INFO,
                 "%s:%d port test: rule \"%s\" %s does not answer from "
                 "outside (%s)",
                 __FILE__, __LINE__, plans[rule].ruleId.c_str(),
                 PortText(port.protocol, port.routerPort).c_str(),
                 answer.reason.c_str());
        }
        record(rule, check, CheckResultOf(port, answer, !token.empty()));
      }
    }
  };
  auto guarded = [&] {
    try {
      work();
    } catch (const std::exception &e) {
      // Nothing may leave a worker; its unfinished checks stay "testing"
      // and the test fails below.
      ZARK_PM_LOG_ERROR("port test worker: %s", e.what());
    }
  };
  {
    const std::size_t workers =
        std::min<std::size_t>(std::max(environment.workers, 1), groups.size());
    std::vector<std::jthread> threads;
    for (std::size_t i = 1; i < workers; ++i) {
      threads.emplace_back(guarded);
    }
    guarded();
  } // joined here

  bool unfinished = false;
  for (std::size_t i = 0; i < plans.size(); ++i) {
    if (pending[i] > 0) {
      unfinished = true;
      status.Set(i, "not tested: internal error");
    }
  }
  syslog(LOG_INFO,
         "%s:%d port test: %d rule(s), %d port(s) checked: %d reachable, %d "
         "unreachable, %d without a verdict",
         __FILE__, __LINE__, counts.rules, counts.checks, counts.reachable,
         counts.unreachable, counts.noVerdict);
  if (status.WriteFailed()) {
    ZARK_PM_LOG_ERROR("port test: %s could not be kept up to date",
                      environment.statusPath.c_str());
    counts.error = ZARK_PORTMAP_ERR_IO;
    return -1;
  }
  if (unfinished) {
    counts.error = ZARK_PORTMAP_ERR_GENERIC;
    return -1;
  }
  if (toCheck > 0 && counts.answered == 0) {
    ZARK_PM_LOG_ERROR("port test: the probe service answered no check");
    counts.error = ZARK_PORTMAP_ERR_PROBE_SERVICE;
    return -1;
  }
  return 0;
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
