#include "drivers/upnp.h"

#include "base/portmap_log.h"
#include "drivers/driver_log.h"

// The miniupnpc library is built as C99, where UNSIGNED_INTEGER is unsigned
// long long. A C++ compiler defines no __STDC_VERSION__, so the header would
// make it unsigned int and read struct PortMapping (its leaseTime, and every
// field after it) at the wrong offsets: every listed entry came out empty.
#include <miniupnpc/miniupnpctypes.h>
#undef UNSIGNED_INTEGER
#define UNSIGNED_INTEGER unsigned long long

#include <miniupnpc/miniupnpc.h>
#include <miniupnpc/portlistingparse.h>
#include <miniupnpc/upnpcommands.h>
#include <miniupnpc/upnperrors.h>
#include <syslog.h>

#include <algorithm>
#include <charconv>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>
#include <utility>

namespace zark::portmap {
namespace {

// The service type as requests carry it (in the SOAPAction header and the
// body): the description's text without surrounding white space. Empty
// when what is left holds a character no service URN has (white space,
// a control character, anything beyond ASCII), which would otherwise end
// up inside the request's header lines.
std::string CleanServiceType(std::string_view text) {
  const auto isSpace = [](char c) {
    return c == ' ' || c == '\t' || c == '\r' || c == '\n';
  };
  while (!text.empty() && isSpace(text.front())) {
    text.remove_prefix(1);
  }
  while (!text.empty() && isSpace(text.back())) {
    text.remove_suffix(1);
  }
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (byte <= 0x20 || byte >= 0x7f) {
      return {};
    }
  }
  return std::string(text);
}

// Owns a device list from upnpDiscoverDevices.
struct DevListDeleter {
  void operator()(UPNPDev *list) const { freeUPNPDevlist(list); }
};
using DevList = std::unique_ptr<UPNPDev, DevListDeleter>;

// Owns the URLs miniupnpc builds from a root description.
class OwnedUrls {
public:
  OwnedUrls() = default;
  OwnedUrls(const OwnedUrls &) = delete;
  OwnedUrls &operator=(const OwnedUrls &) = delete;
  ~OwnedUrls() { FreeUPNPUrls(&mUrls); }
  UPNPUrls *Get() { return &mUrls; }

private:
  UPNPUrls mUrls{};
};

const char *MiniupnpcResultMeaning(int rc) {
  switch (rc) {
  case UPNPCOMMAND_SUCCESS:
    return "success";
  case UPNPCOMMAND_UNKNOWN_ERROR:
    return "reply without result or error code";
  case UPNPCOMMAND_INVALID_ARGS:
    return "invalid arguments";
  case UPNPCOMMAND_HTTP_ERROR:
    return "no reply from the router";
  case UPNPCOMMAND_INVALID_RESPONSE:
    return "reply not understood";
  case UPNPCOMMAND_MEM_ALLOC_ERROR:
    return "out of memory";
  default:
    break;
  }
  const char *text = strupnperror(rc);
  return text != nullptr ? text : "UPnP error";
}

// Logs one miniupnpc call once and turns its result into an outcome.
RouterResult Classify(const char *file, int line, const char *call, int rc,
                      const std::string &detail) {
  RouterResult result;
  result.code = rc;
  const char *meaning = MiniupnpcResultMeaning(rc);
  LogRouterCall(file, line, call, rc, rc != UPNPCOMMAND_SUCCESS, meaning,
                detail);
  switch (rc) {
  case UPNPCOMMAND_SUCCESS:
    result.outcome = RouterOutcome::kOk;
    break;
  case UPNPCOMMAND_HTTP_ERROR:
    result.outcome = RouterOutcome::kNoAnswer;
    break;
  case UPNPCOMMAND_UNKNOWN_ERROR:
  case UPNPCOMMAND_INVALID_RESPONSE:
    result.outcome = RouterOutcome::kBadReply;
    break;
  case UPNPCOMMAND_INVALID_ARGS:
  case UPNPCOMMAND_MEM_ALLOC_ERROR:
    result.outcome = RouterOutcome::kFailed;
    break;
  case kUpnpNoSuchEntry:
    result.outcome = RouterOutcome::kNotFound;
    break;
  case kUpnpConflictInMappingEntry:
  case kUpnpConflictWithOtherMechanisms:
    result.outcome = RouterOutcome::kConflict;
    break;
  default:
    result.outcome =
        rc > 0 ? RouterOutcome::kRefused : RouterOutcome::kBadReply;
    break;
  }
  result.message = std::string(call) + " " + detail + ": " + meaning + " (" +
                   std::to_string(rc) + ")";
  return result;
}

#define ZARK_PM_CLASSIFY(call, rc, detail)                                     \
  Classify(__FILE__, __LINE__, call, rc, detail)

std::optional<uint32_t> ParseUnsigned(const char *text, uint32_t max) {
  std::string_view view(text);
  uint32_t value = 0;
  auto [end, error] =
      std::from_chars(view.data(), view.data() + view.size(), value);
  if (error != std::errc() || end != view.data() + view.size() ||
      view.empty() || value > max) {
    return std::nullopt;
  }
  return value;
}

std::string MappingText(const PortMapping &mapping) {
  return std::string(UpnpProtocolName(mapping.protocol)) + " " +
         std::to_string(mapping.externalPort) + "->" + mapping.internalClient +
         ":" + std::to_string(mapping.internalPort);
}

std::string LeaseText(LeaseKind kind, uint32_t finiteSeconds) {
  return kind == LeaseKind::kPermanent ? "0" : std::to_string(finiteSeconds);
}

LeaseKind OtherKind(LeaseKind kind) {
  return kind == LeaseKind::kPermanent ? LeaseKind::kFinite
                                       : LeaseKind::kPermanent;
}

// The host of a URL, for log lines.
std::string HostOf(const std::string &url) {
  std::optional<std::string> host = UrlHost(url);
  return host ? *host : std::string("(none)");
}

} // namespace

