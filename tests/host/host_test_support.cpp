#include "host_test_support.h"

#include "hermetic.h"
#include "syslog_capture.h"
#include "webapi.h"

#include <crypt.h>
#include <httplib.h>
#include <netinet/in.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <memory>
#include <thread>

extern char **environ;

namespace zark::host::test {

namespace fs = std::filesystem;

fs::path BuiltModule(const std::string &name) {
  return fs::path(HOST_TEST_MODULES_DIR) / (name + ".so");
}

fs::path ModuleFolder(const std::string &folder,
                      std::initializer_list<std::string> modules) {
  fs::path path = fs::path("/tmp/host-modules") / folder;
  fs::remove_all(path);
  fs::create_directories(path);
  for (const std::string &module : modules) {
    fs::copy_file(BuiltModule(module), path / (module + ".so"));
  }
  return path;
}

std::string QuickHash(const std::string &password) {
  char salt[CRYPT_GENSALT_OUTPUT_SIZE];
  if (crypt_gensalt_rn("$y$", 1, nullptr, 0, salt, sizeof(salt)) == nullptr) {
    ADD_FAILURE() << "crypt_gensalt_rn failed";
    return "";
  }
  auto data = std::make_unique<crypt_data>();
  const char *hash = crypt_rn(password.c_str(), salt, data.get(),
                              static_cast<int>(sizeof(crypt_data)));
  if (hash == nullptr || hash[0] == '*') {
    ADD_FAILURE() << "crypt_rn failed";
    return "";
  }
  return hash;
}

void WriteAccounts(const fs::path &file,
                   const std::vector<TestAccount> &accounts, unsigned mode) {
  std::string content = "# test accounts\n";
  for (const TestAccount &account : accounts) {
    content += account.user + ":" + QuickHash(account.password) + ":" +
               account.group + "\n";
  }
  zark::test::WriteFile(file.string(), content, mode);
}

void WriteStandardAccounts() {
  WriteAccounts(kAccountsFile, {kAdmin, kViewer});
}

HostFixture::HostFixture()
    : mSessions(mClock, Sessions()), mThrottle(mClock, ThrottlePolicy{}),
      mLogins(kAccountsFile, mSessions, mThrottle),
      mHandler(mModules, mSessions, mLogins, RequestLimits{}, false) {}

SessionPolicy HostFixture::Sessions() {
  SessionPolicy policy;
  policy.idleTimeout = std::chrono::minutes(30);
  policy.maxLifetime = std::chrono::hours(12);
  return policy;
}

void HostFixture::SetUp() {
  zark::test::ResetFixedPaths();
  WriteStandardAccounts();
  ASSERT_EQ(mModules.LoadFolder(ModuleFolder("fixture", {"good_module"})), 1u);
}

void HostFixture::TearDown() {
  ZARK::APIPolling::JoinAll();
}

namespace {

struct HeldRequest {
  std::string cookies;
  std::string token;
};

WebRequest MakeRequest(Endpoint endpoint, const Browser *browser,
                       const std::string &address, HeldRequest &held) {
  WebRequest request;
  request.endpoint = endpoint;
  request.clientAddress = address;
  if (browser != nullptr) {
    held.cookies = browser->cookie;
    held.token = browser->token;
    request.cookies = held.cookies;
    request.token = held.token;
  }
  return request;
}

} // namespace

WebAnswer HostFixture::Get(Endpoint endpoint, const std::string &query,
                           const Browser *browser) {
  HeldRequest held;
  WebRequest request = MakeRequest(endpoint, browser, mClientAddress, held);
  request.query = query;
  return mHandler.Handle(request);
}

WebAnswer HostFixture::Post(Endpoint endpoint, const std::string &body,
                            const Browser *browser,
                            const std::string &contentType) {
  HeldRequest held;
  WebRequest request = MakeRequest(endpoint, browser, mClientAddress, held);
  request.isPost = true;
  request.body = body;
  request.contentType = contentType;
  return mHandler.Handle(request);
}

Browser HostFixture::Login(const TestAccount &account) {
  WebAnswer answer =
      Post(Endpoint::Auth, "method=login&account=" + FormEncode(account.user) +
                               "&passwd=" + FormEncode(account.password));
  Browser browser;
  EXPECT_TRUE(answer.body["success"].asBool()) << answer.body;
  browser.token = answer.body["data"]["token"].asString();
  for (const auto &[name, value] : answer.headers) {
    if (name == "Set-Cookie") {
      browser.sessionId = CookieId(value);
    }
  }
  browser.cookie = "id=" + browser.sessionId;
  EXPECT_FALSE(browser.sessionId.empty());
  return browser;
}

Json::Value HostFixture::Call(const Browser &browser,
                              const std::string &fields) {
  return Post(Endpoint::Entry, fields, &browser).body;
}

bool HasLogFrom(int priority, const std::string &sourceFile,
                const std::string &text) {
  for (const auto &line : zark::test::CapturedLogs()) {
    const std::string &message = line.message;
    if (line.priority != priority || message.rfind(sourceFile + ":", 0) != 0) {
      continue;
    }
    std::size_t space = message.find(' ');
    if (space != std::string::npos &&
        message.find(text, space + 1) != std::string::npos) {
      return true;
    }
  }
  return false;
}

std::string FormEncode(const std::string &text) {
  std::string out;
  for (unsigned char c : text) {
    if ((c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') ||
        (c >= '0' && c <= '9') || c == '-' || c == '_' || c == '.' ||
        c == '~') {
      out.push_back(static_cast<char>(c));
    } else {
      char escape[4];
      snprintf(escape, sizeof(escape), "%%%02X", c);
      out += escape;
    }
  }
  return out;
}

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

pid_t SpawnProgram(const std::string &program,
                   const std::vector<std::string> &args, int stdinFd) {
  std::vector<std::string> all = {program};
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
  EXPECT_EQ(error, 0) << "posix_spawn " << program;
  return error == 0 ? pid : -1;
}

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
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  kill(pid, SIGKILL);
  int status = 0;
  waitpid(pid, &status, 0);
  return -1;
}

bool WaitUntilServing(pid_t pid, int port) {
  httplib::Client client("127.0.0.1", port);
  client.set_connection_timeout(std::chrono::seconds(1));
  client.set_read_timeout(std::chrono::seconds(10));
  for (int attempt = 0; attempt < 300; ++attempt) {
    httplib::Result page = client.Get("/");
    if (page && page->status == 200) {
      return true;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
  }
  kill(pid, SIGKILL);
  WaitFor(pid, std::chrono::seconds(10));
  return false;
}

std::string CookieId(const std::string &setCookie) {
  if (setCookie.rfind("id=", 0) != 0) {
    return "";
  }
  return setCookie.substr(3, setCookie.find(';') - 3);
}

} // namespace zark::host::test
