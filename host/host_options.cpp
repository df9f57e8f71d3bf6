#include "host_options.h"

#include <arpa/inet.h>

#include <charconv>
#include <cstdint>
#include <optional>

#ifndef ZARK_DEFAULT_MODULES_DIR
#define ZARK_DEFAULT_MODULES_DIR "/usr/lib/zark/modules"
#endif
#ifndef ZARK_DEFAULT_ACCOUNTS_FILE
#define ZARK_DEFAULT_ACCOUNTS_FILE "/etc/zark/webapid.accounts"
#endif
#ifndef ZARK_DEFAULT_WWW_DIR
#define ZARK_DEFAULT_WWW_DIR "/usr/share/zark/www"
#endif

namespace zark::host {
namespace {

std::optional<std::int64_t> ParseNumber(std::string_view text, std::int64_t min,
                                        std::int64_t max) {
  std::int64_t value = 0;
  auto [end, error] =
      std::from_chars(text.data(), text.data() + text.size(), value);
  if (text.empty() || error != std::errc() ||
      end != text.data() + text.size() || value < min || value > max) {
    return std::nullopt;
  }
  return value;
}

bool IsIpAddress(const std::string &address) {
  unsigned char buffer[16];
  return inet_pton(AF_INET, address.c_str(), buffer) == 1 ||
         inet_pton(AF_INET6, address.c_str(), buffer) == 1;
}

} // namespace

std::filesystem::path DefaultModulesFolder() {
  return ZARK_DEFAULT_MODULES_DIR;
}
std::filesystem::path DefaultAccountsFile() {
  return ZARK_DEFAULT_ACCOUNTS_FILE;
}
std::filesystem::path DefaultWwwFolder() {
  return ZARK_DEFAULT_WWW_DIR;
}

bool ParseListen(std::string_view text, std::string &address, int &port) {
  std::size_t colon = text.rfind(':');
  if (colon == std::string_view::npos || colon == 0) {
    return false;
  }
  std::string_view host = text.substr(0, colon);
  if (host.front() == '[') {
    if (host.size() < 3 || host.back() != ']') {
      return false;
    }
    host = host.substr(1, host.size() - 2);
  } else if (host.find(':') != std::string_view::npos) {
    return false; // an IPv6 address needs its brackets
  }
  std::optional<std::int64_t> number =
      ParseNumber(text.substr(colon + 1), 1, 65535);
  std::string candidate(host);
  if (!number || !IsIpAddress(candidate)) {
    return false;
  }
  address = candidate;
  port = static_cast<int>(*number);
  return true;
}

OptionsResult ParseHostOptions(std::span<const std::string> args,
                               HostOptions &options, std::string &error) {
  options.http.wwwFolder = DefaultWwwFolder();
  for (std::size_t i = 0; i < args.size(); ++i) {
    std::string name = args[i];
    std::optional<std::string> value;
    if (std::size_t equals = name.find('='); equals != std::string::npos) {
      value = name.substr(equals + 1);
      name.resize(equals);
    }
    auto takeValue = [&]() -> std::optional<std::string> {
      if (value) {
        return value;
      }
      if (i + 1 < args.size()) {
        return args[++i];
      }
      error = name + " needs a value";
      return std::nullopt;
    };
    auto seconds =
        [&](const std::string &text,
            std::int64_t max) -> std::optional<std::chrono::milliseconds> {
      std::optional<std::int64_t> number = ParseNumber(text, 1, max);
      if (!number) {
        error = name + " takes whole seconds, 1 to " + std::to_string(max);
        return std::nullopt;
      }
      return std::chrono::seconds(*number);
    };

    if (name == "--help" || name == "-h") {
      return OptionsResult::Help;
    }
    if (name == "--secure-cookie") {
      options.secureCookie = true;
      continue;
    }
    std::optional<std::string> text;
    if (name == "--listen" || name == "--modules" || name == "--accounts" ||
        name == "--www" || name == "--threads" || name == "--session-idle" ||
        name == "--session-max") {
      text = takeValue();
      if (!text) {
        return OptionsResult::Error;
      }
    } else {
      error = "unknown option " + name;
      return OptionsResult::Error;
    }
    if (name == "--listen") {
      if (!ParseListen(*text, options.http.address, options.http.port)) {
        error = "--listen takes ADDRESS:PORT, for example 127.0.0.1:5000";
        return OptionsResult::Error;
      }
    } else if (name == "--modules") {
      options.modulesFolder = *text;
    } else if (name == "--accounts") {
      options.accountsFile = *text;
    } else if (name == "--www") {
      options.http.wwwFolder = *text;
    } else if (name == "--threads") {
      std::optional<std::int64_t> number = ParseNumber(*text, 1, 256);
      if (!number) {
        error = "--threads takes 1 to 256";
        return OptionsResult::Error;
      }
      options.http.threads = static_cast<std::size_t>(*number);
    } else if (name == "--session-idle") {
      auto idle = seconds(*text, 7 * 24 * 3600);
      if (!idle) {
        return OptionsResult::Error;
      }
      options.sessions.idleTimeout = *idle;
    } else if (name == "--session-max") {
      auto max = seconds(*text, 30 * 24 * 3600);
      if (!max) {
        return OptionsResult::Error;
      }
      options.sessions.maxLifetime = *max;
    }
  }
  return OptionsResult::Run;
}

std::string HostUsage(std::string_view program) {
  std::string name(program);
  return "usage: " + name + " [options]\n" + "       " + name +
         " passwd USER [--accounts FILE] [--group GROUP]\n"
         "\n"
         "Serves the web API modules of a folder over HTTP.\n"
         "\n"
         "  --listen ADDRESS:PORT  where to listen (default 127.0.0.1:5000)\n"
         "  --modules FOLDER       modules to load (default " +
         DefaultModulesFolder().string() +
         ")\n"
         "  --accounts FILE        accounts file, mode 0600 (default " +
         DefaultAccountsFile().string() +
         ")\n"
         "  --www FOLDER           front end files (default " +
         DefaultWwwFolder().string() +
         ")\n"
         "  --threads N            request threads, 1 to 256 (default 8)\n"
         "  --session-idle SECONDS end a session after this idle time "
         "(default 1800)\n"
         "  --session-max SECONDS  end a session after this time in any "
         "case (default 43200)\n"
         "  --secure-cookie        mark the session cookie Secure (when "
         "served over HTTPS)\n"
         "  --help                 this text\n"
         "\n"
         "passwd reads the password from standard input (twice, without "
         "echo, on a terminal)\nand sets it for USER in the accounts file "
         "(group admin unless --group).\n";
}

} // namespace zark::host
