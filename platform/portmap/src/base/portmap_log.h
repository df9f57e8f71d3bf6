// The port-map library's one way of telling the system log about failures.
// Every line starts with the source file and line of the caller.
#ifndef ZARK_PORTMAP_PORTMAP_LOG_H
#define ZARK_PORTMAP_PORTMAP_LOG_H

namespace zark::portmap {

// Logs "<file>:<line> <text>" at LOG_ERR; text is printf-formatted.
void LogError(const char *file, int line, const char *format, ...)
    __attribute__((format(printf, 3, 4)));

// Logs a failed system or library call once, with its result and the errno
// the caller captured right after it:
// "<file>:<line> <call> failed: rc=<rc> errno=<n> (<strerror>) <detail>".
void LogCallFailure(const char *file, int line, const char *call, long rc,
                    int savedErrno, const char *detail = "");

} // namespace zark::portmap

#define ZARK_PM_LOG_ERROR(...)                                                 \
  ::zark::portmap::LogError(__FILE__, __LINE__, __VA_ARGS__)
#define ZARK_PM_LOG_CALL(call, rc, savedErrno, ...)                            \
  ::zark::portmap::LogCallFailure(__FILE__, __LINE__, call, rc, savedErrno,    \
                                  ##__VA_ARGS__)

#endif
