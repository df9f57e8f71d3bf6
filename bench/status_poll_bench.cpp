// Status polls answered by the real host, many at once: zark-webapid of
// this build with the module ZARK.Core.PortForwarding.so on 127.0.0.1, and
// 200 client threads, each logged in with a session of its own, each
// polling N times in turn Rules save_status (of a save in progress) and
// get_current_process. Every request's time is measured from the client's
// send to its complete answer (a new connection each, as the HTTP
// library's client makes by default); p50, p99 and the slowest are
// printed, overall and per method, with the kernel's counters of dropped
// and reset connections, then one line for the figures script:
//
//   status polls: 200 concurrent, 10000 requests, p50 <x> ms, p99 <y> ms,
//   max <z> ms
//
// Run as root, after building it (RelWithDebInfo for figures):
//
//   cmake --build build --target status_poll_bench
//   build/bin/status_poll_bench [--clients N] [--polls N] [--host-threads N]
//
// The program first enters a network namespace of its own (only loopback:
// no gateway, so nothing it starts can reach a router) and a private mount
// namespace (tests/support/hermetic.h: fresh /tmp, /etc and /usr writes in
// memory); the host, its child, shares both, and its syslog goes to a
// socket of the program (tests/load/host_syslog.h). The save being polled
// waits for the port-map lock, which the program holds for the whole
// measurement (the library's lock gives up after 30 s), so its record says
// "processing"; "/tmp/pfProgress" holds an "add" line, so every poll also
// reads the progress file as it does while rules are applied. Exit status:
// 0 when every poll got the answer it should, 1 otherwise, 2 when the set-up
// failed. No figure is judged.
#include "api_client.h"
#include "hermetic.h"
#include "host_syslog.h"
#include "libzarkportmap.h"
#include "webapid_process.h"

#include <net/if.h>
#include <sched.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <latch>
#include <mutex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

