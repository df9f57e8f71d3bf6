#include "host_syslog.h"

#include "hermetic.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

namespace zark::load {
namespace {

namespace fs = std::filesystem;

constexpr const char *kDev = "/dev";
constexpr const char *kMachineDev = "/dev/.machine";
constexpr const char *kLogSocket = "/dev/log";
// Where the machine's /dev waits while the tmpfs goes over /dev.
constexpr const char *kScratch = "/tmp/.host-syslog-dev";

std::string Failed(const std::string &what) {
  return what + ": " + std::strerror(errno);
}

// The machine's /dev moves to /dev/.machine under a fresh tmpfs on /dev,
// which gets a symbolic link to each of its entries (links copied as they
// are), and no "log": the machine's syslog socket, if any, stays out.
bool MakePrivateDev(std::string &why) {
  std::error_code ec;
  if (fs::exists(kMachineDev, ec)) {
    return true; // done by an earlier call in this process
  }
  fs::create_directories(kScratch, ec);
  if (::mount(kDev, kScratch, nullptr, MS_BIND | MS_REC, nullptr) != 0) {
    why = Failed("bind /dev");
    return false;
  }
  if (::mount("zark-load-dev", kDev, "tmpfs", 0, "mode=0755") != 0) {
    why = Failed("mount tmpfs on /dev");
    return false;
  }
  if (::mkdir(kMachineDev, 0755) != 0 ||
      ::mount(kScratch, kMachineDev, nullptr, MS_MOVE, nullptr) != 0) {
    why = Failed("move the machine's /dev to /dev/.machine");
    return false;
  }
  for (const fs::directory_entry &entry :
       fs::directory_iterator(kMachineDev, ec)) {
    const std::string name = entry.path().filename().string();
    const fs::path link = fs::path(kDev) / name;
    if (entry.is_symlink(ec)) {
      fs::copy_symlink(entry.path(), link, ec);
    } else if (name != "log") {
      fs::create_symlink(fs::path(".machine") / name, link, ec);
    }
    if (ec) {
      why = "link /dev/" + name + ": " + ec.message();
      return false;
    }
  }
  return true;
}

} // namespace

HostSyslog::~HostSyslog() {
  if (mReader.joinable()) {
    const char stop = 'x';
    (void)!::write(mStopWrite.Get(), &stop, 1);
    mReader.join();
  }
}

bool HostSyslog::Start(std::string &why) {
  if (!zark::test::InPrivateMountNamespace()) {
    why = "not in a private mount namespace";
    return false;
  }
  if (mReader.joinable()) {
    why = "already started";
    return false;
  }
  if (!MakePrivateDev(why)) {
    return false;
  }
  ::unlink(kLogSocket);
  mSocket.Reset(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  if (!mSocket.Valid()) {
    why = Failed("socket");
    return false;
  }
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, kLogSocket, sizeof(address.sun_path) - 1);
  if (::bind(mSocket.Get(), reinterpret_cast<const sockaddr *>(&address),
             sizeof(address)) != 0) {
    why = Failed("bind /dev/log");
    return false;
  }
  ::chmod(kLogSocket, 0666);
  int pipeFds[2];
  if (::pipe2(pipeFds, O_CLOEXEC) != 0) {
    why = Failed("pipe");
    return false;
  }
  mStopRead.Reset(pipeFds[0]);
  mStopWrite.Reset(pipeFds[1]);
  mReader = std::thread([this] { Read(); });
  return true;
}

void HostSyslog::Read() {
  char buffer[8192];
  for (;;) {
    pollfd fds[2] = {{mSocket.Get(), POLLIN, 0}, {mStopRead.Get(), POLLIN, 0}};
    int ready = ::poll(fds, 2, -1);
    if (ready < 0) {
      if (errno == EINTR) {
        continue;
      }
      return;
    }
    if (fds[1].revents != 0) {
      return;
    }
    if ((fds[0].revents & POLLIN) == 0) {
      continue;
    }
    ssize_t n = ::recv(mSocket.Get(), buffer, sizeof(buffer), MSG_DONTWAIT);
    if (n <= 0) {
      continue;
    }
    std::string line(buffer, static_cast<std::size_t>(n));
    while (!line.empty() && (line.back() == '\n' || line.back() == '\0')) {
      line.pop_back();
    }
    std::lock_guard lock(mMutex);
    mLines.push_back(std::move(line));
    if (mLines.size() > kKeptLines) {
      mLines.pop_front();
    }
  }
}

std::vector<std::string> HostSyslog::Lines() const {
  std::lock_guard lock(mMutex);
  return {mLines.begin(), mLines.end()};
}

std::size_t HostSyslog::CountContaining(std::string_view text) const {
  std::lock_guard lock(mMutex);
  std::size_t count = 0;
  for (const std::string &line : mLines) {
    if (line.find(text) != std::string::npos) {
      ++count;
    }
  }
  return count;
}

} // namespace zark::load
