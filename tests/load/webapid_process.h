// The zark-webapid executable of the build, started as a child process on
// 127.0.0.1 with the real module ZARK.Core.PortForwarding.so and one
// administrator account, for the load test and the status poll benchmark.
// The child inherits the caller's namespaces, so it sees the same fixed
// paths (the caller's private mount namespace) and network.
#ifndef ZARK_TESTS_LOAD_WEBAPID_PROCESS_H
#define ZARK_TESTS_LOAD_WEBAPID_PROCESS_H

#include <sys/types.h>

#include <chrono>
#include <string>

namespace zark::load {

struct HostSetup {
  std::string executable; // the built zark-webapid
  std::string module;     // the built ZARK.Core.PortForwarding.so
  std::string folder;     // made afresh: module folder and accounts file
  std::string account = "admin";
  std::string password;
  int threads = 0; // request threads; 0 leaves the host's default
};

class WebapidProcess {
public:
  explicit WebapidProcess(HostSetup setup);
  WebapidProcess(const WebapidProcess &) = delete;
  WebapidProcess &operator=(const WebapidProcess &) = delete;
  // Stops the host (Stop with a 30 s wait) if it still runs.
  ~WebapidProcess();

  // Makes the folder (a copy of the module in "modules", an accounts file
  // with the account in group admin, mode 0600), starts the host on a free
  // port of 127.0.0.1 and waits, at most wait, until "/" answers 200.
  // False, with the reason in why, when a file cannot be made, the host
  // cannot start, ends, or does not answer in time (it is killed then).
  [[nodiscard]] bool Start(std::chrono::seconds wait, std::string &why);

  // True while the child runs.
  [[nodiscard]] bool Running();

  // SIGTERM, then waits at most wait for the host to end (it answers what
  // it is handling and joins its task threads first). Its wait status, or
  // -1 when it had to be killed or was not running.
  int Stop(std::chrono::seconds wait);

  [[nodiscard]] int Port() const { return mPort; }
  [[nodiscard]] const HostSetup &Setup() const { return mSetup; }

private:
  HostSetup mSetup;
  pid_t mPid = -1;
  int mPort = -1;
};

// A yescrypt hash of password at the lowest cost, so that logins stay
// quick; empty when libcrypt fails.
std::string QuickPasswordHash(const std::string &password);

} // namespace zark::load

#endif
