// Host web API framework: the request and response objects that the host
// hands to a module's entry functions, and the polling facility that runs
// long operations as background tasks.
//
// This is a shared library: the host and every module link the same copy,
// so a process has exactly one task registry.
#ifndef ZARK_PLATFORM_WEBAPI_H
#define ZARK_PLATFORM_WEBAPI_H

#include <json/json.h>

#include <chrono>
#include <cstddef>
#include <memory>
#include <string>

namespace ZARK {

// Error codes that the framework itself writes into a task record or a
// response. None of them equals a code that a module answers.
enum WebAPIError {
  WEBAPI_ERR_UNKNOWN = 100,        // internal error of the host or framework
  WEBAPI_ERR_BAD_REQUEST = 101,    // a required field is missing or malformed
  WEBAPI_ERR_NO_SUCH_API = 102,    // the API name is not served
  WEBAPI_ERR_NO_SUCH_METHOD = 103, // the API has no such method
  WEBAPI_ERR_BAD_VERSION = 104,    // the API does not serve this version
  WEBAPI_ERR_NOT_ALLOWED = 105,    // the caller may not use this method
  WEBAPI_ERR_NOT_LOGGED_IN = 106,  // no valid session
  WEBAPI_ERR_BAD_TOKEN = 107,      // the session's token is missing or wrong
  WEBAPI_ERR_TOO_LARGE = 108,      // request beyond the size bounds
  WEBAPI_ERR_NO_ANSWER = 109,      // the method finished without answering
  WEBAPI_ERR_TASK_EXCEPTION = 110, // a background task's callback threw
  WEBAPI_ERR_TASK_START = 111,     // a background task could not be started
};

// One API request: its parameters (a JSON object, one member per
// parameter) and who sent it.
class APIRequest {
public:
  APIRequest();
  explicit APIRequest(Json::Value params);
  APIRequest(const APIRequest &) = default;
  APIRequest &operator=(const APIRequest &) = default;
  virtual ~APIRequest();

  // The parameter's value, or def when the request has no such parameter.
  Json::Value GetParam(const std::string &name, const Json::Value &def) const;
  bool HasParam(const std::string &name) const;

  // Host side.
  void SetParam(const std::string &name, const Json::Value &value);
  const Json::Value &GetParams() const { return mParams; }
  void SetUser(const std::string &user) { mUser = user; }
  const std::string &GetUser() const { return mUser; }

private:
  Json::Value mParams;
  std::string mUser;
};

// The answer to one request: success with data, or an error code with
// error data. The last call wins. Safe to use from several threads.
class APIResponse {
public:
  // Observer told of every answer set; the polling facility uses it to keep
  // a task's record. Called with the response's lock released.
  class Listener {
  public:
    virtual ~Listener() = default;
    virtual void OnSuccess(const Json::Value &data) = 0;
    virtual void OnError(int code, const Json::Value &errors) = 0;
  };

  APIResponse();
  virtual ~APIResponse();
  APIResponse(const APIResponse &) = delete;
  APIResponse &operator=(const APIResponse &) = delete;

  void SetSuccess(const Json::Value &data = Json::Value());
  void SetError(int code, const Json::Value &data = Json::Value());

  // Host side.
  enum class State { None, Success, Error };
  State GetState() const;
  bool IsAnswered() const { return GetState() != State::None; }
  bool IsSuccess() const { return GetState() == State::Success; }
  // The current answer: each call reads only its own kind, so after a
  // SetError GetData is null, and after a SetSuccess the code is 0.
  Json::Value GetData() const;      // data of the last SetSuccess
  int GetErrorCode() const;         // code of the last SetError, else 0
  Json::Value GetErrorData() const; // data of the last SetError
  void SetListener(std::shared_ptr<Listener> listener);

private:
  struct Impl;
  std::unique_ptr<Impl> mImpl;
};

// Callback of a background task: runs on a thread of the framework with a
// copy of the start request and the task's own response, whose answers
// become the task's record.
typedef void (*APIPollingCallback)(APIRequest *request, APIResponse *response,
                                   void *argument);

// The polling facility. A task is started with group, prefix and remove
// attributes; its id is "<prefix>#<16 hex digits>", so it contains the
// prefix. Task records have the shape
//   {"finish": bool, "success": bool, "data": <last success data>,
//    "error": {"code": int, "errors": <error data>}}
// where "error" is present only after an error answer. A running task that
// has not answered yet reads {"finish": false, "success": true, "data": {}}.
// Each SetSuccess(data) on the task's response sets "success" true and
// "data", and drops "error"; each SetError(code, errors) sets "success"
// false and "error", and keeps "data". "finish" turns true when the callback
// returns.
//
// A prefix given to List or Stop matches a task when it equals the task's
// id, or when the id starts with it and the next character of the id is "."
// or "#": "A.b" matches "A.b#..." and "A.b.c#..." but not "A.bc#...".
class APIPolling {
public:
  APIPolling();
  explicit APIPolling(APIRequest *request);
  ~APIPolling();

