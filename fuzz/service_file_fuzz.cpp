// Fuzz target of the service definition parser. Besides not crashing, the
// parse must keep its promises: every kept section is one whose name was
// listed, names are listed once, masks are 1..3 and every kept port item is
// a valid port list on its own.
#include "port_list.h"
#include "service_file.h"

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <set>
#include <string_view>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  std::string_view text(reinterpret_cast<const char *>(data), size);
  zark::fw::ServiceFileParse parsed = zark::fw::ParseServiceFile(text);

  std::set<std::string> names(parsed.sectionNames.begin(),
                              parsed.sectionNames.end());
  if (names.size() != parsed.sectionNames.size()) {
    std::abort();
  }
  for (const zark::fw::ServiceSection &section : parsed.sections) {
    if (!names.contains(section.name) || section.name.empty() ||
        section.name.size() > zark::fw::kMaxSectionName ||
        section.protoMask < 1 || section.protoMask > 3) {
      std::abort();
    }
    if (section.ports) {
      for (const std::string &item : *section.ports) {
        zark::fw::PortListParse one = zark::fw::ParsePortList(item);
        if (!one.ok || one.items.size() != 1 || one.items[0] != item) {
          std::abort();
        }
      }
    }
  }
  return 0;
}
