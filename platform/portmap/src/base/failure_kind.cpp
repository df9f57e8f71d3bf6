#include "base/failure_kind.h"

namespace zark::portmap {

const char *FailureKindWord(ZARK_FAILURE_KIND kind) {
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

std::optional<ZARK_FAILURE_KIND> ParseFailureKindWord(std::string_view word) {
  for (int code = ZARK_FAILURE_NONE; code <= ZARK_FAILURE_OTHER; ++code) {
    const auto kind = static_cast<ZARK_FAILURE_KIND>(code);
    if (word == FailureKindWord(kind)) {
      return kind;
    }
  }
  return std::nullopt;
}

} // namespace zark::portmap
