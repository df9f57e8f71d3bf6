#include "base/running_task.h"

#include "base/conf_file.h"
#include "base/portmap_log.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>

namespace zark::portmap {
namespace {

flock ByteOf(int task, short type) {
  flock lock{};
  lock.l_type = type;
  lock.l_whence = SEEK_SET;
  lock.l_start = task;
  lock.l_len = 1;
  return lock;
}

std::string FolderOf(const std::string &path) {
  std::size_t slash = path.find_last_of('/');
  return slash == std::string::npos || slash == 0 ? std::string("/")
                                                  : path.substr(0, slash);
}

} // namespace

RunningTaskMark::RunningTaskMark(int task, const std::string &path) {
  if (!MakeFolders(FolderOf(path), 0755)) {
    return;
  }
  UniqueFd fd(::open(path.c_str(),
                     O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NOCTTY,
                     0600));
  if (!fd.Valid()) {
    ZARK_PM_LOG_CALL("open", -1, errno, path.c_str());
    return;
  }
  flock lock = ByteOf(task, F_WRLCK);
  if (::fcntl(fd.Get(), F_OFD_SETLK, &lock) != 0) {
    ZARK_PM_LOG_CALL("fcntl(F_OFD_SETLK)", -1, errno, path.c_str());
    return;
  }
  mFd = std::move(fd);
}

int CurrentRunningTask(const std::string &path) {
  UniqueFd fd(
      ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NOCTTY));
  if (!fd.Valid()) {
    if (errno == ENOENT) {
      return ZARK_PORTMAP_TASK_NONE;
    }
    ZARK_PM_LOG_CALL("open", -1, errno, path.c_str());
    return -1;
  }
  // Applying rules is named first when both run.
  for (int task :
       {ZARK_PORTMAP_TASK_APPLY_RULES, ZARK_PORTMAP_TASK_UPNP_TEST}) {
    flock lock = ByteOf(task, F_WRLCK);
    if (::fcntl(fd.Get(), F_OFD_GETLK, &lock) != 0) {
      ZARK_PM_LOG_CALL("fcntl(F_OFD_GETLK)", -1, errno, path.c_str());
      return -1;
    }
    if (lock.l_type != F_UNLCK) {
      return task;
    }
  }
  return ZARK_PORTMAP_TASK_NONE;
}

int IsTaskRunning(int task, const std::string &path) {
  UniqueFd fd(
      ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NOCTTY));
  if (!fd.Valid()) {
    if (errno == ENOENT) {
      return 0;
    }
    ZARK_PM_LOG_CALL("open", -1, errno, path.c_str());
    return -1;
  }
  flock lock = ByteOf(task, F_WRLCK);
  if (::fcntl(fd.Get(), F_OFD_GETLK, &lock) != 0) {
    ZARK_PM_LOG_CALL("fcntl(F_OFD_GETLK)", -1, errno, path.c_str());
    return -1;
  }
  return lock.l_type != F_UNLCK ? 1 : 0;
}

} // namespace zark::portmap

extern "C" int
KLibGetLibZarkPortMapRunningTask(ZARK_LIBZARKPORTMAP_TASK *task) {
  if (task == nullptr) {
    ZARK_PM_LOG_ERROR("KLibGetLibZarkPortMapRunningTask: task is NULL");
    return -1;
  }
  int current = zark::portmap::CurrentRunningTask();
  if (current < 0) {
    return -1;
  }
  task->task = current;
  return 0;
}
