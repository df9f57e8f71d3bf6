// What the status module asks the port-map library, as JSON answers: the
// router's live mapping table, deleting one of our mappings, the state of
// each saved rule, and a repair. Each operation that talks to the router
// holds the port-map lock for its whole call, so that it never meets a
// save, a renewal or another repair on the wire.
#ifndef ZARK_STATUS_ROUTER_STATUS_H
#define ZARK_STATUS_ROUTER_STATUS_H

#include "libzarkportmap.h"
#include "zarkportforward.h"

#include <json/json.h>

#include <functional>
#include <string>

namespace zark::status {

// Answer codes of the status module (besides the host's own, 100 to 111).
// The words of each answer are in its errors' "reason".
enum StatusError {
  kErrBadParameter = 1601, // a parameter is missing or malformed: "field"
  kErrLockBusy = 1602,     // another job holds the port-map lock
  kErrNoGateway = 1603,    // the server has no default IPv4 gateway
  kErrRouter = 1604,       // the router refused or did not answer
  kErrNotOurs = 1605,      // the mapping was not made by this server
  kErrLibrary = 1606,      // the library failed (not configured, a file)
  kErrNoTask = 1607,       // no repair task of that id
};

// An operation's outcome: ok with data, or code with errors
// {"reason": "<words>", ...}.
struct Answer {
  bool ok = false;
  Json::Value data;
  int code = 0;
  Json::Value errors;

  static Answer Success(Json::Value data);
  static Answer Failure(int code, const std::string &reason,
                        Json::Value errors = Json::Value(Json::objectValue));
};

// Holds the system-wide port-map lock (KLibZarkPortMapLock) from its
// construction, when it could take it, to its end.
class PortMapLock {
public:
  PortMapLock();
  ~PortMapLock();
  PortMapLock(const PortMapLock &) = delete;
  PortMapLock &operator=(const PortMapLock &) = delete;
  [[nodiscard]] bool Held() const { return mHeld; }

private:
  bool mHeld = false;
};

// The default gateway (KLibGetGatewayIP); false when there is none.
[[nodiscard]] bool FindGateway(std::string &gateway);

// The stable name of a failure kind ("conflict", ...), "" for none.
[[nodiscard]] std::string FailureName(ZARK_FAILURE_KIND kind);

// {"gateway", "router_protocol", "location", "from_record",
//  "record_unreadable", "mappings": [{"protocol", "external_port",
//  "internal_client", "internal_port", "description", "lease_seconds_left",
//  "permanent", "enabled", "ours", "held", "rule_id"}, ...]}.
// Errors: kErrLockBusy, kErrNoGateway, kErrRouter, kErrLibrary.
[[nodiscard]] Answer ListRouterMappings();

// Deletes the mapping protocol ("TCP"/"UDP", any case) externalPort when
// this server made it. {"protocol", "external_port", "deleted": true}.
// Errors: kErrBadParameter, kErrLockBusy, kErrNoGateway, kErrNotOurs (with
// the library's message), kErrRouter, kErrLibrary.
[[nodiscard]] Answer DeleteOurMapping(const Json::Value &protocol,
                                      const Json::Value &externalPort);

// The library's status of the saved rules (KLibGetPortMapStatus) and
// "last_failure": the failure of the last job ({"code", "kind", "reason"})
// or null. Errors: kErrLockBusy, kErrNoGateway, kErrLibrary.
[[nodiscard]] Answer RuleStatus();

// Progress of a repair: 0 to 100.
using RepairProgress = std::function<void(int percentage)>;

// Takes the lock and runs KLibRepairSavedRules, reporting its progress.
// {"percentage": 100, "summary": {"deleted", "added", "checked",
//  "unchanged", "failed", "repaired"}, "repaired": <restored mappings>}.
// Errors: kErrLockBusy, kErrNoGateway, kErrRouter ({"reason", "summary",
// "err_type", "failure"}).
[[nodiscard]] Answer Repair(const RepairProgress &progress);

// {"deleted", "added", "checked", "unchanged", "failed", "repaired"}.
[[nodiscard]] Json::Value SummaryJson(const ZARK_PORTMAP_APPLY_SUMMARY &s);

} // namespace zark::status

#endif
