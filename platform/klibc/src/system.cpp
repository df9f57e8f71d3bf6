// KLIBCSystem: runs a command line with /bin/sh -c and waits for it.
#include "error_state.h"

#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>

#include <cerrno>

extern char **environ;

namespace zark::klibc {
namespace {

// Owns a posix_spawnattr_t.
class SpawnAttributes {
public:
  SpawnAttributes() { mReady = posix_spawnattr_init(&mAttributes) == 0; }
  ~SpawnAttributes() {
    if (mReady) {
      posix_spawnattr_destroy(&mAttributes);
    }
  }
  SpawnAttributes(const SpawnAttributes &) = delete;
  SpawnAttributes &operator=(const SpawnAttributes &) = delete;

  // The shell starts with every signal at its default action and none
  // blocked, whatever the calling thread blocks or ignores: an inherited
  // ignored SIGCHLD or SIGPIPE would change how the command behaves.
  [[nodiscard]] bool ResetSignals() {
    sigset_t all;
    sigset_t none;
    sigfillset(&all);
    sigemptyset(&none);
    return mReady && posix_spawnattr_setsigdefault(&mAttributes, &all) == 0 &&
           posix_spawnattr_setsigmask(&mAttributes, &none) == 0 &&
           posix_spawnattr_setflags(&mAttributes, POSIX_SPAWN_SETSIGDEF |
                                                      POSIX_SPAWN_SETSIGMASK) ==
               0;
  }

  [[nodiscard]] const posix_spawnattr_t *Get() const { return &mAttributes; }

private:
  posix_spawnattr_t mAttributes{};
  bool mReady = false;
};

} // namespace
} // namespace zark::klibc

extern "C" {

int KLIBCSystem(const char *command) {
  if (command == nullptr) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  zark::klibc::SpawnAttributes attributes;
  if (!attributes.ResetSignals()) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_EXEC);
    return -1;
  }
  char shell[] = "/bin/sh";
  char name[] = "sh";
  char option[] = "-c";
  // posix_spawn takes char *const argv[] but does not write to them.
  char *const argv[] = {name, option, const_cast<char *>(command), nullptr};
  pid_t child = -1;
  if (posix_spawn(&child, shell, nullptr, attributes.Get(), argv, environ) !=
      0) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_EXEC);
    return -1;
  }
  int status = 0;
  pid_t waited = -1;
  do {
    waited = waitpid(child, &status, 0);
  } while (waited < 0 && errno == EINTR);
  if (waited < 0) {
    // ECHILD: SIGCHLD is ignored in this process (or someone else reaped
    // the child), so the exit status is lost.
    KLIBC_RECORD_ERROR(KLIBC_ERR_EXEC);
    return -1;
  }
  if (!WIFEXITED(status)) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_EXEC);
    return -1;
  }
  return WEXITSTATUS(status);
}

} // extern "C"
