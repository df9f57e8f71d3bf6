#include "login_throttle.h"

#include <arpa/inet.h>

#include <algorithm>
#include <array>
#include <cstring>

namespace zark::host {
namespace {

std::string AccountKey(std::string_view account) {
  return "account " + std::string(account);
}

std::string AddressKey(std::string_view address) {
  return "address " + ThrottleAddressKey(address);
}

} // namespace

std::string ThrottleAddressKey(std::string_view address) {
  std::string text(address);
  std::array<unsigned char, 16> bytes{};
  if (text.find(':') == std::string::npos ||
      inet_pton(AF_INET6, text.c_str(), bytes.data()) != 1) {
    return text;
  }
  static constexpr unsigned char kMappedPrefix[12] = {0, 0, 0, 0, 0,    0,
                                                      0, 0, 0, 0, 0xff, 0xff};
  char printed[INET6_ADDRSTRLEN] = {};
  if (std::memcmp(bytes.data(), kMappedPrefix, sizeof kMappedPrefix) == 0) {
    if (inet_ntop(AF_INET, bytes.data() + 12, printed, sizeof printed) ==
        nullptr) {
      return text;
    }
    return printed;
  }
  std::fill(bytes.begin() + 8, bytes.end(), 0);
  if (inet_ntop(AF_INET6, bytes.data(), printed, sizeof printed) == nullptr) {
    return text;
  }
  return std::string(printed) + "/64";
}

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

Clock::TimePoint::duration
LoginThrottle::WaitLocked(const std::string &accountKey,
                          const std::string &addressKey,
                          Clock::TimePoint now) const {
  Clock::TimePoint::duration wait{0};
  auto address = mEntries.find(addressKey);
  if (address == mEntries.end()) {
    // A clean address: the account's ceiling does not apply to it.
    return wait;
  }
  if (address->second.blockedUntil > now) {
    wait = address->second.blockedUntil - now;
  }
  auto account = mEntries.find(accountKey);
  if (address->second.failures > 0 && account != mEntries.end() &&
      account->second.blockedUntil > now) {
    wait = std::max(wait, account->second.blockedUntil - now);
  }
  return wait;
}

std::chrono::seconds LoginThrottle::RetryAfter(std::string_view account,
                                               std::string_view address) {
  std::lock_guard lock(mMutex);
  return std::chrono::ceil<std::chrono::seconds>(
      WaitLocked(AccountKey(account), AddressKey(address), mClock.Now()));
}

std::chrono::seconds LoginThrottle::Claim(std::string_view account,
                                          std::string_view address) {
  const std::string accountKey = AccountKey(account);
  const std::string addressKey = AddressKey(address);
  std::unique_lock lock(mMutex);
  // The wait is on the real clock: it bounds a thread, not a backoff.
  if (!mTurnEnded.wait_for(lock, kTurnWait,
                           [&] { return mUnderWay.count(addressKey) == 0; })) {
    return std::chrono::seconds(1);
  }
  const Clock::TimePoint now = mClock.Now();
  ForgetOldLocked(now);
  Clock::TimePoint::duration wait = WaitLocked(accountKey, addressKey, now);
  if (wait.count() > 0) {
    return std::max(std::chrono::seconds(1),
                    std::chrono::ceil<std::chrono::seconds>(wait));
  }
  CountFailureLocked(accountKey, now);
  CountFailureLocked(addressKey, now);
  mUnderWay.insert(addressKey);
  return std::chrono::seconds(0);
}

void LoginThrottle::Release(std::string_view address) {
  const std::string addressKey = AddressKey(address);
  {
    std::lock_guard lock(mMutex);
    mUnderWay.erase(addressKey);
  }
  mTurnEnded.notify_all();
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
  const std::string accountKey = AccountKey(account);
  const std::string addressKey = AddressKey(address);
  std::lock_guard lock(mMutex);
  const Clock::TimePoint now = mClock.Now();
  ForgetOldLocked(now);
  CountFailureLocked(accountKey, now);
  CountFailureLocked(addressKey, now);
}

void LoginThrottle::RecordSuccess(std::string_view account,
                                  std::string_view address) {
  const std::string accountKey = AccountKey(account);
  const std::string addressKey = AddressKey(address);
  std::lock_guard lock(mMutex);
  mEntries.erase(accountKey);
  mEntries.erase(addressKey);
}

} // namespace zark::host
