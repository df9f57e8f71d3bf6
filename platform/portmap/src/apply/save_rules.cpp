#include "apply/save_rules.h"

#include "RouterRuleConf.h"
#include "apply/apply_progress.h"
#include "base/failure_kind.h"
#include "base/ipv4_class.h"
#include "base/local_network.h"
#include "base/portmap_log.h"
#include "base/record_text.h"
#include "catalog/router_conf_store.h"
#include "rules/rule_validation.h"

#include <syslog.h>

#include <climits>
#include <cstring>
#include <ctime>
#include <exception>
#include <map>
#include <set>
#include <utility>
#include <vector>

namespace zark::portmap {
namespace {

using Clock = std::chrono::steady_clock;
using Key = std::pair<IpProtocol, uint16_t>;

std::string PortText(IpProtocol protocol, uint16_t port) {
  return std::string(ProtocolText(protocol)) + " " + std::to_string(port);
}

// One piece of router work.
struct Step {
  enum class Kind { kDelete, kAdd, kCheck };
  Kind kind = Kind::kAdd;
  PortMapping mapping;
  std::string ruleId;
  // The state's entry for the port before this job touched it; put back
  // when the step is never attempted.
  std::optional<RecordedMapping> before;
  bool attempted = false;
  bool missing = false; // the router was asked and had lost it
  bool refresh = false; // held, re-added to renew its lease

  [[nodiscard]] Key PortKey() const {
    return {mapping.protocol, mapping.externalPort};
  }
  // The state's entry for the mapping, not known to be held.
  [[nodiscard]] RecordedMapping Unheld() const {
    RecordedMapping entry;
    entry.protocol = mapping.protocol;
    entry.externalPort = mapping.externalPort;
    entry.internalPort = mapping.internalPort;
    entry.internalClient = mapping.internalClient;
    entry.held = false;
    entry.ruleId = ruleId;
    return entry;
  }
};

// Runs one job; see ApplyRules.
class Applier {
public:
  Applier(std::string gateway, const ApplyOptions &options,
          const ApplyEnvironment &environment,
          ZARK_ROUTER_SAVE_RULE_RESULT &result,
          ZARK_SAVE_RULE_PROGRESS_CB callback, void *arg)
      : mGateway(std::move(gateway)), mOptions(options), mEnv(environment),
        mResult(result),
        mProgress(options.reportProgress ? environment.progressPath
                                         : std::string(),
                  callback, arg, &result),
        mStart(Clock::now()) {}

  int Run(std::span<const ZARK_ROUTER_RULE> rules, ApplySummary &summary);

private:
  // Checks the gateway and the rules and picks the router; false (the
  // result set) when the set is refused or no router is configured.
  [[nodiscard]] bool PlanRules(std::span<const ZARK_ROUTER_RULE> rules,
                               std::vector<WantedMapping> &wanted);
  // Writes the rule configuration (unless the options say not to).
  [[nodiscard]] bool StoreRules(std::span<const ZARK_ROUTER_RULE> rules);
  // Reads the mapping state and picks this gateway's record.
  void LoadState();
  // The router work of a job with anything to delete, add or check.
  void ApplyToRouter(int addTotal);

  // Records the first failure of the job (its type and text go to the
  // result) and logs every one.
  void Fail(uint32_t type, const std::string &message,
            ZARK_FAILURE_KIND kind = ZARK_FAILURE_OTHER);
  // Fails the job with what the router answered.
  void FailFromRouter(const RouterResult &answer, const std::string &where);
  // Records a wanted mapping the router refused (never ours there).
  void RecordRefused(const Step &step, ZARK_FAILURE_KIND kind,
                     const std::string &reason);
  // Marks what this job did not get to, and what the router did not answer
  // about, as pending.
  void MarkPending();
  // Asks the router for its outside address; notes a double NAT.
  void LearnExternalAddress(RouterDriver &router);
  void RecordLastJob();
  [[nodiscard]] bool Failed() const {
    return mResult.errType != ZARK_SAVE_ERR_NONE;
  }
  [[nodiscard]] bool OutOfTime() const {
    return Clock::now() - mStart >= mEnv.deadline;
  }
  [[nodiscard]] bool SaveState();
  void Plan(const std::vector<WantedMapping> &wanted);
  void MarkBeforeTouching();
  void RunDeletions(RouterDriver &router);
  void RunStaleDeletions();
  void RunAdditions(RouterDriver &router);
  // What asking the router about a kCheck step found.
  // kLost: the router said it holds no such mapping.
  enum class Checked { kHeld, kMoved, kLost, kAddAgain, kRouterGone };
  Checked CheckStillHeld(RouterDriver &router, const Step &step,
                         const std::string &where);
  Checked HeldByAnother(const Step &step, const std::string &where,
                        const RouterMapping &entry);
  // Adds the step's mapping and records the router's answer; where names
  // the rule and port in messages.
  // unconfirmed: the add is confirmed later by one listing
  // (ConfirmListed).
  void AddMapping(RouterDriver &router, Step &step, const std::string &where,
                  bool unconfirmed = false);
  // Where the router lists port ranges (IGD:2): reads the wanted ports of
  // each protocol, one listing each. False when it cannot (then every
  // mapping is looked up on its own) or the router stopped answering
  // (mAborted).
  bool ListWanted(RouterDriver &router, std::map<Key, RouterMapping> &listed,
                  bool onlyAdded);
  // What the listing says of a step's port: kHeld (ours, as wanted; no
  // request needed), kMoved (another mapping holds it: left alone, reported),
  // kLost (a held one is gone), kAddAgain (to add).
  Checked CheckListed(const Step &step, const std::string &where,
                      const std::map<Key, RouterMapping> &listed);
  // Confirms the adds of mUnconfirmed with one listing per protocol.
  void ConfirmListed(RouterDriver &router);
  void OnAddConflict(RouterDriver &router, const Step &step,
                     const std::string &where, const RouterResult &added);
  void OnAddTableFull(RouterDriver &router, const Step &step,
                      const std::string &where, const RouterResult &added);
  void OnAddRefused(RouterDriver &router, const Step &step,
                    const std::string &where, const RouterResult &added);
  // Writes the state file when the last write is older than the interval,
  // so that a killed job leaves its progress recorded.
  void SaveStateNowAndThen();
  void RecordAdded(const Step &step, const RouterResult &added);
  void PutBackUnattempted();
  [[nodiscard]] RouterRecord &Record() { return mState.routers[mRecordIndex]; }
  [[nodiscard]] bool IsRouterGone(RouterOutcome outcome) const;

