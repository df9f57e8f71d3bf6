// Fuzz target of the probe service's request parser. Besides not crashing,
// a parse must keep its promises: an accepted request formats to a line
// that parses back to the same request; a check has a port 1..65535 and a
// token that is empty or valid, so it can hold no address ("." and ":"
// never get through); a refused line says why; nothing is accepted from a
// line longer than the protocol allows once the server cuts it.
#include "probe_request_fuzz.h"

#include "probe_protocol.h"

#include <cstddef>
#include <cstdint>

namespace zark::probe::test {

std::string CheckRequestParse(std::string_view line) {
  const ParsedRequest parsed = ParseRequestLine(line);
  if (parsed.error != ParseError::kNone) {
    if (std::string_view(ParseErrorName(parsed.error)) == "unknown") {
      return "a refusal without a name";
    }
    return {};
  }
  const Request &request = parsed.request;
  if (request.kind == Request::Kind::kCheck) {
    if (request.port == 0) {
      return "port 0 accepted";
    }
    if (!request.token.empty() && !IsValidToken(request.token)) {
      return "invalid token accepted: [" + request.token + "]";
    }
    if (request.token.find_first_of(".:/@[]") != std::string::npos) {
      return "a token that could name an address: [" + request.token + "]";
    }
  }
  const std::string canonical = FormatRequest(request);
  if (canonical.empty() || canonical.back() != '\n' ||
      canonical.find('\n') != canonical.size() - 1) {
    return "formatted request is not one line";
  }
  const ParsedRequest again = ParseRequestLine(
      std::string_view(canonical).substr(0, canonical.size() - 1));
  if (again.error != ParseError::kNone || !(again.request == request)) {
    return "formatted request parses differently: [" + canonical + "]";
  }
  if (canonical.size() > kMaxRequestLine) {
    return "an accepted request longer than a request line may be";
  }
  return {};
}

} // namespace zark::probe::test

#ifdef ZARK_PROBE_FUZZER
#include <cstdlib>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  const std::string broken = zark::probe::test::CheckRequestParse(
      std::string_view(reinterpret_cast<const char *>(data), size));
  if (!broken.empty()) {
    std::abort();
  }
  return 0;
}
#endif
