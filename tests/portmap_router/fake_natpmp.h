// A fake NAT-PMP router (RFC 6886) on 127.0.0.1 for unit tests: a UDP
// responder on a thread of its own that keeps a mapping table like a
// router (mapping, unmapping with lifetime 0, another public port when the
// asked one is taken) or answers from a handler a test installs. It can be
// told to stay silent. Every request is counted.
#ifndef ZARK_TESTS_PORTMAP_ROUTER_FAKE_NATPMP_H
#define ZARK_TESTS_PORTMAP_ROUTER_FAKE_NATPMP_H

#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>
#include <thread>
#include <vector>

namespace zark::test {

struct NatPmpRequest {
  uint8_t opcode = 0; // 0 public address, 1 map UDP, 2 map TCP
  uint16_t privatePort = 0;
  uint16_t publicPort = 0;
  uint32_t lifetime = 0;
};

class FakeNatPmp {
public:
  struct Mapping {
    uint8_t opcode = 0; // 1 UDP, 2 TCP
    uint16_t privatePort = 0;
    uint16_t publicPort = 0;
    uint32_t lifetime = 0;
    friend bool operator==(const Mapping &, const Mapping &) = default;
  };
  // Returns the reply's bytes, or nothing to let the built-in router answer.
  // An empty vector sends nothing.
  using Handler =
      std::function<std::optional<std::vector<uint8_t>>(const NatPmpRequest &)>;

  FakeNatPmp();
  ~FakeNatPmp();
  FakeNatPmp(const FakeNatPmp &) = delete;
  FakeNatPmp &operator=(const FakeNatPmp &) = delete;

  uint16_t Port() const { return mPort; }
  void SetHandler(Handler handler);
  void SetSilent(bool silent);
  // A public port some other device holds: the router gives another one.
  void TakePublicPort(uint8_t opcode, uint16_t port);
  // Grants at most this lifetime to a mapping (nothing: what was asked).
  void SetGrantedLifetime(std::optional<uint32_t> seconds);

  int Requests() const;
  std::vector<NatPmpRequest> ReceivedRequests() const;
  std::vector<Mapping> Table() const;

  // A reply in the wire format: version 0, opcode 128 + request opcode.
  static std::vector<uint8_t> MappingReply(uint8_t opcode, uint16_t result,
                                           uint16_t privatePort,
                                           uint16_t publicPort,
                                           uint32_t lifetime);

private:
  void Serve();
  std::vector<uint8_t> BuiltIn(const NatPmpRequest &request);

  int mFd = -1;
  int mWakeRead = -1;
  int mWakeWrite = -1;
  uint16_t mPort = 0;
  std::thread mThread;

  mutable std::mutex mMutex;
  Handler mHandler;
  bool mSilent = false;
  std::vector<Mapping> mTable;
  std::vector<std::pair<uint8_t, uint16_t>> mTaken;
  std::vector<NatPmpRequest> mRequests;
  std::optional<uint32_t> mGrantedLifetime;
};

} // namespace zark::test

#endif
