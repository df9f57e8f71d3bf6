// Router detection (KLibDetectRouter): six checks in a fixed order, each
// announced to the caller's progress callback as the stage it starts, and
// each bounded in time. A run stops at the first check that fails, with
// enProgress left at that check's stage.
//
//   stage  check                                            file
//    10    starting (only a run that cannot start stops here)
//    20    interface of the default route up, with IPv4     interface_probe.h
//    30    default gateway set (warning: looks wrong)       interface_probe.h
//    40    a WAN probe host answers a TCP connection        wan_probe.h
//    70    hops to the first public address (warnings only) hops_probe.h
//    50    a name server answers a lookup                   dns_probe.h
//    80    the router answers UPnP IGD or NAT-PMP           router_probe.h
//   100    done
//
// The hops check comes before the DNS check although its stage number is
// higher: the numbers are fixed identifiers the callers know.
//
// Every outside dependency reaches the checks through DetectEnvironment, so
// that tests run them against fakes.
#ifndef ZARK_PORTMAP_DETECT_ROUTER_H
#define ZARK_PORTMAP_DETECT_ROUTER_H

#include "detect/dns_probe.h"
#include "detect/hops_probe.h"
#include "detect/interface_probe.h"
#include "detect/router_probe.h"
#include "detect/wan_probe.h"
#include "libzarkportmap.h"

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace zark::portmap {

// Warning flag set beside ZARK_DETECT_WARN_*: the router's outside address
// is itself private (RFC 1918) or carrier-grade NAT space (100.64/10), so
// the router sits behind another NAT. ZARK_DETECT_WARN_HOPS_OVER_ONE is set
// with it, since that is what it means for the path.
inline constexpr uint32_t kDetectWarnDoubleNat = ZARK_DETECT_WARN_DOUBLE_NAT;

// The lock that keeps two detections from running at once, in this
// process or another.
inline constexpr const char *kDetectLockPath =
    ZARK_PORTMAP_CONF_DIR "/detect.lock";

struct DetectLimits {
  std::chrono::milliseconds wanBudget{1500};
  HopLimits hops;
  std::chrono::milliseconds dnsBudget{1500};
};

struct DetectEnvironment {
  std::unique_ptr<NetworkInfoSource> network;
  std::unique_ptr<TcpConnector> connector;
  std::unique_ptr<HopProber> hopProber;
  std::unique_ptr<DnsClient> dns;
  std::unique_ptr<RouterProbes> router;
  // The library configuration: GetLibraryConfig(key, fallback).
  std::function<std::string(std::string_view key, std::string_view fallback)>
      config;
  // The text of /etc/resolv.conf; nothing when it cannot be read.
  std::function<std::optional<std::string>()> resolvConf;
  // The most rules the router database allows for this router (its exact
  // entry, else its model's generic one); 0 when it has none.
  std::function<int32_t(const RouterName &name)> maxRules;
  // "<brand>: <model>(<version>)" of the router configuration stored for
  // gateway; empty when none is stored.
  std::function<std::string(const std::string &gateway)> userSettingName;
  // Times each check for the log.
  std::function<std::chrono::steady_clock::time_point()> now;
  DetectLimits limits;
};

// The machine's own: real sockets, /proc/net/route, getifaddrs,
// /etc/resolv.conf, the library configuration, the router database and the
// router configuration store.
[[nodiscard]] DetectEnvironment MakeSystemDetectEnvironment();

// Runs the checks from stage 20 on (the caller has announced stage 10),
// filling record as they go and calling callback(&record, arg) at each
// stage, 100 included; callback may be null. Returns 0 when every check
// passed (enProgress 100) and -1 when one failed (enProgress at its stage;
// the log says why). Throws only what allocation throws.
[[nodiscard]] int RunDetection(ZARK_ROUTER_DETECT_RESULT &record,
                               ZARK_DETECT_PROGRESS_CB callback, void *arg,
                               DetectEnvironment &environment);

// Test seam: the environment KLibDetectRouter runs in (nothing: the
// system's).
void SetDetectEnvironmentFactoryForTesting(
    std::function<DetectEnvironment()> factory);

} // namespace zark::portmap

#endif
