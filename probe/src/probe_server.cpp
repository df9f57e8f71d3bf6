#include "probe_server.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>

#include <cerrno>
#include <charconv>
#include <cstring>
#include <exception>
#include <optional>

namespace zark::probe {
namespace {

using Clock = std::chrono::steady_clock;

std::optional<uint16_t> ParseListenPort(std::string_view text) {
  unsigned value = 0;
  auto [end, error] =
      std::from_chars(text.data(), text.data() + text.size(), value);
  if (text.empty() || error != std::errc() ||
      end != text.data() + text.size() || value > 65535) {
    return std::nullopt;
  }
  return static_cast<uint16_t>(value);
}

uint16_t BoundPort(int fd) {
  sockaddr_storage address{};
  socklen_t length = sizeof(address);
  if (::getsockname(fd, reinterpret_cast<sockaddr *>(&address), &length) != 0) {
    return 0;
  }
  if (address.ss_family == AF_INET) {
    sockaddr_in v4{};
    std::memcpy(&v4, &address, sizeof(v4));
    return ntohs(v4.sin_port);
  }
  sockaddr_in6 v6{};
  std::memcpy(&v6, &address, sizeof(v6));
  return ntohs(v6.sin6_port);
}

} // namespace

bool ParseListenAddress(std::string_view text, sockaddr_storage &address,
                        socklen_t &length) {
  address = sockaddr_storage{};
  std::size_t colon = text.rfind(':');
  if (colon == std::string_view::npos) {
    return false;
  }
  std::optional<uint16_t> port = ParseListenPort(text.substr(colon + 1));
  if (!port) {
    return false;
  }
  std::string host(text.substr(0, colon));
  if (host.size() >= 2 && host.front() == '[' && host.back() == ']') {
    sockaddr_in6 v6{};
    v6.sin6_family = AF_INET6;
    v6.sin6_port = htons(*port);
    host = host.substr(1, host.size() - 2);
    if (::inet_pton(AF_INET6, host.c_str(), &v6.sin6_addr) != 1) {
      return false;
    }
    std::memcpy(&address, &v6, sizeof(v6));
    length = sizeof(v6);
    return true;
  }
  sockaddr_in v4{};
  v4.sin_family = AF_INET;
  v4.sin_port = htons(*port);
  if (::inet_pton(AF_INET, host.c_str(), &v4.sin_addr) != 1) {
    return false;
  }
  std::memcpy(&address, &v4, sizeof(v4));
  length = sizeof(v4);
  return true;
}

ProbeServer::ProbeServer(ServerOptions options, ConnectBack &connectBack,
                         TimeSource clock, Logger log)
    : mOptions(std::move(options)), mConnectBack(connectBack),
      mClock(std::move(clock)), mLog(std::move(log)),
      mLimiter(mOptions.ratePerSecond, mOptions.burst,
               mOptions.maxTrackedAddresses) {}

ProbeServer::~ProbeServer() {
  Stop();
}

Clock::time_point ProbeServer::Now() const {
  return mClock ? mClock() : Clock::now();
}

void ProbeServer::Log(const std::string &line) const {
  if (mLog) {
    mLog(line);
  }
}

bool ProbeServer::Start(std::string &error) {
  if (mStarted) {
    error = "already started";
    return false;
  }
  std::vector<UniqueFd> fds;
  std::vector<uint16_t> ports;
  for (const std::string &text : mOptions.listen) {
    sockaddr_storage address{};
    socklen_t length = 0;
    if (!ParseListenAddress(text, address, length)) {
      error = "not a listen address: \"" + text + "\"";
      return false;
    }
    UniqueFd fd(::socket(address.ss_family,
                         SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
    if (!fd.Valid()) {
      error = "socket: " + std::string(std::strerror(errno));
      return false;
    }
    int one = 1;
    ::setsockopt(fd.Get(), SOL_SOCKET, SO_REUSEADDR, &one, sizeof(one));
    if (address.ss_family == AF_INET6) {
      // "[::]:7777" takes IPv6 only; list "0.0.0.0:7777" too for IPv4.
      ::setsockopt(fd.Get(), IPPROTO_IPV6, IPV6_V6ONLY, &one, sizeof(one));
    }
    if (::bind(fd.Get(), reinterpret_cast<sockaddr *>(&address), length) != 0 ||
        ::listen(fd.Get(), 64) != 0) {
      error = text + ": " + std::strerror(errno);
      return false;
    }
    ports.push_back(BoundPort(fd.Get()));
    fds.push_back(std::move(fd));
  }
  UniqueFd wake(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!wake.Valid()) {
    error = "eventfd: " + std::string(std::strerror(errno));
    return false;
  }
  mListenFds = std::move(fds);
  mPorts = std::move(ports);
  mWakeFd = std::move(wake);
  mStarted = true;
  mAcceptThread = std::thread([this] { AcceptLoop(); });
  return true;
}

void ProbeServer::Stop() {
  if (!mStarted) {
    return;
  }
  const uint64_t one = 1;
  // An eventfd stays readable once written: every session's poll sees it.
  (void)!::write(mWakeFd.Get(), &one, sizeof(one));
  if (mAcceptThread.joinable()) {
    mAcceptThread.join();
  }
  mListenFds.clear();
  mStarted = false;
}

std::vector<uint16_t> ProbeServer::Ports() const {
  return mPorts;
}

ServerCounters ProbeServer::Counters() const {
  std::lock_guard<std::mutex> lock(mMutex);
  return mCounters;
}

void ProbeServer::ReapSessions(bool all) {
  for (auto it = mSessions.begin(); it != mSessions.end();) {
    if (all || (*it)->done.load()) {
      if ((*it)->thread.joinable()) {
        (*it)->thread.join();
      }
      it = mSessions.erase(it);
    } else {
      ++it;
    }
  }
}

void ProbeServer::AcceptLoop() {
  for (;;) {
    std::vector<pollfd> watched;
    watched.push_back({mWakeFd.Get(), POLLIN, 0});
    for (const UniqueFd &fd : mListenFds) {
      watched.push_back({fd.Get(), POLLIN, 0});
    }
    // The timeout only paces the reaping of finished sessions.
    int ready = ::poll(watched.data(), watched.size(), 200);
    if (ready < 0 && errno != EINTR) {
      Log("poll: " + std::string(std::strerror(errno)));
      break;
    }
    if (watched[0].revents != 0) {
      break;
    }
    ReapSessions(false);
    for (std::size_t i = 1; i < watched.size(); ++i) {
      if ((watched[i].revents & POLLIN) != 0) {
        Accept(watched[i].fd);
      }
    }
  }
  ReapSessions(true);
}

void ProbeServer::Accept(int listenFd) {
  // Several may be waiting; take what is there now, bounded.
  for (int i = 0; i < 64; ++i) {
    sockaddr_storage peer{};
    socklen_t peerLength = sizeof(peer);
    UniqueFd fd(::accept4(listenFd, reinterpret_cast<sockaddr *>(&peer),
                          &peerLength, SOCK_NONBLOCK | SOCK_CLOEXEC));
    if (!fd.Valid()) {
      return;
    }
    std::string key = AddressText(peer, peerLength);
    bool admitted = false;
    {
      std::lock_guard<std::mutex> lock(mMutex);
      int &fromAddress = mSessionsPerAddress[key];
      if (!key.empty() && mActiveSessions < mOptions.maxSessions &&
          fromAddress < mOptions.maxSessionsPerAddress) {
        ++fromAddress;
        ++mActiveSessions;
        admitted = true;
      } else {
        if (fromAddress == 0) {
          mSessionsPerAddress.erase(key);
        }
        ++mCounters.busy;
      }
    }
    if (!admitted) {
      // Best effort, never waits: the socket is non-blocking.
      const std::string answer = FormatErrorAnswer(reason::kBusy);
      (void)!::send(fd.Get(), answer.data(), answer.size(), MSG_NOSIGNAL);
      continue;
    }
    auto session = std::make_unique<Session>();
    Session *raw = session.get();
    mSessions.push_back(std::move(session));
    auto finished = [this, raw, key] {
      std::lock_guard<std::mutex> lock(mMutex);
      if (--mSessionsPerAddress[key] <= 0) {
        mSessionsPerAddress.erase(key);
      }
      --mActiveSessions;
      raw->done.store(true);
    };
    try {
      // Shared so that the descriptor is closed also when the thread
      // cannot be started.
      auto owned = std::make_shared<UniqueFd>(std::move(fd));
      raw->thread =
          std::thread([this, peer, peerLength, key, finished, owned]() {
            try {
              Serve(std::move(*owned), peer, peerLength, key);
            } catch (const std::exception &e) {
              // Nothing leaves a session thread; the connection is closed.
              Log(key + ": session ended: " + e.what());
            }
            finished();
          });
    } catch (const std::exception &e) {
      Log(std::string("cannot start a session: ") + e.what());
      finished();
    }
  }
}

bool ProbeServer::SendAll(int fd, std::string_view text) {
  const Clock::time_point deadline = Clock::now() + mOptions.writeTimeout;
  while (!text.empty()) {
    ssize_t sent = ::send(fd, text.data(), text.size(), MSG_NOSIGNAL);
    if (sent > 0) {
      text.remove_prefix(static_cast<std::size_t>(sent));
      continue;
    }
    if (sent < 0 && errno != EAGAIN && errno != EINTR) {
      return false;
    }
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - Clock::now());
    if (left.count() <= 0) {
      return false;
    }
    pollfd watched{fd, POLLOUT, 0};
    if (::poll(&watched, 1, static_cast<int>(left.count())) < 0 &&
        errno != EINTR) {
      return false;
    }
  }
  return true;
}

void ProbeServer::Count(long ServerCounters::*counter) {
  std::lock_guard<std::mutex> lock(mMutex);
  ++(mCounters.*counter);
}

ProbeServer::LineRead ProbeServer::ReadRequestLine(int fd, std::string &pending,
                                                   std::string &line) {
  // One line, waiting at most idleTimeout for it.
  const Clock::time_point deadline = Clock::now() + mOptions.idleTimeout;
  std::size_t newline = pending.find('\n');
  while (newline == std::string::npos) {
    if (pending.size() >= kMaxRequestLine) {
      return LineRead::kTooLong;
    }
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - Clock::now());
    if (left.count() <= 0) {
      return LineRead::kEnd;
    }
    pollfd watched[2] = {{fd, POLLIN, 0}, {mWakeFd.Get(), POLLIN, 0}};
    int ready = ::poll(watched, 2, static_cast<int>(left.count()));
    if (ready < 0 && errno != EINTR) {
      return LineRead::kEnd;
    }
    if (watched[1].revents != 0) {
      return LineRead::kEnd;
    }
    if (ready <= 0 || watched[0].revents == 0) {
      continue;
    }
    char buffer[256];
    // Never read past the longest line: what follows stays unread.
    const std::size_t room = kMaxRequestLine - pending.size();
    ssize_t n = ::recv(fd, buffer, std::min(room, sizeof(buffer)), 0);
    if (n == 0) {
      return LineRead::kEnd;
    }
    if (n < 0) {
      if (errno == EAGAIN || errno == EINTR) {
        continue;
      }
      return LineRead::kEnd;
    }
    std::size_t before = pending.size();
    pending.append(buffer, static_cast<std::size_t>(n));
    newline = pending.find('\n', before);
  }
  line = pending.substr(0, newline);
  pending.erase(0, newline + 1);
  return LineRead::kLine;
}

RateLimiter::Decision ProbeServer::TakeToken(const std::string &key,
                                             Request::Kind kind) {
  std::lock_guard<std::mutex> lock(mMutex);
  RateLimiter::Decision decision = mLimiter.Take(key, Now());
  if (!decision.allowed) {
    if (decision.tooManyAddresses) {
      ++mCounters.busy;
    } else {
      ++mCounters.rateLimited;
    }
  } else if (kind == Request::Kind::kCheck) {
    ++mCounters.checks;
  }
  return decision;
}

std::string ProbeServer::AnswerRequest(const Request &request,
                                       const sockaddr_storage &peer,
                                       socklen_t peerLength,
                                       const std::string &key) {
  const RateLimiter::Decision decision = TakeToken(key, request.kind);
  if (!decision.allowed) {
    return decision.tooManyAddresses
               ? FormatErrorAnswer(reason::kBusy)
               : FormatErrorAnswer(reason::kRateLimited,
                                   decision.retryAfter.count());
  }
  if (request.kind == Request::Kind::kAddress) {
    return FormatAddressAnswer(key);
  }
  // The peer address of this very connection: the only place a check
  // may go.
  Verdict verdict = mConnectBack.Check(peer, peerLength, request);
  Log(key + " " + TransportName(request.transport) + " " +
      std::to_string(request.port) + ": " + ResultName(verdict.result) + " (" +
      verdict.reason + ")");
  return FormatCheckAnswer(request, verdict);
}

void ProbeServer::Serve(UniqueFd fd, sockaddr_storage peer,
                        socklen_t peerLength, const std::string &key) {
  std::string pending;
  std::string line;
  for (int served = 0;; ++served) {
    const LineRead read = ReadRequestLine(fd.Get(), pending, line);
    if (read == LineRead::kTooLong) {
      Count(&ServerCounters::badRequests);
      (void)SendAll(fd.Get(), FormatErrorAnswer(reason::kLineTooLong));
      return;
    }
    if (read != LineRead::kLine) {
      return;
    }
    Count(&ServerCounters::requests);
    if (served >= mOptions.maxRequestsPerSession) {
      Count(&ServerCounters::busy);
      (void)SendAll(fd.Get(), FormatErrorAnswer(reason::kBusy));
      return;
    }
    ParsedRequest parsed = ParseRequestLine(line);
    if (parsed.error != ParseError::kNone) {
      Count(&ServerCounters::badRequests);
      (void)SendAll(fd.Get(), FormatBadRequestAnswer(parsed.error));
      return;
    }
    if (!SendAll(fd.Get(),
                 AnswerRequest(parsed.request, peer, peerLength, key))) {
      return;
    }
  }
}

} // namespace zark::probe
