// A temporary listener on a local port that proves, to the probe service,
// that a path from outside really ends at this server: every TCP connection
// gets "<token>\n"; every UDP datagram "zark-probe <nonce>\n" gets
// "<token> <nonce>\n" (probe/README.md). Other datagrams get nothing, so the
// listener cannot be used to reflect traffic at anyone.
//
// It listens on every local address (the router forwards to our LAN
// address) and serves on a thread of its own until it is destroyed; the
// destructor stops and joins it.
#ifndef ZARK_PORTMAP_TOKEN_LISTENER_H
#define ZARK_PORTMAP_TOKEN_LISTENER_H

#include "base/port_mapping.h"
#include "base/unique_fd.h"

#include <atomic>
#include <cstdint>
#include <string>
#include <string_view>
#include <thread>

namespace zark::portmap {

// A fresh one-time token: 32 hexadecimal digits from getrandom. Empty,
// logged, when the kernel gives no random bytes.
[[nodiscard]] std::string NewProbeToken();

// The answer of a listener holding token to one UDP datagram, or nothing
// (empty) when the datagram is not a probe's. Pure.
[[nodiscard]] std::string UdpListenerAnswer(std::string_view token,
                                            std::string_view datagram);

class TokenListener {
public:
  enum class OpenResult {
    kOpen,      // listening
    kPortInUse, // something of this server already listens there
    kFailed,    // any other failure (logged)
  };

  TokenListener() = default;
  TokenListener(const TokenListener &) = delete;
  TokenListener &operator=(const TokenListener &) = delete;
  ~TokenListener();

  // Binds protocol/port on every local address and starts answering with
  // token (1..64 characters of [A-Za-z0-9_-]). Once only.
  [[nodiscard]] OpenResult Open(IpProtocol protocol, uint16_t port,
                                std::string token);
  // Connections or probe datagrams answered so far.
  [[nodiscard]] int Answered() const { return mAnswered.load(); }
  [[nodiscard]] const std::string &Token() const { return mToken; }

private:
  void Serve();

  IpProtocol mProtocol = IpProtocol::kTcp;
  std::string mToken;
  UniqueFd mFd;
  UniqueFd mWakeFd;
  std::atomic<int> mAnswered{0};
  std::thread mThread;
};

} // namespace zark::portmap

#endif
