// The status and keeper entry points of zarkportforward.h: the library's
// record of the saved rules, repair, the keeper's round, deleting one of
// our mappings.
#include "zarkportforward.h"

#include "api/saved_rules_access.h"
#include "apply/keeper.h"
#include "apply/save_rules.h"
#include "base/failure_kind.h"
#include "base/portmap_log.h"
#include "catalog/mapping_state.h"
#include "catalog/router_conf_store.h"
#include "drivers/driver_choice.h"
#include "rules/rule_validation.h"

#include <json/json.h>

#include <algorithm>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <memory>
#include <span>
#include <string>
#include <vector>

namespace {

void SetErr(ZARK_LIBZARKPORTMAP_ERR *err, int32_t code) {
  if (err != nullptr) {
    err->err = code;
  }
}

} // namespace

extern "C" const char *KLibFailureKindName(ZARK_FAILURE_KIND kind) {
  return zark::portmap::FailureKindWord(kind);
}

extern "C" void KLibFreeText(char *text) {
  std::free(text);
}

namespace zark::portmap {
namespace {

Json::Value FailureJson(ZARK_FAILURE_KIND kind, const std::string &reason) {
  Json::Value failure(Json::objectValue);
  failure["code"] = FailureKindWord(kind);
  failure["kind"] = static_cast<int>(kind);
  failure["reason"] = reason;
  return failure;
}

Json::Value LastJobJson(const LastJob &job) {
  Json::Value last(Json::objectValue);
  last["kind"] = job.kind;
  last["ended"] = Json::Value::Int64(job.ended);
  last["ok"] = job.ok;
  last["repaired"] = job.repaired;
  last["added"] = job.added;
  last["deleted"] = job.deleted;
  // Code "" and kind 0 when the job met no failure.
  last["failure"] = FailureJson(job.failure, job.reason);
  return last;
}

// One wanted mapping of the saved rules, as the record knows it.
Json::Value RuleJson(const WantedMapping &want, const RecordedMapping *entry) {
  Json::Value rule(Json::objectValue);
  rule["rule_id"] = want.ruleId;
  rule["protocol"] = ProtocolText(want.protocol);
  rule["external_port"] = want.externalPort;
  rule["internal_port"] = want.internalPort;
  // A record of another local port is the rule before it changed.
  const bool known =
      entry != nullptr && entry->internalPort == want.internalPort;
  rule["state"] =
      MappingApplyWord(known ? entry->apply : MappingApply::kPending);
  rule["code"] = known ? FailureKindWord(entry->failure) : "";
  rule["reason"] = known ? entry->reason : std::string("not applied yet");
  rule["verified"] = Json::Value::Int64(known ? entry->verified : 0);
  return rule;
}

int StatusJson(const char *gatewayIP, std::string &text,
               ZARK_LIBZARKPORTMAP_ERR *err) {
  std::optional<std::string> gateway = CanonicalGatewayAddress(gatewayIP);
  if (!gateway) {
    ZARK_PM_LOG_ERROR("KLibGetPortMapStatus: \"%s\" is not an IPv4 address",
                      gatewayIP);
    SetErr(err, ZARK_PORTMAP_ERR_BAD_PARAMETER);
    return -1;
  }
  int count = 0;
  ZARK_ROUTER_RULE *raw = nullptr;
  if (KLibGetRulesArrFromRuleConf(&count, &raw, nullptr, false, err) < 0) {
    SetErr(err, ZARK_PORTMAP_ERR_IO);
    return -1;
  }
  std::unique_ptr<ZARK_ROUTER_RULE, RulesArrayDeleter> rules(raw);
  std::vector<WantedMapping> wanted;
  RuleRefusal refusal =
      PlanWantedMappings(std::span<const ZARK_ROUTER_RULE>(
                             rules.get(), static_cast<std::size_t>(count)),
                         INT_MAX, wanted);
  if (refusal.errType != ZARK_SAVE_ERR_NONE) {
    // Only a rule set that passed these checks is ever saved.
    ZARK_PM_LOG_ERROR("the saved rules do not pass the checks: %s",
                      refusal.reason.c_str());
    wanted.clear();
  }

  Json::Value root(Json::objectValue);
  root["gateway"] = *gateway;
  root["protocol"] = "";
  root["external_address"] = "";
  root["last_job"] = Json::Value(Json::nullValue);
  const RouterRecord *record = nullptr;
  MappingState state;
  RouterChoice choice;
  int chooseErr = ZARK_PORTMAP_ERR_NONE;
  if (ChooseRouter(*gateway, choice, chooseErr)) {
    root["protocol"] = std::string(RouterProtocolName(choice.protocol));
    // An unreadable state is logged; every rule is then pending.
    (void)LoadMappingState(kMappingStatePath, state);
    record = state.Find(*gateway, choice.protocol);
  }
  if (record != nullptr) {
    root["external_address"] = record->externalAddress;
    if (record->lastJob) {
      root["last_job"] = LastJobJson(*record->lastJob);
    }
  }
  Json::Value &list = root["rules"] = Json::Value(Json::arrayValue);
  for (const WantedMapping &want : wanted) {
    list.append(RuleJson(
        want, record != nullptr ? record->Find(want.protocol, want.externalPort)
                                : nullptr));
  }
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  builder["emitUTF8"] = true;
  text = Json::writeString(builder, root);
  return 0;
}

} // namespace
} // namespace zark::portmap

