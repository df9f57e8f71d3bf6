// Reading the service definition folders: which ".sc" files a folder holds,
// and the text of one file.
#ifndef ZARK_PLATFORM_FIREWALL_SERVICE_DIR_H
#define ZARK_PLATFORM_FIREWALL_SERVICE_DIR_H

#include <string>
#include <string_view>
#include <vector>

namespace zark::fw {

// File name suffix of a service definition file.
inline constexpr std::string_view kServiceFileSuffix = ".sc";

// Largest service definition file read (bytes); a larger one is refused as
// unreadable, which keeps a runaway file from eating memory.
inline constexpr size_t kMaxServiceFileSize = 1 << 20;

struct ServiceDirListing {
  // 0 when the folder was listed; else the errno of the failure (ENOENT:
  // no such folder).
  int err = 0;
  // Service identifiers (file names without ".sc") of the regular files
  // whose names end in ".sc", sorted by strcmp. A bare ".sc" and names
  // starting with "." are left out.
  std::vector<std::string> serviceIds;
};

[[nodiscard]] ServiceDirListing ListServiceDir(const std::string &dir);

struct FileText {
  int err = 0; // 0, or the errno of the failure (EFBIG: over the size cap)
  std::string text;
};

[[nodiscard]] FileText ReadServiceFile(const std::string &path);

// True when id can name a file of a service folder: not empty, no "/", not
// "." or "..".
[[nodiscard]] bool IsServiceId(std::string_view id);

} // namespace zark::fw

#endif
