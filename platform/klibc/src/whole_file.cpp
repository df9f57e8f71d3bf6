#include "whole_file.h"

#include "error_state.h"
#include "klibc_fd.h"
#include "klibc_file.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <utility>

namespace zark::klibc {
namespace {

// A temporary file, removed again unless the rename took it over. The
// path is complete before the file is made, so that nothing can fail (or
// throw) between making the file and owning it.
class TempFile {
public:
  explicit TempFile(std::string pathTemplate)
      : mPath(std::move(pathTemplate)) {}
  ~TempFile() {
    if (mCreated) {
      unlink(mPath.c_str());
    }
  }
  TempFile(const TempFile &) = delete;
  TempFile &operator=(const TempFile &) = delete;

  // Makes the file from the template ("...XXXXXX"); its descriptor, or -1.
  [[nodiscard]] int Create() {
    const int fd = mkostemp(mPath.data(), O_CLOEXEC);
    mCreated = fd >= 0;
    return fd;
  }
  [[nodiscard]] const std::string &Path() const { return mPath; }
  void Release() { mCreated = false; }

private:
  std::string mPath;
  bool mCreated = false;
};

} // namespace

ReadStatus ReadWholeFile(const char *path, std::string &content,
                         struct stat *info) {
  // O_NONBLOCK: opening a FIFO must not hang; it is refused below anyway.
  UniqueFd fd(open(path, O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  if (!fd.Valid()) {
    if (errno == ENOENT || errno == ENOTDIR) {
      return ReadStatus::kMissing;
    }
    KLIBC_RECORD_ERROR(KLIBC_ERR_FILE_OPEN);
    return ReadStatus::kFailed;
  }
  struct stat status {};
  if (fstat(fd.Get(), &status) != 0) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_FILE_READ);
    return ReadStatus::kFailed;
  }
  if (!S_ISREG(status.st_mode)) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_FILE_OPEN);
    return ReadStatus::kFailed;
  }
  if (status.st_size > static_cast<off_t>(kMaxFileSize)) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_TOO_LARGE);
    return ReadStatus::kFailed;
  }
  // The size is only a hint (files under /proc report 0, a file may grow
  // while read): read to the end, but never past the limit.
  content.clear();
  content.reserve(static_cast<std::size_t>(status.st_size));
  char chunk[16384];
  for (;;) {
    const ssize_t got = read(fd.Get(), chunk, sizeof chunk);
    if (got < 0) {
      if (errno == EINTR) {
        continue;
      }
      KLIBC_RECORD_ERROR(KLIBC_ERR_FILE_READ);
      return ReadStatus::kFailed;
    }
    if (got == 0) {
      break;
    }
    if (content.size() + static_cast<std::size_t>(got) > kMaxFileSize) {
      KLIBC_RECORD_ERROR(KLIBC_ERR_TOO_LARGE);
      return ReadStatus::kFailed;
    }
    content.append(chunk, static_cast<std::size_t>(got));
  }
  if (info != nullptr) {
    *info = status;
  }
  return ReadStatus::kRead;
}

bool ReplaceFileAtomically(const std::string &path, std::string_view content,
                           const struct stat *old) {
  const std::size_t slash = path.rfind('/');
  const std::string folder = slash == std::string::npos ? std::string(".")
                             : slash == 0               ? std::string("/")
                                                        : path.substr(0, slash);
  const std::string name =
      slash == std::string::npos ? path : path.substr(slash + 1);
  TempFile temp(folder + (folder == "/" ? "." : "/.") + name + ".XXXXXX");
  UniqueFd fd(temp.Create());
  if (!fd.Valid()) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_FILE_WRITE);
    return false;
  }
  const mode_t mode = old != nullptr ? (old->st_mode & 07777) : 0644;
  if (fchmod(fd.Get(), mode) != 0) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_FILE_WRITE);
    return false;
  }
  if (old != nullptr &&
      (old->st_uid != geteuid() || old->st_gid != getegid())) {
    // Only a privileged caller may keep another user's ownership; anyone
    // else ends up owning the rewritten file, as with any rewrite.
    if (fchown(fd.Get(), old->st_uid, old->st_gid) == 0 &&
        fchmod(fd.Get(), mode) != 0) { // fchown clears set-id bits
      KLIBC_RECORD_ERROR(KLIBC_ERR_FILE_WRITE);
      return false;
    }
  }
  if (!WriteAll(fd.Get(), content)) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_FILE_WRITE);
    return false;
  }
  if (fsync(fd.Get()) != 0) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_FILE_WRITE);
    return false;
  }
  if (!fd.Close()) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_FILE_WRITE);
    return false;
  }
  if (rename(temp.Path().c_str(), path.c_str()) != 0) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_FILE_WRITE);
    return false;
  }
  temp.Release();
  // Make the rename itself durable. The new content is in place either way,
  // so a folder that cannot be flushed is not a failure.
  UniqueFd folderFd(open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (folderFd.Valid() && fsync(folderFd.Get()) != 0) {
    // ignored, see above
  }
  return true;
}

} // namespace zark::klibc
