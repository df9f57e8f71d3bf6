// Calls of the port-map library that are not built yet. Each one says so in
// the system log ("<function>: not built yet", LOG_ERR) and fails: -1, with
// ZARK_PORTMAP_ERR_NOT_IMPLEMENTED in the error record where the call takes
// one (ZARKIGetExternalIP answers 0, "unknown"). A call moves out of this
// file when its real implementation lands.
#include "libzarkportmap.h"
#include "zarknet.h"

#include <syslog.h>

namespace {

int NotBuiltYet(const char *function, ZARK_LIBZARKPORTMAP_ERR *err = nullptr) {
  syslog(LOG_ERR, "%s: not built yet", function);
  if (err != nullptr) {
    err->err = ZARK_PORTMAP_ERR_NOT_IMPLEMENTED;
  }
  return -1;
}

} // namespace

extern "C" {

int KLibTestRulesInit(void) {
  return NotBuiltYet(__func__);
}

int KLibTestRules(int, ZARK_ROUTER_RULE *, ZARK_LIBZARKPORTMAP_ERR *err, bool) {
  return NotBuiltYet(__func__, err);
}

int KLibDetectRouter(ZARK_ROUTER_DETECT_RESULT *, ZARK_DETECT_PROGRESS_CB,
                     void *, bool) {
  return NotBuiltYet(__func__);
}

int KLibGetRouterDetectResult(ZARK_ROUTER_DETECT_RESULT *) {
  return NotBuiltYet(__func__);
}

int KLibTestUpnpCompatibility(int, ZARK_ROUTER_TEST_COMPATIBILITY_RESULT *,
                              ZARK_TEST_COMPATIBILITY_PROGRESS_CB, void *,
                              bool) {
  return NotBuiltYet(__func__);
}

int KLibWriteRecordIntoUpnpDB(const ZARK_ROUTER_RECORD *) {
  return NotBuiltYet(__func__);
}

int KLibStopTestUpnpCompatibility(void) {
  return NotBuiltYet(__func__);
}

int KLibUploadTestUpnpCompatibilityFailResult(void) {
  return NotBuiltYet(__func__);
}

uint32_t ZARKIGetExternalIP(void) {
  NotBuiltYet(__func__);
  return 0;
}

} // extern "C"
