// The host over real HTTP on 127.0.0.1 (an ephemeral port), with
// cpp-httplib's client: the wire protocol end to end, authentication with
// the cookie and the token header, bounds, static files.
#include "hermetic.h"
#include "host_test_support.h"
#include "http_server.h"
#include "syslog_capture.h"

#include <httplib.h>
#include <syslog.h>

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdint>
#include <cstring>
#include <thread>
#include <vector>

namespace zark::host {
namespace {

using test::FormEncode;

constexpr const char *kForm = "application/x-www-form-urlencoded";

// A logged-in browser over HTTP.
struct HttpSession {
  std::string cookie; // "id=..."
  std::string token;
};

// A raw TCP connection to the server, for requests a well-behaved client
// would not send. Every wait is bounded.
class RawConnection {
public:
  explicit RawConnection(int port) {
    mFd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<std::uint16_t>(port));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    if (mFd < 0 || ::connect(mFd, reinterpret_cast<sockaddr *>(&address),
                             sizeof address) != 0) {
      ADD_FAILURE() << "cannot connect: " << std::strerror(errno);
    }
  }
  ~RawConnection() {
    if (mFd >= 0) {
      ::close(mFd);
    }
  }
  RawConnection(const RawConnection &) = delete;
  RawConnection &operator=(const RawConnection &) = delete;

  // False when the server no longer takes bytes (closed, or not reading).
  bool Send(const std::string &bytes) {
    std::size_t sent = 0;
    while (sent < bytes.size()) {
      pollfd ready{mFd, POLLOUT, 0};
      if (::poll(&ready, 1, 1000) != 1 || (ready.revents & POLLOUT) == 0) {
        return false;
      }
      ssize_t n = ::send(mFd, bytes.data() + sent, bytes.size() - sent,
                         MSG_NOSIGNAL | MSG_DONTWAIT);
      if (n <= 0) {
        return false;
      }
      sent += static_cast<std::size_t>(n);
    }
    return true;
  }

  // What the server answered within wait (empty when nothing came).
  std::string Answer(std::chrono::milliseconds wait) {
    std::string answer;
    const auto deadline = std::chrono::steady_clock::now() + wait;
    for (;;) {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      pollfd ready{mFd, POLLIN, 0};
      if (left.count() <= 0 ||
          ::poll(&ready, 1, static_cast<int>(left.count())) != 1) {
        return answer;
      }
      char buffer[4096];
      ssize_t n = ::recv(mFd, buffer, sizeof buffer, MSG_DONTWAIT);
      if (n <= 0) {
        return answer;
      }
      answer.append(buffer, static_cast<std::size_t>(n));
      if (answer.find("\r\n\r\n") != std::string::npos &&
          answer.find("}") != std::string::npos) {
        return answer;
      }
    }
  }

private:
  int mFd = -1;
};

class HostHttp : public test::HostFixture {
protected:
  void SetUp() override {
    HostFixture::SetUp();
    if (HasFatalFailure()) {
      return;
    }
    StartServer(HttpOptions{});
  }

  void StartServer(HttpOptions options) {
    options.address = "127.0.0.1";
    options.port = 0;
    options.threads = 4;
    mServer = std::make_unique<HttpServer>(mHandler, options);
    ASSERT_TRUE(mServer->Bind());
    mServing = std::thread([this] { mServed = mServer->Serve(); });
    mClient = std::make_unique<httplib::Client>("127.0.0.1", mServer->Port());
    mClient->set_connection_timeout(std::chrono::seconds(5));
    mClient->set_read_timeout(std::chrono::seconds(20));
    mClient->set_write_timeout(std::chrono::seconds(5));
  }

  void StopServer() {
    if (mServer) {
      mServer->Stop();
    }
    if (mServing.joinable()) {
      mServing.join();
    }
    mClient.reset();
    mServer.reset();
  }

  void TearDown() override {
    StopServer();
    HostFixture::TearDown();
  }

