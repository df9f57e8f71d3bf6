// zark-probed: the probe service (see probe/README.md). Runs in the
// foreground until SIGINT or SIGTERM; logs to standard error.
#include "connect_back.h"
#include "probe_server.h"

#include <signal.h>

#include <charconv>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <mutex>
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

} // namespace

int main(int argc, char **argv) {
  ServerOptions options;
  CheckTimeouts timeouts;
  bool quiet = false;
  bool listenGiven = false;
  for (int i = 1; i < argc; ++i) {
    const std::string_view arg = argv[i];
    if (arg == "--help" || arg == "-h") {
      PrintUsage(stdout);
      return 0;
    }
    if (arg == "--quiet") {
      quiet = true;
      continue;
    }
    if (i + 1 >= argc) {
      std::fprintf(stderr, "zark-probed: %s needs a value\n", argv[i]);
      PrintUsage(stderr);
      return 2;
    }
    const std::string_view value = argv[++i];
    long long number = 0;
    bool ok = true;
    if (arg == "--listen") {
      if (!listenGiven) {
        options.listen.clear();
        listenGiven = true;
      }
      options.listen.emplace_back(value);
    } else if (arg == "--rate") {
      ok = ParseNumber(value, 1, 100000, number);
      options.ratePerSecond = static_cast<double>(number);
    } else if (arg == "--burst") {
      ok = ParseNumber(value, 1, 100000, number);
      options.burst = static_cast<double>(number);
    } else if (arg == "--max-sessions") {
      ok = ParseNumber(value, 1, 10000, number);
      options.maxSessions = static_cast<int>(number);
    } else if (arg == "--max-per-address") {
      ok = ParseNumber(value, 1, 10000, number);
      options.maxSessionsPerAddress = static_cast<int>(number);
    } else if (arg == "--max-requests") {
      ok = ParseNumber(value, 1, 100000, number);
      options.maxRequestsPerSession = static_cast<int>(number);
    } else if (arg == "--idle-timeout") {
      ok = ParseNumber(value, 1, 600000, number);
      options.idleTimeout = std::chrono::milliseconds(number);
    } else if (arg == "--connect-timeout") {
      ok = ParseNumber(value, 1, 60000, number);
      timeouts.connect = std::chrono::milliseconds(number);
    } else if (arg == "--answer-timeout") {
      ok = ParseNumber(value, 1, 60000, number);
      timeouts.answer = std::chrono::milliseconds(number);
    } else {
      std::fprintf(stderr, "zark-probed: unknown option %s\n", argv[i - 1]);
      PrintUsage(stderr);
      return 2;
    }
    if (!ok) {
      std::fprintf(stderr, "zark-probed: bad value \"%s\" for %s\n", argv[i],
                   argv[i - 1]);
      return 2;
    }
  }

  // Blocked before any thread starts, so that every thread inherits the
  // mask and only sigwait below receives them.
  sigset_t stopSignals;
  sigemptyset(&stopSignals);
  sigaddset(&stopSignals, SIGINT);
  sigaddset(&stopSignals, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);

  SocketConnectBack connectBack(timeouts);
  ProbeServer::Logger log;
  if (!quiet) {
    log = LogLine;
  }
  ProbeServer server(options, connectBack, {}, log);
  std::string error;
  if (!server.Start(error)) {
    LogLine("cannot start: " + error);
    return 1;
  }
  std::vector<uint16_t> ports = server.Ports();
  for (std::size_t i = 0; i < ports.size(); ++i) {
    LogLine("listening on " + options.listen[i] + " (port " +
            std::to_string(ports[i]) + ")");
  }
  int received = 0;
  sigwait(&stopSignals, &received);
  LogLine(std::string("stopping on ") + strsignal(received));
  server.Stop();
  ServerCounters counters = server.Counters();
  LogLine("served " + std::to_string(counters.requests) + " request(s), " +
          std::to_string(counters.checks) + " check(s), " +
          std::to_string(counters.badRequests) + " bad, " +
          std::to_string(counters.rateLimited) + " rate-limited, " +
          std::to_string(counters.busy) + " busy");
  return 0;
}
