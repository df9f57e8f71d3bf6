// Parsing of key/value text, kept apart from file access so that it can be
// tested and fuzzed on plain strings.
#ifndef ZARK_PLATFORM_KLIBC_KEY_VALUE_PARSER_H
#define ZARK_PLATFORM_KLIBC_KEY_VALUE_PARSER_H

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

namespace zark::klibc {

// One "key=value" line.
struct KeyValueEntry {
  std::string section;   // name of the section it is in, "" before any
  std::string key;       // blanks around it trimmed
  std::string value;     // trimmed, or exactly what lies between quotes
  std::size_t lineStart; // offset of the line's first byte in the text
  std::size_t lineEnd;   // offset just past its content, before "\r\n"/"\n"
};

struct KeyValueText {
  std::vector<std::string> sections;  // each section name once, at its first
                                      // header, in text order
  std::vector<KeyValueEntry> entries; // every key line, in text order
};

// Reads text of this form, line by line ("\n" or "\r\n" endings):
//
//   # comment            (also "; comment"; leading blanks allowed)
//   [general]
//   name = My Server     -> key "name", value "My Server"
//   motd = "  hi = x "   -> value "  hi = x " (kept exactly between quotes)
//   empty =              -> value ""
//
// A section header is "[" name "]" (name trimmed; anything after the "]" is
// ignored). Lines without "=", lines with an empty key and headers without
// "]" are ignored. There are no comments after a value. A UTF-8 byte order
// mark at the start is skipped. Never fails; throws only std::bad_alloc.
[[nodiscard]] KeyValueText ParseKeyValueText(std::string_view text);

} // namespace zark::klibc

#endif
