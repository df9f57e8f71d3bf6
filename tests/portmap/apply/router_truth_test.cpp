// The router, not the library's memory, is the source of truth: every save
// verifies what the router holds and restores what it lost, a rule set that
// passed the checks is kept when the router fails, each wanted mapping is
// recorded with where it stands, and the status record says so. Request
// counts are the fake router's own.
// HERMETIC: real files under /etc/portforward and /tmp in a private mount
// namespace.
#include "apply_test_support.h"
#include "catalog/mapping_state.h"
#include "catalog/router_conf_store.h"
#include "drivers/driver_choice.h"
#include "fake_igd.h"
#include "hermetic.h"
#include "libzarkportmap.h"
#include "zarkportforward.h"

#include <gtest/gtest.h>
#include <json/json.h>

#include <cstring>
#include <map>
#include <memory>
#include <string>
#include <vector>

namespace zark::portmap {
namespace {

using test::FakeIgd;
using test::HttpReply;
using test::IgdVariant;
using test::SoapRequest;
using test_support::SamePortRule;
using test_support::StoreGenericRouter;

const char *const kGateway = "127.0.0.1";

// Five mappings: tcp 8001-8003, udp 5353, tcp 2222.
std::vector<ZARK_ROUTER_RULE> FiveMappings() {
  return {SamePortRule("range", "tcp", "8001-8003"),
          SamePortRule("dns", "udp", "5353"),
          SamePortRule("ssh", "tcp", "2222")};
}

// Every request the fake gets for these actions is answered by closing the
// connection (a router that went away); nullopt handlers bring it back.
void SilenceActions(FakeIgd &igd, bool silent) {
  for (const char *action : {"AddPortMapping", "GetSpecificPortMappingEntry",
                             "DeletePortMapping", "GetExternalIPAddress"}) {
    igd.OnAction(action, [silent](const SoapRequest &) {
      std::optional<HttpReply> reply;
      if (silent) {
        reply.emplace();
        reply->close = true;
      }
      return reply;
    });
  }
}

struct TextDeleter {
  void operator()(char *text) const { KLibFreeText(text); }
};

class PortMapApplyRouterTruth : public testing::Test {
protected:
  explicit PortMapApplyRouterTruth(IgdVariant variant = IgdVariant::kIpV1)
      : mIgd(variant) {}
  void SetUp() override {
    test::ResetFixedPaths();
    RouterOverrides overrides;
    overrides.upnpRootDescUrls = {mIgd.RootDescUrl()};
    overrides.localNetworks = {{0x7f000000u, 0xff000000u}};
    SetRouterOverridesForTesting(overrides);
    StoreGenericRouter(kGateway, true);
  }
  void TearDown() override { SetRouterOverridesForTesting(std::nullopt); }

  // As the module saves: flag false.
  int Save(std::vector<ZARK_ROUTER_RULE> rules) {
    mResult = ZARK_ROUTER_SAVE_RULE_RESULT{};
    return KLibSaveRules(kGateway, static_cast<int>(rules.size()), rules.data(),
                         false, &mResult, nullptr, nullptr);
  }

  RouterRecord Record() {
    MappingState state;
    EXPECT_TRUE(LoadMappingState(kMappingStatePath, state));
    const RouterRecord *record = state.Find(kGateway, RouterProtocol::kUpnp);
    return record != nullptr ? *record : RouterRecord{};
  }

  Json::Value Status() {
    char *raw = nullptr;
    ZARK_LIBZARKPORTMAP_ERR err{-1};
    EXPECT_EQ(0, KLibGetPortMapStatus(kGateway, &raw, &err));
    EXPECT_EQ(ZARK_PORTMAP_ERR_NONE, err.err);
    std::unique_ptr<char, TextDeleter> text(raw);
    Json::Value root;
    std::string errors;
    std::unique_ptr<Json::CharReader> reader(
        Json::CharReaderBuilder().newCharReader());
    const char *begin = text ? text.get() : "";
    EXPECT_TRUE(
        reader->parse(begin, begin + std::strlen(begin), &root, &errors))
        << errors;
    return root;
  }

