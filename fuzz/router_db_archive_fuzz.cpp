// Fuzz target of the router database archive check (CheckRouterDbArchive):
// the bytes of a downloaded archive, plain or compressed tar, whose member
// headers decide whether it is unpacked at all. Besides not crashing:
// - a refusal has a reason;
// - an accepted archive reads to its end when libarchive lists it on its
//   own, and every member is a folder or a regular file named "routerdb"
//   or below "routerdb/" without a "." or ".." component (checked here on
//   the names the listing gives, independently of the check).
#include "catalog/router_db_archive.h"
#include "db_test_support.h"
#include "fuzz_support.h"
#include "syslog_capture.h"

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace {

using zark::fuzz::Require;

bool SafeName(std::string_view name) {
  if (name != "routerdb" && name.rfind("routerdb/", 0) != 0) {
    return false;
  }
  std::size_t start = 0;
  while (start <= name.size()) {
    std::size_t slash = name.find('/', start);
    std::string_view part = name.substr(start, slash == std::string_view::npos
                                                   ? std::string_view::npos
                                                   : slash - start);
    if (part == "." || part == "..") {
      return false;
    }
    if (slash == std::string_view::npos) {
      break;
    }
    start = slash + 1;
  }
  return true;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  // Log lines are captured (tests/support/syslog_capture.h); keep only
  // this input's.
  zark::test::ClearLogs();
  const std::string_view archive = zark::fuzz::AsText(data, size);
  std::string why;
  if (!zark::portmap::CheckRouterDbArchive(archive, why)) {
    Require(!why.empty(), "a refusal without a reason");
    return 0;
  }
  std::vector<zark::test::ListedMember> members;
  Require(zark::test::ListTarMembers(archive, members),
          "an accepted archive that does not read to its end");
  Require(!members.empty(), "an accepted archive without members");
  for (const zark::test::ListedMember &member : members) {
    Require(member.type == 'd' || member.type == '-',
            "an accepted member that is neither folder nor file: " +
                member.name);
    Require(SafeName(member.name),
            "an accepted member outside routerdb/: " + member.name);
  }
  return 0;
}
