// Shared set-up of the hermetic host tests: module folders and accounts
// files under /tmp, and a whole host (registry, sessions, logins, request
// handler) on a clock the test moves.
#ifndef ZARK_TESTS_HOST_SUPPORT_H
#define ZARK_TESTS_HOST_SUPPORT_H

#include "fake_clock.h"
#include "login_service.h"
#include "login_throttle.h"
#include "module_registry.h"
#include "request_handler.h"
#include "session_store.h"

#include <gtest/gtest.h>
#include <sys/types.h>

#include <chrono>

#include <filesystem>
#include <initializer_list>
#include <string>
#include <vector>

namespace zark::host::test {

// The built test module "name.so" (tests/host/modules/name.cpp).
std::filesystem::path BuiltModule(const std::string &name);

// A fresh folder /tmp/host-modules/<folder> holding copies of the named
// test modules ("good_module", ...), and its path.
std::filesystem::path ModuleFolder(const std::string &folder,
                                   std::initializer_list<std::string> modules);

struct TestAccount {
  std::string user;
  std::string password;
  std::string group;
};

// A yescrypt hash of the lowest cost, so that tests stay quick.
std::string QuickHash(const std::string &password);

// Writes an accounts file with these accounts and mode.
void WriteAccounts(const std::filesystem::path &file,
                   const std::vector<TestAccount> &accounts,
                   unsigned mode = 0600);

// The accounts of most tests: admin/admin-secret (group admin) and
// viewer/viewer-secret (group users), in kAccountsFile.
inline const char *const kAccountsFile = "/tmp/host/webapid.accounts";
inline const TestAccount kAdmin{"admin", "Adm1n-secret!", "admin"};
inline const TestAccount kViewer{"viewer", "view3r-secret", "users"};
void WriteStandardAccounts();

// A session as a browser holds it.
struct Browser {
  std::string cookie; // "id=<session id>"
  std::string token;
  std::string sessionId;
};

// A host without sockets: the good module loaded, the standard accounts,
// a fake clock. Joins background tasks before the modules are unloaded.
class HostFixture : public ::testing::Test {
protected:
  HostFixture();
  void SetUp() override;
  void TearDown() override;

  static SessionPolicy Sessions();

  // A call as the HTTP layer would hand it over.
  WebAnswer Get(Endpoint endpoint, const std::string &query,
                const Browser *browser = nullptr);
  WebAnswer
  Post(Endpoint endpoint, const std::string &body,
       const Browser *browser = nullptr,
       const std::string &contentType = "application/x-www-form-urlencoded");
  // Logs in (expects success) and returns the session.
  Browser Login(const TestAccount &account);
  // entry.cgi by POST with these fields (already URL-encoded).
  Json::Value Call(const Browser &browser, const std::string &fields);

  FakeClock mClock;
  ModuleRegistry mModules;
  SessionStore mSessions;
  LoginThrottle mThrottle;
  LoginService mLogins;
  RequestHandler mHandler;
  std::string mClientAddress = "127.0.0.1";
};

// True when a captured log line has this priority, begins with
// "<sourceFile>:<line> " and contains text.
bool HasLogFrom(int priority, const std::string &sourceFile,
                const std::string &text);

// URL-encodes text for a form.
std::string FormEncode(const std::string &text);

// A port on 127.0.0.1 that was free a moment ago, or -1.
int FreePort();

// Starts program with args (program's name is argv[0]); stdinFd (if not -1)
// becomes its input. The child's id, or -1 (a test failure) when it could
// not be started.
pid_t SpawnProgram(const std::string &program,
                   const std::vector<std::string> &args, int stdinFd = -1);

// Waits (bounded) for the process to end; kills it when it does not.
// Returns its wait status, or -1 when it had to be killed.
int WaitFor(pid_t pid, std::chrono::seconds limit);

// Waits (bounded: 15 s) until the host process pid answers "/" on
// 127.0.0.1:port. When it does not, kills it and returns false.
bool WaitUntilServing(pid_t pid, int port);

// The session id in a Set-Cookie value ("id=...; Path=/; ..."), or empty.
std::string CookieId(const std::string &setCookie);

} // namespace zark::host::test

#endif
