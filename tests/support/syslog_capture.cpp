#include "syslog_capture.h"

#include <syslog.h>

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <mutex>

namespace zark::test {
namespace {

std::mutex &LogMutex() {
  static std::mutex mutex;
  return mutex;
}

std::vector<LogLine> &Lines() {
  static std::vector<LogLine> lines;
  return lines;
}

bool &Echo() {
  static bool echo = std::getenv("ZARK_TEST_LOG") != nullptr;
  return echo;
}

void Record(int priority, const char *format, va_list args) {
  char buffer[8192];
  vsnprintf(buffer, sizeof(buffer), format, args);
  std::lock_guard lock(LogMutex());
  Lines().push_back({LOG_PRI(priority), buffer});
  if (Echo()) {
    fprintf(stderr, "[syslog %d] %s\n", LOG_PRI(priority), buffer);
  }
}

} // namespace

std::vector<LogLine> CapturedLogs() {
  std::lock_guard lock(LogMutex());
  return Lines();
}

void ClearLogs() {
  std::lock_guard lock(LogMutex());
  Lines().clear();
}

std::vector<std::string> CapturedMessages() {
  std::vector<std::string> out;
  for (const auto &line : CapturedLogs()) {
    out.push_back(line.message);
  }
  return out;
}

bool HasLog(int priority, const std::string &message) {
  for (const auto &line : CapturedLogs()) {
    if (line.priority == priority && line.message == message) {
      return true;
    }
  }
  return false;
}

bool HasLogContaining(const std::string &text) {
  for (const auto &line : CapturedLogs()) {
    if (line.message.find(text) != std::string::npos) {
      return true;
    }
  }
  return false;
}

void EchoLogs(bool on) {
  std::lock_guard lock(LogMutex());
  Echo() = on;
}

} // namespace zark::test

// The C library's entry points, replaced. The fortified variants are what
// calls compile to under _FORTIFY_SOURCE.
extern "C" {

void syslog(int priority, const char *format, ...) {
  va_list args;
  va_start(args, format);
  zark::test::Record(priority, format, args);
  va_end(args);
}

void vsyslog(int priority, const char *format, va_list args) {
  zark::test::Record(priority, format, args);
}

void __syslog_chk(int priority, int, const char *format, ...) {
  va_list args;
  va_start(args, format);
  zark::test::Record(priority, format, args);
  va_end(args);
}

void __vsyslog_chk(int priority, int, const char *format, va_list args) {
  zark::test::Record(priority, format, args);
}

} // extern "C"
