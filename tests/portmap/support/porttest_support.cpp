#include "porttest_support.h"

#include "klibc.h"

#include <gtest/gtest.h>

#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstring>

namespace zark::porttest {
namespace {

bool Bindable(int type, uint16_t port) {
  int fd = ::socket(AF_INET, type | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    return false;
  }
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  bool ok =
      ::bind(fd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) == 0;
  ::close(fd);
  return ok;
}

} // namespace

uint16_t FreePort() {
  for (int attempt = 0; attempt < 100; ++attempt) {
    int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
      continue;
    }
    sockaddr_in address{};
    address.sin_family = AF_INET;
    socklen_t length = sizeof(address);
    bool bound =
        ::bind(fd, reinterpret_cast<sockaddr *>(&address), length) == 0 &&
        ::getsockname(fd, reinterpret_cast<sockaddr *>(&address), &length) == 0;
    ::close(fd);
    const uint16_t port = ntohs(address.sin_port);
    // The compatibility test maps upwards from a port: leave room below
    // 65000.
    if (bound && port < 60000 && Bindable(SOCK_STREAM, port) &&
        Bindable(SOCK_DGRAM, port)) {
      return port;
    }
  }
  ADD_FAILURE() << "no free port";
  return 0;
}

uint16_t FreePortRun(int count) {
  for (int attempt = 0; attempt < 100; ++attempt) {
    const uint16_t first = FreePort();
    bool free = first != 0;
    for (int i = 1; i < count && free; ++i) {
      free = Bindable(SOCK_STREAM, static_cast<uint16_t>(first + i)) &&
             Bindable(SOCK_DGRAM, static_cast<uint16_t>(first + i));
    }
    if (free) {
      return first;
    }
  }
  ADD_FAILURE() << "no run of " << count << " free ports";
  return 0;
}

ZARK_ROUTER_RULE Rule(const std::string &id, const std::string &protocol,
                      const std::string &routerPort, const std::string &dsPort,
                      bool enable) {
  ZARK_ROUTER_RULE rule{};
  std::strncpy(rule.rule_id, id.c_str(), sizeof(rule.rule_id) - 1);
  rule.enable = enable ? 1 : 0;
  std::strncpy(rule.router_protocol, protocol.c_str(),
               sizeof(rule.router_protocol) - 1);
  std::strncpy(rule.router_port, routerPort.c_str(),
               sizeof(rule.router_port) - 1);
  std::strncpy(rule.ds_port, dsPort.c_str(), sizeof(rule.ds_port) - 1);
  return rule;
}

void SetLibraryConfig(const std::string &key, const std::string &value) {
  ASSERT_EQ(0, KLIBCFileSetKeyValue(ZARK_PORTMAP_CONF_DIR "/portmap.conf",
                                    key.c_str(), value.c_str(), 0));
}

probe::CheckTimeouts ShortTimeouts() {
  return {std::chrono::milliseconds(1000), std::chrono::milliseconds(500)};
}

probe::ServerOptions LoopbackProbe::DefaultOptions() {
  probe::ServerOptions options;
  options.listen = {"127.0.0.1:0"};
  options.ratePerSecond = 1000;
  options.burst = 1000;
  options.maxSessionsPerAddress = 32;
  return options;
}

LoopbackProbe::LoopbackProbe(probe::ConnectBack *connectBack,
                             probe::ServerOptions options)
    : mReal(ShortTimeouts()) {
  mServer = std::make_unique<probe::ProbeServer>(
      std::move(options), connectBack != nullptr ? *connectBack : mReal);
  std::string error;
  if (!mServer->Start(error)) {
    ADD_FAILURE() << "probe service: " << error;
    return;
  }
  mPort = mServer->Ports().at(0);
}

LoopbackProbe::~LoopbackProbe() {
  mServer->Stop();
}

std::string LoopbackProbe::Address() const {
  return "127.0.0.1:" + std::to_string(mPort);
}

} // namespace zark::porttest
