#include "fake_natpmp.h"

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

namespace zark::test {
namespace {

void Put16(std::vector<uint8_t> &out, uint16_t value) {
  out.push_back(static_cast<uint8_t>(value >> 8));
  out.push_back(static_cast<uint8_t>(value));
}

void Put32(std::vector<uint8_t> &out, uint32_t value) {
  Put16(out, static_cast<uint16_t>(value >> 16));
  Put16(out, static_cast<uint16_t>(value));
}

uint16_t Get16(const uint8_t *bytes) {
  return static_cast<uint16_t>((bytes[0] << 8) | bytes[1]);
}

constexpr uint32_t kEpoch = 1000;
constexpr uint32_t kPublicAddress = 0xC6336407; // 198.51.100.7

} // namespace

std::vector<uint8_t> FakeNatPmp::MappingReply(uint8_t opcode, uint16_t result,
                                              uint16_t privatePort,
                                              uint16_t publicPort,
                                              uint32_t lifetime) {
  std::vector<uint8_t> reply{0, static_cast<uint8_t>(128 + opcode)};
  Put16(reply, result);
  Put32(reply, kEpoch);
  Put16(reply, privatePort);
  Put16(reply, publicPort);
  Put32(reply, lifetime);
  return reply;
}

FakeNatPmp::FakeNatPmp() {
  mFd = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof(address);
  int pipeFds[2];
  if (mFd < 0 ||
      ::bind(mFd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) !=
          0 ||
      ::getsockname(mFd, reinterpret_cast<sockaddr *>(&address), &length) !=
          0 ||
      ::pipe2(pipeFds, O_CLOEXEC) != 0) {
    std::perror("FakeNatPmp");
    std::abort();
  }
  mPort = ntohs(address.sin_port);
  mWakeRead = pipeFds[0];
  mWakeWrite = pipeFds[1];
  mThread = std::thread([this] { Serve(); });
}

FakeNatPmp::~FakeNatPmp() {
  char byte = 1;
  (void)!::write(mWakeWrite, &byte, 1);
  mThread.join();
  ::close(mFd);
  ::close(mWakeRead);
  ::close(mWakeWrite);
}

void FakeNatPmp::SetHandler(Handler handler) {
  std::lock_guard<std::mutex> lock(mMutex);
  mHandler = std::move(handler);
}

void FakeNatPmp::SetSilent(bool silent) {
  std::lock_guard<std::mutex> lock(mMutex);
  mSilent = silent;
}

void FakeNatPmp::TakePublicPort(uint8_t opcode, uint16_t port) {
  std::lock_guard<std::mutex> lock(mMutex);
  mTaken.emplace_back(opcode, port);
}

int FakeNatPmp::Requests() const {
  std::lock_guard<std::mutex> lock(mMutex);
  return static_cast<int>(mRequests.size());
}

std::vector<NatPmpRequest> FakeNatPmp::ReceivedRequests() const {
  std::lock_guard<std::mutex> lock(mMutex);
  return mRequests;
}

std::vector<FakeNatPmp::Mapping> FakeNatPmp::Table() const {
  std::lock_guard<std::mutex> lock(mMutex);
  return mTable;
}

void FakeNatPmp::SetGrantedLifetime(std::optional<uint32_t> seconds) {
  std::lock_guard<std::mutex> lock(mMutex);
  mGrantedLifetime = seconds;
}

std::vector<uint8_t> FakeNatPmp::BuiltIn(const NatPmpRequest &request) {
  // Called with mMutex held.
  if (request.opcode == 0) {
    std::vector<uint8_t> reply{0, 128};
    Put16(reply, 0);
    Put32(reply, kEpoch);
    Put32(reply, kPublicAddress);
    return reply;
  }
  if (request.opcode > 2) {
    std::vector<uint8_t> reply{0, static_cast<uint8_t>(128 + request.opcode)};
    Put16(reply, 5); // unsupported opcode
    Put32(reply, kEpoch);
    return reply;
  }
  auto mine = std::find_if(mTable.begin(), mTable.end(), [&](const Mapping &m) {
    return m.opcode == request.opcode && m.privatePort == request.privatePort;
  });
  if (request.lifetime == 0) {
    if (mine != mTable.end()) {
      mTable.erase(mine);
    }
    return MappingReply(request.opcode, 0, request.privatePort, 0, 0);
  }
  // A router may grant less than asked (some grant two minutes).
  const uint32_t granted = mGrantedLifetime
                               ? std::min(*mGrantedLifetime, request.lifetime)
                               : request.lifetime;
  if (mine != mTable.end()) {
    // A mapping of this private port exists: it is renewed as it is.
    mine->lifetime = granted;
    return MappingReply(request.opcode, 0, mine->privatePort, mine->publicPort,
                        mine->lifetime);
  }
  auto taken = [&](uint16_t port) {
    if (std::find(mTaken.begin(), mTaken.end(),
                  std::make_pair(request.opcode, port)) != mTaken.end()) {
      return true;
    }
    return std::any_of(mTable.begin(), mTable.end(), [&](const Mapping &m) {
      return m.opcode == request.opcode && m.publicPort == port;
    });
  };
  uint16_t port =
      request.publicPort != 0 ? request.publicPort : request.privatePort;
  for (int tries = 0; tries < 1000 && taken(port); ++tries) {
    port = static_cast<uint16_t>(port + 1);
  }
  Mapping added{request.opcode, request.privatePort, port, granted};
  mTable.push_back(added);
  return MappingReply(request.opcode, 0, added.privatePort, added.publicPort,
                      added.lifetime);
}

void FakeNatPmp::Serve() {
  for (;;) {
    pollfd watch[2] = {{mWakeRead, POLLIN, 0}, {mFd, POLLIN, 0}};
    int ready = ::poll(watch, 2, 200);
    if (ready < 0 && errno != EINTR) {
      break;
    }
    if (watch[0].revents != 0) {
      break;
    }
    if ((watch[1].revents & POLLIN) == 0) {
      continue;
    }
    uint8_t buffer[64];
    sockaddr_in from{};
    socklen_t length = sizeof(from);
    ssize_t n = ::recvfrom(mFd, buffer, sizeof(buffer), 0,
                           reinterpret_cast<sockaddr *>(&from), &length);
    if (n < 2 || buffer[0] != 0) {
      continue;
    }
    NatPmpRequest request;
    request.opcode = buffer[1];
    if (request.opcode != 0 && n >= 12) {
      request.privatePort = Get16(buffer + 4);
      request.publicPort = Get16(buffer + 6);
      request.lifetime =
          static_cast<uint32_t>(Get16(buffer + 8)) << 16 | Get16(buffer + 10);
    }
    std::vector<uint8_t> reply;
    {
      std::unique_lock<std::mutex> lock(mMutex);
      mRequests.push_back(request);
      if (mSilent) {
        continue;
      }
      Handler handler = mHandler;
      std::optional<std::vector<uint8_t>> chosen;
      if (handler) {
        lock.unlock();
        chosen = handler(request);
        lock.lock();
      }
      reply = chosen ? *chosen : BuiltIn(request);
    }
    if (!reply.empty()) {
      ::sendto(mFd, reply.data(), reply.size(), 0,
               reinterpret_cast<sockaddr *>(&from), length);
    }
  }
}

} // namespace zark::test
