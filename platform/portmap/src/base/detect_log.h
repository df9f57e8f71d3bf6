// Log lines of router detection that are not failures: what each step
// found (LOG_INFO) and what looks wrong without stopping the run
// (LOG_WARNING). Failures go through portmap_log.h like everywhere else in
// the library. Every line starts with the caller's file and line.
#ifndef ZARK_PORTMAP_DETECT_LOG_H
#define ZARK_PORTMAP_DETECT_LOG_H

#include <syslog.h>

namespace zark::portmap {

// Logs "<file>:<line> <text>" at priority; text is printf-formatted.
void LogDetect(int priority, const char *file, int line, const char *format,
               ...) __attribute__((format(printf, 4, 5)));

} // namespace zark::portmap

#define ZARK_DETECT_INFO(...)                                                  \
  ::zark::portmap::LogDetect(LOG_INFO, __FILE__, __LINE__, __VA_ARGS__)
#define ZARK_DETECT_WARNING(...)                                               \
  ::zark::portmap::LogDetect(LOG_WARNING, __FILE__, __LINE__, __VA_ARGS__)

#endif
