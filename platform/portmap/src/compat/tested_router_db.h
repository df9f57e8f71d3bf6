// The local database of routers whose UPnP compatibility test passed
// (KLibWriteRecordIntoUpnpDB): /etc/portforward/upnp_tested_routers.json,
// one record per brand, model and version, the latest test's replacing an
// earlier one. Replaced atomically (mode 0644) under a lock file, so that
// two writers do not lose each other's records:
//
//   {"version": 1, "routers": [
//     {"brand": "ZarkTest", "model": "TestIGD", "version": "1",
//      "max_mappings": 24, "date": "2024-05-01T12:00:00Z"}]}
//
// At most kMaxTestedRouters records are kept; the oldest written go first.
// A file that cannot be parsed is moved aside to "<path>.bad" (logged) and
// a new one is started.
#ifndef ZARK_PORTMAP_TESTED_ROUTER_DB_H
#define ZARK_PORTMAP_TESTED_ROUTER_DB_H

#include "libzarkportmap.h"

#include <chrono>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

inline constexpr const char *kTestedRoutersPath =
    ZARK_PORTMAP_CONF_DIR "/upnp_tested_routers.json";
inline constexpr std::size_t kMaxTestedRouters = 256;

struct TestedRouter {
  std::string brand;
  std::string model;
  std::string version;
  int maxMappings = 0;
  std::string date;
  friend bool operator==(const TestedRouter &, const TestedRouter &) = default;
};

[[nodiscard]] std::string
SerializeTestedRouters(const std::vector<TestedRouter> &routers);
// Strict; false with why set for anything else. Never throws.
[[nodiscard]] bool ParseTestedRouters(std::string_view text,
                                      std::vector<TestedRouter> &routers,
                                      std::string &why) noexcept;

// The record of a test result: false (why set) when a text field is not
// NUL-terminated within its 1024 bytes, brand or model is empty, or
// max_mappings is not 1..kMaxUpnpTestMappings.
[[nodiscard]] bool TestedRouterOfRecord(const ZARK_ROUTER_RECORD &record,
                                        TestedRouter &router, std::string &why);

// Reads the database at path (a missing file holds none). False, logged,
// when it cannot be read or parsed.
[[nodiscard]] bool LoadTestedRouters(const std::string &path,
                                     std::vector<TestedRouter> &routers);

// Puts router into the database at path (replacing the record of the same
// brand, model and version). False, logged, when the lock is not had
// within lockWait or the file cannot be written.
[[nodiscard]] bool
StoreTestedRouter(const std::string &path, const TestedRouter &router,
                  std::chrono::milliseconds lockWait = std::chrono::seconds(5));

} // namespace zark::portmap

#endif
