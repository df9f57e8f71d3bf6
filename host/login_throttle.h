// Slows down password guessing: consecutive failed logins are counted per
// account name and per client address, and after a few of them further
// attempts are refused for a time that doubles with each failure.
#ifndef ZARK_HOST_LOGIN_THROTTLE_H
#define ZARK_HOST_LOGIN_THROTTLE_H

#include "clock.h"

#include <chrono>
#include <cstddef>
#include <map>
#include <mutex>
#include <string>
#include <string_view>

namespace zark::host {

struct ThrottlePolicy {
  // Failures allowed before any wait.
  unsigned freeFailures = 3;
  // Wait after failure number freeFailures; doubles with every further one.
  std::chrono::seconds firstDelay{2};
  std::chrono::seconds maxDelay{60};
  // A counter with no failure for this long starts from zero again.
  std::chrono::seconds forgetAfter{std::chrono::hours(1)};
  // Most counters held; beyond it the one with the oldest failure goes.
  std::size_t maxEntries = 4096;
};

// Safe to use from several threads.
class LoginThrottle {
public:
  LoginThrottle(const Clock &clock, ThrottlePolicy policy);

  // Whole seconds (rounded up) until a login for account from address may
  // be tried again; 0 when it may be tried now. The longer of the account's
  // and the address's waits.
  [[nodiscard]] std::chrono::seconds RetryAfter(std::string_view account,
                                                std::string_view address);

  // A failed login: both counters go up, and from the freeFailures-th
  // consecutive failure on both wait firstDelay * 2^(count - freeFailures),
  // at most maxDelay.
  void RecordFailure(std::string_view account, std::string_view address);

  // A successful login: both counters start from zero.
  void RecordSuccess(std::string_view account, std::string_view address);

private:
  struct Entry {
    unsigned failures = 0;
    Clock::TimePoint lastFailure;
    Clock::TimePoint blockedUntil;
  };
  void ForgetOldLocked(Clock::TimePoint now);
  void CountFailureLocked(const std::string &key, Clock::TimePoint now);

  const Clock &mClock;
  const ThrottlePolicy mPolicy;
  std::mutex mMutex;
  std::map<std::string, Entry, std::less<>> mEntries;
};

} // namespace zark::host

#endif
