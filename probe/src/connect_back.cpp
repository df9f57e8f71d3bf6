#include "connect_back.h"

#include "klibc_fd.h"
#include "klibc_file.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>

#include <cerrno>
#include <cstring>

namespace zark::probe {

using klibc::UniqueFd;
namespace {

using Clock = std::chrono::steady_clock;

// Waits for events on fd until deadline. 1: ready (revents set), 0: the
// deadline passed, -1: poll failed.
int WaitFor(int fd, short events, Clock::time_point deadline, short &revents) {
  for (;;) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - Clock::now());
    if (left.count() <= 0) {
      return 0;
    }
    pollfd watched{fd, events, 0};
    int ready = ::poll(&watched, 1, static_cast<int>(left.count()));
    if (ready > 0) {
      revents = watched.revents;
      return 1;
    }
    if (ready < 0 && errno != EINTR) {
      return -1;
    }
  }
}

const char *ConnectErrorReason(int error) {
  switch (error) {
  case ECONNREFUSED:
    return reason::kRefused;
  case EHOSTUNREACH:
  case ENETUNREACH:
  case EACCES:
  case EPERM:
    return reason::kNoRoute;
  case ETIMEDOUT:
    return reason::kTimeout;
  default:
    return reason::kLocalError;
  }
}

// 16 hexadecimal digits. Should the kernel give no randomness, the nonce is
// all zeros rather than no nonce: the answer is then merely guessable.
std::string RandomNonce() {
  return klibc::RandomHex(8).value_or(std::string(16, '0'));
}

} // namespace

bool MakeTarget(const sockaddr_storage &requester, socklen_t length,
                uint16_t port, Target &target) {
  target = Target{};
  if (requester.ss_family == AF_INET &&
      length >= static_cast<socklen_t>(sizeof(sockaddr_in))) {
    sockaddr_in address{};
    std::memcpy(&address, &requester, sizeof(address));
    sockaddr_in out{};
    out.sin_family = AF_INET;
    out.sin_addr = address.sin_addr;
    out.sin_port = htons(port);
    std::memcpy(&target.address, &out, sizeof(out));
    target.length = sizeof(out);
    return true;
  }
  if (requester.ss_family == AF_INET6 &&
      length >= static_cast<socklen_t>(sizeof(sockaddr_in6))) {
    sockaddr_in6 address{};
    std::memcpy(&address, &requester, sizeof(address));
    sockaddr_in6 out{};
    out.sin6_family = AF_INET6;
    out.sin6_addr = address.sin6_addr;
    out.sin6_scope_id = address.sin6_scope_id;
    out.sin6_port = htons(port);
    std::memcpy(&target.address, &out, sizeof(out));
    target.length = sizeof(out);
    return true;
  }
  return false;
}

std::string AddressText(const sockaddr_storage &address, socklen_t length) {
  char text[INET6_ADDRSTRLEN] = {};
  if (address.ss_family == AF_INET &&
      length >= static_cast<socklen_t>(sizeof(sockaddr_in))) {
    sockaddr_in v4{};
    std::memcpy(&v4, &address, sizeof(v4));
    if (::inet_ntop(AF_INET, &v4.sin_addr, text, sizeof(text)) != nullptr) {
      return text;
    }
  } else if (address.ss_family == AF_INET6 &&
             length >= static_cast<socklen_t>(sizeof(sockaddr_in6))) {
    sockaddr_in6 v6{};
    std::memcpy(&v6, &address, sizeof(v6));
    if (IN6_IS_ADDR_V4MAPPED(&v6.sin6_addr)) {
      if (::inet_ntop(AF_INET, &v6.sin6_addr.s6_addr[12], text, sizeof(text)) !=
          nullptr) {
        return text;
      }
    } else if (::inet_ntop(AF_INET6, &v6.sin6_addr, text, sizeof(text)) !=
               nullptr) {
      return text;
    }
  }
  return {};
}

std::string UdpProbeDatagram(std::string_view nonce) {
  return "zark-probe " + std::string(nonce) + "\n";
}

std::string UdpTokenAnswer(std::string_view token, std::string_view nonce) {
  return std::string(token) + " " + std::string(nonce) + "\n";
}

Verdict SocketConnectBack::Check(const sockaddr_storage &requester,
                                 socklen_t length, const Request &request) {
  Target target;
  if (request.kind != Request::Kind::kCheck ||
      !MakeTarget(requester, length, request.port, target)) {
    return {Result::kUnknown, reason::kLocalError};
  }
  return request.transport == Transport::kTcp ? CheckTcp(target, request.token)
                                              : CheckUdp(target, request.token);
}

