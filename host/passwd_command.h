// "zark-webapid passwd USER [--accounts FILE] [--group GROUP]": sets an
// account's password in the accounts file.
#ifndef ZARK_HOST_PASSWD_COMMAND_H
#define ZARK_HOST_PASSWD_COMMAND_H

#include <filesystem>
#include <iosfwd>
#include <span>
#include <string>

namespace zark::host {

// Where the password comes from.
struct PasswordInput {
  std::istream &in;
  // True when in is the terminal: each prompt is written to prompts, echo
  // is turned off on terminalFd while reading, and the password is asked
  // twice.
  bool terminal = false;
  int terminalFd = 0;
  std::ostream *prompts = nullptr;
};

// Runs the command; args are the words after "passwd". Reads one line as
// the password (a trailing "\r" is dropped), hashes it (HashPassword) and
// stores the account (StoreAccount) with the group "admin" unless --group
// names another. Messages for the operator go to err; the result is logged
// at notice level without the password. Returns the exit status: 0 done,
// 1 failed (nothing changed), 2 bad usage.
int RunPasswdCommand(std::span<const std::string> args, PasswordInput input,
                     std::ostream &err);

} // namespace zark::host

#endif