  FakeIgd mIgd;
  ZARK_ROUTER_SAVE_RULE_RESULT mResult{};
};

TEST(PortMapApplyFailureKinds, EachKindHasItsStableWord) {
  const std::map<ZARK_FAILURE_KIND, std::string> words = {
      {ZARK_FAILURE_NONE, ""},
      {ZARK_FAILURE_ROUTER_NOT_ANSWERING, "router_not_answering"},
      {ZARK_FAILURE_CONFLICT, "conflict"},
      {ZARK_FAILURE_PORT_REFUSED, "port_refused"},
      {ZARK_FAILURE_TABLE_FULL, "table_full"},
      {ZARK_FAILURE_DOUBLE_NAT, "double_nat"},
      {ZARK_FAILURE_LEASE_REFUSED, "lease_refused"},
      {ZARK_FAILURE_NOT_CONFIGURED, "not_configured"},
      {ZARK_FAILURE_LOCAL, "local"},
      {ZARK_FAILURE_OTHER, "other"}};
  for (const auto &[kind, word] : words) {
    EXPECT_EQ(word, KLibFailureKindName(kind)) << kind;
  }
  EXPECT_STREQ("", KLibFailureKindName(static_cast<ZARK_FAILURE_KIND>(42)));
}

TEST_F(PortMapApplyRouterTruth, AnUnchangedSaveRestoresWhatTheRouterLost) {
  ASSERT_EQ(0, Save(FiveMappings())) << mResult.detail.text;
  // Two mappings deleted on the router behind the library's back.
  std::vector<FakeIgd::Entry> table = mIgd.Table();
  ASSERT_EQ(5u, table.size());
  mIgd.ClearTable();
  for (std::size_t i = 0; i < table.size(); ++i) {
    if (table[i].externalPort != 8002 && table[i].externalPort != 5353) {
      mIgd.PutEntry(table[i]);
    }
  }
  mIgd.ResetCounts();

  ASSERT_EQ(0, Save(FiveMappings())) << mResult.detail.text;

  // Each mapping looked up, the two lost ones added and confirmed.
  EXPECT_EQ((std::map<std::string, int>{{"AddPortMapping", 2},
                                        {"GetSpecificPortMappingEntry", 7}}),
            mIgd.Counts());
  EXPECT_EQ(5u, mIgd.Table().size());
  RouterRecord record = Record();
  ASSERT_TRUE(record.lastJob.has_value());
  EXPECT_EQ("save", record.lastJob->kind);
  EXPECT_TRUE(record.lastJob->ok);
  EXPECT_EQ(2, record.lastJob->repaired);
  EXPECT_EQ(2, record.lastJob->added);
  for (const RecordedMapping &mapping : record.mappings) {
    EXPECT_EQ(MappingApply::kOnRouter, mapping.apply) << mapping.externalPort;
    EXPECT_GT(mapping.verified, 0);
  }
  Json::Value status = Status();
  EXPECT_EQ(2, status["last_job"]["repaired"].asInt());
  EXPECT_EQ("", status["last_job"]["failure"]["code"].asString());
}

TEST_F(PortMapApplyRouterTruth, RouterDownKeepsTheRulesPendingUntilARepair) {
  ASSERT_EQ(0, Save({SamePortRule("ssh", "tcp", "2222")}));
  SilenceActions(mIgd, true);

  EXPECT_EQ(-1, Save(FiveMappings()));

  // The error type of a failed apply, as before; the words say why.
  EXPECT_EQ(static_cast<uint32_t>(ZARK_PORTMAP_ERR_ROUTER), mResult.errType);
  EXPECT_NE(nullptr,
            std::strstr(mResult.detail.text, "did not answer within 8 s"));
  // The rules are kept, each mapping pending.
  int count = 0;
  ZARK_ROUTER_RULE *saved = nullptr;
  ASSERT_EQ(
      0, KLibGetRulesArrFromRuleConf(&count, &saved, nullptr, false, nullptr));
  KLibFreeRulesArr(saved);
  EXPECT_EQ(3, count);
  Json::Value status = Status();
  ASSERT_EQ(5u, status["rules"].size());
  for (const Json::Value &rule : status["rules"]) {
    EXPECT_EQ("pending", rule["state"].asString())
        << rule["external_port"].asInt();
  }
  EXPECT_EQ("router_not_answering",
            status["last_job"]["failure"]["code"].asString());
  EXPECT_FALSE(status["last_job"]["ok"].asBool());

  // The router is back: a repair applies them.
  SilenceActions(mIgd, false);
  mIgd.ResetCounts();
  ZARK_PORTMAP_APPLY_SUMMARY summary{};
  ZARK_ROUTER_SAVE_RULE_RESULT result{};
  ASSERT_EQ(0,
            KLibRepairSavedRules(kGateway, &summary, &result, nullptr, nullptr))
      << result.detail.text;
  EXPECT_EQ(4, summary.added);
  EXPECT_EQ(4, mIgd.Count("AddPortMapping"));
  EXPECT_EQ(5u, mIgd.Table().size());
  status = Status();
  EXPECT_EQ("repair", status["last_job"]["kind"].asString());
  EXPECT_EQ("198.51.100.7", status["external_address"].asString());
  for (const Json::Value &rule : status["rules"]) {
    EXPECT_EQ("on_router", rule["state"].asString())
        << rule["external_port"].asInt();
    EXPECT_GT(rule["verified"].asInt64(), 0);
  }
}

TEST_F(PortMapApplyRouterTruth, AForeignMappingIsLeftAloneAndNamed) {
  mIgd.PutEntry({"TCP", 2222, "127.0.0.9", 22, 0, "game console"});

  EXPECT_EQ(-1, Save(FiveMappings()));

  EXPECT_EQ(static_cast<uint32_t>(ZARK_PORTMAP_ERR_ROUTER), mResult.errType);
  EXPECT_NE(nullptr,
            std::strstr(mResult.detail.text, "conflict with another mapping"));
  EXPECT_NE(nullptr, std::strstr(mResult.detail.text, "\"game console\""));
  EXPECT_EQ(5u, mIgd.Table().size());
  EXPECT_EQ(0, mIgd.Count("DeletePortMapping"));
  Json::Value status = Status();
  for (const Json::Value &rule : status["rules"]) {
    const bool ssh = rule["external_port"].asInt() == 2222;
    EXPECT_EQ(ssh ? "refused" : "on_router", rule["state"].asString());
    EXPECT_EQ(ssh ? "conflict" : "", rule["code"].asString());
    if (ssh) {
      EXPECT_NE(std::string::npos,
                rule["reason"].asString().find("game console"));
    }
  }
  // The live table marks the foreign mapping as not ours.
  ZARK_ROUTER_MAPPINGS live{};
  ZARK_LIBZARKPORTMAP_ERR err{};
  ASSERT_EQ(0, KLibListRouterMappings(kGateway, &live, &err)) << live.message;
  ASSERT_EQ(5, live.count);
  for (int i = 0; i < live.count; ++i) {
    const ZARK_ROUTER_MAPPING &entry = live.mappings[i];
    EXPECT_EQ(entry.external_port == 2222 ? 0 : 1, entry.ours)
        << entry.external_port;
    EXPECT_EQ(1, entry.enabled);
  }
  KLibFreeRouterMappings(&live);
  // A repair tries again and still leaves it alone.
  ZARK_PORTMAP_APPLY_SUMMARY summary{};
  EXPECT_EQ(
      -1, KLibRepairSavedRules(kGateway, &summary, nullptr, nullptr, nullptr));
  EXPECT_EQ(1, summary.failed);
  EXPECT_EQ("127.0.0.9", mIgd.Table()[0].client);
}

TEST_F(PortMapApplyRouterTruth, TheControlUrlIsRememberedUntilItFails) {
  ASSERT_EQ(0, Save(FiveMappings())) << mResult.detail.text;
  EXPECT_EQ(1, mIgd.Count("GET"));
  // The router restarted with its service somewhere else; the old control
  // URL no longer answers.
  mIgd.SetControlUrl("/ctl/Moved");
  mIgd.OnAction("GetSpecificPortMappingEntry", [](const SoapRequest &request) {
    std::optional<HttpReply> reply;
    if (request.path != "/ctl/Moved") {
      reply.emplace();
      reply->close = true;
    }
    return reply;
  });
  mIgd.ResetCounts();

  ASSERT_EQ(0, Save(FiveMappings())) << mResult.detail.text;

  // One failed lookup, the description fetched again, then the five.
  EXPECT_EQ((std::map<std::string, int>{{"GET", 1},
                                        {"GetSpecificPortMappingEntry", 6}}),
            mIgd.Counts());
  EXPECT_EQ("http://127.0.0.1:" + std::to_string(mIgd.Port()) + "/ctl/Moved",
            Record().controlUrl);
  mIgd.ResetCounts();
  ASSERT_EQ(0, Save(FiveMappings())) << mResult.detail.text;
  EXPECT_EQ(0, mIgd.Count("GET"));
  EXPECT_EQ(5, mIgd.Count("GetSpecificPortMappingEntry"));
}

// The same against an IGD:2 router, which lists a port range in one request.
class PortMapApplyRouterTruthIgd2 : public PortMapApplyRouterTruth {
protected:
  PortMapApplyRouterTruthIgd2()
      : PortMapApplyRouterTruth(IgdVariant::kIpV2Only) {}
};

// 100 TCP and 100 UDP mappings, ports 10000-10099.
std::vector<ZARK_ROUTER_RULE> TwoHundredMappings() {
  return {SamePortRule("tcp", "tcp", "10000-10099"),
          SamePortRule("udp", "udp", "10000-10099")};
}

TEST_F(PortMapApplyRouterTruthIgd2, ListingsVerifyAndConfirmTwoHundred) {
  ASSERT_EQ(0, Save(TwoHundredMappings())) << mResult.detail.text;
  // One listing per protocol before, the adds, one listing each after.
  EXPECT_EQ((std::map<std::string, int>{{"GET", 1},
                                        {"GetListOfPortMappings", 4},
                                        {"AddPortMapping", 200}}),
            mIgd.Counts());
  EXPECT_EQ(200u, mIgd.Table().size());

  mIgd.ResetCounts();
  ASSERT_EQ(0, Save(TwoHundredMappings())) << mResult.detail.text;
  // An unchanged save of 200 mappings: two requests in all.
  EXPECT_EQ(2, mIgd.TotalRequests());
  EXPECT_EQ(2, mIgd.Count("GetListOfPortMappings"));
  EXPECT_EQ(0, mIgd.Count("AddPortMapping"));
  EXPECT_EQ(0, mIgd.Count("GetSpecificPortMappingEntry"));

  // Two TCP mappings lost: one listing each, two adds, one confirmation.
  std::vector<FakeIgd::Entry> table = mIgd.Table();
  mIgd.ClearTable();
  for (const FakeIgd::Entry &entry : table) {
    if (entry.protocol != "TCP" ||
        (entry.externalPort != 10005 && entry.externalPort != 10050)) {
      mIgd.PutEntry(entry);
    }
  }
  mIgd.ResetCounts();
  ASSERT_EQ(0, Save(TwoHundredMappings())) << mResult.detail.text;
  EXPECT_EQ((std::map<std::string, int>{{"GetListOfPortMappings", 3},
                                        {"AddPortMapping", 2}}),
            mIgd.Counts());
  EXPECT_EQ(200u, mIgd.Table().size());
  EXPECT_EQ(2, Record().lastJob->repaired);
}

TEST_F(PortMapApplyRouterTruthIgd2, AnotherProgramsMappingOnThisServerIsKept) {
  // Same client as ours: the router would let our add replace it.
  mIgd.PutEntry({"TCP", 2222, "127.0.0.1", 22, 0, "other program"});

  EXPECT_EQ(-1, Save(FiveMappings()));

  EXPECT_NE(nullptr, std::strstr(mResult.detail.text, "\"other program\""));
  for (const SoapRequest &request : mIgd.SoapRequests()) {
    if (request.action == "AddPortMapping") {
      EXPECT_NE("2222", request.Arg("NewExternalPort"));
    }
  }
  EXPECT_EQ(5u, mIgd.Table().size());
  EXPECT_EQ("other program", mIgd.Table()[0].description);
  const RouterRecord record = Record();
  const RecordedMapping *ssh = record.Find(IpProtocol::kTcp, 2222);
  ASSERT_NE(nullptr, ssh);
  EXPECT_EQ(MappingApply::kRefused, ssh->apply);
  EXPECT_EQ(ZARK_FAILURE_CONFLICT, ssh->failure);
}

TEST_F(PortMapApplyRouterTruthIgd2, TheConfirmingListingCatchesADroppedAdd) {
  mIgd.SetTableCapacity(2);

  EXPECT_EQ(-1, Save({SamePortRule("range", "tcp", "8001-8003")}));

  EXPECT_EQ(3, mIgd.Count("AddPortMapping"));
  EXPECT_EQ(0, mIgd.Count("GetSpecificPortMappingEntry"));
  EXPECT_NE(nullptr, std::strstr(mResult.detail.text, "table is full"));
  const RouterRecord record = Record();
  const RecordedMapping *third = record.Find(IpProtocol::kTcp, 8003);
  ASSERT_NE(nullptr, third);
  EXPECT_EQ(MappingApply::kRefused, third->apply);
  EXPECT_EQ(ZARK_FAILURE_TABLE_FULL, third->failure);
}

} // namespace
} // namespace zark::portmap
