// The C interface to the router configuration store: KLibGetRouterConf and
// KLibSetRouterConf. The rule limit ("max_rule") comes from the router
// database whenever the configured router is in it, so that a database
// update reaches configurations stored before it.
#include "libzarkportmap.h"

#include "base/portmap_log.h"
#include "catalog/router_conf_store.h"
#include "catalog/router_db.h"

#include <cstdio>
#include <cstring>
#include <exception>
#include <string>

namespace {

using namespace zark::portmap;

int Fail(ZARK_LIBZARKPORTMAP_ERR *err, int code) {
  if (err != nullptr) {
    err->err = code;
  }
  return -1;
}

int Succeed(ZARK_LIBZARKPORTMAP_ERR *err) {
  if (err != nullptr) {
    err->err = ZARK_PORTMAP_ERR_NONE;
  }
  return 0;
}

// Sets conf.max_rule from the database entry of the configured router.
// True when that worked or the router is not in the database (max_rule is
// then left as it is); false with err set when the database cannot be read
// (ZARK_PORTMAP_ERR_DB_SYNTAX, ZARK_PORTMAP_ERR_IO, logged).
bool MaxRuleFromDatabase(ZARK_ROUTER_CONF &conf, int &err) {
  RouterDbEntry entry;
  if (FindRouterDbEntry(conf.brand, conf.model, conf.version, entry, err)) {
    std::memset(conf.max_rule, 0, sizeof(conf.max_rule));
    std::snprintf(conf.max_rule, sizeof(conf.max_rule), "%d", entry.maxRules);
    return true;
  }
  if (err == ZARK_PORTMAP_ERR_NOT_CONFIGURED) {
    err = ZARK_PORTMAP_ERR_NONE;
    return true;
  }
  return false;
}

} // namespace

extern "C" {

// flag true: the record also gets the account and password; false (the
// module's get): they stay empty, so the password never leaves the library
// on that path.
int KLibGetRouterConf(const char *gatewayIP, ZARK_ROUTER_CONF *conf,
                      ZARK_LIBZARKPORTMAP_ERR *err, bool flag) {
  if (gatewayIP == nullptr || conf == nullptr) {
    ZARK_PM_LOG_ERROR("KLibGetRouterConf: gatewayIP and conf must not be NULL");
    return Fail(err, ZARK_PORTMAP_ERR_BAD_PARAMETER);
  }
  try {
    ZARK_ROUTER_CONF stored{};
    int code = ZARK_PORTMAP_ERR_NONE;
    if (!LoadRouterConfForGateway(gatewayIP, stored, code)) {
      return Fail(err, code);
    }
    if (!MaxRuleFromDatabase(stored, code)) {
      return Fail(err, code);
    }
    if (!flag) {
      std::memset(stored.account, 0, sizeof(stored.account));
      std::memset(stored.password, 0, sizeof(stored.password));
    }
    *conf = stored;
    return Succeed(err);
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("KLibGetRouterConf: %s", e.what());
    return Fail(err, ZARK_PORTMAP_ERR_GENERIC);
  }
}

// flag true (the module's set): the router database is consulted, its
// syntax version checked (ZARK_PORTMAP_ERR_DB_SYNTAX) and max_rule stored
// from the router's entry when it has one. False: the record is stored as
// given.
int KLibSetRouterConf(const char *gatewayIP, const ZARK_ROUTER_CONF *conf,
                      ZARK_LIBZARKPORTMAP_ERR *err, bool flag) {
  if (gatewayIP == nullptr || conf == nullptr) {
    ZARK_PM_LOG_ERROR("KLibSetRouterConf: gatewayIP and conf must not be NULL");
    return Fail(err, ZARK_PORTMAP_ERR_BAD_PARAMETER);
  }
  try {
    ZARK_ROUTER_CONF toStore = *conf;
    int code = ZARK_PORTMAP_ERR_NONE;
    // The lookup reads brand, model and version as texts; a record whose
    // fields are not terminated is refused by the store below instead.
    const bool namesAreTexts =
        std::memchr(toStore.brand, 0, sizeof(toStore.brand)) != nullptr &&
        std::memchr(toStore.model, 0, sizeof(toStore.model)) != nullptr &&
        std::memchr(toStore.version, 0, sizeof(toStore.version)) != nullptr;
    if (flag && namesAreTexts && !MaxRuleFromDatabase(toStore, code)) {
      return Fail(err, code);
    }
    if (!StoreRouterConfForGateway(gatewayIP, toStore, code)) {
      return Fail(err, code);
    }
    return Succeed(err);
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("KLibSetRouterConf: %s", e.what());
    return Fail(err, ZARK_PORTMAP_ERR_GENERIC);
  }
}

} // extern "C"
