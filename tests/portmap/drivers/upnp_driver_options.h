// What the UPnP driver tests share: the driver pointed at a fake IGD on
// loopback without discovery, and a TCP mapping to this machine.
#ifndef ZARK_TESTS_PORTMAP_DRIVERS_UPNP_DRIVER_OPTIONS_H
#define ZARK_TESTS_PORTMAP_DRIVERS_UPNP_DRIVER_OPTIONS_H

#include "drivers/upnp.h"
#include "fake_igd.h"

#include <cstdint>
#include <vector>

namespace zark::test {

inline const std::vector<portmap::Ipv4Network> kLoopback = {
    {0x7f000000u, 0xff000000u}};

inline portmap::UpnpOptions OptionsFor(const FakeIgd &igd) {
  portmap::UpnpOptions options;
  options.gateway = "127.0.0.1";
  options.knownRootDescUrls = {igd.RootDescUrl()};
  options.discover = false;
  options.localNetworks = kLoopback;
  return options;
}

inline portmap::PortMapping Tcp(uint16_t external, uint16_t internal) {
  return {portmap::IpProtocol::kTcp, external, internal, "127.0.0.1",
          "zarkportforward test"};
}

} // namespace zark::test

#endif
