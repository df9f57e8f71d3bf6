// Slows down password guessing without handing a stranger a way to lock the
// administrator out.
//
// Failed logins are counted per client address (an IPv6 address counts as
// its /64 prefix, which one attacker holds whole) and per account name.
// The address's count backs that address off: after a few failures, every
// login from it waits, doubling with each further failure. The account's
// count is a ceiling on top: while it is over its few free failures, an
// address that already has a failure on record waits for the account too.
// An address with no failure on record always gets its password checked, so
// the right password from a clean address logs in whatever strangers did to
// the account.
//
// An attempt is claimed (counted as a failure) in the same step as the
// check that lets it through, before the password is checked, and the
// attempts of one address are checked one at a time: concurrent guesses
// cannot all slip in at the end of a wait, and concurrent right passwords
// from one address (several tabs, one office behind NAT) are served in
// turn instead of being refused.
#ifndef ZARK_HOST_LOGIN_THROTTLE_H
#define ZARK_HOST_LOGIN_THROTTLE_H

#include "clock.h"

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <map>
#include <mutex>
#include <set>
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
  // be tried again; 0 when it may be tried now: the address's own wait, or,
  // when the address has a failure on record, the longer of it and the
  // account's wait.
  [[nodiscard]] std::chrono::seconds RetryAfter(std::string_view account,
                                                std::string_view address);

  // One step: 0 when the attempt may go on, and then it is already counted
  // as a failure of both (RecordSuccess undoes that) and the address's
  // attempt is under way until Release; otherwise the wait RetryAfter
  // would give, and nothing is counted. Waits, at most kTurnWait, while
  // another attempt of the same address is under way (then 1 s to wait).
  [[nodiscard]] std::chrono::seconds Claim(std::string_view account,
                                           std::string_view address);

  // Ends the attempt of address that Claim let through.
  void Release(std::string_view address);

  // How long Claim waits for the address's attempt under way.
  static constexpr std::chrono::seconds kTurnWait{15};

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
  [[nodiscard]] Clock::TimePoint::duration
  WaitLocked(const std::string &accountKey, const std::string &addressKey,
             Clock::TimePoint now) const;

  const Clock &mClock;
  const ThrottlePolicy mPolicy;
  std::mutex mMutex;
  std::condition_variable mTurnEnded;
  std::map<std::string, Entry, std::less<>> mEntries;
  // Address keys with an attempt under way.
  std::set<std::string, std::less<>> mUnderWay;
};

// The key an address is counted under: an IPv4 address as it is (also when
// written as an IPv4-mapped IPv6 address), an IPv6 address as its /64
// prefix ("2001:db8:1:2::/64"), anything else as it is.
[[nodiscard]] std::string ThrottleAddressKey(std::string_view address);

} // namespace zark::host

#endif
