#include "host_process.h"

#include "hermetic.h"

#include <fcntl.h>
#include <httplib.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <thread>
#include <vector>

extern char **environ;

namespace zark::faults {
namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

const std::string kModules = std::string(kHostFolder) + "/modules";
const std::string kAccounts = std::string(kHostFolder) + "/webapid.accounts";

// A port of 127.0.0.1 that was free a moment ago.
int FreePort() {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof(address);
  int port = -1;
  if (fd >= 0 &&
      ::bind(fd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) ==
          0 &&
      ::getsockname(fd, reinterpret_cast<sockaddr *>(&address), &length) == 0) {
    port = ntohs(address.sin_port);
  }
  if (fd >= 0) {
    ::close(fd);
  }
  return port;
}

// Starts args[0] (an absolute path) with stdinFd (or /dev/null) as its
// input and its output appended to outputPath. It gets SIGKILL when the
// test process dies, so that no host outlives a crashed test.
pid_t Spawn(std::vector<std::string> args, int stdinFd,
            const std::string &outputPath) {
  // Everything the child needs is made before fork: after it, the child
  // only makes system calls.
  std::vector<char *> argv;
  for (std::string &arg : args) {
    argv.push_back(arg.data());
  }
  argv.push_back(nullptr);
  const pid_t parent = ::getpid();
  pid_t pid = ::fork();
  if (pid != 0) {
    return pid;
  }
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);
  if (::getppid() != parent) {
    ::_exit(127);
  }
  int input = stdinFd >= 0 ? stdinFd : ::open("/dev/null", O_RDONLY);
  int output = ::open(outputPath.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
  if (input < 0 || output < 0 || ::dup2(input, STDIN_FILENO) < 0 ||
      ::dup2(output, STDOUT_FILENO) < 0 || ::dup2(output, STDERR_FILENO) < 0) {
    ::_exit(126);
  }
  ::close_range(3, ~0u, 0);
  ::execve(argv[0], argv.data(), environ);
  ::_exit(127);
}

// Waits for pid to end, at most limit; kills it when it does not. Its wait
// status, or -1 when it had to be killed.
int WaitFor(pid_t pid, std::chrono::milliseconds limit) {
  const Clock::time_point deadline = Clock::now() + limit;
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
      ::kill(pid, SIGKILL);
      ::waitpid(pid, &status, 0);
      return -1;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
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
      std::snprintf(escape, sizeof(escape), "%%%02X", c);
      out += escape;
    }
  }
  return out;
}

Json::Value ParseAnswer(const std::string &body) {
  Json::Value value;
  Json::CharReaderBuilder builder;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  std::string errors;
  if (!reader->parse(body.data(), body.data() + body.size(), &value, &errors)) {
    return Json::Value();
  }
  return value;
}

} // namespace

bool CreateHostAccount(const std::string &user, const std::string &password,
                       std::string &why) {
  fs::create_directories(kHostFolder);
  int pipeFds[2];
  if (::pipe2(pipeFds, O_CLOEXEC) != 0) {
    why = std::string("pipe: ") + std::strerror(errno);
    return false;
  }
  pid_t pid = Spawn({ZARK_WEBAPID_PATH, "passwd", user, "--accounts", kAccounts,
                     "--group", "admin"},
                    pipeFds[0], std::string(kHostFolder) + "/passwd.log");
  ::close(pipeFds[0]);
  const std::string line = password + "\n";
  bool written = ::write(pipeFds[1], line.data(), line.size()) ==
                 static_cast<ssize_t>(line.size());
  ::close(pipeFds[1]);
  if (pid < 0) {
    why = "cannot start " + std::string(ZARK_WEBAPID_PATH);
    return false;
  }
  int status = WaitFor(pid, std::chrono::seconds(60));
  if (!written || status == -1 || !WIFEXITED(status) ||
      WEXITSTATUS(status) != 0) {
    why =
        "zark-webapid passwd failed (status " + std::to_string(status) +
        "): " + zark::test::ReadFile(std::string(kHostFolder) + "/passwd.log");
    return false;
  }
  return true;
}

HostProcess::HostProcess() = default;

HostProcess::~HostProcess() {
  Kill();
}

