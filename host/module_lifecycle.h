// Optional start and stop functions of a module. Besides GetAPITable, a
// module may export
//
//   int ZarkModuleStart(const ZARK_MODULE_SETTINGS *settings);
//   void ZarkModuleStop(void);
//
// The host looks both up (dlsym) once the module's table is accepted. It
// calls ZarkModuleStart once, after every module of the folder is loaded and
// before it serves any request, and ZarkModuleStop once, after the last
// request was answered and before the module is unloaded, in the reverse
// order of loading. A module that exports one of them must export both. A
// start that returns non-zero is logged; the module's methods are still
// served, and its stop is still called. Stop must return within a bounded
// time and leave no thread of the module running: the module is unloaded
// right after the background tasks are joined.
//
// Settings may grow: a module reads only the fields that fit in size.
#ifndef ZARK_HOST_MODULE_LIFECYCLE_H
#define ZARK_HOST_MODULE_LIFECYCLE_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

typedef struct {
  uint32_t size; // sizeof(ZARK_MODULE_SETTINGS) of the host
  // How often a module that keeps something up to date with the router
  // checks it (--keeper-interval, seconds, >= 1).
  int32_t keeper_interval_seconds;
} ZARK_MODULE_SETTINGS;

typedef int (*ZARK_MODULE_START)(const ZARK_MODULE_SETTINGS *settings);
typedef void (*ZARK_MODULE_STOP)(void);

#define ZARK_MODULE_START_SYMBOL "ZarkModuleStart"
#define ZARK_MODULE_STOP_SYMBOL "ZarkModuleStop"

// The host's default check interval: five minutes.
#define ZARK_DEFAULT_KEEPER_INTERVAL_SECONDS 300

#ifdef __cplusplus
} // extern "C"

inline ZARK_MODULE_SETTINGS DefaultModuleSettings() {
  ZARK_MODULE_SETTINGS settings{};
  settings.size = sizeof(settings);
  settings.keeper_interval_seconds = ZARK_DEFAULT_KEEPER_INTERVAL_SECONDS;
  return settings;
}
#endif

#endif
