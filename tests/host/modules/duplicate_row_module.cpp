// Malformed: its third row repeats the first (API, method, version).
#include "ZARK.Core.PortForwarding.h"

namespace {

void Answer(ZARK::APIRequest *, ZARK::APIResponse *response) {
  response->SetSuccess();
}

const ZARK_API_TABLE kTable[] = {
    {"Test.Duplicate", 1, "get", Answer},
    {"Test.Duplicate", 2, "get", Answer},
    {"Test.Duplicate", 1, "get", Answer},
    {nullptr, 0, nullptr, nullptr},
};

} // namespace

extern "C" const ZARK_API_TABLE *GetAPITable(void) {
  return kTable;
}