UpnpRouter::UpnpRouter(UpnpOptions options)
    : mOptions(std::move(options)), mLeaseKind(mOptions.firstLease) {}

UpnpRouter::~UpnpRouter() = default;

bool UpnpRouter::OpenFromMemo(RouterResult &remembered) {
  // Only a control point on the local network, as a fresh description's
  // would have to be (ServicesOnLocalNetwork): the state file is no proof.
  const bool usable =
      !mMemoTried && !mOptions.knownControlUrl.empty() &&
      !mOptions.knownServiceType.empty() &&
      !mOptions.knownRootDescUrls.empty() &&
      IsUrlOnLocalNetwork(mOptions.knownRootDescUrls.front(), mNetworks,
                          mGateway) &&
      IsUrlOnLocalNetwork(mOptions.knownControlUrl, mNetworks, mGateway);
  mMemoTried = true;
  if (!usable) {
    return false;
  }
  // The control point the last job used: no description fetch. A request
  // that fails through it fetches the description again
  // (ControlUrlWasStale).
  mFromMemo = true;
  mRootDescUrl = mOptions.knownRootDescUrls.front();
  mControlUrl = mOptions.knownControlUrl;
  mServiceType = mOptions.knownServiceType;
  mOpen = true;
  remembered.outcome = RouterOutcome::kOk;
  remembered.message =
      "using " + mServiceType + " at " + mControlUrl + " (remembered)";
  return true;
}

