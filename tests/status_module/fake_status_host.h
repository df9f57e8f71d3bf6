// The status module built against the fake port-map library, served by an
// in-process host: every test starts with the fake's defaults.
#ifndef ZARK_TESTS_FAKE_STATUS_HOST_H
#define ZARK_TESTS_FAKE_STATUS_HOST_H

#include "fake_portmap.h"
#include "status_host_fixture.h"

namespace zark::status::test {

class FakeStatusHost : public StatusHost {
protected:
  void SetUp() override {
    StatusHost::SetUp();
    zark::fake::Reset();
  }
  void StartHost(int keeperIntervalSeconds) {
    StatusHost::StartHost(STATUS_TEST_MODULE, keeperIntervalSeconds);
  }
};

// Waits, bounded, until the fake saw at least count calls of name.
bool WaitForCalls(const std::string &name, std::size_t count,
                  std::chrono::milliseconds limit);

} // namespace zark::status::test

#endif
