// Reading and replacing the library's small configuration files.
#ifndef ZARK_PORTMAP_CONF_FILE_H
#define ZARK_PORTMAP_CONF_FILE_H

#include <sys/types.h>

#include <cstddef>
#include <string>
#include <string_view>

namespace zark::portmap {

enum class ReadStatus {
  kRead,     // content holds the whole file
  kMissing,  // no file at path (ENOENT)
  kTooLarge, // the file is larger than the limit
  kFailed,   // it could not be opened or read, or is not a regular file
};

struct ReadResult {
  ReadStatus status = ReadStatus::kFailed;
  std::string content;
};

// Reads the regular file at path, at most maxBytes of it. Failures other
// than a missing file are logged once.
[[nodiscard]] ReadResult ReadSmallFile(const std::string &path,
                                       std::size_t maxBytes);

// Creates folder and its missing parents with the given mode. True when
// folder exists as a folder afterwards; a failure is logged.
[[nodiscard]] bool MakeFolders(const std::string &folder, mode_t mode);

// Replaces the file at path with content so that a reader sees either the
// old file or the new one, whole: the content goes to a temporary file
// ".<name>.XXXXXX" in the same folder (mode `mode`), is flushed to disk,
// renamed over path, and the folder is flushed. A missing folder is created
// with mode 0755. False when any step fails; the old file is then untouched
// and the temporary file removed (when the folder flush fails, the new file
// is already in place). Every failure is logged once.
[[nodiscard]] bool ReplaceFileAtomically(const std::string &path,
                                         std::string_view content, mode_t mode);

} // namespace zark::portmap

#endif
