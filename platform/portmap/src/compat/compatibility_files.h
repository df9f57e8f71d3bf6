// The compatibility test's files, the description of its mappings and its
// limits: shared by the test itself, its report and the database of tested
// routers, which need these and nothing else of the test.
#ifndef ZARK_PORTMAP_COMPAT_COMPATIBILITY_FILES_H
#define ZARK_PORTMAP_COMPAT_COMPATIBILITY_FILES_H

#include "libzarkportmap.h"

#include <cstdint>

namespace zark::portmap {

// Files of the test besides the progress file.
inline constexpr const char *kUpnpTestRunPath =
    ZARK_PORTMAP_CONF_DIR "/upnp_test.run";
inline constexpr const char *kUpnpTestStopPath =
    ZARK_PORTMAP_CONF_DIR "/upnp_test.stop";
inline constexpr const char *kUpnpTestReportPath =
    ZARK_PORTMAP_CONF_DIR "/upnp_test.report.json";

// The description of the test's mappings in the router's table.
inline constexpr const char *kUpnpTestDescription =
    "zarkportforward compatibility test";
// The most mappings one test may be asked to make.
inline constexpr int kMaxUpnpTestMappings = 1024;
inline constexpr uint16_t kDefaultUpnpTestFirstPort = 30500;

} // namespace zark::portmap

#endif
