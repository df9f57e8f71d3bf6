// Port-map platform library: the records it exchanges with its callers and
// its C interface (rules, router database, router configuration, detection,
// port tests, UPnP compatibility test, the system-wide port-map lock).
//
// Records have a fixed layout, checked by the static_asserts below. Integers
// are in the native byte order of the target. Every call that takes a
// ZARK_LIBZARKPORTMAP_ERR* may be given NULL.
#ifndef ZARK_PLATFORM_LIBZARKPORTMAP_H
#define ZARK_PLATFORM_LIBZARKPORTMAP_H

#include <stddef.h>
#include <stdint.h>

#ifndef __cplusplus
#include <stdbool.h>
#endif

#ifdef __cplusplus
extern "C" {
#endif

#define ZARK_PORTMAP_TEXT_SIZE 1024

// Where the library keeps its files.
#define ZARK_PORTMAP_CONF_DIR "/etc/portforward"
#define ZARK_PORTMAP_RULE_CONF "/etc/portforward/rule.conf"
#define ZARK_PORTMAP_TEST_RULE_CONF "/etc/portforward/testrule.conf"
#define ZARK_PORTMAP_LOCK_FILE "/etc/portforward/portmap.lock"
#define ZARK_PORTMAP_ROUTERDB_DIR "/etc.defaults/portforward/routerdb"
#define ZARK_PORTMAP_APPLY_PROGRESS "/tmp/pfProgress"
#define ZARK_PORTMAP_TEST_STATUS "/tmp/pfStatusRule"
#define ZARK_PORTMAP_UPNP_TEST_PROGRESS "/tmp/upnp_test.progress"

// Error numbers of the library (ZARK_LIBZARKPORTMAP_ERR.err).
enum {
  ZARK_PORTMAP_ERR_NONE = 0,
  ZARK_PORTMAP_ERR_GENERIC = 1,         // failure without a particular cause
  ZARK_PORTMAP_ERR_NOT_CONFIGURED = 2,  // router not configured / not supported
  ZARK_PORTMAP_ERR_BAD_PARAMETER = 3,   // an argument is invalid
  ZARK_PORTMAP_ERR_IO = 4,              // a file could not be read or written
  ZARK_PORTMAP_ERR_ROUTER = 5,          // the router refused or did not answer
  ZARK_PORTMAP_ERR_DB_SYNTAX = 6,       // router database syntax version error
  ZARK_PORTMAP_ERR_NOT_IMPLEMENTED = 7, // the operation is not built yet
  ZARK_PORTMAP_ERR_PROBE_SERVICE = 8,   // no probe service is configured, or
                                        // it answered no check (port tests)
};

typedef struct {
  int32_t err;
} ZARK_LIBZARKPORTMAP_ERR;

// One port-forwarding rule. Arrays of it are contiguous.
typedef struct {
  char rule_id[ZARK_PORTMAP_TEXT_SIZE];
  uint8_t enable; // 0 = disabled, any other value = enabled
  char router_protocol[ZARK_PORTMAP_TEXT_SIZE];
  char router_port[ZARK_PORTMAP_TEXT_SIZE];
  char ds_port[ZARK_PORTMAP_TEXT_SIZE];
  char serviceid[ZARK_PORTMAP_TEXT_SIZE];
  char service_name[ZARK_PORTMAP_TEXT_SIZE];
  uint8_t reserved[7];
} ZARK_ROUTER_RULE;

// Why KLibSaveRules refused a rule set (ZARK_ROUTER_SAVE_RULE_RESULT.errType).
// Types 0, 1 and 3 to 6 are not reasons of a save.
enum {
  ZARK_SAVE_ERR_NONE = 0,
  ZARK_SAVE_ERR_NOT_CONFIGURED = 2,   // no router configured for the gateway
  ZARK_SAVE_ERR_TOO_MANY_RULES = 7,   // more rules than the router takes; limit
  ZARK_SAVE_ERR_BAD_PORT_TEXT = 8,    // a port text does not parse; the text
  ZARK_SAVE_ERR_BAD_PROTOCOL = 9,     // a protocol text is unknown; the text
  ZARK_SAVE_ERR_PORT_TOO_HIGH = 10,   // a port above the highest port; limit
  ZARK_SAVE_ERR_TOO_MANY_PORTS = 11,  // more ports in one rule than allowed; limit
  ZARK_SAVE_ERR_RANGE_TOO_LONG = 12,  // a range longer than allowed; both limits
};

// Progress and outcome of KLibSaveRules.
typedef struct {
  int32_t percentage; // 0..100
  uint32_t errType;   // ZARK_SAVE_ERR_*
  union {
    struct {
      int32_t maxPort;  // the limit of types 7, 10, 11, 12
      int32_t maxRange; // the second limit of type 12
    } limit;
    char text[ZARK_PORTMAP_TEXT_SIZE]; // the offending text of types 8, 9
  } detail;
} ZARK_ROUTER_SAVE_RULE_RESULT;

// One node of the router database list; free the whole list with
// KLibFreeRouterDBList.
typedef struct _ZARK_ROUTERDB_LIST {
  char brand[ZARK_PORTMAP_TEXT_SIZE];
  char model[ZARK_PORTMAP_TEXT_SIZE];
  char version[ZARK_PORTMAP_TEXT_SIZE];
  bool generic;
  // On a 32-bit target this pointer sits at offset 3076; a 64-bit pointer is
  // 8-aligned, so here it sits at 3080 and the record is 3088 bytes.
  struct _ZARK_ROUTERDB_LIST *next;
} ZARK_ROUTERDB_LIST;

typedef struct {
  bool support_change_port;
  uint8_t reserved[3];
} ZARK_ROUTER_DESC;

// The router configuration stored for one gateway. Text fields.
typedef struct {
  char brand[ZARK_PORTMAP_TEXT_SIZE];
  char model[ZARK_PORTMAP_TEXT_SIZE];
  char version[ZARK_PORTMAP_TEXT_SIZE];
  char support_upnp[ZARK_PORTMAP_TEXT_SIZE];   // "yes" / "no"
  char support_natpmp[ZARK_PORTMAP_TEXT_SIZE]; // "yes" / "no"
  char account[ZARK_PORTMAP_TEXT_SIZE];
  char password[ZARK_PORTMAP_TEXT_SIZE];
  char conn_type[ZARK_PORTMAP_TEXT_SIZE]; // protocol of the router's pages
  char conn_port[ZARK_PORTMAP_TEXT_SIZE]; // decimal text
  char max_rule[ZARK_PORTMAP_TEXT_SIZE];  // decimal text
} ZARK_ROUTER_CONF;

// Detection stages (ZARK_ROUTER_DETECT_RESULT.enProgress), in the order a run
// goes through them: the hops check (70) comes before the DNS check (50).
enum {
  ZARK_DETECT_STAGE_START = 10,
  ZARK_DETECT_STAGE_INTERFACE = 20,
  ZARK_DETECT_STAGE_GATEWAY = 30,
  ZARK_DETECT_STAGE_WAN = 40,
  ZARK_DETECT_STAGE_HOPS = 70,
  ZARK_DETECT_STAGE_DNS = 50,
  ZARK_DETECT_STAGE_ROUTER = 80,
  ZARK_DETECT_STAGE_DONE = 100,
};

// Warning flags of a detection.
enum {
  ZARK_DETECT_WARN_GATEWAY = 1u << 0,     // the gateway setting looks wrong
  ZARK_DETECT_WARN_HOPS_UNKNOWN = 1u << 1, // the hop count could not be found
  ZARK_DETECT_WARN_HOPS_OVER_ONE = 1u << 2, // more than one private hop
  ZARK_DETECT_WARN_DOUBLE_NAT = 1u << 3,  // the router's outside address is private
};

typedef struct {
  int32_t enProgress;
  int32_t reserved;
  uint32_t warning;
  int32_t hops;
  char gateway_ip[ZARK_PORTMAP_TEXT_SIZE];
  char network_interface[ZARK_PORTMAP_TEXT_SIZE];
  int32_t support_upnp;   // 1 yes, 0 no, other unknown
  int32_t support_natpmp; // 1 yes, 0 no, other unknown
  char router_brand[ZARK_PORTMAP_TEXT_SIZE];
  char router_model[ZARK_PORTMAP_TEXT_SIZE];
  char router_version[ZARK_PORTMAP_TEXT_SIZE];
  char upnp_pfpath[ZARK_PORTMAP_TEXT_SIZE];
  char router_user_setting_name[ZARK_PORTMAP_TEXT_SIZE];
  int32_t router_max_rule;
} ZARK_ROUTER_DETECT_RESULT;

// The long job the library is running (KLibGetLibZarkPortMapRunningTask).
enum {
  ZARK_PORTMAP_TASK_NONE = 0,
  ZARK_PORTMAP_TASK_UPNP_TEST = 1,
  ZARK_PORTMAP_TASK_APPLY_RULES = 2,
};

typedef struct {
  int32_t task;
} ZARK_LIBZARKPORTMAP_TASK;

// A tested router, as kept in the local database of tested routers.
typedef struct {
  char brand[ZARK_PORTMAP_TEXT_SIZE];
  char model[ZARK_PORTMAP_TEXT_SIZE];
  char version[ZARK_PORTMAP_TEXT_SIZE];
  char date[ZARK_PORTMAP_TEXT_SIZE];
  int32_t max_mappings;
} ZARK_ROUTER_RECORD;

typedef struct {
  int32_t progress;
  int32_t error;
  ZARK_ROUTER_RECORD record;
} ZARK_ROUTER_TEST_COMPATIBILITY_RESULT;

// Why a UPnP compatibility test failed (ZARK_ROUTER_TEST_COMPATIBILITY_RESULT
// .error when KLibTestUpnpCompatibility returns non-zero). Besides these:
// ZARK_PORTMAP_ERR_NOT_CONFIGURED (2) when no router is configured for the
// gateway or the configured one is not driven by UPnP,
// ZARK_PORTMAP_ERR_BAD_PARAMETER (3) for bad arguments, and
// ZARK_PORTMAP_ERR_GENERIC (1) when the test cannot start at all (another
// one is running, the port-map lock is held elsewhere, a local file cannot
// be written). The stage that failed is also marked "failed" in
// ZARK_PORTMAP_UPNP_TEST_PROGRESS.
enum {
  ZARK_UPNP_TEST_ERR_INIT = 13,       // no default gateway, the router's UPnP
                                      // service cannot be opened, or no probe
                                      // service is configured
  ZARK_UPNP_TEST_ERR_ADD = 14,        // the first mapping was not added
  ZARK_UPNP_TEST_ERR_FILL = 15,       // filling the table: the router stopped
                                      // answering, or lost mappings it had
                                      // confirmed
  ZARK_UPNP_TEST_ERR_DELETE = 16,     // a mapping could not be deleted, or
                                      // the router still holds it
  ZARK_UPNP_TEST_ERR_STILL_OPEN = 17, // a deleted mapping still answers from
                                      // outside, or the probe service gave no
                                      // verdict
  ZARK_UPNP_TEST_ERR_READD = 18,      // a deleted mapping could not be added
                                      // again, or not renewed over itself
  ZARK_UPNP_TEST_ERR_NOT_OPEN = 19,   // the re-added mapping does not answer
                                      // from outside, or the probe service
                                      // gave no verdict
  ZARK_UPNP_TEST_ERR_STOPPED = 20,    // stopped by
                                      // KLibStopTestUpnpCompatibility, or out
                                      // of time
};

typedef void (*ZARK_SAVE_RULE_PROGRESS_CB)(ZARK_ROUTER_SAVE_RULE_RESULT *result,
                                           void *arg);
typedef void (*ZARK_DETECT_PROGRESS_CB)(ZARK_ROUTER_DETECT_RESULT *result,
                                        void *arg);
typedef void (*ZARK_TEST_COMPATIBILITY_PROGRESS_CB)(
    const ZARK_ROUTER_TEST_COMPATIBILITY_RESULT *result, void *arg);

// --- System-wide port-map lock -------------------------------------------
// Excludes other threads and other processes. Lock waits a bounded time and
// returns a negative value when it could not take the lock; 0 on success.
// Unlock releases the calling thread's lock; without one it does nothing and
// returns 0.
int KLibZarkPortMapLock(void);
int KLibZarkPortMapUnLock(void);

// --- Rule configurations --------------------------------------------------
// Reads the rule configuration at confPath (NULL: the saved rule
// configuration) into a new array of *count records (*rules is NULL when
// the configuration holds no rule). A missing configuration holds no rule.
// Returns 0, or -1 with err set. Free the array with KLibFreeRulesArr.
int KLibGetRulesArrFromRuleConf(int *count, ZARK_ROUTER_RULE **rules,
                                char *confPath, bool flag,
                                ZARK_LIBZARKPORTMAP_ERR *err);
// The same for the test rule configuration (NULL: ZARK_PORTMAP_TEST_RULE_CONF).
int KLibGetRulesArrFromTestRuleConf(int *count, ZARK_ROUTER_RULE **rules,
                                    char *confPath, bool flag,
                                    ZARK_LIBZARKPORTMAP_ERR *err);
void KLibFreeRulesArr(ZARK_ROUTER_RULE *rules);

// --- Applying rules ---------------------------------------------------------
// Checks the rules, stores them as the saved rule configuration, then
// applies them to the router configured for gatewayIP, verifying what the
// router really holds and restoring what it lost (flag is no longer
// looked at: every save verifies). A rule set refused by the checks
// (errType 7..12) or without a configured router (2) is not stored; a set
// that the router then fails to take in full stays stored, each mapping
// marked with its state and reason (KLibGetPortMapStatus), and -1 is
// returned with errType ZARK_PORTMAP_ERR_ROUTER (or _IO, _GENERIC) and
// detail.text naming the failure in words.
int KLibSaveRules(const char *gatewayIP, int count, ZARK_ROUTER_RULE *rules,
                  bool flag, ZARK_ROUTER_SAVE_RULE_RESULT *result,
                  ZARK_SAVE_RULE_PROGRESS_CB callback, void *arg);
int KLibGetLibZarkPortMapRunningTask(ZARK_LIBZARKPORTMAP_TASK *task);

// --- Port tests -------------------------------------------------------------
// Starts a fresh, empty ZARK_PORTMAP_TEST_STATUS. 0, or -1 when it cannot
// be written.
int KLibTestRulesInit(void);
// Checks from outside, through the probe service of the library
// configuration ("probe_service_address"), every router port of every
// enabled rule, and writes ZARK_PORTMAP_TEST_STATUS: one line per enabled
// rule, "<rule id>=" while it is tested, then "<rule id>=<result>"
// ("reachable", "unreachable", "partly reachable (k of n ports)", or why it
// could not be tested, such as "no probe service configured"). 0 when the
// test ran, whatever the results; -1 with err set when it could not:
// ZARK_PORTMAP_ERR_PROBE_SERVICE (none configured, or it answered no
// check), ZARK_PORTMAP_ERR_IO (the status file),
// ZARK_PORTMAP_ERR_BAD_PARAMETER. flag is not used.
int KLibTestRules(int count, ZARK_ROUTER_RULE *rules,
                  ZARK_LIBZARKPORTMAP_ERR *err, bool flag);

// --- Gateway, router database, router configuration -------------------------
// Writes the default IPv4 gateway as text into buf. Negative when unknown.
int KLibGetGatewayIP(char *buf, int size);
int KLibGetRouterDBList(ZARK_ROUTERDB_LIST **list);
void KLibFreeRouterDBList(ZARK_ROUTERDB_LIST *list);
int KLibUpdateRouterDBList(int *version);
int KLibGetRouterDesc(const char *gatewayIP, ZARK_ROUTER_DESC *desc,
                      ZARK_LIBZARKPORTMAP_ERR *err, bool flag);
int KLibGetRouterConf(const char *gatewayIP, ZARK_ROUTER_CONF *conf,
                      ZARK_LIBZARKPORTMAP_ERR *err, bool flag);
int KLibSetRouterConf(const char *gatewayIP, const ZARK_ROUTER_CONF *conf,
                      ZARK_LIBZARKPORTMAP_ERR *err, bool flag);

// --- Detection --------------------------------------------------------------
int KLibDetectRouter(ZARK_ROUTER_DETECT_RESULT *result,
                     ZARK_DETECT_PROGRESS_CB callback, void *arg, bool flag);
int KLibGetRouterDetectResult(ZARK_ROUTER_DETECT_RESULT *result);

// --- UPnP compatibility test --------------------------------------------------
// Tests the UPnP router configured for the default gateway: adds a mapping,
// fills its table up to maxMappings (1..1024), deletes them all, checks
// from outside that the port closed, adds it again (twice) and checks that
// it opened; writes ZARK_PORTMAP_UPNP_TEST_PROGRESS as it goes (flag false:
// not at all) and calls callback (may be NULL) with result->progress
// 0..100. Removes every mapping it made. 0 when the router passed, with
// result->record filled (max_mappings: what its table took); non-zero with
// result->error set (ZARK_UPNP_TEST_ERR_*, 1, 2, 3) when not. While it
// runs, KLibGetLibZarkPortMapRunningTask answers ZARK_PORTMAP_TASK_UPNP_TEST.
int KLibTestUpnpCompatibility(int maxMappings,
                              ZARK_ROUTER_TEST_COMPATIBILITY_RESULT *result,
                              ZARK_TEST_COMPATIBILITY_PROGRESS_CB callback,
                              void *arg, bool flag);
// Stores a passed router's record in the local database of tested routers
// (/etc/portforward/upnp_tested_routers.json), replacing one of the same
// brand, model and version. 0, or -1 for a record that is not one (empty
// brand or model, max_mappings not 1..1024, a field not NUL-terminated) or
// a file that cannot be written.
int KLibWriteRecordIntoUpnpDB(const ZARK_ROUTER_RECORD *record);
// Stops a running compatibility test (in any process) and returns once it
// has ended and removed its mappings (at most 60 s); with none running,
// removes what a killed test left. 0, or -1 when that did not happen.
int KLibStopTestUpnpCompatibility(void);
// Sends the last test's report, when it failed, to the library
// configuration's "report_address" (http:// or https://). 0 when it was
// taken (2xx); -1 when no address is configured, the last test did not
// fail, or the upload failed.
int KLibUploadTestUpnpCompatibilityFailResult(void);

#ifdef __cplusplus
} // extern "C"

