// Applying rules to a real router: KLibSaveRules against miniupnpd in the
// test network, beside the same work done by upnpc.
//
//   scripts/bench-apply.sh [--benchmark_...]
//   (as root: it brings the test network up, runs this in the server
//   namespace, and brings everything down again)
//
// The rule set: 100 single-port rules, each for TCP and UDP (protocol
// "both"), router port = local port = 30000..30099: 200 mappings, within
// miniupnpd's 128 mappings per protocol. Cases, each with no delay, with
// 10 ms and with 20 ms of delay per request (below), 3 runs each:
//
//   first_save     the router holds none of our mappings and the library
//                  has no record of the router: it finds it by SSDP
//                  discovery, then adds all 200 mappings
//   from_nothing   the router holds none of our mappings, the library knows
//                  where the router is (an earlier save): adds all 200
//   upnpc_loop     the same 200 mappings made by 200 runs of
//                  "upnpc -u <root description> -r <port> <TCP|UDP>"
//   upnpc_one_call the same made by one run of upnpc with all 200 pairs
//   unchanged      the 200 mappings applied again, nothing changed
//   change/N       N rules (2N mappings) get another router port, back and
//                  forth between iterations (N = 1, 10, 50)
// and, with no delay and without the relay (the router's counters only),
// from_nothing and upnpc_loop again: what the relay's extra hop costs.
//
// Every timed run is followed (untimed) by "upnpc -l": the router must
// hold exactly the wanted mappings, or the case fails. A summary in
// Markdown (figures and targets) is printed at the end.
//
// Counting the router's requests: an nftables "redirect" rule in this
// (the server) namespace sends every connection to the router's UPnP HTTP
// port to an in-process relay (counting_relay.h), which counts the requests
// by SOAP action, the requests in flight at once and the router's time for
// each, and can hold each request back for the delay. It sees the library
// and upnpc alike, and neither is told about it. On the router, nftables
// counters of the connections to its HTTP port and of SSDP searches from
// the server are the cross-check: the relay's request count and the
// router's connection count must agree (miniupnpc opens one connection per
// request), or the case fails.
//
// The delay: this kernel has no netem queueing discipline ("tc qdisc add
// ... netem" answers "Specified qdisc kind is unknown"), so the relay holds
// each request back before passing it on. 10 ms is one delay per request;
// 20 ms is what netem's 10 ms on the router's LAN link (on the packets from
// the router) would cost a request over a new connection, as miniupnpc
// makes one per request: its SYN-ACK and its reply each come 10 ms late.
#include "base/unique_fd.h"
#include "catalog/mapping_state.h"
#include "child_process.h"
#include "counting_relay.h"
#include "hermetic.h"
#include "libzarkportmap.h"
#include "test_network.h"

#include <benchmark/benchmark.h>

#include <arpa/inet.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <tuple>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;
using zark::bench::CountingRelay;
using zark::bench::RelayCounts;
using zark::portmap::UniqueFd;
using zark::test::ChildOptions;
using zark::test::ChildResult;
using zark::test::RunProgram;
using zark::testnet::TestNetwork;

constexpr int kRules = 100; // each for TCP and UDP
constexpr int kMappings = 2 * kRules;
constexpr int kFirstPort = 30000; // rule i: router and local port 30000 + i
constexpr int kMovedPort = 31000; // a changed rule i: router port 31000 + i
constexpr int kIterations = 3;
// Delays per request (see above).
constexpr int kDelaysMs[] = {0, 10, 20};
// SO_MARK of the relay's own connections to the router, which the redirect
// rule leaves alone.
constexpr uint32_t kRelayMark = 0x5a4b;
constexpr const char *kNft = "/usr/sbin/nft";
constexpr const char *kNsenter = "/usr/bin/nsenter";
constexpr const char *kUpnpc = "/usr/bin/upnpc";
constexpr const char *kWorkDir = "/tmp/zark-bench-apply";
constexpr auto kToolTimeout = std::chrono::seconds(30);

std::optional<TestNetwork> gNet;
std::unique_ptr<CountingRelay> gRelay;
std::string gRouterHost; // the router's LAN address, from the description URL
uint16_t gHttpPort = 0;  // its UPnP HTTP port

// ---------------------------------------------------------------------------
// Programs

