// A module that exports a start function without its stop function.
#include "ZARK.Core.PortForwarding.h"
#include "module_lifecycle.h"

namespace {

void Ping(ZARK::APIRequest *, ZARK::APIResponse *response) {
  response->SetSuccess(Json::Value("pong"));
}

} // namespace

extern "C" const ZARK_API_TABLE gTable[] = {
    {"Test.HalfLifecycle", 1, "ping", Ping},
    {nullptr, 0, nullptr, nullptr},
};

extern "C" const ZARK_API_TABLE *GetAPITable(void) {
  return gTable;
}

extern "C" int ZarkModuleStart(const ZARK_MODULE_SETTINGS *) {
  return 0;
}
