// Logging in: the account's password checked against the accounts file,
// failed attempts slowed down, and a session opened on success.
#ifndef ZARK_HOST_LOGIN_SERVICE_H
#define ZARK_HOST_LOGIN_SERVICE_H

#include "login_throttle.h"
#include "session_store.h"

#include <chrono>
#include <filesystem>
#include <string>
#include <string_view>

namespace zark::host {

struct LoginOutcome {
  enum class Result {
    Ok,             // session and owner are set
    BadCredentials, // unknown account or wrong password (not told apart)
    Throttled,      // too many failures: retryAfter says how long to wait
    Unavailable,    // the accounts file cannot be used, or no session could
                    // be opened (logged)
  };
  Result result = Result::Unavailable;
  NewSession session;
  SessionOwner owner;
  std::chrono::seconds retryAfter{0};
};

class LoginService {
public:
  // The accounts file is read again at every login, so that a password set
  // with "zark-webapid passwd" counts at once.
  LoginService(std::filesystem::path accountsFile, SessionStore &sessions,
               LoginThrottle &throttle);

  // While the throttle asks the address (or, for an address with failures on
  // record, the account) to wait, the password is not even checked. An
  // unknown account costs the time of a password check, like a known one.
  // Every checked attempt is counted as a failure before the check; Ok
  // clears the account's and the address's counts. Logs every
  // outcome, naming known accounts and the address, never the password; the
  // name typed for an unknown account is not logged (it may be a password typed
  // into the wrong field).
  [[nodiscard]] LoginOutcome Login(std::string_view account,
                                   std::string_view password,
                                   std::string_view clientAddress);

private:
  const std::filesystem::path mAccountsFile;
  SessionStore &mSessions;
  LoginThrottle &mThrottle;
};

} // namespace zark::host

#endif
