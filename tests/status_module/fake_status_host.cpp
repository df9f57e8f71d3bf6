#include "fake_status_host.h"

#include <thread>

namespace zark::status::test {

bool WaitForCalls(const std::string &name, std::size_t count,
                  std::chrono::milliseconds limit) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  while (zark::fake::CountCalls(name) < count) {
    if (std::chrono::steady_clock::now() >= deadline) {
      return false;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return true;
}

} // namespace zark::status::test
