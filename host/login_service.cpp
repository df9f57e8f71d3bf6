#include "login_service.h"

#include "account_file.h"
#include "host_log.h"
#include "password_hash.h"

#include <algorithm>
#include <optional>
#include <vector>

namespace zark::host {

LoginService::LoginService(std::filesystem::path accountsFile,
                           SessionStore &sessions, LoginThrottle &throttle)
    : mAccountsFile(std::move(accountsFile)), mSessions(sessions),
      mThrottle(throttle) {}

LoginOutcome LoginService::Login(std::string_view account,
                                 std::string_view password,
                                 std::string_view clientAddress) {
  const std::string address(clientAddress);
  // A name no account can have is counted under one key, so that long
  // invented names cannot fill the throttle's memory.
  const std::string_view throttleName =
      IsValidAccountName(account) ? account : std::string_view("(not a name)");
  LoginOutcome outcome;
  // The attempt is counted as a failure here, in the same step as the
  // check, before the password check that takes milliseconds: concurrent
  // guesses at the end of a wait cannot all get through.
  std::chrono::seconds wait = mThrottle.Claim(throttleName, clientAddress);
  if (wait.count() > 0) {
    HOST_LOG(LOG_NOTICE,
             "login from %s refused: %lld s to wait after failed logins",
             address.c_str(), static_cast<long long>(wait.count()));
    outcome.result = LoginOutcome::Result::Throttled;
    outcome.retryAfter = wait;
    return outcome;
  }
  // The next attempt of this address goes on when this one has ended, on
  // every path below.
  struct EndAttempt {
    LoginThrottle &throttle;
    std::string_view address;
    ~EndAttempt() { throttle.Release(address); }
  } endAttempt{mThrottle, clientAddress};

  std::optional<std::vector<Account>> accounts = LoadAccounts(mAccountsFile);
  if (!accounts) {
    HOST_LOG(LOG_ERR, "login from %s failed: no usable accounts file",
             address.c_str());
    outcome.result = LoginOutcome::Result::Unavailable;
    return outcome;
  }
  auto found = std::find_if(accounts->begin(), accounts->end(),
                            [account](const Account &candidate) {
                              return candidate.user == account;
                            });
  if (found == accounts->end()) {
    VerifyAgainstDummy(password);
    HOST_LOG(LOG_NOTICE, "login from %s refused: unknown account",
             address.c_str());
    outcome.result = LoginOutcome::Result::BadCredentials;
    return outcome;
  }
  if (!VerifyPassword(password, found->hash)) {
    HOST_LOG(LOG_NOTICE, "login of %s from %s refused: wrong password",
             found->user.c_str(), address.c_str());
    outcome.result = LoginOutcome::Result::BadCredentials;
    return outcome;
  }

  SessionOwner owner{found->user, found->group};
  std::optional<NewSession> session = mSessions.Create(owner);
  if (!session) {
    outcome.result = LoginOutcome::Result::Unavailable;
    return outcome;
  }
  mThrottle.RecordSuccess(throttleName, clientAddress);
  HOST_LOG(LOG_INFO, "login of %s (group %s) from %s", owner.account.c_str(),
           owner.group.c_str(), address.c_str());
  outcome.result = LoginOutcome::Result::Ok;
  outcome.session = std::move(*session);
  outcome.owner = std::move(owner);
  return outcome;
}

} // namespace zark::host
