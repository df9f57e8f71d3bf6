// Port-map library: the jobs of the zarkportforward tool, run outside the
// web interface (by hand, or by the renewal timer): applying the saved rules
// to the router, renewing their leases, and listing the router's mappings.
//
// None of these takes the port-map lock: the caller holds it
// (KLibZarkPortMapLock) for the whole job, so that a job and a save from
// the web interface never talk to the router at the same time.
#ifndef ZARK_PLATFORM_ZARKPORTFORWARD_H
#define ZARK_PLATFORM_ZARKPORTFORWARD_H

#include "libzarkportmap.h"

#ifdef __cplusplus
extern "C" {
#endif

// What an apply or a renewal did, counted by mapping.
typedef struct {
  int32_t deleted;   // deleted from the router
  int32_t added;     // added (and seen held)
  int32_t checked;   // asked about (UPnP) or mapped again (NAT-PMP)
  int32_t unchanged; // left alone without a request
  int32_t failed;    // refused or dropped by the router
} ZARK_PORTMAP_APPLY_SUMMARY;

// KLibApplySavedRules could not read the saved rule configuration.
#define ZARK_APPLY_SAVED_RULES_UNREADABLE (-2)

// Applies the saved rule configuration (ZARK_PORTMAP_RULE_CONF) to the
// router configured for gatewayIP: deletes the mappings no longer wanted,
// adds the missing ones, asks the router about the others and adds again
// those it lost, and refreshes leases that end within 45 minutes. The saved
// rule configuration itself is not rewritten. renew false writes
// ZARK_PORTMAP_APPLY_PROGRESS as the job goes; renew true (the timer's
// job) does not.
//
// summary (may be NULL) counts what was done, also on failure. Returns 0
// on success; -1 with result (may be NULL) holding the error type
// (ZARK_SAVE_ERR_* refusals of a rule and ZARK_SAVE_ERR_NOT_CONFIGURED, or
// ZARK_PORTMAP_ERR_GENERIC, _BAD_PARAMETER, _IO, _ROUTER) and its detail,
// as KLibSaveRules fills it; ZARK_APPLY_SAVED_RULES_UNREADABLE when the
// saved rule configuration cannot be read (nothing was done).
int KLibApplySavedRules(const char *gatewayIP, bool renew,
                        ZARK_PORTMAP_APPLY_SUMMARY *summary,
                        ZARK_ROUTER_SAVE_RULE_RESULT *result);

// One port mapping of a router's table, or of the record of the mappings
// this server made.
typedef struct {
  char protocol[4]; // "TCP" or "UDP"
  uint16_t external_port;
  uint16_t internal_port;
  char internal_client[64];                 // dotted IPv4 address
  uint32_t lease_seconds;                   // 0: permanent
  uint8_t ours;                             // 1: made by this server
  uint8_t held;                             // 0: our record does not know
                                            // that the router holds it
  char description[ZARK_PORTMAP_TEXT_SIZE]; // the router's; cut to fit
  char rule_id[ZARK_PORTMAP_TEXT_SIZE];     // the rule of one of ours
} ZARK_ROUTER_MAPPING;

typedef struct {
  char router_protocol[16];              // "upnp" or "natpmp"
  char location[ZARK_PORTMAP_TEXT_SIZE]; // the router's description URL, or
                                         // its address
  // 1: the router cannot list its table (NAT-PMP); the mappings are the
  // record of those this server made.
  uint8_t from_record;
  // 1: the record of our mappings could not be read; none is marked ours.
  uint8_t record_unreadable;
  char message[ZARK_PORTMAP_TEXT_SIZE]; // why listing failed
  int32_t count;
  ZARK_ROUTER_MAPPING *mappings; // count records; free with
                                 // KLibFreeRouterMappings
} ZARK_ROUTER_MAPPINGS;

// Lists the port mappings of the router configured for gatewayIP, marking
// those this server made. *mappings is reset first. Returns 0 with
// *mappings filled; -1 with err set and mappings->message saying why:
// ZARK_PORTMAP_ERR_NOT_CONFIGURED (no router the library can drive is
// configured for the gateway), ZARK_PORTMAP_ERR_IO (its configuration
// cannot be read), ZARK_PORTMAP_ERR_ROUTER (the router refused or did not
// answer), ZARK_PORTMAP_ERR_BAD_PARAMETER, ZARK_PORTMAP_ERR_GENERIC.
int KLibListRouterMappings(const char *gatewayIP,
                           ZARK_ROUTER_MAPPINGS *mappings,
                           ZARK_LIBZARKPORTMAP_ERR *err);
// Frees the records of a list and resets it (NULL: nothing).
void KLibFreeRouterMappings(ZARK_ROUTER_MAPPINGS *mappings);

#ifdef __cplusplus
} // extern "C"
#endif

#endif
