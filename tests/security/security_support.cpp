#include "security_support.h"

#include "ZARK.Core.PortForwarding.h"

#include <arpa/inet.h>
#include <crypt.h>
#include <dlfcn.h>
#include <fcntl.h>
#include <httplib.h>
#include <netinet/in.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cctype>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <sstream>

extern char **environ;

namespace zark::security {
namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

std::string ReadWholeFile(const std::string &path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream buffer;
  buffer << in.rdbuf();
  return buffer.str();
}

bool ParseJson(const std::string &text, Json::Value &value) {
  Json::CharReaderBuilder builder;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  return reader->parse(text.data(), text.data() + text.size(), &value, nullptr);
}

// The character devices a program expects in /dev.
struct DeviceNode {
  const char *path;
  unsigned major;
  unsigned minor;
};
constexpr DeviceNode kDevices[] = {
    {"/dev/null", 1, 3},   {"/dev/zero", 1, 5},    {"/dev/full", 1, 7},
    {"/dev/random", 1, 8}, {"/dev/urandom", 1, 9},
};

// In the child, after fork: system calls only (no allocation), then exec.
[[noreturn]] void ExecInChild(char *const *argv, const char *sinkPath,
                              mode_t mask, const char *outputFile,
                              int inputFd) {
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);
  if (::unshare(CLONE_NEWNS) != 0 ||
      ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
      ::mount("zark-security-dev", "/dev", "tmpfs", MS_NOSUID, "mode=0755") !=
          0) {
    ::_exit(120);
  }
  ::umask(0);
  for (const DeviceNode &device : kDevices) {
    if (::mknod(device.path, S_IFCHR | 0666,
                makedev(device.major, device.minor)) != 0) {
      ::_exit(121);
    }
  }
  ::mkdir("/dev/shm", 01777);
  if ((sinkPath != nullptr && ::symlink(sinkPath, "/dev/log") != 0) ||
      ::symlink("/proc/self/fd", "/dev/fd") != 0 ||
      ::symlink("/proc/self/fd/0", "/dev/stdin") != 0 ||
      ::symlink("/proc/self/fd/1", "/dev/stdout") != 0 ||
      ::symlink("/proc/self/fd/2", "/dev/stderr") != 0) {
    ::_exit(122);
  }
  int output = ::open(outputFile, O_WRONLY | O_CREAT | O_APPEND, 0600);
  int input = inputFd >= 0 ? inputFd : ::open("/dev/null", O_RDONLY);
  if (output < 0 || input < 0 || ::dup2(input, STDIN_FILENO) < 0 ||
      ::dup2(output, STDOUT_FILENO) < 0 || ::dup2(output, STDERR_FILENO) < 0) {
    ::_exit(123);
  }
  ::umask(mask);
  ::execve(argv[0], argv, environ);
  ::_exit(127);
}

std::string Describe(const fs::directory_entry &entry) {
  struct stat info {};
  if (::lstat(entry.path().c_str(), &info) != 0) {
    return "gone";
  }
  char mode[16];
  std::snprintf(mode, sizeof(mode), "%04o", info.st_mode & 07777);
  if (S_ISDIR(info.st_mode)) {
    return std::string("folder ") + mode;
  }
  if (S_ISLNK(info.st_mode)) {
    std::error_code ec;
    return "link to " + fs::read_symlink(entry.path(), ec).string();
  }
  if (!S_ISREG(info.st_mode)) {
    return std::string("special ") + mode;
  }
  const std::string content = ReadWholeFile(entry.path());
  return std::string("file ") + mode + " size " +
         std::to_string(content.size()) + " hash " +
         std::to_string(std::hash<std::string>{}(content));
}

bool Excluded(const std::string &path,
              const std::vector<std::string> &excluded) {
  for (const std::string &prefix : excluded) {
    if (path.rfind(prefix, 0) == 0) {
      return true;
    }
  }
  return false;
}

template <typename Visit>
void WalkTrees(const std::vector<std::string> &roots,
               const std::vector<std::string> &excluded, Visit visit) {
  for (const std::string &root : roots) {
    std::error_code ec;
    if (!fs::exists(root, ec)) {
      continue;
    }
    fs::recursive_directory_iterator it(
        root, fs::directory_options::skip_permission_denied, ec);
    for (; !ec && it != fs::recursive_directory_iterator(); it.increment(ec)) {
      const std::string path = it->path().string();
      if (Excluded(path, excluded)) {
        if (it->is_directory(ec) && !it->is_symlink(ec)) {
          it.disable_recursion_pending();
        }
        continue;
      }
      visit(*it);
    }
  }
}

} // namespace

