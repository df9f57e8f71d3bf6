// Helpers of the module frame tests: calling a method through the module's
// own table, checking log lines by source file, and driving background
// tasks through the host's polling facility.
#ifndef ZARK_TESTS_MODULE_MODULE_TEST_H
#define ZARK_TESTS_MODULE_MODULE_TEST_H

#include "ZARK.Core.PortForwarding.h"
#include "webapi.h"

#include <json/json.h>
#include <syslog.h>

#include <atomic>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

namespace zark::moduletest {

inline constexpr char kModuleFile[] = "src/ZARK.Core.PortForwarding.cpp";
inline constexpr char kReporterFile[] = "src/StatusReportor.cpp";
inline constexpr char kPortForwardingFile[] = "src/PortForwarding.cpp";

// Most polls of a status method, and the pause between two.
inline constexpr int kMaxPolls = 500;
inline constexpr int kPollPauseMs = 10;

Json::Value ParseJson(const std::string &text);

// The entry function of a row of gTable, or NULL.
ZARK_API_HANDLER FindHandler(const std::string &api, const std::string &method);

// Calls the entry function of (api, method); a missing row fails the test.
void CallMethod(const std::string &api, const std::string &method,
                ZARK::APIRequest *request, ZARK::APIResponse *response);

// Captured lines whose text is exactly "<file>:<line> <text>" (any line
// number) at the given priority.
int CountLogs(const std::string &file, const std::string &text,
              int priority = LOG_ERR);
// Index of the first such line at or after `from` among all captured lines,
// or -1.
int FindLog(const std::string &file, const std::string &text, int from = 0,
            int priority = LOG_ERR);
// Every captured line, one per line, for failure messages.
std::string DumpLogs();

// The answer of a response, copied.
struct Answer {
  ZARK::APIResponse::State state = ZARK::APIResponse::State::None;
  Json::Value data;
  int code = 0;
  Json::Value errorData;
};
Answer AnswerOf(const ZARK::APIResponse &response);

// Calls (api, method) with params and returns the answer.
Answer Invoke(const std::string &api, const std::string &method,
              const Json::Value &params);

// Starts a background method; returns the task id of the answer, or "" after
// failing the test.
std::string StartTask(const std::string &api, const std::string &method,
                      const Json::Value &params);

// Whether the host still holds a record for the task.
bool TaskExists(const std::string &taskId);

// Waits (bounded) until the task's record says finished.
bool WaitTaskFinished(const std::string &taskId);

// Polls the status method with the task id until a poll removes the task
// (the poll that first sees it finished); returns that poll's answer. Fails
// the test when the task is still there after kMaxPolls polls.
Answer PollUntilSwept(const std::string &api, const std::string &method,
                      const std::string &taskId);

// Polls once.
Answer PollOnce(const std::string &api, const std::string &method,
                const std::string &taskId);

// Ids of the tasks of group "admin" whose id matches prefix.
std::vector<std::string> ListTasks(const std::string &prefix,
                                   const std::string &group = "admin");

// Stops and removes every task of the groups used by the tests, then joins
// every task thread.
void RemoveAllTasks();

// A point where a fake or a test task waits until the test lets it go. The
// wait is bounded: after about ten seconds the waiter goes on by itself.
class Gate {
public:
  void Wait();        // called by the task
  bool WaitReached(); // test: true once a task waits (bounded)
  void Open();        // test: lets every waiter go
  bool Reached() const { return mReached.load(); }

private:
  std::atomic<bool> mReached{false};
  std::atomic<bool> mOpen{false};
};

// Starts a task of the host directly (not through the module), so that
// tests can shape its record. The callback is a plain function; `argument`
// reaches it unchanged.
std::string StartRawTask(const std::string &prefix, const std::string &group,
                         ZARK::APIPollingCallback callback, void *argument);

// Records every answer set on a response, in order.
class AnswerRecorder : public ZARK::APIResponse::Listener {
public:
  struct Event {
    bool success;
    int code;
    Json::Value data;
  };
  void OnSuccess(const Json::Value &data) override;
  void OnError(int code, const Json::Value &errors) override;
  std::vector<Event> Events() const;

private:
  mutable std::mutex mMutex;
  std::vector<Event> mEvents;
};

} // namespace zark::moduletest

#endif
