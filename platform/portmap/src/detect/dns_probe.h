// The fifth check of router detection: a name server is configured in
// /etc/resolv.conf and answers a lookup of a configured name
// ("dns_probe_name" in the library configuration) with an address. The
// lookup goes through c-ares to exactly the servers read from
// /etc/resolv.conf, every one asked at once on a channel of its own, so
// that its time is bounded to the millisecond; the system resolver's
// timeouts are whole seconds per server and try.
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

// Whether name may be looked up: labels of 1..63 bytes of printable
// characters (no space), 253 at most in all, one trailing dot allowed.
// c-ares would put any bytes on the wire; a configured name with a space
// in it is a mistake to report, not to send. Pure.
[[nodiscard]] bool IsValidDnsName(std::string_view name);

// DNS reply codes (RCODE) acted on, from RFC 1035 (checked against
// <arpa/nameser.h>'s ns_r_* in dns_probe.cpp, which this header keeps out
// of its includers for the macros it brings).
enum DnsRcode : int {
  kDnsNoError = 0,
  kDnsFormatError = 1,
  kDnsServerFailure = 2,
  kDnsNameError = 3, // NXDOMAIN: the name does not exist
  kDnsNotImplemented = 4,
  kDnsRefused = 5,
};

enum class DnsOutcome {
  kAnswered,    // a server answered with at least one address
  kNoAddress,   // answered "no error" without a readable A record
  kNameError,   // answered that the name does not exist
  kServerError, // answered with another error (refused, server failure), or
                // could not be reached (connection refused)
  kNoAnswer,    // nothing answered within the budget
  kFailed,      // nothing could be sent (logged)
};

[[nodiscard]] const char *DnsOutcomeName(DnsOutcome outcome);

struct DnsLookup {
  DnsOutcome outcome = DnsOutcome::kNoAnswer;
  std::string server; // the server whose answer this is
  int rcode = 0;
  std::vector<uint32_t> addresses; // host byte order
  std::string why;                 // one line for the log
};

// What server's reply to the A query says, from the status c-ares hands
// the query's callback (ares_query: ARES_SUCCESS, ARES_ENODATA,
// ARES_ENOTFOUND, ARES_ESERVFAIL, ARES_EREFUSED, ARES_EFORMERR,
// ARES_ENOTIMP, ARES_ETIMEOUT, ARES_ECONNREFUSED, ...) and the reply's
// bytes (empty when c-ares has none). The addresses are read with
// ares_parse_a_reply, CNAME chains followed:
//   ARES_SUCCESS with an A record       kAnswered, its addresses
//   ARES_SUCCESS without a readable one kNoAddress (also ARES_ENODATA)
//   ARES_ENOTFOUND                      kNameError, rcode 3
//   another RCODE, ARES_ECONNREFUSED    kServerError
//   ARES_ETIMEOUT, ARES_ECANCELLED      kNoAnswer
//   anything else                       kFailed
// Pure.
[[nodiscard]] DnsLookup ReadDnsAnswer(std::string_view server, int status,
                                      std::span<const uint8_t> reply);

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
  // A server that has not answered by then is asked once more
  // (ARES_OPT_TIMEOUTMS with ARES_OPT_TRIES 2; c-ares doubles the wait for
  // the second try, so a silent server is given up on after three times
  // this, or at the budget's end, whichever comes first).
  std::chrono::milliseconds resendAfter{500};
};

// One c-ares channel per server, each with that server alone; at most two
// queries per server, over UDP only.
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
