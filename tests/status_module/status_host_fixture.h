// A whole host in the test process, serving the status module over HTTP on
// 127.0.0.1: the module registry, sessions, logins, the request handler and
// the HTTP server, as zark-webapid puts them together. The test prepares
// the port-map library (the fake, or the real one in a test network), then
// starts the host; the host's start starts the module's keeper.
#ifndef ZARK_TESTS_STATUS_HOST_FIXTURE_H
#define ZARK_TESTS_STATUS_HOST_FIXTURE_H

#include "clock.h"
#include "host_test_support.h"
#include "http_server.h"
#include "login_service.h"
#include "login_throttle.h"
#include "module_registry.h"
#include "request_handler.h"
#include "session_store.h"

#include <httplib.h>
#include <json/json.h>

#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <functional>
#include <memory>
#include <string>
#include <thread>

namespace zark::status::test {

inline constexpr const char *kApi = "ZARK.Core.PortForwarding.Status";

// The session of a browser over HTTP.
struct Session {
  std::string cookie; // "id=<session id>"
  std::string token;
};

class StatusHost : public ::testing::Test {
protected:
  void SetUp() override;
  void TearDown() override;

  // Loads the module (a copy of the built file), starts it with this check
  // interval and serves; logs the administrator in.
  void StartHost(const std::filesystem::path &module,
                 int keeperIntervalSeconds);
  // Stops serving and stops the modules (the keeper), as the host's
  // shutdown does; returns how long the module stop took.
  std::chrono::milliseconds StopHost();

  Session Login(const zark::host::test::TestAccount &account);
  // entry.cgi with these fields (URL-encoded) and this session (none: no
  // cookie or token).
  Json::Value Entry(const std::string &fields,
                    const Session *session = nullptr);
  // A method of the status module, called by the administrator.
  Json::Value Call(const std::string &method, const std::string &extra = "");
  // Polls until done(answer) or the deadline; returns the last answer.
  Json::Value PollUntil(const std::string &method, const std::string &extra,
                        const std::function<bool(const Json::Value &)> &done,
                        std::chrono::seconds limit);

  zark::host::SteadyClock mClock;
  std::unique_ptr<zark::host::ModuleRegistry> mModules;
  std::unique_ptr<zark::host::SessionStore> mSessions;
  std::unique_ptr<zark::host::LoginThrottle> mThrottle;
  std::unique_ptr<zark::host::LoginService> mLogins;
  std::unique_ptr<zark::host::RequestHandler> mHandler;
  std::unique_ptr<zark::host::HttpServer> mServer;
  std::thread mServing;
  std::unique_ptr<httplib::Client> mClient;
  Session mAdmin;
};

// The error code of a failed answer (a test failure when it succeeded).
int Code(const Json::Value &answer);

} // namespace zark::status::test

#endif
