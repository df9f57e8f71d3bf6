#include "test_network.h"

#include "child_process.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <regex>
#include <sstream>
#include <tuple>

namespace zark::testnet {
namespace {

using Clock = std::chrono::steady_clock;

std::string Env(const char *name) {
  const char *value = std::getenv(name);
  return value != nullptr ? value : "";
}

// Waits until fd is readable (or writable) or the deadline passes.
bool WaitFd(int fd, short events, Clock::time_point deadline) {
  for (;;) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - Clock::now());
    if (left.count() <= 0) {
      return false;
    }
    pollfd pfd{fd, events, 0};
    int ready = ::poll(&pfd, 1, static_cast<int>(left.count()));
    if (ready > 0) {
      return true;
    }
    if (ready < 0 && errno != EINTR) {
      return false;
    }
  }
}

// In the child, after fork: system calls only (no allocation), then _exit.
[[noreturn]] void ProbeInChild(const char *nsPath, Protocol protocol,
                               const sockaddr_in &target,
                               Clock::time_point deadline) {
  int nsFd = ::open(nsPath, O_RDONLY | O_CLOEXEC);
  if (nsFd < 0 || ::setns(nsFd, CLONE_NEWNET) != 0) {
    ::_exit(3);
  }
  int fd = ::socket(AF_INET,
                    (protocol == Protocol::kTcp ? SOCK_STREAM : SOCK_DGRAM) |
                        SOCK_NONBLOCK | SOCK_CLOEXEC,
                    0);
  if (fd < 0) {
    ::_exit(3);
  }
  if (::connect(fd, reinterpret_cast<const sockaddr *>(&target),
                sizeof(target)) != 0) {
    if (errno != EINPROGRESS) {
      ::_exit(1);
    }
    if (!WaitFd(fd, POLLOUT, deadline)) {
      ::_exit(1);
    }
    int error = 0;
    socklen_t length = sizeof(error);
    if (::getsockopt(fd, SOL_SOCKET, SO_ERROR, &error, &length) != 0 ||
        error != 0) {
      ::_exit(1);
    }
  }
  static const char kProbe[] = "probe\n";
  if (::send(fd, kProbe, sizeof(kProbe) - 1, MSG_NOSIGNAL) !=
      static_cast<ssize_t>(sizeof(kProbe) - 1)) {
    ::_exit(1);
  }
  char reply[64] = {};
  std::size_t got = 0;
  // The reply is "echo:probe\n"; a datagram comes whole.
  while (got < 11) {
    if (!WaitFd(fd, POLLIN, deadline)) {
      ::_exit(1);
    }
    ssize_t n = ::recv(fd, reply + got, sizeof(reply) - 1 - got, 0);
    if (n <= 0) {
      if (n < 0 && (errno == EAGAIN || errno == EINTR)) {
        continue;
      }
      ::_exit(1);
    }
    got += static_cast<std::size_t>(n);
    if (protocol == Protocol::kUdp) {
      break;
    }
  }
  ::_exit(std::memcmp(reply, "echo:probe\n", 11) == 0 ? 0 : 1);
}

} // namespace

std::optional<TestNetwork> CurrentNetwork() {
  TestNetwork network;
  network.serverNs = Env("ZARK_TESTNET_SERVER_NS");
  network.routerNs = Env("ZARK_TESTNET_ROUTER_NS");
  network.outsideNs = Env("ZARK_TESTNET_OUTSIDE_NS");
  network.wanRouter = Env("ZARK_TESTNET_WAN_ROUTER");
  network.wanOutside = Env("ZARK_TESTNET_WAN_OUTSIDE");
  network.lanRouter = Env("ZARK_TESTNET_LAN_ROUTER");
  network.lanServer = Env("ZARK_TESTNET_LAN_SERVER");
  network.rootDesc = Env("ZARK_TESTNET_ROOT_DESC");
  network.name = Env("ZARK_TESTNET_NAME");
  network.stateDir = Env("ZARK_TESTNET_STATE");
  network.script = Env("ZARK_TESTNET_SCRIPT");
  if (network.serverNs.empty() || network.outsideNs.empty() ||
      network.wanRouter.empty() || network.rootDesc.empty()) {
    return std::nullopt;
  }
  return network;
}

