// Fuzz target of detection's parsers of bytes from the network and from
// files: SSDP answers, DNS replies, root descriptions, resolv.conf, the
// kept result, WAN host lists. The first byte picks the parser. Besides
// not crashing, each parse must keep its promises.
#include "catalog/detect_result_store.h"
#include "detect/dns_probe.h"
#include "detect/wan_probe.h"
#include "net/igd_description.h"
#include "net/ssdp_search.h"
#include "net/xml_reader.h"

#include <ares.h>
#include <arpa/inet.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

namespace {

using namespace zark::portmap;

void Check(bool promise) {
  if (!promise) {
    std::abort();
  }
}

bool Printable(std::string_view text) {
  for (char c : text) {
    if (static_cast<unsigned char>(c) < 0x20 || c == 0x7F) {
      return false;
    }
  }
  return true;
}

// ReadXml's promises on its events: every end closes the innermost open
// element, depths count the open elements and stay within the limit, text
// lies inside an element, a reference is one character.
class XmlEventPromises final : public XmlVisitor {
public:
  static constexpr std::size_t kMaxDepth = 16;

  bool OnStart(std::string_view name, std::size_t depth) override {
    Check(depth == mOpen.size() + 1 && depth <= kMaxDepth);
    mOpen.emplace_back(name);
    return true;
  }
  bool OnEnd(std::string_view name, std::size_t depth) override {
    Check(depth == mOpen.size() && depth >= 1 && mOpen.back() == name);
    mOpen.pop_back();
    return true;
  }
  void OnText(std::string_view text, std::size_t depth,
              bool fromReference) override {
    Check(depth == mOpen.size() && depth >= 1);
    Check(!fromReference || (!text.empty() && text.size() <= 4));
  }

  std::vector<std::string> mOpen;
};

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  if (size == 0) {
    return 0;
  }
  const uint8_t which = data[0] % 6;
  std::span<const uint8_t> bytes(data + 1, size - 1);
  std::string_view text(reinterpret_cast<const char *>(data + 1), size - 1);
  switch (which) {
  case 0: {
    if (std::optional<SsdpReply> reply = ParseSsdpReply(text)) {
      Check(reply->location.rfind("http://", 0) == 0);
      Check(reply->location.size() <= 512);
      Check(Printable(reply->location));
    }
    break;
  }
  case 1: {
    // The reply as c-ares hands it over with a "no error" status.
    DnsLookup heard = ReadDnsAnswer("192.0.2.53", ARES_SUCCESS, bytes);
    Check(heard.rcode >= 0 && heard.rcode <= 15);
    Check(heard.addresses.empty() == (heard.outcome != DnsOutcome::kAnswered));
    Check(heard.addresses.size() <= bytes.size() / 16);
    break;
  }
  case 2: {
    IgdIdentity identity = ParseIgdIdentity(text);
    for (const std::string *field :
         {&identity.manufacturer, &identity.modelName, &identity.modelNumber}) {
      Check(field->size() <= kMaxIdentityText);
      Check(Printable(*field));
      Check(field->empty() || (field->front() != ' ' && field->back() != ' '));
    }
    XmlEventPromises events;
    const XmlEnd end =
        ReadXml(text, events,
                XmlLimits{.maxBytes = kMaxRootDescriptionBytes,
                          .maxDepth = XmlEventPromises::kMaxDepth});
    Check(end != XmlEnd::kStopped);
    Check(end != XmlEnd::kComplete || events.mOpen.empty());
    break;
  }
  case 3: {
    std::vector<std::string> servers = ParseResolvConf(text);
    Check(servers.size() <= kMaxNameServers);
    for (const std::string &server : servers) {
      in_addr v4{};
      in6_addr v6{};
      Check(inet_pton(AF_INET, server.c_str(), &v4) == 1 ||
            inet_pton(AF_INET6, server.c_str(), &v6) == 1);
    }
    break;
  }
  case 4: {
    ZARK_ROUTER_DETECT_RESULT result{};
    std::string why;
    if (ParseDetectResult(text, result, why)) {
      // What parses serializes to a text that parses to the same record.
      ZARK_ROUTER_DETECT_RESULT again{};
      Check(ParseDetectResult(SerializeDetectResult(result), again, why));
      Check(std::memcmp(&result, &again, sizeof(result)) == 0);
    } else {
      Check(!why.empty());
    }
    break;
  }
  case 5: {
    std::vector<WanProbeHost> hosts = ParseWanProbeHosts(text);
    Check(hosts.size() <= kMaxWanProbeHosts);
    for (const WanProbeHost &host : hosts) {
      Check(!host.host.empty() && host.port >= 1);
      Check(host.host.find_first_of(" \t:/[],") == std::string::npos);
    }
    break;
  }
  default:
    break;
  }
  return 0;
}
