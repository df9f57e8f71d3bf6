// The promises of the port-map library's parsers of outside bytes that this
// part owns: the mapping state file (ParseMappingState), rule port texts
// (ExpandPortText) and URLs from router descriptions (UrlHost and the local
// network check). Checked by the fuzz target and by the corpus test.
//
// Input: the first byte chooses the parser ('s' state, 'p' port text,
// 'u' URL), the rest is its input.
#ifndef ZARK_FUZZ_ROUTER_PARSERS_FUZZ_H
#define ZARK_FUZZ_ROUTER_PARSERS_FUZZ_H

#include <string>
#include <string_view>

namespace zark::test {

// "" when the parse keeps its promises, else the first broken one.
std::string CheckRouterParsers(std::string_view input);

} // namespace zark::test

#endif
