#include "base/ipv4_class.h"

namespace zark::portmap {
namespace {

constexpr bool InNetwork(uint32_t address, uint32_t network, int prefix) {
  const uint32_t mask = prefix == 0 ? 0 : ~uint32_t{0} << (32 - prefix);
  return (address & mask) == network;
}

} // namespace

Ipv4Class ClassifyIpv4(uint32_t address) {
  if (InNetwork(address, 0x0A000000, 8) ||  // 10.0.0.0/8
      InNetwork(address, 0xAC100000, 12) || // 172.16.0.0/12
      InNetwork(address, 0xC0A80000, 16)) { // 192.168.0.0/16
    return Ipv4Class::kPrivate;
  }
  if (InNetwork(address, 0x64400000, 10)) { // 100.64.0.0/10
    return Ipv4Class::kSharedCgn;
  }
  if (InNetwork(address, 0x7F000000, 8)) {
    return Ipv4Class::kLoopback;
  }
  if (InNetwork(address, 0xA9FE0000, 16)) {
    return Ipv4Class::kLinkLocal;
  }
  if (InNetwork(address, 0x00000000, 8) || InNetwork(address, 0xE0000000, 4) ||
      InNetwork(address, 0xF0000000, 4)) {
    return Ipv4Class::kSpecial;
  }
  return Ipv4Class::kPublic;
}

bool IsBehindNat(uint32_t address) {
  const Ipv4Class kind = ClassifyIpv4(address);
  return kind == Ipv4Class::kPrivate || kind == Ipv4Class::kSharedCgn;
}

const char *Ipv4ClassName(Ipv4Class kind) {
  switch (kind) {
  case Ipv4Class::kPublic:
    return "public";
  case Ipv4Class::kPrivate:
    return "private";
  case Ipv4Class::kSharedCgn:
    return "carrier-grade NAT";
  case Ipv4Class::kLoopback:
    return "loopback";
  case Ipv4Class::kLinkLocal:
    return "link-local";
  case Ipv4Class::kSpecial:
    return "special";
  }
  return "special";
}

} // namespace zark::portmap
