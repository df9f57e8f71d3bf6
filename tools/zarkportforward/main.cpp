// zarkportforward: applies the saved port-forwarding rules to the router,
// renews them, or lists the router's mappings. See zarkportforward_tool.h.
#include "zarkportforward_tool.h"

#include <exception>
#include <iostream>
#include <string>
#include <vector>

int main(int argc, char **argv) {
  try {
    std::vector<std::string> args(argv + 1, argv + argc);
    return zark::portmap::RunZarkPortForward(
        args, std::cout, std::cerr, zark::portmap::DefaultToolEnvironment());
  } catch (const std::exception &e) {
    std::cerr << "zarkportforward: " << e.what() << "\n";
    return zark::portmap::kToolFileFailed;
  }
}
