// The keeper: the renewal service of the host. One thread, owned by the
// status module from its start to its stop, runs KLibKeepRouter in rounds:
// it renews leases at half of what the router granted, checks the router
// for lost mappings every check interval and restores them. A round takes
// the port-map lock (a round that finds it busy is retried soon) and asks
// the library when the next round is due.
#ifndef ZARK_STATUS_KEEPER_H
#define ZARK_STATUS_KEEPER_H

#include <json/json.h>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <mutex>
#include <thread>

namespace zark::status {

class Keeper {
public:
  // Pause after a round that found the lock busy, no gateway, or a failed
  // router, at most: the check interval bounds it too.
  static constexpr std::chrono::seconds kRetryPause{10};

  Keeper() = default;
  ~Keeper(); // stops
  Keeper(const Keeper &) = delete;
  Keeper &operator=(const Keeper &) = delete;

  // Starts the thread (first round at once). False when it runs already or
  // no thread could be started. checkIntervalSeconds >= 1.
  bool Start(int checkIntervalSeconds);
  // Asks the thread to stop and joins it. The wait between rounds ends at
  // once; a round under way ends first (bounded by the lock's wait and the
  // library's router deadlines). Does nothing when not running.
  void Stop();

  // {"running", "check_interval", "rounds", "last_round": {"ended",
  //  "outcome": "ok"|"lock_busy"|"no_gateway"|"failed", "restored",
  //  "summary", "err_type"} | null, "next_round_in"}.
  [[nodiscard]] Json::Value Describe() const;

private:
  void Run();
  // One round; returns the pause before the next one.
  std::chrono::seconds Round();
  void Record(const char *outcome, const Json::Value &details);

  mutable std::mutex mMutex;
  std::condition_variable mWake;
  bool mStopping = false;
  bool mRunning = false;
  int mInterval = 0;
  std::uint64_t mRounds = 0;
  Json::Value mLastRound;
  std::chrono::steady_clock::time_point mNextRound;
  std::thread mThread;
};

// The process's keeper, started and stopped by the module's lifecycle.
Keeper &TheKeeper();

} // namespace zark::status

#endif
