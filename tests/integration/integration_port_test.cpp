// The reachability test of rules in the test network, with the project's
// probe service (zark-probed) running on the outside host: rules applied to
// the real miniupnpd answer "reachable" from outside, a rule the router
// does not forward answers "unreachable". Once through the library's calls
// and once through the module's Rules test / test_status.
#include "integration_fixture.h"

#include "RouterRuleConf.h"
#include "base/library_config.h"

#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <memory>

namespace zark::integration {
namespace {

using zark::test::SetLibraryConfig;
using zark::testnet::OutsideProcess;

constexpr uint16_t kProbePort = 7777;
constexpr const char *kSelection = "/tmp/selection.conf";

Json::Value Rule(const std::string &id, const std::string &protocol,
                 const std::string &routerPort, const std::string &dsPort) {
  Json::Value rule(Json::objectValue);
  rule["rule_id"] = id;
  rule["enable"] = true;
  rule["router_protocol"] = protocol;
  rule["router_port"] = routerPort;
  rule["ds_port"] = dsPort;
  rule["serviceid"] = "";
  rule["service_name"] = "";
  return rule;
}

// True when nothing listens on port (TCP or UDP) in this namespace: the
// test's temporary listeners are gone.
bool Free(int type, uint16_t port) {
  int fd = ::socket(AF_INET, type | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  bool ok = fd >= 0 && ::bind(fd, reinterpret_cast<sockaddr *>(&address),
                              sizeof(address)) == 0;
  if (fd >= 0) {
    ::close(fd);
  }
  return ok;
}

class IntegrationPortTest : public IntegrationTest {
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
    ConfigureRouter("UPnP IGD", "yes", "no");
  }

  // Two rules on the router, through the module's save.
  void SaveTwoRules() {
    Json::Value rules(Json::arrayValue);
    rules.append(Rule("0", "tcp", "18080", "8080"));
    rules.append(Rule("1", "udp", "15000", "5000"));
    Json::Value params(Json::objectValue);
    params["rules"] = rules;
    Answer started = Invoke(kApiRules, "save", params);
    ASSERT_TRUE(started.success) << started.errorCode;
    Json::Value history(Json::arrayValue);
    Answer last = PollUntilFinished(kApiRules, "save_status",
                                    started.data["task_id"].asString(),
                                    std::chrono::seconds(60), history);
    ZARK::APIPolling::JoinAll();
    ASSERT_TRUE(last.success) << history.toStyledString();
  }

  // The two saved rules and one the router does not forward, as a rule
  // configuration of its own.
  static void WriteSelection() {
    RouterRuleConfWriter writer;
    ASSERT_TRUE(writer.AddRule("0", true, "18080", "8080", "tcp", "", ""));
    ASSERT_TRUE(writer.AddRule("1", true, "15000", "5000", "udp", "", ""));
    ASSERT_TRUE(writer.AddRule("2", true, "18081", "8081", "tcp", "", ""));
    ASSERT_TRUE(writer.Sync(kSelection));
  }

  std::unique_ptr<OutsideProcess> mProbe;
};

TEST_F(IntegrationPortTest, LibraryTellsForwardedFromUnforwardedPorts) {
  SaveTwoRules();
  WriteSelection();
  int count = 0;
  ZARK_ROUTER_RULE *rules = nullptr;
  ASSERT_EQ(0, KLibGetRulesArrFromRuleConf(&count, &rules,
                                           const_cast<char *>(kSelection),
                                           false, nullptr));
  ASSERT_EQ(0, KLibTestRulesInit());
  ZARK_LIBZARKPORTMAP_ERR err{-1};
  EXPECT_EQ(0, KLibTestRules(count, rules, &err, false));
  KLibFreeRulesArr(rules);
  EXPECT_EQ(ZARK_PORTMAP_ERR_NONE, err.err);
  EXPECT_EQ("0=reachable\n1=reachable\n2=unreachable\n",
            zark::test::ReadFile(ZARK_PORTMAP_TEST_STATUS));
  // The temporary listeners are gone again.
  EXPECT_TRUE(Free(SOCK_STREAM, 8080));
  EXPECT_TRUE(Free(SOCK_DGRAM, 5000));
  EXPECT_TRUE(Free(SOCK_STREAM, 8081));
}

TEST_F(IntegrationPortTest, RulesTestThroughTheModule) {
  SaveTwoRules();
  WriteSelection();
  Json::Value params(Json::objectValue);
  params["selection"] = kSelection;
  Answer started = Invoke(kApiRules, "test", params);
  ASSERT_TRUE(started.success) << started.errorCode;
  Json::Value history(Json::arrayValue);
  Answer last = PollUntilFinished(kApiRules, "test_status",
                                  started.data["task_id"].asString(),
                                  std::chrono::seconds(60), history);
  ZARK::APIPolling::JoinAll();
  ASSERT_TRUE(last.success) << history.toStyledString();
  EXPECT_EQ("success", last.data["status"].asString());
  EXPECT_EQ(ParseJson(R"({"0": "reachable", "1": "reachable",
                          "2": "unreachable"})"),
            last.data["rules"])
      << history.toStyledString();
}

TEST_F(IntegrationPortTest, WithoutTheProbeServiceTheRulesSayWhy) {
  mProbe.reset();
  SaveTwoRules();
  WriteSelection();
  int count = 0;
  ZARK_ROUTER_RULE *rules = nullptr;
  ASSERT_EQ(0, KLibGetRulesArrFromRuleConf(&count, &rules,
                                           const_cast<char *>(kSelection),
                                           false, nullptr));
  ASSERT_EQ(0, KLibTestRulesInit());
  ZARK_LIBZARKPORTMAP_ERR err{0};
  EXPECT_EQ(-1, KLibTestRules(count, rules, &err, false));
  KLibFreeRulesArr(rules);
  EXPECT_EQ(ZARK_PORTMAP_ERR_PROBE_SERVICE, err.err);
  EXPECT_EQ("0=probe service not reachable\n1=probe service not reachable\n"
            "2=probe service not reachable\n",
            zark::test::ReadFile(ZARK_PORTMAP_TEST_STATUS));
}

} // namespace
} // namespace zark::integration