  void SetRequest(APIRequest *request);
  void SetGroupAttr(const std::string &group);
  void SetPrefixAttr(const std::string &prefix);
  // remove true: the record is dropped as soon as the task ends; false: it
  // is kept until Stop(id, true).
  void SetRemoveAttr(bool remove);

  // Most tasks held at once. A task counts from Start until both its record
  // is dropped and its callback has returned.
  static constexpr std::size_t kMaxTasks = 1024;

  // The record of a finished task is kept until it is dropped (Stop with
  // remove, or SetRemoveAttr(true)) or until nobody asked for it with
  // Status for this long since it finished or was last asked for: a browser
  // tab closed in the middle of a job leaves no record behind for good.
  static constexpr std::chrono::milliseconds kDefaultFinishedRecordLifetime =
      std::chrono::minutes(10);
  // Changes that time for the whole process (hosts and tests).
  static void SetFinishedRecordLifetime(std::chrono::milliseconds lifetime);

  // Starts callback(copy of the request, task response, argument) on a new
  // thread and answers response with {"task_id": id}. Without SetRequest the
  // callback gets an empty request; it never gets null pointers. Returns
  // false (and answers WEBAPI_ERR_TASK_START with errors {"reason": text})
  // when no prefix or no callback was set, kMaxTasks tasks are held already
  // and all of them still running ({"reason": "too many tasks running",
  // "max": kMaxTasks}), or no thread could be started. When kMaxTasks are
  // held and some have finished, the record of the one that finished first
  // is dropped to make room; false without an answer when response is
  // null. A callback that throws ends its task with the error record
  // {"code": WEBAPI_ERR_TASK_EXCEPTION, "errors": {"reason": what()}}.
  bool Start(APIResponse *response, APIPollingCallback callback,
             void *argument);

  // Copies the task's record. False when no such task exists (never started,
  // or its record was dropped). While the task's callback has not answered
  // yet (its thread may not have run), waits up to two seconds for its first
  // answer, so that a poll right after Start sees what the task reported.
  bool Status(const std::string &taskId, Json::Value &record);

  // result becomes {group: [task ids...], ...} for every task whose group is
  // one of groups (an array of strings) and whose id matches prefix (see
  // above; an empty prefix matches every task). Every requested group is a
  // member, an empty array when no task matches; a group named twice appears
  // once. Ids are listed in start order. Tasks whose record was dropped are
  // not listed. False, with result unchanged, when groups is not an array
  // or holds a non-string.
  bool List(const std::string &prefix, const Json::Value &groups,
            Json::Value &result);

  // Asks the task to stop (IsStopRequested turns true for its callback) and,
  // when remove is true, drops its record. The task's thread is still joined
  // by the framework. False when no such task exists.
  bool Stop(const std::string &taskId, bool remove);

  // Task side: true once Stop was called for the task that owns response,
  // while its callback runs. False for any other response and for null.
  static bool IsStopRequested(const APIResponse *response);

  // Waits until every task thread started so far has ended and joins it.
  // For hosts shutting down (before unloading a module whose callbacks may
  // still run) and for tests. Called from a task callback it waits for no
  // running task (a task cannot wait for itself, nor two tasks for each
  // other): it only joins the threads of ended tasks, and logs a warning.
  // Start, Status, List and Stop also join the threads of ended tasks as
  // they go, and the registry joins all of them when the process exits or
  // the library is unloaded; no task thread is ever detached.
  static void JoinAll();

private:
  APIRequest *mRequest = nullptr;
  std::string mGroup;
  std::string mPrefix;
  bool mRemove = false;
};

} // namespace ZARK

#endif