bool HostProcess::Start(std::string &why) {
  if (mPid > 0) {
    why = "the host runs already";
    return false;
  }
  std::error_code error;
  fs::create_directories(kModules, error);
  const fs::path module =
      fs::path(kModules) / fs::path(ZARK_MODULE_PATH).filename();
  if (!fs::exists(module) && !fs::copy_file(ZARK_MODULE_PATH, module, error)) {
    why = "cannot copy the module: " + error.message();
    return false;
  }
  mPort = FreePort();
  if (mPort <= 0) {
    why = "no free port";
    return false;
  }
  mOutputPath =
      std::string(kHostFolder) + "/host-" + std::to_string(++mRun) + ".log";
  mPid = Spawn({ZARK_WEBAPID_PATH, "--listen",
                "127.0.0.1:" + std::to_string(mPort), "--modules", kModules,
                "--accounts", kAccounts, "--www",
                std::string(kHostFolder) + "/no-www", "--threads", "4"},
               -1, mOutputPath);
  if (mPid < 0) {
    why = "cannot start " + std::string(ZARK_WEBAPID_PATH);
    return false;
  }
  mClient = std::make_unique<httplib::Client>("127.0.0.1", mPort);
  mClient->set_connection_timeout(std::chrono::seconds(1));
  mClient->set_read_timeout(std::chrono::seconds(20));
  mClient->set_write_timeout(std::chrono::seconds(5));
  mCookie.clear();
  mToken.clear();
  const Clock::time_point deadline = Clock::now() + std::chrono::seconds(30);
  while (Clock::now() < deadline) {
    int status = 0;
    if (::waitpid(mPid, &status, WNOHANG) == mPid) {
      mPid = -1;
      why = "the host ended (status " + std::to_string(status) +
            ") before it answered: " + Output();
      return false;
    }
    httplib::Result page = mClient->Get("/");
    if (page && page->status == 200) {
      return true;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  why = "the host did not answer on port " + std::to_string(mPort) +
        " within 30 s: " + Output();
  Kill();
  return false;
}

void HostProcess::Kill() {
  mClient.reset();
  if (mPid <= 0) {
    return;
  }
  ::kill(mPid, SIGKILL);
  int status = 0;
  while (::waitpid(mPid, &status, 0) < 0 && errno == EINTR) {
  }
  mPid = -1;
}

bool HostProcess::Login(const std::string &user, const std::string &password,
                        std::string &why) {
  if (!mClient) {
    why = "the host does not run";
    return false;
  }
  httplib::Result login =
      mClient->Post("/webapi/auth.cgi",
                    "method=login&account=" + FormEncode(user) +
                        "&passwd=" + FormEncode(password),
                    "application/x-www-form-urlencoded");
  if (!login) {
    why = "no answer to the login";
    return false;
  }
  Json::Value answer = ParseAnswer(login->body);
  const std::string setCookie = login->get_header_value("Set-Cookie");
  if (!answer["success"].asBool() || setCookie.rfind("id=", 0) != 0) {
    why = "login refused: " + login->body;
    return false;
  }
  mCookie = setCookie.substr(0, setCookie.find(';'));
  mToken = answer["data"]["token"].asString();
  return true;
}

Json::Value
HostProcess::Call(const std::string &api, const std::string &method,
                  const std::map<std::string, std::string> &fields) {
  if (!mClient) {
    return Json::Value();
  }
  std::string body =
      "api=" + FormEncode(api) + "&version=1&method=" + FormEncode(method);
  for (const auto &[name, value] : fields) {
    body += "&" + FormEncode(name) + "=" + FormEncode(value);
  }
  httplib::Headers headers = {{"Cookie", mCookie}, {"X-ZARK-Token", mToken}};
  httplib::Result answer = mClient->Post("/webapi/entry.cgi", headers, body,
                                         "application/x-www-form-urlencoded");
  if (!answer) {
    return Json::Value();
  }
  return ParseAnswer(answer->body);
}

std::string HostProcess::Output() const {
  if (mOutputPath.empty()) {
    return "";
  }
  std::error_code error;
  if (!fs::exists(mOutputPath, error)) {
    return "";
  }
  return zark::test::ReadFile(mOutputPath);
}

} // namespace zark::faults
