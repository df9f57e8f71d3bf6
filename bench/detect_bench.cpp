// A full router detection (KLibDetectRouter, all six checks) in the test
// network: the real miniupnpd router, a name server and a WAN probe host
// on the outside host, with the time of each check as counters. Also the
// external address as ZARKIGetExternalIP finds it with nothing configured
// (a quick probe of the router). The time of one detection in a fresh
// network is printed first.
//
//   testnet/testnet.sh run ./bin/zark_bench_detect [--benchmark_...]
//   (as root; the benchmark enters its private mount namespace itself)
#include "detect_support.h"
#include "hermetic.h"
#include "libzarkportmap.h"
#include "outside_services.h"
#include "test_network.h"
#include "zarknet.h"

#include <benchmark/benchmark.h>

#include <chrono>
#include <cstdio>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace {

std::optional<zark::testnet::TestNetwork> gNetwork;

using Clock = std::chrono::steady_clock;

// When each stage was announced, to split a run's time by check.
struct StageTimes {
  std::vector<std::pair<int32_t, Clock::time_point>> seen;
};

void RecordStage(ZARK_ROUTER_DETECT_RESULT *result, void *arg) {
  static_cast<StageTimes *>(arg)->seen.emplace_back(result->enProgress,
                                                    Clock::now());
}

// The check that each stage starts, for the counters.
const char *CheckOfStage(int32_t stage) {
  switch (stage) {
  case ZARK_DETECT_STAGE_START:
    return "start_ms";
  case ZARK_DETECT_STAGE_INTERFACE:
    return "interface_ms";
  case ZARK_DETECT_STAGE_GATEWAY:
    return "gateway_ms";
  case ZARK_DETECT_STAGE_WAN:
    return "wan_ms";
  case ZARK_DETECT_STAGE_HOPS:
    return "hops_ms";
  case ZARK_DETECT_STAGE_DNS:
    return "dns_ms";
  case ZARK_DETECT_STAGE_ROUTER:
    return "router_ms";
  default:
    return nullptr;
  }
}

void BM_DetectRouter(benchmark::State &state) {
  ZARK_ROUTER_DETECT_RESULT result{};
  std::map<std::string, double> perCheck;
  for (auto _ : state) {
    StageTimes times;
    const int rc = KLibDetectRouter(&result, RecordStage, &times, true);
    if (rc != 0) {
      state.SkipWithError(
          ("detection stopped at stage " + std::to_string(result.enProgress))
              .c_str());
      break;
    }
    for (std::size_t i = 0; i + 1 < times.seen.size(); ++i) {
      if (const char *check = CheckOfStage(times.seen[i].first)) {
        perCheck[check] += std::chrono::duration<double, std::milli>(
                               times.seen[i + 1].second - times.seen[i].second)
                               .count();
      }
    }
    benchmark::DoNotOptimize(result);
  }
  for (const auto &[check, total] : perCheck) {
    state.counters[check] =
        benchmark::Counter(total, benchmark::Counter::kAvgIterations);
  }
}
BENCHMARK(BM_DetectRouter)->Unit(benchmark::kMillisecond)->UseRealTime();

void BM_ExternalAddressUnconfigured(benchmark::State &state) {
  for (auto _ : state) {
    const uint32_t address = ZARKIGetExternalIP();
    if (address == 0) {
      state.SkipWithError("no external address");
      break;
    }
    benchmark::DoNotOptimize(address);
  }
}
BENCHMARK(BM_ExternalAddressUnconfigured)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime();

} // namespace

int main(int argc, char **argv) {
  gNetwork = zark::testnet::CurrentNetwork();
  if (!gNetwork) {
    std::fprintf(stderr, "run me through testnet/testnet.sh run\n");
    return 2;
  }
  std::string why;
  if (!zark::test::EnterPrivateMountNamespace(&why)) {
    std::fprintf(stderr, "private mount namespace: %s\n", why.c_str());
    return 2;
  }
  if (!zark::integration::ConfigureDetection(*gNetwork, why)) {
    std::fprintf(stderr, "%s\n", why.c_str());
    return 2;
  }
  zark::integration::OutsideServices outside(
      *gNetwork, zark::integration::kDetectProbeName, gNetwork->wanOutside,
      zark::integration::kWanProbePort, std::chrono::seconds(600));
  if (!outside.Running()) {
    std::fprintf(stderr, "outside services: %s\n", outside.Why().c_str());
    return 2;
  }
  // One detection as a user starts it: in a fresh network.
  {
    ZARK_ROUTER_DETECT_RESULT result{};
    StageTimes times;
    const Clock::time_point start = Clock::now();
    const int rc = KLibDetectRouter(&result, RecordStage, &times, true);
    const double ms =
        std::chrono::duration<double, std::milli>(Clock::now() - start).count();
    std::printf("first detection in a fresh test network: %.1f ms (result "
                "%d, stage %d)\n",
                ms, rc, result.enProgress);
  }
  // Back-to-back runs would otherwise time the kernel's ICMP rate limit
  // (per peer: a burst of 6, then one message a second) on the router and
  // the outside host, which answer the hop probes; a user starts one
  // detection at a time.
  for (const std::string &ns : {gNetwork->routerNs, gNetwork->outsideNs}) {
    std::string output;
    if (zark::testnet::RunTool({"/usr/sbin/ip", "netns", "exec", ns,
                                "/usr/sbin/sysctl", "-qw",
                                "net.ipv4.icmp_ratelimit=0"},
                               output) != 0) {
      std::fprintf(stderr, "cannot lift the ICMP rate limit in %s: %s\n",
                   ns.c_str(), output.c_str());
      return 2;
    }
  }
  benchmark::Initialize(&argc, argv);
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