  std::string mGateway;
  const ApplyOptions &mOptions;
  const ApplyEnvironment &mEnv;
  ZARK_ROUTER_SAVE_RULE_RESULT &mResult;
  ApplyProgress mProgress;
  Clock::time_point mStart;
  Clock::time_point mLastStateSave;

  RouterProtocol mProtocol = RouterProtocol::kUpnp;
  std::string mClient;
  MappingState mState;
  std::size_t mRecordIndex = 0;
  std::vector<Step> mDeletions;
  std::vector<Step> mAdditions;
  std::set<Key> mWantedKeys;
  std::vector<std::size_t> mStaleRecords; // other protocols, same gateway
  int mStaleTotal = 0;
  int mDeleteDone = 0;
  bool mAborted = false;
  RouterDriver *mRouter = nullptr;
  std::vector<Step *> mUnconfirmed; // added, to be seen in a listing
  ZARK_FAILURE_KIND mFailureKind = ZARK_FAILURE_NONE;
  std::string mFailureReason;
  ApplySummary *mSummary = nullptr;
};

// The failure kind in words, for the log and the result's detail text.
std::string FailureWords(ZARK_FAILURE_KIND kind, int deadlineSeconds) {
  switch (kind) {
  case ZARK_FAILURE_ROUTER_NOT_ANSWERING:
    return "the router did not answer within " +
           std::to_string(deadlineSeconds) + " s";
  case ZARK_FAILURE_CONFLICT:
    return "conflict with another mapping";
  case ZARK_FAILURE_PORT_REFUSED:
    return "port refused by the router's policy";
  case ZARK_FAILURE_TABLE_FULL:
    return "the router's mapping table is full";
  case ZARK_FAILURE_DOUBLE_NAT:
    return "carrier-grade or double NAT";
  case ZARK_FAILURE_LEASE_REFUSED:
    return "the router refused the lease";
  case ZARK_FAILURE_NOT_CONFIGURED:
    return "no router configured (router database or configuration missing)";
  case ZARK_FAILURE_LOCAL:
    return "a file or resource of this server failed";
  case ZARK_FAILURE_OTHER:
  case ZARK_FAILURE_NONE:
    break;
  }
  return "";
}

void Applier::Fail(uint32_t type, const std::string &message,
                   ZARK_FAILURE_KIND kind) {
  const int deadline =
      mRouter != nullptr ? mRouter->AnswerDeadlineSeconds() : 0;
  const std::string words = FailureWords(kind, deadline);
  const std::string text = words.empty() ? message : words + ": " + message;
  ZARK_PM_LOG_ERROR("applying rules to the router at %s: %s", mGateway.c_str(),
                    text.c_str());
  if (Failed()) {
    return;
  }
  mFailureKind = kind;
  mFailureReason = text;
  mResult.errType = type;
  std::memset(&mResult.detail, 0, sizeof(mResult.detail));
  CopyText(mResult.detail.text, text);
}

void Applier::FailFromRouter(const RouterResult &answer,
                             const std::string &where) {
  ZARK_FAILURE_KIND kind =
      mRouter != nullptr ? mRouter->FailureKind(answer) : ZARK_FAILURE_OTHER;
  Fail(kSaveErrRouter,
       where.empty() ? answer.message : where + ": " + answer.message,
       kind == ZARK_FAILURE_NONE ? ZARK_FAILURE_OTHER : kind);
}

void Applier::RecordRefused(const Step &step, ZARK_FAILURE_KIND kind,
                            const std::string &reason) {
  RecordedMapping entry = step.Unheld();
  entry.apply = MappingApply::kRefused;
  entry.failure = kind;
  const int deadline =
      mRouter != nullptr ? mRouter->AnswerDeadlineSeconds() : 0;
  const std::string words = FailureWords(kind, deadline);
  entry.reason = words.empty() ? reason : words + ": " + reason;
  Record().Put(entry);
}

bool Applier::IsRouterGone(RouterOutcome outcome) const {
  return outcome == RouterOutcome::kNoAnswer ||
         outcome == RouterOutcome::kNoRouter ||
         outcome == RouterOutcome::kFailed;
}

bool Applier::SaveState() {
  mLastStateSave = Clock::now();
  if (!SaveMappingState(mEnv.statePath, mState)) {
    Fail(kSaveErrIo,
         "cannot record the router's mappings in " + mEnv.statePath);
    return false;
  }
  return true;
}

void Applier::Plan(const std::vector<WantedMapping> &wanted) {
  RouterRecord &record = Record();
  std::map<Key, const WantedMapping *> byKey;
  for (const WantedMapping &want : wanted) {
    byKey.emplace(Key{want.protocol, want.externalPort}, &want);
    mWantedKeys.insert({want.protocol, want.externalPort});
  }
  std::vector<Key> refusedUnwanted;
  for (const RecordedMapping &recorded : record.mappings) {
    auto found = byKey.find({recorded.protocol, recorded.externalPort});
    if (recorded.apply == MappingApply::kRefused) {
      // The router never held it for us: nothing to delete there.
      if (found == byKey.end()) {
        refusedUnwanted.push_back({recorded.protocol, recorded.externalPort});
      }
      continue;
    }
    bool keep = found != byKey.end() &&
                found->second->internalPort == recorded.internalPort &&
                recorded.internalClient == mClient;
    if (keep) {
      continue;
    }
    Step step;
    step.kind = Step::Kind::kDelete;
    step.mapping = {recorded.protocol, recorded.externalPort,
                    recorded.internalPort, recorded.internalClient,
                    MappingDescription(recorded.ruleId)};
    step.ruleId = recorded.ruleId;
    step.before = recorded;
    mDeletions.push_back(std::move(step));
  }
  for (const Key &key : refusedUnwanted) {
    record.Remove(key.first, key.second);
  }
  const int64_t now = mEnv.now();
  for (const WantedMapping &want : wanted) {
    const RecordedMapping *recorded =
        record.Find(want.protocol, want.externalPort);
    Step step;
    step.mapping = {want.protocol, want.externalPort, want.internalPort,
                    mClient, MappingDescription(want.ruleId)};
    step.ruleId = want.ruleId;
    if (recorded != nullptr) {
      step.before = *recorded;
    }
    bool same = recorded != nullptr && recorded->held &&
                recorded->internalPort == want.internalPort &&
                recorded->internalClient == mClient;
    if (!same) {
      step.kind = Step::Kind::kAdd;
    } else if (mOptions.refreshLeases && recorded->expires != 0 &&
               recorded->expires - now <
                   (mOptions.renewAtHalfLease
                        ? static_cast<int64_t>(recorded->leaseSeconds / 2) + 1
                        : mEnv.renewAhead.count())) {
      step.kind = Step::Kind::kAdd;
      step.refresh = true;
    } else if (mOptions.verifyUnchanged) {
      step.kind = Step::Kind::kCheck;
    } else {
      ++mSummary->unchanged;
      continue;
    }
    mAdditions.push_back(std::move(step));
  }
  for (std::size_t i = 0; i < mState.routers.size(); ++i) {
    const RouterRecord &other = mState.routers[i];
    if (i != mRecordIndex && other.gateway == mGateway &&
        !other.mappings.empty()) {
      mStaleRecords.push_back(i);
      mStaleTotal += static_cast<int>(other.mappings.size());
    }
  }
}

void Applier::MarkBeforeTouching() {
  RouterRecord &record = Record();
  for (const Step &step : mDeletions) {
    if (RecordedMapping *entry =
            record.Find(step.mapping.protocol, step.mapping.externalPort)) {
      entry->held = false;
    }
  }
  for (const Step &step : mAdditions) {
    if (step.kind == Step::Kind::kCheck) {
      continue;
    }
    RecordedMapping entry = step.Unheld();
    if (step.before && step.before->held &&
        step.before->internalPort == entry.internalPort &&
        step.before->internalClient == entry.internalClient) {
      // A lease being refreshed: the mapping is there until it runs out.
      entry = *step.before;
    }
    record.Put(entry);
  }
}

void Applier::RunDeletions(RouterDriver &router) {
  const int total = static_cast<int>(mDeletions.size()) + mStaleTotal;
  for (Step &step : mDeletions) {
    if (mAborted) {
      break;
    }
    if (OutOfTime()) {
      Fail(kSaveErrRouter, "the job ran out of time after " +
                               std::to_string(mEnv.deadline.count()) + " s");
      mAborted = true;
      break;
    }
    step.attempted = true;
    ++mSummary->operations;
    RouterResult deleted = router.DeletePortMapping(step.mapping);
    const Key key = step.PortKey();
    const bool alsoAdded = mWantedKeys.count(key) != 0;
    // The add step of the same port, if any, puts back what the router
    // holds there now should it never run.
    Step *add = nullptr;
    for (Step &candidate : mAdditions) {
      if (candidate.PortKey() == key) {
        add = &candidate;
      }
    }
    if (deleted.Ok() || deleted.outcome == RouterOutcome::kNotFound) {
      ++mSummary->deleted;
      if (!alsoAdded) {
        Record().Remove(key.first, key.second);
      }
      if (add != nullptr) {
        add->before.reset();
      }
    } else if (IsRouterGone(deleted.outcome)) {
      // Left "not known to be held": the next job deletes it again.
      FailFromRouter(deleted, "");
      mAborted = true;
      if (add != nullptr && add->before) {
        add->before->held = false;
      }
      break;
    } else {
      // The router kept it.
      ++mSummary->failed;
      RecordedMapping kept = *step.before;
      kept.held = true;
      if (!alsoAdded) {
        Record().Put(kept);
      }
      if (add != nullptr) {
        add->before = kept;
      }
      FailFromRouter(deleted, "deleting " + PortText(key.first, key.second));
    }
    ++mDeleteDone;
    mProgress.Report("del", mDeleteDone, total);
  }
}

void Applier::RunStaleDeletions() {
  const int total = static_cast<int>(mDeletions.size()) + mStaleTotal;
  for (std::size_t index : mStaleRecords) {
    if (mAborted) {
      return;
    }
    RouterRecord &stale = mState.routers[index];
    // Mappings made with the protocol this gateway used before: deleted
    // through that protocol, as far as it still answers. Failing here does
    // not fail the job; what is left stays recorded for the next one.
    std::unique_ptr<RouterDriver> old =
        mEnv.makeRouter(stale.protocol, mGateway, &stale);
    std::vector<RecordedMapping> mappings = stale.mappings;
    bool gone = old == nullptr;
    for (const RecordedMapping &mapping : mappings) {
      if (!gone && !OutOfTime()) {
        ++mSummary->operations;
        RouterResult deleted = old->DeletePortMapping(
            {mapping.protocol, mapping.externalPort, mapping.internalPort,
             mapping.internalClient, MappingDescription(mapping.ruleId)});
        if (deleted.Ok() || deleted.outcome == RouterOutcome::kNotFound) {
          ++mSummary->deleted;
          stale.Remove(mapping.protocol, mapping.externalPort);
        } else {
          ZARK_PM_LOG_ERROR(
              "cannot delete %s made by %s before: %s",
              PortText(mapping.protocol, mapping.externalPort).c_str(),
              std::string(RouterProtocolName(stale.protocol)).c_str(),
              deleted.message.c_str());
          gone = IsRouterGone(deleted.outcome);
        }
      }
      ++mDeleteDone;
      mProgress.Report("del", mDeleteDone, total);
    }
  }
}

void Applier::RecordAdded(const Step &step, const RouterResult &added) {
  RecordedMapping entry = step.Unheld();
  entry.leaseSeconds = added.leaseSeconds;
  entry.expires = added.leaseSeconds == 0
                      ? 0
                      : mEnv.now() + static_cast<int64_t>(added.leaseSeconds);
  entry.held = true;
  entry.ruleId = step.ruleId;
  entry.apply = MappingApply::kOnRouter;
  entry.verified = mEnv.now();
  Record().Put(entry);
}

Applier::Checked Applier::HeldByAnother(const Step &step,
                                        const std::string &where,
                                        const RouterMapping &entry) {
  // Another mapping holds the port: never taken over, reported with it.
  ++mSummary->failed;
  const std::string reason =
      where + " is held on the router by " + entry.internalClient + ":" +
      std::to_string(entry.internalPort) + " (\"" + entry.description + "\")";
  RecordRefused(step, ZARK_FAILURE_CONFLICT, reason);
  Fail(kSaveErrRouter, reason, ZARK_FAILURE_CONFLICT);
  return Checked::kMoved;
}

Applier::Checked Applier::CheckStillHeld(RouterDriver &router, const Step &step,
                                         const std::string &where) {
  const Key key = step.PortKey();
  ++mSummary->operations;
  RouterMapping entry;
  RouterResult checked =
      router.GetSpecificPortMapping(key.first, key.second, entry);
  if (checked.Ok()) {
    ++mSummary->checked;
    if (entry.internalClient == step.mapping.internalClient &&
        entry.internalPort == step.mapping.internalPort) {
      RouterResult held;
      held.outcome = RouterOutcome::kOk;
      held.leaseSeconds = entry.leaseSeconds;
      RecordAdded(step, held);
      return Checked::kHeld;
    }
    return HeldByAnother(step, where, entry);
  }
  if (IsRouterGone(checked.outcome)) {
    FailFromRouter(checked, where);
    mAborted = true;
    return Checked::kRouterGone;
  }
  // Not found, not understood, or not askable (NAT-PMP): add it again;
  // until the router answers, it is not known to be there.
  if (RecordedMapping *recorded = Record().Find(key.first, key.second)) {
    recorded->held = false;
    if (checked.outcome == RouterOutcome::kNotFound) {
      recorded->apply = MappingApply::kMissing;
      recorded->reason = "the router lost it";
    }
  }
  return checked.outcome == RouterOutcome::kNotFound ? Checked::kLost
                                                     : Checked::kAddAgain;
}

void Applier::AddMapping(RouterDriver &router, Step &step,
                         const std::string &where, bool unconfirmed) {
  ++mSummary->operations;
  RouterResult added = unconfirmed
                           ? router.AddPortMappingUnconfirmed(step.mapping)
                           : router.AddPortMapping(step.mapping);
  switch (added.outcome) {
  case RouterOutcome::kOk:
    if (unconfirmed) {
      mUnconfirmed.push_back(&step);
      break;
    }
    ++mSummary->added;
    if (step.missing) {
      ++mSummary->repaired;
      syslog(LOG_INFO, "%s:%d %s: restored on the router at %s", __FILE__,
             __LINE__, where.c_str(), mGateway.c_str());
    }
    RecordAdded(step, added);
    break;
  case RouterOutcome::kConflict:
    OnAddConflict(router, step, where, added);
    break;
  case RouterOutcome::kNotHeld:
    OnAddTableFull(router, step, where, added);
    break;
  case RouterOutcome::kRefused:
  case RouterOutcome::kNotFound:
  case RouterOutcome::kUnsupported:
    OnAddRefused(router, step, where, added);
    break;
  case RouterOutcome::kBadReply:
    // It may or may not be there: stays "not known to be held".
    ++mSummary->failed;
    FailFromRouter(added, where);
    break;
  case RouterOutcome::kNoAnswer:
  case RouterOutcome::kNoRouter:
  case RouterOutcome::kFailed:
    FailFromRouter(added, where);
    mAborted = true;
    break;
  }
}

void Applier::OnAddConflict(RouterDriver &router, const Step &step,
                            const std::string &where,
                            const RouterResult &added) {
  const Key key = step.PortKey();
  ++mSummary->failed;
  // Name the mapping that holds the port, where the router can be asked.
  std::string holder;
  RouterMapping other;
  if (added.grantedExternalPort == 0) {
    ++mSummary->operations;
    if (router.GetSpecificPortMapping(key.first, key.second, other).Ok()) {
      holder = " by " + other.internalClient + ":" +
               std::to_string(other.internalPort) + " (\"" + other.description +
               "\")";
    }
  }
  const std::string reason =
      where + " is taken on the router" + holder + ": " + added.message;
  RecordRefused(step, ZARK_FAILURE_CONFLICT, reason);
  Fail(kSaveErrRouter, reason, ZARK_FAILURE_CONFLICT);
  // NAT-PMP granted another port: give it back unless it is one of ours.
  uint16_t granted = added.grantedExternalPort;
  if (granted == 0 || mWantedKeys.count({key.first, granted}) != 0 ||
      Record().Find(key.first, granted) != nullptr) {
    return;
  }
  PortMapping extra = step.mapping;
  extra.externalPort = granted;
  ++mSummary->operations;
  RouterResult returned = router.DeletePortMapping(extra);
  if (!returned.Ok()) {
    ZARK_PM_LOG_ERROR("cannot give back %s: %s",
                      PortText(key.first, granted).c_str(),
                      returned.message.c_str());
  }
}

void Applier::OnAddTableFull(RouterDriver &router, const Step &step,
                             const std::string &where,
                             const RouterResult &added) {
  // The router's table is full: further adds would be dropped too.
  OnAddRefused(router, step, where, added);
  mAborted = true;
}

void Applier::OnAddRefused(RouterDriver &router, const Step &step,
                           const std::string &where,
                           const RouterResult &added) {
  ++mSummary->failed;
  ZARK_FAILURE_KIND kind = router.FailureKind(added);
  if (kind == ZARK_FAILURE_NONE) {
    kind = ZARK_FAILURE_OTHER;
  }
  RecordRefused(step, kind, where + ": " + added.message);
  Fail(kSaveErrRouter, where + ": " + added.message, kind);
}

void Applier::SaveStateNowAndThen() {
  if (!mAborted && Clock::now() - mLastStateSave >= mEnv.stateSaveInterval) {
    // A failed write is logged; the final write decides the result.
    (void)SaveMappingState(mEnv.statePath, mState);
    mLastStateSave = Clock::now();
  }
}

bool Applier::ListWanted(RouterDriver &router,
                         std::map<Key, RouterMapping> &listed, bool onlyAdded) {
  listed.clear();
  std::map<IpProtocol, std::pair<uint16_t, uint16_t>> ranges;
  auto widen = [&ranges](const Step &step) {
    auto [it, added] =
        ranges.try_emplace(step.mapping.protocol, step.mapping.externalPort,
                           step.mapping.externalPort);
    if (!added) {
      it->second.first = std::min(it->second.first, step.mapping.externalPort);
      it->second.second =
          std::max(it->second.second, step.mapping.externalPort);
    }
  };
  if (onlyAdded) {
    for (const Step *step : mUnconfirmed) {
      widen(*step);
    }
  } else {
    for (const Step &step : mAdditions) {
      widen(step);
    }
  }
  for (const auto &[protocol, range] : ranges) {
    std::vector<RouterMapping> entries;
    ++mSummary->operations;
    RouterResult read =
        router.ListPortRange(protocol, range.first, range.second, entries);
    if (read.outcome == RouterOutcome::kUnsupported) {
      return false;
    }
    if (!read.Ok()) {
      if (IsRouterGone(read.outcome)) {
        FailFromRouter(read, "listing the router's mappings");
        mAborted = true;
      }
      return false;
    }
    for (RouterMapping &entry : entries) {
      const Key key{entry.protocol, entry.externalPort};
      listed.emplace(key, std::move(entry));
    }
  }
  return true;
}

Applier::Checked
Applier::CheckListed(const Step &step, const std::string &where,
                     const std::map<Key, RouterMapping> &listed) {
  auto found = listed.find(step.PortKey());
  if (found == listed.end()) {
    return step.kind == Step::Kind::kCheck ? Checked::kLost
                                           : Checked::kAddAgain;
  }
  const RouterMapping &entry = found->second;
  const bool sameTarget = entry.internalClient == step.mapping.internalClient &&
                          entry.internalPort == step.mapping.internalPort;
  // Ours: made for this server under our description. A mapping of this
  // server under another description is another program's: the router
  // would let our add replace it.
  const bool ours = entry.internalClient == step.mapping.internalClient &&
                    entry.description.starts_with(MappingDescription(""));
  if (!ours) {
    return HeldByAnother(step, where, entry);
  }
  if (sameTarget && !step.refresh) {
    if (step.kind == Step::Kind::kCheck) {
      ++mSummary->checked;
    }
    RouterResult held;
    held.outcome = RouterOutcome::kOk;
    held.leaseSeconds = entry.leaseSeconds;
    RecordAdded(step, held);
    return Checked::kHeld;
  }
  return Checked::kAddAgain;
}

void Applier::ConfirmListed(RouterDriver &router) {
  std::map<Key, RouterMapping> listed;
  if (mUnconfirmed.empty() || !ListWanted(router, listed, true)) {
    // Unconfirmed adds stay "not known to be held" (pending).
    return;
  }
  for (Step *step : mUnconfirmed) {
    const std::string where =
        "rule \"" + step->ruleId + "\", router port " +
        PortText(step->mapping.protocol, step->mapping.externalPort);
    auto found = listed.find(step->PortKey());
    if (found == listed.end() ||
        found->second.internalClient != step->mapping.internalClient ||
        found->second.internalPort != step->mapping.internalPort) {
      // Answered success and kept nothing, or evicted by a later add.
      ++mSummary->failed;
      const std::string reason =
          where + ": the router answered success but does not hold it";
      RecordRefused(*step, ZARK_FAILURE_TABLE_FULL, reason);
      Fail(kSaveErrRouter, reason, ZARK_FAILURE_TABLE_FULL);
      continue;
    }
    ++mSummary->added;
    if (step->missing) {
      ++mSummary->repaired;
      syslog(LOG_INFO, "%s:%d %s: restored on the router at %s", __FILE__,
             __LINE__, where.c_str(), mGateway.c_str());
    }
    RouterResult held;
    held.outcome = RouterOutcome::kOk;
    held.leaseSeconds = found->second.leaseSeconds;
    RecordAdded(*step, held);
  }
  mUnconfirmed.clear();
}

void Applier::RunAdditions(RouterDriver &router) {
  const int total = static_cast<int>(mAdditions.size());
  int done = 0;
  std::map<Key, RouterMapping> listed;
  const bool listing = !mAdditions.empty() && ListWanted(router, listed, false);
  if (mAborted) {
    return;
  }
  for (Step &step : mAdditions) {
    if (mAborted) {
      break;
    }
    if (OutOfTime()) {
      Fail(kSaveErrRouter, "the job ran out of time after " +
                               std::to_string(mEnv.deadline.count()) + " s");
      mAborted = true;
      break;
    }
    step.attempted = true;
    const std::string where =
        "rule \"" + step.ruleId + "\", router port " +
        PortText(step.mapping.protocol, step.mapping.externalPort);
    Checked checked = Checked::kAddAgain;
    if (listing) {
      checked = CheckListed(step, where, listed);
      step.missing = checked == Checked::kLost;
    } else if (step.kind == Step::Kind::kCheck) {
      checked = CheckStillHeld(router, step, where);
      if (checked == Checked::kRouterGone) {
        step.attempted = false;
        break;
      }
      step.missing = checked == Checked::kLost;
    }
    if (checked == Checked::kAddAgain || checked == Checked::kLost) {
      AddMapping(router, step, where, listing);
    }
    ++done;
    mProgress.Report("add", done, total);
    SaveStateNowAndThen();
  }
  if (listing && !mAborted) {
    ConfirmListed(router);
  }
}

void Applier::PutBackUnattempted() {
  RouterRecord &record = Record();
  for (const Step &step : mDeletions) {
    if (step.attempted) {
      continue;
    }
    if (step.before) {
      record.Put(*step.before);
    }
  }
  MarkPending();
}

void Applier::MarkPending() {
  RouterRecord &record = Record();
  const std::string reason =
      mFailureReason.empty() ? "not applied yet" : mFailureReason;
  for (const Step &step : mAdditions) {
    if (step.attempted) {
      continue;
    }
    RecordedMapping entry;
    if (step.kind == Step::Kind::kCheck && step.before) {
      // Believed held, but the router was not asked this time.
      entry = *step.before;
    } else {
      entry = step.Unheld();
      if (step.before && step.before->held &&
          step.before->internalPort == entry.internalPort &&
          step.before->internalClient == entry.internalClient) {
        entry = *step.before; // a lease refresh that did not happen
      }
    }
    entry.apply = MappingApply::kPending;
    entry.failure = mFailureKind;
    entry.reason = reason;
    record.Put(entry);
  }
  // An add the router did not answer about: may or may not be there.
  for (RecordedMapping &entry : record.mappings) {
    if (!entry.held && entry.apply == MappingApply::kOnRouter) {
      entry.apply = MappingApply::kPending;
      entry.failure = mFailureKind;
      entry.reason = reason;
    }
  }
}

void Applier::LearnExternalAddress(RouterDriver &router) {
  std::string address;
  ++mSummary->operations;
  RouterResult asked = router.GetExternalAddress(address);
  if (!asked.Ok()) {
    return;
  }
  Record().externalAddress = address;
  std::optional<uint32_t> parsed = ParseIpv4(address);
  if (!parsed || !IsBehindNat(*parsed)) {
    return;
  }
  const std::string words =
      "the router's outside address " + address + " is " +
      Ipv4ClassName(ClassifyIpv4(*parsed)) +
      ": the ports are not reachable from the internet (carrier-grade or "
      "double NAT)";
  ZARK_PM_LOG_ERROR("%s", words.c_str());
  if (!Failed()) {
    // The router took every mapping, yet they do not reach the internet.
    mFailureKind = ZARK_FAILURE_DOUBLE_NAT;
    mFailureReason = words;
  } else {
    mFailureReason += "; " + words;
    std::string detail = mResult.detail.text;
    CopyText(mResult.detail.text, detail + "; " + words);
  }
}

void Applier::RecordLastJob() {
  LastJob job;
  job.kind = mOptions.jobKind;
  job.ended = mEnv.now();
  job.ok = !Failed();
  job.repaired = mSummary->repaired;
  job.added = mSummary->added;
  job.deleted = mSummary->deleted;
  job.failure = mFailureKind;
  job.reason = mFailureReason;
  Record().lastJob = job;
}

bool Applier::PlanRules(std::span<const ZARK_ROUTER_RULE> rules,
                        std::vector<WantedMapping> &wanted) {
  std::optional<std::string> canonical = CanonicalGatewayAddress(mGateway);
  if (!canonical) {
    Fail(kSaveErrBadParameter,
         "\"" + mGateway + "\" is not an IPv4 gateway address");
    return false;
  }
  mGateway = *canonical;

  // The rule texts first: nothing else is looked at for a refused set.
  RuleRefusal refusal = PlanWantedMappings(rules, INT_MAX, wanted);
  RouterChoice choice;
  if (refusal.errType == ZARK_SAVE_ERR_NONE) {
    int err = ZARK_PORTMAP_ERR_NONE;
    if (!mEnv.chooseRouter(mGateway, choice, err)) {
      if (err == ZARK_PORTMAP_ERR_NOT_CONFIGURED) {
        Fail(ZARK_SAVE_ERR_NOT_CONFIGURED,
             "no router that the library can drive is configured for " +
                 mGateway);
      } else {
        Fail(err == ZARK_PORTMAP_ERR_IO ? kSaveErrIo : kSaveErrGeneric,
             "cannot read the router configuration of " + mGateway);
      }
      return false;
    }
    refusal = PlanWantedMappings(rules, choice.maxRouterEntries, wanted);
  }
  if (refusal.errType != ZARK_SAVE_ERR_NONE) {
    ZARK_PM_LOG_ERROR("rules refused: %s", refusal.reason.c_str());
    mResult.errType = refusal.errType;
    if (refusal.errType == ZARK_SAVE_ERR_BAD_PORT_TEXT ||
        refusal.errType == ZARK_SAVE_ERR_BAD_PROTOCOL) {
      CopyText(mResult.detail.text, refusal.text);
    } else {
      mResult.detail.limit.maxPort = refusal.maxPort;
      mResult.detail.limit.maxRange = refusal.maxRange;
    }
    return false;
  }
  mProtocol = choice.protocol;
  return true;
}

bool Applier::StoreRules(std::span<const ZARK_ROUTER_RULE> rules) {
  // The rule configuration, written before the router is touched: a rule
  // set that passed the checks is never lost to a router that fails.
  RouterRuleConfWriter writer;
  for (const ZARK_ROUTER_RULE &rule : rules) {
    if (!writer.AddRule(std::string(Field(rule.rule_id)), rule.enable != 0,
                        std::string(Field(rule.router_port)),
                        std::string(Field(rule.ds_port)),
                        std::string(Field(rule.router_protocol)),
                        std::string(Field(rule.serviceid)),
                        std::string(Field(rule.service_name)))) {
      Fail(kSaveErrBadParameter, "a rule text does not fit the rule store");
      return false;
    }
  }
  if (mOptions.writeRuleConf && !writer.Sync(mEnv.ruleConfPath)) {
    Fail(kSaveErrIo, mEnv.ruleConfPath + " cannot be written",
         ZARK_FAILURE_LOCAL);
    return false;
  }
  return true;
}

void Applier::LoadState() {
  if (!LoadMappingState(mEnv.statePath, mState)) {
    ZARK_PM_LOG_ERROR("the mappings made before are unknown; starting from "
                      "none");
  }
  mState.FindOrAdd(mGateway, mProtocol);
  for (std::size_t i = 0; i < mState.routers.size(); ++i) {
    if (mState.routers[i].gateway == mGateway &&
        mState.routers[i].protocol == mProtocol) {
      mRecordIndex = i;
    }
  }
}

void Applier::ApplyToRouter(int addTotal) {
  MarkBeforeTouching();
  if (!SaveState()) {
    return;
  }
  std::unique_ptr<RouterDriver> router =
      mEnv.makeRouter(mProtocol, mGateway, &Record());
  mRouter = router.get();
  if (router == nullptr) {
    Fail(kSaveErrGeneric, "no driver for protocol " +
                              std::string(RouterProtocolName(mProtocol)));
    PutBackUnattempted();
    (void)SaveMappingState(mEnv.statePath, mState);
    return;
  }
  RunDeletions(*router);
  RunStaleDeletions();
  if (!mDeletions.empty() || mStaleTotal > 0) {
    (void)SaveMappingState(mEnv.statePath, mState);
    mLastStateSave = Clock::now();
  }
  mProgress.Report("add", 0, addTotal);
  RunAdditions(*router);
  if (!mAborted && (mOptions.askExternalAddress || mSummary->failed > 0)) {
    LearnExternalAddress(*router);
  }
  PutBackUnattempted();
  std::string location = router->Location();
  if (!location.empty()) {
    Record().location = location;
    Record().finiteLeases = router->FiniteLeases();
    Record().controlUrl = router->ControlUrl();
    Record().serviceType = router->ServiceType();
  }
  RecordLastJob();
  mRouter = nullptr;
  mState.DropEmpty();
  if (!SaveMappingState(mEnv.statePath, mState)) {
    Fail(kSaveErrIo,
         "cannot record the router's mappings in " + mEnv.statePath);
  }
}

int Applier::Run(std::span<const ZARK_ROUTER_RULE> rules,
                 ApplySummary &summary) {
  mSummary = &summary;
  mResult = ZARK_ROUTER_SAVE_RULE_RESULT{};

  std::vector<WantedMapping> wanted;
  if (!PlanRules(rules, wanted) || !StoreRules(rules)) {
    return -1;
  }

  std::optional<std::string> client = mEnv.localAddress(mGateway);
  if (!client) {
    Fail(kSaveErrRouter, "no route to the gateway " + mGateway,
         ZARK_FAILURE_LOCAL);
    return -1;
  }
  mClient = *client;

  RunningTaskMark mark(ZARK_PORTMAP_TASK_APPLY_RULES, mEnv.runningTaskPath);
  LoadState();
  Plan(wanted);

  const int deleteTotal = static_cast<int>(mDeletions.size()) + mStaleTotal;
  const int addTotal = static_cast<int>(mAdditions.size());
  mProgress.Report("del", 0, deleteTotal);
  syslog(LOG_INFO,
         "%s:%d applying rules to the %s router at %s: %d to delete, %d to "
         "add or check, %d unchanged",
         __FILE__, __LINE__, std::string(RouterProtocolName(mProtocol)).c_str(),
         mGateway.c_str(), deleteTotal, addTotal, summary.unchanged);

  if (deleteTotal + addTotal > 0) {
    ApplyToRouter(addTotal);
  } else {
    mProgress.Report("add", 0, 0);
  }

  if (Failed()) {
    return -1;
  }
  mProgress.Finish();
  return 0;
}

} // namespace

std::string MappingDescription(std::string_view ruleId) {
  std::string description = "zarkportforward ";
  std::size_t length = std::min<std::size_t>(ruleId.size(), 40);
  for (std::size_t i = 0; i < length; ++i) {
    char c = ruleId[i];
    bool plain = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') ||
                 (c >= '0' && c <= '9') || c == '.' || c == '-' || c == '_';
    description += plain ? c : '_';
  }
  return description;
}

ApplyEnvironment DefaultApplyEnvironment() {
  ApplyEnvironment environment;
  environment.chooseRouter = ChooseRouter;
  environment.makeRouter = MakeRouter;
  environment.localAddress = [](const std::string &gateway) {
    return LocalAddressTowards(gateway);
  };
  environment.now = [] { return static_cast<int64_t>(std::time(nullptr)); };
  return environment;
}

int ApplyRules(const std::string &gateway,
               std::span<const ZARK_ROUTER_RULE> rules,
               const ApplyOptions &options, const ApplyEnvironment &environment,
               ZARK_ROUTER_SAVE_RULE_RESULT &result,
               ZARK_SAVE_RULE_PROGRESS_CB callback, void *arg,
               ApplySummary *summary) {
  // Where the summary goes when the caller does not want it.
  // cppcheck-suppress unassignedVariable
  ApplySummary local;
  Applier applier(gateway, options, environment, result, callback, arg);
  return applier.Run(rules, summary != nullptr ? *summary : local);
}

} // namespace zark::portmap

