// The words of the failure kinds (ZARK_FAILURE_KIND, zarkportforward.h):
// what the mapping state file, the status JSON and KLibFailureKindName say.
#ifndef ZARK_PORTMAP_BASE_FAILURE_KIND_H
#define ZARK_PORTMAP_BASE_FAILURE_KIND_H

#include "zarkportforward.h"

#include <optional>
#include <string_view>

namespace zark::portmap {

// "router_not_answering", "conflict", ...; "" for ZARK_FAILURE_NONE and for
// a value outside the enumeration.
[[nodiscard]] const char *FailureKindWord(ZARK_FAILURE_KIND kind);
// The kind of a word FailureKindWord gives ("" is ZARK_FAILURE_NONE);
// nothing for any other text.
[[nodiscard]] std::optional<ZARK_FAILURE_KIND>
ParseFailureKindWord(std::string_view word);

} // namespace zark::portmap

#endif
