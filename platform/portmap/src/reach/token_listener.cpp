#include "reach/token_listener.h"

#include "base/portmap_log.h"

#include "klibc_file.h"

#include <netinet/in.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>

#include <cerrno>
#include <exception>
#include <vector>

namespace zark::portmap {
namespace {

// Answered connections kept open at most, waiting for the prober to close.
constexpr std::size_t kMaxHeldConnections = 16;

bool IsNonce(std::string_view text) {
  if (text.empty() || text.size() > 64) {
    return false;
  }
  for (char c : text) {
    bool plain = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') ||
                 (c >= '0' && c <= '9') || c == '-' || c == '_';
    if (!plain) {
      return false;
    }
  }
  return true;
}

} // namespace

std::string NewProbeToken() {
  std::optional<std::string> token = klibc::RandomHex(16);
  if (!token) {
    const int saved = errno;
    ZARK_PM_LOG_CALL("getrandom", -1, saved);
    return {};
  }
  return *token;
}

std::string UdpListenerAnswer(std::string_view token,
                              std::string_view datagram) {
  // "zark-probe <nonce>\n"
  constexpr std::string_view kPrefix = "zark-probe ";
  if (datagram.substr(0, kPrefix.size()) != kPrefix || datagram.empty() ||
      datagram.back() != '\n') {
    return {};
  }
  std::string_view nonce =
      datagram.substr(kPrefix.size(), datagram.size() - kPrefix.size() - 1);
  if (!IsNonce(nonce)) {
    return {};
  }
  return std::string(token) + " " + std::string(nonce) + "\n";
}

TokenListener::~TokenListener() {
  if (mThread.joinable()) {
    const uint64_t one = 1;
    (void)!::write(mWakeFd.Get(), &one, sizeof(one));
    mThread.join();
  }
}

TokenListener::OpenResult
TokenListener::Open(IpProtocol protocol, uint16_t port, std::string token) {
  if (mFd.Valid() || token.empty() || port == 0) {
    ZARK_PM_LOG_ERROR("TokenListener::Open: bad use (port %u)", port);
    return OpenResult::kFailed;
  }
  const bool tcp = protocol == IpProtocol::kTcp;
  UniqueFd fd(::socket(
      AF_INET, (tcp ? SOCK_STREAM : SOCK_DGRAM) | SOCK_NONBLOCK | SOCK_CLOEXEC,
      0));
  if (!fd.Valid()) {
    int saved = errno;
    ZARK_PM_LOG_CALL("socket", -1, saved);
    return OpenResult::kFailed;
  }
  if (tcp) {
    // Lets the port be taken again at once after an earlier test; a port
    // with a live listener still refuses the bind.
    int one = 1;
    ::setsockopt(fd.Get(), SOL_SOCKET, SO_REUSEADDR, &one, sizeof(one));
  }
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  address.sin_addr.s_addr = htonl(INADDR_ANY);
  if (::bind(fd.Get(), reinterpret_cast<sockaddr *>(&address),
             sizeof(address)) != 0) {
    int saved = errno;
    if (saved == EADDRINUSE) {
      return OpenResult::kPortInUse;
    }
    const std::string detail =
        std::string(ProtocolText(protocol)) + " port " + std::to_string(port);
    ZARK_PM_LOG_CALL("bind", -1, saved, detail.c_str());
    return OpenResult::kFailed;
  }
  if (tcp && ::listen(fd.Get(), 16) != 0) {
    int saved = errno;
    ZARK_PM_LOG_CALL("listen", -1, saved);
    return OpenResult::kFailed;
  }
  UniqueFd wake(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!wake.Valid()) {
    int saved = errno;
    ZARK_PM_LOG_CALL("eventfd", -1, saved);
    return OpenResult::kFailed;
  }
  mProtocol = protocol;
  mToken = std::move(token);
  mFd = std::move(fd);
  mWakeFd = std::move(wake);
  try {
    mThread = std::thread([this] { Serve(); });
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("cannot start the listener's thread: %s", e.what());
    mFd.Reset();
    return OpenResult::kFailed;
  }
  return OpenResult::kOpen;
}

void TokenListener::Serve() {
  const std::string line = mToken + "\n";
  // Connections that got the token, kept until the prober closes them: the
  // side that closes first keeps the port in TIME_WAIT, and this is the
  // port of a service of the server, which should be free to start at once.
  std::vector<UniqueFd> answered;
  for (;;) {
    std::vector<pollfd> watched = {{mFd.Get(), POLLIN, 0},
                                   {mWakeFd.Get(), POLLIN, 0}};
    for (const UniqueFd &client : answered) {
      watched.push_back({client.Get(), POLLIN, 0});
    }
    int ready = ::poll(watched.data(), watched.size(), -1);
    if (ready < 0) {
      if (errno == EINTR) {
        continue;
      }
      int saved = errno;
      ZARK_PM_LOG_CALL("poll", ready, saved);
      return;
    }
    if (watched[1].revents != 0) {
      return;
    }
    // Readable means the prober closed (or sent something we do not want):
    // close our end too.
    for (std::size_t i = watched.size(); i-- > 2;) {
      if (watched[i].revents != 0) {
        answered.erase(answered.begin() + static_cast<std::ptrdiff_t>(i - 2));
      }
    }
    if (watched[0].revents == 0) {
      continue;
    }
    if (mProtocol == IpProtocol::kTcp) {
      UniqueFd client(
          ::accept4(mFd.Get(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
      if (!client.Valid()) {
        continue;
      }
      // A few dozen bytes into an empty socket buffer: never blocks.
      if (::send(client.Get(), line.data(), line.size(), MSG_NOSIGNAL) ==
          static_cast<ssize_t>(line.size())) {
        ++mAnswered;
      }
      // No shutdown: the prober reads up to the line end and closes first.
      answered.push_back(std::move(client));
      if (answered.size() > kMaxHeldConnections) {
        answered.erase(answered.begin());
      }
      continue;
    }
    char buffer[256];
    sockaddr_storage from{};
    socklen_t length = sizeof(from);
    ssize_t n = ::recvfrom(mFd.Get(), buffer, sizeof(buffer), 0,
                           reinterpret_cast<sockaddr *>(&from), &length);
    if (n <= 0) {
      continue;
    }
    std::string answer = UdpListenerAnswer(
        mToken, std::string_view(buffer, static_cast<std::size_t>(n)));
    if (!answer.empty() &&
        ::sendto(mFd.Get(), answer.data(), answer.size(), 0,
                 reinterpret_cast<sockaddr *>(&from), length) > 0) {
      ++mAnswered;
    }
  }
}

} // namespace zark::portmap