bool ProbeFromOutside(const TestNetwork &network, Protocol protocol,
                      const std::string &address, uint16_t port,
                      std::chrono::milliseconds timeout) {
  const std::string nsPath = "/run/netns/" + network.outsideNs;
  sockaddr_in target{};
  target.sin_family = AF_INET;
  target.sin_port = htons(port);
  if (::inet_pton(AF_INET, address.c_str(), &target.sin_addr) != 1) {
    return false;
  }
  const Clock::time_point deadline = Clock::now() + timeout;
  pid_t pid = ::fork();
  if (pid < 0) {
    return false;
  }
  if (pid == 0) {
    ProbeInChild(nsPath.c_str(), protocol, target, deadline);
  }
  // The child gives up at the deadline by itself; a second of grace before
  // it is killed keeps this wait bounded whatever happens.
  const Clock::time_point hardDeadline = deadline + std::chrono::seconds(1);
  int status = 0;
  for (;;) {
    pid_t done = ::waitpid(pid, &status, WNOHANG);
    if (done == pid) {
      break;
    }
    if (done < 0 && errno != EINTR) {
      return false;
    }
    if (Clock::now() > hardDeadline) {
      ::kill(pid, SIGKILL);
      ::waitpid(pid, &status, 0);
      return false;
    }
    ::usleep(1000);
  }
  return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

EchoListener::EchoListener(Protocol protocol, uint16_t port)
    : mProtocol(protocol) {
  int fd = ::socket(AF_INET,
                    (protocol == Protocol::kTcp ? SOCK_STREAM : SOCK_DGRAM) |
                        SOCK_CLOEXEC,
                    0);
  if (fd < 0) {
    return;
  }
  int one = 1;
  ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof(one));
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  address.sin_addr.s_addr = htonl(INADDR_ANY);
  if (::bind(fd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) !=
          0 ||
      (protocol == Protocol::kTcp && ::listen(fd, 16) != 0) ||
      ::pipe2(mStopPipe, O_CLOEXEC) != 0) {
    ::close(fd);
    return;
  }
  mFd = fd;
  mThread = std::thread([this] { Serve(); });
}

EchoListener::~EchoListener() {
  if (mThread.joinable()) {
    (void)!::write(mStopPipe[1], "x", 1);
    mThread.join();
  }
  for (int fd : {mFd, mStopPipe[0], mStopPipe[1]}) {
    if (fd >= 0) {
      ::close(fd);
    }
  }
}

void EchoListener::Serve() {
  for (;;) {
    pollfd fds[2] = {{mFd, POLLIN, 0}, {mStopPipe[0], POLLIN, 0}};
    if (::poll(fds, 2, -1) < 0) {
      if (errno == EINTR) {
        continue;
      }
      return;
    }
    if (fds[1].revents != 0) {
      return;
    }
    if (fds[0].revents == 0) {
      continue;
    }
    char buffer[512];
    if (mProtocol == Protocol::kUdp) {
      sockaddr_in from{};
      socklen_t length = sizeof(from);
      ssize_t n = ::recvfrom(mFd, buffer, sizeof(buffer), 0,
                             reinterpret_cast<sockaddr *>(&from), &length);
      if (n > 0) {
        std::string reply = "echo:" + std::string(buffer, n);
        ::sendto(mFd, reply.data(), reply.size(), 0,
                 reinterpret_cast<sockaddr *>(&from), length);
        ++mAnswered;
      }
      continue;
    }
    int client = ::accept4(mFd, nullptr, nullptr, SOCK_CLOEXEC);
    if (client < 0) {
      continue;
    }
    // One short line per connection; bounded by a 2 s wait.
    std::string line;
    const Clock::time_point deadline = Clock::now() + std::chrono::seconds(2);
    while (line.find('\n') == std::string::npos && line.size() < 256 &&
           WaitFd(client, POLLIN, deadline)) {
      ssize_t n = ::recv(client, buffer, sizeof(buffer), 0);
      if (n <= 0) {
        break;
      }
      line.append(buffer, static_cast<std::size_t>(n));
    }
    std::string reply = "echo:" + line;
    ::send(client, reply.data(), reply.size(), MSG_NOSIGNAL);
    ++mAnswered;
    ::close(client);
  }
}

