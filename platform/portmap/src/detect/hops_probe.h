// The fourth check of router detection: how many hops lie between the
// server and the first public address on the way to the WAN host that the
// third check reached. Found like traceroute: UDP datagrams with rising
// TTL, each router on the way answering with an ICMP "time exceeded" and
// the destination with "port unreachable". The system prober reads those
// answers from the socket's error queue (IP_RECVERR), which needs no
// privilege: no raw socket, no capability.
//
// A home network has one private hop (the router). Two or more mean a
// router behind a router, or a carrier that puts its customers behind its
// own NAT (100.64.0.0/10): forwarded ports then do not reach the server
// from the internet.
#ifndef ZARK_PORTMAP_HOPS_PROBE_H
#define ZARK_PORTMAP_HOPS_PROBE_H

#include <chrono>
#include <cstdint>
#include <memory>
#include <span>
#include <string>
#include <vector>

namespace zark::portmap {

// One answer to a probe.
struct HopReply {
  int ttl = 0;              // the TTL of the probe answered
  uint32_t responder = 0;   // who answered, host byte order
  bool destination = false; // the destination itself answered
  friend bool operator==(const HopReply &, const HopReply &) = default;
};

struct HopLimits {
  int maxTtl = 8; // probes go out with TTL 1..maxTtl
  std::chrono::milliseconds budget{800};
  // Probes still unanswered by then are sent once more (an ICMP answer can
  // be lost, and routers limit how many they send).
  std::chrono::milliseconds resendAfter{250};
  // Probe k goes to port basePort + k (traceroute's ports: nothing listens
  // there, so the destination answers "port unreachable").
  uint16_t basePort = 33434;
};

class HopProber {
public:
  virtual ~HopProber() = default;
  // Probes the path to destination (host byte order) and returns the
  // answers received before the answers settle the count (HopsSettled) or
  // the budget runs out, in the order received. Empty when nothing
  // answered or nothing could be sent (logged).
  [[nodiscard]] virtual std::vector<HopReply>
  Probe(uint32_t destination, const HopLimits &limits) = 0;
};

// UDP probes with IP_TTL and IP_RECVERR on one socket, all TTLs sent at
// once; at most 2 * maxTtl datagrams per run.
[[nodiscard]] std::unique_ptr<HopProber> MakeUdpHopProber();

// True when replies already say all there is to know: for the lowest TTL t
// answered by a public address, or failing that by the destination, every
// TTL below t has answered. Pure.
[[nodiscard]] bool HopsSettled(std::span<const HopReply> replies);

struct HopsFinding {
  bool known = false;
  int hops = 0;                 // hops before the first public address
  bool carrierGradeNat = false; // one of them is in 100.64.0.0/10
  std::string path;             // "1 192.168.1.1, 2 *, 3 203.0.113.1"
  std::string why;              // one line for the log
};

// What the replies say. The first public address is the lowest TTL whose
// responder is public (the destination counts); the hops before it are
// counted whether they answered or stayed silent. Unknown when no public
// address answered within maxTtl. Pure.
[[nodiscard]] HopsFinding InterpretHops(std::span<const HopReply> replies,
                                        int maxTtl);

} // namespace zark::portmap

#endif