std::vector<std::string>
UpnpRouter::DiscoverDescriptions(const std::vector<std::string> &tried) {
  // Search for IGD versions 1 and 2; a router may answer only its own.
  static const char *const kSearchTargets[] = {
      "urn:schemas-upnp-org:device:InternetGatewayDevice:1",
      "urn:schemas-upnp-org:device:InternetGatewayDevice:2",
      nullptr,
  };
  int error = 0;
  const int delayMs = static_cast<int>(mOptions.discoverWait.count());
  DevList devices(upnpDiscoverDevices(kSearchTargets, delayMs, nullptr, nullptr,
                                      UPNP_LOCAL_PORT_ANY, 0, 2, &error, 1));
  int found = 0;
  for (const UPNPDev *device = devices.get(); device != nullptr;
       device = device->pNext) {
    ++found;
  }
  ZARK_PM_LOG_ROUTER_CALL("upnpDiscoverDevices", error, devices == nullptr,
                          devices == nullptr ? "no device answered" : "ok",
                          std::to_string(found) + " device(s) in " +
                              std::to_string(delayMs) + " ms per search");

  // The gateway's own device first, then the others in the order found.
  std::vector<std::string> candidates;
  for (const UPNPDev *device = devices.get(); device != nullptr;
       device = device->pNext) {
    if (device->descURL == nullptr) {
      continue;
    }
    std::string url(device->descURL);
    if (std::find(tried.begin(), tried.end(), url) != tried.end() ||
        std::find(candidates.begin(), candidates.end(), url) !=
            candidates.end()) {
      continue;
    }
    candidates.push_back(url);
  }
  std::stable_partition(candidates.begin(), candidates.end(),
                        [&](const std::string &url) {
                          return mGateway && ParseIpv4(HostOf(url)) == mGateway;
                        });
  if (candidates.size() > static_cast<std::size_t>(kMaxCandidates)) {
    candidates.resize(kMaxCandidates);
  }
  return candidates;
}

RouterResult UpnpRouter::Open() {
  if (mOpen) {
    RouterResult ok;
    ok.outcome = RouterOutcome::kOk;
    return ok;
  }
  mNetworks =
      mOptions.localNetworks ? *mOptions.localNetworks : InterfaceNetworks();
  mGateway = ParseIpv4(mOptions.gateway);

  RouterResult remembered;
  if (OpenFromMemo(remembered)) {
    return remembered;
  }

  RouterResult last;
  last.outcome = RouterOutcome::kNoRouter;
  last.message = "no UPnP router found";
  std::vector<std::string> tried;
  for (const std::string &url : mOptions.knownRootDescUrls) {
    if (url.empty() ||
        std::find(tried.begin(), tried.end(), url) != tried.end()) {
      continue;
    }
    tried.push_back(url);
    last = TryRootDescription(url);
    if (last.Ok()) {
      return last;
    }
  }
  if (!mOptions.discover) {
    return last;
  }
  for (const std::string &url : DiscoverDescriptions(tried)) {
    last = TryRootDescription(url);
    if (last.Ok()) {
      return last;
    }
  }
  return last;
}

namespace {

// A WANIPConnection or WANPPPConnection service of a root description.
struct ConnectionService {
  std::string type;
  std::string controlUrl;
};

// The connection services of the description at url, with their control
// URLs. miniupnpc keeps the first WANIPConnection or WANPPPConnection
// service (any version) in data.first and a second one in data.second.
std::vector<ConnectionService> ConnectionServices(const std::string &url,
                                                  const IGDdatas &data,
                                                  OwnedUrls &urls) {
  std::vector<ConnectionService> services;
  const std::string firstType = CleanServiceType(data.first.servicetype);
  const std::string secondType = CleanServiceType(data.second.servicetype);
  if (!firstType.empty() && urls.Get()->controlURL != nullptr) {
    services.push_back({firstType, urls.Get()->controlURL});
  }
  if (!secondType.empty()) {
    // Build the second service's control URL the way miniupnpc builds the
    // first one's: with the two swapped.
    IGDdatas swapped = data;
    std::swap(swapped.first, swapped.second);
    OwnedUrls secondUrls;
    GetUPNPUrls(secondUrls.Get(), &swapped, url.c_str(), 0);
    if (secondUrls.Get()->controlURL != nullptr) {
      services.push_back({secondType, secondUrls.Get()->controlURL});
    }
  }
  return services;
}

// The services whose control URL is on our own network. A description may
// point its control URL anywhere (an absolute URL or URLBase); only a host
// on our own network gets requests. Each one refused is logged, and the
// last one's text left in refusal.
std::vector<ConnectionService> ServicesOnLocalNetwork(
    std::vector<ConnectionService> services, const std::string &url,
    const std::vector<Ipv4Network> &networks,
    const std::optional<uint32_t> &gateway, std::string &refusal) {
  std::vector<ConnectionService> usable;
  for (ConnectionService &service : services) {
    if (IsUrlOnLocalNetwork(service.controlUrl, networks, gateway)) {
      usable.push_back(std::move(service));
    } else {
      refusal = "refusing control URL " + service.controlUrl +
                " of the UPnP device at " + url + ": host " +
                HostOf(service.controlUrl) + " is not on the local network";
      ZARK_PM_LOG_ERROR("%s", refusal.c_str());
    }
  }
  return usable;
}

// With two connection services, the one that is connected; asking costs a
// request, so it is only done when there is a choice. The first one when
// none says it is connected.
std::size_t ConnectedService(const std::vector<ConnectionService> &usable) {
  if (usable.size() <= 1) {
    return 0;
  }
  for (std::size_t i = 0; i < usable.size(); ++i) {
    char status[64] = {};
    char lastError[64] = {};
    unsigned int uptime = 0;
    int statusRc =
        UPNP_GetStatusInfo(usable[i].controlUrl.c_str(), usable[i].type.c_str(),
                           status, &uptime, lastError);
    RouterResult asked = ZARK_PM_CLASSIFY("UPNP_GetStatusInfo", statusRc,
                                          usable[i].type + " status \"" +
                                              std::string(status) + "\"");
    if (asked.Ok() && std::strcmp(status, "Connected") == 0) {
      return i;
    }
  }
  return 0;
}

} // namespace

