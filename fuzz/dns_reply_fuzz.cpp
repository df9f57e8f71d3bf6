// Fuzz target of the DNS reply reader of router detection (ParseDnsReply):
// any datagram that reaches the lookup's socket, read as a reply to a query
// for "example.com" with id 0x5a17. Besides not crashing:
// - an accepted reply has an RCODE of 0..15 and no more addresses than the
//   answer records read;
// - our own query is not taken as its own reply.
#include "detect/dns_probe.h"
#include "fuzz_support.h"
#include "syslog_capture.h"

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>

using zark::fuzz::Require;

namespace {
constexpr uint16_t kQueryId = 0x5a17;
constexpr std::string_view kName = "example.com";
} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  // Log lines are captured (tests/support/syslog_capture.h); keep only
  // this input's.
  zark::test::ClearLogs();
  const std::span<const uint8_t> bytes(data, size);
  const std::optional<zark::portmap::DnsReply> reply =
      zark::portmap::ParseDnsReply(bytes, kQueryId, kName);
  if (reply) {
    Require(reply->rcode >= 0 && reply->rcode <= 15, "an RCODE beyond 4 bits");
    Require(reply->answerRecords >= 0 &&
                reply->addresses.size() <=
                    static_cast<std::size_t>(reply->answerRecords),
            "more addresses than answer records");
  }
  const std::vector<uint8_t> query =
      zark::portmap::BuildDnsQuery(kQueryId, kName);
  Require(!query.empty(), "no query built for example.com");
  Require(!zark::portmap::ParseDnsReply(query, kQueryId, kName),
          "a query read as its own reply");
  return 0;
}
