// The router database: what the library knows about router brands, models
// and firmware versions, kept as files under
// "/etc.defaults/portforward/routerdb" (ZARK_PORTMAP_ROUTERDB_DIR):
//
//   routerdb/
//     routerdb.conf                 database info (key/value):
//                                     syntax_version=1   layout of this tree
//                                     version=3          database version
//     <brand>/<model>/<file>        one description per entry (key/value)
//
// A description file named "generic" is the model's generic description
// (list entries with generic true); any other file describes one firmware
// version. Description keys:
//   version=generic          version name shown for the entry (required)
//   protocol=upnp            how the router is driven: upnp, natpmp or web
//   support_change_port=yes  router port may differ from the local port
//   max_rules=128            most rules the router takes (1..65536)
// Names starting with "." are not part of the database (staging folders of
// an update, editor files). The README's "Router database" has the details.
#ifndef ZARK_PORTMAP_ROUTER_DB_H
#define ZARK_PORTMAP_ROUTER_DB_H

#include "base/router_protocol.h"

#include <string>
#include <string_view>
#include <vector>

namespace zark::portmap {

// The layout this library reads. A database of another syntax version is
// refused with ZARK_PORTMAP_ERR_DB_SYNTAX.
inline constexpr int kRouterDbSyntaxVersion = 1;
inline constexpr const char *kRouterDbInfoFile = "routerdb.conf";
inline constexpr const char *kRouterDbGenericFile = "generic";
// Bounds of one database; a larger one is refused.
inline constexpr std::size_t kMaxRouterDbEntries = 10000;
inline constexpr int kMaxRouterDbRules = 65536;

struct RouterDbEntry {
  std::string brand;   // folder name
  std::string model;   // folder name
  std::string version; // the description's "version"
  std::string file;    // the description's file name in <brand>/<model>/
  bool generic = false;
  RouterProtocol protocol = RouterProtocol::kUpnp;
  bool supportChangePort = false;
  int maxRules = 0;
};

struct RouterDb {
  int syntaxVersion = 0;
  int version = 0;
  // Sorted by brand, then model (bytewise), the generic description first
  // within a model, then by version: a stable order whatever order the
  // folders list their files in.
  std::vector<RouterDbEntry> entries;
};

// Reads the whole database under root (the installed one by default), all
// or nothing. True with db filled and err ZARK_PORTMAP_ERR_NONE; false with
// err set and the reason logged:
//   ZARK_PORTMAP_ERR_DB_SYNTAX  its syntax version is not ours
//   ZARK_PORTMAP_ERR_IO         no database there, or a file is missing,
//                               unreadable or malformed, or the bounds above
//                               are exceeded
// The installed database is read under the database's shared lock, so an
// update never shows half of one and half of the other.
[[nodiscard]] bool ReadRouterDb(RouterDb &db, int &err);
[[nodiscard]] bool ReadRouterDbAt(const std::string &root, RouterDb &db,
                                  int &err);

// Finds the installed entry whose brand, model and version (the
// description's "version") are exactly these. True with entry filled; false
// with err as ReadRouterDb, or ZARK_PORTMAP_ERR_NOT_CONFIGURED when the
// database holds no such router (not logged: the caller knows whether that
// matters).
[[nodiscard]] bool FindRouterDbEntry(std::string_view brand,
                                     std::string_view model,
                                     std::string_view version,
                                     RouterDbEntry &entry, int &err);

// Reads only the database info (routerdb.conf) under root. Errors as
// ReadRouterDbAt; a syntax version other than ours is
// ZARK_PORTMAP_ERR_DB_SYNTAX (info is filled all the same).
[[nodiscard]] bool ReadRouterDbInfoAt(const std::string &root, RouterDb &info,
                                      int &err);

} // namespace zark::portmap

#endif
