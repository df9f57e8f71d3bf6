// The integration tests' view of the test network that testnet.sh brings up
// around the test process (which runs in its server namespace): addresses,
// namespace names, running code in the outside namespace, listeners on the
// server, and the real router clients upnpc and natpmpc.
#ifndef ZARK_TESTS_NETNS_TEST_NETWORK_H
#define ZARK_TESTS_NETNS_TEST_NETWORK_H

#include <atomic>
#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace zark::testnet {

struct TestNetwork {
  std::string serverNs;
  std::string routerNs;
  std::string outsideNs;
  std::string wanRouter;  // the router's outside address
  std::string wanOutside; // the outside host's address
  std::string lanRouter;  // the gateway
  std::string lanServer;  // this process's address
  std::string rootDesc;   // the router's UPnP root description URL
};

// The network testnet.sh described in the environment, or nothing when the
// process was not started by it.
std::optional<TestNetwork> CurrentNetwork();

enum class Protocol { kTcp, kUdp };

// From the outside namespace, sends a probe to address:port and waits (at
// most timeout) for the reply of an EchoListener. True when the reply came
// back: the port is forwarded to the listener. Runs in a child process that
// enters the outside namespace; the calling process stays where it is.
bool ProbeFromOutside(
    const TestNetwork &network, Protocol protocol, const std::string &address,
    uint16_t port,
    std::chrono::milliseconds timeout = std::chrono::milliseconds(2000));

// A listener on every address of this (the server) namespace that answers
// each TCP connection's first line, or each UDP datagram, with "echo:" and
// what it got. Stopped and joined by its destructor.
class EchoListener {
public:
  EchoListener(Protocol protocol, uint16_t port);
  EchoListener(const EchoListener &) = delete;
  EchoListener &operator=(const EchoListener &) = delete;
  ~EchoListener();
  bool Listening() const { return mFd >= 0; }
  int Answered() const { return mAnswered.load(); }

private:
  void Serve();
  Protocol mProtocol;
  int mFd = -1;
  int mStopPipe[2] = {-1, -1};
  std::atomic<int> mAnswered{0};
  std::thread mThread;
};

// One mapping as "upnpc -l" lists it.
struct UpnpMapping {
  std::string protocol; // "TCP" / "UDP"
  int externalPort = 0;
  std::string internalAddress;
  int internalPort = 0;
  std::string description;
  long lease = 0;

  bool operator<(const UpnpMapping &other) const;
};

// Runs "upnpc -u <root description> -l" and parses its listing. False when
// upnpc fails.
bool ListUpnpMappings(const TestNetwork &network,
                      std::vector<UpnpMapping> &mappings,
                      std::string *rawOutput = nullptr);

// A program running in the outside namespace (the internet side of the
// router) for as long as the object lives, such as the probe service. It
// is started in a child process that enters the outside network namespace
// and executes args (args[0] an absolute path); it inherits no descriptor
// but standard input, output and error, and is killed when the test
// process dies. The destructor stops it: SIGTERM, then SIGKILL after
// stopWait, and reaps it.
class OutsideProcess {
public:
  OutsideProcess(
      const TestNetwork &network, std::vector<std::string> args,
      std::chrono::milliseconds stopWait = std::chrono::milliseconds(2000));
  OutsideProcess(const OutsideProcess &) = delete;
  OutsideProcess &operator=(const OutsideProcess &) = delete;
  ~OutsideProcess();

  // False when the process could not be started, or has ended.
  bool Running();
  // Waits, at most timeout, until a TCP connection from this (the server)
  // namespace to address:port succeeds: the program listens and the
  // router passes it. False when it does not in time or the program ended.
  bool WaitForTcp(
      const std::string &address, uint16_t port,
      std::chrono::milliseconds timeout = std::chrono::milliseconds(5000));

private:
  int mPid = -1;
  std::chrono::milliseconds mStopWait;
};

// Runs a program (absolute path) and returns its exit status (-1 when it
// could not run or timed out), with its output in output.
int RunTool(
    const std::vector<std::string> &args, std::string &output,
    std::chrono::milliseconds timeout = std::chrono::milliseconds(10000));

} // namespace zark::testnet

#endif
