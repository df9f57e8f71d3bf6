// A module with start and stop functions. Each call appends a line to
// /tmp/host/lifecycle.log ("start <interval>", "stop"); a start with the
// interval 13 fails with -13.
#include "ZARK.Core.PortForwarding.h"
#include "module_lifecycle.h"

#include <cstdio>

namespace {

void Note(const char *line) {
  if (FILE *file = std::fopen("/tmp/host/lifecycle.log", "a")) {
    std::fputs(line, file);
    std::fclose(file);
  }
}

void Ping(ZARK::APIRequest *, ZARK::APIResponse *response) {
  response->SetSuccess(Json::Value("pong"));
}

} // namespace

extern "C" const ZARK_API_TABLE gTable[] = {
    {"Test.Lifecycle", 1, "ping", Ping},
    {nullptr, 0, nullptr, nullptr},
};

extern "C" const ZARK_API_TABLE *GetAPITable(void) {
  return gTable;
}

extern "C" int ZarkModuleStart(const ZARK_MODULE_SETTINGS *settings) {
  char line[64];
  std::snprintf(line, sizeof(line), "start %d\n",
                static_cast<int>(settings->keeper_interval_seconds));
  Note(line);
  return settings->keeper_interval_seconds == 13 ? -13 : 0;
}

extern "C" void ZarkModuleStop(void) {
  Note("stop\n");
}