RouterResult UpnpRouter::TryRootDescription(const std::string &url) {
  RouterResult result;
  result.outcome = RouterOutcome::kNoRouter;
  if (!IsUrlOnLocalNetwork(url, mNetworks, mGateway)) {
    result.message = "refusing the UPnP device at " + url + ": host " +
                     HostOf(url) + " is not on the local network";
    ZARK_PM_LOG_ERROR("%s", result.message.c_str());
    return result;
  }

  OwnedUrls urls;
  IGDdatas data{};
  char lanAddress[64] = {};
  int rc = UPNP_GetIGDFromUrl(url.c_str(), urls.Get(), &data, lanAddress,
                              sizeof(lanAddress));
  ZARK_PM_LOG_ROUTER_CALL("UPNP_GetIGDFromUrl", rc, rc != 1,
                          rc == 1 ? "ok" : "no description", url);
  if (rc != 1) {
    result.outcome = RouterOutcome::kNoAnswer;
    result.message = "no UPnP description at " + url;
    return result;
  }

  std::vector<ConnectionService> services = ConnectionServices(url, data, urls);
  if (services.empty()) {
    result.message = "the UPnP device at " + url +
                     " has no WANIPConnection or WANPPPConnection service";
    ZARK_PM_LOG_ERROR("%s", result.message.c_str());
    return result;
  }
  std::vector<ConnectionService> usable = ServicesOnLocalNetwork(
      std::move(services), url, mNetworks, mGateway, result.message);
  if (usable.empty()) {
    return result;
  }
  const ConnectionService &chosen = usable[ConnectedService(usable)];

  mRootDescUrl = url;
  mServiceType = chosen.type;
  mControlUrl = chosen.controlUrl;
  mOpen = true;
  result.outcome = RouterOutcome::kOk;
  result.message = "using " + mServiceType + " at " + mControlUrl +
                   " (local address " + lanAddress + ")";
  syslog(LOG_INFO, "%s:%d %s", __FILE__, __LINE__, result.message.c_str());
  return result;
}

RouterResult UpnpRouter::SendAddOnce(const PortMapping &mapping) {
  RouterResult opened = Open();
  if (!opened.Ok()) {
    return opened;
  }
  const std::string external = std::to_string(mapping.externalPort);
  const std::string internal = std::to_string(mapping.internalPort);
  const char *protocol = UpnpProtocolName(mapping.protocol);

  LeaseKind kind = mLeaseKind;
  RouterResult added;
  // Two tries at most: the kind of lease in use, then the other one when
  // the router refuses the first with 725 or 402.
  for (int attempt = 0; attempt < 2; ++attempt) {
    const std::string lease = LeaseText(kind, mOptions.finiteLeaseSeconds);
    int rc = UPNP_AddPortMapping(
        mControlUrl.c_str(), mServiceType.c_str(), external.c_str(),
        internal.c_str(), mapping.internalClient.c_str(),
        mapping.description.c_str(), protocol, nullptr, lease.c_str());
    added = ZARK_PM_CLASSIFY("UPNP_AddPortMapping", rc,
                             MappingText(mapping) + " lease " + lease);
    if (added.Ok()) {
      break;
    }
    if (attempt == 0 &&
        (rc == kUpnpOnlyPermanentLeases || rc == kUpnpInvalidArgs)) {
      kind = OtherKind(kind);
      continue;
    }
    return added;
  }
  if (added.Ok()) {
    mLeaseKind = kind;
  }
  return added;
}

