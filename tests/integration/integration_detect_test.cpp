// Router detection through the module's detect and detect_status, on the
// real platform library, in the server namespace of a test network whose
// router is Debian's miniupnpd (testnet.sh: manufacturer "ZarkTest", model
// name "TestIGD", model number "1"). The outside host runs a name server
// and a WAN probe listener (outside_services.h). Then RouterConf set after
// a real detection, and the external address.
#include "catalog/router_conf_store.h"
#include "detect_support.h"
#include "integration_fixture.h"
#include "outside_services.h"
#include "zarknet.h"

#include <arpa/inet.h>

#include <vector>

namespace zark::integration {
namespace {

using zark::test::HasLogContaining;
using zark::test::ReadFile;
using zark::testnet::ListUpnpMappings;
using zark::testnet::RunTool;
using zark::testnet::UpnpMapping;

constexpr char kApiPortForwarding[] = "ZARK.Core.PortForwarding";

const std::vector<std::string> kSteps = {
    "check_interface_enable_step", "check_gateway_setting_step",
    "check_connect_wan_step",      "check_hops_lan2wan_step",
    "check_dns_setting_step",      "detect_router_step"};

class IntegrationDetect : public IntegrationTest {
protected:
  void SetUp() override {
    IntegrationTest::SetUp();
    std::string why;
    ASSERT_TRUE(ConfigureDetection(mNet, why)) << why;
    mOutside = std::make_unique<OutsideServices>(
        mNet, kDetectProbeName, mNet.wanOutside, kWanProbePort);
    ASSERT_TRUE(mOutside->Running()) << mOutside->Why();
  }

  // Runs detect and follows detect_status to the end; history gets every
  // answer.
  Answer DetectThroughTheModule(Json::Value &history) {
    Answer started = Invoke(kApiPortForwarding, "detect");
    EXPECT_TRUE(started.success) << started.errorCode;
    const std::string taskId = started.data["task_id"].asString();
    EXPECT_FALSE(taskId.empty());
    Answer last = PollUntilFinished(kApiPortForwarding, "detect_status", taskId,
                                    std::chrono::seconds(30), history);
    ZARK::APIPolling::JoinAll();
    return last;
  }

  // The percentages (stages) seen while the run was under way, in order,
  // each once.
  static std::vector<int> Stages(const Json::Value &history) {
    std::vector<int> stages;
    for (const Json::Value &seen : history) {
      const Json::Value &percentage = seen["data"]["percentage"];
      if (percentage.isInt() &&
          (stages.empty() || stages.back() != percentage.asInt())) {
        stages.push_back(percentage.asInt());
      }
    }
    return stages;
  }

