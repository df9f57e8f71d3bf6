// A second well-formed test module, serving an API of its own.
#include "ZARK.Core.PortForwarding.h"

namespace {

void Ping(ZARK::APIRequest *, ZARK::APIResponse *response) {
  response->SetSuccess("pong");
}

const ZARK_API_TABLE kTable[] = {
    {"Test.Other", 1, "ping", Ping},
    {nullptr, 0, nullptr, nullptr},
};

} // namespace

extern "C" const ZARK_API_TABLE *GetAPITable(void) {
  return kTable;
}
