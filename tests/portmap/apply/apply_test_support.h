// What the apply tests share: a rule that forwards router ports to the same
// local ports, and a stored configuration of a generic router.
#ifndef ZARK_TESTS_PORTMAP_APPLY_TEST_SUPPORT_H
#define ZARK_TESTS_PORTMAP_APPLY_TEST_SUPPORT_H

#include "catalog/router_conf_store.h"
#include "libzarkportmap.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <cstring>

namespace zark::portmap::test_support {

// An enabled rule forwarding ports ("8080", "8001-8003") of protocol ("tcp",
// "udp", "both") to the same local ports.
inline ZARK_ROUTER_RULE SamePortRule(const char *id, const char *protocol,
                                     const char *ports) {
  ZARK_ROUTER_RULE rule{};
  std::snprintf(rule.rule_id, sizeof(rule.rule_id), "%s", id);
  rule.enable = 1;
  std::snprintf(rule.router_protocol, sizeof(rule.router_protocol), "%s",
                protocol);
  std::snprintf(rule.router_port, sizeof(rule.router_port), "%s", ports);
  std::snprintf(rule.ds_port, sizeof(rule.ds_port), "%s", ports);
  return rule;
}

// Stores a generic router for gateway that speaks UPnP (upnp) or NAT-PMP.
inline void StoreGenericRouter(const char *gateway, bool upnp) {
  ZARK_ROUTER_CONF conf{};
  std::strcpy(conf.brand, "Generic");
  std::strcpy(conf.model, "Test");
  std::strcpy(conf.version, "generic");
  std::strcpy(conf.support_upnp, upnp ? "yes" : "no");
  std::strcpy(conf.support_natpmp, upnp ? "no" : "yes");
  int err = 0;
  ASSERT_TRUE(StoreRouterConfForGateway(gateway, conf, err)) << err;
}

} // namespace zark::portmap::test_support

#endif
