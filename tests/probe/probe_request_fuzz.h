// The promises of the probe service's request parser, checked on any input
// (the fuzz target and the corpus test share them).
#ifndef ZARK_TESTS_PROBE_PROBE_REQUEST_FUZZ_H
#define ZARK_TESTS_PROBE_PROBE_REQUEST_FUZZ_H

#include <string>
#include <string_view>

namespace zark::probe::test {

// "" when ParseRequestLine kept its promises on line, else what broke.
std::string CheckRequestParse(std::string_view line);

} // namespace zark::probe::test

#endif
