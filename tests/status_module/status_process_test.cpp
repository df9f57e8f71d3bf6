// zark-webapid itself with the status module (against the fake port-map
// library): --keeper-interval reaches the keeper, its rounds run while the
// host serves, and SIGTERM stops the keeper and the host in bounded time
// with status 0 (under the sanitizer builds a leak would change it).
#include "hermetic.h"
#include "host_test_support.h"

#include <httplib.h>
#include <json/json.h>

#include <gtest/gtest.h>

#include <sys/wait.h>

#include <csignal>
#include <filesystem>
#include <thread>

namespace zark::status::test {
namespace {

using namespace std::chrono_literals;
namespace hostTest = zark::host::test;

Json::Value Parse(const httplib::Result &result) {
  Json::Value value;
  if (!result) {
    return value;
  }
  std::unique_ptr<Json::CharReader> reader(
      Json::CharReaderBuilder().newCharReader());
  reader->parse(result->body.data(), result->body.data() + result->body.size(),
                &value, nullptr);
  return value;
}

TEST(StatusProcess, KeeperRunsUnderTheHostAndStopsWithIt) {
  zark::test::ResetFixedPaths();
  hostTest::WriteStandardAccounts();
  const std::filesystem::path folder = "/tmp/status-process-modules";
  std::filesystem::create_directories(folder);
  std::filesystem::copy_file(
      STATUS_TEST_MODULE,
      folder / std::filesystem::path(STATUS_TEST_MODULE).filename());
  const int port = hostTest::FreePort();
  ASSERT_GT(port, 0);
  pid_t pid = hostTest::SpawnProgram(
      STATUS_WEBAPID,
      {"--listen", "127.0.0.1:" + std::to_string(port), "--modules",
       folder.string(), "--accounts", hostTest::kAccountsFile, "--www",
       "/tmp/no-www", "--keeper-interval", "1"});
  ASSERT_GT(pid, 0);

  httplib::Client client("127.0.0.1", port);
  client.set_connection_timeout(1s);
  client.set_read_timeout(10s);
  if (!hostTest::WaitUntilServing(pid, port)) {
    FAIL() << "the host did not answer on port " << port;
  }
  httplib::Result login =
      client.Post("/webapi/auth.cgi",
                  "method=login&account=admin&passwd=" +
                      hostTest::FormEncode(hostTest::kAdmin.password),
                  "application/x-www-form-urlencoded");
  ASSERT_TRUE(login);
  ASSERT_TRUE(Parse(login)["success"].asBool()) << login->body;
  httplib::Headers headers = {
      {"Cookie",
       "id=" + hostTest::CookieId(login->get_header_value("Set-Cookie"))},
      {"X-ZARK-Token", Parse(login)["data"]["token"].asString()}};

  // Rounds of one second: three of them come within a bounded wait.
  Json::Value keeper;
  for (int attempt = 0; attempt < 100; ++attempt) {
    keeper = Parse(client.Post(
        "/webapi/entry.cgi", headers,
        "api=ZARK.Core.PortForwarding.Status&version=1&method=keeper_status",
        "application/x-www-form-urlencoded"));
    if (keeper["data"]["rounds"].asUInt64() >= 3) {
      break;
    }
    std::this_thread::sleep_for(100ms);
  }
  EXPECT_TRUE(keeper["data"]["running"].asBool()) << keeper;
  EXPECT_EQ(keeper["data"]["check_interval"], 1);
  EXPECT_GE(keeper["data"]["rounds"].asUInt64(), 3u) << keeper;
  EXPECT_EQ(keeper["data"]["last_round"]["outcome"], "ok");

  const auto begin = std::chrono::steady_clock::now();
  ASSERT_EQ(kill(pid, SIGTERM), 0);
  int status = hostTest::WaitFor(pid, 30s);
  ASSERT_NE(status, -1) << "the host did not stop";
  EXPECT_LT(std::chrono::steady_clock::now() - begin, 10s);
  ASSERT_TRUE(WIFEXITED(status)) << "status " << status;
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

} // namespace
} // namespace zark::status::test
