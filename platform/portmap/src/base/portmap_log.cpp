#include "base/portmap_log.h"

#include <syslog.h>

#include <cstdarg>
#include <cstdio>
#include <cstring>

namespace zark::portmap {

void LogError(const char *file, int line, const char *format, ...) {
  char text[1024];
  va_list args;
  va_start(args, format);
  vsnprintf(text, sizeof(text), format, args);
  va_end(args);
  syslog(LOG_ERR, "%s:%d %s", file, line, text);
}

void LogCallFailure(const char *file, int line, const char *call, long rc,
                    int savedErrno, const char *detail) {
  char reason[256];
  // The GNU strerror_r returns the text, which may or may not be in reason.
  const char *text = strerror_r(savedErrno, reason, sizeof(reason));
  syslog(LOG_ERR, "%s:%d %s failed: rc=%ld errno=%d (%s)%s%s", file, line, call,
         rc, savedErrno, text, detail[0] != '\0' ? " " : "", detail);
}

} // namespace zark::portmap
