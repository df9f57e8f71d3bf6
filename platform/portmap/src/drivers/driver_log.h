// The one way the router protocols log the library calls they make
// (miniupnpc, libnatpmp). Every call is logged exactly once, with its return
// code and what the code means:
//   failure: LOG_ERR   "<file>:<line> <call> failed: rc=<rc> (<meaning>)
//   <detail>" success: LOG_DEBUG "<file>:<line> <call>: rc=<rc> <detail>"
// savedErrno, when not 0, is the errno the caller captured right after the
// call (socket errors of libnatpmp) and is added as " errno=<n> (<text>)".
#ifndef ZARK_PORTMAP_DRIVERS_DRIVER_LOG_H
#define ZARK_PORTMAP_DRIVERS_DRIVER_LOG_H

#include <string_view>

namespace zark::portmap {

void LogRouterCall(const char *file, int line, const char *call, long rc,
                   bool failed, std::string_view meaning,
                   std::string_view detail, int savedErrno = 0);

} // namespace zark::portmap

#define ZARK_PM_LOG_ROUTER_CALL(call, rc, failed, meaning, detail, ...)        \
  ::zark::portmap::LogRouterCall(__FILE__, __LINE__, call, rc, failed,         \
                                 meaning, detail, ##__VA_ARGS__)

#endif
