// What the library has mapped on which router: the memory that lets a save
// touch only what changed, lets "renew" refresh leases and re-add what a
// router lost, and lets the next save repair what a failed one left.
//
// Kept in /etc/portforward/mappings.json (mode 0600), replaced atomically.
// One record per gateway and protocol:
//
//   {
//     "version" : 2,
//     "routers" : [ {
//       "gateway" : "192.168.1.1", "protocol" : "upnp",
//       "location" : "http://192.168.1.1:5000/rootDesc.xml",
//       "finite_leases" : false, "external_address" : "203.0.113.7",
//       "control_url" : "http://192.168.1.1:5000/ctl/IPConn",
//       "service_type" : "urn:schemas-upnp-org:service:WANIPConnection:2",
//       "last_job" : { "kind" : "save", "ended" : 1700000000, "ok" : false,
//                      "repaired" : 0, "added" : 1, "deleted" : 0,
//                      "failure" : "conflict", "reason" : "words" },
//       "mappings" : [ {
//         "protocol" : "tcp", "external_port" : 8080, "internal_port" : 80,
//         "internal_client" : "192.168.1.10", "lease" : 0, "expires" : 0,
//         "held" : true, "rule_id" : "1", "state" : "on_router",
//         "failure" : "", "reason" : "", "verified" : 1700000000 } ] } ]
//   }
//
// "control_url" and "service_type" are where the last job sent its UPnP
// requests: the next one starts there without fetching the description
// ("" for NAT-PMP). "last_job" may be null. Version 1 files (without
// "external_address", "last_job" and the mappings' "state", "failure",
// "reason", "verified") are read too: a held mapping is then "on_router",
// another "pending", and none was verified.
//
// "held" true: the router was seen to hold the mapping. false: it may or may
// not (a request was under way when the job stopped, or the router stopped
// answering); the next save deletes or re-adds such a mapping instead of
// trusting it. "expires": seconds since 1970 when the lease runs out, 0 for
// a permanent mapping. "location" and "finite_leases" are where the router
// was found and whether it took only finite leases, for the next job to
// start from. "state" is what the administrator is shown: on the router
// (seen there at "verified"), missing (the router lost it), refused (the
// router said no: "failure" and "reason" say why; never ours on the router,
// so never deleted there), pending (not applied yet: the router did not
// answer).
#ifndef ZARK_PORTMAP_MAPPING_STATE_H
#define ZARK_PORTMAP_MAPPING_STATE_H

#include "base/port_mapping.h"
#include "base/router_protocol.h"
#include "libzarkportmap.h"
#include "zarkportforward.h"

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

namespace zark::portmap {

inline constexpr const char *kMappingStatePath =
    ZARK_PORTMAP_CONF_DIR "/mappings.json";
inline constexpr int kMappingStateVersion = 2;
// The most mappings one router's record holds: every port of both
// protocols, the largest rule set the library accepts.
inline constexpr std::size_t kMaxRecordedMappings = 2 * 65535;
// The largest state file read: the most mappings of one router, each with
// a rule id and a reason of 200 bytes, fit (about 825 bytes an entry as
// written).
inline constexpr std::size_t kMaxMappingStateBytes = 128u << 20;

// Where a wanted mapping stands with the router.
enum class MappingApply : uint8_t { kOnRouter, kMissing, kRefused, kPending };
// "on_router", "missing", "refused", "pending".
[[nodiscard]] const char *MappingApplyWord(MappingApply apply);

struct RecordedMapping {
  IpProtocol protocol = IpProtocol::kTcp;
  uint16_t externalPort = 0;
  uint16_t internalPort = 0;
  std::string internalClient;
  uint32_t leaseSeconds = 0;
  int64_t expires = 0; // 0: no end
  bool held = false;
  std::string ruleId;
  MappingApply apply = MappingApply::kPending;
  ZARK_FAILURE_KIND failure = ZARK_FAILURE_NONE;
  std::string reason{}; // why it is not on the router, in words
  int64_t verified = 0; // seen on the router, seconds since 1970; 0 never