bool UpnpRouter::CanListRanges() const {
  // WANIPConnection:2 and later have GetListOfPortMappings.
  return mServiceType.size() > 2 &&
         mServiceType.compare(mServiceType.size() - 2, 2, ":1") != 0;
}

RouterResult UpnpRouter::AddPortMappingUnconfirmed(const PortMapping &mapping) {
  RouterResult opened = Open();
  if (!opened.Ok()) {
    return opened;
  }
  return CanListRanges() ? SendAdd(mapping) : AddPortMapping(mapping);
}

RouterResult UpnpRouter::AddPortMapping(const PortMapping &mapping) {
  RouterResult added = SendAdd(mapping);
  if (!added.Ok()) {
    return added;
  }
  const std::string external = std::to_string(mapping.externalPort);
  const char *protocol = UpnpProtocolName(mapping.protocol);

  // Some routers answer success and drop the mapping (a full table), or
  // answer with a body that miniupnpc reads as success: look.
  RouterMapping held;
  RouterResult confirm =
      GetSpecificPortMapping(mapping.protocol, mapping.externalPort, held);
  if (confirm.outcome == RouterOutcome::kNotFound) {
    confirm.outcome = RouterOutcome::kNotHeld;
    confirm.message = "the router answered success to " + MappingText(mapping) +
                      " but does not hold it (is its table full?)";
    ZARK_PM_LOG_ERROR("%s", confirm.message.c_str());
    return confirm;
  }
  if (confirm.outcome == RouterOutcome::kRefused ||
      confirm.outcome == RouterOutcome::kUnsupported) {
    // The add was answered with success; only the look failed. It may be
    // there: the caller must not count on either.
    confirm.outcome = RouterOutcome::kBadReply;
    confirm.message = "added " + MappingText(mapping) +
                      " but cannot read it back: " + confirm.message;
    return confirm;
  }
  if (!confirm.Ok()) {
    return confirm;
  }
  if (held.internalClient != mapping.internalClient ||
      held.internalPort != mapping.internalPort) {
    confirm.outcome = RouterOutcome::kNotHeld;
    confirm.message = "the router answered success to " + MappingText(mapping) +
                      " but holds " + std::string(protocol) + " " + external +
                      "->" + held.internalClient + ":" +
                      std::to_string(held.internalPort);
    ZARK_PM_LOG_ERROR("%s", confirm.message.c_str());
    return confirm;
  }
  confirm.leaseSeconds = held.leaseSeconds;
  confirm.message = "added " + MappingText(mapping) + " lease " +
                    std::to_string(held.leaseSeconds);
  return confirm;
}

RouterResult UpnpRouter::DeletePortMappingOnce(const PortMapping &mapping) {
  RouterResult opened = Open();
  if (!opened.Ok()) {
    return opened;
  }
  const std::string external = std::to_string(mapping.externalPort);
  int rc = UPNP_DeletePortMapping(mControlUrl.c_str(), mServiceType.c_str(),
                                  external.c_str(),
                                  UpnpProtocolName(mapping.protocol), nullptr);
  return ZARK_PM_CLASSIFY("UPNP_DeletePortMapping", rc, MappingText(mapping));
}

