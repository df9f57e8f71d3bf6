// The system-wide port-map lock, between threads and between processes.
// No test measures time: waits that end the test are bounded generously,
// and order is shown by recorded events, not by clocks.
#include "libzarkportmap.h"

#include "base/portmap_lock.h"
#include "hermetic.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <future>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace {

using namespace std::chrono_literals;
using zark::test::CapturedLogs;
using zark::test::ClearLogs;
using zark::test::HasLogContaining;

// Longest a test waits for something that should happen at once; reaching
// it means the test failed, not that the machine was slow.
constexpr auto kGenerousBound = 60s;
// Lock timeout for attempts that are meant to give up.
constexpr auto kShortTimeout = 20ms;

class PortMapLock : public testing::Test {
protected:
  void SetUp() override {
    zark::test::ResetFixedPaths();
    ClearLogs();
    ZarkPortMapSetLockTimeoutForTesting(30s);
    ZarkPortMapSetLockWaitHookForTesting({});
  }
  void TearDown() override {
    ZarkPortMapSetLockTimeoutForTesting(30s);
    ZarkPortMapSetLockWaitHookForTesting({});
  }
};

// Runs one lock attempt on a fresh thread (unlocking again when it got the
// lock) and returns its result.
int LockFromAnotherThread() {
  int result = 1;
  std::thread other([&] {
    result = KLibZarkPortMapLock();
    if (result == 0) {
      KLibZarkPortMapUnLock();
    }
  });
  other.join();
  return result;
}

// A forked child that takes the lock on request and holds it until told.
// The destructor kills and reaps it, so a failed assertion leaves no child.
class LockingChild {
public:
  LockingChild() {
    if (pipe2(mToChild, O_CLOEXEC) != 0 || pipe2(mFromChild, O_CLOEXEC) != 0) {
      return;
    }
    mPid = fork();
    if (mPid == 0) {
      RunChild();
    }
    close(mToChild[0]);
    close(mFromChild[1]);
  }
  ~LockingChild() {
    if (mPid > 0) {
      kill(mPid, SIGKILL);
      Reap();
    }
    close(mToChild[1]);
    close(mFromChild[0]);
  }
  LockingChild(const LockingChild &) = delete;
  LockingChild &operator=(const LockingChild &) = delete;

  bool Started() const { return mPid > 0; }
  // Sends one command byte and returns the child's one-byte answer ('\0'
  // when the child is gone).
  char Ask(char command) {
    if (write(mToChild[1], &command, 1) != 1) {
      return '\0';
    }
    char answer = '\0';
    if (read(mFromChild[0], &answer, 1) != 1) {
      return '\0';
    }
    return answer;
  }
  void Kill() {
    kill(mPid, SIGKILL);
    Reap();
  }
  int Reap() {
    int status = 0;
    if (mPid > 0) {
      waitpid(mPid, &status, 0);
      mPid = -1;
    }
    return status;
  }

private:
  // Commands: 'l' lock, 'u' unlock, 'q' quit. Answers: the call's result as
  // 'L'/'U' for 0, 'F' for anything else.
  [[noreturn]] void RunChild() {
    close(mToChild[1]);
    close(mFromChild[0]);
    char command = 0;
    while (read(mToChild[0], &command, 1) == 1) {
      char answer = 'F';
      if (command == 'l') {
        answer = KLibZarkPortMapLock() == 0 ? 'L' : 'F';
      } else if (command == 'u') {
        answer = KLibZarkPortMapUnLock() == 0 ? 'U' : 'F';
      } else if (command == 'q') {
        _exit(0);
      }
      if (write(mFromChild[1], &answer, 1) != 1) {
        _exit(2);
      }
    }
    _exit(0);
  }

  int mToChild[2] = {-1, -1};
  int mFromChild[2] = {-1, -1};
  pid_t mPid = -1;
};

