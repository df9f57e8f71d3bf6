#include "catalog/router_db_lock.h"

#include "base/conf_file.h"
#include "base/portmap_log.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <string>
#include <thread>

namespace zark::portmap {
namespace {

using Clock = std::chrono::steady_clock;

UniqueFd OpenLockFile(const std::string &path) {
  UniqueFd fd(::open(path.c_str(),
                     O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NOCTTY,
                     0600));
  if (!fd.Valid()) {
    ZARK_PM_LOG_CALL("open", -1, errno, path.c_str());
  }
  return fd;
}

// flock with LOCK_NB in a loop until deadline (sleeps grow from 1 to 50 ms).
bool TakeFlock(int fd, int operation, Clock::time_point deadline,
               const std::string &path, std::chrono::milliseconds timeout) {
  std::chrono::milliseconds pause(1);
  for (;;) {
    if (::flock(fd, operation | LOCK_NB) == 0) {
      return true;
    }
    if (errno != EWOULDBLOCK && errno != EINTR) {
      ZARK_PM_LOG_CALL("flock", -1, errno, path.c_str());
      return false;
    }
    if (Clock::now() >= deadline) {
      ZARK_PM_LOG_ERROR("%s still held elsewhere after %lld ms, giving up",
                        path.c_str(), static_cast<long long>(timeout.count()));
      return false;
    }
    std::this_thread::sleep_for(pause);
    pause = std::min(pause * 2, std::chrono::milliseconds(50));
  }
}

} // namespace

// flock gives a waiting exclusive lock no priority: readers that come and
// go all the time would keep an update out forever. So every taker first
// passes a gate, "<path>.gate": readers hold it shared only while they take
// their lock, a writer holds it exclusive while it waits for the readers
// already in to leave, so no new reader slips in meanwhile.
RouterDbLock::RouterDbLock(const char *path, Mode mode,
                           std::chrono::milliseconds timeout) {
  if (!MakeFolders(ZARK_PORTMAP_CONF_DIR, 0755)) {
    return;
  }
  const std::string lockPath(path);
  const std::string gatePath = lockPath + ".gate";
  UniqueFd gate = OpenLockFile(gatePath);
  UniqueFd fd = OpenLockFile(lockPath);
  if (!gate.Valid() || !fd.Valid()) {
    return;
  }
  const int operation = mode == Mode::kShared ? LOCK_SH : LOCK_EX;
  const Clock::time_point deadline = Clock::now() + timeout;
  if (!TakeFlock(gate.Get(), operation, deadline, gatePath, timeout) ||
      !TakeFlock(fd.Get(), operation, deadline, lockPath, timeout)) {
    return;
  }
  // Closing the gate's descriptor lets the next taker through.
  mFd = std::move(fd);
}

} // namespace zark::portmap
