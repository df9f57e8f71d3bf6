// The syslog of a host started by a test or benchmark: a /dev of the
// private mount namespace's own whose "log" is a datagram socket read by
// this object, so that the lines of a child process (zark-webapid logs to
// syslog only) can be shown when a run fails, whether or not the machine
// runs a syslog daemon, and never reach the machine's log.
#ifndef ZARK_TESTS_LOAD_HOST_SYSLOG_H
#define ZARK_TESTS_LOAD_HOST_SYSLOG_H

#include "klibc_fd.h"

#include <cstddef>
#include <deque>
#include <mutex>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

namespace zark::load {

class HostSyslog {
public:
  HostSyslog() = default;
  HostSyslog(const HostSyslog &) = delete;
  HostSyslog &operator=(const HostSyslog &) = delete;
  // Stops and joins the reader; the socket stays where it is (the
  // namespace ends with the process).
  ~HostSyslog();

  // Replaces /dev of this mount namespace by a tmpfs that links every entry
  // of the machine's /dev (kept under /dev/.machine) and holds the socket
  // /dev/log, then starts reading it. Must run inside the private mount
  // namespace of a hermetic test (hermetic.h), before the threads that log
  // start. A second call in the same process only binds a new socket.
  // False, with the reason in why, when a mount or the socket fails.
  [[nodiscard]] bool Start(std::string &why);

  // The lines received so far (the last kKeptLines of them), oldest first.
  [[nodiscard]] std::vector<std::string> Lines() const;
  // How many received lines contain text.
  [[nodiscard]] std::size_t CountContaining(std::string_view text) const;

  static constexpr std::size_t kKeptLines = 100000;

private:
  void Read();

  zark::klibc::UniqueFd mSocket;
  zark::klibc::UniqueFd mStopRead;
  zark::klibc::UniqueFd mStopWrite;
  mutable std::mutex mMutex;
  std::deque<std::string> mLines;
  std::thread mReader;
};

} // namespace zark::load

#endif
