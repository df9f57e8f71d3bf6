// Firewall and service platform: the table of firewall sections built from
// the service definition files, and the server's own system services.
#ifndef ZARK_PLATFORM_ZARKFW_H
#define ZARK_PLATFORM_ZARKFW_H

#include "klibc.h"

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define ZARK_FW_PACKAGE_SERVICE_DIR "/usr/local/etc/services.d"
#define ZARK_FW_SYSTEM_SERVICE_DIR "/usr/zark/etc.defaults/services.d"
#define ZARK_FW_SERVICE_MAPPING_TABLE                                          \
  "/usr/zark/etc.defaults/firewall_service_mapping_table"

// Protocol mask of a firewall section.
enum {
  ZARK_FW_PROTO_TCP = 1,
  ZARK_FW_PROTO_UDP = 2,
  ZARK_FW_PROTO_BOTH = 3,
};

// Information kinds of KLIBServicecfgInfoGet.
enum {
  KLIB_SERVICE_INFO_FW_SECTIONS = 64, // the service's firewall-section names
};

// One firewall section.
typedef struct {
  char szName[256];
  int32_t blUsable;     // 0: the section must never be forwarded
  int32_t protoMask;    // ZARK_FW_PROTO_*
  KLIBSZLIST *pslPorts; // port items "a" or "a-b"; may be NULL
} ZARK_FW_SERVICE;

// The table of all firewall sections (opaque).
typedef struct _ZARK_FW_SERVICE_TABLE ZARK_FW_SERVICE_TABLE;

// Builds the table from the system and package service definitions (file
// formats: platform/firewall/README.md). Returns the number of sections
// (> 0), 0 when there is none, negative with the core library's error state
// set on failure (NULL argument, out of memory). Malformed sections and
// unreadable files are left out and logged; they never make the call fail.
// *table is set in every case except a NULL argument (NULL on failure) and
// must be freed with ZARKFwServiceFree.
int ZARKFwServiceEnum(ZARK_FW_SERVICE_TABLE **table);

// The section named name, or NULL when the table has none.
const ZARK_FW_SERVICE *ZARKFWServiceFind(const ZARK_FW_SERVICE_TABLE *table,
                                         const char *name);

// Frees a table. NULL is accepted.
void ZARKFwServiceFree(ZARK_FW_SERVICE_TABLE *table);

// Appends the identifiers of the server's system services (the names of the
// "<id>.sc" files of ZARK_FW_SYSTEM_SERVICE_DIR, sorted). Returns 0, or a
// negative value with the error state set (NULL list; the folder missing or
// unreadable).
int KLIBServiceEnum(KLIBSZLIST **list);

// Appends information of kind `kind` about system service `serviceId`: for
// KLIB_SERVICE_INFO_FW_SECTIONS, its firewall-section names. Returns 0, or a
// negative value with the error state set (unknown service, unknown kind,
// unreadable service file). The names come in file order, each once.
int KLIBServicecfgInfoGet(const char *serviceId, int kind, KLIBSZLIST **list);

#ifdef __cplusplus
}
#endif

#endif
