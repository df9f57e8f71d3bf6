#include "detect/router_probe.h"

#include "base/detect_log.h"
#include "base/ipv4_class.h"
#include "base/portmap_log.h"
#include "drivers/natpmp.h"
#include "drivers/upnp.h"
#include "net/ssdp_search.h"

#include <algorithm>
#include <exception>
#include <thread>

namespace zark::portmap {
namespace {

// Blanks runs of control characters and blanks, trims, replaces what would
// break the name's later split or its use as a folder name.
std::string SanitizeNamePart(std::string_view text, std::string_view from,
                             std::string_view to) {
  std::string cleaned;
  bool blank = false;
  for (char c : text) {
    if (static_cast<unsigned char>(c) <= 0x20 || c == 0x7F) {
      blank = !cleaned.empty();
      continue;
    }
    if (blank) {
      cleaned += ' ';
      blank = false;
    }
    if (c == '/') {
      c = '-';
    }
    const std::size_t replaced = from.find(c);
    cleaned += replaced == std::string_view::npos ? c : to[replaced];
  }
  if (cleaned.size() > kMaxIdentityText) {
    cleaned.resize(kMaxIdentityText);
    while (!cleaned.empty() && cleaned.back() == ' ') {
      cleaned.pop_back();
    }
  }
  return cleaned;
}

class SystemRouterProbes final : public RouterProbes {
public:
  explicit SystemRouterProbes(RouterProbeOptions options)
      : mOptions(std::move(options)) {}

  UpnpFinding ProbeUpnp(const std::string &gateway) override {
    UpnpFinding finding;
    std::vector<std::string> candidates = mOptions.knownRootDescUrls;
    if (mOptions.search) {
      SsdpSearchOptions search;
      search.gateway = gateway;
      search.port = mOptions.ssdpPort;
      search.multicast = mOptions.ssdpMulticast;
      search.wait = mOptions.ssdpWait;
      for (std::string &url : SearchIgds(search)) {
        if (std::find(candidates.begin(), candidates.end(), url) ==
            candidates.end()) {
          candidates.push_back(std::move(url));
        }
      }
    }
    if (candidates.size() > kMaxSsdpDevices) {
      candidates.resize(kMaxSsdpDevices);
    }
    if (candidates.empty()) {
      finding.why = "no UPnP device answered at " + gateway + " within " +
                    std::to_string(mOptions.ssdpWait.count()) + " ms";
      return finding;
    }
    std::string reasons;
    for (const std::string &url : candidates) {
      UpnpOptions options;
      options.gateway = gateway;
      options.knownRootDescUrls = {url};
      options.discover = false;
      options.localNetworks = mOptions.localNetworks;
      UpnpRouter router(std::move(options));
      RouterResult opened = router.Open();
      if (!opened.Ok()) {
        if (opened.outcome == RouterOutcome::kFailed) {
          finding.support = ProtocolSupport::kUnknown;
        }
        reasons += (reasons.empty() ? "" : "; ") + opened.message;
        continue;
      }
      finding.support = ProtocolSupport::kYes;
      finding.location = url;
      std::string address;
      RouterResult asked = router.GetExternalAddress(address);
      if (asked.Ok()) {
        finding.externalAddress = address;
      }
      if (std::optional<std::string> description =
              FetchRootDescription(url, mOptions.descriptionBudget)) {
        finding.identity = ParseIgdIdentity(*description);
      }
      finding.why = "UPnP IGD at " + url + " (" + router.ServiceType() + ")";
      return finding;
    }
    finding.why = "no usable UPnP IGD: " + reasons;
    return finding;
  }

