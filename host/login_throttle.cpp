#include "login_throttle.h"

#include <algorithm>

namespace zark::host {
namespace {

std::string AccountKey(std::string_view account) {
  return "account " + std::string(account);
}

std::string AddressKey(std::string_view address) {
  return "address " + std::string(address);
}

} // namespace

LoginThrottle::LoginThrottle(const Clock &clock, ThrottlePolicy policy)
    : mClock(clock), mPolicy(policy) {}

void LoginThrottle::ForgetOldLocked(Clock::TimePoint now) {
  for (auto it = mEntries.begin(); it != mEntries.end();) {
    if (now - it->second.lastFailure >= mPolicy.forgetAfter &&
        now >= it->second.blockedUntil) {
      it = mEntries.erase(it);
    } else {
      ++it;
    }
  }
}

std::chrono::seconds LoginThrottle::RetryAfter(std::string_view account,
                                               std::string_view address) {
  std::lock_guard lock(mMutex);
  const Clock::TimePoint now = mClock.Now();
  Clock::TimePoint::duration wait{0};
  for (const std::string &key : {AccountKey(account), AddressKey(address)}) {
    auto it = mEntries.find(key);
    if (it != mEntries.end() && it->second.blockedUntil > now) {
      wait = std::max(wait, it->second.blockedUntil - now);
    }
  }
  return std::chrono::ceil<std::chrono::seconds>(wait);
}

void LoginThrottle::CountFailureLocked(const std::string &key,
                                       Clock::TimePoint now) {
  auto it = mEntries.find(key);
  if (it == mEntries.end()) {
    if (mEntries.size() >= mPolicy.maxEntries) {
      auto oldest = std::min_element(
          mEntries.begin(), mEntries.end(), [](const auto &a, const auto &b) {
            return a.second.lastFailure < b.second.lastFailure;
          });
      mEntries.erase(oldest);
    }
    it = mEntries.emplace(key, Entry{}).first;
  }
  Entry &entry = it->second;
  if (entry.failures < 64) {
    ++entry.failures;
  }
  entry.lastFailure = now;
  if (entry.failures >= mPolicy.freeFailures) {
    unsigned doublings = entry.failures - mPolicy.freeFailures;
    std::chrono::seconds delay = mPolicy.maxDelay;
    if (doublings < 31) {
      delay = std::min<std::chrono::seconds>(
          mPolicy.maxDelay, mPolicy.firstDelay * (1LL << doublings));
    }
    entry.blockedUntil = now + delay;
  }
}

void LoginThrottle::RecordFailure(std::string_view account,
                                  std::string_view address) {
  std::lock_guard lock(mMutex);
  const Clock::TimePoint now = mClock.Now();
  ForgetOldLocked(now);
  CountFailureLocked(AccountKey(account), now);
  CountFailureLocked(AddressKey(address), now);
}

void LoginThrottle::RecordSuccess(std::string_view account,
                                  std::string_view address) {
  std::lock_guard lock(mMutex);
  mEntries.erase(AccountKey(account));
  mEntries.erase(AddressKey(address));
}

} // namespace zark::host
