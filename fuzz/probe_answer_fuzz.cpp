// Fuzz target of ParseProbeAnswer (the probe service's answers come from
// the network). Besides not crashing: an accepted answer has one of the
// statuses an answer can have (never one the client decides on itself), an
// address answer carries an address, a rate-limited one a wait that is -1
// or more, an error a reason; and a line over 512 bytes is never accepted.
#include "probe_answer_fuzz.h"

#include "reach/probe_client.h"

#include <cstddef>
#include <cstdint>

namespace zark::porttest {

std::string CheckAnswerParse(std::string_view line) {
  using portmap::ProbeStatus;
  std::optional<portmap::ProbeAnswer> answer = portmap::ParseProbeAnswer(line);
  if (!answer) {
    return {};
  }
  if (line.size() > 512) {
    return "an answer over 512 bytes accepted";
  }
  switch (answer->status) {
  case ProbeStatus::kReachable:
  case ProbeStatus::kUnreachable:
  case ProbeStatus::kUnknown:
    return {};
  case ProbeStatus::kAddress:
    return answer->address.empty() ? "an address answer without address" : "";
  case ProbeStatus::kRateLimited:
    return answer->retryAfterMs < -1 ? "a negative wait" : "";
  case ProbeStatus::kRefused:
    return answer->reason.empty() ? "an error without reason" : "";
  case ProbeStatus::kServiceUnavailable:
  case ProbeStatus::kBadAnswer:
  case ProbeStatus::kCancelled:
    return "a status only the client may decide on";
  }
  return "an unknown status";
}

} // namespace zark::porttest

#ifdef ZARK_PORTTEST_FUZZER
#include <cstdlib>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  if (!zark::porttest::CheckAnswerParse(
           std::string_view(reinterpret_cast<const char *>(data), size))
           .empty()) {
    std::abort();
  }
  return 0;
}
#endif
