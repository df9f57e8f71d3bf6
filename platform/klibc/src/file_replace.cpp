#include "klibc_replace.h"

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
      ::unlink(mPath.c_str());
    }
  }
  TempFile(const TempFile &) = delete;
  TempFile &operator=(const TempFile &) = delete;

  // Makes the file from the template ("...XXXXXX"); its descriptor, or -1.
  [[nodiscard]] int Create() {
    const int fd = ::mkostemp(mPath.data(), O_CLOEXEC);
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

std::optional<ReplaceFailure> ReplaceFile(const std::string &path,
                                          std::string_view content,
                                          const ReplaceOptions &options) {
  const std::size_t slash = path.rfind('/');
  const std::string folder = slash == std::string::npos ? std::string(".")
                             : slash == 0               ? std::string("/")
                                                        : path.substr(0, slash);
  const std::string name =
      slash == std::string::npos ? path : path.substr(slash + 1);
  TempFile temp(options.tempName == TempName::kBesidePath
                    ? path + ".XXXXXX"
                    : folder + (folder == "/" ? "." : "/.") + name + ".XXXXXX");
  auto failure = [&](ReplaceStep step) {
    const int error = errno;
    return std::optional<ReplaceFailure>(
        ReplaceFailure{step, error, temp.Path(), folder});
  };
  UniqueFd fd(temp.Create());
  if (!fd.Valid()) {
    return failure(ReplaceStep::kCreateTemp);
  }
  // mkostemp gives 0600 less the umask; set the mode exactly.
  if (::fchmod(fd.Get(), options.mode) != 0) {
    return failure(ReplaceStep::kSetMode);
  }
  const struct stat *owner = options.owner;
  if (owner != nullptr &&
      (owner->st_uid != ::geteuid() || owner->st_gid != ::getegid())) {
    // Only a privileged caller may keep another user's ownership; anyone
    // else ends up owning the rewritten file, as with any rewrite.
    if (::fchown(fd.Get(), owner->st_uid, owner->st_gid) == 0 &&
        ::fchmod(fd.Get(), options.mode) != 0) { // fchown clears set-id bits
      return failure(ReplaceStep::kSetOwner);
    }
  }
  if (!WriteAll(fd.Get(), content)) {
    return failure(ReplaceStep::kWrite);
  }
  if (options.flush && ::fsync(fd.Get()) != 0) {
    return failure(ReplaceStep::kFlush);
  }
  if (!fd.Close()) {
    return failure(ReplaceStep::kClose);
  }
  if (std::rename(temp.Path().c_str(), path.c_str()) != 0) {
    return failure(ReplaceStep::kRename);
  }
  temp.Release();
  if (!options.flush) {
    return std::nullopt;
  }
  // Make the rename itself durable.
  UniqueFd folderFd(::open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!folderFd.Valid()) {
    return failure(ReplaceStep::kOpenFolder);
  }
  if (::fsync(folderFd.Get()) != 0) {
    return failure(ReplaceStep::kFlushFolder);
  }
  return std::nullopt;
}

} // namespace zark::klibc
