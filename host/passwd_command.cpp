#include "passwd_command.h"

#include "account_file.h"
#include "host_log.h"
#include "host_options.h"
#include "password_hash.h"

#include <getopt.h>
#include <string.h>
#include <termios.h>

#include <istream>
#include <optional>
#include <ostream>

namespace zark::host {
namespace {

// Turns terminal echo off for its lifetime.
class EchoOff {
public:
  explicit EchoOff(int fd) : mFd(fd) {
    if (tcgetattr(mFd, &mSaved) == 0) {
      termios quiet = mSaved;
      quiet.c_lflag &= ~static_cast<tcflag_t>(ECHO);
      mActive = tcsetattr(mFd, TCSAFLUSH, &quiet) == 0;
    }
  }
  ~EchoOff() {
    if (mActive) {
      tcsetattr(mFd, TCSAFLUSH, &mSaved);
    }
  }
  EchoOff(const EchoOff &) = delete;
  EchoOff &operator=(const EchoOff &) = delete;

private:
  int mFd;
  termios mSaved{};
  bool mActive = false;
};

// A string wiped when it goes.
class Secret {
public:
  Secret() = default;
  ~Secret() { Wipe(); }
  Secret(const Secret &) = delete;
  Secret &operator=(const Secret &) = delete;
  std::string &Text() { return mText; }
  void Wipe() { explicit_bzero(mText.data(), mText.size()); }

private:
  std::string mText;
};

bool ReadLine(PasswordInput &input, const char *prompt, Secret &line) {
  if (input.terminal && input.prompts != nullptr) {
    *input.prompts << prompt << std::flush;
  }
  bool got = false;
  {
    std::optional<EchoOff> quiet;
    if (input.terminal) {
      quiet.emplace(input.terminalFd);
    }
    got = static_cast<bool>(std::getline(input.in, line.Text()));
  }
  if (input.terminal && input.prompts != nullptr) {
    *input.prompts << "\n";
  }
  if (got && !line.Text().empty() && line.Text().back() == '\r') {
    line.Text().pop_back();
  }
  return got;
}

int Usage(std::ostream &err, const std::string &problem) {
  err << "zark-webapid passwd: " << problem << "\n"
      << "usage: zark-webapid passwd USER [--accounts FILE] [--group GROUP]\n";
  return 2;
}

// What the command line of "passwd" names.
struct PasswdRequest {
  std::string user;
  std::filesystem::path file = DefaultAccountsFile();
  std::string group{kAdminGroup};
};

// Reads the user's name and the options into request. Nothing when they
// are usable; otherwise the exit status, after the usage went to err.
std::optional<int> ParsePasswdArguments(std::span<const std::string> args,
                                        PasswdRequest &request,
                                        std::ostream &err) {
  std::optional<std::string> user;
  enum : int { kAccounts = 256, kGroup };
  static const option kOptions[] = {
      {"accounts", required_argument, nullptr, kAccounts},
      {"group", required_argument, nullptr, kGroup},
      {nullptr, 0, nullptr, 0},
  };
  ArgumentVector arguments("passwd", args);
  char **argv = arguments.Get();
  const int argc = arguments.Count();
  // optind 0 makes GNU getopt start over (the tests run the command more
  // than once); options may come before or after the user's name.
  optind = 0;
  opterr = 0;
  for (;;) {
    const int got = getopt_long(argc, argv, ":", kOptions, nullptr);
    if (got == -1) {
      break;
    }
    if (got == kAccounts) {
      request.file = optarg;
    } else if (got == kGroup) {
      request.group = optarg;
    } else if (got == ':') {
      return Usage(err, RefusedOption(got, argv) + " needs a value");
    } else {
      return Usage(err, "unknown option " + RefusedOption(got, argv));
    }
  }
  for (int i = optind; i < argc; ++i) {
    if (user) {
      return Usage(err, "one user at a time");
    }
    user = argv[i];
  }
  if (!user) {
    return Usage(err, "no user named");
  }
  if (!IsValidAccountName(*user)) {
    return Usage(err, "a user name has 1 to 64 characters of A-Z a-z 0-9 . _ "
                      "- and does not begin with -");
  }
  if (!IsValidAccountName(request.group)) {
    return Usage(err, "a group name has 1 to 64 characters of A-Z a-z 0-9 . "
                      "_ - and does not begin with -");
  }
  request.user = *user;
  return std::nullopt;
}

// Reads the new password (twice on a terminal) and checks its length;
// false after telling err why not.
bool ReadNewPassword(PasswordInput &input, Secret &password,
                     std::ostream &err) {
  if (!ReadLine(input, "Password: ", password)) {
    err << "zark-webapid passwd: no password given\n";
    return false;
  }
  if (input.terminal) {
    Secret again;
    if (!ReadLine(input, "Password again: ", again) ||
        again.Text() != password.Text()) {
      err << "zark-webapid passwd: the passwords differ; nothing changed\n";
      return false;
    }
  }
  if (password.Text().empty() || password.Text().size() > kMaxPasswordLength) {
    err << "zark-webapid passwd: a password has 1 to " << kMaxPasswordLength
        << " bytes; nothing changed\n";
    return false;
  }
  return true;
}

// Writes the account with its new hash; the exit status of the command.
int StoreNewHash(const PasswdRequest &request, const std::string &hash,
                 std::ostream &err) {
  std::string error;
  std::string warning;
  if (!StoreAccount(request.file, Account{request.user, hash, request.group},
                    error, warning)) {
    err << "zark-webapid passwd: " << error << "; nothing changed\n";
    HOST_LOG(LOG_ERR, "password of %s not set in %s: %s", request.user.c_str(),
             request.file.c_str(), error.c_str());
    return 1;
  }
  if (!warning.empty()) {
    err << "zark-webapid passwd: " << warning << "\n";
  }
  HOST_LOG(LOG_NOTICE, "password of %s (group %s) set in %s",
           request.user.c_str(), request.group.c_str(), request.file.c_str());
  return 0;
}

} // namespace

int RunPasswdCommand(std::span<const std::string> args, PasswordInput input,
                     std::ostream &err) {
  PasswdRequest request;
  if (std::optional<int> status = ParsePasswdArguments(args, request, err)) {
    return *status;
  }
  Secret password;
  if (!ReadNewPassword(input, password, err)) {
    return 1;
  }
  std::optional<std::string> hash = HashPassword(password.Text());
  password.Wipe();
  if (!hash) {
    err << "zark-webapid passwd: the password could not be hashed; nothing "
           "changed\n";
    return 1;
  }
  return StoreNewHash(request, *hash, err);
}

} // namespace zark::host
