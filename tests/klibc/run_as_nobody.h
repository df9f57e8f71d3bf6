// Runs a check in a child process that has given up root, for the results
// that only appear when permission is denied (tests run as root).
#ifndef ZARK_TESTS_KLIBC_RUN_AS_NOBODY_H
#define ZARK_TESTS_KLIBC_RUN_AS_NOBODY_H

#include <grp.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <functional>

namespace zark::test {

// Exit status of a child that runs check as user and group 65534, or -1 when
// the child could not be run or did not exit. check must not use gtest
// assertions; it reports through its result (0..255).
inline int RunAsNobody(const std::function<int()> &check) {
  const pid_t child = fork();
  if (child < 0) {
    return -1;
  }
  if (child == 0) {
    if (setgroups(0, nullptr) != 0 || setgid(65534) != 0 ||
        setuid(65534) != 0) {
      _exit(250);
    }
    _exit(check());
  }
  int status = 0;
  pid_t waited = -1;
  do {
    waited = waitpid(child, &status, 0);
  } while (waited < 0 && errno == EINTR);
  if (waited != child || !WIFEXITED(status)) {
    return -1;
  }
  return WEXITSTATUS(status);
}

} // namespace zark::test

#endif
