// Common fixture of the integration tests: the process runs in the server
// namespace of a test network (testnet.sh) and in its private mount
// namespace; every test starts with empty fixed folders and the shipped
// router database, and ends with every module task joined.
#ifndef ZARK_TESTS_INTEGRATION_INTEGRATION_FIXTURE_H
#define ZARK_TESTS_INTEGRATION_INTEGRATION_FIXTURE_H

#include "db_test_support.h"
#include "hermetic.h"
#include "libzarkportmap.h"
#include "module_invoke.h"
#include "syslog_capture.h"
#include "test_network.h"
#include "webapi.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>

namespace zark::integration {

class IntegrationTest : public testing::Test {
protected:
  void SetUp() override {
    std::optional<zark::testnet::TestNetwork> network =
        zark::testnet::CurrentNetwork();
    ASSERT_TRUE(network.has_value())
        << "run through testnet/run-in-testnet.sh (as CTest does)";
    mNet = *network;
    zark::test::ResetFixedPaths();
    zark::test::InstallShippedRouterDb();
    zark::test::ClearLogs();
  }

  void TearDown() override { ZARK::APIPolling::JoinAll(); }

  // Stores a router configuration for the test network's gateway directly
  // in the library.
  void ConfigureRouter(const char *model, const char *supportUpnp,
                       const char *supportNatpmp) {
    ZARK_ROUTER_CONF conf{};
    std::strcpy(conf.brand, "Generic");
    std::strcpy(conf.model, model);
    std::strcpy(conf.version, "generic");
    std::strcpy(conf.support_upnp, supportUpnp);
    std::strcpy(conf.support_natpmp, supportNatpmp);
    ZARK_LIBZARKPORTMAP_ERR err{0};
    ASSERT_EQ(0, KLibSetRouterConf(mNet.lanRouter.c_str(), &conf, &err, true))
        << err.err;
  }

  zark::testnet::TestNetwork mNet;
};

} // namespace zark::integration

#endif
