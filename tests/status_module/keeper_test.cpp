// The keeper under the host: started by the host's start of the module,
// rounds under the port-map lock at the library's pace, bounded and
// interruptible stop, what it logs.
#include "fake_status_host.h"

#include "syslog_capture.h"

#include <syslog.h>

#include <gtest/gtest.h>

#include <atomic>

namespace zark::status::test {
namespace {

using namespace std::chrono_literals;
using zark::fake::Calls;
using zark::fake::CountCalls;
using zark::fake::Fake;

class KeeperUnderHost : public FakeStatusHost {};

TEST_F(KeeperUnderHost, StartsWithTheHostAndRoundsEveryInterval) {
  StartHost(1);
  // The first round at once, then one a second.
  ASSERT_TRUE(WaitForCalls("KLibKeepRouter", 3, 10s));
  for (const auto &call : Calls()) {
    if (call.name == "KLibKeepRouter") {
      EXPECT_EQ(call.args, (std::vector<std::string>{"192.168.1.1", "1"}));
    }
  }
  // Every round under the lock, given back.
  std::vector<std::string> names = zark::fake::CallNames();
  for (size_t i = 0; i < names.size(); ++i) {
    if (names[i] == "KLibKeepRouter") {
      ASSERT_GE(i, 2u);
      EXPECT_EQ(names[i - 2], "KLibZarkPortMapLock");
      EXPECT_EQ(names[i - 1], "KLibGetGatewayIP");
      ASSERT_LT(i + 1, names.size());
      EXPECT_EQ(names[i + 1], "KLibZarkPortMapUnLock");
    }
  }
  Json::Value status = Call("keeper_status");
  EXPECT_TRUE(status["data"]["running"].asBool());
  EXPECT_EQ(status["data"]["check_interval"], 1);
}

TEST_F(KeeperUnderHost, StopIsBoundedAndEndsTheRounds) {
  StartHost(300);
  ASSERT_TRUE(WaitForCalls("KLibKeepRouter", 1, 10s));
  // The keeper waits 300 s for its next round; the stop cuts that short.
  std::chrono::milliseconds took = StopHost();
  EXPECT_LT(took, 2s);
  const size_t rounds = CountCalls("KLibKeepRouter");
  std::this_thread::sleep_for(200ms);
  EXPECT_EQ(CountCalls("KLibKeepRouter"), rounds);
  EXPECT_TRUE(zark::test::HasLogContaining("keeper stopped after 1 rounds"));
}

TEST_F(KeeperUnderHost, FollowsTheLibrarysDueTimeWithinTheInterval) {
  // A lease granted for 2 s is due for renewal after 1 s: the library says
  // so, and the keeper comes back then, not after its 300 s.
  Fake().KLibKeepRouter = [](const char *, int, int *nextSeconds,
                             ZARK_PORTMAP_APPLY_SUMMARY *,
                             ZARK_ROUTER_SAVE_RULE_RESULT *) {
    *nextSeconds = 1;
    return 0;
  };
  StartHost(300);
  EXPECT_TRUE(WaitForCalls("KLibKeepRouter", 3, 10s));
}

TEST_F(KeeperUnderHost, NeverWaitsLongerThanTheInterval) {
  Fake().KLibKeepRouter = [](const char *, int, int *nextSeconds,
                             ZARK_PORTMAP_APPLY_SUMMARY *,
                             ZARK_ROUTER_SAVE_RULE_RESULT *) {
    *nextSeconds = 100000;
    return 0;
  };
  StartHost(1);
  EXPECT_TRUE(WaitForCalls("KLibKeepRouter", 3, 10s));
}

TEST_F(KeeperUnderHost, BusyLockSkipsTheRoundAndRetries) {
  // Outlives the test body: the keeper runs until the tear-down.
  static std::atomic<int> attempts;
  attempts = 0;
  Fake().KLibZarkPortMapLock = [] {
    // Busy twice (a save holds it), then free.
    return attempts.fetch_add(1) < 2 ? -1 : 0;
  };
  StartHost(1);
  ASSERT_TRUE(WaitForCalls("KLibKeepRouter", 1, 10s));
  EXPECT_GE(attempts.load(), 3);
  // A skipped round gives back no lock it did not take.
  EXPECT_EQ(CountCalls("KLibZarkPortMapUnLock"), 1u);
  Json::Value status = Call("keeper_status");
  EXPECT_GE(status["data"]["rounds"].asUInt64(), 3u);
}

TEST_F(KeeperUnderHost, LogsWhatItRestored) {
  Fake().KLibKeepRouter = [](const char *, int interval, int *nextSeconds,
                             ZARK_PORTMAP_APPLY_SUMMARY *summary,
                             ZARK_ROUTER_SAVE_RULE_RESULT *) {
    summary->added = 2;
    summary->repaired = 2;
    summary->checked = 5;
    *nextSeconds = interval;
    return 0;
  };
  StartHost(300);
  ASSERT_TRUE(WaitForCalls("KLibKeepRouter", 1, 10s));
  Json::Value status = PollUntil(
      "keeper_status", "",
      [](const Json::Value &a) {
        return a["data"]["last_round"]["outcome"] == "ok";
      },
      10s);
  EXPECT_EQ(status["data"]["last_round"]["restored"], 2);
  EXPECT_EQ(status["data"]["last_round"]["summary"]["checked"], 5);
  EXPECT_TRUE(zark::test::HasLogContaining(
      "keeper restored 2 mappings on 192.168.1.1 (5 checked, 0 failed)"));
}

TEST_F(KeeperUnderHost, RouterFailureIsLoggedAndRetriedSoon) {
  Fake().KLibKeepRouter = [](const char *, int, int *,
                             ZARK_PORTMAP_APPLY_SUMMARY *,
                             ZARK_ROUTER_SAVE_RULE_RESULT *result) {
    result->errType = ZARK_PORTMAP_ERR_ROUTER;
    return -1;
  };
  StartHost(2);
  ASSERT_TRUE(WaitForCalls("KLibKeepRouter", 2, 10s));
  Json::Value status = Call("keeper_status");
  EXPECT_EQ(status["data"]["last_round"]["outcome"], "failed");
  EXPECT_EQ(status["data"]["last_round"]["err_type"], ZARK_PORTMAP_ERR_ROUTER);
  EXPECT_TRUE(zark::test::HasLogContaining("keeper round failed: -1"));
}

TEST_F(KeeperUnderHost, NoGatewayIsAnOutcomeNotAFailure) {
  Fake().KLibGetGatewayIP = [](char *, int) { return -1; };
  StartHost(300);
  Json::Value status = PollUntil(
      "keeper_status", "",
      [](const Json::Value &a) { return a["data"]["rounds"].asUInt64() >= 1; },
      10s);
  EXPECT_EQ(status["data"]["last_round"]["outcome"], "no_gateway");
  EXPECT_EQ(CountCalls("KLibKeepRouter"), 0u);
  EXPECT_EQ(CountCalls("KLibZarkPortMapUnLock"), 1u);
}

} // namespace
} // namespace zark::status::test
