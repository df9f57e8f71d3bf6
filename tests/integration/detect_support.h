// Router detection in the test network: pointing the library at the
// outside host (WAN probe host, name server), installing the
// zarkportforward tool where the module runs it, and running a real
// detection. Used by the integration tests and the detection benchmark;
// everything here writes only inside the private mount namespace.
#ifndef ZARK_TESTS_INTEGRATION_DETECT_SUPPORT_H
#define ZARK_TESTS_INTEGRATION_DETECT_SUPPORT_H

#include "libzarkportmap.h"
#include "test_network.h"

#include <cstdint>
#include <string>

namespace zark::integration {

// The name the outside name server answers (with the outside host's
// address) and the port its WAN probe listener accepts on.
inline constexpr char kDetectProbeName[] = "probe.zark.test";
inline constexpr uint16_t kWanProbePort = 443;

// Where the module runs the tool, and what the recording wrapper leaves.
inline constexpr char kPortForwardTool[] = "/usr/zark/bin/zarkportforward";
inline constexpr char kToolSeenConf[] = "/tmp/zarkportforward.seen.conf";
inline constexpr char kToolStatus[] = "/tmp/zarkportforward.status";

// Writes the library configuration (wan_probe_hosts = the outside host on
// kWanProbePort, dns_probe_name = kDetectProbeName) and /etc/resolv.conf
// (the outside host as the only name server). False, with why, outside
// the private mount namespace or when a file cannot be written.
[[nodiscard]] bool ConfigureDetection(const zark::testnet::TestNetwork &network,
                                      std::string &why);

// Installs the tool built at toolPath as kPortForwardTool. With record,
// kPortForwardTool is a wrapper that first copies the router configuration
// stored for gateway to kToolSeenConf, then runs the real tool and writes
// its exit status to kToolStatus.
[[nodiscard]] bool InstallPortForwardTool(const std::string &toolPath,
                                          bool record,
                                          const std::string &gateway,
                                          std::string &why);

// Configures detection, starts the outside services and runs
// KLibDetectRouter(result, no callback, flag true): the library keeps the
// result. Returns its result; -2 (why set) when the set-up failed.
[[nodiscard]] int DetectInTestNetwork(const zark::testnet::TestNetwork &network,
                                      ZARK_ROUTER_DETECT_RESULT &result,
                                      std::string &why);

} // namespace zark::integration

#endif
