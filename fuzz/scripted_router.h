// A router whose every reply comes from the fuzzer: an HTTP server for UPnP
// (root description and SOAP replies) and a UDP responder for NAT-PMP, both
// on 127.0.0.1, each on a thread of its own. Unlike the unit tests' fake
// routers they understand nothing: the n-th request gets the n-th scripted
// reply, byte for byte, and once the script is used up a fallback that ends
// the exchange at once. Requests are recorded so that a target can check
// what the driver asked before it believed an answer.
#ifndef ZARK_FUZZ_SCRIPTED_ROUTER_H
#define ZARK_FUZZ_SCRIPTED_ROUTER_H

#include <cstdint>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace zark::fuzz {

// What an HTTP request asked: "GET /rootDesc.xml" or the SOAP action's name
// ("AddPortMapping").
struct HttpRequestSeen {
  std::string method;
  std::string path;
  std::string soapAction; // after "#", without quotes; empty for a GET
  std::string bodyAction; // the body's first "<u:" element, as miniupnpc
                          // writes the action there too
};

class ScriptedHttpRouter {
public:
  ScriptedHttpRouter();
  ~ScriptedHttpRouter();
  ScriptedHttpRouter(const ScriptedHttpRouter &) = delete;
  ScriptedHttpRouter &operator=(const ScriptedHttpRouter &) = delete;

  [[nodiscard]] uint16_t Port() const { return mPort; }

  // The replies to the next requests, in order: the whole bytes sent back
  // on the connection, which is then closed. Once they are used up, each
  // request is read and its connection closed without a byte. Forgets the
  // requests seen.
  void Script(std::vector<std::string> replies);
  [[nodiscard]] std::vector<HttpRequestSeen> Seen() const;

private:
  void Serve();
  void Answer(int fd);

  int mListenFd = -1;
  int mWakeRead = -1;
  int mWakeWrite = -1;
  uint16_t mPort = 0;
  std::thread mThread;

  mutable std::mutex mMutex;
  std::vector<std::string> mReplies;
  std::size_t mNext = 0;
  std::vector<HttpRequestSeen> mSeen;
};

// One NAT-PMP request as received.
struct NatPmpRequestSeen {
  std::vector<uint8_t> bytes;
};

class ScriptedUdpRouter {
public:
  ScriptedUdpRouter();
  ~ScriptedUdpRouter();
  ScriptedUdpRouter(const ScriptedUdpRouter &) = delete;
  ScriptedUdpRouter &operator=(const ScriptedUdpRouter &) = delete;

  [[nodiscard]] uint16_t Port() const { return mPort; }

  // The datagrams that answer the next requests, in order; an empty one
  // sends nothing. Once they are used up, every request is answered with a
  // well-formed refusal (result 2, not authorized) of its own opcode.
  // Forgets the requests seen.
  void Script(std::vector<std::string> replies);
  [[nodiscard]] std::vector<NatPmpRequestSeen> Seen() const;

private:
  void Serve();

  int mFd = -1;
  int mWakeRead = -1;
  int mWakeWrite = -1;
  uint16_t mPort = 0;
  std::thread mThread;

  mutable std::mutex mMutex;
  std::vector<std::string> mReplies;
  std::size_t mNext = 0;
  std::vector<NatPmpRequestSeen> mSeen;
};

} // namespace zark::fuzz

#endif
