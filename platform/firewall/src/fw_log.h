// System log lines of the firewall library: "<source file>:<line> <text>",
// the same prefix as the rest of the system's log lines.
#ifndef ZARK_PLATFORM_FIREWALL_FW_LOG_H
#define ZARK_PLATFORM_FIREWALL_FW_LOG_H

#include <syslog.h>

#define ZARKFW_LOG(priority, format, ...)                                      \
  syslog(priority, "%s:%d " format, __FILE__, __LINE__, ##__VA_ARGS__)

#endif