TEST_F(PortMapLock, LockAndUnlockSucceed) {
  EXPECT_EQ(0, KLibZarkPortMapLock());
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
  EXPECT_TRUE(CapturedLogs().empty());
}

TEST_F(PortMapLock, CreatesTheFolderAndA0600LockFile) {
  std::filesystem::remove_all(ZARK_PORTMAP_CONF_DIR);
  mode_t old = umask(0);
  int rc = KLibZarkPortMapLock();
  umask(old);
  ASSERT_EQ(0, rc);
  struct stat info {};
  ASSERT_EQ(0, lstat(ZARK_PORTMAP_LOCK_FILE, &info));
  EXPECT_TRUE(S_ISREG(info.st_mode));
  EXPECT_EQ(0600u, info.st_mode & 07777);
  ASSERT_EQ(0, stat(ZARK_PORTMAP_CONF_DIR, &info));
  EXPECT_EQ(0755u, info.st_mode & 07777);
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
}

TEST_F(PortMapLock, ExcludesAnotherThreadUntilUnlocked) {
  ASSERT_EQ(0, KLibZarkPortMapLock());

  std::mutex eventsMutex;
  std::vector<std::string> events;
  auto record = [&](const std::string &event) {
    std::lock_guard guard(eventsMutex);
    events.push_back(event);
  };
  // The hook tells us for certain that the other thread found the lock
  // taken and is waiting for it.
  std::promise<void> waiting;
  std::atomic<bool> told{false};
  ZarkPortMapSetLockWaitHookForTesting([&] {
    if (!told.exchange(true)) {
      waiting.set_value();
    }
  });
  int otherResult = 1;
  std::thread other([&] {
    otherResult = KLibZarkPortMapLock();
    record("other locked");
    KLibZarkPortMapUnLock();
  });
  bool otherWaits = waiting.get_future().wait_for(kGenerousBound) ==
                    std::future_status::ready;
  record("main unlocks");
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
  other.join();

  EXPECT_TRUE(otherWaits);
  EXPECT_EQ(0, otherResult);
  EXPECT_EQ((std::vector<std::string>{"main unlocks", "other locked"}), events);
}

TEST_F(PortMapLock, GivesUpAfterTheTimeout) {
  ASSERT_EQ(0, KLibZarkPortMapLock());
  ZarkPortMapSetLockTimeoutForTesting(kShortTimeout);
  EXPECT_EQ(-1, LockFromAnotherThread());
  EXPECT_TRUE(HasLogContaining("giving up"));
  for (const auto &line : CapturedLogs()) {
    EXPECT_EQ(LOG_ERR, line.priority);
  }
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
  // Once released, the same attempt succeeds.
  EXPECT_EQ(0, LockFromAnotherThread());
}

TEST_F(PortMapLock, SecondLockBySameThreadIsCounted) {
  ASSERT_EQ(0, KLibZarkPortMapLock());
  ASSERT_EQ(0, KLibZarkPortMapLock());
  ZarkPortMapSetLockTimeoutForTesting(kShortTimeout);
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
  // Still held after the inner unlock.
  EXPECT_EQ(-1, LockFromAnotherThread());
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
  EXPECT_EQ(0, LockFromAnotherThread());
}

TEST_F(PortMapLock, UnlockWithoutLockIsHarmless) {
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
  EXPECT_TRUE(CapturedLogs().empty());
  // One more unlock after a lock/unlock pair changes nothing either.
  ASSERT_EQ(0, KLibZarkPortMapLock());
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
  EXPECT_EQ(0, LockFromAnotherThread());
  EXPECT_TRUE(CapturedLogs().empty());
}

