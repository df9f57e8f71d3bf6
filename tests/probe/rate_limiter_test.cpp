// The token bucket per address, on a clock the test moves.
#include "rate_limiter.h"

#include <gtest/gtest.h>

namespace zark::probe {
namespace {

using std::chrono::milliseconds;
using TimePoint = RateLimiter::TimePoint;

const TimePoint kStart = TimePoint() + std::chrono::hours(1);

TEST(ProbeRateLimiter, BurstThenOnePerInterval) {
  RateLimiter limiter(2.0, 3.0, 100);
  for (int i = 0; i < 3; ++i) {
    EXPECT_TRUE(limiter.Take("198.51.100.1", kStart).allowed) << i;
  }
  RateLimiter::Decision refused = limiter.Take("198.51.100.1", kStart);
  EXPECT_FALSE(refused.allowed);
  EXPECT_FALSE(refused.tooManyAddresses);
  EXPECT_EQ(milliseconds(500), refused.retryAfter);

  // Half a token after 250 ms: still refused, 250 ms to go.
  refused = limiter.Take("198.51.100.1", kStart + milliseconds(250));
  EXPECT_FALSE(refused.allowed);
  EXPECT_EQ(milliseconds(250), refused.retryAfter);

  EXPECT_TRUE(limiter.Take("198.51.100.1", kStart + milliseconds(500)).allowed);
  EXPECT_FALSE(
      limiter.Take("198.51.100.1", kStart + milliseconds(500)).allowed);
}

TEST(ProbeRateLimiter, RefillsNoFurtherThanTheBurst) {
  RateLimiter limiter(10.0, 2.0, 100);
  EXPECT_TRUE(limiter.Take("a", kStart).allowed);
  const TimePoint later = kStart + std::chrono::hours(5);
  EXPECT_TRUE(limiter.Take("a", later).allowed);
  EXPECT_TRUE(limiter.Take("a", later).allowed);
  EXPECT_FALSE(limiter.Take("a", later).allowed);
}

TEST(ProbeRateLimiter, AddressesHaveBucketsOfTheirOwn) {
  RateLimiter limiter(1.0, 1.0, 100);
  EXPECT_TRUE(limiter.Take("a", kStart).allowed);
  EXPECT_FALSE(limiter.Take("a", kStart).allowed);
  EXPECT_TRUE(limiter.Take("b", kStart).allowed);
  EXPECT_EQ(2u, limiter.Tracked());
}

TEST(ProbeRateLimiter, MemoryIsBounded) {
  RateLimiter limiter(1.0, 1.0, 2);
  EXPECT_TRUE(limiter.Take("a", kStart).allowed);
  EXPECT_TRUE(limiter.Take("b", kStart).allowed);
  // Both buckets are still empty: a third address is not taken on.
  RateLimiter::Decision refused = limiter.Take("c", kStart);
  EXPECT_FALSE(refused.allowed);
  EXPECT_TRUE(refused.tooManyAddresses);
  EXPECT_EQ(2u, limiter.Tracked());
  // Once they have filled up again they are forgotten.
  EXPECT_TRUE(limiter.Take("c", kStart + milliseconds(1000)).allowed);
  EXPECT_EQ(1u, limiter.Tracked());
}

TEST(ProbeRateLimiter, ClockGoingBackwardsGivesNothing) {
  RateLimiter limiter(1.0, 1.0, 10);
  EXPECT_TRUE(limiter.Take("a", kStart).allowed);
  EXPECT_FALSE(limiter.Take("a", kStart - std::chrono::hours(1)).allowed);
}

} // namespace
} // namespace zark::probe
