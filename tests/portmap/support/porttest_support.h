// Shared set-up of the port test suites: the probe service running in the
// test process on 127.0.0.1, rules, the library configuration, free ports.
#ifndef ZARK_TESTS_PORTTEST_PORTTEST_SUPPORT_H
#define ZARK_TESTS_PORTTEST_PORTTEST_SUPPORT_H

#include "connect_back.h"
#include "libzarkportmap.h"
#include "probe_server.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

namespace zark::porttest {

// A port on which nothing of this machine listens now, TCP and UDP.
uint16_t FreePort();
// The first of `count` consecutive such ports.
uint16_t FreePortRun(int count);

// A rule record; enable given.
ZARK_ROUTER_RULE Rule(const std::string &id, const std::string &protocol,
                      const std::string &routerPort, const std::string &dsPort,
                      bool enable = true);

// Sets a key of the library configuration (/etc/portforward/portmap.conf).
void SetLibraryConfig(const std::string &key, const std::string &value);

// The probe service on 127.0.0.1 (a free port), checks made by connectBack
// (null: the real socket checks with short timeouts), limits as given.
class LoopbackProbe {
public:
  explicit LoopbackProbe(probe::ConnectBack *connectBack = nullptr,
                         probe::ServerOptions options = DefaultOptions());
  ~LoopbackProbe();
  LoopbackProbe(const LoopbackProbe &) = delete;
  LoopbackProbe &operator=(const LoopbackProbe &) = delete;

  [[nodiscard]] bool Running() const { return mPort != 0; }
  [[nodiscard]] uint16_t Port() const { return mPort; }
  // "127.0.0.1:<port>", the library configuration's form.
  [[nodiscard]] std::string Address() const;
  [[nodiscard]] probe::ServerCounters Counters() const {
    return mServer->Counters();
  }

  static probe::ServerOptions DefaultOptions();

private:
  probe::SocketConnectBack mReal;
  std::unique_ptr<probe::ProbeServer> mServer;
  uint16_t mPort = 0;
};

// The socket checks with timeouts short enough for unit tests.
probe::CheckTimeouts ShortTimeouts();

} // namespace zark::porttest

#endif