OutsideProcess::OutsideProcess(const TestNetwork &network,
                               std::vector<std::string> args,
                               std::chrono::milliseconds stopWait)
    : mStopWait(stopWait) {
  if (args.empty()) {
    return;
  }
  // Everything the child needs is made before fork: after it, the child
  // only makes system calls.
  const std::string nsPath = "/run/netns/" + network.outsideNs;
  std::vector<char *> argv;
  for (std::string &arg : args) {
    argv.push_back(arg.data());
  }
  argv.push_back(nullptr);
  const pid_t parent = ::getpid();
  pid_t pid = ::fork();
  if (pid < 0) {
    return;
  }
  if (pid == 0) {
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (::getppid() != parent) {
      ::_exit(127);
    }
    ::close_range(3, ~0u, 0);
    int nsFd = ::open(nsPath.c_str(), O_RDONLY | O_CLOEXEC);
    if (nsFd < 0 || ::setns(nsFd, CLONE_NEWNET) != 0) {
      ::_exit(126);
    }
    ::execv(argv[0], argv.data());
    ::_exit(127);
  }
  mPid = pid;
}

OutsideProcess::~OutsideProcess() {
  if (mPid <= 0) {
    return;
  }
  int status = 0;
  if (::waitpid(mPid, &status, WNOHANG) == mPid) {
    return;
  }
  ::kill(mPid, SIGTERM);
  const Clock::time_point deadline = Clock::now() + mStopWait;
  for (;;) {
    if (::waitpid(mPid, &status, WNOHANG) == mPid) {
      return;
    }
    if (Clock::now() >= deadline) {
      ::kill(mPid, SIGKILL);
      ::waitpid(mPid, &status, 0);
      return;
    }
    ::usleep(2000);
  }
}