  static httplib::Headers SessionHeaders(const HttpSession *session) {
    httplib::Headers headers;
    if (session != nullptr) {
      headers.emplace("Cookie", session->cookie);
      headers.emplace("X-ZARK-Token", session->token);
    }
    return headers;
  }

  httplib::Result PostForm(const std::string &path, const std::string &body,
                           const HttpSession *session = nullptr) {
    return mClient->Post(path.c_str(), SessionHeaders(session), body, kForm);
  }

  httplib::Result GetPath(const std::string &path,
                          const HttpSession *session = nullptr) {
    return mClient->Get(path.c_str(), SessionHeaders(session));
  }

  static Json::Value Body(const httplib::Result &result) {
    Json::Value value;
    if (!result) {
      ADD_FAILURE() << "no HTTP answer: " << httplib::to_string(result.error());
      return value;
    }
    EXPECT_EQ(result->get_header_value("Content-Type"), "application/json");
    std::string errors;
    std::unique_ptr<Json::CharReader> reader(
        Json::CharReaderBuilder().newCharReader());
    EXPECT_TRUE(reader->parse(result->body.data(),
                              result->body.data() + result->body.size(), &value,
                              &errors))
        << result->body;
    return value;
  }

  static int Code(const Json::Value &answer) {
    EXPECT_FALSE(answer["success"].asBool()) << answer;
    return answer["error"]["code"].asInt();
  }

  HttpSession LoginOverHttp(const test::TestAccount &account) {
    httplib::Result result = PostForm(
        "/webapi/auth.cgi", "method=login&account=" + FormEncode(account.user) +
                                "&passwd=" + FormEncode(account.password));
    HttpSession session;
    Json::Value body = Body(result);
    EXPECT_TRUE(body["success"].asBool()) << body;
    session.token = body["data"]["token"].asString();
    if (result) {
      std::string id = test::CookieId(result->get_header_value("Set-Cookie"));
      EXPECT_EQ(id.size(), 32u);
      session.cookie = "id=" + id;
    }
    return session;
  }

  Json::Value Entry(const HttpSession &session, const std::string &fields) {
    return Body(PostForm("/webapi/entry.cgi", fields, &session));
  }

