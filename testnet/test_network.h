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
  // How to reach testnet.sh's router commands (empty when the network was
  // started by an older testnet.sh): the network's name, its state folder
  // and the script's absolute path.
  std::string name;
  std::string stateDir;
  std::string script;
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

// Breaking the router on purpose (fault tests). Each waits for what it
// started, bounded, and returns false with why set when it failed.

// Stops the router daemon (miniupnpd): kill false sends SIGTERM (a clean
// shutdown), true SIGKILL (a crash); either way the kernel keeps the
// forwarding rules it made, and its lease file is kept for
// StartRouterDaemon. Waits at most 3 s for it to end.
[[nodiscard]] bool StopRouterDaemon(const TestNetwork &network, bool kill,
                                    std::string *why = nullptr);

// Empties the router's nftables chains of the daemon: with the daemon
// stopped, what a router that reboots loses.
[[nodiscard]] bool FlushRouterMappings(const TestNetwork &network,
                                       std::string *why = nullptr);

// Starts the router daemon again after StopRouterDaemon and waits until it
// listens (at most 5 s). keepLeases: with the lease file the stopped
// daemon left (a restart); otherwise with none (a fresh start).
[[nodiscard]] bool StartRouterDaemon(const TestNetwork &network,
                                     bool keepLeases,
                                     std::string *why = nullptr);

// Freezes (SIGSTOP) or thaws (SIGCONT) the router daemon: while frozen,
// connections to it are accepted by the kernel and then left unanswered,
// which holds a job at its next router request.
[[nodiscard]] bool PauseRouterDaemon(const TestNetwork &network, bool pause,
                                     std::string *why = nullptr);

// Takes the router's LAN link down (this namespace's link to the router
// loses its carrier; nothing passes either way) and brings it back up,
// with the route of the router's SSDP answers that going down removed.
[[nodiscard]] bool CutRouterLan(const TestNetwork &network,
                                std::string *why = nullptr);
[[nodiscard]] bool RestoreRouterLan(const TestNetwork &network,
                                    std::string *why = nullptr);

} // namespace zark::testnet

#endif
