// The fifth check of router detection: a name server is configured in
// /etc/resolv.conf and answers a lookup of a configured name
// ("dns_probe_name" in the library configuration) with an address. The
// lookup is a DNS query of our own over UDP (RFC 1035), sent to every
// configured server at once, so that its time is bounded to the
// millisecond; the system resolver's timeouts are whole seconds per server
// and try.
#ifndef ZARK_PORTMAP_DNS_PROBE_H
#define ZARK_PORTMAP_DNS_PROBE_H

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

inline constexpr const char *kResolvConfPath = "/etc/resolv.conf";
// Looked up when the configuration names nothing else: a name that the
// IANA keeps resolvable for exactly this kind of use.
inline constexpr std::string_view kDefaultDnsProbeName = "example.com";
// The resolver library reads at most three name servers; so do we.
inline constexpr std::size_t kMaxNameServers = 3;

// The addresses of the "nameserver" lines of a resolv.conf text, in order,
// at most kMaxNameServers: IPv4 dotted quads and IPv6 addresses (a scope
// "%eth0" is not taken). Comments ("#", ";") and other lines are ignored.
// Pure.
[[nodiscard]] std::vector<std::string> ParseResolvConf(std::string_view text);

// A standard query (recursion desired) for the A record of name. Empty when
// name is not a valid name: labels of 1..63 bytes of printable characters,
// 253 at most in all, one trailing dot allowed. Pure.
[[nodiscard]] std::vector<uint8_t> BuildDnsQuery(uint16_t id,
                                                 std::string_view name);

// DNS reply codes (RCODE) acted on, from RFC 1035.
enum DnsRcode : int {
  kDnsNoError = 0,
  kDnsFormatError = 1,
  kDnsServerFailure = 2,
  kDnsNameError = 3, // NXDOMAIN: the name does not exist
  kDnsNotImplemented = 4,
  kDnsRefused = 5,
};

struct DnsReply {
  int rcode = 0;
  bool truncated = false;
  int answerRecords = 0;           // records in the answer section read
  std::vector<uint32_t> addresses; // its A records, host byte order
};

// Reads a reply to BuildDnsQuery(id, name). Nothing when bytes are not
// such a reply: too short, not a response, another id, another question,
// or malformed (names running past the end, compression pointers that do
// not point backwards, more than 16 of them). The answer section is read
// as far as it is whole. Pure.
[[nodiscard]] std::optional<DnsReply>
ParseDnsReply(std::span<const uint8_t> bytes, uint16_t id,
              std::string_view name);

enum class DnsOutcome {
  kAnswered,    // a server answered with at least one address
  kNoAddress,   // answered "no error" without an A record
  kNameError,   // answered that the name does not exist
  kServerError, // answered with another error (refused, server failure)
  kNoAnswer,    // nothing answered within the budget
  kFailed,      // nothing could be sent (logged)
};

[[nodiscard]] const char *DnsOutcomeName(DnsOutcome outcome);

struct DnsLookup {
  DnsOutcome outcome = DnsOutcome::kNoAnswer;
  std::string server; // the server whose answer this is
  int rcode = 0;
  std::vector<uint32_t> addresses;
  std::string why; // one line for the log
};

class DnsClient {
public:
  virtual ~DnsClient() = default;
  // Asks every server in servers (address texts) for name's A record at
  // once. The first answer with an address wins; when none comes within
  // budget, the most telling other outcome is answered (an error answer
  // before silence).
  [[nodiscard]] virtual DnsLookup Lookup(std::span<const std::string> servers,
                                         std::string_view name,
                                         std::chrono::milliseconds budget) = 0;
};

struct DnsClientOptions {
  uint16_t port = 53; // tests use another
  // Servers that have not answered by then are asked once more.
  std::chrono::milliseconds resendAfter{500};
};

// One connected UDP socket per server; at most two queries per server.
[[nodiscard]] std::unique_ptr<DnsClient>
MakeUdpDnsClient(DnsClientOptions options = {});

struct DnsCheck {
  bool ok = false;
  std::string why;
};

// resolvConf: the text of /etc/resolv.conf, nothing when it could not be
// read. Fails when it names no server, or no server answers the lookup of
// name with an address.
[[nodiscard]] DnsCheck CheckDns(const std::optional<std::string> &resolvConf,
                                std::string_view name, DnsClient &client,
                                std::chrono::milliseconds budget);

} // namespace zark::portmap

#endif
