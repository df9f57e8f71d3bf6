// Rules save and load through the module on the real platform, against the
// test network's miniupnpd: the router ends up holding exactly the wanted
// mappings (as upnpc -l lists them), the forwarded ports answer from the
// outside namespace, save_status shows the "del" and "add" stages, and an
// empty rule set leaves none of our mappings. Once with the router driven by
// UPnP IGD, once by NAT-PMP.
#include "integration_fixture.h"

#include "zarkportforward.h"

#include <algorithm>
#include <map>
#include <set>
#include <sstream>
#include <thread>
#include <tuple>
#include <vector>

namespace zark::integration {
namespace {

using zark::test::HasLogContaining;
using zark::testnet::EchoListener;
using zark::testnet::FlushRouterMappings;
using zark::testnet::ListUpnpMappings;
using zark::testnet::ProbeFromOutside;
using zark::testnet::Protocol;
using zark::testnet::RunTool;
using zark::testnet::StartRouterDaemon;
using zark::testnet::StopRouterDaemon;
using zark::testnet::UpnpMapping;

using Wanted = std::tuple<std::string, int, int>; // protocol, outside, inside

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

// Three rules, one of them a range of 40 ports.
Json::Value ThreeRules() {
  Json::Value rules(Json::arrayValue);
  rules.append(Rule("0", "tcp", "18080", "8080"));
  rules.append(Rule("1", "udp", "15000", "5000"));
  rules.append(Rule("2", "tcp", "20000-20039", "20000-20039"));
  return rules;
}

std::set<Wanted> ThreeRulesMappings() {
  std::set<Wanted> wanted = {{"TCP", 18080, 8080}, {"UDP", 15000, 5000}};
  for (int port = 20000; port <= 20039; ++port) {
    wanted.insert({"TCP", port, port});
  }
  return wanted;
}

class IntegrationSave : public IntegrationTest {
protected:
  // The mappings the router holds for this server.
  std::set<Wanted> RouterMappings() {
    std::vector<UpnpMapping> mappings;
    std::string raw;
    EXPECT_TRUE(ListUpnpMappings(mNet, mappings, &raw)) << raw;
    std::set<Wanted> held;
    for (const UpnpMapping &mapping : mappings) {
      EXPECT_EQ(mNet.lanServer, mapping.internalAddress);
      held.insert(
          {mapping.protocol, mapping.externalPort, mapping.internalPort});
    }
    EXPECT_EQ(mappings.size(), held.size()) << raw;
    return held;
  }

  // Saves rules through Rules save and follows save_status to the end.
  // True when the save succeeded; history gets every status answer.
  bool Save(const Json::Value &rules, Json::Value &history) {
    Json::Value params(Json::objectValue);
    params["rules"] = rules;
    Answer started = Invoke(kApiRules, "save", params);
    EXPECT_TRUE(started.success) << started.errorCode;
    const std::string taskId = started.data["task_id"].asString();
    EXPECT_FALSE(taskId.empty());
    Answer last = PollUntilFinished(kApiRules, "save_status", taskId,
                                    std::chrono::seconds(60), history);
    ZARK::APIPolling::JoinAll();
    return last.success;
  }

  static std::vector<std::string> Stages(const Json::Value &history) {
    std::vector<std::string> stages;
    for (const Json::Value &seen : history) {
      const Json::Value &stage = seen["data"]["stage"];
      if (stage.isString() &&
          (stages.empty() || stages.back() != stage.asString())) {
        stages.push_back(stage.asString());
      }
    }
    return stages;
  }

  void SaveAndCheckThreeRules() {
    Json::Value history(Json::arrayValue);
    ASSERT_TRUE(Save(ThreeRules(), history)) << history.toStyledString();
    EXPECT_EQ(ThreeRulesMappings(), RouterMappings());
    std::vector<std::string> stages = Stages(history);
    EXPECT_NE(stages.end(), std::find(stages.begin(), stages.end(), "add"))
        << history.toStyledString();

    // The forwarded ports answer from outside through the router's outside
    // address; a port that is not forwarded does not.
    EchoListener tcp(Protocol::kTcp, 8080);
    EchoListener udp(Protocol::kUdp, 5000);
    EchoListener range(Protocol::kTcp, 20017);
    ASSERT_TRUE(tcp.Listening() && udp.Listening() && range.Listening());
    EXPECT_TRUE(ProbeFromOutside(mNet, Protocol::kTcp, mNet.wanRouter, 18080));
    EXPECT_TRUE(ProbeFromOutside(mNet, Protocol::kUdp, mNet.wanRouter, 15000));
    EXPECT_TRUE(ProbeFromOutside(mNet, Protocol::kTcp, mNet.wanRouter, 20017));
    EXPECT_FALSE(ProbeFromOutside(mNet, Protocol::kTcp, mNet.wanRouter, 8080));
    EXPECT_EQ(1, tcp.Answered());
    EXPECT_EQ(1, udp.Answered());
    EXPECT_EQ(1, range.Answered());

    // Load returns the saved rules.
    Answer loaded = Invoke(kApiRules, "load");
    ASSERT_TRUE(loaded.success) << loaded.errorCode;
    EXPECT_EQ(ThreeRules(), loaded.data);
  }

