// The real zark-webapid against clients that attack it through the login,
// through a victim's browser and through the framing of their requests:
// a stranger's failed logins from another address, a login form of another
// site, an encoded NUL in a path, a chunked body without end. Each request
// is written by hand over TCP from a chosen loopback address; every wait is
// bounded.
#include "hermetic.h"
#include "security_support.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <memory>
#include <string>

namespace zark::security {
namespace {

// One request from source (a loopback address) to the host; what came back
// within wait (the connection is closed by the host or the wait ends).
// Sends as much of request as the host takes.
std::string Exchange(int port, const std::string &source,
                     const std::string &request,
                     std::chrono::milliseconds wait) {
  const int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    ADD_FAILURE() << "socket: " << std::strerror(errno);
    return "";
  }
  sockaddr_in from{};
  from.sin_family = AF_INET;
  inet_pton(AF_INET, source.c_str(), &from.sin_addr);
  sockaddr_in to{};
  to.sin_family = AF_INET;
  to.sin_port = htons(static_cast<std::uint16_t>(port));
  inet_pton(AF_INET, "127.0.0.1", &to.sin_addr);
  if (::bind(fd, reinterpret_cast<sockaddr *>(&from), sizeof from) != 0 ||
      ::connect(fd, reinterpret_cast<sockaddr *>(&to), sizeof to) != 0) {
    ADD_FAILURE() << "connect from " << source << ": " << std::strerror(errno);
    ::close(fd);
    return "";
  }
  std::size_t sent = 0;
  while (sent < request.size()) {
    pollfd out{fd, POLLOUT, 0};
    if (::poll(&out, 1, 500) != 1) {
      break; // the host stopped reading
    }
    ssize_t n = ::send(fd, request.data() + sent, request.size() - sent,
                       MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n <= 0) {
      break;
    }
    sent += static_cast<std::size_t>(n);
  }
  std::string answer;
  const auto deadline = std::chrono::steady_clock::now() + wait;
  for (;;) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    pollfd in{fd, POLLIN, 0};
    if (left.count() <= 0 ||
        ::poll(&in, 1, static_cast<int>(left.count())) != 1) {
      break;
    }
    char buffer[4096];
    ssize_t n = ::recv(fd, buffer, sizeof buffer, MSG_DONTWAIT);
    if (n <= 0) {
      break;
    }
    answer.append(buffer, static_cast<std::size_t>(n));
  }
  ::close(fd);
  return answer;
}

std::string LoginRequest(int port, const HostAccount &account,
                         const std::string &password,
                         const std::string &extraHeaders = "") {
  const std::string body = "method=login&account=" + FormEncode(account.user) +
                           "&passwd=" + FormEncode(password);
  return "POST /webapi/auth.cgi HTTP/1.1\r\nHost: 127.0.0.1:" +
         std::to_string(port) +
         "\r\nConnection: close\r\n"
         "Content-Type: application/x-www-form-urlencoded\r\n" +
         extraHeaders + "Content-Length: " + std::to_string(body.size()) +
         "\r\n\r\n" + body;
}

bool LoggedIn(const std::string &answer) {
  return answer.find("\"success\":true") != std::string::npos &&
         answer.find("Set-Cookie: id=") != std::string::npos;
}

class SecurityHostileClient : public testing::Test {
protected:
  void SetUp() override {
    zark::test::ResetFixedPaths();
    // After the reset, which empties /tmp where its syslog socket lives.
    mProcess = std::make_unique<HostProcess>();
    std::string why;
    ASSERT_TRUE(mProcess->Start(why)) << why;
  }
  std::unique_ptr<HostProcess> mProcess;
};

TEST_F(SecurityHostileClient,
       StrangersFailedLoginsDoNotKeepTheAdministratorOut) {
  const int port = mProcess->Port();
  for (int guess = 0; guess < 6; ++guess) {
    (void)Exchange(
        port, "127.0.0.66",
        LoginRequest(port, kAdminAccount, "guess" + std::to_string(guess)),
        std::chrono::seconds(5));
  }
  // The stranger's own address waits now...
  EXPECT_NE(Exchange(port, "127.0.0.66",
                     LoginRequest(port, kAdminAccount, kAdminAccount.password),
                     std::chrono::seconds(5))
                .find("\"throttled\""),
            std::string::npos);
  // ...but the administrator, from another address, gets in.
  EXPECT_TRUE(LoggedIn(
      Exchange(port, "127.0.0.2",
               LoginRequest(port, kAdminAccount, kAdminAccount.password),
               std::chrono::seconds(5))));
}

TEST_F(SecurityHostileClient, AnotherSitesLoginFormCannotLogTheBrowserIn) {
  const int port = mProcess->Port();
  std::string answer =
      Exchange(port, "127.0.0.1",
               LoginRequest(port, kAdminAccount, kAdminAccount.password,
                            "Origin: http://evil.example\r\n"),
               std::chrono::seconds(5));
  EXPECT_EQ(answer.rfind("HTTP/1.1 403", 0), 0u) << answer.substr(0, 200);
  EXPECT_FALSE(LoggedIn(answer));
  // A page reached under another name (DNS rebinding) is refused as well.
  answer = Exchange(port, "127.0.0.1",
                    "GET /webapi/query.cgi HTTP/1.1\r\nHost: evil.example:" +
                        std::to_string(port) + "\r\nConnection: close\r\n\r\n",
                    std::chrono::seconds(5));
  EXPECT_EQ(answer.rfind("HTTP/1.1 421", 0), 0u) << answer.substr(0, 200);
}

TEST_F(SecurityHostileClient, EncodedNulInAPathIsRefused) {
  const int port = mProcess->Port();
  const std::string host = "Host: 127.0.0.1:" + std::to_string(port) + "\r\n";
  std::string plain = Exchange(port, "127.0.0.1",
                               "GET /index.html HTTP/1.1\r\n" + host +
                                   "Connection: close\r\n\r\n",
                               std::chrono::seconds(5));
  EXPECT_EQ(plain.rfind("HTTP/1.1 200", 0), 0u) << plain.substr(0, 200);
  std::string nul = Exchange(port, "127.0.0.1",
                             "GET /index.html%00.png HTTP/1.1\r\n" + host +
                                 "Connection: close\r\n\r\n",
                             std::chrono::seconds(5));
  EXPECT_EQ(nul.rfind("HTTP/1.1 400", 0), 0u) << nul.substr(0, 200);
}

TEST_F(SecurityHostileClient, EndlessChunkedBodyIsCutAtTheBound) {
  const int port = mProcess->Port();
  std::string request = "POST /webapi/auth.cgi HTTP/1.1\r\nHost: 127.0.0.1:" +
                        std::to_string(port) +
                        "\r\nContent-Type: application/x-www-form-urlencoded"
                        "\r\nTransfer-Encoding: chunked\r\n\r\n";
  // 1 MiB in chunks of 8 KiB and no last chunk.
  for (int i = 0; i < 128; ++i) {
    request += "2000\r\n" + std::string(8192, 'a') + "\r\n";
  }
  std::string answer =
      Exchange(port, "127.0.0.1", request, std::chrono::seconds(3));
  EXPECT_EQ(answer.rfind("HTTP/1.1 413", 0), 0u) << answer.substr(0, 200);
}

} // namespace
} // namespace zark::security
