#include "host_options.h"

#include "request_guard.h"

#include <arpa/inet.h>
#include <getopt.h>

#include <algorithm>
#include <charconv>
#include <chrono>
#include <cstdint>
#include <optional>
#include <vector>

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

ArgumentVector::ArgumentVector(std::string_view program,
                               std::span<const std::string> args) {
  mWords.reserve(args.size() + 1);
  mWords.emplace_back(program);
  mWords.insert(mWords.end(), args.begin(), args.end());
  for (std::string &word : mWords) {
    mPointers.push_back(word.data());
  }
  mPointers.push_back(nullptr);
}

std::string RefusedOption(int got, char *const *argv) {
  // An unknown short option is optopt; otherwise getopt_long has stepped
  // past the element that holds the option.
  if (got == '?' && optopt > 0 && optopt < 256) {
    return std::string("-") + static_cast<char>(optopt);
  }
  std::string written = argv[optind - 1];
  written.resize(std::min(written.find('='), written.size()));
  return written;
}

namespace {

// Values of getopt_long for the options without a short form.
enum : int {
  kListen = 256,
  kModules,
  kAccounts,
  kWww,
  kThreads,
  kSessionIdle,
  kSessionMax,
  kSecureCookie,
  kKeeperInterval,
  kHostName,
};

const option kHostOptions[] = {
    {"help", no_argument, nullptr, 'h'},
    {"listen", required_argument, nullptr, kListen},
    {"modules", required_argument, nullptr, kModules},
    {"accounts", required_argument, nullptr, kAccounts},
    {"www", required_argument, nullptr, kWww},
    {"threads", required_argument, nullptr, kThreads},
    {"session-idle", required_argument, nullptr, kSessionIdle},
    {"session-max", required_argument, nullptr, kSessionMax},
    {"secure-cookie", no_argument, nullptr, kSecureCookie},
    {"keeper-interval", required_argument, nullptr, kKeeperInterval},
    {"host-name", required_argument, nullptr, kHostName},
    {nullptr, 0, nullptr, 0},
};

// The value of the option `name` as whole seconds, 1 to max.
std::optional<std::chrono::milliseconds> ParseSeconds(const char *value,
                                                      const std::string &name,
                                                      std::int64_t max,
                                                      std::string &error) {
  std::optional<std::int64_t> number = ParseNumber(value, 1, max);
  if (!number) {
    error = name + " takes whole seconds, 1 to " + std::to_string(max);
    return std::nullopt;
  }
  return std::chrono::seconds(*number);
}

// Stores one known option of the table (other than --help) in options;
// false, with error set, when its value is refused.
bool ApplyHostOption(int got, const char *value, const std::string &name,
                     HostOptions &options, std::string &error) {
  switch (got) {
  case kSecureCookie:
    options.secureCookie = true;
    break;
  case kListen:
    if (!ParseListen(value, options.http.address, options.http.port)) {
      error = "--listen takes ADDRESS:PORT, for example 127.0.0.1:5000";
      return false;
    }
    break;
  case kModules:
    options.modulesFolder = value;
    break;
  case kAccounts:
    options.accountsFile = value;
    break;
  case kWww:
    options.http.wwwFolder = value;
    break;
  case kThreads: {
    std::optional<std::int64_t> number = ParseNumber(value, 1, 256);
    if (!number) {
      error = "--threads takes 1 to 256";
      return false;
    }
    options.http.threads = static_cast<std::size_t>(*number);
    break;
  }
  case kSessionIdle: {
    auto idle = ParseSeconds(value, name, 7 * 24 * 3600, error);
    if (!idle) {
      return false;
    }
    options.sessions.idleTimeout = *idle;
    break;
  }
  case kSessionMax: {
    auto max = ParseSeconds(value, name, 30 * 24 * 3600, error);
    if (!max) {
      return false;
    }
    options.sessions.maxLifetime = *max;
    break;
  }
  case kKeeperInterval: {
    auto interval = ParseSeconds(value, name, kMaxKeeperIntervalSeconds, error);
    if (!interval) {
      return false;
    }
    options.modules.keeper_interval_seconds =
        static_cast<std::int32_t>(interval->count() / 1000);
    break;
  }
  case kHostName:
    // Names given add to the machine's own (a DNS name of the server, a
    // reverse proxy's); an empty list means the machine's own only.
    if (options.http.hostNames.empty()) {
      options.http.hostNames = LocalHostNames();
    }
    if (value[0] == '\0') {
      error = "--host-name takes a name";
      return false;
    }
    options.http.hostNames.emplace_back(value);
    break;
  default:
    break;
  }
  return true;
}

bool IsTableOption(int got) {
  return got >= kListen && got <= kHostName;
}

} // namespace

OptionsResult ParseHostOptions(std::span<const std::string> args,
                               HostOptions &options, std::string &error) {
  options.http.wwwFolder = DefaultWwwFolder();
  ArgumentVector arguments("zark-webapid", args);
  char **argv = arguments.Get();
  const int argc = arguments.Count();
  // optind 0 makes GNU getopt start over: the options may be parsed more
  // than once in a process (the tests do). "+": stop at the first
  // argument that is no option; ":": report a missing value apart.
  optind = 0;
  opterr = 0;
  for (;;) {
    int index = -1;
    const int got = getopt_long(argc, argv, "+:h", kHostOptions, &index);
    if (got == -1) {
      break;
    }
    if (got == 'h') {
      return OptionsResult::Help;
    }
    if (got == ':') {
      error = RefusedOption(got, argv) + " needs a value";
      return OptionsResult::Error;
    }
    if (!IsTableOption(got)) {
      error = "unknown option " + RefusedOption(got, argv);
      return OptionsResult::Error;
    }
    const std::string name = index >= 0
                                 ? "--" + std::string(kHostOptions[index].name)
                                 : std::string();
    if (!ApplyHostOption(got, optarg, name, options, error)) {
      return OptionsResult::Error;
    }
  }
  // The host takes no arguments besides its options.
  if (optind < argc) {
    error = "unknown option " + std::string(argv[optind]);
    return OptionsResult::Error;
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
         "  --keeper-interval SECONDS  how often modules check the router "
         "for lost\n"
         "                         mappings, 1 to 86400 (default 300)\n"
         "  --host-name NAME       also answer requests for this name "
         "(repeatable;\n"
         "                         default: addresses, localhost and the "
         "machine's name)\n"
         "  --help                 this text\n"
         "\n"
         "passwd reads the password from standard input (twice, without "
         "echo, on a terminal)\nand sets it for USER in the accounts file "
         "(group admin unless --group).\n";
}

} // namespace zark::host
