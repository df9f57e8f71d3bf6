// A whole host without sockets for the host fuzz targets: the fuzz module
// (modules/host_fuzz_module.cpp) loaded, an accounts file with an
// administrator and a non-administrator in the private mount namespace, and
// per input fresh sessions, login throttle and request handler on a clock
// that does not move, so that one input cannot change how the next one is
// answered.
#ifndef ZARK_FUZZ_FUZZ_HOST_H
#define ZARK_FUZZ_FUZZ_HOST_H

#include "clock.h"
#include "login_service.h"
#include "login_throttle.h"
#include "module_registry.h"
#include "request_handler.h"
#include "session_store.h"

#include <json/json.h>

#include <memory>
#include <string>

namespace zark::fuzz {

inline constexpr const char *kHostAdmin = "admin";
inline constexpr const char *kHostAdminPassword = "Adm1n-fuzz-secret";
inline constexpr const char *kHostViewer = "viewer";
inline constexpr const char *kHostViewerPassword = "view3r-fuzz-secret";

class FixedClock final : public zark::host::Clock {
public:
  [[nodiscard]] TimePoint Now() const override { return mNow; }

private:
  TimePoint mNow{std::chrono::hours(1000)};
};

// Sessions of the two accounts, opened for one input.
struct HostSessions {
  zark::host::NewSession admin;
  zark::host::NewSession viewer;
};

class FuzzHost {
public:
  // Call once, in the private mount namespace, before any thread starts:
  // writes the accounts file and loads the module (aborts when it cannot).
  static void Prepare();

  FuzzHost();
  FuzzHost(const FuzzHost &) = delete;
  FuzzHost &operator=(const FuzzHost &) = delete;
  // Stops and removes every task and joins its thread.
  ~FuzzHost();

  [[nodiscard]] const zark::host::RequestHandler &Handler() const {
    return mHandler;
  }
  [[nodiscard]] const HostSessions &Sessions() const { return mOpen; }
  // Ends both sessions (when still open) and opens new ones.
  void RenewSessions();

private:
  FixedClock mClock;
  zark::host::SessionStore mSessions;
  zark::host::LoginThrottle mThrottle;
  zark::host::LoginService mLogins;
  zark::host::RequestHandler mHandler;
  HostSessions mOpen;
};

// The answer codes a host answer may carry: the framework's (100 to 111)
// and the fuzz module's own.
[[nodiscard]] bool IsHostAnswerCode(int code);

// Checks the shape every answer has: HTTP 200, or 413/431 with code 108; a
// body {"success": bool, ...} whose error carries a known code; compact
// JSON text that reads back (repeated keys allowed: see fuzz_host.cpp).
// Aborts (Broken) otherwise.
void CheckHostAnswer(int httpStatus, const Json::Value &body);

} // namespace zark::fuzz

#endif
