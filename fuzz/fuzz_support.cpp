#include "fuzz_support.h"

#include "hermetic.h"

#include <arpa/inet.h>
#include <net/if.h>
#include <netinet/in.h>
#include <poll.h>
#include <sched.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace zark::fuzz {

void Broken(const std::string &what) {
  std::fprintf(stderr, "broken promise: %s\n", what.c_str());
  std::fflush(stderr);
  std::abort();
}

uint8_t InputReader::Byte() {
  if (mRest.empty()) {
    return 0;
  }
  const auto byte = static_cast<uint8_t>(mRest.front());
  mRest.remove_prefix(1);
  return byte;
}

uint16_t InputReader::Uint16() {
  const uint16_t high = Byte();
  return static_cast<uint16_t>((high << 8) | Byte());
}

std::string_view InputReader::Piece(std::string_view separator) {
  const std::size_t at = mRest.find(separator);
  if (at == std::string_view::npos) {
    return Rest();
  }
  std::string_view piece = mRest.substr(0, at);
  mRest.remove_prefix(at + separator.size());
  return piece;
}

std::string_view InputReader::Rest() {
  std::string_view rest = mRest;
  mRest = {};
  return rest;
}

std::vector<std::string_view> SplitPieces(std::string_view text) {
  std::vector<std::string_view> pieces;
  InputReader reader(text);
  while (!reader.Empty()) {
    pieces.push_back(reader.Piece(kPieceSeparator));
  }
  return pieces;
}

void EnterHermeticOrDie() {
  std::string error;
  if (!zark::test::EnterPrivateMountNamespace(&error)) {
    std::fprintf(stderr,
                 "cannot enter a private mount namespace (%s); this fuzz "
                 "target needs root and must not touch the machine's own "
                 "files\n",
                 error.c_str());
    std::exit(2);
  }
}

void EnterPrivateNetworkOrDie() {
  if (unshare(CLONE_NEWNET) != 0) {
    std::fprintf(stderr,
                 "cannot enter a private network namespace (unshare: %s); "
                 "this fuzz target needs root\n",
                 std::strerror(errno));
    std::exit(2);
  }
  // A new network namespace has loopback only, and down.
  const int fd = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  ifreq request{};
  std::strncpy(request.ifr_name, "lo", IFNAMSIZ - 1);
  const bool up =
      fd >= 0 && ::ioctl(fd, SIOCGIFFLAGS, &request) == 0 &&
      (request.ifr_flags |= IFF_UP, ::ioctl(fd, SIOCSIFFLAGS, &request) == 0);
  const int savedErrno = errno;
  if (fd >= 0) {
    ::close(fd);
  }
  if (!up) {
    std::fprintf(stderr, "cannot bring loopback up in the namespace: %s\n",
                 std::strerror(savedErrno));
    std::exit(2);
  }
}

std::string ExchangeOverTcp(uint16_t port, std::string_view bytes,
                            std::size_t maxBytes, int limitMs) {
  using Clock = std::chrono::steady_clock;
  const Clock::time_point deadline =
      Clock::now() + std::chrono::milliseconds(limitMs);
  const int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    return {};
  }
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  std::string received;
  if (::connect(fd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) ==
      0) {
    std::size_t sent = 0;
    while (sent < bytes.size()) {
      const ssize_t n =
          ::send(fd, bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
      if (n <= 0) {
        break; // the peer may close early; read what it said
      }
      sent += static_cast<std::size_t>(n);
    }
    ::shutdown(fd, SHUT_WR);
    char buffer[4096];
    while (received.size() < maxBytes) {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - Clock::now());
      pollfd watch{fd, POLLIN, 0};
      if (left.count() <= 0 ||
          ::poll(&watch, 1, static_cast<int>(left.count())) <= 0) {
        break;
      }
      const ssize_t n = ::recv(fd, buffer, sizeof(buffer), 0);
      if (n <= 0) {
        break;
      }
      received.append(buffer, static_cast<std::size_t>(n));
    }
  }
  ::close(fd);
  return received;
}

} // namespace zark::fuzz
