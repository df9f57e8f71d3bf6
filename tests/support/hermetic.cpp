#include "hermetic.h"

#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>

namespace zark::test {
namespace {

namespace fs = std::filesystem;

bool gInNamespace = false;

// Folders the code under test writes to, emptied by ResetFixedPaths.
const char *const kFixedFolders[] = {
    "/etc/portforward",
    "/usr/zark",
    "/usr/local/etc/services.d",
    "/etc.defaults",
};

bool Fail(std::string *error, const std::string &what) {
  if (error) {
    *error = what + ": " + std::strerror(errno);
  }
  return false;
}

bool MountTmpfs(const char *target, std::string *error) {
  if (mount("zark-test", target, "tmpfs", 0, "mode=0755") != 0) {
    return Fail(error, std::string("mount tmpfs on ") + target);
  }
  return true;
}

// Lays an overlay over folder whose upper layer lives under staging, so the
// folder keeps its content while every write stays in memory.
bool MountOverlay(const std::string &folder, const std::string &staging,
                  std::string *error) {
  std::string upper = staging + "/upper";
  std::string work = staging + "/work";
  std::error_code ec;
  fs::create_directories(upper, ec);
  fs::create_directories(work, ec);
  std::string options =
      "lowerdir=" + folder + ",upperdir=" + upper + ",workdir=" + work;
  if (mount("zark-test", folder.c_str(), "overlay", 0, options.c_str()) != 0) {
    return Fail(error, "mount overlay on " + folder);
  }
  return true;
}

void EmptyFolder(const std::string &folder) {
  std::error_code ec;
  if (!fs::exists(folder, ec)) {
    fs::create_directories(folder, ec);
    return;
  }
  for (const auto &entry : fs::directory_iterator(folder, ec)) {
    fs::remove_all(entry.path(), ec);
  }
}

bool UnderFixedFolder(const std::string &path) {
  if (path.rfind("/tmp/", 0) == 0) {
    return true;
  }
  for (const char *folder : kFixedFolders) {
    std::string prefix = std::string(folder) + "/";
    if (path.rfind(prefix, 0) == 0) {
      return true;
    }
  }
  return false;
}

} // namespace

bool EnterPrivateMountNamespace(std::string *error) {
  if (gInNamespace) {
    return true;
  }
  if (unshare(CLONE_NEWNS) != 0) {
    return Fail(error, "unshare(CLONE_NEWNS)");
  }
  // Nothing mounted from here on propagates back to the machine.
  if (mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
    return Fail(error, "make / private");
  }
  // Staging area for the overlays' upper layers: a tmpfs on /tmp that the
  // fresh /tmp below then covers. The overlays keep using it.
  if (!MountTmpfs("/tmp", error)) {
    return false;
  }
  if (!MountOverlay("/etc", "/tmp/etc", error) ||
      !MountOverlay("/usr", "/tmp/usr", error)) {
    return false;
  }
  if (!MountTmpfs("/tmp", error)) {
    return false;
  }
  chmod("/tmp", 01777);
  // /etc.defaults is not an overlay candidate: its parent is /. Where the
  // machine lacks it, an empty folder is left behind as the mount point.
  std::error_code ec;
  if (!fs::exists("/etc.defaults", ec)) {
    if (mkdir("/etc.defaults", 0755) != 0 && errno != EEXIST) {
      return Fail(error, "mkdir /etc.defaults");
    }
  }
  if (!MountTmpfs("/etc.defaults", error)) {
    return false;
  }
  gInNamespace = true;
  ResetFixedPaths();
  return true;
}

bool InPrivateMountNamespace() { return gInNamespace; }

void ResetFixedPaths() {
  if (!gInNamespace) {
    fprintf(stderr, "ResetFixedPaths called outside the private namespace\n");
    std::abort();
  }
  for (const char *folder : kFixedFolders) {
    EmptyFolder(folder);
  }
  EmptyFolder("/tmp");
}

void WriteFile(const std::string &path, const std::string &content,
               unsigned mode) {
  if (UnderFixedFolder(path) && !gInNamespace) {
    fprintf(stderr, "WriteFile(%s) outside the private namespace\n",
            path.c_str());
    std::abort();
  }
  std::error_code ec;
  fs::create_directories(fs::path(path).parent_path(), ec);
  {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << content;
  }
  chmod(path.c_str(), mode);
}

std::string ReadFile(const std::string &path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream buffer;
  buffer << in.rdbuf();
  return buffer.str();
}

} // namespace zark::test
