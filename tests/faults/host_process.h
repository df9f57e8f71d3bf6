// The real web API host of this build (zark-webapid) as a child process of
// the test, serving the build's ZARK.Core.PortForwarding.so on 127.0.0.1 of
// the server namespace, and a browser's session with it over HTTP.
#ifndef ZARK_TESTS_FAULTS_HOST_PROCESS_H
#define ZARK_TESTS_FAULTS_HOST_PROCESS_H

#include <json/json.h>
#include <sys/types.h>

#include <map>
#include <memory>
#include <string>

namespace httplib {
class Client;
}

namespace zark::faults {

// Where the host's files go: its module folder, accounts file and output.
inline constexpr char kHostFolder[] = "/tmp/faults-host";

// Makes the account user (group admin) in the host's accounts file with
// the host's own "zark-webapid passwd". False, with why set, on failure.
bool CreateHostAccount(const std::string &user, const std::string &password,
                       std::string &why);

class HostProcess {
public:
  HostProcess();
  HostProcess(const HostProcess &) = delete;
  HostProcess &operator=(const HostProcess &) = delete;
  // Kills a host still running.
  ~HostProcess();

  // Starts the host with the build's module on a free port of 127.0.0.1
  // and waits (at most 30 s) until it answers. The host dies with the test
  // process. False, with why set, when it does not come up.
  bool Start(std::string &why);
  // SIGKILL, then reaps it.
  void Kill();

  // Logs in (auth.cgi); keeps the session's cookie and token.
  bool Login(const std::string &user, const std::string &password,
             std::string &why);
  // entry.cgi by POST: api, version 1, method and fields (values as the
  // wire protocol reads them: JSON text, or a plain string). The answer's
  // JSON, or null when the host did not answer with JSON.
  Json::Value Call(const std::string &api, const std::string &method,
                   const std::map<std::string, std::string> &fields = {});

  // What the host wrote to its standard output and error, for messages.
  std::string Output() const;

private:
  pid_t mPid = -1;
  int mPort = -1;
  int mRun = 0;
  std::string mOutputPath;
  std::unique_ptr<httplib::Client> mClient;
  std::string mCookie;
  std::string mToken;
};

} // namespace zark::faults

#endif
