#include "task_registry.h"

#include <syslog.h>

#include <algorithm>
#include <cinttypes>
#include <cstdio>
#include <exception>
#include <system_error>
#include <unordered_set>
#include <utility>

namespace ZARK::webapi_internal {

bool TaskIdMatchesPrefix(std::string_view taskId, std::string_view prefix) {
  if (prefix.empty()) {
    return true;
  }
  if (!taskId.starts_with(prefix)) {
    return false;
  }
  if (taskId.size() == prefix.size()) {
    return true;
  }
  const char next = taskId[prefix.size()];
  return next == '.' || next == '#';
}

struct TaskRegistry::Task {
  std::string id;
  std::string group;
  bool removeWhenEnded = false;
  std::uint64_t seq = 0;
  APIRequest request;
  // Made at Start, before the thread exists, and never replaced.
  std::shared_ptr<APIResponse> response;

  // Guarded by the registry's mutex.
  Json::Value record;
  bool listed = false;
  bool stopRequested = false;
  bool ended = false;
  // True once the callback has answered for the first time, or returned.
  bool reported = false;
  // When the task finished, or a Status after that asked for it last.
  std::chrono::steady_clock::time_point lastAsked;
};

// Keeps a task's record in step with the answers its callback sets on the
// task's response. Owned by that response, which the task owns, so the task
// outlives it.
class TaskRegistry::RecordWriter : public APIResponse::Listener {
public:
  RecordWriter(TaskRegistry &registry, Task &task)
      : mRegistry(registry), mTask(task) {}
  void OnSuccess(const Json::Value &data) override {
    mRegistry.RecordSuccess(mTask, data);
  }
  void OnError(int code, const Json::Value &errors) override {
    mRegistry.RecordError(mTask, code, errors);
  }

private:
  TaskRegistry &mRegistry;
  Task &mTask;
};

namespace {

// Marks the threads that run task callbacks, so that JoinAll called from a
// callback does not wait for running tasks.
thread_local bool tOnTaskThread = false;

Json::Value NewRecord() {
  Json::Value record(Json::objectValue);
  record["finish"] = false;
  record["success"] = true;
  record["data"] = Json::Value(Json::objectValue);
  return record;
}

std::mt19937_64 SeededRandom() {
  std::random_device device;
  std::seed_seq seed{device(), device(), device(), device()};
  return std::mt19937_64(seed);
}

} // namespace

TaskRegistry &TaskRegistry::Instance() {
  static TaskRegistry registry;
  return registry;
}

TaskRegistry::TaskRegistry() : mRandom(SeededRandom()) {}

TaskRegistry::~TaskRegistry() {
  JoinAll();
}

std::string TaskRegistry::NewIdLocked(const std::string &prefix) {
  for (;;) {
    char digits[17];
    std::snprintf(digits, sizeof(digits), "%016" PRIx64, mRandom());
    std::string id = prefix + "#" + digits;
    // A running task whose record is gone keeps its id until it ends.
    const bool taken =
        mSeqById.contains(id) ||
        std::any_of(mRunning.begin(), mRunning.end(), [&id](const auto &entry) {
          return entry.second->id == id;
        });
    if (!taken) {
      return id;
    }
  }
}

std::size_t TaskRegistry::LiveCountLocked() const {
  const auto runningUnlisted =
      std::count_if(mRunning.begin(), mRunning.end(),
                    [](const auto &entry) { return !entry.second->listed; });
  return mListed.size() + static_cast<std::size_t>(runningUnlisted);
}

void TaskRegistry::UnlistLocked(Task &task) {
  if (!task.listed) {
    return;
  }
  task.listed = false;
  mSeqById.erase(task.id);
  // Last: this may drop the final reference to the task.
  mListed.erase(task.seq);
}

void TaskRegistry::ReapLocked(bool makeRoom) {
  const auto now = std::chrono::steady_clock::now();
  Task *firstFinished = nullptr;
  for (auto it = mListed.begin(); it != mListed.end();) {
    Task &task = *(it++)->second;
    if (!task.ended) {
      continue;
    }
    if (now - task.lastAsked >= mFinishedRecordLifetime) {
      syslog(LOG_NOTICE, "%s:%d task %s dropped: finished and not asked for",
             __FILE__, __LINE__, task.id.c_str());
      UnlistLocked(task);
    } else if (firstFinished == nullptr ||
               task.lastAsked < firstFinished->lastAsked) {
      firstFinished = &task;
    }
  }
  if (makeRoom && firstFinished != nullptr &&
      LiveCountLocked() >= kMaxLiveTasks) {
    syslog(LOG_NOTICE, "%s:%d task %s dropped: finished, and %zu tasks held",
           __FILE__, __LINE__, firstFinished->id.c_str(), kMaxLiveTasks);
    UnlistLocked(*firstFinished);
  }
}

void TaskRegistry::SetFinishedRecordLifetime(
    std::chrono::milliseconds lifetime) {
  std::lock_guard lock(mMutex);
  mFinishedRecordLifetime = lifetime;
}

TaskRegistry::Task *
TaskRegistry::FindListedLocked(const std::string &taskId) const {
  const auto seq = mSeqById.find(taskId);
  if (seq == mSeqById.end()) {
    return nullptr;
  }
  return mListed.at(seq->second).get();
}

std::string TaskRegistry::Start(const TaskSpec &spec, bool &full) {
  full = false;
  auto task = std::make_shared<Task>();
  task->group = spec.group;
  task->removeWhenEnded = spec.removeWhenEnded;
  if (spec.request != nullptr) {
    task->request = *spec.request;
  }
  task->response = std::make_shared<APIResponse>();
  task->response->SetListener(std::make_shared<RecordWriter>(*this, *task));

  std::lock_guard lock(mMutex);
  ReapLocked(true);
  if (LiveCountLocked() >= kMaxLiveTasks) {
    syslog(LOG_ERR,
           "%s:%d task %s not started: %zu tasks already held, all running",
           __FILE__, __LINE__, spec.prefix.c_str(), kMaxLiveTasks);
    full = true;
    return {};
  }
  task->id = NewIdLocked(spec.prefix);
  task->seq = mNextSeq++;
  task->record = NewRecord();
  task->listed = true;
  try {
    mListed.emplace(task->seq, task);
    mSeqById.emplace(task->id, task->seq);
    mRunning.emplace(task->response.get(), task);
    // Room first, so that nothing can throw between starting the thread
    // and handing it to mThreads (an unowned joinable thread terminates).
    mThreads.reserve(mThreads.size() + 1);
    std::thread thread(&TaskRegistry::Run, this, task, spec.callback,
                       spec.argument);
    mThreads.push_back({task, std::move(thread)});
  } catch (const std::exception &e) {
    syslog(LOG_ERR, "%s:%d task %s not started: %s", __FILE__, __LINE__,
           task->id.c_str(), e.what());
    UnlistLocked(*task);
    mRunning.erase(task->response.get());
    return {};
  }
  return task->id;
}

// The task thread keeps its own reference to the task for as long as it
// runs: task is taken by value on purpose.
// NOLINTNEXTLINE(performance-unnecessary-value-param)
void TaskRegistry::Run(TaskRegistry *registry, std::shared_ptr<Task> task,
                       APIPollingCallback callback, void *argument) noexcept {
  tOnTaskThread = true;
  std::string reason;
  try {
    callback(&task->request, task->response.get(), argument);
  } catch (const std::exception &e) {
    reason = e.what();
  } catch (...) {
    reason = "unknown exception";
  }
  if (!reason.empty()) {
    syslog(LOG_ERR, "%s:%d task %s ended by an exception: %s", __FILE__,
           __LINE__, task->id.c_str(), reason.c_str());
    try {
      Json::Value errors(Json::objectValue);
      errors["reason"] = reason;
      task->response->SetError(WEBAPI_ERR_TASK_EXCEPTION, errors);
    } catch (const std::exception &e) {
      syslog(LOG_ERR, "%s:%d task %s: exception not recorded: %s", __FILE__,
             __LINE__, task->id.c_str(), e.what());
    }
  }
  registry->Finish(*task);
}

void TaskRegistry::RecordSuccess(Task &task, const Json::Value &data) {
  {
    std::lock_guard lock(mMutex);
    task.record["success"] = true;
    task.record["data"] = data;
    task.record.removeMember("error");
    task.reported = true;
  }
  mFirstReport.notify_all();
}

void TaskRegistry::RecordError(Task &task, int code,
                               const Json::Value &errors) {
  Json::Value error(Json::objectValue);
  error["code"] = code;
  error["errors"] = errors;
  {
    std::lock_guard lock(mMutex);
    task.record["success"] = false;
    task.record["error"] = std::move(error);
    task.reported = true;
  }
  mFirstReport.notify_all();
}

void TaskRegistry::Finish(Task &task) {
  std::lock_guard lock(mMutex);
  task.reported = true;
  try {
    task.record["finish"] = true;
  } catch (const std::exception &e) {
    syslog(LOG_ERR, "%s:%d task %s: end not recorded: %s", __FILE__, __LINE__,
           task.id.c_str(), e.what());
  }
  task.lastAsked = std::chrono::steady_clock::now();
  if (task.removeWhenEnded) {
    UnlistLocked(task);
  }
  mRunning.erase(task.response.get());
  mFirstReport.notify_all();
  // Last: from here on the thread touches nothing of the registry, so
  // JoinEnded may join it.
  task.ended = true;
}

bool TaskRegistry::Status(const std::string &taskId, Json::Value &record) {
  std::unique_lock lock(mMutex);
  ReapLocked(false);
  Task *task = FindListedLocked(taskId);
  if (task == nullptr) {
    return false;
  }
  if (!task->reported) {
    // A task whose thread has not run yet has an empty record, which no
    // status reader can tell from a broken one: a poll right after the
    // start waits (bounded) for the callback's first answer instead.
    const std::uint64_t seq = task->seq;
    mFirstReport.wait_for(lock, kFirstReportWait, [&] {
      const auto listed = mListed.find(seq);
      return listed == mListed.end() || listed->second->reported;
    });
    task = FindListedLocked(taskId);
    if (task == nullptr) {
      return false;
    }
  }
  if (task->ended) {
    task->lastAsked = std::chrono::steady_clock::now();
  }
  record = task->record;
  return true;
}

bool TaskRegistry::List(const std::string &prefix, const Json::Value &groups,
                        Json::Value &result) {
  if (!groups.isArray()) {
    return false;
  }
  std::unordered_set<std::string> wanted;
  for (const Json::Value &group : groups) {
    if (!group.isString()) {
      return false;
    }
    wanted.insert(group.asString());
  }
  // Every requested group is a member, empty when no task matches, so that
  // callers can walk result[group] without looking for it first.
  Json::Value lists(Json::objectValue);
  for (const std::string &group : wanted) {
    lists[group] = Json::Value(Json::arrayValue);
  }
  {
    std::lock_guard lock(mMutex);
    ReapLocked(false);
    for (const auto &[seq, task] : mListed) {
      if (wanted.contains(task->group) &&
          TaskIdMatchesPrefix(task->id, prefix)) {
        lists[task->group].append(task->id);
      }
    }
  }
  result = std::move(lists);
  return true;
}

bool TaskRegistry::Stop(const std::string &taskId, bool remove) {
  std::lock_guard lock(mMutex);
  Task *task = FindListedLocked(taskId);
  if (task == nullptr) {
    return false;
  }
  task->stopRequested = true;
  if (remove) {
    UnlistLocked(*task);
  }
  return true;
}

bool TaskRegistry::IsStopRequested(const APIResponse *response) {
  std::lock_guard lock(mMutex);
  const auto entry = mRunning.find(response);
  return entry != mRunning.end() && entry->second->stopRequested;
}

void TaskRegistry::JoinBatch(std::vector<Runner> &batch) {
  for (Runner &runner : batch) {
    runner.thread.join();
  }
  batch.clear(); // drops the tasks (and their responses) outside the lock
  std::lock_guard lock(mMutex);
  --mJoinsInFlight;
  mJoinsDone.notify_all();
}

void TaskRegistry::JoinEnded() {
  std::vector<Runner> batch;
  {
    std::lock_guard lock(mMutex);
    const auto ended =
        std::stable_partition(mThreads.begin(), mThreads.end(),
                              [](const Runner &r) { return !r.task->ended; });
    if (ended == mThreads.end()) {
      return;
    }
    batch.assign(std::make_move_iterator(ended),
                 std::make_move_iterator(mThreads.end()));
    mThreads.erase(ended, mThreads.end());
    ++mJoinsInFlight;
  }
  JoinBatch(batch);
}

void TaskRegistry::JoinAll() {
  if (tOnTaskThread) {
    // A task cannot wait for its own thread, and two tasks waiting for all
    // others would wait for each other: join only what has ended.
    syslog(LOG_WARNING,
           "%s:%d JoinAll called from a task: joining ended tasks only",
           __FILE__, __LINE__);
    JoinEnded();
    return;
  }
  for (;;) {
    std::vector<Runner> batch;
    {
      std::unique_lock lock(mMutex);
      if (mThreads.empty()) {
        // Threads that JoinEnded took out have ended but may not be joined
        // yet; wait for those batches, then look again for new tasks.
        mJoinsDone.wait(lock, [this] { return mJoinsInFlight == 0; });
        // The wait let go of the lock: tasks may have started meanwhile.
        // cppcheck-suppress knownConditionTrueFalse
        if (mThreads.empty()) {
          return;
        }
        continue;
      }
      batch.swap(mThreads);
      ++mJoinsInFlight;
    }
    JoinBatch(batch);
  }
}

} // namespace ZARK::webapi_internal