  void ChangeThenEmpty() {
    // Dropping the range and the UDP rule, adding one: "del" comes before
    // "add", and only the difference is applied.
    Json::Value changed(Json::arrayValue);
    changed.append(Rule("0", "tcp", "18080", "8080"));
    changed.append(Rule("3", "tcp", "21000", "7000"));
    Json::Value history(Json::arrayValue);
    ASSERT_TRUE(Save(changed, history)) << history.toStyledString();
    EXPECT_EQ((std::set<Wanted>{{"TCP", 18080, 8080}, {"TCP", 21000, 7000}}),
              RouterMappings());
    std::vector<std::string> stages = Stages(history);
    auto del = std::find(stages.begin(), stages.end(), "del");
    auto add = std::find(stages.begin(), stages.end(), "add");
    EXPECT_NE(stages.end(), del) << history.toStyledString();
    EXPECT_NE(stages.end(), add) << history.toStyledString();
    EXPECT_LT(del, add);
    EchoListener range(Protocol::kTcp, 20017);
    ASSERT_TRUE(range.Listening());
    EXPECT_FALSE(ProbeFromOutside(mNet, Protocol::kTcp, mNet.wanRouter, 20017));

    // An empty rule set leaves none of our mappings.
    history = Json::Value(Json::arrayValue);
    ASSERT_TRUE(Save(Json::Value(Json::arrayValue), history))
        << history.toStyledString();
    EXPECT_TRUE(RouterMappings().empty());
    Answer loaded = Invoke(kApiRules, "load");
    ASSERT_TRUE(loaded.success);
    EXPECT_EQ(Json::Value(Json::arrayValue), loaded.data);
  }

  // The state of every mapping of the saved rules, as the library's status
  // record gives it: "protocol port" -> state.
  std::map<std::string, std::string> MappingStates() {
    char *text = nullptr;
    ZARK_LIBZARKPORTMAP_ERR err{};
    EXPECT_EQ(0, KLibGetPortMapStatus(mNet.lanRouter.c_str(), &text, &err));
    std::map<std::string, std::string> states;
    if (text == nullptr) {
      return states;
    }
    Json::Value status;
    std::string why;
    Json::CharReaderBuilder builder;
    std::istringstream in(text);
    EXPECT_TRUE(Json::parseFromStream(builder, in, &status, &why)) << why;
    KLibFreeText(text);
    for (const Json::Value &rule : status["rules"]) {
      states[rule["protocol"].asString() + " " +
             std::to_string(rule["external_port"].asInt())] =
          rule["state"].asString();
    }
    return states;
  }

