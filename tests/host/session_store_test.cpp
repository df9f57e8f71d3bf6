// Sessions: ids and tokens, the checks of a call, idle and absolute expiry,
// logout and the bound on their number.
#include "fake_clock.h"
#include "session_store.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <syslog.h>

namespace zark::host {
namespace {

using namespace std::chrono_literals;
using test::FakeClock;

bool IsHex32(const std::string &text) {
  return text.size() == 32 &&
         text.find_first_not_of("0123456789abcdef") == std::string::npos;
}

class HostSession : public ::testing::Test {
protected:
  HostSession() : mSessions(mClock, Policy()) {}
  static SessionPolicy Policy() {
    SessionPolicy policy;
    policy.idleTimeout = 30min;
    policy.maxLifetime = 12h;
    policy.maxSessions = 3;
    return policy;
  }
  NewSession Open(const std::string &account, const std::string &group) {
    std::optional<NewSession> session = mSessions.Create({account, group});
    EXPECT_TRUE(session.has_value());
    return session.value_or(NewSession{});
  }
  SessionCheck Check(const NewSession &session) {
    SessionOwner owner;
    return mSessions.Check(session.id, session.token, owner);
  }

  FakeClock mClock;
  SessionStore mSessions;
};

TEST_F(HostSession, IdAndTokenAreDistinct128BitHex) {
  NewSession a = Open("admin", "admin");
  NewSession b = Open("admin", "admin");
  EXPECT_TRUE(IsHex32(a.id));
  EXPECT_TRUE(IsHex32(a.token));
  EXPECT_NE(a.id, a.token);
  EXPECT_NE(a.id, b.id);
  EXPECT_NE(a.token, b.token);
}

TEST_F(HostSession, RightTokenGivesTheOwner) {
  NewSession session = Open("viewer", "users");
  SessionOwner owner;
  EXPECT_EQ(mSessions.Check(session.id, session.token, owner),
            SessionCheck::Ok);
  EXPECT_EQ(owner.account, "viewer");
  EXPECT_EQ(owner.group, "users");
}

TEST_F(HostSession, MissingOrWrongTokenIsBadToken) {
  NewSession session = Open("admin", "admin");
  NewSession other = Open("admin", "admin");
  SessionOwner owner;
  EXPECT_EQ(mSessions.Check(session.id, std::nullopt, owner),
            SessionCheck::BadToken);
  EXPECT_EQ(mSessions.Check(session.id, "", owner), SessionCheck::BadToken);
  EXPECT_EQ(mSessions.Check(session.id, other.token, owner),
            SessionCheck::BadToken);
  std::string almost = session.token;
  almost.back() = almost.back() == '0' ? '1' : '0';
  EXPECT_EQ(mSessions.Check(session.id, almost, owner), SessionCheck::BadToken);
  // A wrong token does not end the session.
  EXPECT_EQ(Check(session), SessionCheck::Ok);
}

TEST_F(HostSession, UnknownOrEmptyIdIsNoSession) {
  NewSession session = Open("admin", "admin");
  SessionOwner owner;
  EXPECT_EQ(mSessions.Check("", session.token, owner), SessionCheck::NoSession);
  EXPECT_EQ(mSessions.Check(session.token, session.token, owner),
            SessionCheck::NoSession);
}

TEST_F(HostSession, IdleSessionExpires) {
  NewSession session = Open("admin", "admin");
  mClock.Advance(30min - 1s);
  EXPECT_EQ(Check(session), SessionCheck::Ok);
  mClock.Advance(30min - 1s);
  EXPECT_EQ(Check(session), SessionCheck::Ok);
  zark::test::ClearLogs();
  mClock.Advance(30min);
  EXPECT_EQ(Check(session), SessionCheck::NoSession);
  EXPECT_EQ(mSessions.Count(), 0u);
  EXPECT_TRUE(zark::test::HasLogContaining("session of admin expired"));
}

TEST_F(HostSession, UsedSessionEndsAtItsMaximumLifetime) {
  NewSession session = Open("admin", "admin");
  for (int i = 0; i < 47; ++i) {
    mClock.Advance(15min);
    ASSERT_EQ(Check(session), SessionCheck::Ok) << "after " << i + 1;
  }
  mClock.Advance(15min); // 12 h after the login
  EXPECT_EQ(Check(session), SessionCheck::NoSession);
}

TEST_F(HostSession, BadTokenDoesNotKeepASessionAlive) {
  NewSession session = Open("admin", "admin");
  SessionOwner owner;
  mClock.Advance(20min);
  EXPECT_EQ(mSessions.Check(session.id, "wrong", owner),
            SessionCheck::BadToken);
  mClock.Advance(20min);
  EXPECT_EQ(Check(session), SessionCheck::NoSession);
}

TEST_F(HostSession, DropEndsTheSession) {
  NewSession session = Open("admin", "admin");
  EXPECT_TRUE(mSessions.Drop(session.id));
  EXPECT_EQ(Check(session), SessionCheck::NoSession);
  EXPECT_FALSE(mSessions.Drop(session.id));
}

TEST_F(HostSession, LeastRecentlyUsedGoesBeyondTheBound) {
  NewSession first = Open("a", "admin");
  mClock.Advance(1s);
  NewSession second = Open("b", "admin");
  mClock.Advance(1s);
  NewSession third = Open("c", "admin");
  mClock.Advance(1s);
  EXPECT_EQ(Check(first), SessionCheck::Ok); // now second is the oldest
  NewSession fourth = Open("d", "admin");
  EXPECT_EQ(mSessions.Count(), 3u);
  EXPECT_EQ(Check(second), SessionCheck::NoSession);
  EXPECT_EQ(Check(first), SessionCheck::Ok);
  EXPECT_EQ(Check(third), SessionCheck::Ok);
  EXPECT_EQ(Check(fourth), SessionCheck::Ok);
}

TEST_F(HostSession, OrdinaryLoginsNeverPushOutAnAdministrator) {
  NewSession admin = Open("admin", "admin");
  mClock.Advance(1s);
  NewSession viewer = Open("viewer", "users");
  // Many logins of an ordinary account, each newer than the administrator's
  // session: they push out each other only.
  for (int i = 0; i < 256; ++i) {
    mClock.Advance(1s);
    Open("viewer", "users");
  }
  EXPECT_EQ(mSessions.Count(), 3u);
  EXPECT_EQ(Check(admin), SessionCheck::Ok);
  EXPECT_EQ(Check(viewer), SessionCheck::NoSession);
}

TEST_F(HostSession, OrdinaryLoginIsRefusedWhenOnlyAdministratorsHold) {
  NewSession first = Open("a", "admin");
  NewSession second = Open("b", "admin");
  NewSession third = Open("c", "admin");
  EXPECT_FALSE(mSessions.Create({"viewer", "users"}).has_value());
  EXPECT_EQ(Check(first), SessionCheck::Ok);
  EXPECT_EQ(Check(second), SessionCheck::Ok);
  EXPECT_EQ(Check(third), SessionCheck::Ok);
  // An administrator's login still gets in, pushing out the oldest.
  mClock.Advance(1s);
  EXPECT_EQ(Check(second), SessionCheck::Ok);
  EXPECT_EQ(Check(third), SessionCheck::Ok);
  Open("d", "admin");
  EXPECT_EQ(Check(first), SessionCheck::NoSession);
}

TEST_F(HostSession, LogLinesNameTheAccountOnly) {
  zark::test::ClearLogs();
  NewSession session = Open("admin", "admin");
  mClock.Advance(31min);
  EXPECT_EQ(Check(session), SessionCheck::NoSession);
  ASSERT_FALSE(zark::test::CapturedLogs().empty());
  for (const std::string &line : zark::test::CapturedMessages()) {
    EXPECT_EQ(line.find(session.id), std::string::npos) << line;
    EXPECT_EQ(line.find(session.token), std::string::npos) << line;
  }
}

} // namespace
} // namespace zark::host
