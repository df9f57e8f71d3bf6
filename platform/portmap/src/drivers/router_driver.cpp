#include "drivers/router_driver.h"

namespace zark::portmap {

const char *RouterOutcomeName(RouterOutcome outcome) {
  switch (outcome) {
  case RouterOutcome::kOk:
    return "ok";
  case RouterOutcome::kNotFound:
    return "not found";
  case RouterOutcome::kConflict:
    return "conflict";
  case RouterOutcome::kNotHeld:
    return "not held";
  case RouterOutcome::kRefused:
    return "refused";
  case RouterOutcome::kNoAnswer:
    return "no answer";
  case RouterOutcome::kBadReply:
    return "bad reply";
  case RouterOutcome::kUnsupported:
    return "unsupported";
  case RouterOutcome::kNoRouter:
    return "no router";
  case RouterOutcome::kFailed:
    return "failed";
  }
  return "unknown";
}

RouterResult RouterDriver::ListPortRange(IpProtocol /*protocol*/,
                                         uint16_t /*firstPort*/,
                                         uint16_t /*lastPort*/,
                                         std::vector<RouterMapping> &entries) {
  entries.clear();
  RouterResult result;
  result.outcome = RouterOutcome::kUnsupported;
  result.message = "the router cannot list a port range";
  return result;
}

ZARK_FAILURE_KIND RouterDriver::FailureKind(const RouterResult &result) const {
  switch (result.outcome) {
  case RouterOutcome::kOk:
  case RouterOutcome::kNotFound:
    return ZARK_FAILURE_NONE;
  case RouterOutcome::kConflict:
    return ZARK_FAILURE_CONFLICT;
  case RouterOutcome::kNotHeld:
    return ZARK_FAILURE_TABLE_FULL;
  case RouterOutcome::kRefused:
  case RouterOutcome::kUnsupported:
    return ZARK_FAILURE_PORT_REFUSED;
  case RouterOutcome::kNoAnswer:
  case RouterOutcome::kNoRouter:
    return ZARK_FAILURE_ROUTER_NOT_ANSWERING;
  case RouterOutcome::kBadReply:
    return ZARK_FAILURE_OTHER;
  case RouterOutcome::kFailed:
    return ZARK_FAILURE_LOCAL;
  }
  return ZARK_FAILURE_OTHER;
}

} // namespace zark::portmap
