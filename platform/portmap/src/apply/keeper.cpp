#include "apply/keeper.h"

#include "base/portmap_log.h"
#include "catalog/router_conf_store.h"
#include "rules/rule_validation.h"

#include <syslog.h>

#include <algorithm>
#include <climits>
#include <vector>

namespace zark::portmap {
namespace {

// Seconds from now until the next renewal and the next verification (0 or
// less: due now).
struct Due {
  int64_t renewIn = INT64_MAX;
  int64_t verifyIn = INT64_MAX;
};

Due WhatIsDue(const RouterRecord *record,
              const std::vector<WantedMapping> &wanted, int64_t interval,
              int64_t now) {
  Due due;
  if (record == nullptr) {
    due.verifyIn = 0;
    return due;
  }
  if (record->lastJob && !record->lastJob->ok &&
      record->lastJob->failure != ZARK_FAILURE_DOUBLE_NAT) {
    due.verifyIn = record->lastJob->ended +
                   std::min<int64_t>(interval, kRetrySeconds) - now;
  }
  for (const WantedMapping &want : wanted) {
    const RecordedMapping *entry =
        record->Find(want.protocol, want.externalPort);
    if (entry == nullptr || entry->internalPort != want.internalPort ||
        entry->apply == MappingApply::kPending ||
        entry->apply == MappingApply::kMissing) {
      // Not applied yet: now, or after the failed job's retry delay.
      due.verifyIn = std::min<int64_t>(due.verifyIn, 0);
      if (record->lastJob && !record->lastJob->ok) {
        due.verifyIn = std::max<int64_t>(
            due.verifyIn, record->lastJob->ended +
                              std::min<int64_t>(interval, kRetrySeconds) - now);
      }
      continue;
    }
    if (entry->apply == MappingApply::kRefused) {
      // Tried again at the interval.
      const int64_t tried = record->lastJob ? record->lastJob->ended : 0;
      due.verifyIn = std::min(due.verifyIn, tried + interval - now);
      continue;
    }
    due.verifyIn = std::min(due.verifyIn, entry->verified + interval - now);
    if (entry->held && entry->leaseSeconds > 0 && entry->expires > 0) {
      due.renewIn = std::min(
          due.renewIn,
          entry->expires - static_cast<int64_t>(entry->leaseSeconds / 2) - now);
    }
  }
  return due;
}

int NextRound(const Due &due, int interval) {
  const int64_t next = std::min(due.renewIn, due.verifyIn);
  return static_cast<int>(std::clamp<int64_t>(next, 1, interval));
}

} // namespace

int KeepRouter(const std::string &gateway,
               std::span<const ZARK_ROUTER_RULE> rules,
               int checkIntervalSeconds, const ApplyEnvironment &environment,
               ZARK_ROUTER_SAVE_RULE_RESULT &result, ApplySummary &summary,
               int &nextSeconds) {
  const int interval = std::max(checkIntervalSeconds, 1);
  nextSeconds = interval;
  result = ZARK_ROUTER_SAVE_RULE_RESULT{};
  std::optional<std::string> canonical = CanonicalGatewayAddress(gateway);
  if (!canonical) {
    ZARK_PM_LOG_ERROR("keeper: \"%s\" is not an IPv4 gateway address",
                      gateway.c_str());
    result.errType = kSaveErrBadParameter;
    return -1;
  }
  std::vector<WantedMapping> wanted;
  if (rules.empty() ||
      PlanWantedMappings(rules, INT_MAX, wanted).errType !=
          ZARK_SAVE_ERR_NONE ||
      wanted.empty()) {
    return 0;
  }
  RouterChoice choice;
  int err = ZARK_PORTMAP_ERR_NONE;
  if (!environment.chooseRouter(*canonical, choice, err)) {
    return 0;
  }
  MappingState state;
  // An unreadable state is logged; everything is then due.
  (void)LoadMappingState(environment.statePath, state);
  const RouterRecord *record = state.Find(*canonical, choice.protocol);
  const std::string addressBefore =
      record != nullptr ? record->externalAddress : std::string();
  const Due due = WhatIsDue(record, wanted, interval, environment.now());
  if (due.renewIn > 0 && due.verifyIn > 0) {
    nextSeconds = NextRound(due, interval);
    return 0;
  }

  ApplyOptions options;
  options.verifyUnchanged = due.verifyIn <= 0;
  options.refreshLeases = true;
  options.renewAtHalfLease = true;
  options.writeRuleConf = false;
  options.reportProgress = false;
  options.jobKind = "renew";
  options.askExternalAddress = options.verifyUnchanged;
  const int rc = ApplyRules(*canonical, rules, options, environment, result,
                            nullptr, nullptr, &summary);
  if (summary.repaired > 0) {
    syslog(LOG_NOTICE,
           "%s:%d keeper: restored %d mapping(s) the router at %s had lost",
           __FILE__, __LINE__, summary.repaired, canonical->c_str());
  }

  MappingState after;
  (void)LoadMappingState(environment.statePath, after);
  const RouterRecord *now = after.Find(*canonical, choice.protocol);
  if (now != nullptr && !addressBefore.empty() &&
      !now->externalAddress.empty() && now->externalAddress != addressBefore) {
    syslog(LOG_NOTICE,
           "%s:%d keeper: the router's outside address changed from %s to %s "
           "(the router or its line restarted); its mappings were verified",
           __FILE__, __LINE__, addressBefore.c_str(),
           now->externalAddress.c_str());
  }
  nextSeconds =
      NextRound(WhatIsDue(now, wanted, interval, environment.now()), interval);
  return rc;
}

} // namespace zark::portmap
