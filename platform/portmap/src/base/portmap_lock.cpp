// The system-wide port-map lock: flock(LOCK_EX) on ZARK_PORTMAP_LOCK_FILE.
//
// flock locks belong to open file descriptions, so each locking thread opens
// the file itself: two threads of one process then exclude each other just
// as two processes do. The descriptor of the calling thread lives in
// thread_local storage; a thread that ends while holding the lock closes it
// and so releases the lock, and the kernel releases it when the holding
// process dies.
//
// Recursion is counted: a thread that already holds the lock gets it again
// at once (0), and the lock is released by the matching last unlock. A
// process made by fork() does not hold its parent's lock.
#include "libzarkportmap.h"

#include "base/conf_file.h"
#include "base/portmap_lock.h"
#include "base/portmap_log.h"
#include "base/unique_fd.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <climits>
#include <mutex>
#include <thread>

namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

constexpr milliseconds kDefaultTimeout{30000};
// Sleeps between attempts grow from the first to the last value.
constexpr milliseconds kFirstPause{1};
constexpr milliseconds kLongestPause{50};

std::atomic<long long> gTimeoutMs{kDefaultTimeout.count()};

std::mutex gHookMutex;
std::function<void()> gWaitHook;

struct HeldLock {
  zark::portmap::UniqueFd fd;
  int depth = 0;
  pid_t owner = 0; // the process that took it
};
thread_local HeldLock tHeld;

// A child made by fork() inherits the forking thread's record and a copy of
// its descriptor, which shares the parent's lock. The child does not own
// that lock: it forgets the record and closes its copy (closing a copy does
// not release the lock; LOCK_UN on it would release the parent's).
void ForgetLockInheritedThroughFork() {
  if (tHeld.depth > 0 && tHeld.owner != ::getpid()) {
    tHeld.fd.Reset();
    tHeld.depth = 0;
  }
}

void RunWaitHook() {
  std::function<void()> hook;
  {
    std::lock_guard guard(gHookMutex);
    hook = gWaitHook;
  }
  if (hook) {
    hook();
  }
}

zark::portmap::UniqueFd OpenLockFile() {
  if (!zark::portmap::MakeFolders(ZARK_PORTMAP_CONF_DIR, 0755)) {
    return {};
  }
  zark::portmap::UniqueFd fd(
      ::open(ZARK_PORTMAP_LOCK_FILE,
             O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NOCTTY, 0600));
  if (!fd.Valid()) {
    ZARK_PM_LOG_CALL("open", -1, errno, ZARK_PORTMAP_LOCK_FILE);
  }
  return fd;
}

// True when fd is still the file at the lock path. Someone may have removed
// or replaced the file between our open and our flock; a lock on the old
// file would then exclude nobody who opens the path afresh.
bool StillTheLockFile(int fd) {
  struct stat held {};
  struct stat current {};
  if (::fstat(fd, &held) != 0 ||
      ::lstat(ZARK_PORTMAP_LOCK_FILE, &current) != 0) {
    return false;
  }
  return held.st_dev == current.st_dev && held.st_ino == current.st_ino;
}

int Lock() {
  ForgetLockInheritedThroughFork();
  if (tHeld.depth > 0) {
    if (tHeld.depth == INT_MAX) {
      ZARK_PM_LOG_ERROR("KLibZarkPortMapLock: lock taken too often by one "
                        "thread");
      return -1;
    }
    ++tHeld.depth;
    return 0;
  }
  const milliseconds timeout{gTimeoutMs.load()};
  const Clock::time_point deadline = Clock::now() + timeout;
  milliseconds pause = kFirstPause;
  zark::portmap::UniqueFd fd;
  for (;;) {
    if (!fd.Valid()) {
      fd = OpenLockFile();
      if (!fd.Valid()) {
        return -1;
      }
    }
    if (::flock(fd.Get(), LOCK_EX | LOCK_NB) == 0) {
      if (StillTheLockFile(fd.Get())) {
        tHeld.fd = std::move(fd);
        tHeld.depth = 1;
        tHeld.owner = ::getpid();
        return 0;
      }
      // Locked a file that is no longer the lock file: open it again.
      fd.Reset();
    } else if (errno == EINTR) {
      continue;
    } else if (errno != EWOULDBLOCK) {
      ZARK_PM_LOG_CALL("flock", -1, errno, ZARK_PORTMAP_LOCK_FILE);
      return -1;
    } else {
      RunWaitHook();
    }
    Clock::time_point now = Clock::now();
    if (now >= deadline) {
      ZARK_PM_LOG_ERROR("KLibZarkPortMapLock: %s still held elsewhere after "
                        "%lld ms, giving up",
                        ZARK_PORTMAP_LOCK_FILE,
                        static_cast<long long>(timeout.count()));
      return -1;
    }
    std::this_thread::sleep_for(
        std::min<Clock::duration>(pause, deadline - now));
    pause = std::min(pause * 2, kLongestPause);
  }
}

int Unlock() {
  ForgetLockInheritedThroughFork();
  if (tHeld.depth == 0) {
    return 0;
  }
  if (--tHeld.depth > 0) {
    return 0;
  }
  if (::flock(tHeld.fd.Get(), LOCK_UN) != 0) {
    // Closing the descriptor below releases the lock all the same.
    ZARK_PM_LOG_CALL("flock(LOCK_UN)", -1, errno, ZARK_PORTMAP_LOCK_FILE);
  }
  tHeld.fd.Reset();
  return 0;
}

} // namespace

void ZarkPortMapSetLockTimeoutForTesting(std::chrono::milliseconds timeout) {
  gTimeoutMs.store(timeout.count());
}

void ZarkPortMapSetLockWaitHookForTesting(std::function<void()> hook) {
  std::lock_guard guard(gHookMutex);
  gWaitHook = std::move(hook);
}

extern "C" {

int KLibZarkPortMapLock(void) {
  try {
    return Lock();
  } catch (const std::exception &e) {
    // Only the test hook or a failed allocation can throw.
    ZARK_PM_LOG_ERROR("KLibZarkPortMapLock: %s", e.what());
    return -1;
  }
}

int KLibZarkPortMapUnLock(void) {
  return Unlock();
}

} // extern "C"
