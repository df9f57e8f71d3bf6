#include "base/conf_file.h"

#include "base/portmap_log.h"
#include "base/unique_fd.h"

#include "klibc_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>

namespace zark::portmap {
namespace {

// Removes the temporary file unless it was renamed into place.
class TempFileGuard {
public:
  explicit TempFileGuard(std::string path) : mPath(std::move(path)) {}
  TempFileGuard(const TempFileGuard &) = delete;
  TempFileGuard &operator=(const TempFileGuard &) = delete;
  ~TempFileGuard() {
    if (!mPath.empty()) {
      ::unlink(mPath.c_str());
    }
  }
  void Keep() { mPath.clear(); }

private:
  std::string mPath;
};

void SplitPath(const std::string &path, std::string &folder,
               std::string &name) {
  std::size_t slash = path.find_last_of('/');
  if (slash == std::string::npos) {
    folder = ".";
    name = path;
  } else {
    folder = slash == 0 ? "/" : path.substr(0, slash);
    name = path.substr(slash + 1);
  }
}

} // namespace

ReadResult ReadSmallFile(const std::string &path, std::size_t maxBytes) {
  ReadResult result;
  // O_NONBLOCK: a FIFO at path must not block the open; it is refused as
  // not a regular file below. Reads of a regular file ignore the flag.
  UniqueFd fd(
      ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
  if (!fd.Valid()) {
    int saved = errno;
    if (saved == ENOENT) {
      result.status = ReadStatus::kMissing;
      return result;
    }
    ZARK_PM_LOG_CALL("open", -1, saved, path.c_str());
    return result;
  }
  struct stat info {};
  if (::fstat(fd.Get(), &info) != 0) {
    ZARK_PM_LOG_CALL("fstat", -1, errno, path.c_str());
    return result;
  }
  if (!S_ISREG(info.st_mode)) {
    ZARK_PM_LOG_ERROR("%s is not a regular file", path.c_str());
    return result;
  }
  if (static_cast<unsigned long long>(info.st_size) > maxBytes) {
    ZARK_PM_LOG_ERROR("%s is larger than %zu bytes", path.c_str(), maxBytes);
    result.status = ReadStatus::kTooLarge;
    return result;
  }
  // Read up to one byte past the limit: the file may have grown since fstat.
  std::string content;
  char buffer[65536];
  for (;;) {
    ssize_t got = ::read(fd.Get(), buffer, sizeof(buffer));
    if (got < 0) {
      if (errno == EINTR) {
        continue;
      }
      ZARK_PM_LOG_CALL("read", got, errno, path.c_str());
      return result;
    }
    if (got == 0) {
      break;
    }
    content.append(buffer, static_cast<std::size_t>(got));
    if (content.size() > maxBytes) {
      ZARK_PM_LOG_ERROR("%s is larger than %zu bytes", path.c_str(), maxBytes);
      result.status = ReadStatus::kTooLarge;
      return result;
    }
  }
  result.status = ReadStatus::kRead;
  result.content = std::move(content);
  return result;
}

bool MakeFolders(const std::string &folder, mode_t mode) {
  if (folder.empty()) {
    return false;
  }
  // Walk the path from the root, creating each missing component.
  std::size_t pos = 0;
  while (pos != std::string::npos) {
    pos = folder.find('/', pos + 1);
    std::string part = folder.substr(0, pos);
    if (part.empty() || part == "/") {
      continue;
    }
    if (::mkdir(part.c_str(), mode) != 0 && errno != EEXIST) {
      ZARK_PM_LOG_CALL("mkdir", -1, errno, part.c_str());
      return false;
    }
  }
  struct stat info {};
  if (::stat(folder.c_str(), &info) != 0) {
    ZARK_PM_LOG_CALL("stat", -1, errno, folder.c_str());
    return false;
  }
  if (!S_ISDIR(info.st_mode)) {
    ZARK_PM_LOG_ERROR("%s is not a folder", folder.c_str());
    return false;
  }
  return true;
}

bool ReplaceFileAtomically(const std::string &path, std::string_view content,
                           mode_t mode) {
  std::string folder;
  std::string name;
  SplitPath(path, folder, name);
  if (name.empty() || name == "." || name == "..") {
    ZARK_PM_LOG_ERROR("cannot write a file at \"%s\"", path.c_str());
    return false;
  }
  if (!MakeFolders(folder, 0755)) {
    return false;
  }
  std::string tempPath = folder + "/." + name + ".XXXXXX";
  UniqueFd fd(::mkostemp(tempPath.data(), O_CLOEXEC));
  if (!fd.Valid()) {
    ZARK_PM_LOG_CALL("mkostemp", -1, errno, tempPath.c_str());
    return false;
  }
  TempFileGuard guard(tempPath);
  // mkostemp gives 0600 less the umask; set the mode exactly.
  if (::fchmod(fd.Get(), mode) != 0) {
    ZARK_PM_LOG_CALL("fchmod", -1, errno, tempPath.c_str());
    return false;
  }
  if (!klibc::WriteAll(fd.Get(), content)) {
    ZARK_PM_LOG_CALL("write", -1, errno, tempPath.c_str());
    return false;
  }
  if (::fsync(fd.Get()) != 0) {
    ZARK_PM_LOG_CALL("fsync", -1, errno, tempPath.c_str());
    return false;
  }
  if (::close(fd.Release()) != 0) {
    ZARK_PM_LOG_CALL("close", -1, errno, tempPath.c_str());
    return false;
  }
  if (::rename(tempPath.c_str(), path.c_str()) != 0) {
    ZARK_PM_LOG_CALL("rename", -1, errno, path.c_str());
    return false;
  }
  guard.Keep();
  // Make the rename itself durable.
  UniqueFd dir(::open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!dir.Valid()) {
    ZARK_PM_LOG_CALL("open", -1, errno, folder.c_str());
    return false;
  }
  if (::fsync(dir.Get()) != 0) {
    ZARK_PM_LOG_CALL("fsync", -1, errno, folder.c_str());
    return false;
  }
  return true;
}

} // namespace zark::portmap
