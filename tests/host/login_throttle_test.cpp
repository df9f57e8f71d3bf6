// Login throttling: waits per account and per address, doubling, capped,
// cleared by a success, forgotten after a quiet hour.
#include "fake_clock.h"
#include "login_throttle.h"

#include <gtest/gtest.h>

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

TEST_F(HostThrottle, AccountIsSlowedFromEveryAddress) {
  Fail("admin", "10.0.0.1");
  Fail("admin", "10.0.0.2");
  Fail("admin", "10.0.0.3");
  EXPECT_EQ(Wait("admin", "10.0.0.9"), 2s);
  EXPECT_EQ(Wait("other", "10.0.0.1"), 0s);
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
  EXPECT_EQ(small.RetryAfter("admin", "10.0.0.9"), 0s);
}

} // namespace
} // namespace zark::host
