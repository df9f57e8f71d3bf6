// A UDP responder on 127.0.0.1 for unit tests, on a thread of its own: each
// datagram received is handed to a handler that returns the replies to
// send back (none: stay silent). Stands in for a name server or an SSDP
// device. Every datagram is counted and kept.
#ifndef ZARK_TESTS_DETECT_UDP_RESPONDER_H
#define ZARK_TESTS_DETECT_UDP_RESPONDER_H

#include <cstdint>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace zark::test {

class UdpResponder {
public:
  using Bytes = std::vector<uint8_t>;
  using Handler = std::function<std::vector<Bytes>(const Bytes &request)>;

  explicit UdpResponder(Handler handler);
  ~UdpResponder();
  UdpResponder(const UdpResponder &) = delete;
  UdpResponder &operator=(const UdpResponder &) = delete;

  uint16_t Port() const { return mPort; }
  void SetHandler(Handler handler);
  int Received() const;
  std::vector<Bytes> Requests() const;

private:
  void Serve();

  int mFd = -1;
  int mWake[2] = {-1, -1};
  uint16_t mPort = 0;
  std::thread mThread;
  mutable std::mutex mMutex;
  Handler mHandler;
  std::vector<Bytes> mRequests;
};

// A name server: A queries for name get address (host byte order), other
// names NXDOMAIN.
UdpResponder::Handler DnsServer(std::string name, uint32_t address);

// An SSDP device answering every M-SEARCH with this LOCATION.
UdpResponder::Handler SsdpDevice(std::string location);

// The text of a byte vector / a byte vector of a text.
std::string Text(const UdpResponder::Bytes &bytes);
UdpResponder::Bytes Bytes(const std::string &text);

} // namespace zark::test

#endif
