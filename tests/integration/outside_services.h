// Services on the outside host of the test network (testnet.sh's outside
// namespace, 1.2.3.2) that router detection needs from "the internet": a
// name server on UDP port 53 that answers one name with one address (and
// NXDOMAIN for every other name), and a TCP listener that accepts
// connections (the WAN probe host). They run in a child process that
// enters the outside namespace; the test process stays where it is.
//
// The child stops when the object is destroyed, when the test process
// ends (it watches a pipe), and at the latest after maxLifetime.
#ifndef ZARK_TESTS_INTEGRATION_OUTSIDE_SERVICES_H
#define ZARK_TESTS_INTEGRATION_OUTSIDE_SERVICES_H

#include "test_network.h"

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <string>

namespace zark::integration {

class OutsideServices {
public:
  // name is answered with address (dotted quad); tcpPort accepts.
  OutsideServices(const zark::testnet::TestNetwork &network, std::string name,
                  const std::string &address, uint16_t tcpPort,
                  std::chrono::seconds maxLifetime = std::chrono::seconds(120));
  ~OutsideServices();
  OutsideServices(const OutsideServices &) = delete;
  OutsideServices &operator=(const OutsideServices &) = delete;

  // True once both services listen.
  [[nodiscard]] bool Running() const { return mRunning; }
  // Why they do not, when they do not.
  [[nodiscard]] const std::string &Why() const { return mWhy; }

private:
  void Stop();

  std::string mName;
  pid_t mPid = -1;
  int mStopWrite = -1;
  bool mRunning = false;
  std::string mWhy;
};

} // namespace zark::integration

#endif
