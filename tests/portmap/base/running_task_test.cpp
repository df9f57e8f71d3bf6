// The running-job mark: seen while held, in this process and others, and
// gone when its process is killed. HERMETIC (/etc/portforward).
#include "base/running_task.h"

#include "hermetic.h"
#include "libzarkportmap.h"

#include <gtest/gtest.h>

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

namespace zark::portmap {
namespace {

class PortMapRouterRunningTask : public testing::Test {
protected:
  void SetUp() override { test::ResetFixedPaths(); }
};

int Current() {
  ZARK_LIBZARKPORTMAP_TASK task{-1};
  EXPECT_EQ(0, KLibGetLibZarkPortMapRunningTask(&task));
  return task.task;
}

TEST_F(PortMapRouterRunningTask, NoneWithoutAFile) {
  EXPECT_EQ(ZARK_PORTMAP_TASK_NONE, Current());
}

TEST_F(PortMapRouterRunningTask, SeenWhileHeldInThisProcess) {
  {
    RunningTaskMark mark(ZARK_PORTMAP_TASK_APPLY_RULES);
    ASSERT_TRUE(mark.Held());
    EXPECT_EQ(ZARK_PORTMAP_TASK_APPLY_RULES, Current());
  }
  EXPECT_EQ(ZARK_PORTMAP_TASK_NONE, Current());
  {
    RunningTaskMark mark(ZARK_PORTMAP_TASK_UPNP_TEST);
    EXPECT_EQ(ZARK_PORTMAP_TASK_UPNP_TEST, Current());
  }
  EXPECT_EQ(ZARK_PORTMAP_TASK_NONE, Current());
}

TEST_F(PortMapRouterRunningTask, GoneWhenItsProcessIsKilled) {
  int ready[2];
  ASSERT_EQ(0, ::pipe(ready));
  pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    ::close(ready[0]);
    RunningTaskMark mark(ZARK_PORTMAP_TASK_APPLY_RULES);
    char byte = mark.Held() ? 1 : 0;
    (void)!::write(ready[1], &byte, 1);
    for (int i = 0; i < 600; ++i) { // bounded: killed long before
      ::sleep(1);
    }
    ::_exit(0);
  }
  ::close(ready[1]);
  char byte = 0;
  ASSERT_EQ(1, ::read(ready[0], &byte, 1));
  ::close(ready[0]);
  ASSERT_EQ(1, byte);

  EXPECT_EQ(ZARK_PORTMAP_TASK_APPLY_RULES, Current());
  ASSERT_EQ(0, ::kill(child, SIGKILL));
  int status = 0;
  ASSERT_EQ(child, ::waitpid(child, &status, 0));

  EXPECT_EQ(ZARK_PORTMAP_TASK_NONE, Current());
}

TEST_F(PortMapRouterRunningTask, NullRecordIsRefused) {
  EXPECT_EQ(-1, KLibGetLibZarkPortMapRunningTask(nullptr));
}

} // namespace
} // namespace zark::portmap
