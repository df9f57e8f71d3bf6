// The probe service: listens for request lines (probe_protocol.h), checks
// ports on the requester's own host (connect_back.h) and answers. One thread
// accepts; each connection is served by a session thread of its own, owned
// and joined by the server.
//
// Limits, all enforced before any work is done for a request:
//   - at most maxSessions connections at once, and maxSessionsPerAddress
//     from one address; more are answered "busy" and closed;
//   - a token bucket per address (ratePerSecond, burst): a request without
//     a token is answered "rate-limited" with the wait in retry_after_ms;
//   - a session waits at most idleTimeout for each request line, takes at
//     most maxRequestsPerSession requests, and ends at the first bad one;
//   - each answer is written within writeTimeout, or the session ends;
//   - each check is bounded by the ConnectBack's own timeouts.
#ifndef ZARK_PROBE_PROBE_SERVER_H
#define ZARK_PROBE_PROBE_SERVER_H

#include "connect_back.h"
#include "klibc_fd.h"
#include "rate_limiter.h"

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <list>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

namespace zark::probe {

using klibc::UniqueFd;

struct ServerOptions {
  // "a.b.c.d:port" or "[v6]:port"; port 0 picks a free port (see Ports()).
  std::vector<std::string> listen{"0.0.0.0:7777"};
  double ratePerSecond = 2.0;
  double burst = 60.0;
  std::size_t maxTrackedAddresses = 10000;
  int maxSessions = 64;
  int maxSessionsPerAddress = 8;
  int maxRequestsPerSession = 64;
  std::chrono::milliseconds idleTimeout{5000};
  std::chrono::milliseconds writeTimeout{2000};
};

// What the server has done, for tests and for the log at exit.
struct ServerCounters {
  long requests = 0;    // request lines read
  long checks = 0;      // checks handed to the ConnectBack
  long badRequests = 0; // lines that did not parse, or were too long
  long rateLimited = 0; // requests refused by the token bucket
  long busy = 0;        // connections or requests refused for a limit
};

// Splits "a.b.c.d:port" / "[v6]:port" into a socket address. Pure.
[[nodiscard]] bool ParseListenAddress(std::string_view text,
                                      sockaddr_storage &address,
                                      socklen_t &length);

class ProbeServer {
public:
  using TimeSource = std::function<std::chrono::steady_clock::time_point()>;
  using Logger = std::function<void(const std::string &)>;

  // connectBack must outlive the server. clock empty: steady_clock. log
  // empty: silent.
  ProbeServer(ServerOptions options, ConnectBack &connectBack,
              TimeSource clock = {}, Logger log = {});
  ProbeServer(const ProbeServer &) = delete;
  ProbeServer &operator=(const ProbeServer &) = delete;
  ~ProbeServer(); // Stop()

  // Binds every listen address and starts accepting. False, with error set,
  // when an address does not parse or cannot be bound; nothing then runs.
  [[nodiscard]] bool Start(std::string &error);
  // Stops accepting, ends every session (a check under way finishes first;
  // it is bounded) and joins all threads. Idempotent.
  void Stop();

  // The bound ports, in the order of options.listen.
  [[nodiscard]] std::vector<uint16_t> Ports() const;
  [[nodiscard]] ServerCounters Counters() const;

private:
  struct Session {
    std::thread thread;
    std::atomic<bool> done{false};
  };

  void AcceptLoop();
  void Accept(int listenFd);
  // Answers the request lines of one connection until it closes, idles,
  // breaks a limit or the server stops.
  void Serve(UniqueFd fd, sockaddr_storage peer, socklen_t peerLength,
             const std::string &key);
  enum class LineRead {
    kLine,    // line holds the next request line
    kTooLong, // no newline within kMaxRequestLine bytes
    kEnd,     // closed, idle past idleTimeout, failed, or Stop() was called
  };
  // Reads the next line of the connection fd, keeping what follows it in
  // pending for the next call.
  [[nodiscard]] LineRead ReadRequestLine(int fd, std::string &pending,
                                         std::string &line);
  // Takes a token of the key's bucket and counts the outcome.
  [[nodiscard]] RateLimiter::Decision TakeToken(const std::string &key,
                                                Request::Kind kind);
  // The answer to one well-formed request: a refusal of the rate limiter,
  // the peer's address, or the result of checking back on the peer.
  [[nodiscard]] std::string AnswerRequest(const Request &request,
                                          const sockaddr_storage &peer,
                                          socklen_t peerLength,
                                          const std::string &key);
  void Count(long ServerCounters::*counter);
  void ReapSessions(bool all);
  // Sends all of text on the socket fd, waiting while it is full, until
  // mOptions.writeTimeout has passed. Unlike klibc::WriteAll it never raises
  // SIGPIPE and gives up on a reader that stopped reading.
  [[nodiscard]] bool SendAll(int fd, std::string_view text);
  void Log(const std::string &line) const;
  [[nodiscard]] std::chrono::steady_clock::time_point Now() const;

  ServerOptions mOptions;
  ConnectBack &mConnectBack;
  TimeSource mClock;
  Logger mLog;

  std::vector<UniqueFd> mListenFds;
  std::vector<uint16_t> mPorts;
  UniqueFd mWakeFd; // eventfd, readable once Stop() was called
  std::thread mAcceptThread;
  bool mStarted = false;

  std::list<std::unique_ptr<Session>> mSessions; // accept thread only
  mutable std::mutex mMutex;                     // guards what follows
  std::map<std::string, int> mSessionsPerAddress;
  int mActiveSessions = 0;
  RateLimiter mLimiter;
  ServerCounters mCounters;
};

} // namespace zark::probe

#endif
