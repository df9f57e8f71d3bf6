// zark-probed: the probe service (see probe/README.md). Runs in the
// foreground until SIGINT or SIGTERM; logs to standard error.
#include "connect_back.h"
#include "probe_server.h"

#include <getopt.h>
#include <signal.h>

#include <charconv>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

namespace {

using namespace zark::probe;

void PrintUsage(FILE *out) {
  std::fputs(
      "usage: zark-probed [options]\n"
      "  --listen ADDR:PORT       address to listen on, repeatable\n"
      "                           (default 0.0.0.0:7777; [v6]:PORT for IPv6)\n"
      "  --rate N                 requests per second per address (2)\n"
      "  --burst N                requests an address may make at once (60)\n"
      "  --max-sessions N         connections at once (64)\n"
      "  --max-per-address N      connections at once from one address (8)\n"
      "  --max-requests N         requests per connection (64)\n"
      "  --idle-timeout MS        wait for a request line (5000)\n"
      "  --connect-timeout MS     connecting back (3000)\n"
      "  --answer-timeout MS      waiting for the token or UDP reply (2000)\n"
      "  --quiet                  log only start, stop and errors\n",
      out);
}

bool ParseNumber(std::string_view text, long long min, long long max,
                 long long &value) {
  auto [end, error] =
      std::from_chars(text.data(), text.data() + text.size(), value);
  return !text.empty() && error == std::errc() &&
         end == text.data() + text.size() && value >= min && value <= max;
}

std::mutex gLogMutex;

void LogLine(const std::string &line) {
  std::lock_guard<std::mutex> lock(gLogMutex);
  char stamp[32] = {};
  std::time_t now = std::time(nullptr);
  std::tm utc{};
  gmtime_r(&now, &utc);
  std::strftime(stamp, sizeof(stamp), "%Y-%m-%dT%H:%M:%SZ", &utc);
  std::fprintf(stderr, "%s zark-probed: %s\n", stamp, line.c_str());
}

// Values of getopt_long for the options without a short form.
enum : int {
  kQuiet = 256,
  kListen,
  kRate,
  kBurst,
  kMaxSessions,
  kMaxPerAddress,
  kMaxRequests,
  kIdleTimeout,
  kConnectTimeout,
  kAnswerTimeout,
};

const option kOptions[] = {
    {"help", no_argument, nullptr, 'h'},
    {"quiet", no_argument, nullptr, kQuiet},
    {"listen", required_argument, nullptr, kListen},
    {"rate", required_argument, nullptr, kRate},
    {"burst", required_argument, nullptr, kBurst},
    {"max-sessions", required_argument, nullptr, kMaxSessions},
    {"max-per-address", required_argument, nullptr, kMaxPerAddress},
    {"max-requests", required_argument, nullptr, kMaxRequests},
    {"idle-timeout", required_argument, nullptr, kIdleTimeout},
    {"connect-timeout", required_argument, nullptr, kConnectTimeout},
    {"answer-timeout", required_argument, nullptr, kAnswerTimeout},
    {nullptr, 0, nullptr, 0},
};

struct CommandLine {
  ServerOptions options;
  CheckTimeouts timeouts;
  bool quiet = false;
  bool listenGiven = false;
};

// Stores the value of one option with an argument (or --quiet) in
// `line`; false when the value is out of its range.
bool ApplyOption(int got, std::string_view value, CommandLine &line) {
  long long number = 0;
  bool ok = true;
  switch (got) {
  case kQuiet:
    line.quiet = true;
    break;
  case kListen:
    // The first --listen replaces the default address.
    if (!line.listenGiven) {
      line.options.listen.clear();
      line.listenGiven = true;
    }
    line.options.listen.emplace_back(value);
    break;
  case kRate:
    ok = ParseNumber(value, 1, 100000, number);
    line.options.ratePerSecond = static_cast<double>(number);
    break;
  case kBurst:
    ok = ParseNumber(value, 1, 100000, number);
    line.options.burst = static_cast<double>(number);
    break;
  case kMaxSessions:
    ok = ParseNumber(value, 1, 10000, number);
    line.options.maxSessions = static_cast<int>(number);
    break;
  case kMaxPerAddress:
    ok = ParseNumber(value, 1, 10000, number);
    line.options.maxSessionsPerAddress = static_cast<int>(number);
    break;
  case kMaxRequests:
    ok = ParseNumber(value, 1, 100000, number);
    line.options.maxRequestsPerSession = static_cast<int>(number);
    break;
  case kIdleTimeout:
    ok = ParseNumber(value, 1, 600000, number);
    line.options.idleTimeout = std::chrono::milliseconds(number);
    break;
  case kConnectTimeout:
    ok = ParseNumber(value, 1, 60000, number);
    line.timeouts.connect = std::chrono::milliseconds(number);
    break;
  case kAnswerTimeout:
    ok = ParseNumber(value, 1, 60000, number);
    line.timeouts.answer = std::chrono::milliseconds(number);
    break;
  default:
    break;
  }
  return ok;
}

// Reports a missing value (':') or an unknown option ('?').
void ReportOptionError(int got, char **argv) {
  // getopt_long has stepped past the element holding the option, or
  // names an unknown short one in optopt.
  std::string written = argv[optind - 1];
  if (got == '?' && optopt > 0 && optopt < 256) {
    written = std::string("-") + static_cast<char>(optopt);
  }
  std::fprintf(stderr,
               got == ':' ? "zark-probed: %s needs a value\n"
                          : "zark-probed: unknown option %s\n",
               written.substr(0, written.find('=')).c_str());
  PrintUsage(stderr);
}

// Reads the command line into `line`. Returns the exit status when the
// program must end here (0 after --help, 2 on a usage error), nothing
// when the service should start.
std::optional<int> ParseCommandLine(int argc, char **argv, CommandLine &line) {
  // "+": stop at the first argument that is no option; ":": report a
  // missing value apart. getopt_long's own messages stay off.
  opterr = 0;
  for (;;) {
    int index = -1;
    const int got = getopt_long(argc, argv, "+:h", kOptions, &index);
    if (got == -1) {
      break;
    }
    if (got == 'h') {
      PrintUsage(stdout);
      return 0;
    }
    if (got == ':' || got == '?') {
      ReportOptionError(got, argv);
      return 2;
    }
    const std::string_view value = optarg != nullptr ? optarg : "";
    if (!ApplyOption(got, value, line)) {
      std::fprintf(stderr, "zark-probed: bad value \"%s\" for --%s\n", optarg,
                   kOptions[index].name);
      return 2;
    }
  }
  // The service takes no arguments besides its options.
  if (optind < argc) {
    std::fprintf(stderr, "zark-probed: unknown option %s\n", argv[optind]);
    PrintUsage(stderr);
    return 2;
  }
  return std::nullopt;
}

void LogCounters(const ServerCounters &counters) {
  LogLine("served " + std::to_string(counters.requests) + " request(s), " +
          std::to_string(counters.checks) + " check(s), " +
          std::to_string(counters.badRequests) + " bad, " +
          std::to_string(counters.rateLimited) + " rate-limited, " +
          std::to_string(counters.busy) + " busy");
}

// Runs the service until SIGINT or SIGTERM; returns the exit status.
int RunService(const CommandLine &line) {
  // Blocked before any thread starts, so that every thread inherits the
  // mask and only sigwait below receives them.
  sigset_t stopSignals;
  sigemptyset(&stopSignals);
  sigaddset(&stopSignals, SIGINT);
  sigaddset(&stopSignals, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);

  SocketConnectBack connectBack(line.timeouts);
  ProbeServer::Logger log;
  if (!line.quiet) {
    log = LogLine;
  }
  ProbeServer server(line.options, connectBack, {}, log);
  std::string error;
  if (!server.Start(error)) {
    LogLine("cannot start: " + error);
    return 1;
  }
  std::vector<uint16_t> ports = server.Ports();
  for (std::size_t i = 0; i < ports.size(); ++i) {
    LogLine("listening on " + line.options.listen[i] + " (port " +
            std::to_string(ports[i]) + ")");
  }
  int received = 0;
  sigwait(&stopSignals, &received);
  LogLine(std::string("stopping on ") + strsignal(received));
  server.Stop();
  LogCounters(server.Counters());
  return 0;
}

} // namespace

int main(int argc, char **argv) {
  CommandLine line;
  if (std::optional<int> status = ParseCommandLine(argc, argv, line)) {
    return *status;
  }
  return RunService(line);
}
