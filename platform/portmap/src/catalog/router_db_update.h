// Replacing the installed router database with a newer one from the source
// named in the library configuration ("routerdb_update_source"): an absolute
// path of a local archive, or an "http://" or "https://" URL of one (see
// router_db_archive.h for the archive).
#ifndef ZARK_PORTMAP_ROUTER_DB_UPDATE_H
#define ZARK_PORTMAP_ROUTER_DB_UPDATE_H

#include <string>

namespace zark::portmap {

// Largest archive taken from a source.
inline constexpr std::size_t kMaxRouterDbArchiveBytes = 16u * 1024u * 1024u;

// Fetches the archive, unpacks it into a private staging folder beside the
// database (".routerdb-update.XXXXXX" in /etc.defaults/portforward), reads
// it as a whole database, and when its version is above the installed one
// swaps it in with one atomic rename (renameat2 RENAME_EXCHANGE), then
// removes the old one. Readers see the old database or the new one, whole;
// a failure at any step leaves the installed database untouched.
//
// True with version set to the installed database's version afterwards (the
// old one's when the fetched one is not newer) and err
// ZARK_PORTMAP_ERR_NONE. False with err set, the reason logged:
//   ZARK_PORTMAP_ERR_DB_SYNTAX  the fetched database has another syntax
//                               version
//   ZARK_PORTMAP_ERR_BAD_PARAMETER  no source configured, or not a path or
//                               an http(s):// URL
//   ZARK_PORTMAP_ERR_IO         the source cannot be fetched, is not an
//                               archive of a valid database, or the swap
//                               failed
[[nodiscard]] bool UpdateRouterDb(int &version, int &err);

} // namespace zark::portmap

#endif
