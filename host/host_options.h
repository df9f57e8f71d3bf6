// The host's command line.
#ifndef ZARK_HOST_HOST_OPTIONS_H
#define ZARK_HOST_HOST_OPTIONS_H

#include "http_server.h"
#include "module_lifecycle.h"
#include "session_store.h"

#include <filesystem>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace zark::host {

// Built-in defaults; the build sets them from the install folders.
std::filesystem::path DefaultModulesFolder();
std::filesystem::path DefaultAccountsFile();
std::filesystem::path DefaultWwwFolder();

struct HostOptions {
  HttpOptions http;
  std::filesystem::path modulesFolder = DefaultModulesFolder();
  std::filesystem::path accountsFile = DefaultAccountsFile();
  SessionPolicy sessions;
  bool secureCookie = false;
  // Handed to the modules' start functions (--keeper-interval).
  ZARK_MODULE_SETTINGS modules = DefaultModuleSettings();
};

// Longest --keeper-interval: a day.
inline constexpr std::int64_t kMaxKeeperIntervalSeconds = 24 * 3600;

enum class OptionsResult {
  Run,   // options is filled
  Help,  // --help: print HostUsage and exit 0
  Error, // error says what is wrong: print it and HostUsage, exit 2
};

// Reads the options (args without the program name) with getopt_long. Each
// option takes its value as "--name VALUE" or "--name=VALUE". Not
// reentrant: getopt's state is the process's.
[[nodiscard]] OptionsResult ParseHostOptions(std::span<const std::string> args,
                                             HostOptions &options,
                                             std::string &error);

// The arguments as getopt_long wants them: writable strings, the program's
// name first, a null pointer last.
class ArgumentVector {
public:
  ArgumentVector(std::string_view program, std::span<const std::string> args);
  ArgumentVector(const ArgumentVector &) = delete;
  ArgumentVector &operator=(const ArgumentVector &) = delete;
  [[nodiscard]] int Count() const {
    return static_cast<int>(mPointers.size()) - 1;
  }
  [[nodiscard]] char **Get() { return mPointers.data(); }

private:
  std::vector<std::string> mWords;
  std::vector<char *> mPointers;
};

// The option getopt_long has just refused (it returned got, '?' or ':'),
// as written in argv, without an attached "=VALUE".
[[nodiscard]] std::string RefusedOption(int got, char *const *argv);

// "ADDRESS:PORT", an IPv6 address in brackets ("[::1]:5000"); port 1 to
// 65535. False when text is not such.
[[nodiscard]] bool ParseListen(std::string_view text, std::string &address,
                               int &port);

[[nodiscard]] std::string HostUsage(std::string_view program);

} // namespace zark::host

#endif
