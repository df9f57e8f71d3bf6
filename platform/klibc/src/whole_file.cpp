#include "whole_file.h"

#include "error_state.h"
#include "klibc_fd.h"
#include "klibc_replace.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

namespace zark::klibc {

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
  ReplaceOptions options;
  options.mode = old != nullptr ? (old->st_mode & 07777) : 0644;
  options.owner = old;
  // The new content is in place even when the folder cannot be flushed, so
  // that is not a failure.
  if (!FileWasReplaced(ReplaceFile(path, content, options))) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_FILE_WRITE);
    return false;
  }
  return true;
}

} // namespace zark::klibc