static_assert(sizeof(ZARK_LIBZARKPORTMAP_ERR) == 4);
static_assert(sizeof(ZARK_ROUTER_RULE) == 6152);
static_assert(offsetof(ZARK_ROUTER_RULE, rule_id) == 0);
static_assert(offsetof(ZARK_ROUTER_RULE, enable) == 1024);
static_assert(offsetof(ZARK_ROUTER_RULE, router_protocol) == 1025);
static_assert(offsetof(ZARK_ROUTER_RULE, router_port) == 2049);
static_assert(offsetof(ZARK_ROUTER_RULE, ds_port) == 3073);
static_assert(offsetof(ZARK_ROUTER_RULE, serviceid) == 4097);
static_assert(offsetof(ZARK_ROUTER_RULE, service_name) == 5121);
static_assert(offsetof(ZARK_ROUTER_RULE, reserved) == 6145);
static_assert(offsetof(ZARK_ROUTER_SAVE_RULE_RESULT, percentage) == 0);
static_assert(offsetof(ZARK_ROUTER_SAVE_RULE_RESULT, errType) == 4);
static_assert(offsetof(ZARK_ROUTER_SAVE_RULE_RESULT, detail.limit.maxPort) == 8);
static_assert(offsetof(ZARK_ROUTER_SAVE_RULE_RESULT, detail.text) == 8);
static_assert(offsetof(ZARK_ROUTER_SAVE_RULE_RESULT, detail.limit.maxRange) == 12);
static_assert(offsetof(ZARK_ROUTERDB_LIST, brand) == 0);
static_assert(offsetof(ZARK_ROUTERDB_LIST, model) == 1024);
static_assert(offsetof(ZARK_ROUTERDB_LIST, version) == 2048);
static_assert(offsetof(ZARK_ROUTERDB_LIST, generic) == 3072);
static_assert(offsetof(ZARK_ROUTERDB_LIST, next) ==
              (sizeof(void *) == 4 ? 3076 : 3080));
