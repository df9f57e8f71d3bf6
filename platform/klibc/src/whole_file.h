// Reading a whole (bounded) file and replacing a file atomically.
#ifndef ZARK_PLATFORM_KLIBC_WHOLE_FILE_H
#define ZARK_PLATFORM_KLIBC_WHOLE_FILE_H

#include <sys/stat.h>

#include <cstddef>
#include <string>
#include <string_view>

namespace zark::klibc {

// Largest file the library reads; a configuration file is far smaller, so
// anything bigger is refused rather than read into memory.
inline constexpr std::size_t kMaxFileSize = std::size_t{4} << 20;

enum class ReadStatus {
  kRead,    // content holds the file
  kMissing, // the file does not exist; nothing recorded, the caller decides
  kFailed,  // recorded: KLIBC_ERR_FILE_OPEN (cannot open, not a regular
            // file), KLIBC_ERR_FILE_READ, KLIBC_ERR_TOO_LARGE (over
            // kMaxFileSize)
};

// Reads the regular file at path into content. When info is not null it
// receives the file's status (mode, owner) on kRead. May throw
// std::bad_alloc.
[[nodiscard]] ReadStatus ReadWholeFile(const char *path, std::string &content,
                                       struct stat *info = nullptr);

// Replaces the file at path by content: writes a temporary file in the same
// folder, flushes it to disk, and renames it over path, so that a reader sees
// either the old or the new content and a failure leaves the old file as it
// was. The new file gets the mode (and, when allowed, the owner) of old, or
// mode 0644 when old is null. Returns false with KLIBC_ERR_FILE_WRITE
// recorded on failure; the temporary file is then removed. May throw
// std::bad_alloc.
[[nodiscard]] bool ReplaceFileAtomically(const std::string &path,
                                         std::string_view content,
                                         const struct stat *old);

} // namespace zark::klibc

#endif
