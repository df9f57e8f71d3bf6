// KLibListRouterMappings: the zarkportforward tool's list job.
#include "zarkportforward.h"

#include "apply/save_rules.h"
#include "base/portmap_log.h"
#include "base/text_field.h"

#include <cstdlib>
#include <exception>
#include <memory>
#include <vector>

namespace zark::portmap {
namespace {

void SetErr(ZARK_LIBZARKPORTMAP_ERR *err, int32_t code) {
  if (err != nullptr) {
    err->err = code;
  }
}

// The fields a router's entry and our record of a mapping share.
template <typename Mapping>
ZARK_ROUTER_MAPPING &AddEntry(std::vector<ZARK_ROUTER_MAPPING> &entries,
                              const Mapping &mapping) {
  ZARK_ROUTER_MAPPING &entry = entries.emplace_back();
  CopyText(entry.protocol, UpnpProtocolName(mapping.protocol));
  entry.external_port = mapping.externalPort;
  entry.internal_port = mapping.internalPort;
  CopyText(entry.internal_client, mapping.internalClient);
  entry.lease_seconds = mapping.leaseSeconds;
  return entry;
}

// Hands the mappings to the caller as a malloc'ed array
// (KLibFreeRouterMappings).
bool HandOut(const std::vector<ZARK_ROUTER_MAPPING> &entries,
             ZARK_ROUTER_MAPPINGS &out) {
  if (entries.empty()) {
    return true;
  }
  auto *array = static_cast<ZARK_ROUTER_MAPPING *>(
      std::calloc(entries.size(), sizeof(ZARK_ROUTER_MAPPING)));
  if (array == nullptr) {
    return false;
  }
  std::copy(entries.begin(), entries.end(), array);
  out.mappings = array;
  out.count = static_cast<int32_t>(entries.size());
  return true;
}

int ListMappings(const std::string &gateway, ZARK_ROUTER_MAPPINGS &out,
                 ZARK_LIBZARKPORTMAP_ERR *err) {
  const ApplyEnvironment environment = DefaultApplyEnvironment();
  RouterChoice choice;
  int code = ZARK_PORTMAP_ERR_NONE;
  if (!environment.chooseRouter(gateway, choice, code)) {
    CopyText(out.message, "no router that the library can drive is "
                          "configured for " +
                              gateway);
    SetErr(err, code);
    return -1;
  }
  CopyText(out.router_protocol, RouterProtocolName(choice.protocol));
  MappingState state;
  if (!LoadMappingState(environment.statePath, state)) {
    out.record_unreadable = 1;
  }
  const RouterRecord *record = state.Find(gateway, choice.protocol);
  std::unique_ptr<RouterDriver> router =
      environment.makeRouter(choice.protocol, gateway, record);
  if (router == nullptr) {
    CopyText(out.message, "the router cannot be reached");
    SetErr(err, ZARK_PORTMAP_ERR_ROUTER);
    return -1;
  }
  std::vector<RouterMapping> listed;
  RouterResult result = router->ListMappings(listed);
  std::vector<ZARK_ROUTER_MAPPING> entries;
  if (result.outcome == RouterOutcome::kUnsupported) {
    // NAT-PMP has no request that lists the table: what this server made
    // is all that can be told.
    out.from_record = 1;
    CopyText(out.location, gateway);
    if (record != nullptr) {
      for (const RecordedMapping &mapping : record->mappings) {
        if (mapping.apply == MappingApply::kRefused) {
          continue; // the router refused it: not in its table
        }
        ZARK_ROUTER_MAPPING &entry = AddEntry(entries, mapping);
        entry.enabled = 1;
        entry.ours = 1;
        entry.held = mapping.held ? 1 : 0;
        CopyText(entry.rule_id, mapping.ruleId);
      }
    }
  } else if (!result.Ok()) {
    CopyText(out.message, result.message);
    SetErr(err, ZARK_PORTMAP_ERR_ROUTER);
    return -1;
  } else {
    CopyText(out.location, router->Location());
    for (const RouterMapping &mapping : listed) {
      ZARK_ROUTER_MAPPING &entry = AddEntry(entries, mapping);
      CopyText(entry.description, mapping.description);
      entry.enabled = mapping.enabled ? 1 : 0;
      const RecordedMapping *ours =
          record != nullptr
              ? record->Find(mapping.protocol, mapping.externalPort)
              : nullptr;
      // A port we were refused is held by another mapping: not ours.
      if (ours != nullptr && ours->apply != MappingApply::kRefused &&
          ours->internalClient == mapping.internalClient) {
        entry.ours = 1;
        entry.held = ours->held ? 1 : 0;
        CopyText(entry.rule_id, ours->ruleId);
      }
    }
  }
  if (!HandOut(entries, out)) {
    CopyText(out.message, "out of memory");
    SetErr(err, ZARK_PORTMAP_ERR_GENERIC);
    return -1;
  }
  SetErr(err, ZARK_PORTMAP_ERR_NONE);
  return 0;
}

} // namespace
} // namespace zark::portmap

extern "C" int KLibListRouterMappings(const char *gatewayIP,
                                      ZARK_ROUTER_MAPPINGS *mappings,
                                      ZARK_LIBZARKPORTMAP_ERR *err) {
  using namespace zark::portmap;
  if (mappings == nullptr) {
    ZARK_PM_LOG_ERROR("KLibListRouterMappings: no list given");
    SetErr(err, ZARK_PORTMAP_ERR_BAD_PARAMETER);
    return -1;
  }
  *mappings = ZARK_ROUTER_MAPPINGS{};
  if (gatewayIP == nullptr) {
    ZARK_PM_LOG_ERROR("KLibListRouterMappings: no gateway given");
    CopyText(mappings->message, "no gateway given");
    SetErr(err, ZARK_PORTMAP_ERR_BAD_PARAMETER);
    return -1;
  }
  try {
    return ListMappings(gatewayIP, *mappings, err);
  } catch (const std::exception &e) {
    // Nothing may cross the C boundary.
    ZARK_PM_LOG_ERROR("KLibListRouterMappings: %s", e.what());
    KLibFreeRouterMappings(mappings);
    CopyText(mappings->message, e.what());
    SetErr(err, ZARK_PORTMAP_ERR_GENERIC);
    return -1;
  }
}

extern "C" void KLibFreeRouterMappings(ZARK_ROUTER_MAPPINGS *mappings) {
  if (mappings == nullptr) {
    return;
  }
  std::free(mappings->mappings);
  mappings->mappings = nullptr;
  mappings->count = 0;
}
