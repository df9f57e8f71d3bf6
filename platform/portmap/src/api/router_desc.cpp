// KLibGetRouterDesc: what the router configured at a gateway allows, from
// its router database entry.
#include "libzarkportmap.h"

#include "base/portmap_log.h"
#include "catalog/router_conf_store.h"
#include "catalog/router_db.h"

#include <exception>

namespace {

int Fail(ZARK_LIBZARKPORTMAP_ERR *err, int code) {
  if (err != nullptr) {
    err->err = code;
  }
  return -1;
}

} // namespace

extern "C" {

// The flag is kept for the interface and not used.
int KLibGetRouterDesc(const char *gatewayIP, ZARK_ROUTER_DESC *desc,
                      ZARK_LIBZARKPORTMAP_ERR *err, bool /*flag*/) {
  using namespace zark::portmap;
  if (gatewayIP == nullptr || desc == nullptr) {
    ZARK_PM_LOG_ERROR("KLibGetRouterDesc: gatewayIP and desc must not be NULL");
    return Fail(err, ZARK_PORTMAP_ERR_BAD_PARAMETER);
  }
  try {
    ZARK_ROUTER_CONF conf{};
    int code = ZARK_PORTMAP_ERR_NONE;
    if (!LoadRouterConfForGateway(gatewayIP, conf, code)) {
      return Fail(err, code);
    }
    RouterDbEntry entry;
    if (!FindRouterDbEntry(conf.brand, conf.model, conf.version, entry, code)) {
      if (code == ZARK_PORTMAP_ERR_NOT_CONFIGURED) {
        ZARK_PM_LOG_ERROR("router \"%s\" / \"%s\" / \"%s\" configured for %s "
                          "is not in the router database",
                          conf.brand, conf.model, conf.version, gatewayIP);
      }
      return Fail(err, code);
    }
    *desc = ZARK_ROUTER_DESC{};
    desc->support_change_port = entry.supportChangePort;
    if (err != nullptr) {
      err->err = ZARK_PORTMAP_ERR_NONE;
    }
    return 0;
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("KLibGetRouterDesc: %s", e.what());
    return Fail(err, ZARK_PORTMAP_ERR_GENERIC);
  }
}

} // extern "C"