RouterResult UpnpRouter::GetSpecificPortMappingOnce(IpProtocol protocol,
                                                    uint16_t externalPort,
                                                    RouterMapping &entry) {
  RouterResult opened = Open();
  if (!opened.Ok()) {
    return opened;
  }
  const std::string external = std::to_string(externalPort);
  // miniupnpc writes at most 16, 6, 80, 4 and 16 bytes into these.
  char client[64] = {};
  char port[16] = {};
  char description[128] = {};
  char enabled[16] = {};
  char lease[32] = {};
  int rc = UPNP_GetSpecificPortMappingEntry(
      mControlUrl.c_str(), mServiceType.c_str(), external.c_str(),
      UpnpProtocolName(protocol), nullptr, client, port, description, enabled,
      lease);
  RouterResult result = ZARK_PM_CLASSIFY(
      "UPNP_GetSpecificPortMappingEntry", rc,
      std::string(UpnpProtocolName(protocol)) + " " + external + " -> \"" +
          client + "\":\"" + port + "\" lease \"" + lease + "\"");
  if (!result.Ok()) {
    return result;
  }
  std::optional<uint32_t> internalPort = ParseUnsigned(port, 65535);
  std::optional<uint32_t> leaseSeconds = lease[0] == '\0'
                                             ? std::optional<uint32_t>(0)
                                             : ParseUnsigned(lease, UINT32_MAX);
  if (!ParseIpv4(client) || !internalPort || *internalPort == 0 ||
      !leaseSeconds) {
    result.outcome = RouterOutcome::kBadReply;
    result.message = "the router's entry for " +
                     std::string(UpnpProtocolName(protocol)) + " " + external +
                     " is not understood";
    ZARK_PM_LOG_ERROR("%s", result.message.c_str());
    return result;
  }
  entry.protocol = protocol;
  entry.externalPort = externalPort;
  entry.internalClient = client;
  entry.internalPort = static_cast<uint16_t>(*internalPort);
  entry.description = description;
  entry.leaseSeconds = *leaseSeconds;
  entry.enabled = std::strcmp(enabled, "0") != 0;
  return result;
}

RouterResult UpnpRouter::ListMappingsOnce(std::vector<RouterMapping> &entries) {
  RouterResult opened = Open();
  if (!opened.Ok()) {
    return opened;
  }
  entries.clear();
  for (int index = 0; index < kMaxListedEntries; ++index) {
    const std::string indexText = std::to_string(index);
    // miniupnpc writes at most 6, 16, 6, 4, 80, 4, 64 and 16 bytes.
    char external[16] = {};
    char client[64] = {};
    char internal[16] = {};
    char protocol[16] = {};
    char description[128] = {};
    char enabled[16] = {};
    char remoteHost[128] = {};
    char lease[32] = {};
    int rc = UPNP_GetGenericPortMappingEntry(
        mControlUrl.c_str(), mServiceType.c_str(), indexText.c_str(), external,
        client, internal, protocol, description, enabled, remoteHost, lease);
    if (rc == kUpnpArrayIndexInvalid || rc == kUpnpNoSuchEntry) {
      // The end of the table: 713 by the standard, 714 on some routers.
      LogRouterCall(__FILE__, __LINE__, "UPNP_GetGenericPortMappingEntry", rc,
                    false, "", "index " + indexText + ": end of the table");
      RouterResult done;
      done.outcome = RouterOutcome::kOk;
      done.message = std::to_string(entries.size()) + " mapping(s)";
      return done;
    }
    RouterResult result = ZARK_PM_CLASSIFY("UPNP_GetGenericPortMappingEntry",
                                           rc, "index " + indexText);
    if (!result.Ok()) {
      return result;
    }
    std::optional<uint32_t> externalPort = ParseUnsigned(external, 65535);
    std::optional<uint32_t> internalPort = ParseUnsigned(internal, 65535);
    std::optional<IpProtocol> parsedProtocol = ParseProtocolText(protocol);
    std::optional<uint32_t> leaseSeconds =
        lease[0] == '\0' ? std::optional<uint32_t>(0)
                         : ParseUnsigned(lease, UINT32_MAX);
    if (!externalPort || !internalPort || !parsedProtocol || !leaseSeconds) {
      ZARK_PM_LOG_ERROR("router table entry %d is not understood; skipped",
                        index);
      continue;
    }
    RouterMapping entry;
    entry.protocol = *parsedProtocol;
    entry.externalPort = static_cast<uint16_t>(*externalPort);
    entry.internalPort = static_cast<uint16_t>(*internalPort);
    entry.internalClient = client;
    entry.description = description;
    entry.leaseSeconds = *leaseSeconds;
    entry.enabled = std::strcmp(enabled, "0") != 0;
    entries.push_back(std::move(entry));
  }
  RouterResult capped;
  capped.outcome = RouterOutcome::kOk;
  capped.message = "listed the first " + std::to_string(kMaxListedEntries) +
                   " mappings only";
  ZARK_PM_LOG_ERROR("%s", capped.message.c_str());
  return capped;
}