  NatPmpFinding ProbeNatPmp(const std::string &gateway) override {
    NatPmpFinding finding;
    NatPmpOptions options;
    options.gateway = gateway;
    options.port = mOptions.natpmpPort;
    options.firstWait = mOptions.natpmpFirstWait;
    options.tries = mOptions.natpmpTries;
    NatPmpRouter router(std::move(options));
    std::string address;
    RouterResult asked = router.GetExternalAddress(address);
    switch (asked.outcome) {
    case RouterOutcome::kOk:
      finding.support = ProtocolSupport::kYes;
      finding.publicAddress = address;
      finding.why = "NAT-PMP at " + gateway + ": public address " + address;
      break;
    case RouterOutcome::kRefused:
      // It speaks NAT-PMP, but has no address to tell (no WAN link yet).
      finding.support = ProtocolSupport::kYes;
      finding.why = "NAT-PMP at " + gateway + ": " + asked.message;
      break;
    case RouterOutcome::kNoAnswer:
    case RouterOutcome::kNoRouter:
      finding.support = ProtocolSupport::kNo;
      finding.why = "no NAT-PMP at " + gateway + ": " + asked.message;
      break;
    default:
      finding.support = ProtocolSupport::kUnknown;
      finding.why = "NAT-PMP probe of " + gateway + " failed: " + asked.message;
      break;
    }
    return finding;
  }

private:
  RouterProbeOptions mOptions;
};

std::string SupportWord(ProtocolSupport support) {
  switch (support) {
  case ProtocolSupport::kYes:
    return "yes";
  case ProtocolSupport::kNo:
    return "no";
  case ProtocolSupport::kUnknown:
    return "unknown";
  }
  return "unknown";
}

} // namespace

std::unique_ptr<RouterProbes> MakeRouterProbes(RouterProbeOptions options) {
  return std::make_unique<SystemRouterProbes>(std::move(options));
}

RouterFindings ProbeRouter(RouterProbes &probes, const std::string &gateway) {
  RouterFindings findings;
  {
    // Joined when this block ends, also when the UPnP probe throws.
    std::jthread natpmp([&] {
      try {
        findings.natpmp = probes.ProbeNatPmp(gateway);
      } catch (const std::exception &e) {
        findings.natpmp.support = ProtocolSupport::kUnknown;
        findings.natpmp.why = std::string("NAT-PMP probe failed: ") + e.what();
        ZARK_PM_LOG_ERROR("%s", findings.natpmp.why.c_str());
      }
    });
    try {
      findings.upnp = probes.ProbeUpnp(gateway);
    } catch (const std::exception &e) {
      findings.upnp.support = ProtocolSupport::kUnknown;
      findings.upnp.why = std::string("UPnP probe failed: ") + e.what();
      ZARK_PM_LOG_ERROR("%s", findings.upnp.why.c_str());
    }
  }
  return findings;
}

RouterName NameRouter(const IgdIdentity &identity) {
  RouterName name;
  name.brand = SanitizeNamePart(identity.manufacturer, ":", "-");
  name.model = SanitizeNamePart(identity.modelName, "()", "[]");
  name.version = SanitizeNamePart(identity.modelNumber, "", "");
  if (!name.brand.empty() && !name.model.empty()) {
    name.pfpath = name.brand + ": " + name.model;
    if (!name.version.empty()) {
      name.pfpath += "(" + name.version + ")";
    }
  }
  return name;
}

RouterCheck CheckRouter(const RouterFindings &findings) {
  RouterCheck check;
  check.upnp = findings.upnp.support;
  check.natpmp = findings.natpmp.support;
  check.ok = check.upnp == ProtocolSupport::kYes ||
             check.natpmp == ProtocolSupport::kYes;
  if (check.upnp == ProtocolSupport::kYes) {
    check.name = NameRouter(findings.upnp.identity);
  }
  for (const std::string *reported :
       {&findings.upnp.externalAddress, &findings.natpmp.publicAddress}) {
    if (std::optional<uint32_t> address = ParseIpv4(*reported)) {
      check.outsideAddress = address;
      break;
    }
  }
  check.doubleNat = check.outsideAddress && IsBehindNat(*check.outsideAddress);
  check.why = "UPnP " + SupportWord(check.upnp) + " (" + findings.upnp.why +
              "), NAT-PMP " + SupportWord(check.natpmp) + " (" +
              findings.natpmp.why + ")";
  if (check.outsideAddress) {
    check.why += ", outside address " + FormatIpv4(*check.outsideAddress) +
                 " (" + Ipv4ClassName(ClassifyIpv4(*check.outsideAddress)) +
                 ")";
  }
  return check;
}

} // namespace zark::portmap
