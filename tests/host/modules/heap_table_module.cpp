// Malformed: hands out a table that lives on the heap, outside the module's
// own memory, so that the host cannot bound its walk.
#include "ZARK.Core.PortForwarding.h"

#include <vector>

namespace {

void Answer(ZARK::APIRequest *, ZARK::APIResponse *response) {
  response->SetSuccess();
}

std::vector<ZARK_API_TABLE> &Table() {
  static std::vector<ZARK_API_TABLE> table = {
      {"Test.Heap", 1, "get", Answer},
      {nullptr, 0, nullptr, nullptr},
  };
  return table;
}

} // namespace

extern "C" const ZARK_API_TABLE *GetAPITable(void) {
  return Table().data();
}
