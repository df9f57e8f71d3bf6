// The accounts file: who may log in, with which password hash, in which
// group. One account a line:
//   admin:$y$j9T$...$...:admin
//   viewer:$y$j9T$...$...:users
// Lines that are empty or begin with "#" are kept but hold no account.
// The file holds password hashes: it must belong to the host's user and be
// neither readable nor writable by group or others (mode 0600).
#ifndef ZARK_HOST_ACCOUNT_FILE_H
#define ZARK_HOST_ACCOUNT_FILE_H

#include <cstddef>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zark::host {

// The group whose members may call module methods.
inline constexpr std::string_view kAdminGroup = "admin";

// Largest accounts file read.
inline constexpr std::size_t kMaxAccountsFileSize = 1024 * 1024;

struct Account {
  std::string user;
  std::string hash;
  std::string group;
};

// A user or group name: 1 to 64 characters of [A-Za-z0-9._-], not
// beginning with "-".
[[nodiscard]] bool IsValidAccountName(std::string_view name);

// Reads the accounts for a login. nullopt, after an error log line naming
// the file and the reason, when the file cannot be opened or read, is not a
// regular file, is larger than kMaxAccountsFileSize, is not owned by the
// effective user of the process, or has any group or other permission bit
// set. Malformed lines are logged by number (never their text) and skipped;
// a user named twice keeps its first line.
[[nodiscard]] std::optional<std::vector<Account>>
LoadAccounts(const std::filesystem::path &file);

// Sets account in file: replaces the line of account.user (and drops any
// further lines of that user) or appends one; every other line stays as it
// is. The new content is written to a temporary file beside it with mode
// 0600, flushed to disk, and renamed over file, so that a reader sees the
// old or the new file, never a mix. The file need not exist; its folder
// must. False with error set (a sentence for the operator) on failure, and
// file is then unchanged. warning is set when the old file had group or
// other permission bits.
[[nodiscard]] bool StoreAccount(const std::filesystem::path &file,
                                const Account &account, std::string &error,
                                std::string &warning);

} // namespace zark::host

#endif
