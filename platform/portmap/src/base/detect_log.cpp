#include "base/detect_log.h"

#include <cstdarg>
#include <cstdio>

namespace zark::portmap {

void LogDetect(int priority, const char *file, int line, const char *format,
               ...) {
  char text[1024];
  va_list args;
  va_start(args, format);
  vsnprintf(text, sizeof(text), format, args);
  va_end(args);
  syslog(priority, "%s:%d %s", file, line, text);
}

} // namespace zark::portmap
