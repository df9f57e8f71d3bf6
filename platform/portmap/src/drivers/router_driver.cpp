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

} // namespace zark::portmap
