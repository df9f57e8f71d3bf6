// The UPnP compatibility test (KLibTestUpnpCompatibility,
// KLibStopTestUpnpCompatibility): does the router configured for the
// gateway add, hold, delete and re-add port mappings through UPnP IGD, how
// many does its table take, and do they really open and close the port as
// seen from outside (the probe service, probe_client.h)?
//
// Stages, each written to the progress file /tmp/upnp_test.progress (a
// key/value file, every update through KLIBCFileSetKeyValue, which replaces
// the file atomically) as it runs:
//
//   upnp_init               processing -> success | failed
//       gateway, router configuration (must be UPnP), probe service, the
//       router's UPnP service, free ports, the listener for the outside
//       checks
//   upnp_add                processing -> finished | failed
//       one TCP mapping (the connection-check port), confirmed held
//   upnp_max                "1", "2", ... the number of mappings held while
//       the table fills up to the asked number; at the end the number the
//       router took, or "-1" when it failed (stopped answering, lost
//       mappings it had confirmed). A router that refuses a mapping (728,
//       606, ...) or answers success without holding it has reached its
//       limit: that is the number, not a failure.
//   upnp_delete             processing -> finished | failed
//       every mapping deleted, and confirmed gone
//   upnp_connection_failed  processing -> success | failed
//       the probe service finds the deleted port closed
//   upnp_readd1             processing -> success | failed
//       the deleted mapping added again
//   upnp_readd2             processing -> finished | failed
//       and added once more over itself (how a renewal reaches the router)
//   upnp_connection_success processing -> success | failed
//       the probe service reaches the re-added port (with a one-time token
//       from our temporary listener, so the path is proven end to end)
//   upnp_terminal           finished, once the test has ended and cleaned up
//
// The first failing stage ends the test; its key is "failed" (upnp_max
// "-1"; a failed init also marks upnp_add "failed", because a reader looks
// at upnp_add first). Whatever happens, every mapping the test made is
// deleted before it returns; when the router cannot be reached for that,
// the mappings stay listed in the run file and are removed by the next test
// or by KLibStopTestUpnpCompatibility. Mappings are only deleted when the
// router lists them with our description and our address.
//
// The test holds the system-wide port-map lock (KLibZarkPortMapLock) while
// it runs, so that no rule save changes the router's table meanwhile, and
// asks for finite leases (one hour), so that its mappings run out even if
// every cleanup failed.
//
// Stopping from another process: KLibStopTestUpnpCompatibility writes the
// running test's id into the stop file; the test looks for it between any
// two router requests and in every probe wait, fails the current stage with
// ZARK_UPNP_TEST_ERR_STOPPED, cleans up and ends. While the test runs,
// KLibGetLibZarkPortMapRunningTask answers ZARK_PORTMAP_TASK_UPNP_TEST
// (running_task.h).
#ifndef ZARK_PORTMAP_COMPAT_COMPATIBILITY_TEST_H
#define ZARK_PORTMAP_COMPAT_COMPATIBILITY_TEST_H

#include "base/running_task.h"
#include "catalog/mapping_state.h"
#include "compat/compatibility_files.h"
#include "drivers/driver_choice.h"
#include "drivers/router_driver.h"
#include "libzarkportmap.h"
#include "reach/probe_client.h"

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

// Keys and values of the progress file.
namespace upnp_test_key {
inline constexpr const char *kInit = "upnp_init";
inline constexpr const char *kAdd = "upnp_add";
inline constexpr const char *kMax = "upnp_max";
inline constexpr const char *kDelete = "upnp_delete";
inline constexpr const char *kConnectionFailed = "upnp_connection_failed";
inline constexpr const char *kReadd1 = "upnp_readd1";
inline constexpr const char *kReadd2 = "upnp_readd2";
inline constexpr const char *kConnectionSuccess = "upnp_connection_success";
inline constexpr const char *kTerminal = "upnp_terminal";
} // namespace upnp_test_key
namespace upnp_test_value {
inline constexpr const char *kProcessing = "processing";
inline constexpr const char *kFinished = "finished";
inline constexpr const char *kSuccess = "success";
inline constexpr const char *kFailed = "failed";
} // namespace upnp_test_value

