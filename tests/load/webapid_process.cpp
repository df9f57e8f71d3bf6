#include "webapid_process.h"

#include <crypt.h>
#include <fcntl.h>
#include <httplib.h>
#include <netinet/in.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <thread>
#include <vector>

extern char **environ;

namespace zark::load {
namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

// A port of 127.0.0.1 that was free a moment ago.
int FreePort() {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    return -1;
  }
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof(address);
  int port = -1;
  if (::bind(fd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) ==
          0 &&
      ::getsockname(fd, reinterpret_cast<sockaddr *>(&address), &length) == 0) {
    port = ntohs(address.sin_port);
  }
  ::close(fd);
  return port;
}

bool WriteAccounts(const fs::path &file, const std::string &account,
                   const std::string &password, std::string &why) {
  const std::string hash = QuickPasswordHash(password);
  if (hash.empty()) {
    why = "cannot hash the password";
    return false;
  }
  {
    std::ofstream out(file, std::ios::binary | std::ios::trunc);
    out << "# load test account\n" << account << ":" << hash << ":admin\n";
    if (!out) {
      why = "cannot write " + file.string();
      return false;
    }
  }
  // The host refuses an accounts file with group or other permissions.
  if (::chmod(file.c_str(), 0600) != 0) {
    why = "chmod " + file.string() + ": " + std::strerror(errno);
    return false;
  }
  return true;
}

// Waits, at most until deadline, for pid to end; its wait status, or -1.
int WaitForExit(pid_t pid, Clock::time_point deadline) {
  for (;;) {
    int status = 0;
    pid_t done = ::waitpid(pid, &status, WNOHANG);
    if (done == pid) {
      return status;
    }
    if (done < 0 && errno != EINTR) {
      return -1;
    }
    if (Clock::now() >= deadline) {
      return -1;
    }
    std::this_thread::sleep_for(20ms);
  }
}

} // namespace

std::string QuickPasswordHash(const std::string &password) {
  char salt[CRYPT_GENSALT_OUTPUT_SIZE];
  if (::crypt_gensalt_rn("$y$", 1, nullptr, 0, salt, sizeof(salt)) == nullptr) {
    return "";
  }
  auto data = std::make_unique<crypt_data>();
  const char *hash = ::crypt_rn(password.c_str(), salt, data.get(),
                                static_cast<int>(sizeof(crypt_data)));
  if (hash == nullptr || hash[0] == '*') {
    return "";
  }
  return hash;
}

WebapidProcess::WebapidProcess(HostSetup setup) : mSetup(std::move(setup)) {}

WebapidProcess::~WebapidProcess() {
  if (mPid > 0) {
    Stop(30s);
  }
}

bool WebapidProcess::Start(std::chrono::seconds wait, std::string &why) {
  std::error_code ec;
  const fs::path folder(mSetup.folder);
  const fs::path modules = folder / "modules";
  const fs::path accounts = folder / "webapid.accounts";
  fs::remove_all(folder, ec);
  fs::create_directories(modules, ec);
  if (ec) {
    why = "cannot make " + modules.string() + ": " + ec.message();
    return false;
  }
  fs::copy_file(mSetup.module, modules / fs::path(mSetup.module).filename(),
                ec);
  if (ec) {
    why = "cannot copy " + mSetup.module + ": " + ec.message();
    return false;
  }
  if (!WriteAccounts(accounts, mSetup.account, mSetup.password, why)) {
    return false;
  }
  mPort = FreePort();
  if (mPort <= 0) {
    why = "no free port on 127.0.0.1";
    return false;
  }

  std::vector<std::string> args = {
      mSetup.executable, "--listen",       "127.0.0.1:" + std::to_string(mPort),
      "--modules",       modules.string(), "--accounts",
      accounts.string(), "--www",          (folder / "no-www").string()};
  if (mSetup.threads > 0) {
    args.push_back("--threads");
    args.push_back(std::to_string(mSetup.threads));
  }
  std::vector<char *> argv;
  for (std::string &arg : args) {
    argv.push_back(arg.data());
  }
  argv.push_back(nullptr);
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null",
                                   O_RDONLY, 0);
  pid_t pid = -1;
  const int error =
      ::posix_spawn(&pid, argv[0], &actions, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  if (error != 0) {
    why = "posix_spawn " + mSetup.executable + ": " + std::strerror(error);
    return false;
  }
  mPid = pid;

  httplib::Client client("127.0.0.1", mPort);
  client.set_connection_timeout(1s);
  client.set_read_timeout(5s);
  const Clock::time_point deadline = Clock::now() + wait;
  while (Clock::now() < deadline) {
    if (!Running()) {
      why = "zark-webapid ended before it answered";
      return false;
    }
    httplib::Result page = client.Get("/");
    if (page && page->status == 200) {
      return true;
    }
    std::this_thread::sleep_for(50ms);
  }
  why = "zark-webapid did not answer on 127.0.0.1:" + std::to_string(mPort) +
        " within " + std::to_string(wait.count()) + " s";
  ::kill(mPid, SIGKILL);
  WaitForExit(mPid, Clock::now() + 10s);
  mPid = -1;
  return false;
}

bool WebapidProcess::Running() {
  if (mPid <= 0) {
    return false;
  }
  int status = 0;
  pid_t done = ::waitpid(mPid, &status, WNOHANG);
  if (done == mPid) {
    mPid = -1;
    return false;
  }
  return done == 0;
}

int WebapidProcess::Stop(std::chrono::seconds wait) {
  if (mPid <= 0) {
    return -1;
  }
  ::kill(mPid, SIGTERM);
  int status = WaitForExit(mPid, Clock::now() + wait);
  if (status == -1) {
    ::kill(mPid, SIGKILL);
    WaitForExit(mPid, Clock::now() + 10s);
  }
  mPid = -1;
  return status;
}

} // namespace zark::load
