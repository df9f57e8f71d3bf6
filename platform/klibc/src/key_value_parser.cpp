#include "key_value_parser.h"

#include "klibc_text.h"

#include <unordered_set>

namespace zark::klibc {
namespace {

constexpr std::string_view kByteOrderMark = "\xEF\xBB\xBF";

// A value written as "..." stands for exactly what lies between the quotes,
// so that leading and trailing blanks (and "=", "#") can be kept.
std::string_view Unquote(std::string_view value) {
  if (value.size() >= 2 && value.front() == '"' && value.back() == '"') {
    return value.substr(1, value.size() - 2);
  }
  return value;
}

} // namespace

KeyValueText ParseKeyValueText(std::string_view text) {
  KeyValueText result;
  std::unordered_set<std::string> seenSections;
  std::string currentSection;
  std::size_t lineStart = 0;
  if (text.substr(0, kByteOrderMark.size()) == kByteOrderMark) {
    lineStart = kByteOrderMark.size();
  }
  while (lineStart < text.size()) {
    std::size_t newline = text.find('\n', lineStart);
    if (newline == std::string_view::npos) {
      newline = text.size();
    }
    std::size_t lineEnd = newline;
    if (lineEnd > lineStart && text[lineEnd - 1] == '\r') {
      --lineEnd;
    }
    const std::string_view line =
        Trim(text.substr(lineStart, lineEnd - lineStart), kBlanksButLineFeed);
    if (line.empty() || line.front() == '#' || line.front() == ';') {
      // blank or comment
    } else if (line.front() == '[') {
      const std::size_t close = line.find(']');
      if (close != std::string_view::npos) {
        currentSection =
            std::string(Trim(line.substr(1, close - 1), kBlanksButLineFeed));
        if (seenSections.insert(currentSection).second) {
          result.sections.push_back(currentSection);
        }
      }
    } else if (const std::size_t equals = line.find('=');
               equals != std::string_view::npos) {
      const std::string_view key =
          Trim(line.substr(0, equals), kBlanksButLineFeed);
      if (!key.empty()) {
        result.entries.push_back(KeyValueEntry{
            currentSection, std::string(key),
            std::string(
                Unquote(Trim(line.substr(equals + 1), kBlanksButLineFeed))),
            lineStart, lineEnd});
      }
    }
    lineStart = newline + 1;
  }
  return result;
}

} // namespace zark::klibc
