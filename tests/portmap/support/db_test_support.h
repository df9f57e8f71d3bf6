// Set-up helpers of the router database and configuration tests: the
// shipped database, hand-made databases and archives of them. Every path
// lies under the fixed folders, so callers run in the private mount
// namespace.
#ifndef ZARK_TESTS_DB_TEST_SUPPORT_H
#define ZARK_TESTS_DB_TEST_SUPPORT_H

#include "libzarkportmap.h"

#include <string>
#include <string_view>
#include <vector>

namespace zark::test {

inline const std::string kDbRoot = ZARK_PORTMAP_ROUTERDB_DIR;

// Copies the database shipped in the source tree to the installed place.
void InstallShippedRouterDb();

struct DescriptionSpec {
  std::string brand;
  std::string model;
  std::string file;
  std::string version;
  std::string protocol = "upnp";
  std::string changePort = "yes";
  std::string maxRules = "64";
};

// Writes a database of these descriptions under root.
void WriteRouterDb(const std::string &root, int syntaxVersion, int version,
                   const std::vector<DescriptionSpec> &entries);

// Packs "<parent>/routerdb" with libarchive into archive, a gzip-compressed
// tar whose members are named "<top>/...": folders, files and symbolic
// links as they are on disk. Aborts the test on failure.
void PackRouterDb(const std::string &parent, const std::string &archive,
                  const std::string &top = "routerdb");

// One member of a hand-made tar archive.
struct TarMember {
  std::string name;
  unsigned type = 0100000; // AE_IFREG, AE_IFDIR, AE_IFLNK, AE_IFCHR...
  std::string content;
  std::string symlink;  // target of a symbolic link
  std::string hardLink; // set: a hard link to this earlier member
};

// A tar archive of members, in memory, compressed by filter (one of
// libarchive's ARCHIVE_FILTER_* codes; 0 is none). Aborts the test on
// failure.
std::string MakeTar(const std::vector<TarMember> &members, int filter = 0);

// A member as a tar listing shows it: its type letter ('d' folder, '-'
// regular file, 'h' hard link, 'l' symbolic link, 'c', 'b', 'p', 's') and
// its name.
struct ListedMember {
  char type;
  std::string name;
};

// The members of a tar archive (compressed or not), read with libarchive
// on its own, for tests to judge what a check accepted. False when the
// archive does not read to its end.
bool ListTarMembers(std::string_view archive,
                    std::vector<ListedMember> &members);

// A listing of every file under root with its content, to compare trees.
std::string DescribeTree(const std::string &root);

// Sets a key of /etc/portforward/portmap.conf.
void SetLibraryConfig(const std::string &key, const std::string &value);

} // namespace zark::test

#endif
