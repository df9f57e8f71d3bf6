// What the library has mapped on which router: the memory that lets a save
// touch only what changed, lets "renew" refresh leases and re-add what a
// router lost, and lets the next save repair what a failed one left.
//
// Kept in /etc/portforward/mappings.json (mode 0600), replaced atomically.
// One record per gateway and protocol:
//
//   {
//     "version" : 1,
//     "routers" : [ {
//       "gateway" : "192.168.1.1", "protocol" : "upnp",
//       "location" : "http://192.168.1.1:5000/rootDesc.xml",
//       "finite_leases" : false,
//       "mappings" : [ {
//         "protocol" : "tcp", "external_port" : 8080, "internal_port" : 80,
//         "internal_client" : "192.168.1.10", "lease" : 0, "expires" : 0,
//         "held" : true, "rule_id" : "1" } ] } ]
//   }
//
// "held" true: the router was seen to hold the mapping. false: it may or may
// not (a request was under way when the job stopped, or the router stopped
// answering); the next save deletes or re-adds such a mapping instead of
// trusting it. "expires": seconds since 1970 when the lease runs out, 0 for
// a permanent mapping. "location" and "finite_leases" are where the router
// was found and whether it took only finite leases, for the next job to
// start from.
#ifndef ZARK_PORTMAP_MAPPING_STATE_H
#define ZARK_PORTMAP_MAPPING_STATE_H

#include "base/port_mapping.h"
#include "base/router_protocol.h"
#include "libzarkportmap.h"

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

inline constexpr const char *kMappingStatePath =
    ZARK_PORTMAP_CONF_DIR "/mappings.json";
inline constexpr int kMappingStateVersion = 1;

struct RecordedMapping {
  IpProtocol protocol = IpProtocol::kTcp;
  uint16_t externalPort = 0;
  uint16_t internalPort = 0;
  std::string internalClient;
  uint32_t leaseSeconds = 0;
  int64_t expires = 0; // 0: no end
  bool held = false;
  std::string ruleId;

  friend bool operator==(const RecordedMapping &,
                         const RecordedMapping &) = default;
};

struct RouterRecord {
  std::string gateway;
  RouterProtocol protocol = RouterProtocol::kUpnp; // RouterDriver::Protocol()
  std::string location;                            // RouterDriver::Location()
  bool finiteLeases = false;
  std::vector<RecordedMapping> mappings;

  friend bool operator==(const RouterRecord &, const RouterRecord &) = default;

  // The mapping of externalPort/protocol, or null.
  [[nodiscard]] RecordedMapping *Find(IpProtocol protocol,
                                      uint16_t externalPort);
  [[nodiscard]] const RecordedMapping *Find(IpProtocol protocol,
                                            uint16_t externalPort) const;
  // Replaces the mapping of the same port and protocol, or appends it.
  void Put(const RecordedMapping &mapping);
  // Removes the mapping of externalPort/protocol, if any.
  void Remove(IpProtocol protocol, uint16_t externalPort);
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
// the right type, ports 1..65535, addresses dotted quads. Members it does
// not know are ignored. Never throws.
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
