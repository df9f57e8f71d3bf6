// The module's exported interface: the method table that the host walks.
#ifndef ZARK_CORE_PORTFORWARDING_MODULE_H
#define ZARK_CORE_PORTFORWARDING_MODULE_H

#include "webapi.h"

#include <stdint.h>

typedef void (*ZARK_API_HANDLER)(ZARK::APIRequest *request,
                                 ZARK::APIResponse *response);

// One row of the method table. The table ends with an all-zero row.
typedef struct {
  const char *szAPI;
  int32_t version;
  const char *szMethod;
  ZARK_API_HANDLER handler;
} ZARK_API_TABLE;

extern "C" {
extern const ZARK_API_TABLE gTable[];
const ZARK_API_TABLE *GetAPITable(void);
}

#endif