  std::unique_ptr<OutsideServices> mOutside;
};

TEST_F(IntegrationDetect, FindsTheTestRouterInSixSuccessfulSteps) {
  Json::Value history(Json::arrayValue);
  Answer answer = DetectThroughTheModule(history);
  ASSERT_TRUE(answer.success) << history.toStyledString();
  const Json::Value &data = answer.data;
  EXPECT_EQ("success", data["status"].asString());
  EXPECT_EQ(100, data["percentage"].asInt());
  const Json::Value &progress = data["progress"];
  for (const std::string &step : kSteps) {
    EXPECT_EQ("success", progress[step]["status"].asString())
        << step << "\n"
        << data.toStyledString();
  }
  EXPECT_EQ(
      "eth0",
      progress["check_interface_enable_step"]["network_interface"].asString());
  EXPECT_EQ(mNet.lanRouter,
            progress["check_gateway_setting_step"]["gateway_ip"].asString());
  // One private hop, the router, then the outside host.
  EXPECT_EQ(1, progress["check_hops_lan2wan_step"]["hops_number"].asInt());
  EXPECT_EQ("ZarkTest", data["router_brand"].asString());
  EXPECT_EQ("TestIGD", data["router_model"].asString());
  EXPECT_EQ("1", data["router_version"].asString());
  EXPECT_EQ("ZarkTest: TestIGD(1)", data["upnp_pfpath"].asString());
  EXPECT_EQ("yes", data["support_upnp"].asString());
  EXPECT_EQ("yes", data["support_natpmp"].asString());

  // The stages seen follow the library's order; polling may miss some.
  const std::vector<int> order = {10, 20, 30, 40, 70, 50, 80, 100};
  std::size_t next = 0;
  for (int stage : Stages(history)) {
    while (next < order.size() && order[next] != stage) {
      ++next;
    }
    EXPECT_LT(next, order.size()) << "stage " << stage << " out of order\n"
                                  << history.toStyledString();
  }

  // The library keeps the result for RouterConf set.
  ZARK_ROUTER_DETECT_RESULT kept{};
  ASSERT_EQ(0, KLibGetRouterDetectResult(&kept));
  EXPECT_EQ(100, kept.enProgress);
  EXPECT_EQ(0u, kept.warning);
  EXPECT_STREQ("ZarkTest: TestIGD(1)", kept.upnp_pfpath);
}

TEST_F(IntegrationDetect, RouterOutsideLinkDownStopsAtTheWanStep) {
  std::string output;
  ASSERT_EQ(0, RunTool({"/usr/sbin/ip", "-n", mNet.routerNs, "link", "set",
                        "wan0", "down"},
                       output))
      << output;
  Json::Value history(Json::arrayValue);
  Answer answer = DetectThroughTheModule(history);
  ASSERT_TRUE(answer.success) << history.toStyledString();
  const Json::Value &data = answer.data;
  EXPECT_EQ("success", data["status"].asString());
  EXPECT_EQ(100, data["percentage"].asInt());
  const Json::Value &progress = data["progress"];
  EXPECT_EQ("success",
            progress["check_interface_enable_step"]["status"].asString());
  EXPECT_EQ("success",
            progress["check_gateway_setting_step"]["status"].asString());
  EXPECT_EQ("failed", progress["check_connect_wan_step"]["status"].asString());
  EXPECT_EQ("stop", progress["check_hops_lan2wan_step"]["status"].asString());
  EXPECT_EQ("stop", progress["check_dns_setting_step"]["status"].asString());
  EXPECT_EQ("stop", progress["detect_router_step"]["status"].asString());
  EXPECT_FALSE(data.isMember("router_brand"));
  EXPECT_TRUE(HasLogContaining("detection stopped at the WAN check (stage 40)"))
      << ::testing::PrintToString(zark::test::CapturedMessages());

  ZARK_ROUTER_DETECT_RESULT kept{};
  ASSERT_EQ(0, KLibGetRouterDetectResult(&kept));
  EXPECT_EQ(40, kept.enProgress);
}

// RouterConf set with support_upnp "yes" after a detection that found the
// router by UPnP: first the detected router's own configuration is stored
// (its name split into brand, model and version, both protocol flags "no",
// so it needs the connection type and port given), zarkportforward runs
// with it, then the user's choice is stored. The tool finds the router's
// protocol in the kept detection record (the router database does not know
// "ZarkTest TestIGD") and puts back the saved rule, which was taken off the
// router behind the library's back.
TEST_F(IntegrationDetect,
       SetAfterDetectionStoresTheDetectedRouterThenTheUsersChoice) {
  // Rules saved with the UPnP router configured are on the router.
  ConfigureRouter("UPnP IGD", "yes", "no");
  Json::Value rule(Json::objectValue);
  rule["rule_id"] = "0";
  rule["enable"] = true;
  rule["router_protocol"] = "tcp";
  rule["router_port"] = "18080";
  rule["ds_port"] = "8080";
  rule["serviceid"] = "";
  rule["service_name"] = "";
  Json::Value params(Json::objectValue);
  params["rules"].append(rule);
  Answer saved = Invoke(kApiRules, "save", params);
  ASSERT_TRUE(saved.success) << saved.errorCode;
  Json::Value saveHistory(Json::arrayValue);
  Answer saveEnd = PollUntilFinished(kApiRules, "save_status",
                                     saved.data["task_id"].asString(),
                                     std::chrono::seconds(60), saveHistory);
  ZARK::APIPolling::JoinAll();
  ASSERT_TRUE(saveEnd.success) << saveHistory.toStyledString();

  std::vector<UpnpMapping> mappings;
  std::string raw;
  ASSERT_TRUE(ListUpnpMappings(mNet, mappings, &raw)) << raw;
  ASSERT_EQ(1u, mappings.size()) << raw;
  ASSERT_EQ(
      0, RunTool({"/usr/bin/upnpc", "-u", mNet.rootDesc, "-d", "18080", "TCP"},
                 raw))
      << raw;
  ASSERT_TRUE(ListUpnpMappings(mNet, mappings, &raw)) << raw;
  ASSERT_TRUE(mappings.empty()) << raw;

  ZARK_ROUTER_DETECT_RESULT detected{};
  ASSERT_EQ(0, KLibDetectRouter(&detected, nullptr, nullptr, true));
  std::string why;
  ASSERT_STREQ("ZarkTest: TestIGD(1)", detected.upnp_pfpath);
  ASSERT_EQ(1, detected.support_upnp);
  ASSERT_TRUE(InstallPortForwardTool(ZARK_PORTFORWARD_TOOL_PATH, true,
                                     mNet.lanRouter, why))
      << why;

  Answer answer = Invoke(kApiRouterConf, "set", ParseJson(R"({
      "router_brand": "Generic", "router_model": "UPnP IGD",
      "router_version": "generic", "support_upnp": "yes",
      "support_natpmp": "no", "router_protocol": "http", "router_port": 80})"));
  ASSERT_TRUE(answer.success)
      << answer.errorCode << " "
      << ::testing::PrintToString(zark::test::CapturedMessages());

  // The tool ran, saw the detected router's configuration and succeeded.
  const std::string status = ReadFile(kToolStatus);
  EXPECT_EQ("0\n", status) << "zarkportforward's exit status";
  ZARK_ROUTER_CONF seen{};
  ASSERT_TRUE(
      zark::portmap::ParseRouterConf(ReadFile(kToolSeenConf), seen, why))
      << why;
  EXPECT_STREQ("ZarkTest", seen.brand);
  EXPECT_STREQ("TestIGD", seen.model);
  EXPECT_STREQ("1", seen.version);
  EXPECT_STREQ("no", seen.support_upnp);
  EXPECT_STREQ("no", seen.support_natpmp);
  EXPECT_STREQ("http", seen.conn_type);
  EXPECT_STREQ("80", seen.conn_port);

  // The user's choice is what is stored in the end.
  answer = Invoke(kApiRouterConf, "get");
  ASSERT_TRUE(answer.success);
  EXPECT_EQ("Generic", answer.data["router_brand"].asString());
  EXPECT_EQ("UPnP IGD", answer.data["router_model"].asString());
  EXPECT_EQ("yes", answer.data["support_upnp"].asString());

  // The tool's run left exactly the saved rule on the router.
  ASSERT_TRUE(ListUpnpMappings(mNet, mappings, &raw)) << raw;
  ASSERT_EQ(1u, mappings.size()) << raw;
  EXPECT_EQ("TCP", mappings[0].protocol);
  EXPECT_EQ(18080, mappings[0].externalPort);
  EXPECT_EQ(mNet.lanServer, mappings[0].internalAddress);
  EXPECT_EQ(8080, mappings[0].internalPort);
}

TEST_F(IntegrationDetect,
       SetWithoutConnectionTypeAfterFindingAUpnpRouterFails) {
  ZARK_ROUTER_DETECT_RESULT detected{};
  ASSERT_EQ(0, KLibDetectRouter(&detected, nullptr, nullptr, true));
  std::string why;
  ASSERT_TRUE(InstallPortForwardTool(ZARK_PORTFORWARD_TOOL_PATH, true,
                                     mNet.lanRouter, why))
      << why;
  Answer answer = Invoke(kApiRouterConf, "set", ParseJson(R"({
      "router_brand": "Generic", "router_model": "UPnP IGD",
      "router_version": "generic", "support_upnp": "yes",
      "support_natpmp": "no"})"));
  EXPECT_FALSE(answer.success);
  EXPECT_EQ(1500, answer.errorCode);
  EXPECT_TRUE(HasLogContaining("conntype shall not be empty"));
  EXPECT_TRUE(HasLogContaining("set pfpath router conf failed"));
  EXPECT_EQ("", ReadFile(kToolStatus)) << "zarkportforward ran";
}

TEST_F(IntegrationDetect, ExternalAddressIsTheRoutersOutsideAddress) {
  in_addr expected{};
  ASSERT_EQ(1, ::inet_pton(AF_INET, mNet.wanRouter.c_str(), &expected));
  // Nothing configured: the router is probed.
  EXPECT_EQ(expected.s_addr, ZARKIGetExternalIP());
  // Configured for UPnP, then for NAT-PMP: asked with that protocol.
  ConfigureRouter("UPnP IGD", "yes", "no");
  EXPECT_EQ(expected.s_addr, ZARKIGetExternalIP());
  ConfigureRouter("NAT-PMP", "no", "yes");
  EXPECT_EQ(expected.s_addr, ZARKIGetExternalIP());
}

} // namespace
} // namespace zark::integration
