// RunDetection over fakes: the stage sequence the callers rely on, what
// each check fills in, where a run stops, and the warnings.
#include "detect_fakes.h"

#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <cstring>

namespace zark::test {
namespace {

using namespace zark::portmap;

struct Seen {
  std::vector<int32_t> stages;
  std::vector<ZARK_ROUTER_DETECT_RESULT> records;
};

void Record(ZARK_ROUTER_DETECT_RESULT *result, void *arg) {
  auto *seen = static_cast<Seen *>(arg);
  seen->stages.push_back(result->enProgress);
  seen->records.push_back(*result);
}

class DetectRun : public testing::Test {
protected:
  void SetUp() override {
    ClearLogs();
    mEnvironment = MakeFakeEnvironment(mScene);
  }

  int Detect() {
    mRecord = ZARK_ROUTER_DETECT_RESULT{};
    mRecord.enProgress = ZARK_DETECT_STAGE_START;
    return RunDetection(mRecord, Record, &mSeen, mEnvironment);
  }

  void SetConfig(const std::string &key, const std::string &value) {
    mScene.config.emplace_back(key, value);
  }

  Scene mScene;
  DetectEnvironment mEnvironment;
  ZARK_ROUTER_DETECT_RESULT mRecord{};
  Seen mSeen;
};

const std::vector<int32_t> kAllStages = {20, 30, 40, 70, 50, 80, 100};

TEST_F(DetectRun, CompleteRunAnnouncesEveryStageInOrderAndFillsTheRecord) {
  mScene.userSettingName = "Generic: UPnP IGD(generic)";
  ASSERT_EQ(0, Detect());
  EXPECT_EQ(kAllStages, mSeen.stages);
  EXPECT_EQ(100, mRecord.enProgress);
  EXPECT_EQ(0u, mRecord.warning);
  EXPECT_EQ(1, mRecord.hops);
  EXPECT_STREQ("eth0", mRecord.network_interface);
  EXPECT_STREQ("192.168.1.1", mRecord.gateway_ip);
  EXPECT_EQ(1, mRecord.support_upnp);
  EXPECT_EQ(1, mRecord.support_natpmp);
  EXPECT_STREQ("Acme", mRecord.router_brand);
  EXPECT_STREQ("R1", mRecord.router_model);
  EXPECT_STREQ("2.0", mRecord.router_version);
  EXPECT_STREQ("Acme: R1(2.0)", mRecord.upnp_pfpath);
  EXPECT_STREQ("Generic: UPnP IGD(generic)", mRecord.router_user_setting_name);
  EXPECT_EQ(64, mRecord.router_max_rule);
  EXPECT_EQ(0, mRecord.reserved);
  ASSERT_EQ(1u, mScene.maxRulesAsked.size());
  EXPECT_EQ((RouterName{"Acme", "R1", "2.0", "Acme: R1(2.0)"}),
            mScene.maxRulesAsked[0]);
  EXPECT_EQ(std::vector<std::string>{"192.168.1.1"}, mScene.userSettingAsked);
  EXPECT_EQ(std::vector<std::string>{"192.168.1.1"}, mScene.router->upnpAsked);
  EXPECT_EQ(std::vector<std::string>{"192.168.1.1"},
            mScene.router->natpmpAsked);
}

TEST_F(DetectRun, EachStageSeesWhatTheChecksBeforeItFound) {
  ASSERT_EQ(0, Detect());
  ASSERT_EQ(7u, mSeen.records.size());
  // At 20 nothing is known yet; at 30 the interface is; at 40 the gateway.
  EXPECT_STREQ("", mSeen.records[0].network_interface);
  EXPECT_STREQ("eth0", mSeen.records[1].network_interface);
  EXPECT_STREQ("", mSeen.records[1].gateway_ip);
  EXPECT_STREQ("192.168.1.1", mSeen.records[2].gateway_ip);
  // The hop count is there when the DNS check (50) starts.
  EXPECT_EQ(0, mSeen.records[3].hops);
  EXPECT_EQ(1, mSeen.records[4].hops);
  // The router's names only at 100.
  EXPECT_STREQ("", mSeen.records[5].router_brand);
  EXPECT_STREQ("Acme", mSeen.records[6].router_brand);
}

TEST_F(DetectRun, EachCheckIsTimedWithTheClockAndLogged) {
  ASSERT_EQ(0, Detect());
  // Every clock reading advances the fake clock by 5 ms: one reading when
  // a check starts, one when it is logged.
  EXPECT_TRUE(HasLogContaining("detection: interface check passed in 5 ms: "
                               "interface eth0 is up with 192.168.1.10/24"));
  EXPECT_TRUE(HasLogContaining("detection: gateway check passed in 5 ms: "
                               "default gateway 192.168.1.1 on eth0"));
  EXPECT_TRUE(HasLogContaining("detection: WAN check passed in 5 ms: "
                               "connected to 1.1.1.1:443"));
  EXPECT_TRUE(HasLogContaining("1 hop(s) before the first public address "
                               "203.0.113.1 (path 1 192.168.1.1, 2 "
                               "203.0.113.1)"));
}

TEST_F(DetectRun, InterfaceDownStopsAtStage20) {
  (*mScene.network->interfaces)[1].up = false;
  EXPECT_EQ(-1, Detect());
  EXPECT_EQ(20, mRecord.enProgress);
  EXPECT_EQ(std::vector<int32_t>{20}, mSeen.stages);
  EXPECT_STREQ("eth0", mRecord.network_interface);
  EXPECT_TRUE(HasLogContaining("detection stopped at the interface check "
                               "(stage 20) after 5 ms: interface eth0 is "
                               "down"));
  EXPECT_TRUE(mScene.connector->calls.empty());
}

TEST_F(DetectRun, InterfaceWithoutLinkOrAddressStopsAtStage20) {
  (*mScene.network->interfaces)[1].running = false;
  EXPECT_EQ(-1, Detect());
  EXPECT_EQ(20, mRecord.enProgress);
  EXPECT_TRUE(HasLogContaining("interface eth0 has no link"));

  (*mScene.network->interfaces)[1].running = true;
  (*mScene.network->interfaces)[1].addresses.clear();
  mSeen = {};
  EXPECT_EQ(-1, Detect());
  EXPECT_EQ(20, mRecord.enProgress);
  EXPECT_TRUE(HasLogContaining("interface eth0 has no IPv4 address"));
}

TEST_F(DetectRun, InterfacesThatCannotBeListedStopAtStage20) {
  mScene.network->interfaces.reset();
  EXPECT_EQ(-1, Detect());
  EXPECT_EQ(20, mRecord.enProgress);
  EXPECT_STREQ("", mRecord.network_interface);
}

TEST_F(DetectRun, NoDefaultRouteStopsAtTheGatewayCheck) {
  mScene.network->routeTable = RouteTable({});
  EXPECT_EQ(-1, Detect());
  EXPECT_EQ(30, mRecord.enProgress);
  EXPECT_EQ((std::vector<int32_t>{20, 30}), mSeen.stages);
  // Without a default route the first usable interface was looked at.
  EXPECT_STREQ("eth0", mRecord.network_interface);
  EXPECT_STREQ("", mRecord.gateway_ip);
  EXPECT_TRUE(HasLogContaining("no default gateway is set"));
}

TEST_F(DetectRun, UnreadableRoutingTableStopsAtTheGatewayCheck) {
  mScene.network->routeTable.reset();
  EXPECT_EQ(-1, Detect());
  EXPECT_EQ(30, mRecord.enProgress);
  EXPECT_TRUE(HasLogContaining("the routing table cannot be read"));
}

TEST_F(DetectRun, GatewayOutsideTheSubnetWarnsAndGoesOn) {
  mScene.network->routeTable = RouteTable({RouteLine("eth0", "10.9.9.1", 100)});
  ASSERT_EQ(0, Detect());
  EXPECT_EQ(static_cast<uint32_t>(ZARK_DETECT_WARN_GATEWAY), mRecord.warning);
  EXPECT_STREQ("10.9.9.1", mRecord.gateway_ip);
  EXPECT_TRUE(HasLogContaining("the gateway setting looks wrong: default "
                               "gateway 10.9.9.1 on eth0; it is outside the "
                               "interface's subnet (192.168.1.0/24)"));
}

TEST_F(DetectRun, TwoDefaultRoutesWarn) {
  mScene.network->routeTable =
      RouteTable({RouteLine("eth0", "192.168.1.254", 200),
                  RouteLine("eth0", "192.168.1.1", 100)});
  ASSERT_EQ(0, Detect());
  // The lower metric wins, as in the kernel.
  EXPECT_STREQ("192.168.1.1", mRecord.gateway_ip);
  EXPECT_EQ(static_cast<uint32_t>(ZARK_DETECT_WARN_GATEWAY), mRecord.warning);
  EXPECT_TRUE(HasLogContaining("2 default routes lead to different gateways "
                               "(also 192.168.1.254 on eth0)"));
}

TEST_F(DetectRun, NoWanHostAnsweringStopsAtStage40) {
  mScene.connector->answering.clear();
  EXPECT_EQ(-1, Detect());
  EXPECT_EQ(40, mRecord.enProgress);
  EXPECT_EQ((std::vector<int32_t>{20, 30, 40}), mSeen.stages);
  EXPECT_TRUE(mScene.hops->destinations.empty());
  EXPECT_TRUE(HasLogContaining("no WAN probe host answered: 1.1.1.1:443 "
                               "refused, 8.8.8.8:443 refused, 9.9.9.9:443 "
                               "refused"));
}

TEST_F(DetectRun,
       WanProbeUsesTheConfiguredHostsAndMeasuresHopsTowardsTheOneReached) {
  SetConfig("wan_probe_hosts", " 10.0.0.5:8080 , 198.51.100.9");
  mScene.connector->answering = {{Ip("198.51.100.9"), 443}};
  ASSERT_EQ(0, Detect());
  ASSERT_EQ(1u, mScene.connector->calls.size());
  EXPECT_EQ((std::vector<Ipv4Endpoint>{{Ip("10.0.0.5"), 8080},
                                       {Ip("198.51.100.9"), 443}}),
            mScene.connector->calls[0]);
  EXPECT_EQ(std::vector<uint32_t>{Ip("198.51.100.9")},
            mScene.hops->destinations);
  EXPECT_EQ(std::vector<int>{8}, mScene.hops->maxTtls);
}

TEST_F(DetectRun, WanHostNamesAreResolvedWithTheConfiguredNameServers) {
  SetConfig("wan_probe_hosts", "probe.example:7000,unknown.example");
  mScene.resolvConf = "# test\nnameserver 10.0.0.53\nnameserver 10.0.0.54\n";
  mScene.dns->names.emplace_back("probe.example", Ip("198.51.100.20"));
  mScene.connector->answering = {{Ip("198.51.100.20"), 7000}};
  ASSERT_EQ(0, Detect());
  ASSERT_GE(mScene.dns->calls.size(), 2u);
  EXPECT_EQ("probe.example", mScene.dns->calls[0].name);
  EXPECT_EQ((std::vector<std::string>{"10.0.0.53", "10.0.0.54"}),
            mScene.dns->calls[0].servers);
  EXPECT_EQ("unknown.example", mScene.dns->calls[1].name);
  ASSERT_EQ(1u, mScene.connector->calls.size());
  EXPECT_EQ((std::vector<Ipv4Endpoint>{{Ip("198.51.100.20"), 7000}}),
            mScene.connector->calls[0]);
  EXPECT_TRUE(HasLogContaining("connected to 198.51.100.20:7000 "
                               "(unknown.example not resolved)"));
}

TEST_F(DetectRun, NoWanHostConfiguredStopsAtStage40) {
  SetConfig("wan_probe_hosts", "not a host:99999");
  EXPECT_EQ(-1, Detect());
  EXPECT_EQ(40, mRecord.enProgress);
  EXPECT_TRUE(HasLogContaining("no WAN probe host is configured"));
}

TEST_F(DetectRun, SilentHopsWarnThatTheCountIsUnknownAndTheRunGoesOn) {
  mScene.hops->replies.clear();
  ASSERT_EQ(0, Detect());
  EXPECT_EQ(static_cast<uint32_t>(ZARK_DETECT_WARN_HOPS_UNKNOWN),
            mRecord.warning);
  EXPECT_EQ(0, mRecord.hops);
  EXPECT_EQ(kAllStages, mSeen.stages);
  EXPECT_TRUE(HasLogContaining("the hop count towards 1.1.1.1 is unknown: no "
                               "hop answered within 8 hops"));
}

TEST_F(DetectRun, TwoPrivateHopsWarnOfARouterBehindARouter) {
  mScene.hops->replies = {{1, Ip("192.168.1.1"), false},
                          {2, Ip("10.0.0.1"), false},
                          {3, Ip("203.0.113.1"), false}};
  ASSERT_EQ(0, Detect());
  EXPECT_EQ(2, mRecord.hops);
  EXPECT_EQ(static_cast<uint32_t>(ZARK_DETECT_WARN_HOPS_OVER_ONE),
            mRecord.warning);
  EXPECT_TRUE(HasLogContaining("2 private hops before the internet (path 1 "
                               "192.168.1.1, 2 10.0.0.1, 3 203.0.113.1): a "
                               "router behind a router"));
}

TEST_F(DetectRun, ACarrierGradeNatHopIsNamedAsSuch) {
  mScene.hops->replies = {{1, Ip("192.168.1.1"), false},
                          {3, Ip("100.64.0.1"), false},
                          {4, Ip("203.0.113.1"), false}};
  ASSERT_EQ(0, Detect());
  // The silent second hop counts.
  EXPECT_EQ(3, mRecord.hops);
  EXPECT_EQ(static_cast<uint32_t>(ZARK_DETECT_WARN_HOPS_OVER_ONE),
            mRecord.warning);
  EXPECT_TRUE(HasLogContaining("(path 1 192.168.1.1, 2 *, 3 100.64.0.1, 4 "
                               "203.0.113.1): the carrier puts this network "
                               "behind its own NAT (carrier-grade NAT, "
                               "100.64.0.0/10)"));
}

TEST_F(DetectRun, DnsCheckLooksUpTheConfiguredNameWithTheConfiguredServers) {
  SetConfig("dns_probe_name", "probe.zark.test");
  mScene.resolvConf = "nameserver 10.0.0.53\n";
  mScene.dns->names = {{"probe.zark.test", Ip("198.51.100.1")}};
  ASSERT_EQ(0, Detect());
  ASSERT_EQ(1u, mScene.dns->calls.size());
  EXPECT_EQ("probe.zark.test", mScene.dns->calls[0].name);
  EXPECT_EQ(std::vector<std::string>{"10.0.0.53"},
            mScene.dns->calls[0].servers);
}

TEST_F(DetectRun, DnsAnsweringNoSuchNameStopsAtStage50) {
  mScene.dns->names.clear();
  EXPECT_EQ(-1, Detect());
  EXPECT_EQ(50, mRecord.enProgress);
  EXPECT_EQ((std::vector<int32_t>{20, 30, 40, 70, 50}), mSeen.stages);
  // The hop count is kept for the finished hops check.
  EXPECT_EQ(1, mRecord.hops);
  EXPECT_TRUE(HasLogContaining("detection stopped at the DNS check (stage 50) "
                               "after 5 ms: lookup of example.com: "
                               "192.168.1.1 answered that the name does not "
                               "exist"));
  EXPECT_TRUE(mScene.router->upnpAsked.empty());
}

TEST_F(DetectRun, NoNameServerOrNoResolvConfStopsAtStage50) {
  mScene.resolvConf = "search example.net\n";
  EXPECT_EQ(-1, Detect());
  EXPECT_EQ(50, mRecord.enProgress);
  EXPECT_TRUE(HasLogContaining("no name server is configured in "
                               "/etc/resolv.conf"));
  EXPECT_TRUE(mScene.dns->calls.empty());

  mScene.resolvConf.reset();
  EXPECT_EQ(-1, Detect());
  EXPECT_EQ(50, mRecord.enProgress);
  EXPECT_TRUE(HasLogContaining("cannot read /etc/resolv.conf"));
}

TEST_F(DetectRun, RouterWithoutUpnpOrNatPmpStopsAtStage80) {
  mScene.router->upnp = UpnpFinding{};
  mScene.router->upnp.why = "no UPnP device answered";
  mScene.router->natpmp = NatPmpFinding{};
  mScene.router->natpmp.why = "no NAT-PMP";
  EXPECT_EQ(-1, Detect());
  EXPECT_EQ(80, mRecord.enProgress);
  EXPECT_EQ((std::vector<int32_t>{20, 30, 40, 70, 50, 80}), mSeen.stages);
  EXPECT_EQ(0, mRecord.support_upnp);
  EXPECT_EQ(0, mRecord.support_natpmp);
  EXPECT_STREQ("", mRecord.upnp_pfpath);
  EXPECT_TRUE(HasLogContaining("detection stopped at the router check (stage "
                               "80) after 5 ms: UPnP no (no UPnP device "
                               "answered), NAT-PMP no (no NAT-PMP)"));
}

TEST_F(DetectRun, NatPmpOnlyRouterPassesWithoutNames) {
  mScene.router->upnp = UpnpFinding{};
  ASSERT_EQ(0, Detect());
  EXPECT_EQ(0, mRecord.support_upnp);
  EXPECT_EQ(1, mRecord.support_natpmp);
  EXPECT_STREQ("", mRecord.router_brand);
  EXPECT_STREQ("", mRecord.upnp_pfpath);
  EXPECT_EQ(0, mRecord.router_max_rule);
  EXPECT_TRUE(mScene.maxRulesAsked.empty());
}

TEST_F(DetectRun, UpnpOnlyRouterPasses) {
  mScene.router->natpmp = NatPmpFinding{};
  ASSERT_EQ(0, Detect());
  EXPECT_EQ(1, mRecord.support_upnp);
  EXPECT_EQ(0, mRecord.support_natpmp);
  EXPECT_STREQ("Acme: R1(2.0)", mRecord.upnp_pfpath);
}

TEST_F(DetectRun, AProbeThatFailedLocallyIsUnknown) {
  mScene.router->upnp = UpnpFinding{};
  mScene.router->upnp.support = ProtocolSupport::kUnknown;
  ASSERT_EQ(0, Detect());
  EXPECT_EQ(2, mRecord.support_upnp);
  EXPECT_EQ(1, mRecord.support_natpmp);
}

TEST_F(DetectRun, PrivateOutsideAddressIsDoubleNat) {
  mScene.router->upnp.externalAddress = "10.0.0.2";
  mScene.router->natpmp.publicAddress = "10.0.0.2";
  ASSERT_EQ(0, Detect());
  EXPECT_EQ(kDetectWarnDoubleNat | ZARK_DETECT_WARN_HOPS_OVER_ONE,
            mRecord.warning);
  EXPECT_TRUE(HasLogContaining("double NAT: the router's outside address "
                               "10.0.0.2 is a private address (RFC 1918)"));
}

TEST_F(DetectRun, CarrierGradeOutsideAddressIsDoubleNat) {
  mScene.router->upnp.externalAddress = "";
  mScene.router->natpmp.publicAddress = "100.72.1.2";
  ASSERT_EQ(0, Detect());
  EXPECT_EQ(kDetectWarnDoubleNat | ZARK_DETECT_WARN_HOPS_OVER_ONE,
            mRecord.warning);
  EXPECT_TRUE(HasLogContaining("the router's outside address 100.72.1.2 is "
                               "carrier-grade NAT space (100.64.0.0/10)"));
}

TEST_F(DetectRun, RouterNamesAreSanitizedForTheLaterSplit) {
  mScene.router->upnp.identity = {"Net: Gear", "R7000 (EU)", "1.0(2)"};
  ASSERT_EQ(0, Detect());
  EXPECT_STREQ("Net- Gear", mRecord.router_brand);
  EXPECT_STREQ("R7000 [EU]", mRecord.router_model);
  EXPECT_STREQ("1.0(2)", mRecord.router_version);
  EXPECT_STREQ("Net- Gear: R7000 [EU](1.0(2))", mRecord.upnp_pfpath);
}

} // namespace
} // namespace zark::test
