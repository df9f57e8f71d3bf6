// The reachability test of 20 rules (KLibTestRulesInit + KLibTestRules) in
// the test network: the real miniupnpd router forwarding the rules (TCP
// and UDP alternately), the probe service zark-probed on the outside host
// checking each port with a one-time token through the router. Every rule
// forwarded; the TCP half not forwarded; the UDP half not forwarded. (A
// router that drops unforwarded TCP would cost the probe's 3 s connect
// timeout per check, eight checks at a time.)
//
//   testnet/testnet.sh run ./bin/zark_bench_porttest [--benchmark_...]
//   (as root; the benchmark enters its private mount namespace itself)
#include "hermetic.h"
#include "klibc.h"
#include "libzarkportmap.h"
#include "test_network.h"

#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstring>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace {

constexpr int kRules = 20;
constexpr uint16_t kProbePort = 7777;

std::vector<ZARK_ROUTER_RULE> gForwarded;
std::vector<ZARK_ROUTER_RULE> gTcpHalfForwarded;
std::vector<ZARK_ROUTER_RULE> gUdpHalfForwarded;

ZARK_ROUTER_RULE Rule(int index, const char *protocol, int routerPort,
                      int localPort) {
  ZARK_ROUTER_RULE rule{};
  std::snprintf(rule.rule_id, sizeof(rule.rule_id), "%d", index);
  rule.enable = 1;
  std::snprintf(rule.router_protocol, sizeof(rule.router_protocol), "%s",
                protocol);
  std::snprintf(rule.router_port, sizeof(rule.router_port), "%d", routerPort);
  std::snprintf(rule.ds_port, sizeof(rule.ds_port), "%d", localPort);
  return rule;
}

// Counts the lines of the status file that say reachable.
int Reachable() {
  int count = 0;
  char line[ZARK_PORTMAP_TEXT_SIZE * 2];
  FILE *file = std::fopen(ZARK_PORTMAP_TEST_STATUS, "r");
  if (file == nullptr) {
    return -1;
  }
  while (std::fgets(line, sizeof(line), file) != nullptr) {
    const char *equals = std::strchr(line, '=');
    if (equals != nullptr && std::strcmp(equals + 1, "reachable\n") == 0) {
      ++count;
    }
  }
  std::fclose(file);
  return count;
}

void RunTest(benchmark::State &state, std::vector<ZARK_ROUTER_RULE> &rules,
             int expectReachable) {
  for (auto _ : state) {
    if (KLibTestRulesInit() != 0 ||
        KLibTestRules(static_cast<int>(rules.size()), rules.data(), nullptr,
                      false) != 0) {
      state.SkipWithError("the reachability test failed");
      break;
    }
    state.PauseTiming();
    const int reachable = Reachable();
    state.ResumeTiming();
    if (reachable != expectReachable) {
      state.SkipWithError(("reachable: " + std::to_string(reachable) +
                           ", expected " + std::to_string(expectReachable))
                              .c_str());
      break;
    }
  }
  state.counters["rules"] = static_cast<double>(rules.size());
}

void BM_ReachabilityTest20RulesForwarded(benchmark::State &state) {
  RunTest(state, gForwarded, kRules);
}
BENCHMARK(BM_ReachabilityTest20RulesForwarded)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime();

// The 10 TCP rules not forwarded: the router refuses each connection at
// once.
void BM_ReachabilityTest20RulesTcpHalfForwarded(benchmark::State &state) {
  RunTest(state, gTcpHalfForwarded, kRules / 2);
}
BENCHMARK(BM_ReachabilityTest20RulesTcpHalfForwarded)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime();

// The 10 UDP rules not forwarded: the router's ICMP answers are rate
// limited, so most checks end at the probe's 2 s answer timeout (in
// parallel).
void BM_ReachabilityTest20RulesUdpHalfForwarded(benchmark::State &state) {
  RunTest(state, gUdpHalfForwarded, kRules / 2);
}
BENCHMARK(BM_ReachabilityTest20RulesUdpHalfForwarded)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime();

} // namespace

int main(int argc, char **argv) {
  std::optional<zark::testnet::TestNetwork> network =
      zark::testnet::CurrentNetwork();
  if (!network) {
    std::fprintf(stderr, "run me through testnet/testnet.sh run\n");
    return 2;
  }
  std::string why;
  if (!zark::test::EnterPrivateMountNamespace(&why)) {
    std::fprintf(stderr, "private mount namespace: %s\n", why.c_str());
    return 2;
  }
  // A probe service that lets this one requester ask as often as the
  // benchmark does.
  zark::testnet::OutsideProcess probe(
      *network,
      {ZARK_PROBED_PATH, "--listen",
       network->wanOutside + ":" + std::to_string(kProbePort), "--rate",
       "100000", "--burst", "100000", "--max-per-address", "64", "--quiet"});
  if (!probe.WaitForTcp(network->wanOutside, kProbePort)) {
    std::fprintf(stderr, "zark-probed does not listen on the outside host\n");
    return 2;
  }
  const std::string probeAddress =
      network->wanOutside + ":" + std::to_string(kProbePort);
  if (KLIBCFileSetKeyValue(ZARK_PORTMAP_CONF_DIR "/portmap.conf",
                           "probe_service_address", probeAddress.c_str(),
                           0) != 0) {
    std::fprintf(stderr, "cannot configure the probe service\n");
    return 2;
  }
  ZARK_ROUTER_CONF conf{};
  std::strcpy(conf.brand, "Generic");
  std::strcpy(conf.model, "UPnP IGD");
  std::strcpy(conf.version, "generic");
  std::strcpy(conf.support_upnp, "yes");
  std::strcpy(conf.support_natpmp, "no");
  ZARK_LIBZARKPORTMAP_ERR err{0};
  if (KLibSetRouterConf(network->lanRouter.c_str(), &conf, &err, false) != 0) {
    std::fprintf(stderr, "cannot store the router configuration (%d)\n",
                 err.err);
    return 2;
  }
  // 20 rules on the router, TCP and UDP alternately.
  for (int i = 0; i < kRules; ++i) {
    gForwarded.push_back(
        Rule(i, i % 2 == 0 ? "tcp" : "udp", 20100 + i, 10100 + i));
  }
  ZARK_ROUTER_SAVE_RULE_RESULT saved{};
  if (KLibSaveRules(network->lanRouter.c_str(), kRules, gForwarded.data(),
                    false, &saved, nullptr, nullptr) != 0) {
    std::fprintf(stderr, "cannot apply the rules (%u: %s)\n", saved.errType,
                 saved.detail.text);
    return 2;
  }
  // The same rules, with the TCP ones (or the UDP ones) moved to router
  // ports that are not forwarded.
  gTcpHalfForwarded = gForwarded;
  gUdpHalfForwarded = gForwarded;
  for (int i = 0; i < kRules; ++i) {
    std::vector<ZARK_ROUTER_RULE> &moved =
        i % 2 == 0 ? gTcpHalfForwarded : gUdpHalfForwarded;
    std::snprintf(moved[i].router_port, sizeof(moved[i].router_port), "%d",
                  21100 + i);
  }
  benchmark::Initialize(&argc, argv);
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
