// The promises of ParseKeyValueText, checked by the fuzz target and by the
// corpus test.
#ifndef ZARK_FUZZ_KEY_VALUE_PARSER_FUZZ_H
#define ZARK_FUZZ_KEY_VALUE_PARSER_FUZZ_H

#include <string>
#include <string_view>

namespace zark::test {

// Parses text and returns "" when the parse keeps its promises, else a
// description of the first broken one.
std::string CheckKeyValueParse(std::string_view text);

} // namespace zark::test

#endif
