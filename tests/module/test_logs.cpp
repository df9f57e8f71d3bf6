// Log-line and JSON helpers shared by every module test executable.
#include "module_test.h"

#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <regex>
#include <sstream>

namespace zark::moduletest {
namespace {

std::string RegexEscape(const std::string &text) {
  static const std::regex special(R"([.^$|()\[\]{}*+?\\])");
  return std::regex_replace(text, special, R"(\$&)");
}

bool LineMatches(const zark::test::LogLine &line, const std::string &file,
                 const std::string &text, int priority) {
  if (line.priority != priority) {
    return false;
  }
  std::regex pattern("^" + RegexEscape(file) + ":[0-9]+ " + RegexEscape(text) +
                     "$");
  return std::regex_match(line.message, pattern);
}

} // namespace

Json::Value ParseJson(const std::string &text) {
  Json::CharReaderBuilder builder;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value value;
  std::string errors;
  if (!reader->parse(text.data(), text.data() + text.size(), &value, &errors)) {
    ADD_FAILURE() << "bad JSON in test: " << text << ": " << errors;
  }
  return value;
}

int CountLogs(const std::string &file, const std::string &text, int priority) {
  int count = 0;
  for (const auto &line : zark::test::CapturedLogs()) {
    count += LineMatches(line, file, text, priority);
  }
  return count;
}

int FindLog(const std::string &file, const std::string &text, int from,
            int priority) {
  std::vector<zark::test::LogLine> lines = zark::test::CapturedLogs();
  for (int i = from; i < static_cast<int>(lines.size()); ++i) {
    if (LineMatches(lines[i], file, text, priority)) {
      return i;
    }
  }
  return -1;
}

std::string DumpLogs() {
  std::ostringstream out;
  out << "captured log lines:\n";
  for (const auto &line : zark::test::CapturedLogs()) {
    out << "  [" << line.priority << "] " << line.message << "\n";
  }
  return out.str();
}

} // namespace zark::moduletest
