// A scriptable stand-in for the firewall and service calls of zarkfw.h, for
// the failure paths that real service definition files cannot produce (a
// failing enumeration, section ports outside the port space) and for
// counting how tables are built and freed. Reset() gives an empty firewall
// whose calls succeed.
#ifndef ZARK_TESTS_FAKE_FIREWALL_H
#define ZARK_TESTS_FAKE_FIREWALL_H

#include "zarkfw.h"

#include <map>
#include <optional>
#include <string>
#include <vector>

namespace zark::fake {

struct FwSection {
  std::string name;
  int usable = 1;
  int protoMask = ZARK_FW_PROTO_TCP;
  bool hasPorts = true; // false: the record's port list is NULL
  std::vector<std::string> ports;
};

struct Firewall {
  // What ZARKFwServiceEnum puts in a table (copied at that moment).
  std::vector<FwSection> sections;
  // What KLIBServiceEnum appends.
  std::vector<std::string> systemServices;
  // What KLIBServicecfgInfoGet appends per service; a service missing here
  // is unknown (-1, KLIBC_ERR_FILE_NOT_FOUND).
  std::map<std::string, std::vector<std::string>> serviceSections;

  // Forced results. ZARKFwServiceEnum still hands out its table; the
  // others append nothing. A negative one also sets the core library
  // error KLIBC_ERR_FILE_OPEN.
  std::optional<int> fwServiceEnumResult;
  std::optional<int> serviceEnumResult;
  std::optional<int> servicecfgInfoGetResult;

  // Counters.
  int tablesBuilt = 0;
  int tablesFreed = 0; // non-NULL tables given to ZARKFwServiceFree
  int serviceEnumCalls = 0;
};

// The process's fake firewall.
Firewall &FakeFirewall();
// Back to an empty firewall with every counter 0.
void ResetFakeFirewall();

} // namespace zark::fake

#endif
