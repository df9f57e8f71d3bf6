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
  int32_t repaired;  // wanted, found missing on the router, added again
} ZARK_PORTMAP_APPLY_SUMMARY;

// KLibApplySavedRules could not read the saved rule configuration.
#define ZARK_APPLY_SAVED_RULES_UNREADABLE (-2)

// Applies the saved rule configuration (ZARK_PORTMAP_RULE_CONF) to the
// router configured for gatewayIP: deletes the mappings no longer wanted,
// adds the missing ones, asks the router about the others and adds again
// those it lost (summary->repaired), and refreshes leases that end within
// 45 minutes (the keeper, KLibKeepRouter, renews at half the lease). The saved
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
  uint8_t enabled; // 1: the router says the mapping is enabled (UPnP);
                   // 1 for NAT-PMP records
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

// Why a mapping is not on the router, or why a job failed. The codes are
// stable (scripts key on them); KLibFailureKindName gives the word the
// status page and the JSON show.
typedef enum {
  ZARK_FAILURE_NONE = 0,
  ZARK_FAILURE_ROUTER_NOT_ANSWERING = 1, // no answer within the deadline
  ZARK_FAILURE_CONFLICT = 2,             // another mapping holds the port
  ZARK_FAILURE_PORT_REFUSED = 3,         // refused by the router's policy
  ZARK_FAILURE_TABLE_FULL = 4,           // the router's table has no room
  ZARK_FAILURE_DOUBLE_NAT = 5,           // carrier-grade or double NAT
  ZARK_FAILURE_LEASE_REFUSED = 6,        // the router refused the lease asked
  ZARK_FAILURE_NOT_CONFIGURED = 7, // router database / configuration missing
  ZARK_FAILURE_LOCAL = 8,          // a file or resource of this server
  ZARK_FAILURE_OTHER = 9,
} ZARK_FAILURE_KIND;

// "router_not_answering", "conflict", "port_refused", "table_full",
// "double_nat", "lease_refused", "not_configured", "local", "other"; "" for
// ZARK_FAILURE_NONE and for a value outside the enumeration.
const char *KLibFailureKindName(ZARK_FAILURE_KIND kind);

// The library's record of the saved rules and of the router, as JSON text
// (UTF-8) in *json, freed with KLibFreeText. Nothing is sent to the router.
// Returns 0 on success; -1 with err set otherwise
// (ZARK_PORTMAP_ERR_BAD_PARAMETER, ZARK_PORTMAP_ERR_IO when the saved rules
// cannot be read, ZARK_PORTMAP_ERR_GENERIC). Shape: { "gateway": "192.168.1.1",
// "protocol": "upnp"|"natpmp"|"",
//   "external_address": "203.0.113.7"|"",
//   "last_job": { "kind": "save"|"renew"|"repair", "ended": <unix s>,
//                 "ok": true, "repaired": 2, "added": 0, "deleted": 0,
//                 "failure": { "code": "conflict", "kind": 2,
//                              "reason": "words for the administrator" } }
//               | null,
//   "rules": [ { "rule_id": "1", "protocol": "tcp", "external_port": 8080,
//                "internal_port": 80,
//                "state": "on_router"|"missing"|"refused"|"pending",
//                "code": ""|<failure code>, "reason": ""|"words",
//                "verified": <unix s, 0 never> } ] }
int KLibGetPortMapStatus(const char *gatewayIP, char **json,
                         ZARK_LIBZARKPORTMAP_ERR *err);
// Frees a text the library returned (NULL: nothing).
void KLibFreeText(char *text);

// Verifies every saved rule against the router and restores what is missing
// (a repair; a save does the same). Progress as a save's (callback may be
// NULL). summary (may be NULL) counts what was done; summary->added and
// summary->repaired count the restored mappings. Same results as
// KLibApplySavedRules. The caller holds the port-map lock.
int KLibRepairSavedRules(const char *gatewayIP,
                         ZARK_PORTMAP_APPLY_SUMMARY *summary,
                         ZARK_ROUTER_SAVE_RULE_RESULT *result,
                         ZARK_SAVE_RULE_PROGRESS_CB callback, void *arg);

// One round of the keeper (the renewal service): renews every mapping whose
// lease is past half of what the router granted, verifies the router when
// checkIntervalSeconds passed since the last verification or when a restart
// sign was seen (NAT-PMP epoch going backwards, a changed external address,
// a failed request), and restores what is missing. Sends nothing when
// nothing is due. *nextSeconds (may be NULL) receives the seconds until the
// next round is due (>= 1). Returns 0 on success or when there is nothing to
// do (no saved rules, no router configured: *nextSeconds =
// checkIntervalSeconds); -1 with result set when the router failed. The
// caller holds the port-map lock.
int KLibKeepRouter(const char *gatewayIP, int checkIntervalSeconds,
                   int *nextSeconds, ZARK_PORTMAP_APPLY_SUMMARY *summary,
                   ZARK_ROUTER_SAVE_RULE_RESULT *result);

// Deletes one mapping this server made. protocol "TCP" or "UDP". Returns 0
// when the router no longer holds it; -1 with err set and message (may be
// NULL) saying why: ZARK_PORTMAP_ERR_BAD_PARAMETER (bad arguments, or the
// mapping is not ours), ZARK_PORTMAP_ERR_NOT_CONFIGURED,
// ZARK_PORTMAP_ERR_ROUTER, ZARK_PORTMAP_ERR_IO. The caller holds the
// port-map lock.
int KLibDeleteOurMapping(const char *gatewayIP, const char *protocol,
                         uint16_t externalPort, char *message,
                         size_t messageSize, ZARK_LIBZARKPORTMAP_ERR *err);

#ifdef __cplusplus
} // extern "C"
#endif

#endif
