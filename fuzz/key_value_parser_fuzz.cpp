// Fuzz target of the key/value parser. Besides not crashing, the parse must
// keep its promises: section names listed once, every entry's section is
// listed (or "" before any header), keys are non-empty and trimmed, line
// offsets lie in the text in order, and each entry's line parsed alone
// gives the same key and value.
#include "key_value_parser_fuzz.h"

#include "key_value_parser.h"

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <set>

namespace zark::test {

std::string CheckKeyValueParse(std::string_view text) {
  using klibc::KeyValueEntry;
  using klibc::KeyValueText;
  const KeyValueText parsed = klibc::ParseKeyValueText(text);
  const std::set<std::string> names(parsed.sections.begin(),
                                    parsed.sections.end());
  if (names.size() != parsed.sections.size()) {
    return "a section name is listed twice";
  }
  std::size_t previousEnd = 0;
  for (const KeyValueEntry &entry : parsed.entries) {
    if (!entry.section.empty() && !names.contains(entry.section)) {
      return "entry in unlisted section [" + entry.section + "]";
    }
    if (entry.key.empty()) {
      return "empty key";
    }
    const std::string_view blanks = " \t\r\f\v";
    if (blanks.find(entry.key.front()) != std::string_view::npos ||
        blanks.find(entry.key.back()) != std::string_view::npos ||
        entry.key.find('=') != std::string::npos) {
      return "key not trimmed or holding '=': [" + entry.key + "]";
    }
    if (entry.lineStart > entry.lineEnd || entry.lineEnd > text.size() ||
        entry.lineStart < previousEnd) {
      return "line offsets out of order for key [" + entry.key + "]";
    }
    previousEnd = entry.lineEnd;
    const std::string_view line =
        text.substr(entry.lineStart, entry.lineEnd - entry.lineStart);
    if (line.find('\n') != std::string_view::npos) {
      return "line of key [" + entry.key + "] spans a line break";
    }
    // After a line break, so that a byte order mark in it is not skipped.
    const KeyValueText alone =
        klibc::ParseKeyValueText("\n" + std::string(line));
    if (alone.entries.size() != 1 || alone.entries[0].key != entry.key ||
        alone.entries[0].value != entry.value) {
      return "line of key [" + entry.key + "] parses differently alone";
    }
  }
  return {};
}

} // namespace zark::test

#ifdef ZARK_KLIBC_FUZZER
extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  const std::string_view text(reinterpret_cast<const char *>(data), size);
  if (!zark::test::CheckKeyValueParse(text).empty()) {
    std::abort();
  }
  return 0;
}
#endif