  std::unique_ptr<HttpServer> mServer;
  std::thread mServing;
  bool mServed = false;
  std::unique_ptr<httplib::Client> mClient;
};

TEST_F(HostHttp, LoginThenCallWithCookieAndToken) {
  HttpSession admin = LoginOverHttp(test::kAdmin);
  httplib::Result result =
      PostForm("/webapi/entry.cgi",
               "api=Test.Echo&version=1&method=echo&rules=" +
                   FormEncode("[{\"router_port\":\"8080\"}]") + "&name=web",
               &admin);
  ASSERT_TRUE(result);
  EXPECT_EQ(result->status, 200);
  EXPECT_EQ(result->get_header_value("Cache-Control"), "no-store");
  EXPECT_EQ(result->get_header_value("X-Content-Type-Options"), "nosniff");
  Json::Value body = Body(result);
  ASSERT_TRUE(body["success"].asBool()) << body;
  EXPECT_EQ(body["data"]["params"]["rules"][0]["router_port"].asString(),
            "8080");
  EXPECT_EQ(body["data"]["params"]["name"].asString(), "web");
  EXPECT_EQ(body["data"]["user"].asString(), "admin");
}

TEST_F(HostHttp, GetWithQueryString) {
  HttpSession admin = LoginOverHttp(test::kAdmin);
  Json::Value body = Body(GetPath(
      "/webapi/entry.cgi?api=Test.Echo&version=2&method=echo&n=%5B1%2C2%5D",
      &admin));
  ASSERT_TRUE(body["success"].asBool()) << body;
  EXPECT_EQ(body["data"]["version"].asInt(), 2);
  EXPECT_EQ(body["data"]["params"]["n"][1].asInt(), 2);
}

TEST_F(HostHttp, ErrorShapesAndHostCodes) {
  HttpSession admin = LoginOverHttp(test::kAdmin);
  EXPECT_EQ(Code(Entry(admin, "version=1&method=echo")), 101);
  EXPECT_EQ(Code(Entry(admin, "api=Test.Nope&version=1&method=echo")), 102);
  EXPECT_EQ(Code(Entry(admin, "api=Test.Echo&version=1&method=nope")), 103);
  EXPECT_EQ(Code(Entry(admin, "api=Test.Echo&version=9&method=echo")), 104);
  Json::Value fail = Entry(admin, "api=Test.Echo&version=1&method=fail");
  EXPECT_EQ(Code(fail), 1521);
  EXPECT_EQ(fail["error"]["errors"]["key"].asString(), "port");
  Json::Value bare = Entry(admin, "api=Test.Echo&version=1&method=fail_bare");
  EXPECT_EQ(Code(bare), 1500);
  EXPECT_FALSE(bare["error"].isMember("errors"));
  Json::Value empty = Entry(admin, "api=Test.Echo&version=1&method=empty");
  EXPECT_TRUE(empty["success"].asBool());
  EXPECT_FALSE(empty.isMember("data"));
}

TEST_F(HostHttp, ThrowingMethodIs100AndTheNextRequestIsAnswered) {
  HttpSession admin = LoginOverHttp(test::kAdmin);
  EXPECT_EQ(Code(Entry(admin, "api=Test.Echo&version=1&method=throw")), 100);
  EXPECT_EQ(Code(Entry(admin, "api=Test.Echo&version=1&method=throw_int")),
            100);
  EXPECT_TRUE(
      Entry(admin, "api=Test.Echo&version=1&method=echo")["success"].asBool());
}

TEST_F(HostHttp, MethodThatSetsNothingIs109) {
  HttpSession admin = LoginOverHttp(test::kAdmin);
  EXPECT_EQ(Code(Entry(admin, "api=Test.Echo&version=1&method=silent")), 109);
}

TEST_F(HostHttp, BackgroundTaskStartsAndIsPolledUntilFinished) {
  HttpSession admin = LoginOverHttp(test::kAdmin);
  Json::Value start = Entry(admin, "api=Test.Task&version=1&method=start");
  ASSERT_TRUE(start["success"].asBool()) << start;
  const std::string id = start["data"]["task_id"].asString();
  ASSERT_EQ(id.rfind("Test.Task.count#", 0), 0u) << start;

  Json::Value record;
  int polls = 0;
  const auto deadline =
      std::chrono::steady_clock::now() + std::chrono::seconds(30);
  while (polls < 3000 && std::chrono::steady_clock::now() < deadline) {
    ++polls;
    Json::Value status = Body(GetPath(
        "/webapi/entry.cgi?api=Test.Task&version=1&method=status&task_id=" +
            FormEncode(id),
        &admin));
    ASSERT_TRUE(status["success"].asBool()) << status;
    record = status["data"];
    if (record["finish"].asBool()) {
      break;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  ASSERT_TRUE(record["finish"].asBool()) << record;
  EXPECT_TRUE(record["success"].asBool());
  EXPECT_EQ(record["data"]["step"].asInt(), 3);
  EXPECT_TRUE(record["data"]["done"].asBool());
}

TEST_F(HostHttp, AuthenticationOverHttp) {
  const std::string echo = "api=Test.Echo&version=1&method=echo";
  EXPECT_EQ(Code(Body(PostForm("/webapi/entry.cgi", echo))), 106);
  HttpSession admin = LoginOverHttp(test::kAdmin);
  HttpSession noToken{admin.cookie, ""};
  EXPECT_EQ(Code(Body(PostForm("/webapi/entry.cgi", echo, &noToken))), 107);
  httplib::Headers cookieOnly = {{"Cookie", admin.cookie}};
  EXPECT_EQ(
      Code(Body(mClient->Post("/webapi/entry.cgi", cookieOnly, echo, kForm))),
      107);
  HttpSession wrong{admin.cookie, std::string(32, 'a')};
  EXPECT_EQ(Code(Body(PostForm("/webapi/entry.cgi", echo, &wrong))), 107);

  HttpSession viewer = LoginOverHttp(test::kViewer);
  EXPECT_EQ(Code(Entry(viewer, echo)), 105);

  EXPECT_TRUE(Entry(admin, echo)["success"].asBool());
  mClock.Advance(std::chrono::minutes(31));
  EXPECT_EQ(Code(Entry(admin, echo)), 106);
}

TEST_F(HostHttp, WrongPasswordsAreSlowedDown) {
  for (int i = 0; i < 3; ++i) {
    Json::Value answer = Body(PostForm(
        "/webapi/auth.cgi", "method=login&account=admin&passwd=guess"));
    EXPECT_EQ(answer["error"]["errors"]["reason"].asString(),
              "bad_credentials");
  }
  httplib::Result result =
      PostForm("/webapi/auth.cgi", "method=login&account=admin&passwd=" +
                                       FormEncode(test::kAdmin.password));
  ASSERT_TRUE(result);
  Json::Value answer = Body(result);
  EXPECT_EQ(Code(answer), 105);
  EXPECT_EQ(answer["error"]["errors"]["reason"].asString(), "throttled");
  EXPECT_EQ(answer["error"]["errors"]["retry_after"].asInt(), 2);
  EXPECT_EQ(result->get_header_value("Retry-After"), "2");
}

TEST_F(HostHttp, LogoutEndsTheSession) {
  HttpSession admin = LoginOverHttp(test::kAdmin);
  httplib::Result result =
      PostForm("/webapi/auth.cgi", "method=logout", &admin);
  ASSERT_TRUE(result);
  EXPECT_TRUE(Body(result)["success"].asBool());
  EXPECT_NE(result->get_header_value("Set-Cookie").find("Max-Age=0"),
            std::string::npos);
  EXPECT_EQ(Code(Entry(admin, "api=Test.Echo&version=1&method=echo")), 106);
}

TEST_F(HostHttp, QueryListsTheLoadedApis) {
  HttpSession admin = LoginOverHttp(test::kAdmin);
  Json::Value body = Body(GetPath("/webapi/query.cgi", &admin));
  ASSERT_TRUE(body["success"].asBool());
  EXPECT_TRUE(body["data"].isMember("Test.Echo"));
  EXPECT_TRUE(body["data"].isMember("Test.Task"));
}

TEST_F(HostHttp, BodyBeyondTheBoundIs413With108) {
  HttpSession admin = LoginOverHttp(test::kAdmin);
  std::string body =
      "api=Test.Echo&version=1&method=echo&big=" + std::string(70 * 1024, 'x');
  httplib::Result result = PostForm("/webapi/entry.cgi", body, &admin);
  ASSERT_TRUE(result);
  EXPECT_EQ(result->status, 413);
  EXPECT_EQ(Code(Body(result)), 108);
  // A body just within the bound passes: the library's own smaller bound on
  // forms does not apply.
  std::string fits = "api=Test.Echo&version=1&method=echo&big=";
  fits += std::string(64 * 1024 - fits.size(), 'x');
  EXPECT_TRUE(Entry(admin, fits)["success"].asBool());
}

TEST_F(HostHttp, ChunkedBodyIsBoundedWhileItArrives) {
  RawConnection connection(mServer->Port());
  ASSERT_TRUE(
      connection.Send("POST /webapi/auth.cgi HTTP/1.1\r\nHost: 127.0.0.1\r\n"
                      "Content-Type: application/x-www-form-urlencoded\r\n"
                      "Transfer-Encoding: chunked\r\n\r\n"));
  // Twice the bound in chunks of 8 KiB, and never the last chunk.
  const std::string chunk = "2000\r\n" + std::string(8192, 'a') + "\r\n";
  for (int i = 0; i < 16 && connection.Send(chunk); ++i) {
  }
  std::string answer = connection.Answer(std::chrono::seconds(3));
  EXPECT_EQ(answer.rfind("HTTP/1.1 413", 0), 0u) << answer.substr(0, 200);
  EXPECT_NE(answer.find("\"limit\":\"body\""), std::string::npos);
}

TEST_F(HostHttp, BodyWithoutLengthIsBoundedWhileItArrives) {
  RawConnection connection(mServer->Port());
  ASSERT_TRUE(connection.Send(
      "POST /webapi/auth.cgi HTTP/1.1\r\nHost: 127.0.0.1\r\n"
      "Content-Type: application/x-www-form-urlencoded\r\n\r\n"));
  for (int i = 0; i < 16 && connection.Send(std::string(8192, 'a')); ++i) {
  }
  std::string answer = connection.Answer(std::chrono::seconds(3));
  EXPECT_EQ(answer.rfind("HTTP/1.1 413", 0), 0u) << answer.substr(0, 200);
}

TEST_F(HostHttp, TrickledBodyEndsAtItsDeadline) {
  StopServer();
  HttpOptions options;
  options.bodyTimeout = std::chrono::milliseconds(500);
  StartServer(options);
  RawConnection connection(mServer->Port());
  ASSERT_TRUE(
      connection.Send("POST /webapi/auth.cgi HTTP/1.1\r\nHost: 127.0.0.1\r\n"
                      "Content-Type: application/x-www-form-urlencoded\r\n"
                      "Content-Length: 100\r\n\r\n"));
  // One byte every 100 ms: each read is far within the read timeout.
  std::string answer;
  for (int i = 0; i < 40 && answer.empty(); ++i) {
    if (!connection.Send("a")) {
      break;
    }
    answer = connection.Answer(std::chrono::milliseconds(100));
  }
  if (answer.empty()) {
    answer = connection.Answer(std::chrono::seconds(1));
  }
  EXPECT_EQ(answer.rfind("HTTP/1.1 408", 0), 0u) << answer.substr(0, 200);
  EXPECT_NE(answer.find("body_timeout"), std::string::npos);
}

TEST_F(HostHttp, CompressedBodiesAreRefusedUnread) {
  for (const char *encoding : {"gzip", "deflate", "br", "GZIP"}) {
    httplib::Headers headers = {{"Content-Encoding", encoding}};
    httplib::Result result = mClient->Post("/webapi/auth.cgi", headers,
                                           std::string(1000, '\x1f'), kForm);
    ASSERT_TRUE(result) << encoding;
    EXPECT_EQ(result->status, 415) << encoding;
    EXPECT_EQ(Body(result)["error"]["errors"]["reason"].asString(),
              "content_encoding");
  }
}

TEST_F(HostHttp, TooManyHeadersAre431) {
  httplib::Headers headers;
  for (int i = 0; i < 100; ++i) {
    headers.emplace("X-Filler-" + std::to_string(i), "v");
  }
  httplib::Result result = mClient->Get("/webapi/query.cgi", headers);
  ASSERT_TRUE(result);
  EXPECT_EQ(result->status, 431);
  Json::Value answer = Body(result);
  EXPECT_EQ(Code(answer), 108);
  EXPECT_EQ(answer["error"]["errors"]["limit"].asString(), "header_count");
  // Outside the API too.
  httplib::Result page = mClient->Get("/", headers);
  ASSERT_TRUE(page);
  EXPECT_EQ(page->status, 431);
}

TEST_F(HostHttp, KeptAliveRequestsAreNotHeldByDelayedAcks) {
  mClient->set_keep_alive(true);
  // The client's own request leaves in one segment after another too.
  mClient->set_tcp_nodelay(true);
  std::vector<double> milliseconds;
  for (int i = 0; i < 11; ++i) {
    const auto start = std::chrono::steady_clock::now();
    httplib::Result result = PostForm("/webapi/query.cgi", "a=1");
    ASSERT_TRUE(result);
    milliseconds.push_back(std::chrono::duration<double, std::milli>(
                               std::chrono::steady_clock::now() - start)
                               .count());
  }
  // Without TCP_NODELAY every request after the first waits about 40 ms for
  // the client's delayed ACK.
  std::sort(milliseconds.begin() + 1, milliseconds.end());
  EXPECT_LT(milliseconds[6], 20.0);
}

TEST_F(HostHttp, UnknownApiPathGetsAJsonError) {
  httplib::Result result = GetPath("/webapi/other.cgi");
  ASSERT_TRUE(result);
  EXPECT_EQ(result->status, 404);
  EXPECT_EQ(Code(Body(result)), 101);
}

TEST_F(HostHttp, BuiltInPageWithoutFrontEnd) {
  httplib::Result result = GetPath("/");
  ASSERT_TRUE(result);
  EXPECT_EQ(result->status, 200);
  EXPECT_NE(result->body.find("front end is not installed"), std::string::npos);
}

TEST_F(HostHttp, FrontEndFilesAreServed) {
  StopServer();
  zark::test::WriteFile("/tmp/www/index.html", "<p>front end</p>\n");
  zark::test::WriteFile("/tmp/www/app.js", "let x = 1;\n");
  HttpOptions options;
  options.wwwFolder = "/tmp/www";
  StartServer(options);
  httplib::Result index = GetPath("/");
  ASSERT_TRUE(index);
  EXPECT_EQ(index->body, "<p>front end</p>\n");
  httplib::Result script = GetPath("/app.js");
  ASSERT_TRUE(script);
  EXPECT_EQ(script->body, "let x = 1;\n");
  httplib::Result escape = GetPath("/../etc/passwd");
  ASSERT_TRUE(escape);
  EXPECT_EQ(escape->status, 404);
  // The API is still there.
  EXPECT_EQ(Code(Body(GetPath("/webapi/query.cgi"))), 106);
}

TEST_F(HostHttp, EncodedControlCharactersInPathsAreRefused) {
  StopServer();
  zark::test::WriteFile("/tmp/www/index.html", "<p>front end</p>\n");
  HttpOptions options;
  options.wwwFolder = "/tmp/www";
  StartServer(options);
  for (const char *path :
       {"/index.html%00.png", "/index.html%00", "/%0aindex.html",
        "/index.html%7f", "/webapi/query.cgi%00"}) {
    httplib::Result result = GetPath(path);
    ASSERT_TRUE(result) << path;
    EXPECT_EQ(result->status, 400) << path;
    EXPECT_EQ(result->body.find("front end"), std::string::npos) << path;
  }
  httplib::Result index = GetPath("/index.html");
  ASSERT_TRUE(index);
  EXPECT_EQ(index->body, "<p>front end</p>\n");
}

TEST_F(HostHttp, LoginFromAnotherSitesPageIsRefused) {
  const std::string login =
      "method=login&account=admin&passwd=" + FormEncode(test::kAdmin.password);
  for (const char *origin :
       {"http://evil.example", "null", "http://127.0.0.1.evil.example"}) {
    httplib::Headers headers = {{"Origin", origin}};
    httplib::Result result =
        mClient->Post("/webapi/auth.cgi", headers, login, kForm);
    ASSERT_TRUE(result) << origin;
    EXPECT_EQ(result->status, 403) << origin;
    EXPECT_TRUE(result->get_header_value("Set-Cookie").empty()) << origin;
    Json::Value answer = Body(result);
    EXPECT_EQ(Code(answer), 105);
    EXPECT_EQ(answer["error"]["errors"]["reason"].asString(), "origin");
  }
  EXPECT_EQ(mSessions.Count(), 0u);
  // The host's own page sends its own origin.
  httplib::Headers own = {
      {"Origin", "http://127.0.0.1:" + std::to_string(mServer->Port())}};
  Json::Value answer =
      Body(mClient->Post("/webapi/auth.cgi", own, login, kForm));
  EXPECT_TRUE(answer["success"].asBool()) << answer;
}

TEST_F(HostHttp, CallsFromAnotherSitesPageAreRefused) {
  HttpSession admin = LoginOverHttp(test::kAdmin);
  httplib::Headers headers = SessionHeaders(&admin);
  headers.emplace("Origin", "https://evil.example");
  httplib::Result result =
      mClient->Post("/webapi/entry.cgi", headers,
                    "api=Test.Echo&version=1&method=echo", kForm);
  ASSERT_TRUE(result);
  EXPECT_EQ(result->status, 403);
  EXPECT_EQ(Code(Body(result)), 105);
}

TEST_F(HostHttp, RequestsNamingAnotherHostAreRefused) {
  const std::string port = std::to_string(mServer->Port());
  for (const std::string &host : std::vector<std::string>{
           "evil.example:" + port, "evil.example",
           "127.0.0.1.nip.example:" + port, "[::1:" + port}) {
    httplib::Headers headers = {{"Host", host}};
    httplib::Result result = mClient->Get("/webapi/query.cgi", headers);
    ASSERT_TRUE(result) << host;
    EXPECT_EQ(result->status, 421) << host;
    EXPECT_EQ(Body(result)["error"]["errors"]["reason"].asString(), "host");
  }
  for (const std::string &host :
       std::vector<std::string>{"localhost:" + port, "127.0.0.1:" + port,
                                "LOCALHOST", "[::1]:" + port}) {
    httplib::Headers headers = {{"Host", host}};
    httplib::Result result = mClient->Get("/webapi/query.cgi", headers);
    ASSERT_TRUE(result) << host;
    EXPECT_EQ(result->status, 200) << host;
    EXPECT_EQ(Code(Body(result)), 106) << host;
  }
}

TEST_F(HostHttp, FrontEndThatWouldHideTheApiIsNotServed) {
  StopServer();
  zark::test::ClearLogs();
  zark::test::WriteFile("/tmp/www/index.html", "<p>front end</p>\n");
  zark::test::WriteFile("/tmp/www/webapi/entry.cgi", "shadow\n");
  HttpOptions options;
  options.wwwFolder = "/tmp/www";
  StartServer(options);
  EXPECT_TRUE(test::HasLogFrom(LOG_ERR, "host/http_server.cpp",
                               "www folder /tmp/www holds a \"webapi\" entry"));
  httplib::Result index = GetPath("/");
  ASSERT_TRUE(index);
  EXPECT_NE(index->body.find("front end is not installed"), std::string::npos);
  EXPECT_EQ(Code(Body(GetPath("/webapi/entry.cgi"))), 106);
}

TEST_F(HostHttp, SecretsNeverReachTheLog) {
  zark::test::ClearLogs();
  PostForm("/webapi/auth.cgi",
           "method=login&account=admin&passwd=Wrong-Guess-77");
  HttpSession admin = LoginOverHttp(test::kAdmin);
  Entry(admin, "api=Test.Echo&version=1&method=throw");
  Entry(admin, "api=Test.Echo&version=1&method=silent");
  PostForm("/webapi/auth.cgi", "method=logout", &admin);
  ASSERT_FALSE(zark::test::CapturedLogs().empty());
  const std::string id = admin.cookie.substr(3);
  for (const std::string &line : zark::test::CapturedMessages()) {
    for (const std::string &secret : {std::string("Wrong-Guess-77"),
                                      test::kAdmin.password, id, admin.token}) {
      EXPECT_EQ(line.find(secret), std::string::npos) << line;
    }
  }
}

TEST_F(HostHttp, StopBeforeServeReturnsAtOnce) {
  HttpOptions options;
  options.port = 0;
  HttpServer server(mHandler, options);
  ASSERT_TRUE(server.Bind());
  server.Stop();
  EXPECT_TRUE(server.Serve());
}

TEST_F(HostHttp, StopEndsServe) {
  HttpSession admin = LoginOverHttp(test::kAdmin);
  EXPECT_TRUE(
      Entry(admin, "api=Test.Echo&version=1&method=echo")["success"].asBool());
  StopServer();
  EXPECT_TRUE(mServed);
}

} // namespace
} // namespace zark::host
