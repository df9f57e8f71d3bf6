// Fuzz target of the readers of the kernel's routing table
// (/proc/net/route): ParseDefaultGateway, which gives the gateway the
// library works with, and ParseDefaultRoutes, which router detection checks.
// Besides not crashing:
// - both find the same gateway: the first of the default routes (lowest
//   metric, the first listed of equal ones) is the one ParseDefaultGateway
//   answers, and neither finds one without the other;
// - default routes come lowest metric first and have a gateway.
#include "base/route_table.h"
#include "detect/interface_probe.h"
#include "fuzz_support.h"
#include "syslog_capture.h"

#include <arpa/inet.h>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <vector>

using zark::fuzz::Require;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  // Log lines are captured (tests/support/syslog_capture.h); keep only
  // this input's.
  zark::test::ClearLogs();
  const std::string_view text = zark::fuzz::AsText(data, size);
  const std::optional<uint32_t> gateway =
      zark::portmap::ParseDefaultGateway(text);
  const std::vector<zark::portmap::DefaultRoute> routes =
      zark::portmap::ParseDefaultRoutes(text);

  for (std::size_t i = 0; i < routes.size(); ++i) {
    Require(routes[i].gateway != 0, "a default route without a gateway");
    Require(i == 0 || routes[i - 1].metric <= routes[i].metric,
            "default routes not in metric order");
  }
  Require(gateway.has_value() == !routes.empty(),
          "one reader finds a default route and the other does not");
  if (gateway) {
    Require(*gateway != 0, "gateway 0.0.0.0 answered");
    // ParseDefaultGateway answers network byte order, the routes host order.
    Require(ntohl(*gateway) == routes.front().gateway,
            "the readers answer different gateways");
  }
  return 0;
}
