// Fuzz target of the router part's parsers. Besides not crashing:
// - a mapping state that is accepted serializes to a text that parses to
//   the same state, and serializing that gives the same text again;
// - a port text that is accepted expands to ports 1..65535, and writing
//   them back one by one ("a,b,c") expands to the same list; a refusal
//   keeps at most the ports read before it;
// - a URL host never holds "/" or ":", and a URL judged local has a host
//   that is a dotted quad in the given network.
#include "router_parsers_fuzz.h"

#include "base/local_network.h"
#include "catalog/mapping_state.h"
#include "rules/rule_validation.h"

#include <cstddef>
#include <cstdint>
#include <vector>

namespace zark::test {
namespace {

using namespace zark::portmap;

std::string CheckState(std::string_view text) {
  MappingState state;
  std::string why;
  if (!ParseMappingState(text, state, why)) {
    return why.empty() ? "a refusal without a reason" : "";
  }
  const std::string written = SerializeMappingState(state);
  MappingState again;
  if (!ParseMappingState(written, again, why)) {
    return "an accepted state does not read back: " + why;
  }
  if (!(again == state)) {
    return "an accepted state reads back different";
  }
  if (SerializeMappingState(again) != written) {
    return "serializing is not stable";
  }
  return "";
}

std::string CheckPorts(std::string_view text) {
  std::vector<uint16_t> ports;
  PortTextError error = ExpandPortText(text, ports);
  for (uint16_t port : ports) {
    if (port == 0) {
      return "port 0 expanded";
    }
  }
  if (error != PortTextError::kNone) {
    return "";
  }
  if (ports.empty()) {
    return "an accepted text with no port";
  }
  std::string joined;
  for (uint16_t port : ports) {
    joined += (joined.empty() ? "" : ",") + std::to_string(port);
  }
  std::vector<uint16_t> again;
  if (ExpandPortText(joined, again) != PortTextError::kNone || again != ports) {
    return "the expanded ports do not read back: " + joined;
  }
  return "";
}

std::string CheckUrl(std::string_view url) {
  std::optional<std::string> host = UrlHost(url);
  if (host && host->find_first_of("/:") != std::string::npos) {
    return "a host holding / or :";
  }
  const std::vector<Ipv4Network> lan = {{0xc0a80100u, 0xffffff00u}};
  if (IsUrlOnLocalNetwork(url, lan, std::nullopt)) {
    std::optional<uint32_t> address = host ? ParseIpv4(*host) : std::nullopt;
    if (!address || (*address & 0xffffff00u) != 0xc0a80100u) {
      return "a URL judged local whose host is not in the network";
    }
  }
  return "";
}

} // namespace

std::string CheckRouterParsers(std::string_view input) {
  if (input.empty()) {
    return "";
  }
  const std::string_view rest = input.substr(1);
  switch (input.front()) {
  case 's':
    return CheckState(rest);
  case 'p':
    return CheckPorts(rest);
  case 'u':
    return CheckUrl(rest);
  default:
    return "";
  }
}

} // namespace zark::test

#ifdef ZARK_ROUTER_PARSERS_FUZZER
#include <cstdio>
#include <cstdlib>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  std::string broken = zark::test::CheckRouterParsers(
      std::string_view(reinterpret_cast<const char *>(data), size));
  if (!broken.empty()) {
    std::fprintf(stderr, "broken promise: %s\n", broken.c_str());
    std::abort();
  }
  return 0;
}
#endif
