// Which long job the library is running (KLibGetLibZarkPortMapRunningTask),
// told in a way that survives the job's process being killed.
//
// The job holds an open-file-description write lock (F_OFD_SETLK) on one
// byte of /etc/portforward/running_task.lock: byte 1 for the UPnP
// compatibility test (ZARK_PORTMAP_TASK_UPNP_TEST), byte 2 for applying
// rules (ZARK_PORTMAP_TASK_APPLY_RULES). The kernel drops the lock when the
// job ends in any way, a kill included, so there is no stale state to
// clean up. A reader asks the kernel whether the byte is locked
// (F_OFD_GETLK); it takes no lock and waits for nothing. Locks of separate
// opens conflict within one process too, so a reader in the job's own
// process sees the job.
#ifndef ZARK_PORTMAP_RUNNING_TASK_H
#define ZARK_PORTMAP_RUNNING_TASK_H

#include "base/unique_fd.h"
#include "libzarkportmap.h"

#include <string>

namespace zark::portmap {

inline constexpr const char *kRunningTaskPath =
    ZARK_PORTMAP_CONF_DIR "/running_task.lock";

// Marks a job as running for as long as the object lives.
class RunningTaskMark {
public:
  // task: ZARK_PORTMAP_TASK_UPNP_TEST or ZARK_PORTMAP_TASK_APPLY_RULES.
  // When the mark cannot be set (file not writable, the same job already
  // marked elsewhere) it is logged and Held() is false; the job goes on.
  explicit RunningTaskMark(int task,
                           const std::string &path = kRunningTaskPath);
  RunningTaskMark(const RunningTaskMark &) = delete;
  RunningTaskMark &operator=(const RunningTaskMark &) = delete;
  ~RunningTaskMark() = default; // closing the descriptor drops the lock

  [[nodiscard]] bool Held() const { return mFd.Valid(); }

private:
  UniqueFd mFd;
};

// The job running now: ZARK_PORTMAP_TASK_APPLY_RULES, _UPNP_TEST or _NONE
// (also when the file does not exist). -1, logged, when the file exists but
// cannot be asked.
[[nodiscard]] int
CurrentRunningTask(const std::string &path = kRunningTaskPath);

// Whether one job (ZARK_PORTMAP_TASK_UPNP_TEST or _APPLY_RULES) is marked
// running now, whatever else runs: 1 yes, 0 no (also when the file does not
// exist), -1, logged, when the file exists but cannot be asked.
[[nodiscard]] int IsTaskRunning(int task,
                                const std::string &path = kRunningTaskPath);

} // namespace zark::portmap

#endif
