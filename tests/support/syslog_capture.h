// Captures what the code under test sends to the system log. Linking this
// file into a test executable replaces syslog() for the whole process, the
// shared libraries it loads included, so that tests can check log lines.
#ifndef ZARK_TESTS_SYSLOG_CAPTURE_H
#define ZARK_TESTS_SYSLOG_CAPTURE_H

#include <string>
#include <vector>

namespace zark::test {

struct LogLine {
  int priority; // LOG_ERR, LOG_INFO, ... (facility bits removed)
  std::string message;
};

// Every line logged since the last ClearLogs, in order.
std::vector<LogLine> CapturedLogs();
void ClearLogs();

// Texts of the captured lines, for compact assertions.
std::vector<std::string> CapturedMessages();

// True when some captured line has this priority and exactly this text.
bool HasLog(int priority, const std::string &message);

// True when some captured line contains text.
bool HasLogContaining(const std::string &text);

// Also print captured lines to stderr (off by default; ZARK_TEST_LOG=1).
void EchoLogs(bool on);

} // namespace zark::test

#endif
