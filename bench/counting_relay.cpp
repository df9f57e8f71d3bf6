#include "counting_relay.h"

#include <arpa/inet.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <deque>
#include <optional>
#include <vector>

namespace zark::bench {

using zark::portmap::UniqueFd;
using Clock = std::chrono::steady_clock;

namespace {

constexpr std::size_t kBufferLimit = 1u << 20;
constexpr std::size_t kHeadLimit = 64u << 10;
constexpr uint64_t kBodyLimit = 16u << 20;
constexpr auto kIdleLimit = std::chrono::seconds(30);
constexpr std::string_view kHeadEnd = "\r\n\r\n";

bool EqualsIgnoringCase(std::string_view a, std::string_view b) {
  return a.size() == b.size() &&
         std::equal(a.begin(), a.end(), b.begin(), [](char x, char y) {
           return std::tolower(static_cast<unsigned char>(x)) ==
                  std::tolower(static_cast<unsigned char>(y));
         });
}

std::string_view Trim(std::string_view text) {
  while (!text.empty() &&
         (text.front() == ' ' || text.front() == '\t' || text.front() == '"')) {
    text.remove_prefix(1);
  }
  while (!text.empty() && (text.back() == ' ' || text.back() == '\t' ||
                           text.back() == '"' || text.back() == '\r')) {
    text.remove_suffix(1);
  }
  return text;
}

// What an HTTP head says. A request head:
//
//   POST /ctl/IPConn HTTP/1.1
//   Host: 192.168.77.1:5000
//   Content-Length: 612
//   Content-Type: text/xml
//   SOAPAction: "urn:schemas-upnp-org:service:WANIPConnection:2#AddPortMapping"
//
// and a reply head:
//
//   HTTP/1.1 200 OK
//   Content-Type: text/xml; charset="utf-8"
//   Connection: close
//   Content-Length: 364
//
struct HttpHead {
  std::string action; // requests: "AddPortMapping", or "GET /rootDesc.xml"
  int status = 0;     // replies: the status code
  std::optional<uint64_t> contentLength;
  bool chunked = false;
  bool valid = false;
};

HttpHead ReadHead(std::string_view head) {
  HttpHead result;
  std::size_t lineEnd = head.find("\r\n");
  std::string_view firstLine = head.substr(0, lineEnd);
  std::size_t firstSpace = firstLine.find(' ');
  if (firstSpace == std::string_view::npos) {
    return result;
  }
  std::size_t secondSpace = firstLine.find(' ', firstSpace + 1);
  std::string_view second =
      firstLine.substr(firstSpace + 1, secondSpace == std::string_view::npos
                                           ? std::string_view::npos
                                           : secondSpace - firstSpace - 1);
  (void)std::from_chars(second.data(), second.data() + second.size(),
                        result.status);
  std::string_view soapAction;
  while (lineEnd != std::string_view::npos && lineEnd + 2 < head.size()) {
    std::size_t start = lineEnd + 2;
    lineEnd = head.find("\r\n", start);
    std::string_view line = head.substr(start, lineEnd - start);
    std::size_t colon = line.find(':');
    if (colon == std::string_view::npos) {
      continue;
    }
    std::string_view name = line.substr(0, colon);
    std::string_view value = Trim(line.substr(colon + 1));
    if (EqualsIgnoringCase(name, "Content-Length")) {
      uint64_t length = 0;
      auto [end, error] =
          std::from_chars(value.data(), value.data() + value.size(), length);
      if (error != std::errc() || end != value.data() + value.size() ||
          length > kBodyLimit) {
        return result;
      }
      result.contentLength = length;
    } else if (EqualsIgnoringCase(name, "Transfer-Encoding")) {
      result.chunked = value.find("chunked") != std::string_view::npos;
    } else if (EqualsIgnoringCase(name, "SOAPAction")) {
      soapAction = value;
    }
  }
  std::size_t hash = soapAction.rfind('#');
  if (hash != std::string_view::npos) {
    result.action = std::string(soapAction.substr(hash + 1));
  } else {
    result.action = std::string(firstLine.substr(0, secondSpace));
  }
  result.valid = true;
  return result;
}

std::string ActionName(const HttpHead &head) {
  return head.valid ? head.action : "(unreadable)";
}

} // namespace

struct CountingRelay::Connection {
  UniqueFd client;
  UniqueFd upstream;
  bool upstreamConnected = false;
  Clock::time_point lastActivity = Clock::now();

