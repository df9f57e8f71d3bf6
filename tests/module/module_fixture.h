// Common fixture of the module tests that run the module's code: fixed
// folders emptied, the fake port-map library back to its defaults, the log
// cleared; after each test every task is released, removed and joined.
#ifndef ZARK_TESTS_MODULE_MODULE_FIXTURE_H
#define ZARK_TESTS_MODULE_MODULE_FIXTURE_H

#include "fake_portmap.h"
#include "hermetic.h"
#include "module_test.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

namespace zark::moduletest {

inline constexpr char kApiPortForwarding[] = "ZARK.Core.PortForwarding";
inline constexpr char kApiRouterConf[] = "ZARK.Core.PortForwarding.RouterConf";
inline constexpr char kApiRouterList[] = "ZARK.Core.PortForwarding.RouterList";
inline constexpr char kApiRules[] = "ZARK.Core.PortForwarding.Rules";
inline constexpr char kApiRulesServ[] = "ZARK.Core.PortForwarding.Rules.Serv";
inline constexpr char kApiCompatibility[] =
    "ZARK.Core.PortForwarding.Compatibility";

class ModuleFixture : public testing::Test {
protected:
  void SetUp() override {
    zark::test::ResetFixedPaths();
    zark::fake::Reset();
    zark::test::ClearLogs();
  }

  void TearDown() override {
    mGate.Open();
    mSecondGate.Open();
    RemoveAllTasks();
    zark::fake::Reset();
  }

  Gate mGate;
  Gate mSecondGate;
};

} // namespace zark::moduletest

#endif
