#include "keeper.h"

#include "router_status.h"

#include <syslog.h>

#include <algorithm>
#include <ctime>
#include <system_error>

namespace zark::status {

Keeper::~Keeper() {
  Stop();
}

bool Keeper::Start(int checkIntervalSeconds) {
  std::lock_guard lock(mMutex);
  if (mThread.joinable()) {
    return false;
  }
  mInterval = std::max(1, checkIntervalSeconds);
  mStopping = false;
  mNextRound = std::chrono::steady_clock::now();
  try {
    mThread = std::thread([this] { Run(); });
  } catch (const std::system_error &e) {
    syslog(LOG_ERR, "%s:%d keeper thread not started: %s", __FILE__, __LINE__,
           e.what());
    return false;
  }
  mRunning = true;
  syslog(LOG_INFO, "%s:%d keeper started, check interval %d s", __FILE__,
         __LINE__, mInterval);
  return true;
}

void Keeper::Stop() {
  {
    std::lock_guard lock(mMutex);
    if (!mThread.joinable()) {
      return;
    }
    mStopping = true;
  }
  mWake.notify_all();
  mThread.join();
  std::lock_guard lock(mMutex);
  mRunning = false;
  syslog(LOG_INFO, "%s:%d keeper stopped after %llu rounds", __FILE__, __LINE__,
         static_cast<unsigned long long>(mRounds));
}

void Keeper::Run() {
  std::unique_lock lock(mMutex);
  while (!mStopping) {
    lock.unlock();
    std::chrono::seconds pause = Round();
    lock.lock();
    ++mRounds;
    mNextRound = std::chrono::steady_clock::now() + pause;
    mWake.wait_until(lock, mNextRound, [this] { return mStopping; });
  }
}

std::chrono::seconds Keeper::Round() {
  const std::chrono::seconds interval(mInterval);
  const std::chrono::seconds retry = std::min(interval, kRetryPause);
  PortMapLock portMapLock;
  if (!portMapLock.Held()) {
    Record("lock_busy", Json::Value(Json::objectValue));
    return retry;
  }
  std::string gateway;
  if (!FindGateway(gateway)) {
    Record("no_gateway", Json::Value(Json::objectValue));
    return interval;
  }
  int next = mInterval;
  ZARK_PORTMAP_APPLY_SUMMARY summary{};
  ZARK_ROUTER_SAVE_RULE_RESULT result{};
  int rc = KLibKeepRouter(gateway.c_str(), mInterval, &next, &summary, &result);
  Json::Value details(Json::objectValue);
  details["summary"] = SummaryJson(summary);
  details["restored"] = summary.repaired;
  if (rc != 0) {
    details["err_type"] = result.errType;
    syslog(LOG_WARNING,
           "%s:%d keeper round failed: %d (type %u); %d restored, %d failed",
           __FILE__, __LINE__, rc, static_cast<unsigned>(result.errType),
           static_cast<int>(summary.repaired),
           static_cast<int>(summary.failed));
    Record("failed", details);
    return retry;
  }
  if (summary.repaired > 0 || summary.failed > 0) {
    syslog(LOG_NOTICE,
           "%s:%d keeper restored %d mappings on %s (%d checked, %d failed)",
           __FILE__, __LINE__, static_cast<int>(summary.repaired),
           gateway.c_str(), static_cast<int>(summary.checked),
           static_cast<int>(summary.failed));
  }
  Record("ok", details);
  // The library's due time, kept within [1 s, interval].
  return std::chrono::seconds(std::clamp(next, 1, mInterval));
}

void Keeper::Record(const char *outcome, const Json::Value &details) {
  Json::Value round = details;
  round["outcome"] = outcome;
  round["ended"] = static_cast<Json::Int64>(std::time(nullptr));
  std::lock_guard lock(mMutex);
  mLastRound = round;
}

Json::Value Keeper::Describe() const {
  std::lock_guard lock(mMutex);
  Json::Value data(Json::objectValue);
  data["running"] = mRunning;
  data["check_interval"] = mInterval;
  data["rounds"] = static_cast<Json::UInt64>(mRounds);
  data["last_round"] = mLastRound;
  if (mRunning) {
    auto left = std::chrono::duration_cast<std::chrono::seconds>(
        mNextRound - std::chrono::steady_clock::now());
    data["next_round_in"] =
        static_cast<Json::Int64>(std::max<std::int64_t>(0, left.count()));
  } else {
    data["next_round_in"] = Json::Value();
  }
  return data;
}

Keeper &TheKeeper() {
  static Keeper keeper;
  return keeper;
}

} // namespace zark::status