  // Client to router. toUpstream holds the stream's bytes [sent, received).
  std::string toUpstream;
  uint64_t received = 0;
  uint64_t sent = 0;
  bool clientEof = false;
  bool upstreamWriteShut = false;

  // Reading the client's stream: a request head starting at cursor (not yet
  // complete), a body of which bodyLeft bytes from cursor on are still to
  // come, or (after a chunked body, which miniupnpc never sends) nothing
  // read any more.
  enum class Parse { kHead, kBody, kOpaque };
  Parse parse = Parse::kHead;
  uint64_t cursor = 0;
  uint64_t scanned = 0; // where the search for the head's end goes on
  uint64_t bodyLeft = 0;
  // Requests held back until their time: where each starts in the stream.
  struct Held {
    uint64_t start;
    Clock::time_point release;
  };
  std::deque<Held> held;

  // Router to client. The replies are read to know when each is complete:
  // a head being read (replyHead so far), a body with replyBodyLeft bytes
  // to come, or a reply that lasts until the router closes (no length).
  std::string toClient;
  bool upstreamEof = false;
  enum class Reply { kHead, kBody, kToEnd };
  Reply reply = Reply::kHead;
  std::string replyHead;
  uint64_t replyBodyLeft = 0;
  // Requests read whose reply is not complete, in order: their action and
  // when they were let through to the router.
  struct Awaited {
    std::string action;
    Clock::time_point passedOn;
  };
  std::deque<Awaited> awaiting;
  int countedInFlight = 0; // awaiting.size() as last added to mInFlight