extern "C" int KLibGetPortMapStatus(const char *gatewayIP, char **json,
                                    ZARK_LIBZARKPORTMAP_ERR *err) {
  SetErr(err, ZARK_PORTMAP_ERR_NONE);
  if (json == nullptr || gatewayIP == nullptr) {
    ZARK_PM_LOG_ERROR("KLibGetPortMapStatus: bad arguments");
    SetErr(err, ZARK_PORTMAP_ERR_BAD_PARAMETER);
    return -1;
  }
  *json = nullptr;
  try {
    std::string text;
    if (zark::portmap::StatusJson(gatewayIP, text, err) != 0) {
      return -1;
    }
    *json = strdup(text.c_str());
    if (*json == nullptr) {
      SetErr(err, ZARK_PORTMAP_ERR_GENERIC);
      return -1;
    }
    return 0;
  } catch (const std::exception &e) {
    // Nothing may cross the C boundary.
    ZARK_PM_LOG_ERROR("KLibGetPortMapStatus: %s", e.what());
    SetErr(err, ZARK_PORTMAP_ERR_GENERIC);
    return -1;
  }
}

namespace zark::portmap {
namespace {

void Message(char *message, size_t size, const std::string &text) {
  if (message != nullptr && size > 0) {
    std::snprintf(message, size, "%s", text.c_str());
  }
}

int DeleteOurMapping(const std::string &gatewayText, IpProtocol protocol,
                     uint16_t port, char *message, size_t messageSize,
                     ZARK_LIBZARKPORTMAP_ERR *err) {
  const std::string what =
      std::string(ProtocolText(protocol)) + " " + std::to_string(port);
  std::optional<std::string> gateway = CanonicalGatewayAddress(gatewayText);
  if (!gateway || port == 0) {
    Message(message, messageSize, "bad gateway or port");
    SetErr(err, ZARK_PORTMAP_ERR_BAD_PARAMETER);
    return -1;
  }
  const ApplyEnvironment environment = DefaultApplyEnvironment();
  RouterChoice choice;
  int code = ZARK_PORTMAP_ERR_NONE;
  if (!environment.chooseRouter(*gateway, choice, code)) {
    Message(message, messageSize, "no router is configured for " + *gateway);
    SetErr(err, code);
    return -1;
  }
  MappingState state;
  if (!LoadMappingState(environment.statePath, state)) {
    Message(message, messageSize, "the record of our mappings is unreadable");
    SetErr(err, ZARK_PORTMAP_ERR_IO);
    return -1;
  }
  RouterRecord *record = state.Find(*gateway, choice.protocol);
  const RecordedMapping *entry =
      record != nullptr ? record->Find(protocol, port) : nullptr;
  if (entry == nullptr || entry->apply == MappingApply::kRefused) {
    Message(message, messageSize, what + " is not a mapping this server made");
    SetErr(err, ZARK_PORTMAP_ERR_BAD_PARAMETER);
    return -1;
  }
  std::unique_ptr<RouterDriver> router =
      environment.makeRouter(choice.protocol, *gateway, record);
  if (router == nullptr) {
    Message(message, messageSize, "the router cannot be reached");
    SetErr(err, ZARK_PORTMAP_ERR_ROUTER);
    return -1;
  }
  // Where the router can be asked, make sure the port is still ours there:
  // another device or program may hold it since.
  RouterMapping held;
  RouterResult looked = router->GetSpecificPortMapping(protocol, port, held);
  if (looked.Ok() && (held.internalClient != entry->internalClient ||
                      !held.description.starts_with(MappingDescription("")))) {
    Message(message, messageSize,
            what + " is held on the router by " + held.internalClient + " (\"" +
                held.description + "\"), not by this server");
    SetErr(err, ZARK_PORTMAP_ERR_BAD_PARAMETER);
    return -1;
  }
  RouterResult deleted =
      looked.outcome == RouterOutcome::kNotFound
          ? looked
          : router->DeletePortMapping({protocol, port, entry->internalPort,
                                       entry->internalClient,
                                       MappingDescription(entry->ruleId)});
  if (!deleted.Ok() && deleted.outcome != RouterOutcome::kNotFound) {
    Message(message, messageSize, deleted.message);
    SetErr(err, ZARK_PORTMAP_ERR_ROUTER);
    return -1;
  }
  record->Remove(protocol, port);
  if (!SaveMappingState(environment.statePath, state)) {
    Message(message, messageSize,
            "deleted, but the record of our mappings cannot be written");
    SetErr(err, ZARK_PORTMAP_ERR_IO);
    return -1;
  }
  Message(message, messageSize, "deleted " + what);
  return 0;
}

} // namespace
} // namespace zark::portmap

