#include "router_status.h"

#include <syslog.h>

#include <cstring>
#include <memory>
#include <strings.h>

namespace zark::status {
namespace {

const char kLockBusyWords[] =
    "Another job is talking to the router (a save, a renewal or a repair). "
    "Try again in a moment.";
const char kNoGatewayWords[] =
    "This server has no default gateway, so no router can be asked. Check "
    "its network settings.";

// A text the library filled, bounded by its field.
std::string FieldText(const char *field, std::size_t size) {
  return std::string(field, strnlen(field, size));
}

// The router and the gateway for an operation that holds the lock: the
// common refusals, or an empty answer to go on.
bool Prepare(const PortMapLock &lock, std::string &gateway, Answer &refusal) {
  if (!lock.Held()) {
    refusal = Answer::Failure(kErrLockBusy, kLockBusyWords);
    return false;
  }
  if (!FindGateway(gateway)) {
    refusal = Answer::Failure(kErrNoGateway, kNoGatewayWords);
    return false;
  }
  return true;
}

// The words of a library error number, for answers that have no message.
const char *LibraryErrorWords(int32_t err) {
  switch (err) {
  case ZARK_PORTMAP_ERR_NOT_CONFIGURED:
    return "No router that this server can drive is configured for the "
           "gateway.";
  case ZARK_PORTMAP_ERR_IO:
    return "A file of this server could not be read or written.";
  case ZARK_PORTMAP_ERR_ROUTER:
    return "The router refused or did not answer.";
  case ZARK_PORTMAP_ERR_BAD_PARAMETER:
    return "The request was refused as invalid.";
  case ZARK_PORTMAP_ERR_NOT_IMPLEMENTED:
    return "This operation is not built into the port-map library yet.";
  default:
    return "The port-map library failed; the system log has the details.";
  }
}

int CodeOfLibraryError(int32_t err) {
  return err == ZARK_PORTMAP_ERR_ROUTER ? kErrRouter : kErrLibrary;
}

struct FreeText {
  void operator()(char *text) const { KLibFreeText(text); }
};

// KLibGetPortMapStatus as JSON; the caller holds the lock.
bool ReadPortMapStatus(const std::string &gateway, Json::Value &status,
                       int32_t &err) {
  char *raw = nullptr;
  ZARK_LIBZARKPORTMAP_ERR libErr{};
  int rc = KLibGetPortMapStatus(gateway.c_str(), &raw, &libErr);
  std::unique_ptr<char, FreeText> text(raw);
  err = libErr.err;
  if (rc != 0 || text == nullptr) {
    syslog(LOG_ERR, "%s:%d KLibGetPortMapStatus failed: %d (err %d)", __FILE__,
           __LINE__, rc, static_cast<int>(libErr.err));
    if (err == ZARK_PORTMAP_ERR_NONE) {
      err = ZARK_PORTMAP_ERR_GENERIC;
    }
    return false;
  }
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  std::string errors;
  const char *begin = text.get();
  if (!reader->parse(begin, begin + std::strlen(begin), &status, &errors) ||
      !status.isObject()) {
    syslog(LOG_ERR, "%s:%d KLibGetPortMapStatus gave no JSON object: %s",
           __FILE__, __LINE__, errors.c_str());
    err = ZARK_PORTMAP_ERR_GENERIC;
    return false;
  }
  return true;
}

// The failure of the last job in a status, or null: also when the job's
// failure record says none (kind 0, no code).
Json::Value LastFailure(const Json::Value &status) {
  const Json::Value &job = status["last_job"];
  if (!job.isObject() || !job["failure"].isObject()) {
    return Json::Value();
  }
  const Json::Value &failure = job["failure"];
  if (failure["kind"].asInt() == ZARK_FAILURE_NONE &&
      failure["code"].asString().empty()) {
    return Json::Value();
  }
  return failure;
}

bool ParseProtocol(const Json::Value &value, std::string &protocol) {
  if (!value.isString()) {
    return false;
  }
  std::string text = value.asString();
  if (strcasecmp(text.c_str(), "tcp") == 0) {
    protocol = "TCP";
  } else if (strcasecmp(text.c_str(), "udp") == 0) {
    protocol = "UDP";
  } else {
    return false;
  }
  return true;
}

Answer BadParameter(const char *field, const std::string &words) {
  Json::Value errors(Json::objectValue);
  errors["field"] = field;
  return Answer::Failure(kErrBadParameter, words, errors);
}

void ForwardProgress(ZARK_ROUTER_SAVE_RULE_RESULT *result, void *arg) {
  const auto *progress = static_cast<const RepairProgress *>(arg);
  if (result != nullptr && progress != nullptr && *progress) {
    (*progress)(result->percentage);
  }
}

} // namespace

Answer Answer::Success(Json::Value data) {
  Answer answer;
  answer.ok = true;
  answer.data = std::move(data);
  return answer;
}

Answer Answer::Failure(int code, const std::string &reason,
                       Json::Value errors) {
  Answer answer;
  answer.code = code;
  answer.errors = std::move(errors);
  answer.errors["reason"] = reason;
  return answer;
}

PortMapLock::PortMapLock() : mHeld(KLibZarkPortMapLock() == 0) {
  if (!mHeld) {
    syslog(LOG_WARNING, "%s:%d the port-map lock is busy", __FILE__, __LINE__);
  }
}

PortMapLock::~PortMapLock() {
  if (mHeld) {
    KLibZarkPortMapUnLock();
  }
}

bool FindGateway(std::string &gateway) {
  char buffer[64] = {};
  if (KLibGetGatewayIP(buffer, sizeof(buffer)) < 0 || buffer[0] == '\0') {
    return false;
  }
  gateway = FieldText(buffer, sizeof(buffer));
  return true;
}

std::string FailureName(ZARK_FAILURE_KIND kind) {
  const char *name = KLibFailureKindName(kind);
  return name != nullptr ? name : "";
}

Json::Value SummaryJson(const ZARK_PORTMAP_APPLY_SUMMARY &s) {
  Json::Value summary(Json::objectValue);
  summary["deleted"] = s.deleted;
  summary["added"] = s.added;
  summary["checked"] = s.checked;
  summary["unchanged"] = s.unchanged;
  summary["failed"] = s.failed;
  summary["repaired"] = s.repaired;
  return summary;
}

Answer ListRouterMappings() {
  PortMapLock lock;
  std::string gateway;
  Answer refusal;
  if (!Prepare(lock, gateway, refusal)) {
    return refusal;
  }
  ZARK_ROUTER_MAPPINGS list{};
  ZARK_LIBZARKPORTMAP_ERR err{};
  int rc = KLibListRouterMappings(gateway.c_str(), &list, &err);
  // Frees the records on every path below.
  std::unique_ptr<ZARK_ROUTER_MAPPINGS, void (*)(ZARK_ROUTER_MAPPINGS *)> owner(
      &list, KLibFreeRouterMappings);
  if (rc != 0) {
    std::string message = FieldText(list.message, sizeof(list.message));
    syslog(LOG_ERR, "%s:%d KLibListRouterMappings failed: err %d, %s", __FILE__,
           __LINE__, static_cast<int>(err.err), message.c_str());
    return Answer::Failure(CodeOfLibraryError(err.err),
                           message.empty() ? LibraryErrorWords(err.err)
                                           : message);
  }
  Json::Value data(Json::objectValue);
  data["gateway"] = gateway;
  data["router_protocol"] =
      FieldText(list.router_protocol, sizeof(list.router_protocol));
  data["location"] = FieldText(list.location, sizeof(list.location));
  data["from_record"] = list.from_record != 0;
  data["record_unreadable"] = list.record_unreadable != 0;
  Json::Value mappings(Json::arrayValue);
  for (int32_t i = 0; i < list.count && list.mappings != nullptr; ++i) {
    const ZARK_ROUTER_MAPPING &m = list.mappings[i];
    Json::Value entry(Json::objectValue);
    entry["protocol"] = FieldText(m.protocol, sizeof(m.protocol));
    entry["external_port"] = m.external_port;
    entry["internal_client"] =
        FieldText(m.internal_client, sizeof(m.internal_client));
    entry["internal_port"] = m.internal_port;
    entry["description"] = FieldText(m.description, sizeof(m.description));
    entry["lease_seconds_left"] = m.lease_seconds;
    entry["permanent"] = m.lease_seconds == 0;
    entry["enabled"] = m.enabled != 0;
    entry["ours"] = m.ours != 0;
    entry["held"] = m.held != 0;
    entry["rule_id"] = FieldText(m.rule_id, sizeof(m.rule_id));
    mappings.append(entry);
  }
  data["mappings"] = mappings;
  return Answer::Success(data);
}

Answer DeleteOurMapping(const Json::Value &protocolValue,
                        const Json::Value &portValue) {
  std::string protocol;
  if (!ParseProtocol(protocolValue, protocol)) {
    return BadParameter("protocol", "The protocol must be \"TCP\" or \"UDP\".");
  }
  if (!portValue.isInt() || portValue.asInt() < 1 ||
      portValue.asInt() > 65535) {
    return BadParameter("external_port",
                        "The external port must be a number from 1 to 65535.");
  }
  const auto port = static_cast<uint16_t>(portValue.asInt());
  PortMapLock lock;
  std::string gateway;
  Answer refusal;
  if (!Prepare(lock, gateway, refusal)) {
    return refusal;
  }
  char message[ZARK_PORTMAP_TEXT_SIZE] = {};
  ZARK_LIBZARKPORTMAP_ERR err{};
  int rc = KLibDeleteOurMapping(gateway.c_str(), protocol.c_str(), port,
                                message, sizeof(message), &err);
  std::string words = FieldText(message, sizeof(message));
  if (rc != 0) {
    syslog(LOG_ERR, "%s:%d KLibDeleteOurMapping %s %u failed: err %d, %s",
           __FILE__, __LINE__, protocol.c_str(), static_cast<unsigned>(port),
           static_cast<int>(err.err), words.c_str());
    Json::Value errors(Json::objectValue);
    errors["protocol"] = protocol;
    errors["external_port"] = port;
    // The library refuses a mapping it did not make as a bad parameter.
    int code = err.err == ZARK_PORTMAP_ERR_BAD_PARAMETER
                   ? kErrNotOurs
                   : CodeOfLibraryError(err.err);
    return Answer::Failure(
        code, words.empty() ? LibraryErrorWords(err.err) : words, errors);
  }
  syslog(LOG_NOTICE, "%s:%d deleted our mapping %s %u on request", __FILE__,
         __LINE__, protocol.c_str(), static_cast<unsigned>(port));
  Json::Value data(Json::objectValue);
  data["protocol"] = protocol;
  data["external_port"] = port;
  data["deleted"] = true;
  return Answer::Success(data);
}

Answer RuleStatus() {
  PortMapLock lock;
  std::string gateway;
  Answer refusal;
  if (!Prepare(lock, gateway, refusal)) {
    return refusal;
  }
  Json::Value status;
  int32_t err = ZARK_PORTMAP_ERR_NONE;
  if (!ReadPortMapStatus(gateway, status, err)) {
    return Answer::Failure(CodeOfLibraryError(err), LibraryErrorWords(err));
  }
  status["last_failure"] = LastFailure(status);
  return Answer::Success(status);
}

Answer Repair(const RepairProgress &progress) {
  PortMapLock lock;
  std::string gateway;
  Answer refusal;
  if (!Prepare(lock, gateway, refusal)) {
    return refusal;
  }
  ZARK_PORTMAP_APPLY_SUMMARY summary{};
  ZARK_ROUTER_SAVE_RULE_RESULT result{};
  int rc =
      KLibRepairSavedRules(gateway.c_str(), &summary, &result, ForwardProgress,
                           const_cast<RepairProgress *>(&progress));
  if (rc == 0) {
    syslog(LOG_NOTICE, "%s:%d repair: %d restored, %d checked, %d failed",
           __FILE__, __LINE__, static_cast<int>(summary.repaired),
           static_cast<int>(summary.checked), static_cast<int>(summary.failed));
    Json::Value data(Json::objectValue);
    data["percentage"] = 100;
    data["summary"] = SummaryJson(summary);
    data["repaired"] = summary.repaired;
    return Answer::Success(data);
  }
  syslog(LOG_ERR, "%s:%d KLibRepairSavedRules failed: %d (type %u)", __FILE__,
         __LINE__, rc, static_cast<unsigned>(result.errType));
  // The words come from the library's record of the job just ended.
  Json::Value status;
  int32_t err = ZARK_PORTMAP_ERR_NONE;
  Json::Value failure;
  if (ReadPortMapStatus(gateway, status, err)) {
    failure = LastFailure(status);
  }
  Json::Value errors(Json::objectValue);
  errors["summary"] = SummaryJson(summary);
  errors["err_type"] = result.errType;
  errors["failure"] = failure;
  std::string words =
      failure.isObject() && failure["reason"].isString() &&
              !failure["reason"].asString().empty()
          ? failure["reason"].asString()
          : std::string(
                rc == ZARK_APPLY_SAVED_RULES_UNREADABLE
                    ? "The saved rules could not be read."
                    : "The repair failed; the system log has the details.");
  return Answer::Failure(rc == ZARK_APPLY_SAVED_RULES_UNREADABLE ? kErrLibrary
                                                                 : kErrRouter,
                         words, errors);
}

} // namespace zark::status
