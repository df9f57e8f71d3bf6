// Fuzz target of the router database archive check (CheckArchiveListing):
// the verbose listing tar prints for a downloaded archive, which decides
// whether the archive is unpacked at all. Besides not crashing:
// - a refusal has a reason;
// - in an accepted listing every member line names a path under
//   "routerdb/" without a "." or ".." component, and is a folder or a
//   regular file (checked here independently of the parser, on the last
//   field of each line).
#include "catalog/router_db_archive.h"
#include "fuzz_support.h"
#include "syslog_capture.h"

#include <cstddef>
#include <cstdint>
#include <string>

namespace {

using zark::fuzz::Require;

// The name of a listing line: what follows the blank after the fifth
// blank-separated field, the time
// ("-rw-r--r-- 0/0  74 2024-05-01 12:00 routerdb/routerdb.conf").
std::string_view NameOf(std::string_view line) {
  std::size_t at = 0;
  for (int field = 0; field < 5; ++field) {
    while (at < line.size() && line[at] == ' ') {
      ++at;
    }
    while (at < line.size() && line[at] != ' ') {
      ++at;
    }
  }
  return at < line.size() ? line.substr(at + 1) : std::string_view();
}

bool SafeName(std::string_view name) {
  if (name.rfind("routerdb/", 0) != 0) {
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
  const std::string_view listing = zark::fuzz::AsText(data, size);
  std::string why;
  if (!zark::portmap::CheckArchiveListing(listing, why)) {
    Require(!why.empty(), "a refusal without a reason");
    return 0;
  }
  zark::fuzz::InputReader lines(listing);
  while (!lines.Empty()) {
    const std::string_view line = lines.Piece("\n");
    if (line.empty()) {
      continue;
    }
    Require(line.front() == 'd' || line.front() == '-',
            "an accepted member that is neither folder nor file: " +
                std::string(line));
    Require(SafeName(NameOf(line)),
            "an accepted member outside routerdb/: " + std::string(line));
  }
  return 0;
}