  friend bool operator==(const RecordedMapping &,
                         const RecordedMapping &) = default;
};

// The outcome of the last job that talked to a router.
struct LastJob {
  std::string kind;  // "save", "renew", "repair"
  int64_t ended = 0; // seconds since 1970
  bool ok = false;
  int repaired = 0;
  int added = 0;
  int deleted = 0;
  ZARK_FAILURE_KIND failure = ZARK_FAILURE_NONE;
  std::string reason;

  friend bool operator==(const LastJob &, const LastJob &) = default;
};

struct RouterRecord {
  std::string gateway;
  RouterProtocol protocol = RouterProtocol::kUpnp; // RouterDriver::Protocol()
  std::string location;                            // RouterDriver::Location()
  bool finiteLeases = false;
  std::string externalAddress; // "" unknown
  std::string controlUrl;      // RouterDriver::ControlUrl()
  std::string serviceType;     // RouterDriver::ServiceType()
  std::optional<LastJob> lastJob;
  std::vector<RecordedMapping> mappings;

  // Equal content; the lookup index is not content.
  friend bool operator==(const RouterRecord &a, const RouterRecord &b) {
    return a.gateway == b.gateway && a.protocol == b.protocol &&
           a.location == b.location && a.finiteLeases == b.finiteLeases &&
           a.externalAddress == b.externalAddress &&
           a.controlUrl == b.controlUrl && a.serviceType == b.serviceType &&
           a.lastJob == b.lastJob && a.mappings == b.mappings;
  }

  // The mapping of externalPort/protocol, or null. Keyed (not a search of
  // the list): a save of many mappings looks each up several times.
  [[nodiscard]] RecordedMapping *Find(IpProtocol protocol,
                                      uint16_t externalPort);
  [[nodiscard]] const RecordedMapping *Find(IpProtocol protocol,
                                            uint16_t externalPort) const;
  // Replaces the mapping of the same port and protocol, or appends it.
  void Put(const RecordedMapping &mapping);
  // Removes the mapping of externalPort/protocol, if any.
  void Remove(IpProtocol protocol, uint16_t externalPort);

private:
  // Position in mappings by protocol and port, rebuilt when it no longer
  // matches the list (a caller may change the list directly).
  [[nodiscard]] std::size_t IndexOf(IpProtocol protocol,
                                    uint16_t externalPort) const;
  mutable std::unordered_map<uint32_t, std::size_t> mIndex;
};

struct MappingState {
  std::vector<RouterRecord> routers;

  friend bool operator==(const MappingState &, const MappingState &) = default;

  // The record of gateway and protocol, or null.
  [[nodiscard]] RouterRecord *Find(std::string_view gateway,
                                   RouterProtocol protocol);
  // The record of gateway and protocol, created empty when missing.
  RouterRecord &FindOrAdd(std::string_view gateway, RouterProtocol protocol);
  // Drops records that hold no mapping and remember no location.
  void DropEmpty();
};

// The file's text (pure; no file access). Parse refuses anything but the
// format above (false, why set): strict JSON, version 1, every member of
// the right type, ports 1..65535, addresses dotted quads; version 1 or 2.
// Members it does not know are ignored. Never throws.
[[nodiscard]] std::string SerializeMappingState(const MappingState &state);
[[nodiscard]] bool ParseMappingState(std::string_view text, MappingState &state,
                                     std::string &why) noexcept;

// Reads the state at path. A missing file is an empty state (true). A file
// that cannot be read or parsed is logged and gives false with an empty
// state.
[[nodiscard]] bool LoadMappingState(const std::string &path,
                                    MappingState &state);

// Replaces the state at path atomically (mode 0600). False, logged, when it
// cannot be written; the old file is then untouched.
[[nodiscard]] bool SaveMappingState(const std::string &path,
                                    const MappingState &state);

} // namespace zark::portmap

#endif
