// The report of the last UPnP compatibility test, kept for
// KLibUploadTestUpnpCompatibilityFailResult: the test writes it when it
// ends (/etc/portforward/upnp_test.report.json, replaced atomically), and
// the upload sends it, with the progress file and the router's UPnP root
// description, to the configuration's "report_address" (an http:// or
// https:// URL) as one JSON document in a POST:
//
//   {"version": 1, "result": "failed", "error": 17,
//    "reason": "the deleted mapping tcp 30500 still answers from outside",
//    "date": "2024-05-01T12:00:00Z", "mappings_asked": 60,
//    "mappings_reached": 24, "gateway": "192.168.1.1",
//    "location": "http://192.168.1.1:5000/rootDesc.xml",
//    "router": {"brand": "...", "model": "...", "version": "...",
//               "support_upnp": "yes", "support_natpmp": "no"},
//    "log": ["12:00:00 upnp_init: using urn:...", ...],
//    "progress": "upnp_init=success\nupnp_add=finished\n...",   (upload)
//    "root_description": "<?xml ...",                          (upload)
//    "root_description_error": "..."}               (upload, when none)
//
// The router's account and password are never part of it.
#ifndef ZARK_PORTMAP_COMPAT_COMPATIBILITY_REPORT_H
#define ZARK_PORTMAP_COMPAT_COMPATIBILITY_REPORT_H

#include "libzarkportmap.h"

#include <chrono>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

struct UpnpTestReport {
  bool failed = true;
  int error = 0; // ZARK_UPNP_TEST_ERR_*, ZARK_PORTMAP_ERR_*
  std::string reason;
  std::string date;
  int mappingsAsked = 0;
  int mappingsReached = 0;
  std::string gateway;
  std::string location;
  std::string brand;
  std::string model;
  std::string version;
  std::string supportUpnp;
  std::string supportNatpmp;
  std::vector<std::string> log;
  friend bool operator==(const UpnpTestReport &,
                         const UpnpTestReport &) = default;
};

// The most log lines a report keeps (the first ones and the last ones).
inline constexpr std::size_t kMaxReportLogLines = 200;

[[nodiscard]] std::string SerializeUpnpTestReport(const UpnpTestReport &report);
// Strict JSON of the shape above (upload members ignored); false with why
// set for anything else. Never throws.
[[nodiscard]] bool ParseUpnpTestReport(std::string_view text,
                                       UpnpTestReport &report,
                                       std::string &why) noexcept;

// "2024-05-01T12:00:00Z" of seconds since 1970.
[[nodiscard]] std::string UtcDateText(int64_t seconds);

struct UploadOptions {
  std::string reportAddress; // empty: none configured
  std::string reportPath;
  std::string progressPath = ZARK_PORTMAP_UPNP_TEST_PROGRESS;
  std::chrono::milliseconds connectTimeout{5000};
  std::chrono::milliseconds transferTimeout{10000};
  // The root description fetch, which must not hold up the upload long.
  std::chrono::milliseconds descriptionTimeout{3000};
  std::size_t maxDescriptionBytes = 64 * 1024;
};

// The options of KLibUploadTestUpnpCompatibilityFailResult: the
// configuration's "report_address" and the library's paths.
[[nodiscard]] UploadOptions DefaultUploadOptions();

// The document that would be POSTed for report (with progress and the
// description or the reason there is none). Pure.
[[nodiscard]] std::string UploadDocument(const UpnpTestReport &report,
                                         std::string_view progress,
                                         std::string_view description,
                                         std::string_view descriptionError);

// Sends the last failed test's report. 0 when the report address answered
// 2xx; -1, logged, when no report address is configured, it is not an
// http(s) URL, there is no report or the last test did not fail, or the
// upload fails.
[[nodiscard]] int UploadUpnpTestReport(const UploadOptions &options);

} // namespace zark::portmap

#endif
