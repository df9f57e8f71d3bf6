#include "catalog/router_db_update.h"

#include "base/conf_file.h"
#include "base/library_config.h"
#include "base/portmap_log.h"
#include "base/unique_fd.h"
#include "catalog/router_db.h"
#include "catalog/router_db_archive.h"
#include "catalog/router_db_lock.h"
#include "libzarkportmap.h"
#include "net/http_download.h"

#include <fcntl.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <system_error>

namespace zark::portmap {
namespace {

namespace fs = std::filesystem;

constexpr const char *kStagingPrefix = ".routerdb-update.";

// Removes a staging folder and everything in it when it goes away.
class StagingFolder {
public:
  StagingFolder() = default;
  StagingFolder(const StagingFolder &) = delete;
  StagingFolder &operator=(const StagingFolder &) = delete;
  ~StagingFolder() {
    if (!mPath.empty()) {
      std::error_code ec;
      fs::remove_all(mPath, ec);
      if (ec) {
        ZARK_PM_LOG_ERROR("cannot remove %s: %s", mPath.c_str(),
                          ec.message().c_str());
      }
    }
  }

  // Makes "<parent>/.routerdb-update.XXXXXX", mode 0700.
  [[nodiscard]] bool Create(const std::string &parent) {
    std::string pattern = parent + "/" + kStagingPrefix + "XXXXXX";
    if (::mkdtemp(pattern.data()) == nullptr) {
      ZARK_PM_LOG_CALL("mkdtemp", -1, errno, pattern.c_str());
      return false;
    }
    mPath = pattern;
    return true;
  }
  [[nodiscard]] const std::string &Path() const { return mPath; }

private:
  std::string mPath;
};

std::string ParentOf(const std::string &path) {
  return fs::path(path).parent_path().string();
}

// Staging folders left by an update that was killed. Only called under the
// update lock, so none of them belongs to a running update.
void RemoveStaleStaging(const std::string &parent) {
  std::error_code ec;
  for (const fs::directory_entry &item : fs::directory_iterator(parent, ec)) {
    if (item.path().filename().string().rfind(kStagingPrefix, 0) == 0) {
      std::error_code removeEc;
      fs::remove_all(item.path(), removeEc);
      if (removeEc) {
        ZARK_PM_LOG_ERROR("cannot remove stale %s: %s", item.path().c_str(),
                          removeEc.message().c_str());
      }
    }
  }
}

bool CopyLocalArchive(const std::string &source, int out) {
  // O_NONBLOCK: a FIFO must not hang the open; it is refused below.
  UniqueFd in(
      ::open(source.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
  if (!in.Valid()) {
    ZARK_PM_LOG_CALL("open", -1, errno, source.c_str());
    return false;
  }
  struct stat info {};
  if (::fstat(in.Get(), &info) != 0) {
    ZARK_PM_LOG_CALL("fstat", -1, errno, source.c_str());
    return false;
  }
  if (!S_ISREG(info.st_mode)) {
    ZARK_PM_LOG_ERROR("%s is not a regular file", source.c_str());
    return false;
  }
  std::size_t total = 0;
  char buffer[65536];
  for (;;) {
    ssize_t got = ::read(in.Get(), buffer, sizeof(buffer));
    if (got < 0) {
      if (errno == EINTR) {
        continue;
      }
      ZARK_PM_LOG_CALL("read", got, errno, source.c_str());
      return false;
    }
    if (got == 0) {
      return true;
    }
    total += static_cast<std::size_t>(got);
    if (total > kMaxRouterDbArchiveBytes) {
      ZARK_PM_LOG_ERROR("%s is larger than %zu bytes", source.c_str(),
                        kMaxRouterDbArchiveBytes);
      return false;
    }
    for (ssize_t done = 0; done < got;) {
      ssize_t written =
          ::write(out, buffer + done, static_cast<std::size_t>(got - done));
      if (written < 0) {
        if (errno == EINTR) {
          continue;
        }
        ZARK_PM_LOG_CALL("write", written, errno, "router database archive");
        return false;
      }
      done += written;
    }
  }
}

// Brings the archive named by source to path. err set on failure.
bool FetchArchive(const std::string &source, const std::string &path,
                  int &err) {
  UniqueFd out(::open(path.c_str(),
                      O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW,
                      0600));
  if (!out.Valid()) {
    ZARK_PM_LOG_CALL("open", -1, errno, path.c_str());
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  bool fetched = false;
  if (!source.empty() && source[0] == '/') {
    fetched = CopyLocalArchive(source, out.Get());
  } else if (source.rfind("http://", 0) == 0 ||
             source.rfind("https://", 0) == 0) {
    DownloadLimits limits;
    limits.maxBytes = kMaxRouterDbArchiveBytes;
    fetched = DownloadToFd(source, out.Get(), limits);
  } else {
    ZARK_PM_LOG_ERROR("router database update source \"%.300s\" is neither "
                      "an absolute path nor an http:// or https:// URL",
                      source.c_str());
    err = ZARK_PORTMAP_ERR_BAD_PARAMETER;
    return false;
  }
  if (!fetched) {
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  if (::close(out.Release()) != 0) {
    ZARK_PM_LOG_CALL("close", -1, errno, path.c_str());
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  return true;
}

// The unpacked tree gets the modes of an installed database whatever the
// archive or the umask said: folders 0755, files 0644.
bool NormaliseModes(const std::string &root) {
  std::error_code ec;
  if (::chmod(root.c_str(), 0755) != 0) {
    ZARK_PM_LOG_CALL("chmod", -1, errno, root.c_str());
    return false;
  }
  for (fs::recursive_directory_iterator it(root, ec), end; !ec && it != end;
       it.increment(ec)) {
    fs::file_status status = it->symlink_status(ec);
    if (ec) {
      break;
    }
    mode_t mode = 0;
    if (status.type() == fs::file_type::directory) {
      mode = 0755;
    } else if (status.type() == fs::file_type::regular) {
      mode = 0644;
    } else {
      // Only folders and files were unpacked; anything else means the
      // tree changed under us.
      ZARK_PM_LOG_ERROR("%s is neither a folder nor a regular file",
                        it->path().c_str());
      return false;
    }
    if (::chmod(it->path().c_str(), mode) != 0) {
      ZARK_PM_LOG_CALL("chmod", -1, errno, it->path().c_str());
      return false;
    }
  }
  if (ec) {
    ZARK_PM_LOG_ERROR("cannot walk %s: %s", root.c_str(), ec.message().c_str());
    return false;
  }
  return true;
}

bool SyncFolder(const std::string &folder) {
  UniqueFd fd(::open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd.Valid() || ::fsync(fd.Get()) != 0) {
    ZARK_PM_LOG_CALL("fsync", -1, errno, folder.c_str());
    return false;
  }
  return true;
}

// Puts the database at staged in place of the installed one. After
// RENAME_EXCHANGE the old database sits at staged, to be removed with the
// staging folder.
bool SwapIn(const std::string &staged, int &err) {
  const std::string installed = ZARK_PORTMAP_ROUTERDB_DIR;
  RouterDbLock lock(kRouterDbLockFile, RouterDbLock::Mode::kExclusive);
  if (!lock.Held()) {
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  struct stat info {};
  if (::lstat(installed.c_str(), &info) == 0) {
    if (::renameat2(AT_FDCWD, staged.c_str(), AT_FDCWD, installed.c_str(),
                    RENAME_EXCHANGE) != 0) {
      ZARK_PM_LOG_CALL("renameat2(RENAME_EXCHANGE)", -1, errno,
                       installed.c_str());
      err = ZARK_PORTMAP_ERR_IO;
      return false;
    }
  } else if (errno == ENOENT) {
    if (::rename(staged.c_str(), installed.c_str()) != 0) {
      ZARK_PM_LOG_CALL("rename", -1, errno, installed.c_str());
      err = ZARK_PORTMAP_ERR_IO;
      return false;
    }
  } else {
    ZARK_PM_LOG_CALL("lstat", -1, errno, installed.c_str());
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  // The new database is in place; a failed flush only weakens how well
  // that survives a power cut, so it is logged and the update stands.
  (void)SyncFolder(ParentOf(installed));
  return true;
}

// The configured update source; empty (logged, err set) when there is none.
std::string UpdateSource(int &err) {
  std::string source = GetLibraryConfig(config_key::kRouterDbUpdateSource, "");
  if (source.empty()) {
    ZARK_PM_LOG_ERROR("no router database update source: set %s in %s",
                      std::string(config_key::kRouterDbUpdateSource).c_str(),
                      kLibraryConfigPath);
    err = ZARK_PORTMAP_ERR_BAD_PARAMETER;
  }
  return source;
}

// A fresh staging folder beside the installed database, after removing
// what an interrupted update left there.
bool CreateStaging(StagingFolder &staging, int &err) {
  const std::string parent = ParentOf(ZARK_PORTMAP_ROUTERDB_DIR);
  if (!MakeFolders(parent, 0755)) {
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  RemoveStaleStaging(parent);
  if (!staging.Create(parent)) {
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  return true;
}

// Downloads the archive from source to archive and unpacks it into tree.
bool FetchAndUnpack(const std::string &source, const std::string &archive,
                    const std::string &tree, int &err) {
  if (!FetchArchive(source, archive, err)) {
    return false;
  }
  if (::mkdir(tree.c_str(), 0700) != 0) {
    ZARK_PM_LOG_CALL("mkdir", -1, errno, tree.c_str());
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  if (!ExtractRouterDbArchive(archive, tree)) {
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  return true;
}

// Reads the unpacked database at staged; false (logged, err set) when it is
// not valid or holds no router.
bool ReadFetchedDb(const std::string &source, const std::string &staged,
                   RouterDb &fetched, int &err) {
  if (!ReadRouterDbAt(staged, fetched, err)) {
    ZARK_PM_LOG_ERROR("router database from %.300s refused; the installed "
                      "one stays",
                      source.c_str());
    return false;
  }
  if (fetched.entries.empty()) {
    ZARK_PM_LOG_ERROR("router database from %.300s holds no router; the "
                      "installed one stays",
                      source.c_str());
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  return true;
}

// True, with its version, when the installed database is readable and not
// older than fetched.
bool InstalledIsAsNew(const RouterDb &fetched, int &version) {
  RouterDb installed;
  int installedErr = ZARK_PORTMAP_ERR_NONE;
  RouterDbLock readLock(kRouterDbLockFile, RouterDbLock::Mode::kShared);
  // An installed database that cannot be read (or of another syntax) is
  // replaced by any valid one; ReadRouterDbInfoAt has logged why.
  if (readLock.Held() &&
      ReadRouterDbInfoAt(ZARK_PORTMAP_ROUTERDB_DIR, installed, installedErr) &&
      installed.version >= fetched.version) {
    version = installed.version;
    return true;
  }
  return false;
}

bool Update(int &version, int &err) {
  const std::string source = UpdateSource(err);
  if (source.empty()) {
    return false;
  }
  RouterDbLock updateLock(kRouterDbUpdateLockFile,
                          RouterDbLock::Mode::kExclusive,
                          std::chrono::milliseconds(120000));
  if (!updateLock.Held()) {
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  StagingFolder staging;
  if (!CreateStaging(staging, err)) {
    return false;
  }
  const std::string tree = staging.Path() + "/tree";
  const std::string staged = tree + "/routerdb";
  RouterDb fetched;
  if (!FetchAndUnpack(source, staging.Path() + "/archive", tree, err) ||
      !ReadFetchedDb(source, staged, fetched, err)) {
    return false;
  }
  if (InstalledIsAsNew(fetched, version)) {
    err = ZARK_PORTMAP_ERR_NONE;
    return true;
  }
  if (!NormaliseModes(staged) || !SyncFolder(tree)) {
    err = ZARK_PORTMAP_ERR_IO;
    return false;
  }
  if (!SwapIn(staged, err)) {
    return false;
  }
  version = fetched.version;
  err = ZARK_PORTMAP_ERR_NONE;
  return true;
}

} // namespace

bool UpdateRouterDb(int &version, int &err) {
  try {
    return Update(version, err);
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("router database update: %s", e.what());
    err = ZARK_PORTMAP_ERR_GENERIC;
    return false;
  }
}

} // namespace zark::portmap
