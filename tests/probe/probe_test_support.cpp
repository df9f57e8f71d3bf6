#include "probe_test_support.h"

#include "connect_back.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <vector>

namespace zark::probe::test {
namespace {

using Clock = std::chrono::steady_clock;

sockaddr_in Loopback(const std::string &address, uint16_t port) {
  sockaddr_in out{};
  out.sin_family = AF_INET;
  out.sin_port = htons(port);
  ::inet_pton(AF_INET, address.c_str(), &out.sin_addr);
  return out;
}

bool Bindable(int type, uint16_t port) {
  int fd = ::socket(AF_INET, type | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    return false;
  }
  sockaddr_in address = Loopback("0.0.0.0", port);
  bool ok =
      ::bind(fd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) == 0;
  ::close(fd);
  return ok;
}

} // namespace

uint16_t UnusedPort() {
  for (int attempt = 0; attempt < 100; ++attempt) {
    int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address = Loopback("0.0.0.0", 0);
    socklen_t length = sizeof(address);
    if (fd < 0 ||
        ::bind(fd, reinterpret_cast<sockaddr *>(&address), length) != 0 ||
        ::getsockname(fd, reinterpret_cast<sockaddr *>(&address), &length) !=
            0) {
      if (fd >= 0) {
        ::close(fd);
      }
      continue;
    }
    ::close(fd);
    const uint16_t port = ntohs(address.sin_port);
    if (Bindable(SOCK_STREAM, port) && Bindable(SOCK_DGRAM, port)) {
      return port;
    }
  }
  return 0;
}

int ConnectFrom(const std::string &from, uint16_t port) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    return -1;
  }
  sockaddr_in local = Loopback(from, 0);
  sockaddr_in remote = Loopback("127.0.0.1", port);
  if (::bind(fd, reinterpret_cast<sockaddr *>(&local), sizeof(local)) != 0 ||
      ::connect(fd, reinterpret_cast<sockaddr *>(&remote), sizeof(remote)) !=
          0) {
    ::close(fd);
    return -1;
  }
  return fd;
}

bool SendAll(int fd, const std::string &text) {
  std::size_t sent = 0;
  while (sent < text.size()) {
    ssize_t n =
        ::send(fd, text.data() + sent, text.size() - sent, MSG_NOSIGNAL);
    if (n <= 0) {
      return false;
    }
    sent += static_cast<std::size_t>(n);
  }
  return true;
}

std::string ReadLine(int fd, std::chrono::milliseconds timeout) {
  const Clock::time_point deadline = Clock::now() + timeout;
  std::string line;
  for (;;) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - Clock::now());
    if (left.count() <= 0) {
      return "<timeout>";
    }
    pollfd watched{fd, POLLIN, 0};
    if (::poll(&watched, 1, static_cast<int>(left.count())) <= 0) {
      continue;
    }
    char c = 0;
    ssize_t n = ::recv(fd, &c, 1, 0);
    if (n <= 0) {
      return "<eof>";
    }
    if (c == '\n') {
      return line;
    }
    line += c;
  }
}

std::string Ask(const std::string &from, uint16_t port,
                const std::string &request) {
  int fd = ConnectFrom(from, port);
  if (fd < 0) {
    return "<no connection>";
  }
  std::string answer = SendAll(fd, request) ? ReadLine(fd) : "<send failed>";
  ::close(fd);
  return answer;
}

TestListener::TestListener(bool tcp, const std::string &address, uint16_t port,
                           Behaviour behaviour, std::string token)
    : mTcp(tcp), mBehaviour(behaviour), mToken(std::move(token)) {
  int fd =
      ::socket(AF_INET, (tcp ? SOCK_STREAM : SOCK_DGRAM) | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    return;
  }
  int one = 1;
  ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof(one));
  sockaddr_in local = Loopback(address, port);
  if (::bind(fd, reinterpret_cast<sockaddr *>(&local), sizeof(local)) != 0 ||
      (tcp && ::listen(fd, 16) != 0) || ::pipe2(mWake, O_CLOEXEC) != 0) {
    ::close(fd);
    return;
  }
  mFd = fd;
  mThread = std::thread([this] { Serve(); });
}

TestListener::~TestListener() {
  if (mThread.joinable()) {
    (void)!::write(mWake[1], "x", 1);
    mThread.join();
  }
  for (int fd : {mFd, mWake[0], mWake[1]}) {
    if (fd >= 0) {
      ::close(fd);
    }
  }
}

void TestListener::Serve() {
  std::vector<int> held; // silent TCP connections, closed at the end
  for (;;) {
    pollfd watched[2] = {{mFd, POLLIN, 0}, {mWake[0], POLLIN, 0}};
    if (::poll(watched, 2, -1) < 0) {
      if (errno == EINTR) {
        continue;
      }
      break;
    }
    if (watched[1].revents != 0) {
      break;
    }
    if (mTcp) {
      int client = ::accept4(mFd, nullptr, nullptr, SOCK_CLOEXEC);
      if (client < 0) {
        continue;
      }
      ++mSeen;
      std::string reply;
      if (mBehaviour == Behaviour::kWriteToken) {
        reply = mToken + "\n";
      } else if (mBehaviour == Behaviour::kWriteOther) {
        reply = "other\n";
      }
      if (mBehaviour == Behaviour::kStaySilent) {
        held.push_back(client);
        continue;
      }
      if (!reply.empty()) {
        (void)SendAll(client, reply);
      }
      ::close(client);
      continue;
    }
    char buffer[512];
    sockaddr_in from{};
    socklen_t length = sizeof(from);
    ssize_t n = ::recvfrom(mFd, buffer, sizeof(buffer), 0,
                           reinterpret_cast<sockaddr *>(&from), &length);
    if (n <= 0) {
      continue;
    }
    ++mSeen;
    std::string datagram(buffer, static_cast<std::size_t>(n));
    std::string reply;
    if (mBehaviour == Behaviour::kWriteToken) {
      // "zark-probe <nonce>\n" -> "<token> <nonce>\n"
      const std::string prefix = "zark-probe ";
      if (datagram.rfind(prefix, 0) == 0 && datagram.back() == '\n') {
        reply = UdpTokenAnswer(
            mToken, datagram.substr(prefix.size(),
                                    datagram.size() - prefix.size() - 1));
      }
    } else if (mBehaviour == Behaviour::kWriteOther) {
      reply = "other\n";
    } else if (mBehaviour == Behaviour::kEcho) {
      reply = datagram;
    }
    if (!reply.empty()) {
      ::sendto(mFd, reply.data(), reply.size(), 0,
               reinterpret_cast<sockaddr *>(&from), length);
    }
  }
  for (int fd : held) {
    ::close(fd);
  }
}

} // namespace zark::probe::test
