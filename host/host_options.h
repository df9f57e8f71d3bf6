// The host's command line.
#ifndef ZARK_HOST_HOST_OPTIONS_H
#define ZARK_HOST_HOST_OPTIONS_H

#include "http_server.h"
#include "session_store.h"

#include <filesystem>
#include <span>
#include <string>
#include <string_view>

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
};

enum class OptionsResult {
  Run,   // options is filled
  Help,  // --help: print HostUsage and exit 0
  Error, // error says what is wrong: print it and HostUsage, exit 2
};

// Reads the options (args without the program name). Each option takes its
// value as "--name VALUE" or "--name=VALUE".
[[nodiscard]] OptionsResult ParseHostOptions(std::span<const std::string> args,
                                             HostOptions &options,
                                             std::string &error);

// "ADDRESS:PORT", an IPv6 address in brackets ("[::1]:5000"); port 1 to
// 65535. False when text is not such.
[[nodiscard]] bool ParseListen(std::string_view text, std::string &address,
                               int &port);

[[nodiscard]] std::string HostUsage(std::string_view program);

} // namespace zark::host

#endif