namespace {

using namespace std::chrono_literals;
using zark::load::ApiAnswer;
using zark::load::ApiClient;

constexpr const char *kApiBase = "ZARK.Core.PortForwarding";
constexpr const char *kApiRules = "ZARK.Core.PortForwarding.Rules";
constexpr const char *kAccount = "admin";
constexpr const char *kPassword = "Bench-p0ll-Adm1n";
constexpr const char *kProgressFile = "/tmp/pfProgress";
constexpr auto kRequestBound = std::chrono::seconds(30);

struct Options {
  int clients = 200;
  int polls = 50;      // per client
  int hostThreads = 0; // the host's default
};

bool ParseCount(const char *text, int low, int high, int &value) {
  char *end = nullptr;
  long number = std::strtol(text, &end, 10);
  if (end == text || *end != '\0' || number < low || number > high) {
    return false;
  }
  value = static_cast<int>(number);
  return true;
}

bool ParseOptions(int argc, char **argv, Options &options) {
  for (int i = 1; i < argc; ++i) {
    const std::string name = argv[i];
    const char *value = i + 1 < argc ? argv[i + 1] : nullptr;
    int *target = nullptr;
    int high = 0;
    if (name == "--clients") {
      target = &options.clients;
      high = 250; // the host keeps 256 sessions
    } else if (name == "--polls") {
      target = &options.polls;
      high = 100000;
    } else if (name == "--host-threads") {
      target = &options.hostThreads;
      high = 256;
    }
    if (target == nullptr || value == nullptr ||
        !ParseCount(value, 1, high, *target)) {
      std::fprintf(stderr,
                   "usage: status_poll_bench [--clients 1-250] [--polls N] "
                   "[--host-threads 1-256]\n");
      return false;
    }
    ++i;
  }
  return true;
}

// A network namespace of the process's own, with loopback up.
bool EnterLoopbackNetwork(std::string &why) {
  if (::unshare(CLONE_NEWNET) != 0) {
    why = std::string("unshare(CLONE_NEWNET): ") + std::strerror(errno);
    return false;
  }
  int fd = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  ifreq request{};
  std::strncpy(request.ifr_name, "lo", IFNAMSIZ - 1);
  bool up = fd >= 0 && ::ioctl(fd, SIOCGIFFLAGS, &request) == 0;
  request.ifr_flags |= IFF_UP;
  up = up && ::ioctl(fd, SIOCSIFFLAGS, &request) == 0;
  if (!up) {
    why = std::string("bring lo up: ") + std::strerror(errno);
  }
  if (fd >= 0) {
    ::close(fd);
  }
  return up;
}

// Counters of the kernel's TCP stack in this network namespace (the
// program's own): "name value" for the named ones, from the header and
// value line pairs of /proc/net/netstat and /proc/net/snmp.
std::string TcpCounters(const std::vector<std::string> &names) {
  std::string text;
  for (const char *file : {"/proc/net/netstat", "/proc/net/snmp"}) {
    std::ifstream in(file);
    std::string header;
    std::string values;
    while (std::getline(in, header) && std::getline(in, values)) {
      std::istringstream keys(header);
      std::istringstream numbers(values);
      std::string key;
      std::string number;
      keys >> key;
      numbers >> number; // the "TcpExt:" / "Tcp:" prefix
      while (keys >> key && numbers >> number) {
        if (std::find(names.begin(), names.end(), key) != names.end()) {
          text += (text.empty() ? "" : ", ") + key + " " + number;
        }
      }
    }
  }
  return text;
}

// One poll's method and time.
struct Sample {
  bool status; // save_status (else get_current_process)
  long long micros;
};

double Millis(long long micros) {
  return static_cast<double>(micros) / 1000.0;
}

// Nearest-rank percentile of sorted times.
long long Percentile(const std::vector<long long> &sorted, double fraction) {
  if (sorted.empty()) {
    return 0;
  }
  std::size_t rank = static_cast<std::size_t>(
      std::ceil(fraction * static_cast<double>(sorted.size())));
  return sorted[std::clamp<std::size_t>(rank, 1, sorted.size()) - 1];
}

void PrintFigures(const char *what, std::vector<long long> times) {
  std::sort(times.begin(), times.end());
  std::printf("  %-20s %6zu requests  p50 %8.2f ms  p99 %8.2f ms  max %8.2f "
              "ms\n",
              what, times.size(), Millis(Percentile(times, 0.50)),
              Millis(Percentile(times, 0.99)),
              Millis(times.empty() ? 0 : times.back()));
}

// A save_status answer of the save waiting for the lock, with the
// progress file's "add" stage.
bool GoodStatus(const ApiAnswer &answer) {
  return answer.answered && answer.success &&
         answer.data["status"].asString() == "processing" &&
         answer.data["stage"].asString() == "add";
}

bool GoodProcess(const ApiAnswer &answer) {
  return answer.answered && answer.success && answer.data["process"].isString();
}

int Run(const Options &options) {
  std::string why;
  if (!EnterLoopbackNetwork(why) ||
      !zark::test::EnterPrivateMountNamespace(&why)) {
    std::fprintf(stderr, "status_poll_bench: %s (run as root)\n", why.c_str());
    return 2;
  }
  zark::load::HostSyslog syslog;
  if (!syslog.Start(why)) {
    std::fprintf(stderr, "status_poll_bench: host syslog: %s\n", why.c_str());
    return 2;
  }
  zark::load::WebapidProcess host(zark::load::HostSetup{
      ZARK_WEBAPID_PATH, ZARK_MODULE_PATH, "/tmp/status-poll-bench", kAccount,
      kPassword, options.hostThreads});
  if (!host.Start(30s, why)) {
    std::fprintf(stderr, "status_poll_bench: %s\n", why.c_str());
    return 2;
  }

  // The save to poll: it waits for the lock this process holds.
  if (KLibZarkPortMapLock() < 0) {
    std::fprintf(stderr, "status_poll_bench: cannot take the port-map lock\n");
    return 2;
  }
  zark::test::WriteFile(kProgressFile, "add=3/6\n");
  ApiClient starter(host.Port(), kRequestBound);
  if (!starter.Login(kAccount, kPassword, why)) {
    std::fprintf(stderr, "status_poll_bench: %s\n", why.c_str());
    return 2;
  }
  Json::Value save(Json::objectValue);
  save["rules"] = Json::Value(Json::arrayValue);
  ApiAnswer started = starter.Call(kApiRules, "save", save);
  if (!started.success || !started.data["task_id"].isString()) {
    std::fprintf(stderr, "status_poll_bench: save not started: %s\n",
                 started.body.c_str());
    return 2;
  }
  Json::Value statusParams(Json::objectValue);
  statusParams["task_id"] = started.data["task_id"];
  // Until the task reports, its status is an error (nothing recorded yet).
  bool reported = false;
  for (int attempt = 0; attempt < 500 && !reported; ++attempt) {
    reported = GoodStatus(starter.Call(kApiRules, "save_status", statusParams));
    if (!reported) {
      std::this_thread::sleep_for(10ms);
    }
  }
  if (!reported) {
    std::fprintf(stderr, "status_poll_bench: the save never reported\n");
    return 2;
  }

  std::mutex samplesMutex;
  std::vector<Sample> samples;
  samples.reserve(static_cast<std::size_t>(options.clients) *
                  static_cast<std::size_t>(options.polls));
  std::atomic<int> loginFailures{0};
  std::atomic<int> badAnswers{0};
  std::mutex firstBadMutex;
  std::string firstBad;
  std::string firstLoginFailure;
  std::latch ready(options.clients + 1);
  std::chrono::steady_clock::time_point begin;
  {
    std::vector<std::jthread> clients;
    for (int c = 0; c < options.clients; ++c) {
      clients.emplace_back([&, c] {
        ApiClient client(host.Port(), kRequestBound);
        std::string loginWhy;
        const bool in = client.Login(kAccount, kPassword, loginWhy);
        if (!in) {
          ++loginFailures;
          std::lock_guard lock(firstBadMutex);
          if (firstLoginFailure.empty()) {
            firstLoginFailure = loginWhy;
          }
        }
        ready.arrive_and_wait();
        if (!in) {
          return;
        }
        std::vector<Sample> mine;
        mine.reserve(static_cast<std::size_t>(options.polls));
        const Json::Value none(Json::objectValue);
        for (int i = 0; i < options.polls; ++i) {
          // Half the clients start with the other method, so both run at
          // once throughout.
          const bool status = (i + c) % 2 == 0;
          ApiAnswer answer =
              status ? client.Call(kApiRules, "save_status", statusParams)
                     : client.Call(kApiBase, "get_current_process", none);
          if (!(status ? GoodStatus(answer) : GoodProcess(answer))) {
            ++badAnswers;
            std::lock_guard lock(firstBadMutex);
            if (firstBad.empty()) {
              firstBad = answer.answered ? answer.body : answer.failure;
            }
          }
          mine.push_back({status, answer.latency.count()});
        }
        std::lock_guard lock(samplesMutex);
        samples.insert(samples.end(), mine.begin(), mine.end());
      });
    }
    ready.arrive_and_wait();
    begin = std::chrono::steady_clock::now();
  }
  const double seconds =
      std::chrono::duration<double>(std::chrono::steady_clock::now() - begin)
          .count();

  KLibZarkPortMapUnLock();
  const int stopStatus = host.Stop(30s);

  std::vector<long long> all;
  std::vector<long long> statusTimes;
  std::vector<long long> processTimes;
  for (const Sample &sample : samples) {
    all.push_back(sample.micros);
    (sample.status ? statusTimes : processTimes).push_back(sample.micros);
  }
  std::printf("status poll benchmark: %d clients x %d polls, host threads "
              "%s, %.2f s, %.0f requests/s\n",
              options.clients, options.polls,
              options.hostThreads > 0
                  ? std::to_string(options.hostThreads).c_str()
                  : "default",
              seconds, static_cast<double>(all.size()) / seconds);
  PrintFigures("save_status", statusTimes);
  PrintFigures("get_current_process", processTimes);
  PrintFigures("all", all);
  std::printf(
      "  kernel TCP counters: %s\n",
      TcpCounters({"ListenOverflows", "ListenDrops", "TCPReqQFullDrop",
                   "TCPReqQFullDoCookies", "SyncookiesSent", "SyncookiesRecv",
                   "TCPSynRetrans", "EstabResets", "OutRsts", "AttemptFails"})
          .c_str());
  std::sort(all.begin(), all.end());
  std::printf("status polls: %d concurrent, %zu requests, p50 %.2f ms, p99 "
              "%.2f ms, max %.2f ms\n",
              options.clients, all.size(), Millis(Percentile(all, 0.50)),
              Millis(Percentile(all, 0.99)),
              Millis(all.empty() ? 0 : all.back()));
  std::fflush(stdout);

  int result = 0;
  if (loginFailures.load() > 0 || badAnswers.load() > 0) {
    std::fprintf(stderr,
                 "status_poll_bench: %d logins failed (first: %s), %d polls "
                 "got a wrong answer (first: %s)\n",
                 loginFailures.load(), firstLoginFailure.c_str(),
                 badAnswers.load(), firstBad.c_str());
    result = 1;
  }
  if (stopStatus == -1 || !WIFEXITED(stopStatus) ||
      WEXITSTATUS(stopStatus) != 0) {
    std::fprintf(stderr, "status_poll_bench: the host did not stop cleanly\n");
    result = 1;
  }
  if (result != 0) {
    for (const std::string &line : syslog.Lines()) {
      std::fprintf(stderr, "%s\n", line.c_str());
    }
  }
  return result;
}

} // namespace

int main(int argc, char **argv) {
  Options options;
  if (!ParseOptions(argc, argv, options)) {
    return 2;
  }
  return Run(options);
}
