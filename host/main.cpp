// zark-webapid: the web API host. Loads the module shared objects of a
// folder and serves their methods over HTTP to logged-in administrators;
// "zark-webapid passwd" sets account passwords.
#include "host_log.h"
#include "host_options.h"
#include "http_server.h"
#include "login_service.h"
#include "login_throttle.h"
#include "module_registry.h"
#include "passwd_command.h"
#include "request_handler.h"
#include "session_store.h"

#include "webapi.h"

#include <pthread.h>
#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <iostream>
#include <string>
#include <thread>
#include <vector>

namespace {

using namespace zark::host;

// Waits for SIGTERM or SIGINT (blocked in every thread, so only this one
// takes them) and stops the server. Dismiss() ends the wait without a
// signal when the server ended by itself.
class SignalWaiter {
public:
  SignalWaiter(HttpServer &server, const sigset_t &signals)
      : mServer(server), mSignals(signals), mThread([this] { Wait(); }) {}
  ~SignalWaiter() { Dismiss(); }
  SignalWaiter(const SignalWaiter &) = delete;
  SignalWaiter &operator=(const SignalWaiter &) = delete;

  void Dismiss() {
    if (!mThread.joinable()) {
      return;
    }
    mDismissed = true;
    // The waiter sits in sigwait() for SIGTERM, blocked in every thread: the
    // signal is taken by sigwait, nothing is terminated.
    // NOLINTNEXTLINE(bugprone-bad-signal-to-kill-thread)
    pthread_kill(mThread.native_handle(), SIGTERM);
    mThread.join();
  }

private:
  void Wait() {
    int signal = 0;
    int error = sigwait(&mSignals, &signal);
    if (error != 0) {
      HOST_LOG(LOG_ERR, "sigwait failed (%d); SIGTERM will not stop the host",
               error);
      return;
    }
    if (!mDismissed) {
      HOST_LOG(LOG_INFO, "stopping on signal %d", signal);
      mServer.Stop();
    }
  }

  HttpServer &mServer;
  const sigset_t mSignals;
  std::atomic<bool> mDismissed{false};
  std::thread mThread;
};

// Asks every background task of the administrators' group to stop, so that
// JoinAll does not wait for tasks that would notice.
void AskTasksToStop() {
  ZARK::APIPolling polling;
  Json::Value groups(Json::arrayValue);
  groups.append("admin");
  Json::Value tasks;
  if (!polling.List("", groups, tasks)) {
    return;
  }
  for (const Json::Value &id : tasks["admin"]) {
    if (id.isString()) {
      polling.Stop(id.asString(), false);
    }
  }
}

int Serve(const HostOptions &options) {
  ModuleRegistry modules;
  modules.LoadFolder(options.modulesFolder);
  if (modules.ModuleCount() == 0) {
    HOST_LOG(LOG_WARNING, "no module loaded from %s; serving none",
             options.modulesFolder.c_str());
  }
  modules.StartModules(options.modules);
  SteadyClock clock;
  SessionStore sessions(clock, options.sessions);
  LoginThrottle throttle(clock, ThrottlePolicy{});
  LoginService logins(options.accountsFile, sessions, throttle);
  RequestLimits limits;
  limits.maxBodyBytes = options.http.maxBodyBytes;
  RequestHandler handler(modules, sessions, logins, limits,
                         options.secureCookie);
  HttpServer server(handler, options.http);
  if (!server.Bind()) {
    return 1;
  }

  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGTERM);
  sigaddset(&signals, SIGINT);
  bool served = false;
  {
    SignalWaiter waiter(server, signals);
    served = server.Serve();
  }
  // Module code may still run in task threads: join them before the
  // modules are unloaded (when modules goes out of scope).
  AskTasksToStop();
  modules.StopModules();
  ZARK::APIPolling::JoinAll();
  HOST_LOG(LOG_INFO, "stopped");
  return served ? 0 : 1;
}

} // namespace

int main(int argc, char **argv) {
  std::vector<std::string> args(argv + 1, argv + argc);
  if (!args.empty() && args.front() == "passwd") {
    openlog("zark-webapid", LOG_PID, LOG_AUTHPRIV);
    bool terminal = isatty(STDIN_FILENO) == 1;
    PasswordInput input{std::cin, terminal, STDIN_FILENO, &std::cerr};
    int status = RunPasswdCommand(std::span(args).subspan(1), input, std::cerr);
    closelog();
    return status;
  }

  HostOptions options;
  std::string error;
  switch (ParseHostOptions(args, options, error)) {
  case OptionsResult::Help:
    std::cout << HostUsage("zark-webapid");
    return 0;
  case OptionsResult::Error:
    std::cerr << "zark-webapid: " << error << "\n" << HostUsage("zark-webapid");
    return 2;
  case OptionsResult::Run:
    break;
  }

  openlog("zark-webapid", LOG_PID | LOG_NDELAY, LOG_DAEMON);
  // Before any thread starts: every thread inherits the mask, so only the
  // waiter takes the stop signals. A client that goes away must not kill
  // the host with SIGPIPE.
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGTERM);
  sigaddset(&signals, SIGINT);
  pthread_sigmask(SIG_BLOCK, &signals, nullptr);
  signal(SIGPIPE, SIG_IGN);

  int status = Serve(options);
  closelog();
  return status;
}