extern "C" int KLibKeepRouter(const char *gatewayIP, int checkIntervalSeconds,
                              int *nextSeconds,
                              ZARK_PORTMAP_APPLY_SUMMARY *summary,
                              ZARK_ROUTER_SAVE_RULE_RESULT *result) {
  using namespace zark::portmap;
  // Where the result goes when the caller does not want it.
  ZARK_ROUTER_SAVE_RULE_RESULT local{};
  ZARK_ROUTER_SAVE_RULE_RESULT *const picked =
      result != nullptr ? result : &local;
  ZARK_ROUTER_SAVE_RULE_RESULT &out = *picked;
  out = ZARK_ROUTER_SAVE_RULE_RESULT{};
  int next = std::max(checkIntervalSeconds, 1);
  if (nextSeconds != nullptr) {
    *nextSeconds = next;
  }
  if (summary != nullptr) {
    *summary = ZARK_PORTMAP_APPLY_SUMMARY{};
  }
  if (gatewayIP == nullptr) {
    ZARK_PM_LOG_ERROR("KLibKeepRouter: no gateway given");
    out.errType = kSaveErrBadParameter;
    return -1;
  }
  try {
    SavedRuleArray saved;
    if (!ReadSavedRules(saved)) {
      out.errType = kSaveErrIo;
      return -1;
    }
    ApplySummary done;
    const int rc = KeepRouter(gatewayIP, saved.Span(), checkIntervalSeconds,
                              DefaultApplyEnvironment(), out, done, next);
    if (nextSeconds != nullptr) {
      *nextSeconds = next;
    }
    CopySummary(done, summary);
    return rc;
  } catch (const std::exception &e) {
    // Nothing may cross the C boundary.
    ZARK_PM_LOG_ERROR("KLibKeepRouter: %s", e.what());
    out.errType = kSaveErrGeneric;
    return -1;
  }
}

extern "C" int KLibDeleteOurMapping(const char *gatewayIP, const char *protocol,
                                    uint16_t externalPort, char *message,
                                    size_t messageSize,
                                    ZARK_LIBZARKPORTMAP_ERR *err) {
  using namespace zark::portmap;
  SetErr(err, ZARK_PORTMAP_ERR_NONE);
  Message(message, messageSize, "");
  std::optional<IpProtocol> parsed =
      protocol != nullptr ? ParseProtocolText(protocol) : std::nullopt;
  if (gatewayIP == nullptr || !parsed) {
    Message(message, messageSize, "bad gateway or protocol");
    SetErr(err, ZARK_PORTMAP_ERR_BAD_PARAMETER);
    return -1;
  }
  try {
    return DeleteOurMapping(gatewayIP, *parsed, externalPort, message,
                            messageSize, err);
  } catch (const std::exception &e) {
    // Nothing may cross the C boundary.
    ZARK_PM_LOG_ERROR("KLibDeleteOurMapping: %s", e.what());
    SetErr(err, ZARK_PORTMAP_ERR_GENERIC);
    return -1;
  }
}
