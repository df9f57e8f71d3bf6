// Logging of the web API host: every line goes to the system log with the
// source file and line in front, as the framework and the module do.
// Passwords, session ids and tokens are never arguments of these lines.
#ifndef ZARK_HOST_LOG_H
#define ZARK_HOST_LOG_H

#include <syslog.h>

#define HOST_LOG(priority, format, ...)                                        \
  syslog(priority, "%s:%d " format, __FILE__, __LINE__, ##__VA_ARGS__)

#endif
