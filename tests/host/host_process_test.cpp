// The zark-webapid executable itself: serving until SIGTERM or SIGINT and
// exiting 0 after its background tasks ended, and the passwd subcommand.
#include "hermetic.h"
#include "host_test_support.h"

#include <httplib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <chrono>
#include <csignal>
#include <thread>

namespace zark::host {
namespace {

using namespace std::chrono_literals;

using test::FreePort;
using test::WaitFor;

// Starts the executable with args; stdinFd (if not -1) becomes its input.
pid_t Spawn(const std::vector<std::string> &args, int stdinFd = -1) {
  return test::SpawnProgram(HOST_WEBAPID, args, stdinFd);
}

class HostProcess : public ::testing::TestWithParam<int> {
protected:
  void SetUp() override {
    zark::test::ResetFixedPaths();
    test::WriteStandardAccounts();
  }
};

TEST_P(HostProcess, StopSignalEndsTheHostWithStatusZero) {
  const int stopSignal = GetParam();
  std::filesystem::path modules =
      test::ModuleFolder("process", {"good_module"});
  const int port = FreePort();
  ASSERT_GT(port, 0);
  pid_t pid = Spawn({"--listen", "127.0.0.1:" + std::to_string(port),
                     "--modules", modules.string(), "--accounts",
                     test::kAccountsFile, "--www", "/tmp/no-www"});
  ASSERT_GT(pid, 0);

  httplib::Client client("127.0.0.1", port);
  client.set_connection_timeout(1s);
  client.set_read_timeout(10s);
  if (!test::WaitUntilServing(pid, port)) {
    FAIL() << "the host did not answer on port " << port;
  }

  // A background task is running when the signal comes: the host asks it
  // to stop and waits for it.
  httplib::Result login =
      client.Post("/webapi/auth.cgi",
                  "method=login&account=admin&passwd=" +
                      test::FormEncode(test::kAdmin.password),
                  "application/x-www-form-urlencoded");
  ASSERT_TRUE(login);
  Json::Value answer;
  std::unique_ptr<Json::CharReader> reader(
      Json::CharReaderBuilder().newCharReader());
  ASSERT_TRUE(reader->parse(login->body.data(),
                            login->body.data() + login->body.size(), &answer,
                            nullptr));
  httplib::Headers headers = {
      {"Cookie", "id=" + test::CookieId(login->get_header_value("Set-Cookie"))},
      {"X-ZARK-Token", answer["data"]["token"].asString()}};
  httplib::Result start =
      client.Post("/webapi/entry.cgi", headers,
                  "api=Test.Task&version=1&method=start&steps=50",
                  "application/x-www-form-urlencoded");
  ASSERT_TRUE(start);
  EXPECT_NE(start->body.find("Test.Task.count#"), std::string::npos)
      << start->body;

  ASSERT_EQ(kill(pid, stopSignal), 0);
  int status = WaitFor(pid, 30s);
  ASSERT_NE(status, -1) << "the host did not stop";
  ASSERT_TRUE(WIFEXITED(status)) << "status " << status;
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

INSTANTIATE_TEST_SUITE_P(HostSignals, HostProcess,
                         ::testing::Values(SIGTERM, SIGINT),
                         [](const ::testing::TestParamInfo<int> &info) {
                           return info.param == SIGTERM ? "Sigterm" : "Sigint";
                         });

TEST(HostProcessPasswd, SubcommandWritesA0600File) {
  zark::test::ResetFixedPaths();
  std::filesystem::create_directories("/tmp/process");
  int pipeFds[2];
  ASSERT_EQ(pipe(pipeFds), 0);
  pid_t pid = Spawn({"passwd", "operator", "--accounts",
                     "/tmp/process/accounts", "--group", "admin"},
                    pipeFds[0]);
  close(pipeFds[0]);
  const char input[] = "Op3rator pass\n";
  EXPECT_EQ(write(pipeFds[1], input, sizeof(input) - 1),
            static_cast<ssize_t>(sizeof(input) - 1));
  close(pipeFds[1]);
  ASSERT_GT(pid, 0);
  int status = WaitFor(pid, 60s);
  ASSERT_TRUE(status != -1 && WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
  struct stat info {};
  ASSERT_EQ(stat("/tmp/process/accounts", &info), 0);
  EXPECT_EQ(info.st_mode & 07777, 0600u);
  std::string content = zark::test::ReadFile("/tmp/process/accounts");
  EXPECT_EQ(content.rfind("operator:$y$", 0), 0u) << content;
  EXPECT_EQ(content.find("Op3rator"), std::string::npos);
}

TEST(HostProcessUsage, BadOptionIsStatusTwo) {
  pid_t pid = Spawn({"--no-such-option"});
  ASSERT_GT(pid, 0);
  int status = WaitFor(pid, 30s);
  ASSERT_TRUE(status != -1 && WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 2);
}

} // namespace
} // namespace zark::host
