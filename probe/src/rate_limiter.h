// Requests allowed per source address: one token bucket per address. A
// bucket holds at most `burst` tokens and gains `perSecond` tokens a second;
// every request takes one. The clock is passed in, so tests decide what time
// it is.
//
// Memory is bounded: at most maxTracked addresses are remembered. Buckets
// that have filled up again are forgotten first (they behave exactly like a
// new bucket); when every remembered address still has a partly empty
// bucket, a new address is refused until one fills up.
#ifndef ZARK_PROBE_RATE_LIMITER_H
#define ZARK_PROBE_RATE_LIMITER_H

#include <chrono>
#include <cstddef>
#include <string>
#include <string_view>
#include <unordered_map>

namespace zark::probe {

class RateLimiter {
public:
  using TimePoint = std::chrono::steady_clock::time_point;

  // perSecond > 0, burst >= 1, maxTracked >= 1.
  RateLimiter(double perSecond, double burst, std::size_t maxTracked);

  struct Decision {
    bool allowed = false;
    // When refused: how long until the address has a token again (0 when
    // refused because too many addresses are tracked).
    std::chrono::milliseconds retryAfter{0};
    bool tooManyAddresses = false;
  };

  // Takes one token of key's bucket at time now. Not thread-safe: callers
  // serialise.
  [[nodiscard]] Decision Take(std::string_view key, TimePoint now);

  [[nodiscard]] std::size_t Tracked() const { return mBuckets.size(); }

private:
  struct Bucket {
    double tokens = 0;
    TimePoint last;
  };
  void Refill(Bucket &bucket, TimePoint now) const;
  void ForgetFullBuckets(TimePoint now);

  double mPerSecond;
  double mBurst;
  std::size_t mMaxTracked;
  std::unordered_map<std::string, Bucket> mBuckets;
};

} // namespace zark::probe

#endif
