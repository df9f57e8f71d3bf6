// Fuzz target of the resolv.conf reader of router detection
// (ParseResolvConf). Besides not crashing: at most kMaxNameServers servers,
// each an address text that inet_pton takes as IPv4 or IPv6 (so nothing
// else reaches the socket code), without a scope.
#include "detect/dns_probe.h"
#include "fuzz_support.h"
#include "syslog_capture.h"

#include <arpa/inet.h>

#include <cstddef>
#include <cstdint>
#include <string>

using zark::fuzz::Require;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  // Log lines are captured (tests/support/syslog_capture.h); keep only
  // this input's.
  zark::test::ClearLogs();
  const std::vector<std::string> servers =
      zark::portmap::ParseResolvConf(zark::fuzz::AsText(data, size));
  Require(servers.size() <= zark::portmap::kMaxNameServers,
          "more name servers than the bound");
  for (const std::string &server : servers) {
    unsigned char address[16];
    Require(inet_pton(AF_INET, server.c_str(), address) == 1 ||
                inet_pton(AF_INET6, server.c_str(), address) == 1,
            "a name server that is not an address: [" + server + "]");
    Require(server.find('%') == std::string::npos, "a scoped address kept");
  }
  return 0;
}
