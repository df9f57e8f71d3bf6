#include "klibc.h"
#include "klibc_test_util.h"

#include <gtest/gtest.h>

#include <signal.h>

namespace zark::test {
namespace {

class KlibcSystem : public ::testing::Test {
protected:
  void SetUp() override { ClearError(); }
};

// Sets a signal's action for the length of a test.
class ScopedSignalAction {
public:
  ScopedSignalAction(int signal, void (*handler)(int), int flags)
      : mSignal(signal) {
    struct sigaction action {};
    action.sa_handler = handler;
    action.sa_flags = flags;
    sigemptyset(&action.sa_mask);
    EXPECT_EQ(sigaction(signal, &action, &mOld), 0);
  }
  ~ScopedSignalAction() { sigaction(mSignal, &mOld, nullptr); }
  ScopedSignalAction(const ScopedSignalAction &) = delete;
  ScopedSignalAction &operator=(const ScopedSignalAction &) = delete;

private:
  int mSignal;
  struct sigaction mOld {};
};

volatile sig_atomic_t gChildSignals = 0;
void CountChildSignal(int) {
  gChildSignals = gChildSignals + 1;
}

TEST_F(KlibcSystem, ReturnsZeroForSuccess) {
  EXPECT_EQ(KLIBCSystem("true"), 0);
  EXPECT_EQ(KLIBCSystem("exit 0"), 0);
  ExpectNoError();
}

TEST_F(KlibcSystem, ReturnsTheExitStatus) {
  EXPECT_EQ(KLIBCSystem("exit 3"), 3);
  EXPECT_EQ(KLIBCSystem("false"), 1);
  EXPECT_EQ(KLIBCSystem("exit 255"), 255);
  ExpectNoError();
}

TEST_F(KlibcSystem, RunsAShellCommandLine) {
  EXPECT_EQ(KLIBCSystem("a=4; b=3; exit $((a + b))"), 7);
  EXPECT_EQ(KLIBCSystem("echo hidden >/dev/null 2>&1 && exit 9"), 9);
}

TEST_F(KlibcSystem, CommandNotFoundIs127) {
  EXPECT_EQ(KLIBCSystem("zark-no-such-command-here 2>/dev/null"), 127);
  ExpectNoError();
}

TEST_F(KlibcSystem, DeathBySignalIsAFailure) {
  EXPECT_EQ(KLIBCSystem("kill -KILL $$"), -1);
  ExpectError(KLIBC_ERR_EXEC);
  ClearError();
  EXPECT_EQ(KLIBCSystem("kill -TERM $$"), -1);
  ExpectError(KLIBC_ERR_EXEC);
}

TEST_F(KlibcSystem, NullCommandIsABadParameter) {
  EXPECT_EQ(KLIBCSystem(nullptr), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
}

TEST_F(KlibcSystem, IgnoredChildSignalMakesTheStatusUnknown) {
  // With SIGCHLD ignored the kernel reaps the shell itself, so its status
  // is lost; this must fail, not hang or report success.
  ScopedSignalAction ignore(SIGCHLD, SIG_IGN, 0);
  EXPECT_EQ(KLIBCSystem("exit 0"), -1);
  ExpectError(KLIBC_ERR_EXEC);
}

TEST_F(KlibcSystem, ChildSignalHandlerWithoutRestartStillGetsTheStatus) {
  // No SA_RESTART: the SIGCHLD can interrupt the wait, which must retry.
  gChildSignals = 0;
  ScopedSignalAction count(SIGCHLD, CountChildSignal, 0);
  EXPECT_EQ(KLIBCSystem("exit 5"), 5);
  EXPECT_EQ(KLIBCSystem("exit 6"), 6);
  EXPECT_GE(gChildSignals, 1);
  ExpectNoError();
}

TEST_F(KlibcSystem, CommandDoesNotInheritIgnoredOrBlockedSignals) {
  ScopedSignalAction ignore(SIGTERM, SIG_IGN, 0);
  sigset_t block;
  sigset_t old;
  sigemptyset(&block);
  sigaddset(&block, SIGUSR1);
  ASSERT_EQ(pthread_sigmask(SIG_BLOCK, &block, &old), 0);
  const int term = KLIBCSystem("kill -TERM $$; exit 0");
  const int usr1 = KLIBCSystem("kill -USR1 $$; exit 0");
  ASSERT_EQ(pthread_sigmask(SIG_SETMASK, &old, nullptr), 0);
  EXPECT_EQ(term, -1);
  EXPECT_EQ(usr1, -1);
}

} // namespace
} // namespace zark::test
