// The zarkportforward tool, as a function the executable and the tests
// call. See Usage() for what it does and its exit codes.
#ifndef ZARK_TOOLS_ZARKPORTFORWARD_TOOL_H
#define ZARK_TOOLS_ZARKPORTFORWARD_TOOL_H

#include <functional>
#include <optional>
#include <ostream>
#include <span>
#include <string>

namespace zark::portmap {

// Exit codes.
enum ToolExit : int {
  kToolOk = 0,
  kToolUsage = 1,         // unknown argument
  kToolNotConfigured = 2, // no router the library can drive is configured
                          // for the gateway
  kToolNoGateway = 3,     // no default gateway, or another port-map job
                          // holds the lock
  kToolRouterFailed = 4,  // the router refused, dropped or did not answer
                          // (some mappings are not as saved)
  kToolFileFailed = 5,    // a file of the library cannot be read or written
  kToolRulesRefused = 6,  // the saved rules are refused (a limit or a text;
                          // the log says which)
};

struct ToolEnvironment {
  // The default gateway, nothing when unknown (KLibGetGatewayIP).
  std::function<std::optional<std::string>()> gateway;
};

[[nodiscard]] ToolEnvironment DefaultToolEnvironment();

[[nodiscard]] std::string Usage();

// args: the arguments after the program name.
[[nodiscard]] int RunZarkPortForward(std::span<const std::string> args,
                                     std::ostream &out, std::ostream &err,
                                     const ToolEnvironment &environment);

} // namespace zark::portmap

#endif