ZARK_FAILURE_KIND UpnpRouter::FailureKind(const RouterResult &result) const {
  switch (result.code) {
  case kUpnpConflictInMappingEntry:
  case kUpnpConflictWithOtherMechanisms:
    return ZARK_FAILURE_CONFLICT;
  case kUpnpNoPortMapsAvailable:
    return ZARK_FAILURE_TABLE_FULL;
  case kUpnpOnlyPermanentLeases:
    return ZARK_FAILURE_LEASE_REFUSED;
  case kUpnpNotAuthorized:
  case kUpnpSamePortValuesRequired:
  case kUpnpWildcardExternalPort:
    return ZARK_FAILURE_PORT_REFUSED;
  default:
    return RouterDriver::FailureKind(result);
  }
}

static_assert(sizeof(::PortMapping::leaseTime) == sizeof(unsigned long long),
              "miniupnpc's listing entries must be read with its C99 layout");

RouterResult
UpnpRouter::ListPortRangeOnce(IpProtocol protocol, uint16_t firstPort,
                              uint16_t lastPort,
                              std::vector<RouterMapping> &entries) {
  entries.clear();
  RouterResult opened = Open();
  if (!opened.Ok()) {
    return opened;
  }
  if (!CanListRanges()) {
    return RouterDriver::ListPortRange(protocol, firstPort, lastPort, entries);
  }
  // One page per request; a router sends at most the number asked (and
  // miniupnpd at most 1000 whatever is asked), so a full page asks again
  // from the port after its last entry. Bounded: 65536 ports, 1000 a page.
  constexpr int kPageEntries = 1000;
  const std::string page = std::to_string(kPageEntries);
  uint32_t start = firstPort;
  RouterResult result;
  for (int request = 0; request < 66 && start <= lastPort; ++request) {
    const std::string startText = std::to_string(start);
    const std::string endText = std::to_string(lastPort);
    PortMappingParserData data{};
    int rc = UPNP_GetListOfPortMappings(
        mControlUrl.c_str(), mServiceType.c_str(), startText.c_str(),
        endText.c_str(), UpnpProtocolName(protocol), page.c_str(), &data);
    std::unique_ptr<PortMappingParserData, void (*)(PortMappingParserData *)>
        owner(&data, FreePortListing);
    if (rc == kUpnpPortMappingNotFound) {
      LogRouterCall(__FILE__, __LINE__, "UPNP_GetListOfPortMappings", rc, false,
                    "", startText + "-" + endText + ": no more mappings");
      break;
    }
    result = ZARK_PM_CLASSIFY("UPNP_GetListOfPortMappings", rc,
                              std::string(UpnpProtocolName(protocol)) + " " +
                                  startText + "-" + endText);
    if (!result.Ok()) {
      entries.clear();
      return result;
    }
    int count = 0;
    uint32_t highest = 0;
    for (const ::PortMapping *item = data.l_head; item != nullptr;
         item = item->l_next) {
      ++count;
      std::optional<IpProtocol> itemProtocol =
          ParseProtocolText(item->protocol);
      if (!itemProtocol || *itemProtocol != protocol ||
          item->externalPort == 0 || item->externalPort < start) {
        continue;
      }
      RouterMapping entry;
      entry.protocol = protocol;
      entry.externalPort = item->externalPort;
      entry.internalPort = item->internalPort;
      entry.internalClient = item->internalClient;
      entry.description = item->description;
      entry.leaseSeconds = static_cast<uint32_t>(item->leaseTime);
      entry.enabled = item->enabled != 0;
      highest = std::max<uint32_t>(highest, item->externalPort);
      entries.push_back(std::move(entry));
    }
    if (count < kPageEntries || highest == 0) {
      break;
    }
    start = highest + 1;
  }
  std::sort(entries.begin(), entries.end(),
            [](const RouterMapping &a, const RouterMapping &b) {
              return a.externalPort < b.externalPort;
            });
  result.outcome = RouterOutcome::kOk;
  result.code = 0;
  result.message = std::to_string(entries.size()) + " mapping(s) listed";
  return result;
}