bool OutsideProcess::Running() {
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

bool OutsideProcess::WaitForTcp(const std::string &address, uint16_t port,
                                std::chrono::milliseconds timeout) {
  sockaddr_in target{};
  target.sin_family = AF_INET;
  target.sin_port = htons(port);
  if (::inet_pton(AF_INET, address.c_str(), &target.sin_addr) != 1) {
    return false;
  }
  const Clock::time_point deadline = Clock::now() + timeout;
  while (Clock::now() < deadline) {
    if (!Running()) {
      return false;
    }
    int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (fd < 0) {
      return false;
    }
    bool connected = ::connect(fd, reinterpret_cast<const sockaddr *>(&target),
                               sizeof(target)) == 0;
    if (!connected && errno == EINPROGRESS &&
        WaitFd(fd, POLLOUT,
               std::min(deadline, Clock::now() + std::chrono::seconds(1)))) {
      int error = 0;
      socklen_t length = sizeof(error);
      connected =
          ::getsockopt(fd, SOL_SOCKET, SO_ERROR, &error, &length) == 0 &&
          error == 0;
    }
    ::close(fd);
    if (connected) {
      return true;
    }
    ::usleep(10000);
  }
  return false;
}

bool UpnpMapping::operator<(const UpnpMapping &other) const {
  return std::tie(protocol, externalPort, internalAddress, internalPort) <
         std::tie(other.protocol, other.externalPort, other.internalAddress,
                  other.internalPort);
}

int RunTool(const std::vector<std::string> &args, std::string &output,
            std::chrono::milliseconds timeout) {
  zark::test::ChildOptions options;
  options.timeout = timeout;
  zark::test::ChildResult result =
      zark::test::RunProgram(args.at(0), args, options);
  output = result.output + result.errors;
  if (!result.started || !result.exited || result.timedOut) {
    return -1;
  }
  return result.exitStatus;
}

bool ListUpnpMappings(const TestNetwork &network,
                      std::vector<UpnpMapping> &mappings,
                      std::string *rawOutput) {
  std::string output;
  int status =
      RunTool({"/usr/bin/upnpc", "-u", network.rootDesc, "-l"}, output);
  if (rawOutput != nullptr) {
    *rawOutput = output;
  }
  if (status != 0) {
    return false;
  }
  // " 0 TCP 18080->192.168.77.2:8080  'zark' '' 604800"
  static const std::regex kLine(
      R"(^\s*\d+\s+(TCP|UDP)\s+(\d+)->([0-9.]+):(\d+)\s+'([^']*)'\s+'[^']*'\s+(\d+))");
  mappings.clear();
  std::istringstream lines(output);
  std::string line;
  while (std::getline(lines, line)) {
    std::smatch match;
    if (std::regex_search(line, match, kLine)) {
      UpnpMapping mapping;
      mapping.protocol = match[1];
      mapping.externalPort = std::stoi(match[2]);
      mapping.internalAddress = match[3];
      mapping.internalPort = std::stoi(match[4]);
      mapping.description = match[5];
      mapping.lease = std::stol(match[6]);
      mappings.push_back(mapping);
    }
  }
  return true;
}

namespace {

bool Failed(std::string *why, const std::string &text) {
  if (why != nullptr) {
    *why = text;
  }
  return false;
}

// Runs one of testnet.sh's router commands for this network.
bool RunRouterCommand(const TestNetwork &network,
                      const std::vector<std::string> &args, std::string *why) {
  if (network.script.empty() || network.name.empty()) {
    return Failed(why, "the network was not started by a testnet.sh that "
                       "has router commands (ZARK_TESTNET_SCRIPT unset)");
  }
  std::vector<std::string> command = {"/bin/bash", network.script};
  command.insert(command.end(), args.begin(), args.end());
  std::string output;
  int status = RunTool(command, output, std::chrono::seconds(15));
  if (status != 0) {
    return Failed(why, args.at(0) + " exited with " + std::to_string(status) +
                           ": " + output);
  }
  return true;
}

bool RunIp(const TestNetwork &network, const std::vector<std::string> &args,
           std::string *why) {
  std::vector<std::string> command = {"/usr/sbin/ip", "-n", network.routerNs};
  command.insert(command.end(), args.begin(), args.end());
  std::string output;
  int status = RunTool(command, output);
  if (status != 0) {
    std::string text;
    for (const std::string &arg : command) {
      text += arg + " ";
    }
    return Failed(why, text + "exited with " + std::to_string(status) + ": " +
                           output);
  }
  return true;
}

} // namespace

bool StopRouterDaemon(const TestNetwork &network, bool kill, std::string *why) {
  std::vector<std::string> args = {"router-stop", network.name};
  if (kill) {
    args.push_back("--kill");
  }
  return RunRouterCommand(network, args, why);
}

bool FlushRouterMappings(const TestNetwork &network, std::string *why) {
  return RunRouterCommand(network, {"router-flush", network.name}, why);
}

bool StartRouterDaemon(const TestNetwork &network, bool keepLeases,
                       std::string *why) {
  std::vector<std::string> args = {"router-start", network.name};
  if (keepLeases) {
    args.push_back("--keep-leases");
  }
  return RunRouterCommand(network, args, why);
}

bool PauseRouterDaemon(const TestNetwork &network, bool pause,
                       std::string *why) {
  if (network.stateDir.empty()) {
    return Failed(why, "the network's state folder is unknown "
                       "(ZARK_TESTNET_STATE unset)");
  }
  const std::string pidFile = network.stateDir + "/router.pid";
  int fd = ::open(pidFile.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    return Failed(why, "no router daemon: cannot open " + pidFile);
  }
  char text[32] = {};
  ssize_t got = ::read(fd, text, sizeof(text) - 1);
  ::close(fd);
  long pid = got > 0 ? std::strtol(text, nullptr, 10) : 0;
  if (pid <= 1) {
    return Failed(why, "no router daemon pid in " + pidFile);
  }
  if (::kill(static_cast<pid_t>(pid), pause ? SIGSTOP : SIGCONT) != 0) {
    return Failed(why,
                  "kill " + std::to_string(pid) + ": " + std::strerror(errno));
  }
  return true;
}

bool CutRouterLan(const TestNetwork &network, std::string *why) {
  return RunIp(network, {"link", "set", "lan0", "down"}, why);
}

bool RestoreRouterLan(const TestNetwork &network, std::string *why) {
  // Taking the link down removed the routes through it: the LAN's own
  // comes back with the link, the multicast route testnet.sh added must be
  // put back.
  return RunIp(network, {"link", "set", "lan0", "up"}, why) &&
         RunIp(network, {"route", "replace", "239.0.0.0/8", "dev", "lan0"},
               why);
}

} // namespace zark::testnet
