// "zark-webapid passwd": the password from the input, the file it writes,
// and a login that the new file accepts.
#include "account_file.h"
#include "fake_clock.h"
#include "hermetic.h"
#include "host_test_support.h"
#include "login_service.h"
#include "passwd_command.h"
#include "password_hash.h"
#include "syslog_capture.h"

#include <sys/stat.h>
#include <syslog.h>

#include <gtest/gtest.h>

#include <sstream>

namespace zark::host {
namespace {

namespace fs = std::filesystem;

const fs::path kFile = "/tmp/passwd/webapid.accounts";

struct PasswdRun {
  int status = -1;
  std::string err;
  std::string prompts;
};

PasswdRun Passwd(std::vector<std::string> args, const std::string &input,
                 bool terminal = false) {
  std::istringstream in(input);
  std::ostringstream err;
  std::ostringstream prompts;
  // fd -1: echo cannot be turned off on it, and nothing else is touched.
  PasswordInput password{in, terminal, -1, &prompts};
  PasswdRun run;
  run.status = RunPasswdCommand(args, password, err);
  run.err = err.str();
  run.prompts = prompts.str();
  return run;
}

class HostPasswd : public ::testing::Test {
protected:
  void SetUp() override {
    zark::test::ResetFixedPaths();
    zark::test::ClearLogs();
    fs::create_directories(kFile.parent_path());
  }
  static std::optional<Account> Find(const std::string &user) {
    auto accounts = LoadAccounts(kFile);
    if (!accounts) {
      return std::nullopt;
    }
    for (const Account &account : *accounts) {
      if (account.user == user) {
        return account;
      }
    }
    return std::nullopt;
  }
};

TEST_F(HostPasswd, WritesA0600FileThatALoginAccepts) {
  PasswdRun run =
      Passwd({"admin", "--accounts", kFile.string()}, "S3cret pass\n");
  ASSERT_EQ(run.status, 0) << run.err;
  struct stat info {};
  ASSERT_EQ(stat(kFile.c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & 07777, 0600u);
  std::optional<Account> admin = Find("admin");
  ASSERT_TRUE(admin.has_value());
  EXPECT_EQ(admin->group, "admin");
  EXPECT_EQ(admin->hash.rfind("$y$", 0), 0u) << admin->hash;

  test::FakeClock clock;
  SessionStore sessions(clock, SessionPolicy{});
  LoginThrottle throttle(clock, ThrottlePolicy{});
  LoginService logins(kFile, sessions, throttle);
  LoginOutcome outcome = logins.Login("admin", "S3cret pass", "127.0.0.1");
  EXPECT_EQ(outcome.result, LoginOutcome::Result::Ok);
  EXPECT_EQ(outcome.owner.group, "admin");
  EXPECT_EQ(logins.Login("admin", "S3cret", "127.0.0.1").result,
            LoginOutcome::Result::BadCredentials);

  EXPECT_TRUE(test::HasLogFrom(LOG_NOTICE, "host/passwd_command.cpp",
                               "password of admin (group admin) set in " +
                                   kFile.string()));
  EXPECT_FALSE(zark::test::HasLogContaining("S3cret"));
}

TEST_F(HostPasswd, GroupOptionAndEqualsForms) {
  ASSERT_EQ(Passwd({"--accounts=" + kFile.string(), "viewer", "--group=users"},
                   "pw\n")
                .status,
            0);
  std::optional<Account> viewer = Find("viewer");
  ASSERT_TRUE(viewer.has_value());
  EXPECT_EQ(viewer->group, "users");
}

TEST_F(HostPasswd, NewPasswordReplacesTheOld) {
  ASSERT_EQ(Passwd({"admin", "--accounts", kFile.string()}, "first\n").status,
            0);
  ASSERT_EQ(Passwd({"admin", "--accounts", kFile.string()}, "second\n").status,
            0);
  auto accounts = LoadAccounts(kFile);
  ASSERT_TRUE(accounts.has_value());
  ASSERT_EQ(accounts->size(), 1u);
  EXPECT_FALSE(VerifyPassword("first", (*accounts)[0].hash));
  EXPECT_TRUE(VerifyPassword("second", (*accounts)[0].hash));
}

TEST_F(HostPasswd, LineEndIsNotPartOfThePassword) {
  ASSERT_EQ(Passwd({"admin", "--accounts", kFile.string()}, "pw\r\n").status,
            0);
  EXPECT_TRUE(VerifyPassword("pw", Find("admin")->hash));
  ASSERT_EQ(Passwd({"admin", "--accounts", kFile.string()}, "last").status, 0);
  EXPECT_TRUE(VerifyPassword("last", Find("admin")->hash));
}

TEST_F(HostPasswd, EmptyOrMissingPasswordChangesNothing) {
  PasswdRun empty = Passwd({"admin", "--accounts", kFile.string()}, "\n");
  EXPECT_EQ(empty.status, 1);
  EXPECT_NE(empty.err.find("nothing changed"), std::string::npos);
  PasswdRun none = Passwd({"admin", "--accounts", kFile.string()}, "");
  EXPECT_EQ(none.status, 1);
  EXPECT_NE(none.err.find("no password given"), std::string::npos);
  EXPECT_FALSE(fs::exists(kFile));
}

TEST_F(HostPasswd, TerminalAsksTwiceAndComparesTheAnswers) {
  PasswdRun same =
      Passwd({"admin", "--accounts", kFile.string()}, "pw\npw\n", true);
  EXPECT_EQ(same.status, 0) << same.err;
  EXPECT_EQ(same.prompts, "Password: \nPassword again: \n");
  PasswdRun differ =
      Passwd({"admin", "--accounts", kFile.string()}, "new\nnwe\n", true);
  EXPECT_EQ(differ.status, 1);
  EXPECT_NE(differ.err.find("the passwords differ"), std::string::npos);
  EXPECT_TRUE(VerifyPassword("pw", Find("admin")->hash));
}

TEST_F(HostPasswd, BadUsageIsStatus2) {
  const std::vector<std::vector<std::string>> cases = {
      {},
      {"--accounts", kFile.string()},
      {"bad:user", "--accounts", kFile.string()},
      {"admin", "--group", "bad group", "--accounts", kFile.string()},
      {"admin", "--accounts"},
      {"admin", "other", "--accounts", kFile.string()},
      {"admin", "--colour", "red"},
  };
  for (const auto &args : cases) {
    PasswdRun run = Passwd(args, "pw\n");
    EXPECT_EQ(run.status, 2) << ::testing::PrintToString(args);
    EXPECT_NE(run.err.find("usage: zark-webapid passwd USER"),
              std::string::npos);
  }
  EXPECT_FALSE(fs::exists(kFile));
}

TEST_F(HostPasswd, MissingFolderFailsWithStatus1) {
  PasswdRun run = Passwd({"admin", "--accounts", "/tmp/none/accounts"}, "pw\n");
  EXPECT_EQ(run.status, 1);
  EXPECT_NE(run.err.find("nothing changed"), std::string::npos);
  EXPECT_TRUE(test::HasLogFrom(LOG_ERR, "host/passwd_command.cpp",
                               "password of admin not set in "
                               "/tmp/none/accounts"));
}

} // namespace
} // namespace zark::host
