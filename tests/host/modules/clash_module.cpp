// Serves "Test.Echo" "echo" (in a version good_module lacks) besides an API
// of its own: loaded after good_module, the whole module is refused.
#include "ZARK.Core.PortForwarding.h"

namespace {

void Answer(ZARK::APIRequest *, ZARK::APIResponse *response) {
  response->SetSuccess("clash");
}

const ZARK_API_TABLE kTable[] = {
    {"Test.Clash", 1, "own", Answer},
    {"Test.Echo", 3, "echo", Answer},
    {nullptr, 0, nullptr, nullptr},
};

} // namespace

extern "C" const ZARK_API_TABLE *GetAPITable(void) {
  return kTable;
}
