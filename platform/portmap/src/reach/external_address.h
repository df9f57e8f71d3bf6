// The server's external IPv4 address (ZARKIGetExternalIP): what the router
// at the default gateway reports as its outside address, asked with the
// protocol of the stored router configuration, or, when none is stored or
// it does not answer, with a quick UPnP and NAT-PMP probe (router_probe.h).
// When the router will not tell, or tells a private address (it sits
// behind another NAT, so its address is not the one the internet sees),
// the probe service named by "probe_service_address" is asked
// (ExternalAddressFromProbeService, probe_client.h).
#ifndef ZARK_PORTMAP_EXTERNAL_ADDRESS_H
#define ZARK_PORTMAP_EXTERNAL_ADDRESS_H

#include "detect/router_probe.h"
#include "drivers/router_driver.h"
#include "libzarkportmap.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace zark::portmap {

struct ExternalAddressEnvironment {
  // The default gateway (KLibGetGatewayIP); nothing when there is none.
  std::function<std::optional<std::string>()> gateway;
  // The router configuration stored for gateway; nothing when none is.
  std::function<std::optional<ZARK_ROUTER_CONF>(const std::string &gateway)>
      storedConf;
  // A driver for protocol ("upnp", "natpmp") at gateway (MakeRouter).
  std::function<std::unique_ptr<RouterDriver>(RouterProtocol protocol,
                                              const std::string &gateway)>
      makeRouter;
  // The quick probe used when the configuration does not say or its
  // protocol does not answer.
  std::unique_ptr<RouterProbes> probes;
  // The library configuration: GetLibraryConfig(key, fallback).
  std::function<std::string(std::string_view key, std::string_view fallback)>
      config;
  // Asks the probe service at "host:port" (ExternalAddressFromProbeService).
  std::function<std::optional<uint32_t>(const std::string &serviceAddress)>
      probeService;
};

[[nodiscard]] ExternalAddressEnvironment MakeSystemExternalAddressEnvironment();

// The external address in host byte order; nothing when unknown. Every
// source that fails says why in the log.
[[nodiscard]] std::optional<uint32_t>
FindExternalAddress(ExternalAddressEnvironment &environment);

// Test seam: the environment ZARKIGetExternalIP uses (nothing: the
// system's).
void SetExternalAddressEnvironmentFactoryForTesting(
    std::function<ExternalAddressEnvironment()> factory);

} // namespace zark::portmap

#endif
