// Loopback helpers of the probe service tests: a TCP client bound to a
// chosen 127.x address, bounded line reads, small listeners standing in for
// the requester's own ports.
#ifndef ZARK_TESTS_PROBE_PROBE_TEST_SUPPORT_H
#define ZARK_TESTS_PROBE_PROBE_TEST_SUPPORT_H

#include <atomic>
#include <chrono>
#include <cstdint>
#include <string>
#include <thread>

namespace zark::probe::test {

// A port on which nothing listens right now (TCP and UDP, any 127.x).
uint16_t UnusedPort();

// A connected TCP socket from `from` (a 127.x address) to 127.0.0.1:port;
// -1 when it fails.
int ConnectFrom(const std::string &from, uint16_t port);

// Sends text whole. False when the peer is gone.
bool SendAll(int fd, const std::string &text);

// Reads up to and including "\n", waiting at most timeout in all. The line
// without "\n"; "<eof>" when the peer closed first, "<timeout>" when the
// wait ran out.
std::string
ReadLine(int fd,
         std::chrono::milliseconds timeout = std::chrono::milliseconds(10000));

// One request on a fresh connection from `from`; the answer line.
std::string Ask(const std::string &from, uint16_t port,
                const std::string &request);

// What a listener does with each TCP connection or UDP datagram.
enum class Behaviour {
  kWriteToken,  // TCP: "<token>\n"; UDP: "<token> <nonce>\n"
  kWriteOther,  // TCP: "other\n"; UDP: "other\n"
  kCloseAtOnce, // TCP: close without a byte; UDP: nothing
  kStaySilent,  // TCP: keep the connection, write nothing; UDP: nothing
  kEcho,        // UDP: send the datagram back
};

// A TCP or UDP listener on address:port serving on a thread of its own
// until destroyed (joined). Counts what it saw.
class TestListener {
public:
  TestListener(bool tcp, const std::string &address, uint16_t port,
               Behaviour behaviour, std::string token = "");
  TestListener(const TestListener &) = delete;
  TestListener &operator=(const TestListener &) = delete;
  ~TestListener();
  bool Ok() const { return mFd >= 0; }
  int Seen() const { return mSeen.load(); }

private:
  void Serve();
  bool mTcp;
  Behaviour mBehaviour;
  std::string mToken;
  int mFd = -1;
  int mWake[2] = {-1, -1};
  std::atomic<int> mSeen{0};
  std::thread mThread;
};

} // namespace zark::probe::test

#endif
