// A TCP relay that stands between the server and the router's UPnP HTTP
// port and counts what goes through it, for the rule-apply benchmark.
//
// The benchmark process runs in the test network's server namespace. An
// nftables rule there ("nat output ... redirect") sends every connection to
// the router's HTTP port to this relay, which listens on 127.0.0.1 and opens
// its own connection to the router for each one. Its upstream sockets carry
// a firewall mark (SO_MARK) so that the redirect rule leaves them alone.
// Everything in the namespace that speaks UPnP to the router (the library in
// this process, upnpc in a child process) is thus seen the same way,
// without either of them being told.
//
// What it counts:
//   - requests: HTTP request heads read from clients ("POST /ctl/IPConn
//     HTTP/1.1" ... blank line), by SOAP action (the part of the SOAPAction
//     header after '#') or, without one, by method and path;
//   - in flight: a request is in flight from the moment its head has been
//     read until its reply has come back whole from the router (by the
//     reply's Content-Length; without one, until the router closes). The
//     most requests in flight at the same time is reported. (Not the
//     router's closing: miniupnpc reads a reply by its length and may open
//     its next connection before the router's FIN has come through.)
//
// Optional delay: each request is held back for the given time before any
// of its bytes are passed on to the router (one delay per request; the
// replies are not delayed).
//
// Bounds: at most kMaxConnections connections at once (more are accepted
// and closed at once, and counted as refused), 1 MiB buffered per direction
// and connection (reading stops until it drains), 64 KiB per request head
// (a longer one closes the connection), and a connection idle for 30 s is
// closed. The relay's thread is owned and joined by the destructor.
#ifndef ZARK_BENCH_COUNTING_RELAY_H
#define ZARK_BENCH_COUNTING_RELAY_H

#include "base/unique_fd.h"

#include <netinet/in.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <thread>

namespace zark::bench {

struct RelayCounts {
  int connections = 0;      // client connections accepted and relayed
  int refused = 0;          // connections closed for going over the bound
  int upstreamFailures = 0; // connections to the router that failed
  int malformed = 0;        // request heads that could not be read
  int requests = 0;         // HTTP requests seen
  int maxInFlight = 0;      // most requests in flight at the same time
  std::map<std::string, int> byAction; // requests by SOAP action or path
  // Time the router took over the requests of each kind, in all: from
  // letting the request through (after the delay) to its whole reply.
  std::map<std::string, double> routerSecondsByAction;
};

class CountingRelay {
public:
  static constexpr int kMaxConnections = 64;

  // Starts the relay on 127.0.0.1 (a port of the kernel's choice) towards
  // upstream, its upstream sockets marked with mark. Null, with error set,
  // when the listening socket or the thread cannot be made.
  [[nodiscard]] static std::unique_ptr<CountingRelay>
  Start(const sockaddr_in &upstream, uint32_t mark, std::string &error);

  CountingRelay(const CountingRelay &) = delete;
  CountingRelay &operator=(const CountingRelay &) = delete;
  // Stops the thread, joins it and closes every connection.
  ~CountingRelay();

  [[nodiscard]] uint16_t Port() const { return mPort; }

  // Delay applied to each request from now on (0: none).
  void SetDelay(std::chrono::milliseconds delay) {
    mDelayMs.store(delay.count());
  }

  // The counts since the last call (or the start), and starts counting
  // afresh. maxInFlight starts again from the requests in flight now.
  [[nodiscard]] RelayCounts Take();

private:
  struct Connection;
  // Only Start makes a relay.
  struct PassKey {
    explicit PassKey() = default;
  };

public:
  CountingRelay(PassKey, zark::portmap::UniqueFd listenFd,
                zark::portmap::UniqueFd stopFd, uint16_t port,
                const sockaddr_in &upstream, uint32_t mark);

private:
  void Run();
  void Accept();
  // Moves the bytes of one connection as far as they can go now. False when
  // the connection is finished (or broken) and must be closed.
  bool Pump(Connection &connection, short clientEvents, short upstreamEvents);
  // Reads request heads out of the bytes the client sent. False when a head
  // cannot be read.
  bool ParseFromClient(Connection &connection);
  // Reads reply heads and bodies out of what the router sent, to see when
  // each reply is complete. False when a head cannot be read.
  bool ParseFromRouter(Connection &connection, std::string_view data);
  void ReplyComplete(Connection &connection);
  void CountRequest(const std::string &action);
  // Brings mInFlight up to date with the connection's awaited replies.
  void SyncInFlight(Connection &connection);

  zark::portmap::UniqueFd mListenFd;
  zark::portmap::UniqueFd mStopFd; // an eventfd: readable when stopping
  uint16_t mPort;
  sockaddr_in mUpstream;
  uint32_t mMark;
  std::atomic<long long> mDelayMs{0};

  std::mutex mCountsMutex;
  RelayCounts mCounts;
  int mInFlight = 0; // guarded by mCountsMutex

  // Owned by the relay's thread.
  std::map<int, std::unique_ptr<Connection>> mConnections;
  std::thread mThread;
};

} // namespace zark::bench

#endif
