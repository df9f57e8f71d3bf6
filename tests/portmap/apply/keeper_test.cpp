// The keeper's round: nothing is sent when nothing is due, a lease is
// renewed once half of the granted lifetime has passed, the router is
// verified at the interval and what it lost is restored, a failed job is
// retried soon. Time is the test's own clock; request counts are the fake
// routers' own.
// HERMETIC: real files under /etc/portforward and /tmp in a private mount
// namespace.
#include "apply/keeper.h"

#include "apply_test_support.h"
#include "catalog/mapping_state.h"
#include "catalog/router_conf_store.h"
#include "drivers/driver_choice.h"
#include "fake_igd.h"
#include "fake_natpmp.h"
#include "hermetic.h"
#include "zarkportforward.h"

#include <gtest/gtest.h>

#include <cstring>
#include <ctime>
#include <string>
#include <vector>

namespace zark::portmap {
namespace {

using test::FakeIgd;
using test::FakeNatPmp;
using test::HttpReply;
using test::SoapRequest;
using test_support::SamePortRule;
using test_support::StoreGenericRouter;

const char *const kGateway = "127.0.0.1";
constexpr int kInterval = 300;

class PortMapApplyKeeper : public testing::Test {
protected:
  void SetUp() override {
    test::ResetFixedPaths();
    RouterOverrides overrides;
    overrides.upnpRootDescUrls = {mIgd.RootDescUrl()};
    overrides.localNetworks = {{0x7f000000u, 0xff000000u}};
    overrides.natpmpPort = mNatPmp.Port();
    overrides.natpmpFirstWait = std::chrono::milliseconds(20);
    SetRouterOverridesForTesting(overrides);
    mEnvironment = DefaultApplyEnvironment();
    mEnvironment.now = [this] { return mClock; };
  }
  void TearDown() override { SetRouterOverridesForTesting(std::nullopt); }

  void Configure(bool upnp) { StoreGenericRouter(kGateway, upnp); }

  int Save() {
    ZARK_ROUTER_SAVE_RULE_RESULT result{};
    return ApplyRules(kGateway, mRules, ApplyOptions{}, mEnvironment, result,
                      nullptr, nullptr);
  }

  // One round; the seconds until the next one.
  int Round(int expectedRc = 0) {
    ZARK_ROUTER_SAVE_RULE_RESULT result{};
    mSummary = ApplySummary{};
    int next = -1;
    EXPECT_EQ(expectedRc, KeepRouter(kGateway, mRules, kInterval, mEnvironment,
                                     result, mSummary, next))
        << result.detail.text;
    EXPECT_GE(next, 1);
    EXPECT_LE(next, kInterval);
    return next;
  }

  FakeIgd mIgd;
  FakeNatPmp mNatPmp;
  ApplyEnvironment mEnvironment;
  int64_t mClock = static_cast<int64_t>(std::time(nullptr));
  std::vector<ZARK_ROUTER_RULE> mRules = {SamePortRule("web", "tcp", "8080"),
                                          SamePortRule("dns", "udp", "5353")};
  ApplySummary mSummary;
};

TEST_F(PortMapApplyKeeper, AShortNatPmpGrantIsRenewedAtHalfItsLifetime) {
  Configure(false);
  mNatPmp.SetGrantedLifetime(4); // asked 7200 s, granted 4 s
  ASSERT_EQ(0, Save());
  ASSERT_EQ(2u, mNatPmp.Table().size());
  const int afterSave = mNatPmp.Requests();

  // Nothing due yet: nothing sent, the next round at half the lease.
  EXPECT_EQ(2, Round());
  EXPECT_EQ(afterSave, mNatPmp.Requests());

  mClock += 2;
  EXPECT_EQ(2, Round());
  // Both renewed (one request each) before they lapse.
  EXPECT_EQ(afterSave + 2, mNatPmp.Requests());
  EXPECT_EQ(2, mSummary.added);
  for (const FakeNatPmp::Mapping &mapping : mNatPmp.Table()) {
    EXPECT_EQ(4u, mapping.lifetime);
  }
}

TEST_F(PortMapApplyKeeper, ARouterThatLostItsMappingsIsRestoredAtTheInterval) {
  Configure(true);
  ASSERT_EQ(0, Save());
  mIgd.ClearTable(); // the router restarted
  mIgd.ResetCounts();

  EXPECT_EQ(kInterval, Round());
  EXPECT_EQ(0, mIgd.TotalRequests());

  mClock += kInterval;
  EXPECT_EQ(kInterval, Round());
  EXPECT_EQ(2, mSummary.repaired);
  EXPECT_EQ(2u, mIgd.Table().size());
  // A lookup each (IGD:1), then the add and its confirmation.
  EXPECT_EQ((std::map<std::string, int>{{"GetSpecificPortMappingEntry", 4},
                                        {"AddPortMapping", 2},
                                        {"GetExternalIPAddress", 1}}),
            mIgd.Counts());
}

TEST_F(PortMapApplyKeeper, AFailedJobIsRetriedWithinAMinute) {
  Configure(true);
  mIgd.OnAction("AddPortMapping", [](const SoapRequest &) {
    HttpReply gone;
    gone.close = true;
    return std::optional<HttpReply>(gone);
  });
  EXPECT_EQ(-1, Save());
  mIgd.ResetCounts();

  // Pending, but the router just failed: wait for the retry.
  EXPECT_EQ(kRetrySeconds, Round());
  EXPECT_EQ(0, mIgd.TotalRequests());

  mIgd.OnAction("AddPortMapping",
                [](const SoapRequest &) { return std::optional<HttpReply>(); });
  mClock += kRetrySeconds;
  EXPECT_EQ(kInterval, Round());
  EXPECT_EQ(2, mIgd.Count("AddPortMapping"));
  EXPECT_EQ(2u, mIgd.Table().size());
}

TEST_F(PortMapApplyKeeper, NoRulesOrNoRouterIsNothingToDo) {
  mRules.clear();
  Configure(true);
  EXPECT_EQ(kInterval, Round());
  mRules = {SamePortRule("web", "tcp", "8080")};
  test::ResetFixedPaths(); // no router configured
  EXPECT_EQ(kInterval, Round());
  EXPECT_EQ(0, mIgd.TotalRequests());
}

TEST_F(PortMapApplyKeeper, OnlyOurOwnMappingIsDeleted) {
  Configure(true);
  ZARK_ROUTER_SAVE_RULE_RESULT result{};
  ASSERT_EQ(0, KLibSaveRules(kGateway, static_cast<int>(mRules.size()),
                             mRules.data(), false, &result, nullptr, nullptr));
  mIgd.PutEntry({"TCP", 2222, "127.0.0.9", 22, 0, "game console"});
  char message[256] = {};
  ZARK_LIBZARKPORTMAP_ERR err{};

  EXPECT_EQ(-1, KLibDeleteOurMapping(kGateway, "TCP", 2222, message,
                                     sizeof(message), &err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_BAD_PARAMETER, err.err);
  EXPECT_NE(nullptr, std::strstr(message, "not a mapping this server made"));
  EXPECT_EQ(3u, mIgd.Table().size());

  EXPECT_EQ(0, KLibDeleteOurMapping(kGateway, "TCP", 8080, message,
                                    sizeof(message), &err))
      << message;
  EXPECT_EQ(2u, mIgd.Table().size());
  MappingState state;
  ASSERT_TRUE(LoadMappingState(kMappingStatePath, state));
  EXPECT_EQ(nullptr, state.Find(kGateway, RouterProtocol::kUpnp)
                         ->Find(IpProtocol::kTcp, 8080));
}

} // namespace
} // namespace zark::portmap
