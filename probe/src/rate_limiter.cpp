#include "rate_limiter.h"

#include <algorithm>
#include <cmath>

namespace zark::probe {

RateLimiter::RateLimiter(double perSecond, double burst, std::size_t maxTracked)
    : mPerSecond(std::max(perSecond, 1e-6)), mBurst(std::max(burst, 1.0)),
      mMaxTracked(std::max<std::size_t>(maxTracked, 1)) {}

void RateLimiter::Refill(Bucket &bucket, TimePoint now) const {
  if (now <= bucket.last) {
    return;
  }
  const double seconds =
      std::chrono::duration<double>(now - bucket.last).count();
  bucket.tokens = std::min(mBurst, bucket.tokens + seconds * mPerSecond);
  bucket.last = now;
}

void RateLimiter::ForgetFullBuckets(TimePoint now) {
  for (auto it = mBuckets.begin(); it != mBuckets.end();) {
    Refill(it->second, now);
    if (it->second.tokens >= mBurst) {
      it = mBuckets.erase(it);
    } else {
      ++it;
    }
  }
}

RateLimiter::Decision RateLimiter::Take(std::string_view key, TimePoint now) {
  Decision decision;
  auto found = mBuckets.find(std::string(key));
  if (found == mBuckets.end()) {
    if (mBuckets.size() >= mMaxTracked) {
      ForgetFullBuckets(now);
    }
    if (mBuckets.size() >= mMaxTracked) {
      decision.tooManyAddresses = true;
      return decision;
    }
    found = mBuckets.emplace(std::string(key), Bucket{mBurst, now}).first;
  }
  Bucket &bucket = found->second;
  Refill(bucket, now);
  if (bucket.tokens >= 1.0) {
    bucket.tokens -= 1.0;
    decision.allowed = true;
    return decision;
  }
  const double missing = 1.0 - bucket.tokens;
  decision.retryAfter = std::chrono::milliseconds(
      static_cast<long long>(std::ceil(missing / mPerSecond * 1000.0)));
  return decision;
}

} // namespace zark::probe
