// Logged-in sessions: a random id (the browser's cookie) and a random token
// (sent back in a header with every call), both 128-bit hex, kept in memory
// only. A session ends at logout, after an idle time, after an absolute
// lifetime, or when the host stops.
#ifndef ZARK_HOST_SESSION_STORE_H
#define ZARK_HOST_SESSION_STORE_H

#include "clock.h"

#include <chrono>
#include <cstddef>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>

namespace zark::host {

struct SessionPolicy {
  std::chrono::milliseconds idleTimeout = std::chrono::minutes(30);
  std::chrono::milliseconds maxLifetime = std::chrono::hours(12);
  // Most sessions held; beyond it the least recently used one is dropped.
  std::size_t maxSessions = 256;
};

// The secrets of a new session, for the login answer only.
struct NewSession {
  std::string id;
  std::string token;
};

// Who a session belongs to.
struct SessionOwner {
  std::string account;
  std::string group;
};

enum class SessionCheck {
  Ok,        // owner is set; the session's idle time starts again
  NoSession, // no id, unknown id, or the session expired (and is gone)
  BadToken,  // the session exists but the token is missing or wrong
};

// Safe to use from several threads.
class SessionStore {
public:
  SessionStore(const Clock &clock, SessionPolicy policy);

  // Opens a session for owner. When maxSessions are held, the least
  // recently used one goes; a login outside the group "admin" pushes out
  // only sessions outside it too. nullopt (logged) when no random id or
  // token could be made, or when every held session is an administrator's
  // and owner is not one.
  [[nodiscard]] std::optional<NewSession> Create(const SessionOwner &owner);

  // Checks a call's session id and token. The token is compared in
  // constant time. An expired session is removed (logged at info level).
  [[nodiscard]] SessionCheck Check(std::string_view id,
                                   std::optional<std::string_view> token,
                                   SessionOwner &owner);

  // Ends a session. False when there is no such session.
  bool Drop(std::string_view id);

  [[nodiscard]] std::size_t Count() const;

private:
  struct Session {
    SessionOwner owner;
    std::string token;
    Clock::TimePoint created;
    Clock::TimePoint lastUsed;
  };
  bool IsExpired(const Session &session, Clock::TimePoint now) const;
  void DropExpiredLocked(Clock::TimePoint now);

  const Clock &mClock;
  const SessionPolicy mPolicy;
  mutable std::mutex mMutex;
  std::unordered_map<std::string, Session> mSessions;
};

} // namespace zark::host

#endif
