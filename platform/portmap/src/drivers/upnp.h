// UPnP IGD (Internet Gateway Device) over miniupnpc: finding the router's
// WANIPConnection or WANPPPConnection service (IGD versions 1 and 2) and
// adding, deleting, reading and listing its port mappings. The only file
// that includes miniupnpc's headers is upnp.cpp.
//
// Deadlines: miniupnpc bounds every request itself (3 s to connect, then 5 s
// of silence at most between two reads of the reply); discovery waits
// discoverWait per search target, two targets. A router that stops
// answering therefore fails the call in about 5 s with kNoAnswer.
#ifndef ZARK_PORTMAP_UPNP_H
#define ZARK_PORTMAP_UPNP_H

#include "base/local_network.h"
#include "drivers/router_driver.h"

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace zark::portmap {

// Error codes a UPnP router answers in a SOAP fault (<errorCode>), numbered
// by the UPnP IGD standard. They are not miniupnpc's own results
// (UPNPCOMMAND_*, all negative), which miniupnpc names itself.
enum UpnpErrorCode : int {
  kUpnpInvalidAction = 401,        // no such action at this control URL
  kUpnpInvalidArgs = 402,          // an argument is wrong; some routers say so
                                   // about the lease duration
  kUpnpActionFailed = 501,         // the router failed to do it
  kUpnpNotAuthorized = 606,        // denied by the router's permission rules
  kUpnpArrayIndexInvalid = 713,    // GetGenericPortMappingEntry: past the end
  kUpnpNoSuchEntry = 714,          // no such mapping
  kUpnpWildcardExternalPort = 716, // external port 0 is not allowed
  kUpnpConflictInMappingEntry = 718,      // the port is held for another device
  kUpnpSamePortValuesRequired = 724,      // router and local port must be equal
  kUpnpOnlyPermanentLeases = 725,         // the router takes lease 0 only (some
                                          // answer it to lease 0 as well)
  kUpnpNoPortMapsAvailable = 728,         // the router's table is full
  kUpnpConflictWithOtherMechanisms = 729, // a port the router itself uses
  kUpnpPortMappingNotFound = 730, // GetListOfPortMappings: none in the range
};

// How long a mapping is asked for.
enum class LeaseKind {
  kPermanent, // lease 0 (IGDv2 routers turn it into one week)
  kFinite,    // UpnpOptions::finiteLeaseSeconds; renewed by "renew"
};

struct UpnpOptions {
  // The default gateway (dotted quad). Its device is tried first among
  // discovered ones, and it counts as local.
  std::string gateway;
  // Root description URLs to try first, in order (the one found by the last
  // job, or one given by a test). Discovery runs only when none works.
  std::vector<std::string> knownRootDescUrls;
  // Search by SSDP multicast when no known URL works.
  bool discover = true;
  // How long discovery listens for answers to each of its two searches.
  std::chrono::milliseconds discoverWait{1000};
  // Networks that count as local; none given: the interfaces' networks
  // (InterfaceNetworks), loopback left out.
  std::optional<std::vector<Ipv4Network>> localNetworks;
  // The first kind of lease to ask for; the other is tried when the router
  // refuses it with 725 or 402, and then kept for the rest of the job.
  // The control URL and service type the last job used at
  // knownRootDescUrls.front(): Open trusts them without fetching the
  // description until a request through them fails.
  std::string knownControlUrl;
  std::string knownServiceType;
  LeaseKind firstLease = LeaseKind::kPermanent;
  uint32_t finiteLeaseSeconds = 3600;
};

class UpnpRouter final : public RouterDriver {
public:
  explicit UpnpRouter(UpnpOptions options);
  ~UpnpRouter() override;

  [[nodiscard]] RouterProtocol Protocol() const override {
    return RouterProtocol::kUpnp;
  }
  [[nodiscard]] RouterResult Open() override;
  [[nodiscard]] std::string Location() const override { return mRootDescUrl; }

  [[nodiscard]] RouterResult
  AddPortMapping(const PortMapping &mapping) override;
  [[nodiscard]] RouterResult
  DeletePortMapping(const PortMapping &mapping) override;
  [[nodiscard]] RouterResult
  GetSpecificPortMapping(IpProtocol protocol, uint16_t externalPort,
                         RouterMapping &entry) override;
  [[nodiscard]] RouterResult
  ListMappings(std::vector<RouterMapping> &entries) override;
  [[nodiscard]] RouterResult GetExternalAddress(std::string &address) override;
  // IGD:2 only (GetListOfPortMappings).
  [[nodiscard]] RouterResult
  ListPortRange(IpProtocol protocol, uint16_t firstPort, uint16_t lastPort,
                std::vector<RouterMapping> &entries) override;
  // IGD:2 only; IGD:1 routers cannot list, so their adds are read back.
  [[nodiscard]] RouterResult
  AddPortMappingUnconfirmed(const PortMapping &mapping) override;
  [[nodiscard]] ZARK_FAILURE_KIND
  FailureKind(const RouterResult &result) const override;
  // miniupnpc's 3 s to connect and 5 s of silence.
  [[nodiscard]] int AnswerDeadlineSeconds() const override { return 8; }

  // The kind of lease the router took last (remembered for the next job).
  [[nodiscard]] LeaseKind CurrentLeaseKind() const { return mLeaseKind; }
  [[nodiscard]] bool FiniteLeases() const override {
    return mLeaseKind == LeaseKind::kFinite;
  }
  // The service in use after Open ("urn:...:WANIPConnection:1" ...) and its
  // control URL; empty before.
  [[nodiscard]] std::string ServiceType() const override {
    return mServiceType;
  }
  [[nodiscard]] std::string ControlUrl() const override { return mControlUrl; }

  // At most this many entries are read by ListMappings.
  static constexpr int kMaxListedEntries = 1024;
  // At most this many discovered devices are looked at.
  static constexpr int kMaxCandidates = 8;

private:
  // Opens on the control point the last job used, when it is still on the
  // local network: true with remembered set.
  [[nodiscard]] bool OpenFromMemo(RouterResult &remembered);
  // Root description URLs found by an SSDP search, not in tried: the
  // gateway's own first, at most kMaxCandidates.
  [[nodiscard]] std::vector<std::string>
  DiscoverDescriptions(const std::vector<std::string> &tried);
  RouterResult TryRootDescription(const std::string &url);
  // AddPortMapping's request (a second try with the other kind of lease on
  // 725 or 402), without reading the mapping back.
  RouterResult SendAdd(const PortMapping &mapping);
  // The operations once, through the current control point; the public ones
  // retry once when ControlUrlWasStale.
  RouterResult SendAddOnce(const PortMapping &mapping);
  RouterResult DeletePortMappingOnce(const PortMapping &mapping);
  RouterResult GetSpecificPortMappingOnce(IpProtocol protocol,
                                          uint16_t externalPort,
                                          RouterMapping &entry);
  RouterResult ListMappingsOnce(std::vector<RouterMapping> &entries);
  RouterResult ListPortRangeOnce(IpProtocol protocol, uint16_t firstPort,
                                 uint16_t lastPort,
                                 std::vector<RouterMapping> &entries);
  RouterResult GetExternalAddressOnce(std::string &address);
  // After a failure through a remembered control point: true when a fresh
  // description names another one (then the request is worth repeating).
  bool ControlUrlWasStale(const RouterResult &failed);
  [[nodiscard]] bool CanListRanges() const;

  UpnpOptions mOptions;
  std::vector<Ipv4Network> mNetworks;
  std::optional<uint32_t> mGateway;
  bool mOpen = false;
  std::string mRootDescUrl;
  std::string mControlUrl;
  std::string mServiceType;
  bool mMemoTried = false; // Open has looked at the remembered control point
  bool mFromMemo = false;  // the control point is the remembered one
  LeaseKind mLeaseKind;
};

} // namespace zark::portmap

#endif
