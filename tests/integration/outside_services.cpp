#include "outside_services.h"

#include "dns_answer.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace zark::integration {
namespace {

using Clock = std::chrono::steady_clock;

// Exit codes of the child, for Why().
enum ChildExit : int {
  kChildDone = 0,
  kChildNoNamespace = 10,
  kChildNoUdp = 11,
  kChildNoTcp = 12,
};

long long NowMs() {
  timespec now{};
  ::clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<long long>(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
}

int Bound(int type, uint16_t port) {
  int fd = ::socket(AF_INET, type | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    return -1;
  }
  const int on = 1;
  ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &on, sizeof(on));
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  address.sin_addr.s_addr = htonl(INADDR_ANY);
  if (::bind(fd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) !=
          0 ||
      (type == SOCK_STREAM && ::listen(fd, 16) != 0)) {
    ::close(fd);
    return -1;
  }
  return fd;
}

// In the child, after fork: system calls only (no allocation), then _exit.
[[noreturn]] void ServeInChild(const char *nsPath, int stopRead, int readyWrite,
                               const char *name, uint32_t address,
                               uint16_t tcpPort, long long lifetimeMs) {
  int nsFd = ::open(nsPath, O_RDONLY | O_CLOEXEC);
  if (nsFd < 0 || ::setns(nsFd, CLONE_NEWNET) != 0) {
    ::_exit(kChildNoNamespace);
  }
  ::close(nsFd);
  const int udp = Bound(SOCK_DGRAM, 53);
  if (udp < 0) {
    ::_exit(kChildNoUdp);
  }
  const int tcp = Bound(SOCK_STREAM, tcpPort);
  if (tcp < 0) {
    ::_exit(kChildNoTcp);
  }
  (void)!::write(readyWrite, "r", 1);
  ::close(readyWrite);
  const long long deadline = NowMs() + lifetimeMs;
  for (;;) {
    const long long left = deadline - NowMs();
    if (left <= 0) {
      ::_exit(kChildDone);
    }
    pollfd watched[3] = {
        {udp, POLLIN, 0}, {tcp, POLLIN, 0}, {stopRead, POLLIN, 0}};
    const int ready = ::poll(watched, 3, static_cast<int>(left));
    if (ready < 0) {
      if (errno == EINTR) {
        continue;
      }
      ::_exit(kChildDone);
    }
    // The parent closed its end (or ended): stop.
    if (watched[2].revents != 0) {
      ::_exit(kChildDone);
    }
    if (watched[0].revents != 0) {
      uint8_t query[512];
      uint8_t reply[512];
      sockaddr_in from{};
      socklen_t length = sizeof(from);
      const ssize_t got =
          ::recvfrom(udp, query, sizeof(query), 0,
                     reinterpret_cast<sockaddr *>(&from), &length);
      if (got > 0) {
        const std::size_t size =
            zark::test::BuildDnsAnswer(query, static_cast<std::size_t>(got),
                                       name, address, reply, sizeof(reply));
        if (size > 0) {
          ::sendto(udp, reply, size, 0, reinterpret_cast<sockaddr *>(&from),
                   length);
        }
      }
    }
    if (watched[1].revents != 0) {
      const int client = ::accept4(tcp, nullptr, nullptr, SOCK_CLOEXEC);
      if (client >= 0) {
        ::close(client);
      }
    }
  }
}

} // namespace

OutsideServices::OutsideServices(const zark::testnet::TestNetwork &network,
                                 std::string name, const std::string &address,
                                 uint16_t tcpPort,
                                 std::chrono::seconds maxLifetime)
    : mName(std::move(name)) {
  in_addr parsed{};
  if (::inet_pton(AF_INET, address.c_str(), &parsed) != 1) {
    mWhy = "not an address: " + address;
    return;
  }
  const std::string nsPath = "/run/netns/" + network.outsideNs;
  int stop[2] = {-1, -1};
  int ready[2] = {-1, -1};
  if (::pipe2(stop, O_CLOEXEC) != 0 || ::pipe2(ready, O_CLOEXEC) != 0) {
    mWhy = std::string("pipe2: ") + std::strerror(errno);
    return;
  }
  const long long lifetimeMs =
      std::chrono::duration_cast<std::chrono::milliseconds>(maxLifetime)
          .count();
  mPid = ::fork();
  if (mPid == 0) {
    ::close(stop[1]);
    ::close(ready[0]);
    ServeInChild(nsPath.c_str(), stop[0], ready[1], mName.c_str(),
                 ntohl(parsed.s_addr), tcpPort, lifetimeMs);
  }
  ::close(stop[0]);
  ::close(ready[1]);
  mStopWrite = stop[1];
  if (mPid < 0) {
    mWhy = std::string("fork: ") + std::strerror(errno);
    ::close(ready[0]);
    return;
  }
  // The child binds within milliseconds; 5 s bounds a stuck one.
  pollfd watched{ready[0], POLLIN, 0};
  char byte = 0;
  if (::poll(&watched, 1, 5000) == 1 && ::read(ready[0], &byte, 1) == 1) {
    mRunning = true;
  } else {
    mWhy = "the outside services did not start";
  }
  ::close(ready[0]);
  if (!mRunning) {
    Stop();
  }
}

OutsideServices::~OutsideServices() {
  Stop();
}

void OutsideServices::Stop() {
  if (mStopWrite >= 0) {
    ::close(mStopWrite);
    mStopWrite = -1;
  }
  if (mPid <= 0) {
    return;
  }
  // It stops as soon as it sees the pipe closed; 2 s of grace, then kill.
  const Clock::time_point deadline = Clock::now() + std::chrono::seconds(2);
  int status = 0;
  for (;;) {
    const pid_t done = ::waitpid(mPid, &status, WNOHANG);
    if (done == mPid || (done < 0 && errno != EINTR)) {
      break;
    }
    if (Clock::now() > deadline) {
      ::kill(mPid, SIGKILL);
      ::waitpid(mPid, &status, 0);
      break;
    }
    ::usleep(1000);
  }
  if (!mRunning && WIFEXITED(status) &&
      mWhy.find("exit") == std::string::npos) {
    mWhy += " (child exit " + std::to_string(WEXITSTATUS(status)) + ")";
  }
  mPid = -1;
}

} // namespace zark::integration
