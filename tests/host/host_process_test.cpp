// The zark-webapid executable itself: serving until SIGTERM or SIGINT and
// exiting 0 after its background tasks ended, and the passwd subcommand.
#include "hermetic.h"
#include "host_test_support.h"

#include <httplib.h>
#include <netinet/in.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <chrono>
#include <csignal>
#include <thread>

extern char **environ;

namespace zark::host {
namespace {

using namespace std::chrono_literals;

// A port on 127.0.0.1 that was free a moment ago.
int FreePort() {
  int fd = socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof(address);
  int port = -1;
  if (fd >= 0 &&
      bind(fd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) == 0 &&
      getsockname(fd, reinterpret_cast<sockaddr *>(&address), &length) == 0) {
    port = ntohs(address.sin_port);
  }
  if (fd >= 0) {
    close(fd);
  }
  return port;
}

// Starts the executable with args; stdinFd (if not -1) becomes its input.
pid_t Spawn(const std::vector<std::string> &args, int stdinFd = -1) {
  std::vector<std::string> all = {HOST_WEBAPID};
  all.insert(all.end(), args.begin(), args.end());
  std::vector<char *> argv;
  for (std::string &arg : all) {
    argv.push_back(arg.data());
  }
  argv.push_back(nullptr);
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  if (stdinFd >= 0) {
    posix_spawn_file_actions_adddup2(&actions, stdinFd, STDIN_FILENO);
  }
  pid_t pid = -1;
  int error =
      posix_spawn(&pid, argv[0], &actions, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  EXPECT_EQ(error, 0) << "posix_spawn " << HOST_WEBAPID;
  return error == 0 ? pid : -1;
}

// Waits (bounded) for the process to end; kills it when it does not.
// Returns its wait status, or -1 when it had to be killed.
int WaitFor(pid_t pid, std::chrono::seconds limit) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  while (std::chrono::steady_clock::now() < deadline) {
    int status = 0;
    pid_t done = waitpid(pid, &status, WNOHANG);
    if (done == pid) {
      return status;
    }
    if (done < 0) {
      return -1;
    }
    std::this_thread::sleep_for(20ms);
  }
  kill(pid, SIGKILL);
  int status = 0;
  waitpid(pid, &status, 0);
  return -1;
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
  bool up = false;
  for (int attempt = 0; attempt < 300 && !up; ++attempt) {
    httplib::Result page = client.Get("/");
    up = page && page->status == 200;
    if (!up) {
      std::this_thread::sleep_for(50ms);
    }
  }
  if (!up) {
    kill(pid, SIGKILL);
    WaitFor(pid, 10s);
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
