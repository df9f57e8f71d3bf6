// Shared pieces of the security suite: the real zark-webapid executable run
// with a syslog of the test's own, calls to it over HTTP, snapshots of the
// folders the module and its library write, and listeners that count who
// knocked (also in another network namespace of the test network).
//
// Everything runs inside the hermetic test process's private mount
// namespace and, under CTest, in the server namespace of a test network of
// its own (testnet/run-in-testnet.sh).
#ifndef ZARK_TESTS_SECURITY_SUPPORT_H
#define ZARK_TESTS_SECURITY_SUPPORT_H

#include <json/json.h>
#include <sys/socket.h>
#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <vector>

namespace zark::security {

// The build's programs and module.
inline const std::string kWebapid = SECURITY_WEBAPID;
inline const std::string kBuiltModule = SECURITY_PORTFORWARDING_MODULE;
inline const std::string kProbed = SECURITY_PROBED;
inline const std::string kPortForwardToolBuilt = SECURITY_PORTFORWARD_TOOL;

// The folder of the suite's own files (sockets, accounts, program output);
// the "no effect" and "no password" checks leave it out where they say so.
inline const std::string kWorkDir = "/tmp/zark-security";

// One row of a module's method table.
struct MethodRow {
  std::string api;
  int version = 0;
  std::string method;
};

// The rows of the table that GetAPITable of the module file returns, read
// the way the host reads them (up to the all-zero row, at most 4096).
// Empty, with why set, when the module cannot be loaded.
std::vector<MethodRow> ReadModuleTable(const std::string &modulePath,
                                       std::string &why);

// A datagram socket that stands in for /dev/log of the programs this suite
// starts: every syslog line they write is kept.
class SyslogSink {
public:
  SyslogSink();
  ~SyslogSink();
  SyslogSink(const SyslogSink &) = delete;
  SyslogSink &operator=(const SyslogSink &) = delete;

  [[nodiscard]] bool Ok() const { return mFd >= 0; }
  [[nodiscard]] const std::string &Path() const { return mPath; }
  // Every line received so far, as sent ("<priority>date tag[pid]: text").
  [[nodiscard]] std::vector<std::string> Lines() const;
  // Waits (bounded) until no datagram has come for quiet.
  void Settle(std::chrono::milliseconds quiet = std::chrono::milliseconds(100));

private:
  void Serve();
  std::string mPath;
  int mFd = -1;
  int mWake[2] = {-1, -1};
  mutable std::mutex mMutex;
  std::vector<std::string> mLines;
  std::chrono::steady_clock::time_point mLast;
  std::thread mThread;
};

// How a program is started: in a mount namespace of its own whose /dev is
// a fresh tmpfs holding the usual character devices and a /dev/log that
// leads to sink, with the given umask, standard output and error appended
// to outputFile, and standard input from inputText. It and everything it
// starts (the module's tools) log to sink.
struct LaunchOptions {
  std::vector<std::string> args; // args[0]: absolute path of the program
  const SyslogSink *sink = nullptr;
  mode_t umask = 022;
  std::string outputFile;
  std::optional<std::string> inputText;
};

// Starts the program; -1 (why set) when it cannot be started.
pid_t Launch(const LaunchOptions &options, std::string &why);

// Waits, at most limit, for pid to end; kills it when it does not. Its wait
// status, or -1 when it had to be killed.
int WaitForExit(pid_t pid, std::chrono::milliseconds limit);

// Runs a program to its end (at most limit). Its exit status; -1 when it
// could not run, did not exit normally or had to be killed.
int RunToEnd(const LaunchOptions &options, std::chrono::milliseconds limit,
             std::string &why);

// A port on 127.0.0.1 that was free a moment ago.
int FreeLoopbackPort();

// An account of the host's accounts file.
struct HostAccount {
  std::string user;
  std::string password;
  std::string group;
};
inline const HostAccount kAdminAccount{"admin", "Adm1n-Secur1ty", "admin"};
inline const HostAccount kViewerAccount{"viewer", "V1ewer-Secur1ty", "users"};

// Writes an accounts file (mode 0600) with these accounts, hashed at
// libcrypt's lowest yescrypt cost so that logins stay quick.
bool WriteAccountsFile(const std::string &path,
                       const std::vector<HostAccount> &accounts);

// A logged-in browser: the session cookie and the token.
struct HostSession {
  std::string sessionId;
  std::string token;
};

// An answer of the host: HTTP status, raw body, and the body as JSON.
struct HostAnswer {
  int httpStatus = 0;
  std::string body;
  std::string setCookie; // the Set-Cookie header, when there is one
  Json::Value json;
  [[nodiscard]] bool Success() const { return json["success"].asBool(); }
  // The error code, or 0 for a success or an answer without one.
  [[nodiscard]] int Code() const;
};

// URL-encodes text for a form.
std::string FormEncode(const std::string &text);

// The real zark-webapid on 127.0.0.1, serving the build's module from a
// copy of it in kWorkDir, with its own syslog (Log()). Stopped (SIGTERM,
// bounded wait, then SIGKILL) by its destructor at the latest.
class HostProcess {
public:
  explicit HostProcess(mode_t umask = 022);
  ~HostProcess();
  HostProcess(const HostProcess &) = delete;
  HostProcess &operator=(const HostProcess &) = delete;

