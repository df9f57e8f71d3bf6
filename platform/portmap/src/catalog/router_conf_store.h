// The router configuration store: one configuration per gateway address,
// kept under /etc/portforward/routers/ (folder 0700, files 0600: a
// configuration holds the router's password). Files are replaced
// atomically. Nothing here logs a password.
#ifndef ZARK_PORTMAP_ROUTER_CONF_STORE_H
#define ZARK_PORTMAP_ROUTER_CONF_STORE_H

#include "libzarkportmap.h"

#include <optional>
#include <string>
#include <string_view>

namespace zark::portmap {

// Folder of the stored configurations.
inline constexpr const char *kRouterConfDir = ZARK_PORTMAP_CONF_DIR "/routers";

// The canonical dotted-quad form of an IPv4 gateway address ("192.168.1.1"),
// or nothing when gateway is not one (names, IPv6, leading zeros, blanks).
// Only canonical addresses name a configuration file.
[[nodiscard]] std::optional<std::string>
CanonicalGatewayAddress(std::string_view gateway);

// Path of the configuration file of a canonical gateway address:
// "/etc/portforward/routers/<gateway>.conf".
[[nodiscard]] std::string RouterConfPath(std::string_view canonicalGateway);

// The text of a configuration file, one JSON document (no file access, so
// it can be fed any bytes):
//   {"format": 1, "gateway": "192.168.1.1",
//    "router": {"brand": "Generic", "model": "UPnP IGD", "version": "generic",
//               "support_upnp": "yes", "support_natpmp": "no",
//               "account": "", "password": "", "conn_type": "",
//               "conn_port": "", "max_rule": ""}}
// Every field of ZARK_ROUTER_CONF is a string member of "router", at most
// 1023 bytes, no NUL. ParseRouterConf refuses anything else (false, why
// set); members it does not know are ignored. Never throws.
inline constexpr int kRouterConfFormat = 1;
[[nodiscard]] std::string SerializeRouterConf(std::string_view gateway,
                                              const ZARK_ROUTER_CONF &conf);
[[nodiscard]] bool ParseRouterConf(std::string_view text,
                                   ZARK_ROUTER_CONF &conf,
                                   std::string &why) noexcept;

// Reads the configuration stored for gateway; false with err set
// (ZARK_PORTMAP_ERR_NOT_CONFIGURED when none is stored).
// On success conf holds every field, account and password included, and
// err is ZARK_PORTMAP_ERR_NONE. Errors:
//   ZARK_PORTMAP_ERR_BAD_PARAMETER  gateway is not an IPv4 address
//   ZARK_PORTMAP_ERR_NOT_CONFIGURED no configuration stored for gateway
//   ZARK_PORTMAP_ERR_IO             the file cannot be read or is malformed
//                                   (logged)
[[nodiscard]] bool LoadRouterConfForGateway(const std::string &gateway,
                                            ZARK_ROUTER_CONF &conf, int &err);

// Stores conf as the configuration of gateway, replacing any earlier one
// atomically (a reader sees the old or the new one, whole). Every text
// field must be NUL-terminated within its 1024 bytes. True on success with
// err ZARK_PORTMAP_ERR_NONE; false with err set:
//   ZARK_PORTMAP_ERR_BAD_PARAMETER  gateway is not an IPv4 address, or a
//                                   field is not NUL-terminated
//   ZARK_PORTMAP_ERR_IO             the file cannot be written (logged; the
//                                   earlier configuration is untouched)
[[nodiscard]] bool StoreRouterConfForGateway(const std::string &gateway,
                                             const ZARK_ROUTER_CONF &conf,
                                             int &err);

} // namespace zark::portmap

#endif
