// NAT-PMP (RFC 6886) over libnatpmp: the router's public address, mapping
// and unmapping ports. The only file that includes <natpmp.h> is
// natpmp.cpp.
//
// libnatpmp retries a request nine times over about two minutes. Here each
// request is sent at most `tries` times, waiting firstWait, then twice as
// long each time (250 + 500 + 1000 + 2000 ms = 3.75 s by default), polling
// the socket with our own deadline; libnatpmp's own retry is pushed out of
// the way. NAT-PMP has no way to read the router's table: GetSpecific and
// List answer kUnsupported, and a mapping is confirmed by the router's
// reply itself (the public port it granted).
#ifndef ZARK_PORTMAP_NATPMP_H
#define ZARK_PORTMAP_NATPMP_H

#include "drivers/router_driver.h"

#include <chrono>
#include <cstdint>
#include <memory>
#include <string>

namespace zark::portmap {

struct NatPmpOptions {
  std::string gateway;  // dotted quad: the router asked
  uint16_t port = 5351; // NAT-PMP's port (NATPMP_PORT); tests use another
  std::chrono::milliseconds firstWait{250};
  int tries = 4;
  // Lifetime asked for a mapping; RFC 6886 recommends two hours.
  uint32_t lifetimeSeconds = 7200;
};

class NatPmpRouter final : public RouterDriver {
public:
  explicit NatPmpRouter(NatPmpOptions options);
  ~NatPmpRouter() override;

  [[nodiscard]] RouterProtocol Protocol() const override {
    return RouterProtocol::kNatPmp;
  }
  [[nodiscard]] RouterResult Open() override;
  [[nodiscard]] std::string Location() const override;
  [[nodiscard]] RouterResult
  AddPortMapping(const PortMapping &mapping) override;
  [[nodiscard]] RouterResult
  DeletePortMapping(const PortMapping &mapping) override;
  [[nodiscard]] RouterResult
  GetSpecificPortMapping(IpProtocol protocol, uint16_t externalPort,
                         RouterMapping &entry) override;
  [[nodiscard]] RouterResult
  ListMappings(std::vector<RouterMapping> &entries) override;
  [[nodiscard]] RouterResult GetExternalAddress(std::string &address) override;
  [[nodiscard]] ZARK_FAILURE_KIND
  FailureKind(const RouterResult &result) const override;
  // Every try's wait: firstWait, doubled each time.
  [[nodiscard]] int AnswerDeadlineSeconds() const override;
  [[nodiscard]] bool FiniteLeases() const override { return true; }

private:
  struct Session;
  NatPmpOptions mOptions;
  std::unique_ptr<Session> mSession;
};

} // namespace zark::portmap

#endif
