#include "drivers/driver_log.h"

#include <syslog.h>

#include <cstring>
#include <string>

namespace zark::portmap {

void LogRouterCall(const char *file, int line, const char *call, long rc,
                   bool failed, std::string_view meaning,
                   std::string_view detail, int savedErrno) {
  std::string error;
  if (savedErrno != 0) {
    char reason[256];
    // The GNU strerror_r returns the text, which may or may not be in reason.
    const char *text = strerror_r(savedErrno, reason, sizeof(reason));
    error = " errno=" + std::to_string(savedErrno) + " (" + text + ")";
  }
  if (failed) {
    syslog(LOG_ERR, "%s:%d %s failed: rc=%ld (%.*s)%s%s%.*s", file, line, call,
           rc, static_cast<int>(meaning.size()), meaning.data(), error.c_str(),
           detail.empty() ? "" : " ", static_cast<int>(detail.size()),
           detail.data());
  } else {
    syslog(LOG_DEBUG, "%s:%d %s: rc=%ld%s%.*s", file, line, call, rc,
           detail.empty() ? "" : " ", static_cast<int>(detail.size()),
           detail.data());
  }
}

} // namespace zark::portmap
