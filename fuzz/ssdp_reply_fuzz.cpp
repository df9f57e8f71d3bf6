// Fuzz target of the SSDP answer reader (ParseSsdpReply): any datagram that
// reaches the search socket. Besides not crashing, an accepted answer has a
// LOCATION that is an "http://" URL of at most 512 printable characters,
// since it is the next thing the library fetches.
#include "fuzz_support.h"
#include "net/ssdp_search.h"
#include "syslog_capture.h"

#include <cstddef>
#include <cstdint>
#include <optional>

using zark::fuzz::Require;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  // Log lines are captured (tests/support/syslog_capture.h); keep only
  // this input's.
  zark::test::ClearLogs();
  const std::optional<zark::portmap::SsdpReply> reply =
      zark::portmap::ParseSsdpReply(zark::fuzz::AsText(data, size));
  if (!reply) {
    return 0;
  }
  const std::string &location = reply->location;
  Require(location.rfind("http://", 0) == 0, "a LOCATION that is not http://");
  Require(location.size() <= 512, "a LOCATION beyond 512 characters");
  for (char c : location) {
    const auto byte = static_cast<unsigned char>(c);
    Require(byte > ' ' && byte < 0x7f, "a LOCATION with a blank or control");
  }
  return 0;
}
