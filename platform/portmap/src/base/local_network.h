// Which addresses count as "our local network" when a router tells us where
// to send requests, and which of our addresses the router sees.
//
// A UPnP root description names the URL that receives the SOAP requests
// (its control URL). A hostile or broken device on the LAN can answer the
// discovery and name any host there, also one on the internet or the server
// itself; we would then send requests on its behalf. So a control URL (and
// the description URL itself) is used only when its host is a literal IPv4
// address on the subnet of one of our non-loopback interfaces, or the
// gateway itself.
#ifndef ZARK_PORTMAP_LOCAL_NETWORK_H
#define ZARK_PORTMAP_LOCAL_NETWORK_H

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

// An IPv4 network: address and mask, both in host byte order.
struct Ipv4Network {
  uint32_t address = 0;
  uint32_t mask = 0;
  friend bool operator==(const Ipv4Network &, const Ipv4Network &) = default;
};

// The IPv4 address of a dotted-quad text ("192.168.1.1"), host byte order.
// Nothing for anything else: names, IPv6, fewer or more parts, blanks.
[[nodiscard]] std::optional<uint32_t> ParseIpv4(std::string_view text);

// The dotted-quad text of an address in host byte order.
[[nodiscard]] std::string FormatIpv4(uint32_t address);

// The host part of an "http://" URL, cut exactly as miniupnpc cuts it
// before it connects: the text after "://" up to the first ":" or "/"
// (whichever comes first). Nothing when the URL does not start with
// "http://", has no "/" after the host, or names an IPv6 literal ("[").
// The host is returned as text; whether it is an address is for the caller.
[[nodiscard]] std::optional<std::string> UrlHost(std::string_view url);

// True when host is a literal IPv4 address (ParseIpv4) that equals gateway
// (when gateway is given) or lies in one of networks (a network with mask 0
// counts for nothing: a default route is not a subnet). Pure.
[[nodiscard]] bool IsOnLocalNetwork(std::string_view host,
                                    std::span<const Ipv4Network> networks,
                                    std::optional<uint32_t> gateway);

// The same for the host of url (UrlHost); false when it has none.
[[nodiscard]] bool IsUrlOnLocalNetwork(std::string_view url,
                                       std::span<const Ipv4Network> networks,
                                       std::optional<uint32_t> gateway);

// The IPv4 networks of the machine's interfaces that are up, loopback
// interfaces left out (getifaddrs). Empty, logged, when they cannot be read.
[[nodiscard]] std::vector<Ipv4Network> InterfaceNetworks();

// The local address the kernel would use to reach destination (a UDP socket
// connected to it and asked for its name; nothing is sent). Nothing, logged,
// when there is no route.
[[nodiscard]] std::optional<std::string>
LocalAddressTowards(std::string_view destination);

} // namespace zark::portmap

#endif
