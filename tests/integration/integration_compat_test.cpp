// The UPnP compatibility test through the module's Compatibility test and
// test_status, against the test network's miniupnpd and the probe service
// (zark-probed) on the outside host. The router is limited to a known
// number of mappings: this executable's tests run with
// ZARK_TESTNET_UPNP_ALLOW (CMakeLists.txt) letting it map only the 24 ports
// from 30500, which is where the test fills from; the 25th is answered with
// 606, and the test reports 24.
#include "integration_fixture.h"

#include "base/library_config.h"
#include "compat/compatibility_test.h"
#include "compat/tested_router_db.h"

#include <memory>
#include <thread>

namespace zark::integration {
namespace {

using zark::test::SetLibraryConfig;
using zark::testnet::ListUpnpMappings;
using zark::testnet::OutsideProcess;
using zark::testnet::UpnpMapping;

constexpr char kApiCompatibility[] = "ZARK.Core.PortForwarding.Compatibility";
constexpr uint16_t kProbePort = 7777;
constexpr int kRouterLimit = 24; // ZARK_TESTNET_UPNP_ALLOW

class IntegrationCompat : public IntegrationTest {
protected:
  void SetUp() override {
    IntegrationTest::SetUp();
    mProbe = std::make_unique<OutsideProcess>(
        mNet, std::vector<std::string>{ZARK_PROBED_PATH, "--listen",
                                       mNet.wanOutside + ":" +
                                           std::to_string(kProbePort)});
    ASSERT_TRUE(mProbe->WaitForTcp(mNet.wanOutside, kProbePort))
        << "zark-probed does not listen on the outside host";
    SetLibraryConfig(
        std::string(zark::portmap::config_key::kProbeServiceAddress),
        mNet.wanOutside + ":" + std::to_string(kProbePort));
    SetLibraryConfig(std::string(zark::portmap::config_key::kUpnpTestFirstPort),
                     "30500");
    ConfigureRouter("UPnP IGD", "yes", "no");
  }

  // Starts the test and polls test_status until it says "success" or
  // "failed" (at most timeout); every answer goes to history.
  Answer RunTest(Json::Value &history,
                 std::chrono::seconds timeout = std::chrono::seconds(120)) {
    Answer started = Invoke(kApiCompatibility, "test");
    EXPECT_TRUE(started.success) << started.errorCode;
    Json::Value params(Json::objectValue);
    params["task_id"] = started.data["task_id"];
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    Answer answer;
    while (std::chrono::steady_clock::now() < deadline) {
      answer = Invoke(kApiCompatibility, "test_status", params);
      history.append(answer.data);
      const std::string status = answer.data.get("status", "").asString();
      if (answer.success && (status == "success" || status == "failed")) {
        break;
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    ZARK::APIPolling::JoinAll();
    return answer;
  }

  std::vector<UpnpMapping> Mappings() {
    std::vector<UpnpMapping> mappings;
    std::string raw;
    EXPECT_TRUE(ListUpnpMappings(mNet, mappings, &raw)) << raw;
    return mappings;
  }

  std::unique_ptr<OutsideProcess> mProbe;
};

TEST_F(IntegrationCompat, ReachesSuccessWithTheRouterTableSize) {
  Json::Value history(Json::arrayValue);
  Answer last = RunTest(history);
  ASSERT_TRUE(last.success) << history.toStyledString();
  EXPECT_EQ("success", last.data["status"].asString())
      << history.toStyledString();
  EXPECT_EQ(100, last.data["percentage"].asInt());
  EXPECT_EQ(ParseJson(R"([
      {"test_item": "add", "status": "success"},
      {"test_item": "max", "status": "24"},
      {"test_item": "del", "status": "success"},
      {"test_item": "readd", "status": "success"},
      {"test_item": "con_s", "status": "success"}])"),
            last.data["test"]);

  // Nothing of the test is left on the router.
  EXPECT_TRUE(Mappings().empty());

  // The module stored the router's record once the test had passed.
  std::vector<zark::portmap::TestedRouter> tested;
  ASSERT_TRUE(zark::portmap::LoadTestedRouters(
      zark::portmap::kTestedRoutersPath, tested));
  ASSERT_EQ(1u, tested.size());
  EXPECT_EQ("Generic", tested[0].brand);
  EXPECT_EQ("UPnP IGD", tested[0].model);
  EXPECT_EQ(kRouterLimit, tested[0].maxMappings);

  // Upload has nothing to send after a success.
  SetLibraryConfig(std::string(zark::portmap::config_key::kReportAddress),
                   "http://" + mNet.wanOutside + ":9/report");
  Answer upload = Invoke(kApiCompatibility, "upload");
  EXPECT_FALSE(upload.success);
  EXPECT_TRUE(zark::test::HasLogContaining(
      "the last UPnP compatibility test succeeded"));
}

TEST_F(IntegrationCompat, WithoutTheProbeServiceTheOutsideCheckFails) {
  mProbe.reset();
  Json::Value history(Json::arrayValue);
  Answer last = RunTest(history);
  ASSERT_TRUE(last.success) << history.toStyledString();
  // The probe service is configured but does not answer: the router part
  // passes, the check that the deleted port is closed cannot be made.
  EXPECT_EQ("failed", last.data["status"].asString())
      << history.toStyledString();
  EXPECT_EQ(-1, last.data["percentage"].asInt());
  const Json::Value &items = last.data["test"];
  ASSERT_EQ(3u, items.size()) << items.toStyledString();
  EXPECT_EQ("del", items[2]["test_item"].asString());
  EXPECT_EQ("failed", items[2]["status"].asString());
  EXPECT_TRUE(Mappings().empty());
}

TEST_F(IntegrationCompat, StopEndsTheTestAndCleansUp) {
  Answer started = Invoke(kApiCompatibility, "test");
  ASSERT_TRUE(started.success);
  // Bounded wait until the test has mapped something, then stop it.
  bool mapped = false;
  for (int i = 0; i < 1000 && !mapped; ++i) {
    mapped = !Mappings().empty();
    if (!mapped) {
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
  }
  Answer stopped = Invoke(kApiCompatibility, "stop");
  EXPECT_TRUE(stopped.success) << stopped.errorCode;
  ZARK::APIPolling::JoinAll();
  EXPECT_TRUE(Mappings().empty());
  ZARK_LIBZARKPORTMAP_TASK task{-1};
  ASSERT_EQ(0, KLibGetLibZarkPortMapRunningTask(&task));
  EXPECT_EQ(ZARK_PORTMAP_TASK_NONE, task.task);
}

} // namespace
} // namespace zark::integration