// Runs a program (absolute path) with standard input, output and error on
// /dev/null and a minimal environment, at most timeout. Its exit status, or
// -1 when it could not start, was killed or ran out of time. Cheaper than
// RunProgram (no pipes to read), so the upnpc loop pays no more than a
// shell loop would.
int RunQuiet(const std::vector<std::string> &args,
             std::chrono::milliseconds timeout) {
  struct FileActions {
    posix_spawn_file_actions_t actions;
    FileActions() { posix_spawn_file_actions_init(&actions); }
    ~FileActions() { posix_spawn_file_actions_destroy(&actions); }
  } files;
  posix_spawn_file_actions_addopen(&files.actions, 0, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_addopen(&files.actions, 1, "/dev/null", O_WRONLY, 0);
  posix_spawn_file_actions_adddup2(&files.actions, 1, 2);
  std::vector<std::string> copy = args;
  std::vector<char *> argv;
  for (std::string &arg : copy) {
    argv.push_back(arg.data());
  }
  argv.push_back(nullptr);
  char path[] = "PATH=/usr/sbin:/usr/bin:/sbin:/bin";
  char locale[] = "LC_ALL=C";
  char *envp[] = {path, locale, nullptr};
  pid_t pid = -1;
  if (posix_spawn(&pid, argv[0], &files.actions, nullptr, argv.data(), envp) !=
      0) {
    return -1;
  }
  // glibc 2.36 declares pidfd_open without C linkage for C++: the system
  // call itself.
  UniqueFd pidFd(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
  bool ended = false;
  if (pidFd.Valid()) {
    const Clock::time_point deadline = Clock::now() + timeout;
    for (;;) {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - Clock::now());
      if (left.count() <= 0) {
        break;
      }
      pollfd pfd{pidFd.Get(), POLLIN, 0};
      int ready = ::poll(&pfd, 1, static_cast<int>(left.count()));
      if (ready > 0) {
        ended = true;
        break;
      }
      if (ready < 0 && errno != EINTR) {
        break;
      }
    }
  }
  if (!ended) {
    ::kill(pid, SIGKILL);
  }
  int status = 0;
  while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  return ended && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// Runs a program, its output kept, and says what went wrong in why.
bool RunTool(const std::vector<std::string> &args, std::string &output,
             std::string &why) {
  ChildOptions options;
  options.timeout = kToolTimeout;
  ChildResult result = RunProgram(args.at(0), args, options);
  output = result.output;
  if (!result.Succeeded()) {
    why = args.at(0) + " " + (args.size() > 1 ? args[1] : "") +
          " failed (status " + std::to_string(result.exitStatus) +
          (result.timedOut ? ", timed out" : "") + "): " + result.errors +
          result.output.substr(0, 2000);
    return false;
  }
  return true;
}

bool RunInRouterNamespace(const std::vector<std::string> &args,
                          std::string &output, std::string &why) {
  std::vector<std::string> full = {kNsenter,
                                   "--net=/run/netns/" + gNet->routerNs};
  full.insert(full.end(), args.begin(), args.end());
  return RunTool(full, output, why);
}

// ---------------------------------------------------------------------------
// Counting on the router (the cross-check)

struct RouterCounts {
  long long http = 0; // connections to the UPnP HTTP port
  long long ssdp = 0; // SSDP packets (discovery)

  RouterCounts operator-(const RouterCounts &other) const {
    return {http - other.http, ssdp - other.ssdp};
  }
};

// Counters in a table of our own on the router, of packets from the server.
bool InstallRouterCounters(std::string &why) {
  const std::string path = std::string(kWorkDir) + "/router-counters.nft";
  zark::test::WriteFile(
      path, "table inet zark_bench {\n"
            "  counter upnp_http {}\n"
            "  counter ssdp {}\n"
            "  chain input {\n"
            "    type filter hook input priority -10; policy accept;\n"
            "    ip saddr " +
                gNet->lanServer + " tcp dport " + std::to_string(gHttpPort) +
                " tcp flags & (syn | ack) == syn counter name upnp_http\n"
                "    ip saddr " +
                gNet->lanServer +
                " udp dport 1900 counter name ssdp\n"
                "  }\n"
                "}\n");
  std::string output;
  return RunInRouterNamespace({kNft, "-f", path}, output, why);
}

bool ReadRouterCounts(RouterCounts &counts, std::string &why) {
  std::string output;
  if (!RunInRouterNamespace({kNft, "list", "table", "inet", "zark_bench"},
                            output, why)) {
    return false;
  }
  //   counter upnp_http {
  //           packets 401 bytes 24060
  //   }
  std::map<std::string, long long> found;
  for (const char *name : {"upnp_http", "ssdp"}) {
    const std::size_t counter =
        output.find("counter " + std::string(name) + " {");
    const std::size_t packets = output.find("packets ", counter);
    if (counter == std::string::npos || packets == std::string::npos) {
      break;
    }
    const char *digits = output.data() + packets + 8;
    long long value = 0;
    auto [end, error] =
        std::from_chars(digits, output.data() + output.size(), value);
    if (error != std::errc() || end == digits) {
      break;
    }
    found[name] = value;
  }
  if (found.size() != 2) {
    why = "cannot read the router's counters: " + output;
    return false;
  }
  counts = {found["upnp_http"], found["ssdp"]};
  return true;
}

// The redirect of this namespace's connections to the router's HTTP port to
// the relay (which its own connections, marked, escape).
bool InstallRedirect(std::string &why) {
  const std::string path = std::string(kWorkDir) + "/redirect.nft";
  char mark[16];
  std::snprintf(mark, sizeof(mark), "0x%x", kRelayMark);
  zark::test::WriteFile(
      path, "table ip zark_bench {\n"
            "  chain output {\n"
            "    type nat hook output priority -100; policy accept;\n"
            "    meta mark != " +
                std::string(mark) + " ip daddr " + gRouterHost + " tcp dport " +
                std::to_string(gHttpPort) +
                " redirect to :" + std::to_string(gRelay->Port()) +
                "\n"
                "  }\n"
                "}\n");
  std::string output;
  return RunTool({kNft, "-f", path}, output, why);
}

// Without the redirect, connections go straight to the router: for the
// cases that measure what the relay's extra hop costs.
bool RemoveRedirect(std::string &why) {
  std::string output;
  return RunTool({kNft, "delete", "table", "ip", "zark_bench"}, output, why);
}

void RemoveNftTables() {
  std::string output;
  std::string why;
  if (!RunTool({kNft, "delete", "table", "ip", "zark_bench"}, output, why) ||
      !RunInRouterNamespace({kNft, "delete", "table", "inet", "zark_bench"},
                            output, why)) {
    std::fprintf(stderr, "cleaning up: %s\n", why.c_str());
  }
}

// ---------------------------------------------------------------------------
// Rules and the router's table

void CopyText(char (&field)[ZARK_PORTMAP_TEXT_SIZE], const std::string &text) {
  std::snprintf(field, sizeof(field), "%s", text.c_str());
}

// The rule set with its first `moved` rules on another router port.
std::vector<ZARK_ROUTER_RULE> RuleSet(int moved) {
  std::vector<ZARK_ROUTER_RULE> rules(kRules);
  for (int i = 0; i < kRules; ++i) {
    ZARK_ROUTER_RULE &rule = rules[i];
    CopyText(rule.rule_id, "r" + std::to_string(i));
    rule.enable = 1;
    CopyText(rule.router_protocol, "both");
    CopyText(rule.router_port,
             std::to_string((i < moved ? kMovedPort : kFirstPort) + i));
    CopyText(rule.ds_port, std::to_string(kFirstPort + i));
    CopyText(rule.serviceid, "bench");
  }
  return rules;
}

// protocol ("TCP"/"UDP"), router port, local port
using Wanted = std::tuple<std::string, int, int>;

std::set<Wanted> WantedOf(int moved) {
  std::set<Wanted> wanted;
  for (int i = 0; i < kRules; ++i) {
    const int routerPort = (i < moved ? kMovedPort : kFirstPort) + i;
    wanted.insert({"TCP", routerPort, kFirstPort + i});
    wanted.insert({"UDP", routerPort, kFirstPort + i});
  }
  return wanted;
}

std::string Describe(const Wanted &mapping) {
  return std::get<0>(mapping) + " " + std::to_string(std::get<1>(mapping)) +
         "->" + std::to_string(std::get<2>(mapping));
}

bool Save(std::vector<ZARK_ROUTER_RULE> &rules, std::string &why) {
  ZARK_ROUTER_SAVE_RULE_RESULT result{};
  const int rc = KLibSaveRules(
      gNet->lanRouter.c_str(), static_cast<int>(rules.size()),
      rules.empty() ? nullptr : rules.data(), false, &result, nullptr, nullptr);
  if (rc == 0) {
    return true;
  }
  why =
      "KLibSaveRules failed with error type " + std::to_string(result.errType);
  switch (result.errType) {
  case ZARK_SAVE_ERR_TOO_MANY_RULES:
  case ZARK_SAVE_ERR_PORT_TOO_HIGH:
  case ZARK_SAVE_ERR_TOO_MANY_PORTS:
  case ZARK_SAVE_ERR_RANGE_TOO_LONG:
    why += " (limit " + std::to_string(result.detail.limit.maxPort) + ")";
    break;
  default:
    why += ": " +
           std::string(result.detail.text,
                       strnlen(result.detail.text, sizeof(result.detail.text)));
  }
  return false;
}

bool ListRouter(std::set<Wanted> &held, std::string &why) {
  std::vector<zark::testnet::UpnpMapping> mappings;
  std::string raw;
  if (!zark::testnet::ListUpnpMappings(*gNet, mappings, &raw)) {
    why = "upnpc -l failed: " + raw;
    return false;
  }
  held.clear();
  for (const zark::testnet::UpnpMapping &mapping : mappings) {
    if (mapping.internalAddress != gNet->lanServer) {
      why = "the router maps to " + mapping.internalAddress;
      return false;
    }
    held.insert({mapping.protocol, mapping.externalPort, mapping.internalPort});
  }
  if (held.size() != mappings.size()) {
    why = "upnpc -l lists a mapping twice:\n" + raw;
    return false;
  }
  return true;
}

// The router holds exactly wanted.
bool RouterHolds(const std::set<Wanted> &wanted, std::string &why) {
  std::set<Wanted> held;
  if (!ListRouter(held, why)) {
    return false;
  }
  if (held == wanted) {
    return true;
  }
  std::vector<Wanted> missing;
  std::vector<Wanted> extra;
  std::set_difference(wanted.begin(), wanted.end(), held.begin(), held.end(),
                      std::back_inserter(missing));
  std::set_difference(held.begin(), held.end(), wanted.begin(), wanted.end(),
                      std::back_inserter(extra));
  why = "the router holds " + std::to_string(held.size()) + " mappings, " +
        std::to_string(missing.size()) + " wanted ones missing" +
        (missing.empty() ? "" : " (" + Describe(missing.front()) + ", ...)") +
        ", " + std::to_string(extra.size()) + " others" +
        (extra.empty() ? "" : " (" + Describe(extra.front()) + ", ...)");
  return false;
}

// Leaves the router without any mapping for this server: the library
// deletes its own (an empty rule set), upnpc those it made.
bool ClearRouter(std::string &why) {
  std::vector<ZARK_ROUTER_RULE> none;
  if (!Save(none, why)) {
    return false;
  }
  std::set<Wanted> held;
  if (!ListRouter(held, why)) {
    return false;
  }
  if (!held.empty()) {
    // DeletePortMappingRange (IGD:2) per protocol, then one by one for
    // whatever it left.
    for (const char *protocol : {"TCP", "UDP"}) {
      (void)RunQuiet({kUpnpc, "-u", gNet->rootDesc, "-N",
                      std::to_string(kFirstPort),
                      std::to_string(kMovedPort + kRules), protocol},
                     kToolTimeout);
    }
    if (!ListRouter(held, why)) {
      return false;
    }
    for (const Wanted &mapping : held) {
      (void)RunQuiet({kUpnpc, "-u", gNet->rootDesc, "-d",
                      std::to_string(std::get<1>(mapping)),
                      std::get<0>(mapping)},
                     kToolTimeout);
    }
  }
  return RouterHolds({}, why);
}

// The library forgets where the router is (and everything else it
// recorded): its next save starts with SSDP discovery.
bool ForgetRouter(std::string &why) {
  std::error_code error;
  std::filesystem::remove(zark::portmap::kMappingStatePath, error);
  if (error) {
    why = std::string("removing the mapping state: ") + error.message();
    return false;
  }
  return true;
}

// ---------------------------------------------------------------------------
// Measuring

struct Sample {
  double seconds = 0;
  RelayCounts relay;
  RouterCounts router;
};

// Times work with the relay holding each request for delay, and counts
// what the router got meanwhile.
bool Timed(std::chrono::milliseconds delay,
           const std::function<bool(std::string &)> &work, Sample &sample,
           std::string &why) {
  RouterCounts before;
  if (!ReadRouterCounts(before, why)) {
    return false;
  }
  (void)gRelay->Take();
  gRelay->SetDelay(delay);
  const Clock::time_point start = Clock::now();
  const bool done = work(why);
  const Clock::time_point end = Clock::now();
  gRelay->SetDelay(std::chrono::milliseconds(0));
  sample.relay = gRelay->Take();
  sample.seconds = std::chrono::duration<double>(end - start).count();
  RouterCounts after;
  std::string countWhy;
  if (!ReadRouterCounts(after, countWhy)) {
    why = done ? countWhy : why;
    return false;
  }
  sample.router = after - before;
  return done;
}

// Everything measured for one case, for the summary.
struct CaseFigures {
  int mappings = 0;    // mappings the work makes or changes
  bool direct = false; // measured without the relay: router counts only
  std::vector<Sample> samples;
  std::string failure;
};
std::map<std::string, CaseFigures> gFigures;
std::vector<std::string> gCaseOrder;

std::string CaseKey(const std::string &name, std::chrono::milliseconds delay) {
  return name + " @" + std::to_string(delay.count()) + "ms";
}

CaseFigures &Figures(const std::string &key) {
  if (gFigures.find(key) == gFigures.end()) {
    gCaseOrder.push_back(key);
  }
  return gFigures[key];
}

double Mean(const std::vector<Sample> &samples,
            const std::function<double(const Sample &)> &of) {
  double sum = 0;
  for (const Sample &sample : samples) {
    sum += of(sample);
  }
  return samples.empty() ? 0 : sum / static_cast<double>(samples.size());
}

int MaxInFlight(const std::vector<Sample> &samples) {
  int most = 0;
  for (const Sample &sample : samples) {
    most = std::max(most, sample.relay.maxInFlight);
  }
  return most;
}

// Requests as the relay counted them; without the relay, the connections
// the router counted (one per request).
double MeanRequests(const CaseFigures &figures) {
  return Mean(figures.samples, [&](const Sample &s) {
    return figures.direct ? static_cast<double>(s.router.http)
                          : static_cast<double>(s.relay.requests);
  });
}

void SetCounters(benchmark::State &state, const CaseFigures &figures) {
  const std::vector<Sample> &samples = figures.samples;
  if (samples.empty()) {
    return;
  }
  const double requests = MeanRequests(figures);
  state.counters["requests"] = requests;
  state.counters["router_conns"] = Mean(samples, [](const Sample &s) {
    return static_cast<double>(s.router.http);
  });
  state.counters["ssdp"] = Mean(samples, [](const Sample &s) {
    return static_cast<double>(s.router.ssdp);
  });
  if (!figures.direct) {
    state.counters["max_in_flight"] = MaxInFlight(samples);
  }
  if (figures.mappings > 0) {
    state.counters["req_per_mapping"] = requests / figures.mappings;
  }
}

// One case: before (untimed) sets the router up for an iteration, work is
// timed, and afterwards the router must hold wanted(iteration). direct:
// without the relay (and so without delay) while work runs.
void RunCase(benchmark::State &state, const std::string &name, int mappings,
             const std::function<bool(int, std::string &)> &before,
             const std::function<bool(int, std::string &)> &work,
             const std::function<std::set<Wanted>(int)> &wanted,
             bool direct = false) {
  const auto delay = std::chrono::milliseconds(state.range(0));
  CaseFigures &figures = Figures(CaseKey(name, delay));
  figures.mappings = mappings;
  figures.direct = direct;
  int iteration = 0;
  for (auto _ : state) {
    std::string why;
    Sample sample;
    bool ok = before(iteration, why) && (!direct || RemoveRedirect(why)) &&
              Timed(
                  delay, [&](std::string &w) { return work(iteration, w); },
                  sample, why);
    if (direct) {
      std::string restoreWhy;
      if (!InstallRedirect(restoreWhy) && ok) {
        ok = false;
        why = restoreWhy;
      }
    }
    ok = ok && RouterHolds(wanted(iteration), why);
    if (!ok) {
      figures.failure = why;
      state.SkipWithError(why.c_str());
      break;
    }
    if (sample.relay.refused + sample.relay.upstreamFailures +
            sample.relay.malformed >
        0) {
      figures.failure = "the relay refused or broke connections";
      state.SkipWithError(figures.failure.c_str());
      break;
    }
    if (!direct && sample.relay.requests != sample.router.http) {
      figures.failure = "the relay counted " +
                        std::to_string(sample.relay.requests) +
                        " requests, the router " +
                        std::to_string(sample.router.http) + " connections";
      state.SkipWithError(figures.failure.c_str());
      break;
    }
    if (direct && sample.relay.requests != 0) {
      figures.failure = "requests went through the relay without redirect";
      state.SkipWithError(figures.failure.c_str());
      break;
    }
    state.SetIterationTime(sample.seconds);
    figures.samples.push_back(sample);
    ++iteration;
  }
  SetCounters(state, figures);
}

// ---------------------------------------------------------------------------
// The cases

bool NoPreparation(int, std::string &) {
  return true;
}

void BM_FirstSave(benchmark::State &state) {
  std::vector<ZARK_ROUTER_RULE> rules = RuleSet(0);
  RunCase(
      state, "first_save", kMappings,
      [](int, std::string &why) {
        return ClearRouter(why) && ForgetRouter(why);
      },
      [&](int, std::string &why) { return Save(rules, why); },
      [](int) { return WantedOf(0); });
}

void BM_FromNothing(benchmark::State &state) {
  std::vector<ZARK_ROUTER_RULE> rules = RuleSet(0);
  // The library learns where the router is from a first save of one rule.
  std::vector<ZARK_ROUTER_RULE> one(rules.begin(), rules.begin() + 1);
  std::string why;
  if (!ClearRouter(why) || !Save(one, why)) {
    state.SkipWithError(why.c_str());
    Figures(CaseKey("from_nothing", std::chrono::milliseconds(state.range(0))))
        .failure = why;
    return;
  }
  RunCase(
      state, "from_nothing", kMappings,
      [](int, std::string &why) { return ClearRouter(why); },
      [&](int, std::string &why) { return Save(rules, why); },
      [](int) { return WantedOf(0); });
}

// The same without the relay (no delay): what its extra hop costs.
void BM_FromNothingDirect(benchmark::State &state) {
  std::vector<ZARK_ROUTER_RULE> rules = RuleSet(0);
  std::vector<ZARK_ROUTER_RULE> one(rules.begin(), rules.begin() + 1);
  std::string why;
  if (!ClearRouter(why) || !Save(one, why)) {
    state.SkipWithError(why.c_str());
    Figures(CaseKey("from_nothing (no relay)",
                    std::chrono::milliseconds(state.range(0))))
        .failure = why;
    return;
  }
  RunCase(
      state, "from_nothing (no relay)", kMappings,
      [](int, std::string &why) { return ClearRouter(why); },
      [&](int, std::string &why) { return Save(rules, why); },
      [](int) { return WantedOf(0); }, true);
}

std::vector<std::string> UpnpcAdd(int port, const char *protocol) {
  return {kUpnpc, "-u", gNet->rootDesc, "-r", std::to_string(port), protocol};
}

bool UpnpcLoop(std::string &why) {
  for (int i = 0; i < kRules; ++i) {
    for (const char *protocol : {"TCP", "UDP"}) {
      const int status =
          RunQuiet(UpnpcAdd(kFirstPort + i, protocol), kToolTimeout);
      if (status != 0) {
        why = "upnpc -r " + std::to_string(kFirstPort + i) + " " + protocol +
              " ended with " + std::to_string(status);
        return false;
      }
    }
  }
  return true;
}

void BM_UpnpcLoop(benchmark::State &state) {
  RunCase(
      state, "upnpc_loop", kMappings,
      [](int, std::string &why) { return ClearRouter(why); },
      [](int, std::string &why) { return UpnpcLoop(why); },
      [](int) { return WantedOf(0); });
}

void BM_UpnpcLoopDirect(benchmark::State &state) {
  RunCase(
      state, "upnpc_loop (no relay)", kMappings,
      [](int, std::string &why) { return ClearRouter(why); },
      [](int, std::string &why) { return UpnpcLoop(why); },
      [](int) { return WantedOf(0); }, true);
}

void BM_UpnpcOneCall(benchmark::State &state) {
  std::vector<std::string> args = {kUpnpc, "-u", gNet->rootDesc, "-r"};
  for (int i = 0; i < kRules; ++i) {
    for (const char *protocol : {"TCP", "UDP"}) {
      args.push_back(std::to_string(kFirstPort + i));
      args.push_back(protocol);
    }
  }
  RunCase(
      state, "upnpc_one_call", kMappings,
      [](int, std::string &why) { return ClearRouter(why); },
      [&](int, std::string &why) {
        const int status = RunQuiet(args, kToolTimeout);
        if (status != 0) {
          why = "upnpc -r with 200 pairs ended with " + std::to_string(status);
        }
        return status == 0;
      },
      [](int) { return WantedOf(0); });
}

void BM_Unchanged(benchmark::State &state) {
  std::vector<ZARK_ROUTER_RULE> rules = RuleSet(0);
  std::string why;
  if (!ClearRouter(why) || !Save(rules, why)) {
    state.SkipWithError(why.c_str());
    Figures(CaseKey("unchanged", std::chrono::milliseconds(state.range(0))))
        .failure = why;
    return;
  }
  RunCase(
      state, "unchanged", 0, NoPreparation,
      [&](int, std::string &why) { return Save(rules, why); },
      [](int) { return WantedOf(0); });
}

// range(0): delay, range(1): rules changed per iteration.
void BM_Change(benchmark::State &state) {
  const int changes = static_cast<int>(state.range(1));
  std::vector<ZARK_ROUTER_RULE> original = RuleSet(0);
  std::vector<ZARK_ROUTER_RULE> changed = RuleSet(changes);
  const std::string name = "change/" + std::to_string(changes);
  std::string why;
  if (!ClearRouter(why) || !Save(original, why)) {
    state.SkipWithError(why.c_str());
    Figures(CaseKey(name, std::chrono::milliseconds(state.range(0)))).failure =
        why;
    return;
  }
  // Even iterations move the rules, odd ones move them back.
  RunCase(
      state, name, 2 * changes, NoPreparation,
      [&](int iteration, std::string &why) {
        return Save(iteration % 2 == 0 ? changed : original, why);
      },
      [changes](int iteration) {
        return WantedOf(iteration % 2 == 0 ? changes : 0);
      });
}

void Register() {
  for (auto *b : {benchmark::RegisterBenchmark("BM_FromNothingDirect/no_relay",
                                               BM_FromNothingDirect),
                  benchmark::RegisterBenchmark("BM_UpnpcLoopDirect/no_relay",
                                               BM_UpnpcLoopDirect)}) {
    b->Arg(0)
        ->Iterations(kIterations)
        ->UseManualTime()
        ->Unit(benchmark::kMillisecond);
  }
  for (int delay : kDelaysMs) {
    const std::string suffix = "/delay_ms:" + std::to_string(delay);
    auto setUp = [&](benchmark::internal::Benchmark *b) {
      b->Arg(delay)
          ->Iterations(kIterations)
          ->UseManualTime()
          ->Unit(benchmark::kMillisecond);
    };
    setUp(benchmark::RegisterBenchmark(("BM_FirstSave" + suffix).c_str(),
                                       BM_FirstSave));
    setUp(benchmark::RegisterBenchmark(("BM_FromNothing" + suffix).c_str(),
                                       BM_FromNothing));
    setUp(benchmark::RegisterBenchmark(("BM_UpnpcLoop" + suffix).c_str(),
                                       BM_UpnpcLoop));
    setUp(benchmark::RegisterBenchmark(("BM_UpnpcOneCall" + suffix).c_str(),
                                       BM_UpnpcOneCall));
    setUp(benchmark::RegisterBenchmark(("BM_Unchanged" + suffix).c_str(),
                                       BM_Unchanged));
    for (int changes : {1, 10, 50}) {
      benchmark::RegisterBenchmark(
          ("BM_Change" + suffix + "/changes:" + std::to_string(changes))
              .c_str(),
          BM_Change)
          ->Args({delay, changes})
          ->Iterations(kIterations)
          ->UseManualTime()
          ->Unit(benchmark::kMillisecond);
    }
  }
}

// ---------------------------------------------------------------------------
// The summary

std::string Milliseconds(const std::vector<Sample> &samples) {
  double low = 1e300;
  double high = 0;
  for (const Sample &sample : samples) {
    low = std::min(low, sample.seconds);
    high = std::max(high, sample.seconds);
  }
  char text[64];
  std::snprintf(text, sizeof(text), "%.0f (%.0f-%.0f)",
                1000 * Mean(samples, [](const Sample &s) { return s.seconds; }),
                1000 * low, 1000 * high);
  return text;
}

// "AddPortMapping 200 (8.1 ms)": requests of each kind and the router's
// mean time for one, delay excluded.
std::string Actions(const RelayCounts &counts) {
  std::string text;
  for (const auto &[action, count] : counts.byAction) {
    auto seconds = counts.routerSecondsByAction.find(action);
    char each[32] = "";
    if (seconds != counts.routerSecondsByAction.end() && count > 0) {
      std::snprintf(each, sizeof(each), " (%.1f ms)",
                    1000 * seconds->second / count);
    }
    text += (text.empty() ? "" : ", ") + action + " " + std::to_string(count) +
            each;
  }
  return text.empty() ? "none" : text;
}

const CaseFigures *Find(const std::string &name, int delay) {
  auto found = gFigures.find(CaseKey(name, std::chrono::milliseconds(delay)));
  return found == gFigures.end() || found->second.samples.empty() ||
                 !found->second.failure.empty()
             ? nullptr
             : &found->second;
}

double MeanSeconds(const CaseFigures &figures) {
  return Mean(figures.samples, [](const Sample &s) { return s.seconds; });
}

void PrintSummary() {
  std::printf("\n## Rule-apply figures\n\n"
              "%d rules, TCP and UDP each (%d mappings), miniupnpd in the "
              "test network; mean of %d runs (min-max); requests counted by "
              "the relay, router = connections counted on the router.\n\n",
              kRules, kMappings, kIterations);
  std::printf("| case | delay/request | wall time ms | requests | router | "
              "SSDP | max in flight | requests by kind |\n"
              "|---|---|---|---|---|---|---|---|\n");
  for (const std::string &key : gCaseOrder) {
    const CaseFigures &figures = gFigures[key];
    const std::size_t at = key.find(" @");
    if (!figures.failure.empty() || figures.samples.empty()) {
      std::printf("| %s | %s | FAILED: %s |||||| \n", key.substr(0, at).c_str(),
                  key.substr(at + 2).c_str(), figures.failure.c_str());
      continue;
    }
    const Sample &last = figures.samples.back();
    char relayed[32] = "-";
    char inFlight[16] = "-";
    std::string kinds = "(no relay: not seen)";
    if (!figures.direct) {
      std::snprintf(relayed, sizeof(relayed), "%.1f", MeanRequests(figures));
      std::snprintf(inFlight, sizeof(inFlight), "%d",
                    MaxInFlight(figures.samples));
      kinds = Actions(last.relay);
    }
    std::printf("| %s | %s | %s | %s | %.1f | %.1f | %s | %s |\n",
                key.substr(0, at).c_str(), key.substr(at + 2).c_str(),
                Milliseconds(figures.samples).c_str(), relayed,
                Mean(figures.samples,
                     [](const Sample &s) {
                       return static_cast<double>(s.router.http);
                     }),
                Mean(figures.samples,
                     [](const Sample &s) {
                       return static_cast<double>(s.router.ssdp);
                     }),
                inFlight, kinds.c_str());
  }

  std::printf("\n## Targets\n");
  for (int delay : kDelaysMs) {
    bool any = false;
    for (const auto &[key, figures] : gFigures) {
      any = any || key.ends_with(CaseKey("", std::chrono::milliseconds(delay)));
    }
    if (!any) {
      continue;
    }
    std::printf("\ndelay %d ms per request:\n", delay);
    const CaseFigures *ours = Find("from_nothing", delay);
    const CaseFigures *loop = Find("upnpc_loop", delay);
    const CaseFigures *oursDirect = Find("from_nothing (no relay)", delay);
    const CaseFigures *loopDirect = Find("upnpc_loop (no relay)", delay);
    if (oursDirect != nullptr && loopDirect != nullptr) {
      std::printf("- without the relay: from nothing %.0f ms (%.0f "
                  "requests) vs upnpc loop %.0f ms (%.0f requests), %.2fx\n",
                  1000 * MeanSeconds(*oursDirect), MeanRequests(*oursDirect),
                  1000 * MeanSeconds(*loopDirect), MeanRequests(*loopDirect),
                  MeanSeconds(*loopDirect) / MeanSeconds(*oursDirect));
    }
    if (ours != nullptr) {
      const double requests = MeanRequests(*ours);
      const double perMapping = requests / kMappings;
      const double over = requests - 2.0 * kMappings;
      char verdict[160];
      if (over <= 0) {
        std::snprintf(verdict, sizeof(verdict), "met");
      } else {
        std::snprintf(verdict, sizeof(verdict), "over by %.0f per save", over);
      }
      std::printf("- from nothing: %.0f requests for %d mappings, %.3f per "
                  "mapping (target <= 2): %s [%s]\n",
                  requests, kMappings, perMapping, verdict,
                  Actions(ours->samples.back().relay).c_str());
      std::printf("- from nothing: most requests in flight %d (target 1): "
                  "%s\n",
                  MaxInFlight(ours->samples),
                  MaxInFlight(ours->samples) <= 1 ? "met" : "MISSED");
    }
    if (ours != nullptr && loop != nullptr) {
      const double ratio = MeanSeconds(*loop) / MeanSeconds(*ours);
      std::printf("- from nothing vs upnpc loop: %.0f ms vs %.0f ms, %.2fx "
                  "faster (target >= 2): %s\n",
                  1000 * MeanSeconds(*ours), 1000 * MeanSeconds(*loop), ratio,
                  ratio >= 2.0 ? "met" : "MISSED");
    }
    if (const CaseFigures *one = Find("upnpc_one_call", delay);
        ours != nullptr && one != nullptr) {
      std::printf("- from nothing vs one upnpc call for all: %.0f ms vs %.0f "
                  "ms, %.2fx\n",
                  1000 * MeanSeconds(*ours), 1000 * MeanSeconds(*one),
                  MeanSeconds(*one) / MeanSeconds(*ours));
    }
    if (const CaseFigures *first = Find("first_save", delay)) {
      std::printf("- first save (SSDP discovery first): %.0f ms, %.1f "
                  "requests, %.1f SSDP packets\n",
                  1000 * MeanSeconds(*first), MeanRequests(*first),
                  Mean(first->samples, [](const Sample &s) {
                    return static_cast<double>(s.router.ssdp);
                  }));
    }
    if (const CaseFigures *same = Find("unchanged", delay)) {
      std::printf("- unchanged: %.1f requests (target <= 2): %s\n",
                  MeanRequests(*same),
                  MeanRequests(*same) <= 2.0 ? "met" : "MISSED");
    }
    for (int changes : {1, 10, 50}) {
      if (const CaseFigures *change =
              Find("change/" + std::to_string(changes), delay)) {
        std::printf("- %d changed rules (%d mappings): %.1f requests, %.2f "
                    "per changed mapping, most in flight %d\n",
                    changes, 2 * changes, MeanRequests(*change),
                    MeanRequests(*change) / (2 * changes),
                    MaxInFlight(change->samples));
      }
    }
  }
  std::fflush(stdout);
}

bool ParseRootDescription(const std::string &url, std::string &host,
                          uint16_t &port) {
  // "http://192.168.77.1:5000/rootDesc.xml"
  constexpr std::string_view kScheme = "http://";
  std::string_view rest(url);
  if (!rest.starts_with(kScheme)) {
    return false;
  }
  rest.remove_prefix(kScheme.size());
  const std::size_t colon = rest.find(':');
  const std::size_t slash = rest.find('/');
  if (colon == std::string_view::npos || slash == std::string_view::npos ||
      slash < colon) {
    return false;
  }
  host = std::string(rest.substr(0, colon));
  auto [end, error] =
      std::from_chars(rest.data() + colon + 1, rest.data() + slash, port);
  return error == std::errc() && end == rest.data() + slash && port != 0;
}

} // namespace

int main(int argc, char **argv) {
  gNet = zark::testnet::CurrentNetwork();
  if (!gNet) {
    std::fprintf(stderr, "run me through scripts/bench-apply.sh\n");
    return 2;
  }
  std::string why;
  if (!zark::test::EnterPrivateMountNamespace(&why)) {
    std::fprintf(stderr, "private mount namespace: %s\n", why.c_str());
    return 2;
  }
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
    return 2;
  }
  std::string routerHost;
  uint16_t httpPort = 0;
  if (!ParseRootDescription(gNet->rootDesc, routerHost, httpPort)) {
    std::fprintf(stderr, "cannot read the root description URL %s\n",
                 gNet->rootDesc.c_str());
    return 2;
  }
  sockaddr_in upstream{};
  upstream.sin_family = AF_INET;
  upstream.sin_port = htons(httpPort);
  if (::inet_pton(AF_INET, routerHost.c_str(), &upstream.sin_addr) != 1) {
    return 2;
  }
  gRelay = CountingRelay::Start(upstream, kRelayMark, why);
  gRouterHost = routerHost;
  gHttpPort = httpPort;
  if (!gRelay || !InstallRedirect(why) || !InstallRouterCounters(why)) {
    std::fprintf(stderr, "setting up the counting: %s\n", why.c_str());
    return 2;
  }

  // The relay must see what the router gets: one upnpc call through both.
  Sample check;
  std::string output;
  if (!Timed(
          std::chrono::milliseconds(0),
          [&](std::string &w) {
            return RunTool({kUpnpc, "-u", gNet->rootDesc, "-s"}, output, w);
          },
          check, why)) {
    std::fprintf(stderr, "upnpc -s through the relay: %s\n", why.c_str());
    return 2;
  }
  if (check.relay.requests == 0 || check.relay.requests != check.router.http) {
    std::fprintf(stderr,
                 "the relay counted %d requests, the router %lld "
                 "connections: the redirect does not work\n",
                 check.relay.requests, check.router.http);
    return 2;
  }

  // The router, as the module stores it after detection, with room for the
  // 200 mappings (the generic database entry allows 128 in all).
  ZARK_ROUTER_CONF conf{};
  CopyText(conf.brand, "Generic");
  CopyText(conf.model, "UPnP IGD");
  CopyText(conf.version, "generic");
  CopyText(conf.support_upnp, "yes");
  CopyText(conf.support_natpmp, "no");
  CopyText(conf.max_rule, "256");
  ZARK_LIBZARKPORTMAP_ERR err{0};
  if (KLibSetRouterConf(gNet->lanRouter.c_str(), &conf, &err, false) != 0) {
    std::fprintf(stderr, "KLibSetRouterConf failed: %d\n", err.err);
    return 2;
  }

  Register();
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  PrintSummary();

  int status = 0;
  for (const auto &[key, figures] : gFigures) {
    if (!figures.failure.empty()) {
      status = 1;
    }
  }
  if (!ClearRouter(why)) {
    std::fprintf(stderr, "clearing the router at the end: %s\n", why.c_str());
    status = 1;
  }
  RemoveNftTables();
  gRelay.reset();
  return status;
}