static_assert(sizeof(ZARK_ROUTER_DESC) == 4);
static_assert(offsetof(ZARK_ROUTER_DESC, support_change_port) == 0);
static_assert(sizeof(ZARK_ROUTER_CONF) == 10240);
static_assert(offsetof(ZARK_ROUTER_CONF, support_upnp) == 3072);
static_assert(offsetof(ZARK_ROUTER_CONF, support_natpmp) == 4096);
static_assert(offsetof(ZARK_ROUTER_CONF, account) == 5120);
static_assert(offsetof(ZARK_ROUTER_CONF, password) == 6144);
static_assert(offsetof(ZARK_ROUTER_CONF, conn_type) == 7168);
static_assert(offsetof(ZARK_ROUTER_CONF, conn_port) == 8192);
static_assert(offsetof(ZARK_ROUTER_CONF, max_rule) == 9216);
static_assert(sizeof(ZARK_ROUTER_DETECT_RESULT) == 7196);
static_assert(offsetof(ZARK_ROUTER_DETECT_RESULT, enProgress) == 0);
static_assert(offsetof(ZARK_ROUTER_DETECT_RESULT, warning) == 8);
static_assert(offsetof(ZARK_ROUTER_DETECT_RESULT, hops) == 12);
static_assert(offsetof(ZARK_ROUTER_DETECT_RESULT, gateway_ip) == 16);
static_assert(offsetof(ZARK_ROUTER_DETECT_RESULT, network_interface) == 1040);
static_assert(offsetof(ZARK_ROUTER_DETECT_RESULT, support_upnp) == 2064);
static_assert(offsetof(ZARK_ROUTER_DETECT_RESULT, support_natpmp) == 2068);
static_assert(offsetof(ZARK_ROUTER_DETECT_RESULT, router_brand) == 2072);
static_assert(offsetof(ZARK_ROUTER_DETECT_RESULT, router_model) == 3096);
static_assert(offsetof(ZARK_ROUTER_DETECT_RESULT, router_version) == 4120);
static_assert(offsetof(ZARK_ROUTER_DETECT_RESULT, upnp_pfpath) == 5144);
static_assert(offsetof(ZARK_ROUTER_DETECT_RESULT, router_user_setting_name) ==
              6168);
static_assert(offsetof(ZARK_ROUTER_DETECT_RESULT, router_max_rule) == 7192);
static_assert(sizeof(ZARK_LIBZARKPORTMAP_TASK) == 4);
static_assert(sizeof(ZARK_ROUTER_RECORD) == 4100);
static_assert(sizeof(ZARK_ROUTER_TEST_COMPATIBILITY_RESULT) == 4108);
static_assert(offsetof(ZARK_ROUTER_TEST_COMPATIBILITY_RESULT, progress) == 0);
static_assert(offsetof(ZARK_ROUTER_TEST_COMPATIBILITY_RESULT, error) == 4);
static_assert(offsetof(ZARK_ROUTER_TEST_COMPATIBILITY_RESULT, record) == 8);
#endif

#endif
