// What kind of IPv4 address an address is, as router detection needs to
// know it: an address on the internet, or one that only lives behind a NAT
// (a home network, or a carrier's shared space).
#ifndef ZARK_PORTMAP_IPV4_CLASS_H
#define ZARK_PORTMAP_IPV4_CLASS_H

#include <cstdint>

namespace zark::portmap {

enum class Ipv4Class {
  kPublic,    // routed on the internet
  kPrivate,   // RFC 1918: 10/8, 172.16/12, 192.168/16
  kSharedCgn, // RFC 6598: 100.64/10, carrier-grade NAT
  kLoopback,  // 127/8
  kLinkLocal, // 169.254/16
  kSpecial,   // 0/8, multicast 224/4, reserved 240/4 (broadcast included)
};

// The class of an address in host byte order. Pure.
[[nodiscard]] Ipv4Class ClassifyIpv4(uint32_t address);

// True for the addresses that sit behind a NAT: kPrivate and kSharedCgn.
[[nodiscard]] bool IsBehindNat(uint32_t address);

// "public", "private", "carrier-grade NAT", "loopback", "link-local",
// "special", for log lines.
[[nodiscard]] const char *Ipv4ClassName(Ipv4Class kind);

} // namespace zark::portmap

#endif