std::vector<MethodRow> ReadModuleTable(const std::string &modulePath,
                                       std::string &why) {
  std::vector<MethodRow> rows;
  void *handle = ::dlopen(modulePath.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (handle == nullptr) {
    const char *error = ::dlerror();
    why = "dlopen " + modulePath + ": " + (error != nullptr ? error : "?");
    return rows;
  }
  using GetTable = const ZARK_API_TABLE *(*)();
  auto getTable = reinterpret_cast<GetTable>(::dlsym(handle, "GetAPITable"));
  const ZARK_API_TABLE *table = getTable != nullptr ? getTable() : nullptr;
  if (table == nullptr) {
    why = modulePath + " has no GetAPITable or no table";
  } else {
    for (int i = 0; i < 4096; ++i) {
      const ZARK_API_TABLE &row = table[i];
      if (row.szAPI == nullptr && row.szMethod == nullptr &&
          row.handler == nullptr && row.version == 0) {
        break;
      }
      if (row.szAPI == nullptr || row.szMethod == nullptr) {
        why = "row " + std::to_string(i) + " has no name";
        rows.clear();
        break;
      }
      rows.push_back({row.szAPI, row.version, row.szMethod});
    }
  }
  ::dlclose(handle);
  return rows;
}

// ---------------------------------------------------------------------------
// SyslogSink

SyslogSink::SyslogSink() : mLast(Clock::now()) {
  static std::atomic<int> counter{0};
  std::error_code ec;
  fs::create_directories(kWorkDir, ec);
  mPath = kWorkDir + "/syslog." + std::to_string(::getpid()) + "." +
          std::to_string(counter++) + ".sock";
  ::unlink(mPath.c_str());
  int fd = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::snprintf(address.sun_path, sizeof(address.sun_path), "%s",
                mPath.c_str());
  if (fd < 0 ||
      ::bind(fd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) !=
          0 ||
      ::pipe2(mWake, O_CLOEXEC) != 0) {
    if (fd >= 0) {
      ::close(fd);
    }
    return;
  }
  ::chmod(mPath.c_str(), 0666);
  mFd = fd;
  mThread = std::thread([this] { Serve(); });
}

SyslogSink::~SyslogSink() {
  if (mThread.joinable()) {
    (void)!::write(mWake[1], "x", 1);
    mThread.join();
  }
  for (int fd : {mFd, mWake[0], mWake[1]}) {
    if (fd >= 0) {
      ::close(fd);
    }
  }
  ::unlink(mPath.c_str());
}

void SyslogSink::Serve() {
  for (;;) {
    pollfd watched[2] = {{mFd, POLLIN, 0}, {mWake[0], POLLIN, 0}};
    if (::poll(watched, 2, -1) < 0 && errno != EINTR) {
      return;
    }
    if (watched[1].revents != 0) {
      return;
    }
    if ((watched[0].revents & POLLIN) == 0) {
      continue;
    }
    char buffer[16384];
    ssize_t n = ::recv(mFd, buffer, sizeof(buffer), MSG_DONTWAIT);
    if (n <= 0) {
      continue;
    }
    std::string line(buffer, static_cast<std::size_t>(n));
    while (!line.empty() && (line.back() == '\n' || line.back() == '\0')) {
      line.pop_back();
    }
    std::lock_guard<std::mutex> lock(mMutex);
    mLines.push_back(std::move(line));
    mLast = Clock::now();
  }
}

std::vector<std::string> SyslogSink::Lines() const {
  std::lock_guard<std::mutex> lock(mMutex);
  return mLines;
}

void SyslogSink::Settle(std::chrono::milliseconds quiet) {
  const Clock::time_point deadline = Clock::now() + 5s;
  while (Clock::now() < deadline) {
    {
      std::lock_guard<std::mutex> lock(mMutex);
      if (Clock::now() - mLast >= quiet) {
        return;
      }
    }
    std::this_thread::sleep_for(10ms);
  }
}

// ---------------------------------------------------------------------------
// Programs

pid_t Launch(const LaunchOptions &options, std::string &why) {
  if (options.args.empty() || options.outputFile.empty()) {
    why = "no program or no output file";
    return -1;
  }
  std::error_code ec;
  fs::create_directories(fs::path(options.outputFile).parent_path(), ec);
  std::vector<std::string> args = options.args;
  std::vector<char *> argv;
  for (std::string &arg : args) {
    argv.push_back(arg.data());
  }
  argv.push_back(nullptr);
  int inputPipe[2] = {-1, -1};
  if (options.inputText) {
    if (::pipe2(inputPipe, O_CLOEXEC) != 0) {
      why = std::string("pipe: ") + std::strerror(errno);
      return -1;
    }
    // Small texts fit the pipe's buffer whole.
    const std::string &text = *options.inputText;
    if (::write(inputPipe[1], text.data(), text.size()) !=
        static_cast<ssize_t>(text.size())) {
      why = "cannot write the program's input";
      ::close(inputPipe[0]);
      ::close(inputPipe[1]);
      return -1;
    }
    ::close(inputPipe[1]);
  }
  const char *sinkPath =
      options.sink != nullptr ? options.sink->Path().c_str() : nullptr;
  pid_t pid = ::fork();
  if (pid < 0) {
    why = std::string("fork: ") + std::strerror(errno);
    return -1;
  }
  if (pid == 0) {
    ExecInChild(argv.data(), sinkPath, options.umask,
                options.outputFile.c_str(), inputPipe[0]);
  }
  if (inputPipe[0] >= 0) {
    ::close(inputPipe[0]);
  }
  return pid;
}

int WaitForExit(pid_t pid, std::chrono::milliseconds limit) {
  const Clock::time_point deadline = Clock::now() + limit;
  while (Clock::now() < deadline) {
    int status = 0;
    pid_t done = ::waitpid(pid, &status, WNOHANG);
    if (done == pid) {
      return status;
    }
    if (done < 0 && errno != EINTR) {
      return -1;
    }
    std::this_thread::sleep_for(10ms);
  }
  ::kill(pid, SIGKILL);
  int status = 0;
  ::waitpid(pid, &status, 0);
  return -1;
}

int RunToEnd(const LaunchOptions &options, std::chrono::milliseconds limit,
             std::string &why) {
  pid_t pid = Launch(options, why);
  if (pid < 0) {
    return -1;
  }
  int status = WaitForExit(pid, limit);
  if (status == -1) {
    why = "killed after " + std::to_string(limit.count()) + " ms";
    return -1;
  }
  if (!WIFEXITED(status)) {
    why = "ended by signal " + std::to_string(WTERMSIG(status));
    return -1;
  }
  return WEXITSTATUS(status);
}

int FreeLoopbackPort() {
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

bool WriteAccountsFile(const std::string &path,
                       const std::vector<HostAccount> &accounts) {
  std::string content = "# accounts of the security tests\n";
  for (const HostAccount &account : accounts) {
    char salt[CRYPT_GENSALT_OUTPUT_SIZE];
    if (::crypt_gensalt_rn("$y$", 1, nullptr, 0, salt, sizeof(salt)) ==
        nullptr) {
      return false;
    }
    auto data = std::make_unique<crypt_data>();
    const char *hash = ::crypt_rn(account.password.c_str(), salt, data.get(),
                                  static_cast<int>(sizeof(crypt_data)));
    if (hash == nullptr || hash[0] == '*') {
      return false;
    }
    content += account.user + ":" + hash + ":" + account.group + "\n";
  }
  std::error_code ec;
  fs::create_directories(fs::path(path).parent_path(), ec);
  {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << content;
    if (!out) {
      return false;
    }
  }
  return ::chmod(path.c_str(), 0600) == 0;
}

int HostAnswer::Code() const {
  const Json::Value &error = json["error"];
  return error.isObject() && error["code"].isInt() ? error["code"].asInt() : 0;
}

std::string FormEncode(const std::string &text) {
  static const char kHex[] = "0123456789ABCDEF";
  std::string out;
  for (unsigned char c : text) {
    if (std::isalnum(c) != 0 || c == '-' || c == '_' || c == '.' || c == '~') {
      out += static_cast<char>(c);
    } else {
      out += '%';
      out += kHex[c >> 4];
      out += kHex[c & 0xf];
    }
  }
  return out;
}

// ---------------------------------------------------------------------------
// HostProcess

HostProcess::HostProcess(mode_t umask) : mUmask(umask) {}

HostProcess::~HostProcess() {
  if (mPid > 0) {
    Stop();
  }
}

bool HostProcess::Start(std::string &why) {
  std::error_code ec;
  if (!mSink.Ok() || !fs::exists(mSink.Path(), ec)) {
    why = "no syslog socket at " + mSink.Path();
    return false;
  }
  const fs::path modules = fs::path(kWorkDir) / "modules";
  fs::create_directories(modules, ec);
  fs::copy_file(kBuiltModule, modules / "ZARK.Core.PortForwarding.so",
                fs::copy_options::overwrite_existing, ec);
  if (ec) {
    why = "cannot copy the module: " + ec.message();
    return false;
  }
  const std::string accounts = kWorkDir + "/webapid.accounts";
  if (!WriteAccountsFile(accounts, {kAdminAccount, kViewerAccount})) {
    why = "cannot write the accounts file";
    return false;
  }
  mPort = FreeLoopbackPort();
  if (mPort <= 0) {
    why = "no free port";
    return false;
  }
  mOutputFile = kWorkDir + "/webapid." + std::to_string(mPort) + ".out";
  LaunchOptions options;
  options.args = {
      kWebapid,    "--listen",       "127.0.0.1:" + std::to_string(mPort),
      "--modules", modules.string(), "--accounts",
      accounts,    "--www",          kWorkDir + "/no-www"};
  options.sink = &mSink;
  options.umask = mUmask;
  options.outputFile = mOutputFile;
  mPid = Launch(options, why);
  if (mPid < 0) {
    return false;
  }
  httplib::Client client("127.0.0.1", mPort);
  client.set_connection_timeout(1s);
  client.set_read_timeout(10s);
  // At most 30 s: a sanitizer build loads slowly on a busy machine.
  for (int attempt = 0; attempt < 600; ++attempt) {
    httplib::Result page = client.Get("/");
    if (page && page->status == 200) {
      return true;
    }
    int status = 0;
    if (::waitpid(mPid, &status, WNOHANG) == mPid) {
      mPid = -1;
      why = "zark-webapid ended at start: " + ReadWholeFile(mOutputFile);
      return false;
    }
    std::this_thread::sleep_for(50ms);
  }
  why = "zark-webapid did not answer on port " + std::to_string(mPort);
  return false;
}

int HostProcess::Stop() {
  if (mPid <= 0) {
    return -1;
  }
  ::kill(mPid, SIGTERM);
  // The host waits for its background tasks, each bounded by its own
  // deadlines.
  int status = WaitForExit(mPid, 60s);
  mPid = -1;
  mSink.Settle();
  return status;
}

std::vector<std::string> HostProcess::LogLines() const {
  std::vector<std::string> lines = mSink.Lines();
  std::istringstream output(ReadWholeFile(mOutputFile));
  for (std::string line; std::getline(output, line);) {
    lines.push_back("(output) " + line);
  }
  return lines;
}

std::optional<HostSession> HostProcess::Login(const HostAccount &account) {
  HostAnswer answer = Post("/webapi/auth.cgi",
                           "method=login&account=" + FormEncode(account.user) +
                               "&passwd=" + FormEncode(account.password),
                           std::nullopt, std::nullopt);
  if (!answer.Success()) {
    ADD_FAILURE() << "login of " << account.user << ": " << answer.body;
    return std::nullopt;
  }
  HostSession session;
  session.token = answer.json["data"]["token"].asString();
  const std::string &cookie = answer.setCookie;
  if (cookie.rfind("id=", 0) == 0) {
    session.sessionId = cookie.substr(3, cookie.find(';') - 3);
  }
  if (session.token.empty() || session.sessionId.empty()) {
    ADD_FAILURE() << "login of " << account.user << " without a session";
    return std::nullopt;
  }
  return session;
}

HostAnswer HostProcess::Post(const std::string &endpoint,
                             const std::string &fields,
                             const std::optional<std::string> &cookie,
                             const std::optional<std::string> &token) {
  return Send(true, endpoint, fields, cookie, token);
}

HostAnswer HostProcess::Get(const std::string &endpoint,
                            const std::string &fields,
                            const std::optional<std::string> &cookie,
                            const std::optional<std::string> &token) {
  return Send(false, endpoint, fields, cookie, token);
}

HostAnswer HostProcess::Send(bool post, const std::string &endpoint,
                             const std::string &fields,
                             const std::optional<std::string> &cookie,
                             const std::optional<std::string> &token) {
  HostAnswer answer;
  httplib::Client client("127.0.0.1", mPort);
  client.set_connection_timeout(5s);
  client.set_read_timeout(30s);
  httplib::Headers headers;
  if (cookie) {
    headers.emplace("Cookie", *cookie);
  }
  if (token) {
    headers.emplace("X-ZARK-Token", *token);
  }
  httplib::Result result =
      post ? client.Post(endpoint, headers, fields,
                         "application/x-www-form-urlencoded")
           : client.Get(endpoint + "?" + fields, headers);
  if (!result) {
    ADD_FAILURE() << "no answer from the host to " << endpoint << " " << fields;
    return answer;
  }
  answer.httpStatus = result->status;
  answer.body = result->body;
  answer.setCookie = result->get_header_value("Set-Cookie");
  if (!ParseJson(answer.body, answer.json)) {
    ADD_FAILURE() << "not JSON: " << answer.body;
  }
  return answer;
}

HostAnswer HostProcess::Call(const HostSession &session,
                             const std::string &fields) {
  return Post("/webapi/entry.cgi", fields, "id=" + session.sessionId,
              session.token);
}

std::string RowFields(const MethodRow &row) {
  return "api=" + FormEncode(row.api) +
         "&version=" + std::to_string(row.version) +
         "&method=" + FormEncode(row.method);
}

HostAnswer WaitForTask(HostProcess &host, const HostSession &session,
                       const std::string &api, const std::string &statusMethod,
                       const HostAnswer &started, std::chrono::seconds limit) {
  const std::string taskId = started.json["data"]["task_id"].asString();
  HostAnswer last;
  if (taskId.empty()) {
    ADD_FAILURE() << "no task id in " << started.body;
    return last;
  }
  const MethodRow status{api, 1, statusMethod};
  const Clock::time_point deadline = Clock::now() + limit;
  // A task that ended is answered once from its record and then swept: the
  // poll after that finds no record (an error). A failed task answers its
  // error. A task that has not reported yet, or whose status cannot be
  // read, answers nothing (109) until it is swept.
  constexpr int kNoAnswer = 109;
  while (Clock::now() < deadline) {
    last = host.Call(session,
                     RowFields(status) + "&task_id=" + FormEncode(taskId));
    if (!last.Success() && last.Code() != kNoAnswer) {
      return last;
    }
    std::this_thread::sleep_for(50ms);
  }
  ADD_FAILURE() << "task " << taskId << " still running after " << limit.count()
                << " s: " << last.body;
  return last;
}

// ---------------------------------------------------------------------------
// Files

TreeSnapshot SnapshotTrees(const std::vector<std::string> &roots,
                           const std::vector<std::string> &excluded) {
  TreeSnapshot snapshot;
  WalkTrees(roots, excluded, [&](const fs::directory_entry &entry) {
    snapshot[entry.path().string()] = Describe(entry);
  });
  return snapshot;
}

std::string DescribeChanges(const TreeSnapshot &before,
                            const TreeSnapshot &after) {
  std::string changes;
  for (const auto &[path, description] : before) {
    auto found = after.find(path);
    if (found == after.end()) {
      changes += "removed " + path + "\n";
    } else if (found->second != description) {
      changes += "changed " + path + ": " + description + " -> " +
                 found->second + "\n";
    }
  }
  for (const auto &[path, description] : after) {
    if (before.find(path) == before.end()) {
      changes += "created " + path + " (" + description + ")\n";
    }
  }
  return changes;
}

std::vector<std::string> ModuleWrittenRoots() {
  return {"/etc/portforward", "/tmp", "/etc.defaults", "/usr/zark",
          "/usr/local/etc/services.d"};
}

std::map<std::string, std::string>
ReadAllFiles(const std::vector<std::string> &roots,
             const std::vector<std::string> &excluded) {
  std::map<std::string, std::string> files;
  WalkTrees(roots, excluded, [&](const fs::directory_entry &entry) {
    std::error_code ec;
    if (entry.is_regular_file(ec) && !entry.is_symlink(ec)) {
      files[entry.path().string()] = ReadWholeFile(entry.path());
    }
  });
  return files;
}

// ---------------------------------------------------------------------------
// Sockets and listeners

int BoundSocket(int type, const std::string &address, uint16_t port) {
  sockaddr_storage storage{};
  socklen_t length = 0;
  sockaddr_in v4{};
  sockaddr_in6 v6{};
  int family = AF_INET;
  if (::inet_pton(AF_INET, address.c_str(), &v4.sin_addr) == 1) {
    v4.sin_family = AF_INET;
    v4.sin_port = htons(port);
    std::memcpy(&storage, &v4, sizeof(v4));
    length = sizeof(v4);
  } else if (::inet_pton(AF_INET6, address.c_str(), &v6.sin6_addr) == 1) {
    family = AF_INET6;
    v6.sin6_family = AF_INET6;
    v6.sin6_port = htons(port);
    std::memcpy(&storage, &v6, sizeof(v6));
    length = sizeof(v6);
  } else {
    return -1;
  }
  int fd = ::socket(family, type | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    return -1;
  }
  const int on = 1;
  ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &on, sizeof(on));
  if (family == AF_INET6) {
    ::setsockopt(fd, IPPROTO_IPV6, IPV6_V6ONLY, &on, sizeof(on));
  }
  if (::bind(fd, reinterpret_cast<sockaddr *>(&storage), length) != 0 ||
      (type == SOCK_STREAM && ::listen(fd, 16) != 0)) {
    ::close(fd);
    return -1;
  }
  return fd;
}

int BoundSocketInNamespace(const std::string &netns, int type,
                           const std::string &address, uint16_t port) {
  int fd = -1;
  // Network namespaces belong to threads: a thread of its own enters the
  // namespace, and the socket stays in it whoever uses it afterwards.
  std::thread maker([&] {
    const std::string path = "/run/netns/" + netns;
    int nsFd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (nsFd < 0) {
      return;
    }
    if (::setns(nsFd, CLONE_NEWNET) == 0) {
      fd = BoundSocket(type, address, port);
    }
    ::close(nsFd);
  });
  maker.join();
  return fd;
}

uint16_t BoundPort(int fd) {
  sockaddr_storage address{};
  socklen_t length = sizeof(address);
  if (::getsockname(fd, reinterpret_cast<sockaddr *>(&address), &length) != 0) {
    return 0;
  }
  if (address.ss_family == AF_INET) {
    sockaddr_in v4{};
    std::memcpy(&v4, &address, sizeof(v4));
    return ntohs(v4.sin_port);
  }
  sockaddr_in6 v6{};
  std::memcpy(&v6, &address, sizeof(v6));
  return ntohs(v6.sin6_port);
}

CountingListener::CountingListener(int fd, std::string token, UdpReply udpReply)
    : mToken(std::move(token)), mUdpReply(udpReply) {
  if (fd < 0) {
    return;
  }
  int type = 0;
  socklen_t length = sizeof(type);
  if (::getsockopt(fd, SOL_SOCKET, SO_TYPE, &type, &length) != 0 ||
      ::pipe2(mWake, O_CLOEXEC) != 0) {
    ::close(fd);
    return;
  }
  mTcp = type == SOCK_STREAM;
  mPort = BoundPort(fd);
  mFd = fd;
  mThread = std::thread([this] { Serve(); });
}

CountingListener::~CountingListener() {
  if (mThread.joinable()) {
    (void)!::write(mWake[1], "x", 1);
    mThread.join();
  }
  for (int fd : {mFd, mWake[0], mWake[1]}) {
    if (fd >= 0) {
      ::close(fd);
    }
  }
}

void CountingListener::Serve() {
  for (;;) {
    pollfd watched[2] = {{mFd, POLLIN, 0}, {mWake[0], POLLIN, 0}};
    if (::poll(watched, 2, -1) < 0 && errno != EINTR) {
      return;
    }
    if (watched[1].revents != 0) {
      return;
    }
    if ((watched[0].revents & POLLIN) == 0) {
      continue;
    }
    if (mTcp) {
      int client = ::accept4(mFd, nullptr, nullptr, SOCK_CLOEXEC);
      if (client < 0) {
        continue;
      }
      ++mSeen;
      if (!mToken.empty()) {
        const std::string line = mToken + "\n";
        (void)!::send(client, line.data(), line.size(), MSG_NOSIGNAL);
      }
      ::close(client);
      continue;
    }
    char buffer[2048];
    sockaddr_storage from{};
    socklen_t fromLength = sizeof(from);
    ssize_t n = ::recvfrom(mFd, buffer, sizeof(buffer), MSG_DONTWAIT,
                           reinterpret_cast<sockaddr *>(&from), &fromLength);
    if (n < 0) {
      continue;
    }
    ++mSeen;
    if (mUdpReply != nullptr) {
      const std::string reply =
          mUdpReply(std::string(buffer, static_cast<std::size_t>(n)), mToken);
      if (!reply.empty()) {
        (void)!::sendto(mFd, reply.data(), reply.size(), 0,
                        reinterpret_cast<sockaddr *>(&from), fromLength);
      }
    }
  }
}

} // namespace zark::security
