// Malformed: its second row has no handler.
#include "ZARK.Core.PortForwarding.h"

namespace {

void Answer(ZARK::APIRequest *, ZARK::APIResponse *response) {
  response->SetSuccess();
}

const ZARK_API_TABLE kTable[] = {
    {"Test.NullHandler", 1, "fine", Answer},
    {"Test.NullHandler", 1, "broken", nullptr},
    {nullptr, 0, nullptr, nullptr},
};

} // namespace

extern "C" const ZARK_API_TABLE *GetAPITable(void) {
  return kTable;
}
