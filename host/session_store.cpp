#include "session_store.h"

#include "account_file.h"
#include "host_log.h"
#include "random_token.h"

#include <algorithm>

namespace zark::host {

SessionStore::SessionStore(const Clock &clock, SessionPolicy policy)
    : mClock(clock), mPolicy(policy) {}

bool SessionStore::IsExpired(const Session &session,
                             Clock::TimePoint now) const {
  return now - session.lastUsed >= mPolicy.idleTimeout ||
         now - session.created >= mPolicy.maxLifetime;
}

void SessionStore::DropExpiredLocked(Clock::TimePoint now) {
  for (auto it = mSessions.begin(); it != mSessions.end();) {
    if (IsExpired(it->second, now)) {
      HOST_LOG(LOG_INFO, "session of %s expired",
               it->second.owner.account.c_str());
      it = mSessions.erase(it);
    } else {
      ++it;
    }
  }
}

std::optional<NewSession> SessionStore::Create(const SessionOwner &owner) {
  std::optional<std::string> token = RandomHex128();
  if (!token) {
    HOST_LOG(LOG_ERR, "no session for %s: no random token",
             owner.account.c_str());
    return std::nullopt;
  }
  std::lock_guard lock(mMutex);
  const Clock::TimePoint now = mClock.Now();
  DropExpiredLocked(now);
  if (mSessions.size() >= mPolicy.maxSessions && !mSessions.empty()) {
    // The least recently used session that this login may push out: an
    // administrator's login any session, another account's login only the
    // sessions of accounts outside the group "admin", so that logins of an
    // ordinary account cannot log an administrator out.
    const bool mayDropAdmins = owner.group == kAdminGroup;
    auto oldest = mSessions.end();
    for (auto it = mSessions.begin(); it != mSessions.end(); ++it) {
      if (!mayDropAdmins && it->second.owner.group == kAdminGroup) {
        continue;
      }
      if (oldest == mSessions.end() ||
          it->second.lastUsed < oldest->second.lastUsed) {
        oldest = it;
      }
    }
    if (oldest == mSessions.end()) {
      HOST_LOG(LOG_NOTICE,
               "no session for %s: %zu sessions held, all of administrators",
               owner.account.c_str(), mSessions.size());
      return std::nullopt;
    }
    HOST_LOG(LOG_NOTICE, "session of %s dropped: %zu sessions held",
             oldest->second.owner.account.c_str(), mSessions.size());
    mSessions.erase(oldest);
  }
  // A repeated 128-bit id is not expected; a few draws rule it out.
  for (int draw = 0; draw < 4; ++draw) {
    std::optional<std::string> id = RandomHex128();
    if (!id) {
      break;
    }
    if (mSessions.contains(*id)) {
      continue;
    }
    mSessions.emplace(*id, Session{owner, *token, now, now});
    return NewSession{std::move(*id), std::move(*token)};
  }
  HOST_LOG(LOG_ERR, "no session for %s: no random id", owner.account.c_str());
  return std::nullopt;
}

SessionCheck SessionStore::Check(std::string_view id,
                                 std::optional<std::string_view> token,
                                 SessionOwner &owner) {
  if (id.empty()) {
    return SessionCheck::NoSession;
  }
  std::lock_guard lock(mMutex);
  auto it = mSessions.find(std::string(id));
  if (it == mSessions.end()) {
    return SessionCheck::NoSession;
  }
  const Clock::TimePoint now = mClock.Now();
  if (IsExpired(it->second, now)) {
    HOST_LOG(LOG_INFO, "session of %s expired",
             it->second.owner.account.c_str());
    mSessions.erase(it);
    return SessionCheck::NoSession;
  }
  if (!token || !ConstantTimeEquals(*token, it->second.token)) {
    return SessionCheck::BadToken;
  }
  it->second.lastUsed = now;
  owner = it->second.owner;
  return SessionCheck::Ok;
}

bool SessionStore::Drop(std::string_view id) {
  std::lock_guard lock(mMutex);
  return mSessions.erase(std::string(id)) > 0;
}

std::size_t SessionStore::Count() const {
  std::lock_guard lock(mMutex);
  return mSessions.size();
}

} // namespace zark::host
