// A router that reboots: rules are saved to the test network's miniupnpd,
// then the router loses every mapping (its daemon stops, its nftables
// chains are emptied, it starts again without a lease file) while the
// library still records them as held. "zarkportforward renew" of this
// build, as its timer runs it, asks the router about each recorded mapping
// and puts back exactly the saved ones.
#include "fault_support.h"

#include "libzarkportmap.h"

namespace zark::faults {
namespace {

Json::Value SavedRules() {
  Json::Value rules(Json::arrayValue);
  rules.append(Rule("web", "tcp", "18080", "8080"));
  rules.append(Rule("game", "udp", "15000", "5000"));
  rules.append(Rule("voice", "both", "16000", "6000"));
  rules.append(Rule("range", "tcp", "20000-20019", "21000-21019"));
  Json::Value disabled = Rule("later", "tcp", "18443", "443");
  disabled["enable"] = false;
  rules.append(disabled);
  return rules;
}

class FaultRouterReboot : public FaultTest {};

TEST_F(FaultRouterReboot, RenewPutsBackEverySavedMapping) {
  ConfigureUpnpRouter();
  Json::Value history(Json::arrayValue);
  ASSERT_TRUE(Save(SavedRules(), history)) << history.toStyledString();
  const Mappings wanted = MappingsOf(SavedRules());
  ASSERT_EQ(24u, wanted.size());
  ASSERT_EQ(wanted, RouterMappings());

  std::string why;
  ASSERT_TRUE(zark::testnet::StopRouterDaemon(mNet, false, &why)) << why;
  ASSERT_TRUE(zark::testnet::FlushRouterMappings(mNet, &why)) << why;
  ASSERT_TRUE(zark::testnet::StartRouterDaemon(mNet, false, &why)) << why;
  ASSERT_TRUE(RouterMappings().empty());

  std::string output;
  ASSERT_EQ(0, zark::testnet::RunTool({ZARK_PORTFORWARD_TOOL_PATH, "renew"},
                                      output, std::chrono::seconds(60)))
      << output;
  EXPECT_EQ(wanted, RouterMappings());
  // The saved rules are what they were.
  std::optional<Json::Value> saved = ReadRuleConf(ZARK_PORTMAP_RULE_CONF, why);
  ASSERT_TRUE(saved.has_value()) << why;
  EXPECT_EQ(SavedRules(), *saved);
  EXPECT_TRUE(LockFree(ZARK_PORTMAP_LOCK_FILE, why)) << why;
}

} // namespace
} // namespace zark::faults