  // The end of what may go to the router now: nothing of a head still being
  // read, nothing of a request still held back.
  uint64_t SendLimit(Clock::time_point now) {
    while (!held.empty() && held.front().release <= now) {
      held.pop_front();
    }
    uint64_t limit = received;
    if (parse == Parse::kHead) {
      limit = std::min(limit, cursor);
    }
    if (!held.empty()) {
      limit = std::min(limit, held.front().start);
    }
    return limit;
  }
};

std::unique_ptr<CountingRelay> CountingRelay::Start(const sockaddr_in &upstream,
                                                    uint32_t mark,
                                                    std::string &error) {
  UniqueFd listenFd(
      ::socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
  if (!listenFd.Valid()) {
    error = std::string("socket: ") + std::strerror(errno);
    return nullptr;
  }
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof(address);
  if (::bind(listenFd.Get(), reinterpret_cast<sockaddr *>(&address),
             sizeof(address)) != 0 ||
      ::listen(listenFd.Get(), 64) != 0 ||
      ::getsockname(listenFd.Get(), reinterpret_cast<sockaddr *>(&address),
                    &length) != 0) {
    error = std::string("listening on 127.0.0.1: ") + std::strerror(errno);
    return nullptr;
  }
  UniqueFd stopFd(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!stopFd.Valid()) {
    error = std::string("eventfd: ") + std::strerror(errno);
    return nullptr;
  }
  auto relay = std::make_unique<CountingRelay>(
      PassKey{}, std::move(listenFd), std::move(stopFd),
      ntohs(address.sin_port), upstream, mark);
  try {
    relay->mThread = std::thread([raw = relay.get()] { raw->Run(); });
  } catch (const std::system_error &e) {
    error = std::string("thread: ") + e.what();
    return nullptr;
  }
  return relay;
}

CountingRelay::CountingRelay(PassKey, UniqueFd listenFd, UniqueFd stopFd,
                             uint16_t port, const sockaddr_in &upstream,
                             uint32_t mark)
    : mListenFd(std::move(listenFd)), mStopFd(std::move(stopFd)), mPort(port),
      mUpstream(upstream), mMark(mark) {}

CountingRelay::~CountingRelay() {
  if (mThread.joinable()) {
    uint64_t one = 1;
    (void)!::write(mStopFd.Get(), &one, sizeof(one));
    mThread.join();
  }
}

RelayCounts CountingRelay::Take() {
  std::lock_guard<std::mutex> lock(mCountsMutex);
  RelayCounts taken = std::move(mCounts);
  mCounts = RelayCounts{};
  mCounts.maxInFlight = mInFlight;
  return taken;
}

void CountingRelay::SyncInFlight(Connection &connection) {
  const int awaiting = static_cast<int>(connection.awaiting.size());
  const int change = awaiting - connection.countedInFlight;
  if (change == 0) {
    return;
  }
  connection.countedInFlight = awaiting;
  std::lock_guard<std::mutex> lock(mCountsMutex);
  mInFlight += change;
  mCounts.maxInFlight = std::max(mCounts.maxInFlight, mInFlight);
}

void CountingRelay::ReplyComplete(Connection &connection) {
  if (connection.awaiting.empty()) {
    return;
  }
  const Connection::Awaited done = std::move(connection.awaiting.front());
  connection.awaiting.pop_front();
  const double seconds =
      std::chrono::duration<double>(Clock::now() - done.passedOn).count();
  {
    std::lock_guard<std::mutex> lock(mCountsMutex);
    mCounts.routerSecondsByAction[done.action] += seconds;
  }
  SyncInFlight(connection);
}

bool CountingRelay::ParseFromRouter(Connection &c, std::string_view data) {
  while (!data.empty()) {
    switch (c.reply) {
    case Connection::Reply::kToEnd:
      return true;
    case Connection::Reply::kBody: {
      const uint64_t take = std::min<uint64_t>(c.replyBodyLeft, data.size());
      c.replyBodyLeft -= take;
      data.remove_prefix(static_cast<std::size_t>(take));
      if (c.replyBodyLeft == 0) {
        c.reply = Connection::Reply::kHead;
        ReplyComplete(c);
      }
      break;
    }
    case Connection::Reply::kHead: {
      const std::size_t had = c.replyHead.size();
      c.replyHead.append(data);
      const std::size_t end =
          c.replyHead.find(kHeadEnd, had >= 3 ? had - 3 : 0);
      if (end == std::string::npos) {
        return c.replyHead.size() <= kHeadLimit;
      }
      const std::size_t headLength = end + kHeadEnd.size();
      data.remove_prefix(headLength - had);
      HttpHead read = ReadHead(std::string_view(c.replyHead).substr(0, end));
      c.replyHead.clear();
      if (!read.valid) {
        return false;
      }
      if (read.status >= 100 && read.status < 200) {
        break; // "100 Continue": the reply proper follows
      }
      if (read.chunked || !read.contentLength) {
        c.reply = Connection::Reply::kToEnd;
      } else if (*read.contentLength == 0) {
        ReplyComplete(c);
      } else {
        c.reply = Connection::Reply::kBody;
        c.replyBodyLeft = *read.contentLength;
      }
      break;
    }
    }
  }
  return true;
}

void CountingRelay::CountRequest(const std::string &action) {
  std::lock_guard<std::mutex> lock(mCountsMutex);
  ++mCounts.requests;
  ++mCounts.byAction[action];
}

void CountingRelay::Accept() {
  for (;;) {
    UniqueFd client(::accept4(mListenFd.Get(), nullptr, nullptr,
                              SOCK_NONBLOCK | SOCK_CLOEXEC));
    if (!client.Valid()) {
      return; // EAGAIN, or an error the next poll reports again
    }
    if (mConnections.size() >= static_cast<std::size_t>(kMaxConnections)) {
      std::lock_guard<std::mutex> lock(mCountsMutex);
      ++mCounts.refused;
      continue;
    }
    auto connection = std::make_unique<Connection>();
    connection->client = std::move(client);
    connection->upstream = UniqueFd(
        ::socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
    bool started = connection->upstream.Valid() &&
                   ::setsockopt(connection->upstream.Get(), SOL_SOCKET, SO_MARK,
                                &mMark, sizeof(mMark)) == 0;
    if (started) {
      int rc = ::connect(connection->upstream.Get(),
                         reinterpret_cast<const sockaddr *>(&mUpstream),
                         sizeof(mUpstream));
      connection->upstreamConnected = rc == 0;
      started = rc == 0 || errno == EINPROGRESS;
    }
    std::lock_guard<std::mutex> lock(mCountsMutex);
    if (!started) {
      ++mCounts.upstreamFailures;
      continue;
    }
    ++mCounts.connections;
    const int key = connection->client.Get();
    mConnections.emplace(key, std::move(connection));
  }
}

bool CountingRelay::ParseFromClient(Connection &c) {
  for (;;) {
    switch (c.parse) {
    case Connection::Parse::kOpaque:
      return true;
    case Connection::Parse::kBody: {
      uint64_t take = std::min(c.bodyLeft, c.received - c.cursor);
      c.cursor += take;
      c.bodyLeft -= take;
      if (c.bodyLeft > 0) {
        return true;
      }
      c.parse = Connection::Parse::kHead;
      c.scanned = c.cursor;
      break;
    }
    case Connection::Parse::kHead: {
      if (c.received == c.cursor) {
        return true;
      }
      // The head lies in toUpstream from index cursor - sent: nothing of it
      // has been sent, as SendLimit stops at the cursor while a head is read.
      const uint64_t base = c.sent;
      std::string_view buffered(c.toUpstream);
      const uint64_t from =
          std::max(c.cursor, c.scanned >= 3 ? c.scanned - 3 : 0);
      std::size_t end = buffered.find(kHeadEnd, from - base);
      if (end == std::string_view::npos) {
        c.scanned = c.received;
        return c.received - c.cursor <= kHeadLimit;
      }
      const uint64_t headEnd = base + end + kHeadEnd.size();
      std::string_view head =
          buffered.substr(c.cursor - base, headEnd - c.cursor);
      HttpHead read = ReadHead(head);
      CountRequest(ActionName(read));
      const auto delay = std::chrono::milliseconds(mDelayMs.load());
      const Clock::time_point passedOn = Clock::now() + delay;
      if (delay.count() > 0) {
        c.held.push_back({c.cursor, passedOn});
      }
      c.awaiting.push_back({ActionName(read), passedOn});
      SyncInFlight(c);
      if (!read.valid) {
        std::lock_guard<std::mutex> lock(mCountsMutex);
        ++mCounts.malformed;
        return false;
      }
      c.cursor = headEnd;
      c.scanned = headEnd;
      if (read.chunked) {
        c.parse = Connection::Parse::kOpaque;
      } else if (read.contentLength.value_or(0) > 0) {
        c.parse = Connection::Parse::kBody;
        c.bodyLeft = *read.contentLength;
      }
      break;
    }
    }
  }
}

bool CountingRelay::Pump(Connection &c, short clientEvents,
                         short upstreamEvents) {
  const Clock::time_point now = Clock::now();
  if (!c.upstreamConnected && upstreamEvents != 0) {
    int error = 0;
    socklen_t length = sizeof(error);
    if (::getsockopt(c.upstream.Get(), SOL_SOCKET, SO_ERROR, &error, &length) !=
            0 ||
        error != 0) {
      std::lock_guard<std::mutex> lock(mCountsMutex);
      ++mCounts.upstreamFailures;
      return false;
    }
    c.upstreamConnected = true;
    c.lastActivity = now;
  }
  char buffer[16384];
  if ((clientEvents & (POLLIN | POLLHUP | POLLERR)) != 0 && !c.clientEof &&
      c.toUpstream.size() < kBufferLimit) {
    ssize_t got = ::recv(c.client.Get(), buffer, sizeof(buffer), 0);
    if (got > 0) {
      c.toUpstream.append(buffer, static_cast<std::size_t>(got));
      c.received += static_cast<uint64_t>(got);
      c.lastActivity = now;
      if (!ParseFromClient(c)) {
        return false;
      }
    } else if (got == 0) {
      c.clientEof = true;
    } else if (errno != EAGAIN && errno != EINTR) {
      return false;
    }
  }
  if (c.upstreamConnected &&
      (upstreamEvents & (POLLIN | POLLHUP | POLLERR)) != 0 && !c.upstreamEof &&
      c.toClient.size() < kBufferLimit) {
    ssize_t got = ::recv(c.upstream.Get(), buffer, sizeof(buffer), 0);
    if (got > 0) {
      c.toClient.append(buffer, static_cast<std::size_t>(got));
      c.lastActivity = now;
      if (!ParseFromRouter(
              c, std::string_view(buffer, static_cast<std::size_t>(got)))) {
        std::lock_guard<std::mutex> lock(mCountsMutex);
        ++mCounts.malformed;
        return false;
      }
    } else if (got == 0) {
      c.upstreamEof = true;
      // Whatever was still awaited has ended with the connection.
      c.awaiting.clear();
      SyncInFlight(c);
    } else if (errno != EAGAIN && errno != EINTR) {
      return false;
    }
  }
  if (c.upstreamConnected) {
    const uint64_t limit = c.SendLimit(now);
    if (limit > c.sent) {
      ssize_t put = ::send(c.upstream.Get(), c.toUpstream.data(),
                           static_cast<std::size_t>(limit - c.sent),
                           MSG_NOSIGNAL | MSG_DONTWAIT);
      if (put > 0) {
        c.toUpstream.erase(0, static_cast<std::size_t>(put));
        c.sent += static_cast<uint64_t>(put);
        c.lastActivity = now;
      } else if (put < 0 && errno != EAGAIN && errno != EINTR) {
        return false;
      }
    }
    if (c.clientEof && c.sent == c.received && !c.upstreamWriteShut) {
      ::shutdown(c.upstream.Get(), SHUT_WR);
      c.upstreamWriteShut = true;
    }
  }
  if (!c.toClient.empty()) {
    ssize_t put = ::send(c.client.Get(), c.toClient.data(), c.toClient.size(),
                         MSG_NOSIGNAL | MSG_DONTWAIT);
    if (put > 0) {
      c.toClient.erase(0, static_cast<std::size_t>(put));
      c.lastActivity = now;
    } else if (put < 0 && errno != EAGAIN && errno != EINTR) {
      return false;
    }
  }
  // The router has answered and closed: once its reply is passed on, the
  // exchange is over (whatever the client still sends has nowhere to go).
  if (c.upstreamEof && c.toClient.empty()) {
    return false;
  }
  // A client that closed before its request was passed on, with nothing
  // held back: nothing more will happen.
  if (c.clientEof && c.received == 0) {
    return false;
  }
  return now - c.lastActivity < kIdleLimit;
}

void CountingRelay::Run() {
  std::vector<pollfd> fds;
  std::vector<int> keys;
  for (;;) {
    fds.clear();
    keys.clear();
    fds.push_back({mStopFd.Get(), POLLIN, 0});
    fds.push_back({mListenFd.Get(), POLLIN, 0});
    const Clock::time_point now = Clock::now();
    Clock::time_point wake = now + std::chrono::seconds(1);
    for (auto &[key, c] : mConnections) {
      short clientEvents = 0;
      short upstreamEvents = 0;
      if (!c->clientEof && c->toUpstream.size() < kBufferLimit) {
        clientEvents |= POLLIN;
      }
      if (!c->toClient.empty()) {
        clientEvents |= POLLOUT;
      }
      if (!c->upstreamConnected) {
        upstreamEvents |= POLLOUT;
      } else {
        if (!c->upstreamEof && c->toClient.size() < kBufferLimit) {
          upstreamEvents |= POLLIN;
        }
        if (c->SendLimit(now) > c->sent) {
          upstreamEvents |= POLLOUT;
        }
      }
      if (!c->held.empty()) {
        wake = std::min(wake, c->held.front().release);
      }
      keys.push_back(key);
      fds.push_back({c->client.Get(), clientEvents, 0});
      fds.push_back({c->upstream.Get(), upstreamEvents, 0});
    }
    const auto wait = std::chrono::ceil<std::chrono::milliseconds>(wake - now);
    int ready = ::poll(fds.data(), fds.size(),
                       static_cast<int>(std::max<long long>(0, wait.count())));
    if (ready < 0 && errno != EINTR) {
      break;
    }
    if (fds[0].revents != 0) {
      break;
    }
    // Every connection is looked at on each round: a request held back
    // may have come due without any descriptor being ready.
    for (std::size_t i = 0; i < keys.size(); ++i) {
      auto found = mConnections.find(keys[i]);
      Connection &c = *found->second;
      if (!Pump(c, fds[2 + 2 * i].revents, fds[3 + 2 * i].revents)) {
        c.awaiting.clear();
        SyncInFlight(c);
        mConnections.erase(found);
      }
    }
    if (fds[1].revents != 0) {
      Accept();
    }
  }
  for (auto &[key, c] : mConnections) {
    c->awaiting.clear();
    SyncInFlight(*c);
  }
  mConnections.clear();
}

} // namespace zark::bench
