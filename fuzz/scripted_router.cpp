#include "scripted_router.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <strings.h>

namespace zark::fuzz {
namespace {

// A request larger than this, or silent for longer, is cut off: the driver
// under test writes small requests at once.
constexpr std::size_t kMaxRequestBytes = 64 * 1024;
constexpr int kReadWaitMs = 2000;

[[noreturn]] void Die(const char *what) {
  std::perror(what);
  std::abort();
}

// A socket bound to 127.0.0.1 on a free port, and its port.
int BoundSocket(int type, uint16_t &port) {
  const int fd = ::socket(AF_INET, type | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof(address);
  if (fd < 0 ||
      ::bind(fd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) !=
          0 ||
      ::getsockname(fd, reinterpret_cast<sockaddr *>(&address), &length) != 0) {
    Die("scripted router socket");
  }
  port = ntohs(address.sin_port);
  return fd;
}

void WakePipe(int &readEnd, int &writeEnd) {
  int fds[2];
  if (::pipe2(fds, O_CLOEXEC) != 0) {
    Die("scripted router pipe");
  }
  readEnd = fds[0];
  writeEnd = fds[1];
}

void SendAll(int fd, const std::string &data) {
  std::size_t sent = 0;
  while (sent < data.size()) {
    const ssize_t n =
        ::send(fd, data.data() + sent, data.size() - sent, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n <= 0) {
      return;
    }
    sent += static_cast<std::size_t>(n);
  }
}

// The value of header name (any case) in the head of a request, or "".
std::string Header(const std::string &head, const char *name) {
  const std::size_t nameLength = std::strlen(name);
  std::size_t at = head.find("\r\n");
  while (at != std::string::npos && at + 2 < head.size()) {
    const std::size_t start = at + 2;
    const std::size_t end = head.find("\r\n", start);
    const std::string line = head.substr(start, end - start);
    if (line.size() > nameLength && line[nameLength] == ':' &&
        ::strncasecmp(line.c_str(), name, nameLength) == 0) {
      const std::size_t value = line.find_first_not_of(" \t", nameLength + 1);
      return value == std::string::npos ? std::string() : line.substr(value);
    }
    at = end;
  }
  return {};
}

} // namespace

ScriptedHttpRouter::ScriptedHttpRouter() {
  mListenFd = BoundSocket(SOCK_STREAM, mPort);
  if (::listen(mListenFd, 16) != 0) {
    Die("scripted router listen");
  }
  WakePipe(mWakeRead, mWakeWrite);
  mThread = std::thread([this] { Serve(); });
}

ScriptedHttpRouter::~ScriptedHttpRouter() {
  const char byte = 1;
  (void)!::write(mWakeWrite, &byte, 1);
  mThread.join();
  ::close(mListenFd);
  ::close(mWakeRead);
  ::close(mWakeWrite);
}

void ScriptedHttpRouter::Script(std::vector<std::string> replies) {
  std::lock_guard lock(mMutex);
  mReplies = std::move(replies);
  mNext = 0;
  mSeen.clear();
}

std::vector<HttpRequestSeen> ScriptedHttpRouter::Seen() const {
  std::lock_guard lock(mMutex);
  return mSeen;
}

void ScriptedHttpRouter::Serve() {
  for (;;) {
    pollfd watch[2] = {{mWakeRead, POLLIN, 0}, {mListenFd, POLLIN, 0}};
    if (::poll(watch, 2, -1) < 0) {
      if (errno == EINTR) {
        continue;
      }
      Die("scripted router poll");
    }
    if (watch[0].revents != 0) {
      return;
    }
    if ((watch[1].revents & POLLIN) != 0) {
      const int fd = ::accept4(mListenFd, nullptr, nullptr, SOCK_CLOEXEC);
      if (fd >= 0) {
        Answer(fd);
        ::close(fd);
      }
    }
  }
}

// Reads one request (head and Content-Length body) and sends the next
// scripted reply. One connection at a time: the driver sends one request
// at a time and waits for its answer.
void ScriptedHttpRouter::Answer(int fd) {
  std::string data;
  std::size_t headEnd = std::string::npos;
  std::size_t wanted = 0;
  for (;;) {
    if (headEnd == std::string::npos) {
      headEnd = data.find("\r\n\r\n");
      if (headEnd != std::string::npos) {
        const std::string length =
            Header(data.substr(0, headEnd + 2), "Content-Length");
        wanted = headEnd + 4 + std::strtoul(length.c_str(), nullptr, 10);
      }
    }
    if ((headEnd != std::string::npos && data.size() >= wanted) ||
        data.size() > kMaxRequestBytes) {
      break;
    }
    pollfd watch{fd, POLLIN, 0};
    if (::poll(&watch, 1, kReadWaitMs) <= 0) {
      return;
    }
    char buffer[4096];
    const ssize_t n = ::recv(fd, buffer, sizeof(buffer), 0);
    if (n <= 0) {
      return;
    }
    data.append(buffer, static_cast<std::size_t>(n));
  }

  HttpRequestSeen seen;
  const std::string head = data.substr(0, headEnd + 2);
  const std::size_t space = head.find(' ');
  const std::size_t space2 = head.find(' ', space + 1);
  seen.method = head.substr(0, space);
  if (space != std::string::npos) {
    seen.path = head.substr(space + 1, space2 - space - 1);
  }
  std::string action = Header(head, "SOAPAction");
  action.erase(std::remove(action.begin(), action.end(), '"'), action.end());
  const std::size_t hash = action.find('#');
  seen.soapAction =
      hash == std::string::npos ? std::string() : action.substr(hash + 1);
  const std::size_t element = data.find("<u:", headEnd);
  if (element != std::string::npos) {
    const std::size_t end = data.find_first_of(" />", element + 3);
    seen.bodyAction =
        data.substr(element + 3, end == std::string::npos ? std::string::npos
                                                          : end - element - 3);
  }

  std::string reply;
  {
    std::lock_guard lock(mMutex);
    mSeen.push_back(std::move(seen));
    if (mNext < mReplies.size()) {
      reply = mReplies[mNext++];
    }
  }
  SendAll(fd, reply);
}

ScriptedUdpRouter::ScriptedUdpRouter() {
  mFd = BoundSocket(SOCK_DGRAM, mPort);
  WakePipe(mWakeRead, mWakeWrite);
  mThread = std::thread([this] { Serve(); });
}

ScriptedUdpRouter::~ScriptedUdpRouter() {
  const char byte = 1;
  (void)!::write(mWakeWrite, &byte, 1);
  mThread.join();
  ::close(mFd);
  ::close(mWakeRead);
  ::close(mWakeWrite);
}

void ScriptedUdpRouter::Script(std::vector<std::string> replies) {
  std::lock_guard lock(mMutex);
  mReplies = std::move(replies);
  mNext = 0;
  mSeen.clear();
}

std::vector<NatPmpRequestSeen> ScriptedUdpRouter::Seen() const {
  std::lock_guard lock(mMutex);
  return mSeen;
}

void ScriptedUdpRouter::Serve() {
  for (;;) {
    pollfd watch[2] = {{mWakeRead, POLLIN, 0}, {mFd, POLLIN, 0}};
    if (::poll(watch, 2, -1) < 0) {
      if (errno == EINTR) {
        continue;
      }
      Die("scripted router poll");
    }
    if (watch[0].revents != 0) {
      return;
    }
    if ((watch[1].revents & POLLIN) == 0) {
      continue;
    }
    uint8_t buffer[1500];
    sockaddr_in peer{};
    socklen_t peerLength = sizeof(peer);
    const ssize_t n =
        ::recvfrom(mFd, buffer, sizeof(buffer), 0,
                   reinterpret_cast<sockaddr *>(&peer), &peerLength);
    if (n < 0) {
      continue;
    }
    NatPmpRequestSeen seen;
    seen.bytes.assign(buffer, buffer + n);
    std::string reply;
    {
      std::lock_guard lock(mMutex);
      if (mNext < mReplies.size()) {
        reply = mReplies[mNext++];
      } else {
        // RFC 6886 reply head: version 0, opcode 128 + request opcode,
        // result code 2 (not authorized), seconds since start of epoch.
        const uint8_t opcode = n >= 2 ? buffer[1] : 0;
        const uint8_t refusal[16] = {
            0, static_cast<uint8_t>(128 + opcode), 0, 2, 0, 0, 0, 1};
        const std::size_t length = opcode == 0 ? 12 : 16;
        reply.assign(reinterpret_cast<const char *>(refusal), length);
      }
      mSeen.push_back(std::move(seen));
    }
    if (!reply.empty()) {
      (void)::sendto(mFd, reply.data(), reply.size(), 0,
                     reinterpret_cast<sockaddr *>(&peer), peerLength);
    }
  }
}

} // namespace zark::fuzz
