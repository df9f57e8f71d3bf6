#include "udp_responder.h"

#include "dns_answer.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>

namespace zark::test {

UdpResponder::UdpResponder(Handler handler) : mHandler(std::move(handler)) {
  mFd = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof(address);
  if (mFd < 0 ||
      ::bind(mFd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) !=
          0 ||
      ::getsockname(mFd, reinterpret_cast<sockaddr *>(&address), &length) !=
          0 ||
      ::pipe2(mWake, O_CLOEXEC) != 0) {
    return;
  }
  mPort = ntohs(address.sin_port);
  mThread = std::thread([this] { Serve(); });
}

UdpResponder::~UdpResponder() {
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

void UdpResponder::SetHandler(Handler handler) {
  std::lock_guard<std::mutex> lock(mMutex);
  mHandler = std::move(handler);
}

int UdpResponder::Received() const {
  std::lock_guard<std::mutex> lock(mMutex);
  return static_cast<int>(mRequests.size());
}

std::vector<UdpResponder::Bytes> UdpResponder::Requests() const {
  std::lock_guard<std::mutex> lock(mMutex);
  return mRequests;
}

void UdpResponder::Serve() {
  for (;;) {
    pollfd watched[2] = {{mFd, POLLIN, 0}, {mWake[0], POLLIN, 0}};
    if (::poll(watched, 2, -1) < 0) {
      if (errno == EINTR) {
        continue;
      }
      return;
    }
    if (watched[1].revents != 0) {
      return;
    }
    uint8_t buffer[4096];
    sockaddr_in from{};
    socklen_t length = sizeof(from);
    const ssize_t got =
        ::recvfrom(mFd, buffer, sizeof(buffer), 0,
                   reinterpret_cast<sockaddr *>(&from), &length);
    if (got < 0) {
      continue;
    }
    Bytes request(buffer, buffer + got);
    Handler handler;
    {
      std::lock_guard<std::mutex> lock(mMutex);
      mRequests.push_back(request);
      handler = mHandler;
    }
    if (!handler) {
      continue;
    }
    for (const Bytes &reply : handler(request)) {
      ::sendto(mFd, reply.data(), reply.size(), 0,
               reinterpret_cast<sockaddr *>(&from), length);
    }
  }
}

UdpResponder::Handler DnsServer(std::string name, uint32_t address) {
  return [name, address](const UdpResponder::Bytes &request) {
    uint8_t reply[512];
    const std::size_t length =
        BuildDnsAnswer(request.data(), request.size(), name.c_str(), address,
                       reply, sizeof(reply));
    std::vector<UdpResponder::Bytes> replies;
    if (length > 0) {
      replies.emplace_back(reply, reply + length);
    }
    return replies;
  };
}

UdpResponder::Handler SsdpDevice(std::string location) {
  return [location](const UdpResponder::Bytes &request) {
    std::vector<UdpResponder::Bytes> replies;
    if (Text(request).rfind("M-SEARCH * HTTP/1.1\r\n", 0) != 0) {
      return replies;
    }
    replies.push_back(
        Bytes("HTTP/1.1 200 OK\r\n"
              "CACHE-CONTROL: max-age=120\r\n"
              "ST: urn:schemas-upnp-org:device:InternetGatewayDevice:1\r\n"
              "USN: uuid:00000000-0000-0000-0000-000000000001::"
              "urn:schemas-upnp-org:device:InternetGatewayDevice:1\r\n"
              "EXT:\r\n"
              "SERVER: Test/1 UPnP/1.1 FakeSsdp/1\r\n"
              "LOCATION: " +
              location + "\r\n\r\n"));
    return replies;
  };
}

std::string Text(const UdpResponder::Bytes &bytes) {
  return std::string(bytes.begin(), bytes.end());
}

UdpResponder::Bytes Bytes(const std::string &text) {
  return UdpResponder::Bytes(text.begin(), text.end());
}

} // namespace zark::test
