#include "base/conf_file.h"

#include "base/portmap_log.h"
#include "base/unique_fd.h"

#include "klibc_replace.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>

namespace zark::portmap {
namespace {

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
  klibc::ReplaceOptions options;
  options.mode = mode;
  const std::optional<klibc::ReplaceFailure> failure =
      klibc::ReplaceFile(path, content, options);
  if (!failure) {
    return true;
  }
  const char *call = "";
  const std::string *subject = &failure->tempPath;
  switch (failure->step) {
  case klibc::ReplaceStep::kCreateTemp:
    call = "mkostemp";
    break;
  case klibc::ReplaceStep::kSetMode:
  case klibc::ReplaceStep::kSetOwner:
    call = "fchmod";
    break;
  case klibc::ReplaceStep::kWrite:
    call = "write";
    break;
  case klibc::ReplaceStep::kFlush:
    call = "fsync";
    break;
  case klibc::ReplaceStep::kClose:
    call = "close";
    break;
  case klibc::ReplaceStep::kRename:
    call = "rename";
    subject = &path;
    break;
  case klibc::ReplaceStep::kOpenFolder:
    call = "open";
    subject = &failure->folder;
    break;
  case klibc::ReplaceStep::kFlushFolder:
    call = "fsync";
    subject = &failure->folder;
    break;
  }
  ZARK_PM_LOG_CALL(call, -1, failure->error, subject->c_str());
  return false;
}

} // namespace zark::portmap