Verdict SocketConnectBack::CheckTcp(const Target &target,
                                    const std::string &token) const {
  UniqueFd fd(::socket(target.address.ss_family,
                       SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
  if (!fd.Valid()) {
    return {Result::kUnknown, reason::kLocalError};
  }
  const Clock::time_point connectDeadline = Clock::now() + mTimeouts.connect;
  if (::connect(fd.Get(), reinterpret_cast<const sockaddr *>(&target.address),
                target.length) != 0) {
    if (errno != EINPROGRESS) {
      const char *why = ConnectErrorReason(errno);
      return {why == reason::kLocalError ? Result::kUnknown
                                         : Result::kUnreachable,
              why};
    }
    short revents = 0;
    int ready = WaitFor(fd.Get(), POLLOUT, connectDeadline, revents);
    if (ready == 0) {
      return {Result::kUnreachable, reason::kTimeout};
    }
    if (ready < 0) {
      return {Result::kUnknown, reason::kLocalError};
    }
    int error = 0;
    socklen_t errorLength = sizeof(error);
    if (::getsockopt(fd.Get(), SOL_SOCKET, SO_ERROR, &error, &errorLength) !=
        0) {
      return {Result::kUnknown, reason::kLocalError};
    }
    if (error != 0) {
      const char *why = ConnectErrorReason(error);
      return {why == reason::kLocalError ? Result::kUnknown
                                         : Result::kUnreachable,
              why};
    }
  }
  if (token.empty()) {
    return {Result::kReachable, reason::kConnected};
  }
  // "<token>\n", nothing else.
  const Clock::time_point answerDeadline = Clock::now() + mTimeouts.answer;
  std::string line;
  char buffer[kMaxTokenLine];
  while (line.find('\n') == std::string::npos) {
    short revents = 0;
    int ready = WaitFor(fd.Get(), POLLIN, answerDeadline, revents);
    if (ready == 0) {
      return {Result::kUnreachable, reason::kSilent};
    }
    if (ready < 0) {
      return {Result::kUnknown, reason::kLocalError};
    }
    ssize_t n = ::recv(fd.Get(), buffer, sizeof(buffer), 0);
    if (n < 0) {
      if (errno == EINTR || errno == EAGAIN) {
        continue;
      }
      return {Result::kUnreachable, reason::kClosed};
    }
    if (n == 0) {
      return {Result::kUnreachable,
              line.empty() ? reason::kClosed : reason::kWrongAnswer};
    }
    line.append(buffer, static_cast<std::size_t>(n));
    if (line.size() > kMaxTokenLine) {
      return {Result::kUnreachable, reason::kWrongAnswer};
    }
  }
  line.resize(line.find('\n'));
  if (!line.empty() && line.back() == '\r') {
    line.pop_back();
  }
  return line == token ? Verdict{Result::kReachable, reason::kTokenMatched}
                       : Verdict{Result::kUnreachable, reason::kWrongAnswer};
}

Verdict SocketConnectBack::CheckUdp(const Target &target,
                                    const std::string &token) const {
  UniqueFd fd(::socket(target.address.ss_family,
                       SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
  if (!fd.Valid()) {
    return {Result::kUnknown, reason::kLocalError};
  }
  // A connected UDP socket only receives from the target and reports its
  // ICMP port-unreachable as ECONNREFUSED.
  if (::connect(fd.Get(), reinterpret_cast<const sockaddr *>(&target.address),
                target.length) != 0) {
    const char *why = ConnectErrorReason(errno);
    return {why == reason::kLocalError ? Result::kUnknown
                                       : Result::kUnreachable,
            why};
  }
  const std::string nonce = RandomNonce();
  const std::string datagram = UdpProbeDatagram(nonce);
  const std::string expected = UdpTokenAnswer(token, nonce);
  const Clock::time_point deadline = Clock::now() + mTimeouts.answer;
  constexpr int kSends = 4;
  const auto interval = mTimeouts.answer / kSends;
  bool wrongAnswer = false;
  for (int send = 0; send < kSends; ++send) {
    if (::send(fd.Get(), datagram.data(), datagram.size(), MSG_NOSIGNAL) < 0) {
      if (errno == ECONNREFUSED) {
        return {Result::kUnreachable, reason::kRefused};
      }
      if (errno == EHOSTUNREACH || errno == ENETUNREACH) {
        return {Result::kUnreachable, reason::kNoRoute};
      }
      return {Result::kUnknown, reason::kLocalError};
    }
    const Clock::time_point resend =
        send + 1 == kSends ? deadline
                           : std::min(deadline, Clock::now() + interval);
    for (;;) {
      short revents = 0;
      int ready = WaitFor(fd.Get(), POLLIN, resend, revents);
      if (ready == 0) {
        break;
      }
      if (ready < 0) {
        return {Result::kUnknown, reason::kLocalError};
      }
      char buffer[kMaxTokenLine + 32];
      ssize_t n = ::recv(fd.Get(), buffer, sizeof(buffer), 0);
      if (n < 0) {
        if (errno == EINTR || errno == EAGAIN) {
          continue;
        }
        if (errno == ECONNREFUSED) {
          return {Result::kUnreachable, reason::kRefused};
        }
        if (errno == EHOSTUNREACH || errno == ENETUNREACH) {
          return {Result::kUnreachable, reason::kNoRoute};
        }
        return {Result::kUnknown, reason::kLocalError};
      }
      if (token.empty()) {
        return {Result::kReachable, reason::kReplied};
      }
      if (std::string_view(buffer, static_cast<std::size_t>(n)) == expected) {
        return {Result::kReachable, reason::kTokenMatched};
      }
      // Something else answers there; keep listening for our listener
      // until the deadline, then say so.
      wrongAnswer = true;
    }
    if (Clock::now() >= deadline) {
      break;
    }
  }
  if (wrongAnswer) {
    return {Result::kUnreachable, reason::kWrongAnswer};
  }
  return token.empty() ? Verdict{Result::kUnknown, reason::kNoAnswer}
                       : Verdict{Result::kUnreachable, reason::kTimeout};
}

} // namespace zark::probe
