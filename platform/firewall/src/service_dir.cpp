#include "service_dir.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <memory>

namespace zark::fw {
namespace {

struct DirCloser {
  void operator()(DIR *dir) const { closedir(dir); }
};
using DirPtr = std::unique_ptr<DIR, DirCloser>;

class Fd {
public:
  explicit Fd(int fd) : mFd(fd) {}
  ~Fd() {
    if (mFd >= 0) {
      close(mFd);
    }
  }
  Fd(const Fd &) = delete;
  Fd &operator=(const Fd &) = delete;
  [[nodiscard]] int get() const { return mFd; }

private:
  int mFd;
};

bool IsRegularFile(const std::string &path) {
  struct stat st {};
  return stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

} // namespace

bool IsServiceId(std::string_view id) {
  return !id.empty() && id != "." && id != ".." &&
         id.find('/') == std::string_view::npos;
}

ServiceDirListing ListServiceDir(const std::string &dir) {
  ServiceDirListing listing;
  DirPtr handle(opendir(dir.c_str()));
  if (!handle) {
    listing.err = errno;
    return listing;
  }
  while (true) {
    errno = 0;
    struct dirent *entry = readdir(handle.get());
    if (entry == nullptr) {
      if (errno != 0) {
        listing.err = errno;
        listing.serviceIds.clear();
        return listing;
      }
      break;
    }
    std::string_view name(entry->d_name);
    if (name.size() <= kServiceFileSuffix.size() || name.front() == '.' ||
        !name.ends_with(kServiceFileSuffix)) {
      continue;
    }
    // The folder entry's type saves a stat per file where the file system
    // reports it; symbolic links are followed.
    bool regular = entry->d_type == DT_REG;
    if (entry->d_type == DT_UNKNOWN || entry->d_type == DT_LNK) {
      regular = IsRegularFile(dir + "/" + std::string(name));
    }
    if (!regular) {
      continue;
    }
    listing.serviceIds.emplace_back(
        name.substr(0, name.size() - kServiceFileSuffix.size()));
  }
  std::sort(listing.serviceIds.begin(), listing.serviceIds.end());
  return listing;
}

FileText ReadServiceFile(const std::string &path) {
  FileText result;
  Fd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (fd.get() < 0) {
    result.err = errno;
    return result;
  }
  char buffer[4096];
  while (true) {
    ssize_t got = read(fd.get(), buffer, sizeof(buffer));
    if (got < 0) {
      if (errno == EINTR) {
        continue;
      }
      result.err = errno;
      result.text.clear();
      return result;
    }
    if (got == 0) {
      break;
    }
    if (result.text.size() + static_cast<size_t>(got) > kMaxServiceFileSize) {
      result.err = EFBIG;
      result.text.clear();
      return result;
    }
    result.text.append(buffer, static_cast<size_t>(got));
  }
  return result;
}

} // namespace zark::fw