extern "C" int KLibSaveRules(const char *gatewayIP, int count,
                             ZARK_ROUTER_RULE *rules, bool flag,
                             ZARK_ROUTER_SAVE_RULE_RESULT *result,
                             ZARK_SAVE_RULE_PROGRESS_CB callback, void *arg) {
  using namespace zark::portmap;
  ZARK_ROUTER_SAVE_RULE_RESULT local{};
  ZARK_ROUTER_SAVE_RULE_RESULT &out = result != nullptr ? *result : local;
  if (gatewayIP == nullptr || count < 0 || (count > 0 && rules == nullptr)) {
    ZARK_PM_LOG_ERROR("KLibSaveRules: bad arguments (gateway %s, count %d, "
                      "rules %s)",
                      gatewayIP != nullptr ? "given" : "NULL", count,
                      rules != nullptr ? "given" : "NULL");
    out = ZARK_ROUTER_SAVE_RULE_RESULT{};
    out.errType = kSaveErrBadParameter;
    return -1;
  }
  try {
    ApplyOptions options;
    // Every save asks the router about the mappings the library believes
    // unchanged and adds again what it lost, whatever flag says: the router,
    // not the library's memory, decides what is there.
    (void)flag;
    options.verifyUnchanged = true;
    ApplyEnvironment environment = DefaultApplyEnvironment();
    return ApplyRules(gatewayIP,
                      std::span<const ZARK_ROUTER_RULE>(
                          rules, static_cast<std::size_t>(count)),
                      options, environment, out, callback, arg);
  } catch (const std::exception &e) {
    // Nothing may cross the C boundary.
    ZARK_PM_LOG_ERROR("KLibSaveRules: %s", e.what());
    out.errType = kSaveErrGeneric;
    return -1;
  }
}