  // Writes the accounts (admin and viewer), starts the host and waits until
  // it answers. False, with why, when it does not.
  [[nodiscard]] bool Start(std::string &why);
  // SIGTERM and a bounded wait: the wait status, -1 when it had to be
  // killed.
  int Stop();

  [[nodiscard]] pid_t Pid() const { return mPid; }
  // The port it listens on (127.0.0.1), once started.
  [[nodiscard]] int Port() const { return mPort; }
  [[nodiscard]] SyslogSink &Log() { return mSink; }
  // The host's syslog lines and its standard output and error.
  [[nodiscard]] std::vector<std::string> LogLines() const;

  // Logs in; nullopt when the login does not succeed.
  [[nodiscard]] std::optional<HostSession> Login(const HostAccount &account);

  // POSTs form fields (already encoded) to endpoint ("/webapi/entry.cgi"),
  // with the session's cookie when there is a session, and the token
  // header when token is set.
  [[nodiscard]] HostAnswer Post(const std::string &endpoint,
                                const std::string &fields,
                                const std::optional<std::string> &cookie,
                                const std::optional<std::string> &token);
  // The same as a GET with the fields in the query string.
  [[nodiscard]] HostAnswer Get(const std::string &endpoint,
                               const std::string &fields,
                               const std::optional<std::string> &cookie,
                               const std::optional<std::string> &token);
  // An entry.cgi call as a logged-in browser makes it.
  [[nodiscard]] HostAnswer Call(const HostSession &session,
                                const std::string &fields);

private:
  [[nodiscard]] HostAnswer Send(bool post, const std::string &endpoint,
                                const std::string &fields,
                                const std::optional<std::string> &cookie,
                                const std::optional<std::string> &token);

  mode_t mUmask;
  SyslogSink mSink;
  pid_t mPid = -1;
  int mPort = 0;
  std::string mOutputFile;
};

// The fields of an entry.cgi call of row.
std::string RowFields(const MethodRow &row);

// Waits (bounded) for the background task a start answer named to finish
// and be swept, polling statusMethod of api as session. The last status
// answer (an error: the record is gone, or the task's own error).
HostAnswer WaitForTask(HostProcess &host, const HostSession &session,
                       const std::string &api, const std::string &statusMethod,
                       const HostAnswer &started,
                       std::chrono::seconds limit = std::chrono::seconds(60));

// Every regular file and folder under roots (skipping paths that begin with
// one of excluded), each described by its type, mode, size and content, so
// that two snapshots differ when anything was created, removed, changed or
// had its mode changed.
using TreeSnapshot = std::map<std::string, std::string>;
TreeSnapshot SnapshotTrees(const std::vector<std::string> &roots,
                           const std::vector<std::string> &excluded);
// What changed from before to after, one line per path; empty when nothing.
std::string DescribeChanges(const TreeSnapshot &before,
                            const TreeSnapshot &after);

// The folders that the module, its library and its tools write.
std::vector<std::string> ModuleWrittenRoots();

// Every regular file under roots with its content (paths beginning with one
// of excluded left out).
std::map<std::string, std::string>
ReadAllFiles(const std::vector<std::string> &roots,
             const std::vector<std::string> &excluded);

// A socket made in another network namespace (/run/netns/<name>), bound to
// address:port; -1 when that fails. type: SOCK_STREAM (listening) or
// SOCK_DGRAM. The calling thread's own namespace is not changed.
int BoundSocketInNamespace(const std::string &netns, int type,
                           const std::string &address, uint16_t port);
// The same in the calling thread's own namespace ("0.0.0.0", "::1", ...).
int BoundSocket(int type, const std::string &address, uint16_t port);
// The port a socket is bound to.
uint16_t BoundPort(int fd);

// Serves one bound socket on a thread of its own and counts what reaches
// it: accepted TCP connections (each answered with reply and closed), or
// UDP datagrams (each answered with replyFor(datagram) when that is not
// empty). Joined by its destructor.
class CountingListener {
public:
  using UdpReply = std::string (*)(const std::string &datagram,
                                   const std::string &token);
  // Takes fd over. token: what TCP connections get ("<token>\n") and what
  // udpReply gets.
  CountingListener(int fd, std::string token = "", UdpReply udpReply = nullptr);
  ~CountingListener();
  CountingListener(const CountingListener &) = delete;
  CountingListener &operator=(const CountingListener &) = delete;

  [[nodiscard]] bool Ok() const { return mFd >= 0; }
  [[nodiscard]] uint16_t Port() const { return mPort; }
  [[nodiscard]] int Seen() const { return mSeen.load(); }

private:
  void Serve();
  int mFd = -1;
  bool mTcp = true;
  uint16_t mPort = 0;
  std::string mToken;
  UdpReply mUdpReply;
  int mWake[2] = {-1, -1};
  std::atomic<int> mSeen{0};
  std::thread mThread;
};

} // namespace zark::security

#endif