  // Every mapping of ThreeRules() in state.
  static std::map<std::string, std::string>
  AllThreeRulesIn(const std::string &state) {
    std::map<std::string, std::string> states;
    for (const auto &[protocol, outside, inside] : ThreeRulesMappings()) {
      std::string lower = protocol == "TCP" ? "tcp" : "udp";
      states[lower + " " + std::to_string(outside)] = state;
    }
    return states;
  }
};

// Mappings deleted on the router behind the library's back (another
// client's "upnpc -d"): saving the same rules again puts them back, since
// a save asks the router instead of trusting what the library remembers.
TEST_F(IntegrationSave, UnchangedSaveRestoresMappingsDeletedOnTheRouter) {
  ConfigureRouter("UPnP IGD", "yes", "no");
  Json::Value history(Json::arrayValue);
  ASSERT_TRUE(Save(ThreeRules(), history)) << history.toStyledString();
  ASSERT_EQ(ThreeRulesMappings(), RouterMappings());
  for (const char *port : {"18080", "20005"}) {
    std::string output;
    ASSERT_EQ(
        0, RunTool({"/usr/bin/upnpc", "-u", mNet.rootDesc, "-d", port, "TCP"},
                   output))
        << output;
  }
  std::set<Wanted> lacking = ThreeRulesMappings();
  lacking.erase({"TCP", 18080, 8080});
  lacking.erase({"TCP", 20005, 20005});
  ASSERT_EQ(lacking, RouterMappings());

  history = Json::Value(Json::arrayValue);
  ASSERT_TRUE(Save(ThreeRules(), history)) << history.toStyledString();
  EXPECT_EQ(ThreeRulesMappings(), RouterMappings());
  EXPECT_EQ(AllThreeRulesIn("on_router"), MappingStates());
}

// The router restarted and lost every mapping: an unchanged save restores
// them all.
TEST_F(IntegrationSave, UnchangedSaveRestoresWhatARestartedRouterLost) {
  ConfigureRouter("UPnP IGD", "yes", "no");
  Json::Value history(Json::arrayValue);
  ASSERT_TRUE(Save(ThreeRules(), history)) << history.toStyledString();
  std::string why;
  ASSERT_TRUE(StopRouterDaemon(mNet, false, &why)) << why;
  ASSERT_TRUE(FlushRouterMappings(mNet, &why)) << why;
  ASSERT_TRUE(StartRouterDaemon(mNet, false, &why)) << why;
  ASSERT_TRUE(RouterMappings().empty());

  history = Json::Value(Json::arrayValue);
  ASSERT_TRUE(Save(ThreeRules(), history)) << history.toStyledString();
  EXPECT_EQ(ThreeRulesMappings(), RouterMappings());
}

// A save while the router does not answer fails as before (the default
// code), but the rules are kept and marked pending; once the router is
// back, the keeper's round applies them without another save.
TEST_F(IntegrationSave, RulesSavedWhileTheRouterIsDownAreAppliedLater) {
  ConfigureRouter("UPnP IGD", "yes", "no");
  std::string why;
  ASSERT_TRUE(StopRouterDaemon(mNet, false, &why)) << why;
  Json::Value history(Json::arrayValue);
  EXPECT_FALSE(Save(ThreeRules(), history)) << history.toStyledString();
  ASSERT_FALSE(history.empty());
  EXPECT_EQ(1500, history[history.size() - 1]["code"].asInt())
      << history.toStyledString();
  Answer loaded = Invoke(kApiRules, "load");
  ASSERT_TRUE(loaded.success) << loaded.errorCode;
  EXPECT_EQ(ThreeRules(), loaded.data);
  EXPECT_EQ(AllThreeRulesIn("pending"), MappingStates());

  ASSERT_TRUE(StartRouterDaemon(mNet, false, &why)) << why;
  // The keeper retries a failed job after its check interval at most: with
  // an interval of 1 s, the round a second after the failure is due.
  std::this_thread::sleep_for(std::chrono::milliseconds(1100));
  ASSERT_GE(KLibZarkPortMapLock(), 0);
  int next = 0;
  ZARK_PORTMAP_APPLY_SUMMARY summary{};
  ZARK_ROUTER_SAVE_RULE_RESULT result{};
  const int kept =
      KLibKeepRouter(mNet.lanRouter.c_str(), 1, &next, &summary, &result);
  ASSERT_GE(KLibZarkPortMapUnLock(), 0);
  EXPECT_EQ(0, kept) << result.detail.text;
  EXPECT_EQ(ThreeRulesMappings(), RouterMappings());
  EXPECT_EQ(AllThreeRulesIn("on_router"), MappingStates());
}

TEST_F(IntegrationSave, UpnpRouterHoldsExactlyTheSavedRules) {
  ConfigureRouter("UPnP IGD", "yes", "no");
  SaveAndCheckThreeRules();
  if (IsSkipped() || HasFatalFailure()) {
    return;
  }
  ChangeThenEmpty();
}

TEST_F(IntegrationSave, NatPmpRouterHoldsExactlyTheSavedRules) {
  ConfigureRouter("NAT-PMP", "no", "yes");
  // natpmpc reaches the router and reads its outside address.
  std::string output;
  EXPECT_EQ(0, zark::testnet::RunTool(
                   {"/usr/bin/natpmpc", "-g", mNet.lanRouter}, output))
      << output;
  EXPECT_NE(std::string::npos,
            output.find("Public IP address : " + mNet.wanRouter))
      << output;
  SaveAndCheckThreeRules();
  if (IsSkipped() || HasFatalFailure()) {
    return;
  }
  ChangeThenEmpty();
}

} // namespace
} // namespace zark::integration
