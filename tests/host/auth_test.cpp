// Authentication without sockets: login and its answer, the session and
// token every call needs, expiry, administrators only, slowed-down
// guessing, logout, and secrets kept out of the log.
#include "hermetic.h"
#include "host_test_support.h"
#include "syslog_capture.h"

#include <sys/stat.h>
#include <syslog.h>

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

namespace zark::host {
namespace {

using namespace std::chrono_literals;
using test::Browser;
using test::FormEncode;

class HostAuth : public test::HostFixture {
protected:
  static int Code(const Json::Value &answer) {
    EXPECT_FALSE(answer["success"].asBool()) << answer;
    return answer["error"]["code"].asInt();
  }
  WebAnswer TryLogin(const std::string &account, const std::string &password) {
    return Post(Endpoint::Auth, "method=login&account=" + FormEncode(account) +
                                    "&passwd=" + FormEncode(password));
  }
  static std::string Header(const WebAnswer &answer, const std::string &name) {
    for (const auto &[key, value] : answer.headers) {
      if (key == name) {
        return value;
      }
    }
    return "";
  }
};

// Every row of the module, an unknown API, and a broken call.
const char *const kCalls[] = {
    "api=Test.Echo&version=1&method=echo",
    "api=Test.Echo&version=2&method=echo",
    "api=Test.Echo&version=1&method=empty",
    "api=Test.Echo&version=1&method=fail",
    "api=Test.Echo&version=1&method=fail_bare",
    "api=Test.Echo&version=1&method=silent",
    "api=Test.Echo&version=1&method=throw",
    "api=Test.Echo&version=1&method=throw_int",
    "api=Test.Task&version=1&method=start",
    "api=Test.Task&version=1&method=status&task_id=x",
    "api=Test.Nope&version=1&method=echo",
    "version=1",
};

TEST_F(HostAuth, LoginAnswersTokenAndAccountAndSetsTheCookie) {
  WebAnswer answer = TryLogin("admin", test::kAdmin.password);
  ASSERT_TRUE(answer.body["success"].asBool()) << answer.body;
  const Json::Value &data = answer.body["data"];
  EXPECT_EQ(data.size(), 2u);
  EXPECT_EQ(data["account"].asString(), "admin");
  const std::string token = data["token"].asString();
  EXPECT_EQ(token.size(), 32u);
  EXPECT_EQ(token.find_first_not_of("0123456789abcdef"), std::string::npos);
  const std::string cookie = Header(answer, "Set-Cookie");
  const std::string id = test::CookieId(cookie);
  EXPECT_EQ(id.size(), 32u);
  EXPECT_NE(id, token);
  EXPECT_EQ(cookie, "id=" + id + "; Path=/; HttpOnly; SameSite=Strict");
}

TEST_F(HostAuth, SecureCookieOption) {
  RequestHandler secure(mModules, mSessions, mLogins, RequestLimits{}, true);
  std::string body =
      "method=login&account=admin&passwd=" + FormEncode(test::kAdmin.password);
  WebRequest request;
  request.endpoint = Endpoint::Auth;
  request.isPost = true;
  request.body = body;
  request.contentType = "application/x-www-form-urlencoded";
  request.clientAddress = "127.0.0.1";
  WebAnswer answer = secure.Handle(request);
  EXPECT_NE(Header(answer, "Set-Cookie").find("; Secure"), std::string::npos);
}

TEST_F(HostAuth, EveryCallWithoutSessionIs106) {
  for (const char *fields : kCalls) {
    EXPECT_EQ(Code(Post(Endpoint::Entry, fields).body), 106) << fields;
    EXPECT_EQ(Code(Get(Endpoint::Entry, fields).body), 106) << fields;
  }
  EXPECT_EQ(Code(Get(Endpoint::Query, "").body), 106);
  Browser unknown{"id=00000000000000000000000000000000",
                  "00000000000000000000000000000000", ""};
  EXPECT_EQ(Code(Post(Endpoint::Entry, kCalls[0], &unknown).body), 106);
}

TEST_F(HostAuth, EveryCallWithoutTheRightTokenIs107) {
  Browser admin = Login(test::kAdmin);
  Browser other = Login(test::kAdmin);
  Browser noToken = admin;
  noToken.token.clear();
  Browser wrongToken = admin;
  wrongToken.token = other.token;
  for (const char *fields : kCalls) {
    EXPECT_EQ(Code(Post(Endpoint::Entry, fields, &wrongToken).body), 107)
        << fields;
    EXPECT_EQ(Code(Post(Endpoint::Entry, fields, &noToken).body), 107)
        << fields;
  }
  // No header at all.
  WebRequest request;
  request.endpoint = Endpoint::Entry;
  request.query = kCalls[0];
  request.cookies = admin.cookie;
  EXPECT_EQ(Code(mHandler.Handle(request).body), 107);
  EXPECT_EQ(Code(Get(Endpoint::Query, "", &wrongToken).body), 107);
  // The session itself is still good.
  EXPECT_TRUE(Call(admin, kCalls[0])["success"].asBool());
}

TEST_F(HostAuth, IdleSessionExpires) {
  Browser admin = Login(test::kAdmin);
  mClock.Advance(29min);
  EXPECT_TRUE(Call(admin, kCalls[0])["success"].asBool());
  mClock.Advance(30min);
  EXPECT_EQ(Code(Call(admin, kCalls[0])), 106);
}

TEST_F(HostAuth, TinyIdleTimeExpiresAtOnce) {
  SessionPolicy tiny;
  tiny.idleTimeout = 1s;
  SessionStore sessions(mClock, tiny);
  LoginService logins(test::kAccountsFile, sessions, mThrottle);
  RequestHandler handler(mModules, sessions, logins, RequestLimits{}, false);
  LoginOutcome outcome =
      logins.Login("admin", test::kAdmin.password, "127.0.0.1");
  ASSERT_EQ(outcome.result, LoginOutcome::Result::Ok);
  std::string cookie = "id=" + outcome.session.id;
  WebRequest request;
  request.endpoint = Endpoint::Entry;
  request.query = kCalls[0];
  request.cookies = cookie;
  request.token = outcome.session.token;
  EXPECT_TRUE(handler.Handle(request).body["success"].asBool());
  mClock.Advance(1s);
  EXPECT_EQ(Code(handler.Handle(request).body), 106);
}

TEST_F(HostAuth, SessionEndsAfterTwelveHoursInAnyCase) {
  Browser admin = Login(test::kAdmin);
  for (int i = 0; i < 24; ++i) {
    mClock.Advance(29min);
    ASSERT_TRUE(Call(admin, kCalls[0])["success"].asBool()) << i;
  }
  mClock.Advance(24min); // 12 h since the login
  EXPECT_EQ(Code(Call(admin, kCalls[0])), 106);
}

TEST_F(HostAuth, NonAdministratorGets105ForModuleMethods) {
  Browser viewer = Login(test::kViewer);
  for (const char *fields : kCalls) {
    Json::Value answer = Call(viewer, fields);
    EXPECT_EQ(Code(answer), 105) << fields;
    EXPECT_EQ(answer["error"]["errors"]["reason"].asString(), "admin_only");
  }
  // The list of what is served is open to every logged-in account.
  EXPECT_TRUE(Get(Endpoint::Query, "", &viewer).body["success"].asBool());
}

TEST_F(HostAuth, WrongPasswordAndUnknownAccountAnswerAlike) {
  WebAnswer wrong = TryLogin("admin", "not-it");
  EXPECT_EQ(Code(wrong.body), 105);
  EXPECT_EQ(wrong.body["error"]["errors"]["reason"].asString(),
            "bad_credentials");
  EXPECT_TRUE(Header(wrong, "Set-Cookie").empty());
  WebAnswer unknown = TryLogin("nobody", "not-it");
  EXPECT_EQ(unknown.body, wrong.body);
  EXPECT_EQ(mSessions.Count(), 0u);
}

TEST_F(HostAuth, RepeatedFailuresAreSlowedDown) {
  for (int i = 0; i < 3; ++i) {
    EXPECT_EQ(TryLogin("admin", "guess" + std::to_string(i))
                  .body["error"]["errors"]["reason"]
                  .asString(),
              "bad_credentials");
  }
  // Even the right password waits now.
  WebAnswer throttled = TryLogin("admin", test::kAdmin.password);
  EXPECT_EQ(Code(throttled.body), 105);
  EXPECT_EQ(throttled.body["error"]["errors"]["reason"].asString(),
            "throttled");
  EXPECT_EQ(throttled.body["error"]["errors"]["retry_after"].asInt(), 2);
  EXPECT_EQ(Header(throttled, "Retry-After"), "2");
  mClock.Advance(2s);
  EXPECT_TRUE(
      TryLogin("admin", test::kAdmin.password).body["success"].asBool());
}

TEST_F(HostAuth, GuessesFromOneAddressSlowEveryAccount) {
  TryLogin("a", "x");
  TryLogin("b", "x");
  TryLogin("c", "x");
  EXPECT_EQ(TryLogin("viewer", test::kViewer.password)
                .body["error"]["errors"]["reason"]
                .asString(),
            "throttled");
  mClientAddress = "127.0.0.2";
  EXPECT_TRUE(
      TryLogin("viewer", test::kViewer.password).body["success"].asBool());
}

TEST_F(HostAuth, StrangerRetryingEachWaitCannotKeepTheAdministratorOut) {
  for (int round = 0; round < 34; ++round) {
    LoginOutcome guess =
        mLogins.Login("admin", "guess" + std::to_string(round), "192.0.2.66");
    ASSERT_EQ(guess.result, LoginOutcome::Result::BadCredentials);
    LoginOutcome real =
        mLogins.Login("admin", test::kAdmin.password, "10.0.0.1");
    EXPECT_EQ(real.result, LoginOutcome::Result::Ok) << "round " << round;
    mClock.Advance(mThrottle.RetryAfter("admin", "192.0.2.66"));
  }
}

TEST_F(HostAuth, ConcurrentGuessesAtTheEndOfAWaitAreNotAllChecked) {
  for (int i = 0; i < 4; ++i) {
    (void)mLogins.Login("admin", "guess", "192.0.2.66");
  }
  mClock.Advance(mThrottle.RetryAfter("admin", "192.0.2.66"));
  std::atomic<int> checked{0};
  std::vector<std::thread> guessers;
  for (int i = 0; i < 8; ++i) {
    guessers.emplace_back([this, &checked, i] {
      LoginOutcome outcome =
          mLogins.Login("admin", "guess" + std::to_string(i), "192.0.2.66");
      if (outcome.result != LoginOutcome::Result::Throttled) {
        ++checked;
      }
    });
  }
  for (std::thread &guesser : guessers) {
    guesser.join();
  }
  EXPECT_EQ(checked.load(), 1);
}

TEST_F(HostAuth, OrdinaryLoginsDoNotLogTheAdministratorOut) {
  Browser admin = Login(test::kAdmin);
  for (int i = 0; i < 300; ++i) {
    mClock.Advance(1ms);
    ASSERT_TRUE(
        mLogins.Login("viewer", test::kViewer.password, "10.0.0.2").result ==
        LoginOutcome::Result::Ok);
  }
  EXPECT_TRUE(
      Call(admin, "api=Test.Echo&version=1&method=echo")["success"].asBool());
}

TEST_F(HostAuth, LoginMustBeAPostWithThePasswordInTheBody) {
  WebAnswer get = Get(Endpoint::Auth, "method=login&account=admin&passwd=" +
                                          FormEncode(test::kAdmin.password));
  EXPECT_EQ(Code(get.body), 101);
  EXPECT_EQ(get.body["error"]["errors"]["reason"].asString(), "post_required");
  WebRequest request;
  request.endpoint = Endpoint::Auth;
  request.isPost = true;
  std::string query = "passwd=" + FormEncode(test::kAdmin.password);
  request.query = query;
  request.body = "method=login&account=admin";
  request.contentType = "application/x-www-form-urlencoded";
  EXPECT_EQ(
      mHandler.Handle(request).body["error"]["errors"]["reason"].asString(),
      "post_required");
  EXPECT_EQ(mSessions.Count(), 0u);
}

TEST_F(HostAuth, LoginFieldsAreRequired) {
  EXPECT_EQ(Post(Endpoint::Auth, "method=login&passwd=x")
                .body["error"]["errors"]["field"]
                .asString(),
            "account");
  EXPECT_EQ(Post(Endpoint::Auth, "method=login&account=admin&passwd=")
                .body["error"]["errors"]["field"]
                .asString(),
            "passwd");
  EXPECT_EQ(Code(Post(Endpoint::Auth, "account=admin&passwd=x").body), 101);
  EXPECT_EQ(Code(Post(Endpoint::Auth, "method=whoami").body), 103);
}

TEST_F(HostAuth, PasswordIsNotReadAsJson) {
  test::WriteAccounts(test::kAccountsFile, {{"admin", "123", "admin"}});
  EXPECT_TRUE(TryLogin("admin", "123").body["success"].asBool());
}

TEST_F(HostAuth, LogoutEndsTheSessionAndClearsTheCookie) {
  Browser admin = Login(test::kAdmin);
  Browser second = Login(test::kAdmin);
  Browser wrong = admin;
  wrong.token = second.token;
  EXPECT_EQ(Code(Post(Endpoint::Auth, "method=logout", &wrong).body), 107);
  EXPECT_EQ(Code(Post(Endpoint::Auth, "method=logout").body), 106);

  WebAnswer logout = Post(Endpoint::Auth, "method=logout", &admin);
  EXPECT_TRUE(logout.body["success"].asBool());
  EXPECT_FALSE(logout.body.isMember("data"));
  EXPECT_EQ(Header(logout, "Set-Cookie"),
            "id=; Path=/; HttpOnly; SameSite=Strict; Max-Age=0");
  EXPECT_EQ(Code(Call(admin, kCalls[0])), 106);
  EXPECT_EQ(Code(Post(Endpoint::Auth, "method=logout", &admin).body), 106);
  // Other sessions of the same account stay.
  EXPECT_TRUE(Call(second, kCalls[0])["success"].asBool());
}

TEST_F(HostAuth, OpenAccountsFileRefusesEveryLogin) {
  ASSERT_EQ(chmod(test::kAccountsFile, 0644), 0);
  zark::test::ClearLogs();
  WebAnswer answer = TryLogin("admin", test::kAdmin.password);
  EXPECT_EQ(Code(answer.body), 100);
  EXPECT_TRUE(test::HasLogFrom(
      LOG_ERR, "host/account_file.cpp",
      std::string("accounts file ") + test::kAccountsFile +
          " can be read or written by group or others (mode 0644)"));
  EXPECT_EQ(mSessions.Count(), 0u);
}

TEST_F(HostAuth, LogNamesKnownAccountsButNeverSecrets) {
  zark::test::ClearLogs();
  TryLogin("admin", "wrong-Password-1");
  TryLogin("Secret-typed-as-name", "wrong-Password-2");
  Browser admin = Login(test::kAdmin);
  Browser viewer = Login(test::kViewer);
  Call(admin, "api=Test.Echo&version=1&method=throw&passwd=" +
                  FormEncode(test::kAdmin.password));
  Call(admin, "api=Test.Echo&version=1&method=silent");
  Post(Endpoint::Auth, "method=logout", &admin);
  mClock.Advance(31min);
  Call(viewer, kCalls[0]); // expires

  EXPECT_TRUE(test::HasLogFrom(LOG_NOTICE, "host/login_service.cpp",
                               "login of admin from 127.0.0.1 refused: "
                               "wrong password"));
  EXPECT_TRUE(test::HasLogFrom(LOG_NOTICE, "host/login_service.cpp",
                               "login from 127.0.0.1 refused: unknown "
                               "account"));
  EXPECT_TRUE(test::HasLogFrom(LOG_INFO, "host/login_service.cpp",
                               "login of admin (group admin) from 127.0.0.1"));
  EXPECT_TRUE(test::HasLogFrom(LOG_INFO, "host/request_handler.cpp",
                               "logout of admin"));
  EXPECT_TRUE(test::HasLogFrom(LOG_INFO, "host/session_store.cpp",
                               "session of viewer expired"));
  const std::string secrets[] = {
      "wrong-Password-1",    "wrong-Password-2",     "Secret-typed-as-name",
      test::kAdmin.password, test::kViewer.password, admin.sessionId,
      admin.token,           viewer.sessionId,       viewer.token,
  };
  for (const std::string &line : zark::test::CapturedMessages()) {
    for (const std::string &secret : secrets) {
      EXPECT_EQ(line.find(secret), std::string::npos)
          << "\"" << line << "\" holds a secret";
    }
  }
}

} // namespace
} // namespace zark::host
