// Fuzz target of the reading of a DNS reply in router detection
// (ReadDnsAnswer: ares_parse_a_reply and the outcome made of it): any
// datagram c-ares took as the reply to the A query of the probe name,
// handed over with each status ares_query gives a reply with. Besides not
// crashing:
// - the RCODE is one of 4 bits;
// - an address only with ARES_SUCCESS, and then the outcome is "answered";
//   never more addresses than A records fit in the bytes;
// - every other status has its one outcome (NXDOMAIN: no such name; the
//   other error codes: server error; no data: no address).
#include "detect/dns_probe.h"
#include "fuzz_support.h"
#include "syslog_capture.h"

#include <ares.h>

#include <cstddef>
#include <cstdint>
#include <span>

using zark::fuzz::Require;
using zark::portmap::DnsOutcome;

namespace {
// The smallest A record: a compressed name (2), type, class, TTL, length
// (10) and the address (4).
constexpr std::size_t kMinARecord = 16;
} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  // Log lines are captured (tests/support/syslog_capture.h); keep only
  // this input's.
  zark::test::ClearLogs();
  const std::span<const uint8_t> bytes(data, size);
  for (const int status :
       {ARES_SUCCESS, ARES_ENODATA, ARES_ENOTFOUND, ARES_ESERVFAIL,
        ARES_EREFUSED, ARES_EFORMERR, ARES_ENOTIMP}) {
    const zark::portmap::DnsLookup heard =
        zark::portmap::ReadDnsAnswer("192.0.2.53", status, bytes);
    Require(heard.rcode >= 0 && heard.rcode <= 15, "an RCODE beyond 4 bits");
    Require(heard.server == "192.0.2.53" && heard.why.starts_with("192.0.2.53"),
            "an outcome not about the server asked");
    Require(heard.addresses.empty() == (heard.outcome != DnsOutcome::kAnswered),
            "addresses without the answered outcome, or the reverse");
    Require(heard.addresses.size() <= size / kMinARecord,
            "more addresses than A records fit");
    switch (status) {
    case ARES_SUCCESS:
      Require(heard.outcome == DnsOutcome::kAnswered ||
                  heard.outcome == DnsOutcome::kNoAddress ||
                  heard.outcome == DnsOutcome::kServerError,
              "a reply read as neither an answer nor an error");
      Require(heard.outcome != DnsOutcome::kServerError ||
                  heard.rcode != zark::portmap::kDnsNoError,
              "a server error without an error code");
      break;
    case ARES_ENODATA:
      Require(heard.outcome == DnsOutcome::kNoAddress,
              "no data read as something else");
      break;
    case ARES_ENOTFOUND:
      Require(heard.outcome == DnsOutcome::kNameError,
              "NXDOMAIN read as something else");
      break;
    default:
      Require(heard.outcome == DnsOutcome::kServerError,
              "an error answer read as something else");
      break;
    }
  }
  return 0;
}
