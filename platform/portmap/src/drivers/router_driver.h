// The small interface every router protocol's driver implements (UPnP IGD
// in upnp.{h,cpp}, NAT-PMP in natpmp.{h,cpp}). Applying rules, renewing and
// listing talk to a router only through it, so a new protocol (PCP, a
// router's own web pages) is one more file pair, and tests can put a
// recording fake in its place.
//
// One object talks to one router for the life of one job (a save, a renew,
// a listing). It is used from one thread and sends one request at a time:
// home routers serve these protocols from one slow loop.
#ifndef ZARK_PORTMAP_DRIVERS_ROUTER_DRIVER_H
#define ZARK_PORTMAP_DRIVERS_ROUTER_DRIVER_H

#include "base/port_mapping.h"
#include "base/router_protocol.h"
#include "zarkportforward.h"

#include <cstdint>
#include <string>
#include <vector>

namespace zark::portmap {

// What became of one router operation. The protocol's own codes stay in
// RouterResult::code; this is what the callers act on.
enum class RouterOutcome {
  kOk,          // done; after an add, the router was seen to hold the mapping
  kNotFound,    // the router holds no such mapping
  kConflict,    // the router port is taken: by another device, by the router
                // itself, or the router granted a different port
  kNotHeld,     // the router answered success but does not hold the mapping
                // (seen on routers whose table is full)
  kRefused,     // the router answered with another error
  kNoAnswer,    // no usable answer before the deadline: connection refused,
                // timeout, empty reply
  kBadReply,    // an answer that could not be understood
  kUnsupported, // the protocol has no such operation (NAT-PMP has no table
                // to read)
  kNoRouter,    // no usable router of this protocol was found
  kFailed,      // a local failure (socket, memory)
};

[[nodiscard]] const char *RouterOutcomeName(RouterOutcome outcome);

struct RouterResult {
  RouterOutcome outcome = RouterOutcome::kFailed;
  // The protocol's own result: a UPnP error code (402, 718, 725 ...) or a
  // miniupnpc result (UPNPCOMMAND_*, negative), a libnatpmp result
  // (NATPMP_ERR_*, negative). 0 when none applies.
  int code = 0;
  uint32_t leaseSeconds = 0;        // add: the lease the router holds
  uint16_t grantedExternalPort = 0; // kConflict on NAT-PMP: the port the
                                    // router chose instead (0: none)
  std::string message;              // one line saying what happened

  [[nodiscard]] bool Ok() const { return outcome == RouterOutcome::kOk; }
};

class RouterDriver {
public:
  RouterDriver() = default;
  RouterDriver(const RouterDriver &) = delete;
  RouterDriver &operator=(const RouterDriver &) = delete;
  virtual ~RouterDriver() = default;

  // The protocol this driver speaks.
  [[nodiscard]] virtual RouterProtocol Protocol() const = 0;

  // Finds the router and checks that it can be used. Later calls reuse what
  // it found (UPnP: the control URL). Every other operation calls it first
  // when it has not succeeded yet. kOk, kNoRouter, kNoAnswer, kFailed.
  [[nodiscard]] virtual RouterResult Open() = 0;

  // Where the router was found, for the next job to try first (UPnP: the
  // root description URL; NAT-PMP: the gateway address). Empty before Open.
  [[nodiscard]] virtual std::string Location() const = 0;

  // Where requests go, for the next job to start from without fetching the
  // router's description (UPnP: the control URL and service type); empty
  // when the protocol has no such thing or before Open.
  [[nodiscard]] virtual std::string ControlUrl() const { return {}; }
  [[nodiscard]] virtual std::string ServiceType() const { return {}; }

  // Adds a mapping and makes sure the router holds it. kOk (leaseSeconds
  // set), kConflict, kNotHeld, kRefused, kNoAnswer, kBadReply, kNoRouter,
  // kFailed.
  [[nodiscard]] virtual RouterResult
  AddPortMapping(const PortMapping &mapping) = 0;

  // Deletes a mapping. kOk, kNotFound, kRefused, kNoAnswer, kBadReply,
  // kNoRouter, kFailed.
  [[nodiscard]] virtual RouterResult
  DeletePortMapping(const PortMapping &mapping) = 0;

  // Reads the router's entry for externalPort/protocol. kOk (entry set),
  // kNotFound, kUnsupported, kRefused, kNoAnswer, kBadReply, kNoRouter,
  // kFailed.
  [[nodiscard]] virtual RouterResult
  GetSpecificPortMapping(IpProtocol protocol, uint16_t externalPort,
                         RouterMapping &entry) = 0;

  // Reads the router's whole table (at most a bounded number of entries).
  // kOk, kUnsupported, kRefused, kNoAnswer, kBadReply, kNoRouter, kFailed.
  [[nodiscard]] virtual RouterResult
  ListMappings(std::vector<RouterMapping> &entries) = 0;

  // Reads the router's mappings of one protocol whose external ports lie in
  // [firstPort, lastPort], a page of many entries per request, where the
  // protocol can (IGD:2's GetListOfPortMappings). The entries come in port
  // order. kOk, kUnsupported (this router cannot: IGD:1, NAT-PMP), kRefused,
  // kNoAnswer, kBadReply, kNoRouter, kFailed.
  [[nodiscard]] virtual RouterResult
  ListPortRange(IpProtocol protocol, uint16_t firstPort, uint16_t lastPort,
                std::vector<RouterMapping> &entries);

  // Adds a mapping without reading it back: for a caller that confirms a
  // batch of adds with ListPortRange. Drivers that confirm otherwise (by the
  // answer itself, NAT-PMP) just add. Results as AddPortMapping's; kOk means
  // only that the router answered success (leaseSeconds not known).
  [[nodiscard]] virtual RouterResult
  AddPortMappingUnconfirmed(const PortMapping &mapping) {
    return AddPortMapping(mapping);
  }

  // True when the router takes only finite leases, so that mappings must be
  // renewed; the next job starts from it.
  [[nodiscard]] virtual bool FiniteLeases() const { return false; }

  // What kind of failure a result of this driver is, for the administrator
  // (ZARK_FAILURE_NONE for kOk and kNotFound). The default goes by the
  // outcome alone; a protocol refines it by its own codes.
  [[nodiscard]] virtual ZARK_FAILURE_KIND
  FailureKind(const RouterResult &result) const;

  // The longest one request waits for the router's answer, in seconds.
  [[nodiscard]] virtual int AnswerDeadlineSeconds() const = 0;

  // The router's address on the internet side. kOk (address set), kRefused,
  // kNoAnswer, kBadReply, kNoRouter, kFailed.
  [[nodiscard]] virtual RouterResult
  GetExternalAddress(std::string &address) = 0;
};

} // namespace zark::portmap

#endif
