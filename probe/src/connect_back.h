// Checking a port on the requester's own host. The only address a check
// ever goes to is the one the request connection came from: the server
// hands the peer address of that connection to Check, which replaces its
// port and nothing else.
//
// TCP: connect (bounded by connectTimeout). Without a token, the connection
// itself is the answer. With one, the port must send "<token>\n" within
// answerTimeout.
// UDP: sends "zark-probe <nonce>\n" (a fresh random nonce; again every
// quarter of answerTimeout, four times at most). With a token, the answer
// must be "<token> <nonce>\n": proof that the datagram reached the
// requester's own listener and that its answer came back. Without a token,
// any answer will do, and silence means "cannot tell".
#ifndef ZARK_PROBE_CONNECT_BACK_H
#define ZARK_PROBE_CONNECT_BACK_H

#include "probe_protocol.h"

#include <sys/socket.h>

#include <chrono>
#include <string>

namespace zark::probe {

struct CheckTimeouts {
  std::chrono::milliseconds connect{3000};
  std::chrono::milliseconds answer{2000};
};

// The requester's address with another port. Only the address part of
// requester (AF_INET or AF_INET6) is kept.
struct Target {
  sockaddr_storage address{};
  socklen_t length = 0;
};
// False for an address family other than AF_INET / AF_INET6.
[[nodiscard]] bool MakeTarget(const sockaddr_storage &requester,
                              socklen_t length, uint16_t port, Target &target);

// The address part of a socket address as text ("203.0.113.5", "2001:db8::1";
// an IPv4-mapped IPv6 address is shown as IPv4). Empty when unknown.
[[nodiscard]] std::string AddressText(const sockaddr_storage &address,
                                      socklen_t length);

class ConnectBack {
public:
  ConnectBack() = default;
  ConnectBack(const ConnectBack &) = delete;
  ConnectBack &operator=(const ConnectBack &) = delete;
  virtual ~ConnectBack() = default;

  // Checks request.port (request.transport, request.token) on the host of
  // requester, the peer address of the request's connection. Bounded by the
  // implementation's timeouts. Called from several sessions at once.
  [[nodiscard]] virtual Verdict Check(const sockaddr_storage &requester,
                                      socklen_t length,
                                      const Request &request) = 0;
};

class SocketConnectBack final : public ConnectBack {
public:
  explicit SocketConnectBack(CheckTimeouts timeouts) : mTimeouts(timeouts) {}
  [[nodiscard]] Verdict Check(const sockaddr_storage &requester,
                              socklen_t length,
                              const Request &request) override;

private:
  Verdict CheckTcp(const Target &target, const std::string &token) const;
  Verdict CheckUdp(const Target &target, const std::string &token) const;

  CheckTimeouts mTimeouts;
};

// The datagram a UDP check sends and the answer a listener holding token
// gives to it. Shared with the tests and with the client library's
// temporary listener, which implements the other side.
[[nodiscard]] std::string UdpProbeDatagram(std::string_view nonce);
[[nodiscard]] std::string UdpTokenAnswer(std::string_view token,
                                         std::string_view nonce);

} // namespace zark::probe

#endif