RouterResult UpnpRouter::GetExternalAddressOnce(std::string &address) {
  RouterResult opened = Open();
  if (!opened.Ok()) {
    return opened;
  }
  char text[64] = {};
  int rc = UPNP_GetExternalIPAddress(mControlUrl.c_str(), mServiceType.c_str(),
                                     text);
  RouterResult result =
      ZARK_PM_CLASSIFY("UPNP_GetExternalIPAddress", rc, std::string(text));
  if (!result.Ok()) {
    return result;
  }
  if (!ParseIpv4(text)) {
    result.outcome = RouterOutcome::kBadReply;
    result.message = "the router's external address \"" + std::string(text) +
                     "\" is not an IPv4 address";
    ZARK_PM_LOG_ERROR("%s", result.message.c_str());
    return result;
  }
  address = text;
  return result;
}

bool UpnpRouter::ControlUrlWasStale(const RouterResult &failed) {
  const bool mayBeStale = failed.outcome == RouterOutcome::kNoAnswer ||
                          failed.outcome == RouterOutcome::kBadReply ||
                          failed.code == UPNPCOMMAND_HTTP_ERROR ||
                          failed.code == kUpnpInvalidAction;
  if (!mFromMemo || failed.Ok() || !mayBeStale) {
    return false;
  }
  // The remembered control URL failed: the router may have restarted on
  // another port or path. Fetch its description once; retry only when it
  // names another control point.
  mFromMemo = false;
  mOpen = false;
  const std::string oldUrl = mControlUrl;
  const std::string oldType = mServiceType;
  if (!Open().Ok()) {
    return false;
  }
  return mControlUrl != oldUrl || mServiceType != oldType;
}

RouterResult UpnpRouter::SendAdd(const PortMapping &mapping) {
  RouterResult result = SendAddOnce(mapping);
  return ControlUrlWasStale(result) ? SendAddOnce(mapping) : result;
}

RouterResult UpnpRouter::DeletePortMapping(const PortMapping &mapping) {
  RouterResult result = DeletePortMappingOnce(mapping);
  return ControlUrlWasStale(result) ? DeletePortMappingOnce(mapping) : result;
}

RouterResult UpnpRouter::GetSpecificPortMapping(IpProtocol protocol,
                                                uint16_t externalPort,
                                                RouterMapping &entry) {
  RouterResult result =
      GetSpecificPortMappingOnce(protocol, externalPort, entry);
  return ControlUrlWasStale(result)
             ? GetSpecificPortMappingOnce(protocol, externalPort, entry)
             : result;
}

RouterResult UpnpRouter::ListMappings(std::vector<RouterMapping> &entries) {
  RouterResult result = ListMappingsOnce(entries);
  return ControlUrlWasStale(result) ? ListMappingsOnce(entries) : result;
}

RouterResult UpnpRouter::ListPortRange(IpProtocol protocol, uint16_t firstPort,
                                       uint16_t lastPort,
                                       std::vector<RouterMapping> &entries) {
  RouterResult result =
      ListPortRangeOnce(protocol, firstPort, lastPort, entries);
  return ControlUrlWasStale(result)
             ? ListPortRangeOnce(protocol, firstPort, lastPort, entries)
             : result;
}

RouterResult UpnpRouter::GetExternalAddress(std::string &address) {
  RouterResult result = GetExternalAddressOnce(address);
  return ControlUrlWasStale(result) ? GetExternalAddressOnce(address) : result;
}

} // namespace zark::portmap