// The callers' pattern: unlock also after a failed lock. That must not
// release the lock of whoever holds it.
TEST_F(PortMapLock, UnlockAfterFailedLockKeepsTheHoldersLock) {
  std::promise<void> held;
  std::promise<void> release;
  int holderResult = 1;
  std::thread holder([&] {
    holderResult = KLibZarkPortMapLock();
    held.set_value();
    release.get_future().wait_for(kGenerousBound);
    KLibZarkPortMapUnLock();
  });
  ASSERT_EQ(std::future_status::ready,
            held.get_future().wait_for(kGenerousBound));
  ASSERT_EQ(0, holderResult);
  ZarkPortMapSetLockTimeoutForTesting(kShortTimeout);
  EXPECT_EQ(-1, KLibZarkPortMapLock());
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
  EXPECT_EQ(-1, LockFromAnotherThread());
  release.set_value();
  holder.join();
  EXPECT_EQ(0, KLibZarkPortMapLock());
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
}

TEST_F(PortMapLock, ThreadThatEndsHoldingTheLockReleasesIt) {
  int leaverResult = 1;
  std::thread leaver([&] { leaverResult = KLibZarkPortMapLock(); });
  leaver.join();
  ASSERT_EQ(0, leaverResult);
  ZarkPortMapSetLockTimeoutForTesting(kShortTimeout);
  EXPECT_EQ(0, KLibZarkPortMapLock());
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
}

TEST_F(PortMapLock, ExcludesAnotherProcess) {
  // Set before the fork, so that the child's attempts give up soon too.
  ZarkPortMapSetLockTimeoutForTesting(kShortTimeout);
  LockingChild child;
  ASSERT_TRUE(child.Started());
  ASSERT_EQ('L', child.Ask('l'));

  EXPECT_EQ(-1, KLibZarkPortMapLock());
  EXPECT_TRUE(HasLogContaining("giving up"));

  ASSERT_EQ('U', child.Ask('u'));
  EXPECT_EQ(0, KLibZarkPortMapLock());

  // And the other way round: while we hold it, the child cannot take it.
  EXPECT_EQ('F', child.Ask('l'));
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
  EXPECT_EQ('L', child.Ask('l'));
  EXPECT_EQ('U', child.Ask('u'));
  child.Ask('q');
  int status = child.Reap();
  EXPECT_TRUE(WIFEXITED(status));
  EXPECT_EQ(0, WEXITSTATUS(status));
}

TEST_F(PortMapLock, ChildForkedWhileHoldingDoesNotOwnTheLock) {
  ZarkPortMapSetLockTimeoutForTesting(kShortTimeout);
  ASSERT_EQ(0, KLibZarkPortMapLock());
  LockingChild child; // forked while this thread holds the lock
  ASSERT_TRUE(child.Started());
  // Unlocking in the child neither fails nor releases our lock.
  EXPECT_EQ('U', child.Ask('u'));
  EXPECT_EQ(-1, LockFromAnotherThread());
  // Nor does the child hold it: it has to wait like anyone else.
  EXPECT_EQ('F', child.Ask('l'));
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
  EXPECT_EQ('L', child.Ask('l'));
  EXPECT_EQ('U', child.Ask('u'));
}

TEST_F(PortMapLock, ReleasedWhenTheHoldingProcessDies) {
  LockingChild child;
  ASSERT_TRUE(child.Started());
  ASSERT_EQ('L', child.Ask('l'));
  ZarkPortMapSetLockTimeoutForTesting(kShortTimeout);
  ASSERT_EQ(-1, KLibZarkPortMapLock());

  child.Kill();
  ZarkPortMapSetLockTimeoutForTesting(30s);
  EXPECT_EQ(0, KLibZarkPortMapLock());
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
}

TEST_F(PortMapLock, RefusesASymlinkAsLockFile) {
  const std::string target = std::string(ZARK_PORTMAP_CONF_DIR) + "/elsewhere";
  ASSERT_EQ(0, symlink(target.c_str(), ZARK_PORTMAP_LOCK_FILE));
  EXPECT_EQ(-1, KLibZarkPortMapLock());
  EXPECT_TRUE(HasLogContaining("open failed"));
  EXPECT_FALSE(std::filesystem::exists(target));
  EXPECT_EQ(0, KLibZarkPortMapUnLock());
}

} // namespace
