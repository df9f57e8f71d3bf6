// The promises of the library's parser of probe service answers, checked on
// any input (the fuzz target and the corpus test share them).
#ifndef ZARK_FUZZ_PROBE_ANSWER_FUZZ_H
#define ZARK_FUZZ_PROBE_ANSWER_FUZZ_H

#include <string>
#include <string_view>

namespace zark::porttest {

// "" when ParseProbeAnswer kept its promises on line, else what broke.
std::string CheckAnswerParse(std::string_view line);

} // namespace zark::porttest

#endif
