// Replacing a file atomically: the one implementation of "write a temporary
// file beside it, flush it, rename it over the old one" for the platform
// libraries and the host (C++ only). It records nothing in the error state
// and logs nothing: the caller reports the failed step in its own way.
#ifndef ZARK_PLATFORM_KLIBC_REPLACE_H
#define ZARK_PLATFORM_KLIBC_REPLACE_H

#include <sys/stat.h>

#include <optional>
#include <string>
#include <string_view>

namespace zark::klibc {

// The steps of ReplaceFile, in order.
enum class ReplaceStep {
  kCreateTemp, // mkostemp of the temporary file
  kSetMode,    // fchmod to the wanted mode
  kSetOwner,   // fchmod again after a successful fchown (it clears set-id)
  kWrite,      // writing the content
  kFlush,      // fsync of the temporary file
  kClose,      // close of the temporary file (a delayed write error)
  kRename,     // rename over the path
  // The file is replaced already at the two steps below; only the rename's
  // durability is in doubt.
  kOpenFolder,  // opening the folder to flush it
  kFlushFolder, // fsync of the folder
};

// Where the temporary file goes.
enum class TempName {
  kHiddenInFolder, // "<folder>/.<name>.XXXXXX"
  kBesidePath,     // "<path>.XXXXXX"
};

struct ReplaceOptions {
  mode_t mode = 0644; // mode of the new file
  // When not null and naming another owner, the new file gets that owner
  // if the caller may give it (a failed fchown is not a failure).
  const struct stat *owner = nullptr;
  TempName tempName = TempName::kHiddenInFolder;
  // fsync the file before the rename and the folder after it. Without, the
  // replacement is still atomic for readers but may be lost in a crash.
  bool flush = true;
};

struct ReplaceFailure {
  ReplaceStep step;
  int error;            // errno of the failed call
  std::string tempPath; // the temporary file's path (removed again)
  std::string folder;   // the folder of path
};

// Replaces the file at path by content with options. nullopt when every
// step succeeded; otherwise the first step that failed. Before kOpenFolder
// the old file is untouched and the temporary file removed. May throw
// std::bad_alloc.
[[nodiscard]] std::optional<ReplaceFailure>
ReplaceFile(const std::string &path, std::string_view content,
            const ReplaceOptions &options);

// True when failure left path replaced (nullopt, or a folder step).
[[nodiscard]] inline bool
FileWasReplaced(const std::optional<ReplaceFailure> &failure) {
  return !failure || failure->step >= ReplaceStep::kOpenFolder;
}

} // namespace zark::klibc

#endif
