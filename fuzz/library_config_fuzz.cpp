// Fuzz target of the readers of values in the library configuration file
// (/etc/portforward/portmap.conf): "wan_probe_hosts" (ParseWanProbeHosts),
// "probe_service_address" (ParseProbeServiceAddress) and
// "routerdb_update_source" (ParseHttpUrl). The first byte of an input
// chooses the reader ('w', 'p', 'u'), the rest is the value.
// Besides not crashing:
// - probe hosts: at most kMaxWanProbeHosts, each a non-empty host without
//   ":", "/", "[", "]", blanks or control characters, port not 0;
//   writing them back as "host:port,..." reads back the same list;
// - probe service: host not empty, port not 0; "host:port" (brackets around
//   an IPv6 host) reads back the same endpoint;
// - URL: host not empty, without blanks, control characters, "@" or ":",
//   port 1..65535, target
//   starting with "/"; the URL written back from the parts reads back the
//   same parts.
#include "detect/wan_probe.h"
#include "fuzz_support.h"
#include "net/http_download.h"
#include "reach/probe_client.h"
#include "syslog_capture.h"

#include <cstddef>
#include <cstdint>
#include <string>

namespace {

using zark::fuzz::Require;
using namespace zark::portmap;

// No blank and no control character (bytes of 0x80 and above are taken:
// a name in UTF-8 is left to the resolver to refuse).
bool NoBlankOrControl(std::string_view text) {
  for (char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (byte <= ' ' || byte == 0x7f) {
      return false;
    }
  }
  return true;
}

void CheckWanHosts(std::string_view text) {
  const std::vector<WanProbeHost> hosts = ParseWanProbeHosts(text);
  Require(hosts.size() <= kMaxWanProbeHosts, "more probe hosts than the bound");
  std::string written;
  for (const WanProbeHost &host : hosts) {
    Require(!host.host.empty() && NoBlankOrControl(host.host) &&
                host.host.find_first_of(":/[]") == std::string::npos,
            "a probe host that is not a host: [" + host.host + "]");
    Require(host.port != 0, "probe host port 0");
    written += (written.empty() ? "" : ",") + host.host + ":" +
               std::to_string(host.port);
  }
  Require(ParseWanProbeHosts(written) == hosts,
          "probe hosts do not read back: " + written);
}

void CheckProbeService(std::string_view text) {
  const std::optional<ProbeEndpoint> endpoint = ParseProbeServiceAddress(text);
  if (!endpoint) {
    return;
  }
  Require(!endpoint->host.empty() && endpoint->port != 0,
          "an empty probe service host or port 0");
  const bool v6 = endpoint->host.find(':') != std::string::npos;
  const std::string written =
      (v6 ? "[" + endpoint->host + "]" : endpoint->host) + ":" +
      std::to_string(endpoint->port);
  Require(ParseProbeServiceAddress(written) == endpoint,
          "the probe service address does not read back: " + written);
}

void CheckUrl(std::string_view text) {
  HttpUrl url;
  if (!ParseHttpUrl(text, url)) {
    return;
  }
  Require(!url.host.empty() && NoBlankOrControl(url.host) &&
              url.host.find_first_of("@:") == std::string::npos,
          "a URL host that is not a host: [" + url.host + "]");
  Require(url.port >= 1 && url.port <= 65535, "a URL port out of range");
  Require(!url.target.empty() && url.target.front() == '/',
          "a URL target not starting with /");
  const std::string written = std::string(url.tls ? "https://" : "http://") +
                              url.host + ":" + std::to_string(url.port) +
                              url.target;
  HttpUrl again;
  Require(ParseHttpUrl(written, again) && again.tls == url.tls &&
              again.host == url.host && again.port == url.port &&
              again.target == url.target,
          "the URL does not read back: " + written);
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  // Log lines are captured (tests/support/syslog_capture.h); keep only
  // this input's.
  zark::test::ClearLogs();
  zark::fuzz::InputReader input(zark::fuzz::AsText(data, size));
  const uint8_t choice = input.Byte();
  const std::string_view value = input.Rest();
  switch (choice) {
  case 'w':
    CheckWanHosts(value);
    break;
  case 'p':
    CheckProbeService(value);
    break;
  case 'u':
    CheckUrl(value);
    break;
  default:
    break;
  }
  return 0;
}
