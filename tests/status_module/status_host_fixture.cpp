#include "status_host_fixture.h"

#include "hermetic.h"
#include "webapi.h"

#include <filesystem>

namespace zark::status::test {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using zark::host::test::FormEncode;

void StatusHost::SetUp() {
  zark::test::ResetFixedPaths();
  zark::host::test::WriteStandardAccounts();
}

void StatusHost::StartHost(const fs::path &module, int keeperIntervalSeconds) {
  using namespace zark::host;
  const fs::path folder = "/tmp/status-modules";
  fs::remove_all(folder);
  fs::create_directories(folder);
  fs::copy_file(module, folder / module.filename());
  mModules = std::make_unique<ModuleRegistry>();
  ASSERT_EQ(mModules->LoadFolder(folder), 1u);
  ZARK_MODULE_SETTINGS settings = DefaultModuleSettings();
  settings.keeper_interval_seconds = keeperIntervalSeconds;
  ASSERT_EQ(mModules->StartModules(settings), 1u);

  SessionPolicy policy;
  mSessions = std::make_unique<SessionStore>(mClock, policy);
  mThrottle = std::make_unique<LoginThrottle>(mClock, ThrottlePolicy{});
  mLogins = std::make_unique<LoginService>(zark::host::test::kAccountsFile,
                                           *mSessions, *mThrottle);
  mHandler = std::make_unique<RequestHandler>(*mModules, *mSessions, *mLogins,
                                              RequestLimits{}, false);
  HttpOptions options;
  options.address = "127.0.0.1";
  options.port = 0;
  options.threads = 4;
  mServer = std::make_unique<HttpServer>(*mHandler, options);
  ASSERT_TRUE(mServer->Bind());
  mServing = std::thread([this] { mServer->Serve(); });
  mClient = std::make_unique<httplib::Client>("127.0.0.1", mServer->Port());
  mClient->set_connection_timeout(5s);
  mClient->set_read_timeout(60s);
  mClient->set_write_timeout(5s);
  mAdmin = Login(zark::host::test::kAdmin);
}

std::chrono::milliseconds StatusHost::StopHost() {
  if (mServer) {
    mServer->Stop();
  }
  if (mServing.joinable()) {
    mServing.join();
  }
  mClient.reset();
  auto begin = std::chrono::steady_clock::now();
  if (mModules) {
    mModules->StopModules();
  }
  auto took = std::chrono::duration_cast<std::chrono::milliseconds>(
      std::chrono::steady_clock::now() - begin);
  ZARK::APIPolling::JoinAll();
  mServer.reset();
  mHandler.reset();
  mLogins.reset();
  mThrottle.reset();
  mSessions.reset();
  mModules.reset();
  return took;
}

void StatusHost::TearDown() {
  StopHost();
}

Session StatusHost::Login(const zark::host::test::TestAccount &account) {
  Session session;
  httplib::Result result =
      mClient->Post("/webapi/auth.cgi",
                    "method=login&account=" + FormEncode(account.user) +
                        "&passwd=" + FormEncode(account.password),
                    "application/x-www-form-urlencoded");
  if (!result) {
    ADD_FAILURE() << "login: no HTTP answer";
    return session;
  }
  Json::Value body;
  std::unique_ptr<Json::CharReader> reader(
      Json::CharReaderBuilder().newCharReader());
  EXPECT_TRUE(reader->parse(result->body.data(),
                            result->body.data() + result->body.size(), &body,
                            nullptr));
  EXPECT_TRUE(body["success"].asBool()) << result->body;
  session.token = body["data"]["token"].asString();
  session.cookie = "id=" + zark::host::test::CookieId(
                               result->get_header_value("Set-Cookie"));
  return session;
}

Json::Value StatusHost::Entry(const std::string &fields,
                              const Session *session) {
  httplib::Headers headers;
  if (session != nullptr) {
    headers.emplace("Cookie", session->cookie);
    headers.emplace("X-ZARK-Token", session->token);
  }
  httplib::Result result = mClient->Post("/webapi/entry.cgi", headers, fields,
                                         "application/x-www-form-urlencoded");
  Json::Value body;
  if (!result) {
    ADD_FAILURE() << "no HTTP answer: " << httplib::to_string(result.error());
    return body;
  }
  EXPECT_EQ(result->status, 200);
  std::unique_ptr<Json::CharReader> reader(
      Json::CharReaderBuilder().newCharReader());
  EXPECT_TRUE(reader->parse(result->body.data(),
                            result->body.data() + result->body.size(), &body,
                            nullptr))
      << result->body;
  return body;
}

Json::Value StatusHost::Call(const std::string &method,
                             const std::string &extra) {
  return Entry(std::string("api=") + kApi + "&version=1&method=" + method +
                   extra,
               &mAdmin);
}

Json::Value
StatusHost::PollUntil(const std::string &method, const std::string &extra,
                      const std::function<bool(const Json::Value &)> &done,
                      std::chrono::seconds limit) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  Json::Value answer;
  for (int attempt = 0; attempt < 2000; ++attempt) {
    answer = Call(method, extra);
    if (done(answer) || std::chrono::steady_clock::now() >= deadline) {
      break;
    }
    std::this_thread::sleep_for(20ms);
  }
  return answer;
}

int Code(const Json::Value &answer) {
  EXPECT_FALSE(answer["success"].asBool()) << answer;
  return answer["error"]["code"].asInt();
}

} // namespace zark::status::test