// The run file: what a running (or killed) test may have left on the
// router. JSON:
//   {"version": 1, "run_id": "4f1c...", "pid": 1234,
//    "gateway": "192.168.1.1", "location": "http://192.168.1.1:5000/x.xml",
//    "client": "192.168.1.10", "ports": [30500, 30501]}
// ports: TCP router ports the test may have mapped (to client, same port).
struct UpnpTestRun {
  std::string runId;
  long pid = 0;
  std::string gateway;
  std::string location;
  std::string client;
  std::vector<uint16_t> ports;
  friend bool operator==(const UpnpTestRun &, const UpnpTestRun &) = default;
};
[[nodiscard]] std::string SerializeUpnpTestRun(const UpnpTestRun &run);
// Strict; false with why set for anything else. Never throws.
[[nodiscard]] bool ParseUpnpTestRun(std::string_view text, UpnpTestRun &run,
                                    std::string &why) noexcept;

struct UpnpTestEnvironment {
  // The default gateway; nothing when there is none.
  std::function<std::optional<std::string>()> gateway;
  std::function<bool(const std::string &gateway, RouterChoice &choice,
                     int &err)>
      chooseRouter;
  std::function<std::unique_ptr<RouterDriver>(RouterProtocol protocol,
                                              const std::string &gateway,
                                              const RouterRecord *memo)>
      makeRouter;
  // Our address as the router sees it.
  std::function<std::optional<std::string>(const std::string &gateway)>
      localAddress;
  // The outside probe, its waits cut short when cancelled() says so; null,
  // with why set, when there is none.
  std::function<std::unique_ptr<OutsideProbe>(std::string &why,
                                              std::function<bool()> cancelled)>
      makeProbe;
  // The router configuration stored for gateway (brand, model, version
  // of the record); false when none.
  std::function<bool(const std::string &gateway, ZARK_ROUTER_CONF &conf)>
      routerConf;
  // Seconds since 1970, for the record's date.
  std::function<int64_t()> now;
  std::string progressPath = ZARK_PORTMAP_UPNP_TEST_PROGRESS;
  std::string runPath = kUpnpTestRunPath;
  std::string stopPath = kUpnpTestStopPath;
  std::string reportPath = kUpnpTestReportPath;
  std::string runningTaskPath = kRunningTaskPath;
  std::string mappingStatePath = kMappingStatePath;
  // Write the progress file (the callback is called either way).
  bool writeProgress = true;
  uint16_t firstPort = kDefaultUpnpTestFirstPort;
  // The whole test; past it, the test stops as if asked to.
  std::chrono::seconds deadline{900};
  // 718 (port taken) answered this many times in a row ends the filling:
  // some routers answer it for every port once their table is full.
  int conflictsInARow = 8;
};

// The real environment: KLibGetGatewayIP, ChooseRouter, MakeRouter,
// LocalAddressTowards, the configured probe service, the stored router
// configuration, the system clock, the library's paths, and
// "upnp_test_first_port" of the library configuration.
[[nodiscard]] UpnpTestEnvironment DefaultUpnpTestEnvironment();

// Runs the test; see the top of this file. result is reset, then receives
// the progress (0..100) before each callback (callback may be null) and,
// on failure, the error (ZARK_UPNP_TEST_ERR_*, ZARK_PORTMAP_ERR_*); on
// success the router's record (brand, model, version from the router
// configuration, the mappings its table took, the date). 0 on success, -1
// on failure.
[[nodiscard]] int RunUpnpCompatibilityTest(
    int maxMappings, const UpnpTestEnvironment &environment,
    ZARK_ROUTER_TEST_COMPATIBILITY_RESULT &result,
    ZARK_TEST_COMPATIBILITY_PROGRESS_CB callback, void *arg);

// Stops a running test (in any process) and waits, at most wait, until it
// has ended; with no test running, removes what a killed test left on the
// router and marks its unfinished stage "failed" in the progress file.
// 0 done, -1 (logged) when the test did not end in time or leftovers could
// not be removed.
[[nodiscard]] int StopUpnpCompatibilityTest(
    const UpnpTestEnvironment &environment,
    std::chrono::milliseconds wait = std::chrono::seconds(60));

// Removes the mappings a killed test listed in the run file (those the
// router holds with our description and address), then the run file.
// True when nothing is left (also when there was no run file).
[[nodiscard]] bool
CleanUpEarlierUpnpTest(const UpnpTestEnvironment &environment);

} // namespace zark::portmap

#endif
