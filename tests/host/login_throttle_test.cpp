// Login throttling: waits per address, the account's ceiling for addresses
// with failures on record, doubling, capped, cleared by a success, forgotten
// after a quiet hour; attempts claimed in the same step as the check.
#include "fake_clock.h"
#include "login_throttle.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

namespace zark::host {
namespace {

using namespace std::chrono_literals;
using test::FakeClock;

class HostThrottle : public ::testing::Test {
protected:
  HostThrottle() : mThrottle(mClock, ThrottlePolicy{}) {}
  void Fail(const char *account, const char *address, int times = 1) {
    for (int i = 0; i < times; ++i) {
      mThrottle.RecordFailure(account, address);
    }
  }
  std::chrono::seconds Wait(const char *account, const char *address) {
    return mThrottle.RetryAfter(account, address);
  }

  FakeClock mClock;
  LoginThrottle mThrottle;
};

TEST_F(HostThrottle, ThreeFailuresBeforeTheFirstWait) {
  Fail("admin", "127.0.0.1", 2);
  EXPECT_EQ(Wait("admin", "127.0.0.1"), 0s);
  Fail("admin", "127.0.0.1");
  EXPECT_EQ(Wait("admin", "127.0.0.1"), 2s);
}

TEST_F(HostThrottle, WaitDoublesUpToTheCap) {
  Fail("admin", "10.0.0.1", 3);
  const std::chrono::seconds expected[] = {4s, 8s, 16s, 32s, 60s, 60s};
  for (std::chrono::seconds wait : expected) {
    Fail("admin", "10.0.0.1");
    EXPECT_EQ(Wait("admin", "10.0.0.1"), wait);
  }
}

TEST_F(HostThrottle, WaitEndsWithTime) {
  Fail("admin", "10.0.0.1", 4);
  EXPECT_EQ(Wait("admin", "10.0.0.1"), 4s);
  mClock.Advance(1500ms);
  EXPECT_EQ(Wait("admin", "10.0.0.1"), 3s); // 2.5 s, rounded up
  mClock.Advance(2500ms);
  EXPECT_EQ(Wait("admin", "10.0.0.1"), 0s);
}

TEST_F(HostThrottle, AccountCeilingSlowsAddressesWithFailuresOnly) {
  Fail("admin", "10.0.0.1");
  Fail("admin", "10.0.0.2");
  Fail("admin", "10.0.0.3");
  // Each of these addresses failed once: the account's wait holds them.
  EXPECT_EQ(Wait("admin", "10.0.0.1"), 2s);
  EXPECT_EQ(Wait("admin", "10.0.0.3"), 2s);
  // A clean address gets its password checked: the right one logs in.
  EXPECT_EQ(Wait("admin", "10.0.0.9"), 0s);
  EXPECT_EQ(Wait("other", "10.0.0.1"), 0s);
}

TEST_F(HostThrottle, StrangerCannotKeepACleanAddressOut) {
  // One guess from the stranger's address each time its wait runs out.
  for (int round = 0; round < 20; ++round) {
    std::chrono::seconds wait = Wait("admin", "192.0.2.66");
    mClock.Advance(wait);
    EXPECT_EQ(mThrottle.Claim("admin", "192.0.2.66"), 0s);
    mThrottle.Release("192.0.2.66");
    EXPECT_EQ(mThrottle.Claim("admin", "10.0.0.1"), 0s) << "round " << round;
    mThrottle.RecordSuccess("admin", "10.0.0.1");
    mThrottle.Release("10.0.0.1");
  }
}

TEST_F(HostThrottle, ClaimCountsTheAttemptBeforeItIsChecked) {
  Fail("admin", "10.0.0.1", 2);
  EXPECT_EQ(mThrottle.Claim("admin", "10.0.0.1"), 0s);
  mThrottle.Release("10.0.0.1");
  // The claimed attempt is the third failure already.
  EXPECT_EQ(mThrottle.Claim("admin", "10.0.0.1"), 2s);
  EXPECT_EQ(Wait("admin", "10.0.0.1"), 2s);
  mThrottle.RecordSuccess("admin", "10.0.0.1");
  EXPECT_EQ(Wait("admin", "10.0.0.1"), 0s);
}

TEST_F(HostThrottle, ConcurrentClaimsAtTheEndOfAWaitLetOneThrough) {
  Fail("admin", "10.0.0.1", 4);
  mClock.Advance(Wait("admin", "10.0.0.1"));
  std::atomic<int> through{0};
  std::vector<std::thread> guessers;
  for (int i = 0; i < 8; ++i) {
    guessers.emplace_back([this, &through] {
      if (mThrottle.Claim("admin", "10.0.0.1") == 0s) {
        ++through;
        // A wrong password: the claim stays counted as the failure.
        mThrottle.Release("10.0.0.1");
      }
    });
  }
  for (std::thread &guesser : guessers) {
    guesser.join();
  }
  EXPECT_EQ(through.load(), 1);
}

TEST_F(HostThrottle, ConcurrentRightPasswordsOfOneAddressAreServedInTurn) {
  std::atomic<int> through{0};
  std::vector<std::thread> tabs;
  for (int i = 0; i < 8; ++i) {
    tabs.emplace_back([this, &through] {
      if (mThrottle.Claim("admin", "10.0.0.1") == 0s) {
        ++through;
        mThrottle.RecordSuccess("admin", "10.0.0.1");
        mThrottle.Release("10.0.0.1");
      }
    });
  }
  for (std::thread &tab : tabs) {
    tab.join();
  }
  EXPECT_EQ(through.load(), 8);
}

TEST_F(HostThrottle, Ipv6AddressesCountByTheirSlash64) {
  EXPECT_EQ(ThrottleAddressKey("2001:db8:1:2:aaaa::1"), "2001:db8:1:2::/64");
  EXPECT_EQ(ThrottleAddressKey("::ffff:192.0.2.7"), "192.0.2.7");
  EXPECT_EQ(ThrottleAddressKey("192.0.2.7"), "192.0.2.7");
  Fail("a", "2001:db8:1:2::1");
  Fail("b", "2001:db8:1:2::2");
  Fail("c", "2001:db8:1:2:ffff::3");
  EXPECT_EQ(Wait("admin", "2001:db8:1:2::99"), 2s);
  EXPECT_EQ(Wait("admin", "2001:db8:1:3::1"), 0s);
}

TEST_F(HostThrottle, AddressIsSlowedForEveryAccount) {
  Fail("a", "10.0.0.1");
  Fail("b", "10.0.0.1");
  Fail("c", "10.0.0.1");
  EXPECT_EQ(Wait("admin", "10.0.0.1"), 2s);
  EXPECT_EQ(Wait("admin", "10.0.0.2"), 0s);
}

TEST_F(HostThrottle, SuccessClearsBothCounts) {
  Fail("admin", "10.0.0.1", 2);
  mThrottle.RecordSuccess("admin", "10.0.0.1");
  Fail("admin", "10.0.0.1", 2);
  EXPECT_EQ(Wait("admin", "10.0.0.1"), 0s);
}

TEST_F(HostThrottle, QuietHourStartsAgainFromZero) {
  Fail("admin", "10.0.0.1", 5);
  mClock.Advance(1h);
  Fail("other", "10.0.0.2"); // forgetting happens as failures come in
  Fail("admin", "10.0.0.1", 2);
  EXPECT_EQ(Wait("admin", "10.0.0.1"), 0s);
}

TEST_F(HostThrottle, CountersAreBounded) {
  ThrottlePolicy policy;
  policy.maxEntries = 4;
  LoginThrottle small(mClock, policy);
  for (int i = 0; i < 3; ++i) {
    small.RecordFailure("admin", "10.0.0.1");
  }
  mClock.Advance(1s);
  // Two new counters per failure push out the oldest ones.
  small.RecordFailure("x", "10.0.0.2");
  small.RecordFailure("y", "10.0.0.3");
  EXPECT_EQ(small.RetryAfter("admin", "10.0.0.1"), 0s);
}

} // namespace
} // namespace zark::host
