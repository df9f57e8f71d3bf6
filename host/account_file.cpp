#include "account_file.h"

#include "host_log.h"

#include "klibc_fd.h"
#include "klibc_replace.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <set>

namespace zark::host {
namespace {

constexpr std::size_t kMaxNameLength = 64;

std::string ErrnoText(int error) {
  return std::strerror(error);
}

// Reads the whole of fd, at most limit bytes. False when reading fails or
// there is more.
bool ReadAll(int fd, std::size_t limit, std::string &content, int &error) {
  content.clear();
  char buffer[4096];
  for (;;) {
    ssize_t got = read(fd, buffer, sizeof(buffer));
    if (got < 0) {
      if (errno == EINTR) {
        continue;
      }
      error = errno;
      return false;
    }
    if (got == 0) {
      return true;
    }
    if (content.size() + static_cast<std::size_t>(got) > limit) {
      error = EFBIG;
      return false;
    }
    content.append(buffer, static_cast<std::size_t>(got));
  }
}

std::vector<std::string_view> SplitLines(std::string_view content) {
  std::vector<std::string_view> lines;
  while (!content.empty()) {
    std::size_t end = content.find('\n');
    if (end == std::string_view::npos) {
      lines.push_back(content);
      break;
    }
    lines.push_back(content.substr(0, end));
    content.remove_prefix(end + 1);
  }
  return lines;
}

bool IsBlankOrComment(std::string_view line) {
  std::size_t first = line.find_first_not_of(" \t\r");
  return first == std::string_view::npos || line[first] == '#';
}

bool IsValidHashText(std::string_view hash) {
  if (hash.empty()) {
    return false;
  }
  for (char c : hash) {
    if (c <= ' ' || c == ':' || c > '~') {
      return false;
    }
  }
  return true;
}

// "user:hash:group" with valid parts.
std::optional<Account> ParseAccountLine(std::string_view line) {
  std::size_t first = line.find(':');
  if (first == std::string_view::npos) {
    return std::nullopt;
  }
  std::size_t second = line.find(':', first + 1);
  if (second == std::string_view::npos ||
      line.find(':', second + 1) != std::string_view::npos) {
    return std::nullopt;
  }
  Account account{std::string(line.substr(0, first)),
                  std::string(line.substr(first + 1, second - first - 1)),
                  std::string(line.substr(second + 1))};
  if (!IsValidAccountName(account.user) || !IsValidHashText(account.hash) ||
      !IsValidAccountName(account.group)) {
    return std::nullopt;
  }
  return account;
}

} // namespace

bool IsValidAccountName(std::string_view name) {
  if (name.empty() || name.size() > kMaxNameLength || name.front() == '-') {
    return false;
  }
  for (char c : name) {
    bool good = (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') ||
                (c >= '0' && c <= '9') || c == '.' || c == '_' || c == '-';
    if (!good) {
      return false;
    }
  }
  return true;
}

std::optional<std::vector<Account>>
LoadAccounts(const std::filesystem::path &file) {
  // O_NONBLOCK: a FIFO put in the file's place must not hang a login.
  klibc::UniqueFd fd(
      open(file.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
  if (!fd.Valid()) {
    int error = errno;
    HOST_LOG(LOG_ERR, "accounts file %s cannot be opened: %s", file.c_str(),
             ErrnoText(error).c_str());
    return std::nullopt;
  }
  struct stat info {};
  if (fstat(fd.Get(), &info) != 0) {
    int error = errno;
    HOST_LOG(LOG_ERR, "accounts file %s: fstat failed: %s", file.c_str(),
             ErrnoText(error).c_str());
    return std::nullopt;
  }
  if (!S_ISREG(info.st_mode)) {
    HOST_LOG(LOG_ERR, "accounts file %s is not a regular file; not using it",
             file.c_str());
    return std::nullopt;
  }
  if (info.st_uid != geteuid()) {
    HOST_LOG(LOG_ERR,
             "accounts file %s is owned by uid %u, not by uid %u that the "
             "host runs as; not using it",
             file.c_str(), static_cast<unsigned>(info.st_uid),
             static_cast<unsigned>(geteuid()));
    return std::nullopt;
  }
  if ((info.st_mode & 077) != 0) {
    HOST_LOG(LOG_ERR,
             "accounts file %s can be read or written by group or others "
             "(mode %04o); not using it until its mode is 0600",
             file.c_str(), static_cast<unsigned>(info.st_mode & 07777));
    return std::nullopt;
  }
  std::string content;
  int error = 0;
  if (!ReadAll(fd.Get(), kMaxAccountsFileSize, content, error)) {
    HOST_LOG(LOG_ERR, "accounts file %s cannot be read: %s", file.c_str(),
             ErrnoText(error).c_str());
    return std::nullopt;
  }
  std::vector<Account> accounts;
  std::set<std::string, std::less<>> users;
  int number = 0;
  for (std::string_view line : SplitLines(content)) {
    ++number;
    if (IsBlankOrComment(line)) {
      continue;
    }
    std::optional<Account> account = ParseAccountLine(line);
    if (!account) {
      HOST_LOG(LOG_ERR, "accounts file %s line %d is malformed; skipped",
               file.c_str(), number);
      continue;
    }
    if (!users.insert(account->user).second) {
      HOST_LOG(LOG_ERR, "accounts file %s line %d names user %s again; skipped",
               file.c_str(), number, account->user.c_str());
      continue;
    }
    accounts.push_back(std::move(*account));
  }
  return accounts;
}

namespace {

// The current content of the accounts file into old: empty when there is
// none yet. False, with error set, when it exists and cannot be read or
// is no regular file; warning is set when group or others had access.
bool ReadOldAccounts(const std::filesystem::path &file, std::string &old,
                     std::string &error, std::string &warning) {
  klibc::UniqueFd in(
      open(file.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
  if (!in.Valid() && errno != ENOENT) {
    error = "cannot open " + file.string() + ": " + ErrnoText(errno);
    return false;
  }
  if (!in.Valid()) {
    return true;
  }
  struct stat info {};
  if (fstat(in.Get(), &info) != 0 || !S_ISREG(info.st_mode)) {
    error = file.string() + " is not a regular file";
    return false;
  }
  if ((info.st_mode & 077) != 0) {
    char octal[8];
    snprintf(octal, sizeof(octal), "%04o",
             static_cast<unsigned>(info.st_mode & 07777));
    warning = file.string() + " had mode " + octal +
              ", readable or writable by group or others; it is now 0600";
  }
  int readError = 0;
  if (!ReadAll(in.Get(), kMaxAccountsFileSize, old, readError)) {
    error = "cannot read " + file.string() + ": " + ErrnoText(readError);
    return false;
  }
  return true;
}

// old with the account's line in place of the first line of the same
// user (later ones dropped), or added at the end; other lines, comments
// included, kept as they were.
std::string WithAccount(std::string_view old, const Account &account) {
  const std::string newLine =
      account.user + ":" + account.hash + ":" + account.group;
  std::string content;
  bool replaced = false;
  for (std::string_view line : SplitLines(old)) {
    std::optional<Account> existing;
    if (!IsBlankOrComment(line)) {
      existing = ParseAccountLine(line);
    }
    if (existing && existing->user == account.user) {
      if (!replaced) {
        content += newLine;
        content += '\n';
        replaced = true;
      }
      continue;
    }
    content.append(line);
    content += '\n';
  }
  if (!replaced) {
    content += newLine;
    content += '\n';
  }
  return content;
}

// What went wrong in replacing file, for the user.
std::string ReplaceFailureText(const klibc::ReplaceFailure &failure,
                               const std::filesystem::path &file) {
  const std::string &temp = failure.tempPath;
  std::string what;
  switch (failure.step) {
  case klibc::ReplaceStep::kCreateTemp:
    what = "cannot create a temporary file beside " + file.string();
    break;
  case klibc::ReplaceStep::kSetMode:
  case klibc::ReplaceStep::kSetOwner:
    what = "cannot set mode 0600 on " + temp;
    break;
  case klibc::ReplaceStep::kWrite:
    what = "cannot write " + temp;
    break;
  case klibc::ReplaceStep::kFlush:
    what = "cannot flush " + temp;
    break;
  case klibc::ReplaceStep::kClose:
    what = "cannot close " + temp;
    break;
  case klibc::ReplaceStep::kRename:
  case klibc::ReplaceStep::kOpenFolder:
  case klibc::ReplaceStep::kFlushFolder:
    what = "cannot rename " + temp + " to " + file.string();
    break;
  }
  return what + ": " + ErrnoText(failure.error);
}

} // namespace

bool StoreAccount(const std::filesystem::path &file, const Account &account,
                  std::string &error, std::string &warning) {
  if (!IsValidAccountName(account.user) || !IsValidAccountName(account.group) ||
      !IsValidHashText(account.hash)) {
    error = "the user name, group name or hash is not valid";
    return false;
  }
  std::string old;
  if (!ReadOldAccounts(file, old, error, warning)) {
    return false;
  }
  klibc::ReplaceOptions options;
  options.mode = 0600;
  options.tempName = klibc::TempName::kBesidePath;
  const std::optional<klibc::ReplaceFailure> failure =
      klibc::ReplaceFile(file.string(), WithAccount(old, account), options);
  // The rename reaches the disk with the folder; the new file is in place
  // even when the folder cannot be flushed.
  if (klibc::FileWasReplaced(failure)) {
    return true;
  }
  error = ReplaceFailureText(*failure, file);
  return false;
}

} // namespace zark::host
