// The process-wide registry of background tasks behind APIPolling: task
// records, stop flags and the threads that run the callbacks.
//
// Internal to the library; the host and modules use APIPolling.
#ifndef ZARK_PLATFORM_WEBAPI_TASK_REGISTRY_H
#define ZARK_PLATFORM_WEBAPI_TASK_REGISTRY_H

#include "webapi.h"

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <random>
#include <string>
#include <string_view>
#include <thread>
#include <unordered_map>
#include <vector>

namespace ZARK::webapi_internal {

// Most tasks the registry holds at once: a task counts from Start until its
// record is dropped and its callback has returned. Start fails beyond it.
inline constexpr std::size_t kMaxLiveTasks = APIPolling::kMaxTasks;

// How long the record of a finished task is kept while nobody asks for it
// (Status) before it is dropped, by default; see APIPolling.
inline constexpr std::chrono::milliseconds kDefaultFinishedRecordLifetime =
    APIPolling::kDefaultFinishedRecordLifetime;

// How long Status waits for a task's first answer when its callback has not
// answered yet (a poll that comes before the task's thread has run).
inline constexpr std::chrono::milliseconds kFirstReportWait{2000};

// True when prefix selects the task id: equal to it, or a leading part of it
// that ends where the id has "." or "#". An empty prefix selects every id.
[[nodiscard]] bool TaskIdMatchesPrefix(std::string_view taskId,
                                       std::string_view prefix);

// What APIPolling asks of a new task.
struct TaskSpec {
  std::string group;
  std::string prefix; // not empty
  bool removeWhenEnded = false;
  const APIRequest *request = nullptr; // copied; null gives an empty request
  APIPollingCallback callback = nullptr;
  void *argument = nullptr;
};

class TaskRegistry {
public:
  // The one registry of the process, created on first use. Its destructor
  // (at exit or when the library is unloaded) joins every task thread.
  static TaskRegistry &Instance();

  TaskRegistry(const TaskRegistry &) = delete;
  TaskRegistry &operator=(const TaskRegistry &) = delete;
  ~TaskRegistry();

  // Creates the task's record and starts its thread. Returns the new id, or
  // an empty string (after logging why) when the registry is full of
  // running tasks (full is then true) or no thread could be started.
  [[nodiscard]] std::string Start(const TaskSpec &spec, bool &full);

  // The operations of APIPolling of the same names.
  [[nodiscard]] bool Status(const std::string &taskId, Json::Value &record);
  [[nodiscard]] bool List(const std::string &prefix, const Json::Value &groups,
                          Json::Value &result);
  [[nodiscard]] bool Stop(const std::string &taskId, bool remove);
  [[nodiscard]] bool IsStopRequested(const APIResponse *response);

  // See APIPolling::SetFinishedRecordLifetime.
  void SetFinishedRecordLifetime(std::chrono::milliseconds lifetime);

  // Joins the threads of tasks whose callback has returned. Never waits for
  // a task that is still running.
  void JoinEnded();

  // Joins every task thread, waiting for running tasks to end, until none
  // is left. Called from a task callback it only does what JoinEnded does.
  void JoinAll();

private:
  struct Task;
  class RecordWriter;
  struct Runner {
    std::shared_ptr<Task> task;
    std::thread thread;
  };

  TaskRegistry();

  // Task thread side.
  static void Run(TaskRegistry *registry, std::shared_ptr<Task> task,
                  APIPollingCallback callback, void *argument) noexcept;
  void RecordSuccess(Task &task, const Json::Value &data);
  void RecordError(Task &task, int code, const Json::Value &errors);
  void Finish(Task &task);

  // Helpers that need mMutex held.
  std::string NewIdLocked(const std::string &prefix);
  std::size_t LiveCountLocked() const;
  // Drops the record from Status and List; may destroy task.
  void UnlistLocked(Task &task);
  // Drops the records of finished tasks nobody asked for within the
  // lifetime; with makeRoom, when no room is left, the record of the task
  // that finished first as well. Logs what it drops.
  void ReapLocked(bool makeRoom);
  Task *FindListedLocked(const std::string &taskId) const;

  // Joins the given threads with mJoinsInFlight counted, lock not held.
  void JoinBatch(std::vector<Runner> &batch);

  mutable std::mutex mMutex;
  std::condition_variable mJoinsDone;
  // Notified when a task answers or returns (Status waits for the first).
  std::condition_variable mFirstReport;
  std::mt19937_64 mRandom;
  std::uint64_t mNextSeq = 0;
  std::chrono::milliseconds mFinishedRecordLifetime =
      kDefaultFinishedRecordLifetime;
  // Records that Status and List see, in start order (key: start sequence).
  std::map<std::uint64_t, std::shared_ptr<Task>> mListed;
  std::unordered_map<std::string, std::uint64_t> mSeqById;
  // Tasks whose callback has not returned, by their response.
  std::unordered_map<const APIResponse *, std::shared_ptr<Task>> mRunning;
  // Threads not joined yet.
  std::vector<Runner> mThreads;
  // Batches of threads being joined outside the lock.
  int mJoinsInFlight = 0;
};

} // namespace ZARK::webapi_internal

#endif
