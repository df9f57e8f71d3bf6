// The status and keeper entry points of zarkportforward.h: the library's
// record of the saved rules, repair, the keeper's round, deleting one of
// our mappings.
#include "zarkportforward.h"

#include "base/portmap_log.h"

#include <cstdio>
#include <cstdlib>

namespace {

void SetErr(ZARK_LIBZARKPORTMAP_ERR *err, int32_t code) {
  if (err != nullptr) {
    err->err = code;
  }
}

// An entry point whose work is not built yet: it fails loudly.
int NotBuiltYet(const char *function, ZARK_LIBZARKPORTMAP_ERR *err) {
  ZARK_PM_LOG_ERROR("%s: not built yet", function);
  SetErr(err, ZARK_PORTMAP_ERR_NOT_IMPLEMENTED);
  return -1;
}

} // namespace

extern "C" const char *KLibFailureKindName(ZARK_FAILURE_KIND kind) {
  switch (kind) {
  case ZARK_FAILURE_ROUTER_NOT_ANSWERING:
    return "router_not_answering";
  case ZARK_FAILURE_CONFLICT:
    return "conflict";
  case ZARK_FAILURE_PORT_REFUSED:
    return "port_refused";
  case ZARK_FAILURE_TABLE_FULL:
    return "table_full";
  case ZARK_FAILURE_DOUBLE_NAT:
    return "double_nat";
  case ZARK_FAILURE_LEASE_REFUSED:
    return "lease_refused";
  case ZARK_FAILURE_NOT_CONFIGURED:
    return "not_configured";
  case ZARK_FAILURE_LOCAL:
    return "local";
  case ZARK_FAILURE_OTHER:
    return "other";
  case ZARK_FAILURE_NONE:
    break;
  }
  return "";
}

extern "C" void KLibFreeText(char *text) {
  std::free(text);
}

extern "C" int KLibGetPortMapStatus(const char * /*gatewayIP*/, char **json,
                                    ZARK_LIBZARKPORTMAP_ERR *err) {
  if (json != nullptr) {
    *json = nullptr;
  }
  return NotBuiltYet("KLibGetPortMapStatus", err);
}

extern "C" int KLibRepairSavedRules(const char * /*gatewayIP*/,
                                    ZARK_PORTMAP_APPLY_SUMMARY *summary,
                                    ZARK_ROUTER_SAVE_RULE_RESULT *result,
                                    ZARK_SAVE_RULE_PROGRESS_CB /*callback*/,
                                    void * /*arg*/) {
  if (summary != nullptr) {
    *summary = ZARK_PORTMAP_APPLY_SUMMARY{};
  }
  if (result != nullptr) {
    *result = ZARK_ROUTER_SAVE_RULE_RESULT{};
    result->errType = ZARK_PORTMAP_ERR_NOT_IMPLEMENTED;
  }
  return NotBuiltYet("KLibRepairSavedRules", nullptr);
}

extern "C" int KLibKeepRouter(const char * /*gatewayIP*/,
                              int checkIntervalSeconds, int *nextSeconds,
                              ZARK_PORTMAP_APPLY_SUMMARY *summary,
                              ZARK_ROUTER_SAVE_RULE_RESULT *result) {
  if (nextSeconds != nullptr) {
    *nextSeconds = checkIntervalSeconds > 0 ? checkIntervalSeconds : 1;
  }
  if (summary != nullptr) {
    *summary = ZARK_PORTMAP_APPLY_SUMMARY{};
  }
  if (result != nullptr) {
    *result = ZARK_ROUTER_SAVE_RULE_RESULT{};
    result->errType = ZARK_PORTMAP_ERR_NOT_IMPLEMENTED;
  }
  return NotBuiltYet("KLibKeepRouter", nullptr);
}

extern "C" int KLibDeleteOurMapping(const char * /*gatewayIP*/,
                                    const char * /*protocol*/,
                                    uint16_t /*externalPort*/, char *message,
                                    size_t messageSize,
                                    ZARK_LIBZARKPORTMAP_ERR *err) {
  if (message != nullptr && messageSize > 0) {
    std::snprintf(message, messageSize, "not built yet");
  }
  return NotBuiltYet("KLibDeleteOurMapping", err);
}
