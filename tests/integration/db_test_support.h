// Set-up helpers of the router database and configuration tests: the
// shipped database, hand-made databases and archives of them. Every path
// lies under the fixed folders, so callers run in the private mount
// namespace.
#ifndef ZARK_TESTS_DB_TEST_SUPPORT_H
#define ZARK_TESTS_DB_TEST_SUPPORT_H

#include "libzarkportmap.h"

#include <string>
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

// Packs "<parent>/routerdb" with tar (extra tar arguments before the
// member) into archive. Aborts the test on failure.
void PackRouterDb(const std::string &parent, const std::string &archive,
                  const std::vector<std::string> &extra = {});

// A listing of every file under root with its content, to compare trees.
std::string DescribeTree(const std::string &root);

// Sets a key of /etc/portforward/portmap.conf.
void SetLibraryConfig(const std::string &key, const std::string &value);

} // namespace zark::test

#endif
