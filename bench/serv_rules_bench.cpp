// Service rules over a large rule set: SetServPfRules with a policy that
// adds 100 services and removes 100 others, over 2,000 saved rules, and the
// forwarding status of every service over the same rules.
//
//   ./bin/zark_bench_serv [--benchmark_...]   (as root)
#include "RouterRuleServHandler.h"
#include "hermetic.h"
#include "libzarkportmap.h"
#include "zarkfw.h"

#include <benchmark/benchmark.h>

#include <cstdio>
#include <filesystem>
#include <random>
#include <string>

namespace {

constexpr int kSavedRules = 2000;
constexpr int kPolicyServices = 100; // added, and as many removed

std::string ServiceId(int i) {
  char id[16];
  snprintf(id, sizeof(id), "svc%03d", i);
  return id;
}

// 2 * kPolicyServices system services, each with one to three sections
// of single ports and ranges, in the same port area as the saved rules so
// that the rewrite has conflicts to resolve; plus the shipped services.
void WriteServices(std::mt19937 &rng) {
  namespace fs = std::filesystem;
  for (const auto &entry : fs::directory_iterator(
           std::string(ZARK_FIREWALL_DATA_DIR) + "/services.d")) {
    zark::test::WriteFile(std::string(ZARK_FW_SYSTEM_SERVICE_DIR) + "/" +
                              entry.path().filename().string(),
                          zark::test::ReadFile(entry.path().string()));
  }
  zark::test::WriteFile(ZARK_FW_SERVICE_MAPPING_TABLE, "# none\n");
  std::uniform_int_distribution<int> port(10000, 40000);
  std::uniform_int_distribution<int> sections(1, 3);
  std::uniform_int_distribution<int> width(0, 20);
  const char *protocols[] = {"tcp", "udp", "both"};
  for (int i = 0; i < 2 * kPolicyServices; ++i) {
    std::string text;
    int count = sections(rng);
    for (int s = 0; s < count; ++s) {
      int first = port(rng);
      int w = width(rng);
      std::string ports = std::to_string(first);
      if (w > 10) {
        ports += "-" + std::to_string(first + w);
      }
      ports += "," + std::to_string(port(rng));
      text += "[" + ServiceId(i) + "_" + std::to_string(s) +
              "]\nprotocol=" + protocols[(i + s) % 3] + "\nports=" + ports +
              "\n";
    }
    zark::test::WriteFile(std::string(ZARK_FW_SYSTEM_SERVICE_DIR) + "/" +
                              ServiceId(i) + ".sc",
                          text);
  }
}

// kSavedRules rules: single ports and ranges (router = local), single-port
// mappings to another local port, some disabled, TCP and UDP.
bool WriteSavedRules(std::mt19937 &rng) {
  std::uniform_int_distribution<int> port(10000, 40000);
  std::uniform_int_distribution<int> kind(0, 9);
  RouterRuleConfWriter writer;
  for (int i = 0; i < kSavedRules; ++i) {
    int first = port(rng);
    int k = kind(rng);
    std::string router = std::to_string(first);
    std::string local = router;
    if (k < 4) {
      router += "-" + std::to_string(first + 1 + k * 5);
      local = router;
    } else if (k == 4) {
      router = std::to_string(port(rng));
    } else if (k == 5) {
      router += "," + std::to_string(first + 100);
      local = router;
    }
    if (!writer.AddRule(i, k != 9, router, local, (i % 2) ? "tcp" : "udp",
                        "user", "")) {
      return false;
    }
  }
  return writer.Sync(ZARK_PORTMAP_RULE_CONF);
}

Json::Value Policy() {
  Json::Value policy(Json::objectValue);
  policy["add"] = Json::Value(Json::arrayValue);
  policy["remove"] = Json::Value(Json::arrayValue);
  for (int i = 0; i < kPolicyServices; ++i) {
    policy["add"].append(ServiceId(i));
    policy["remove"].append(ServiceId(kPolicyServices + i));
  }
  return policy;
}

void BM_SetServPfRules(benchmark::State &state) {
  const Json::Value policy = Policy();
  size_t rules = 0;
  for (auto _ : state) {
    RouterRuleServHandler handler;
    RouterRuleConfWriter writer;
    if (handler.SetServPfRules(policy, writer) != 0) {
      state.SkipWithError("SetServPfRules failed");
      break;
    }
    rules = writer.Rules().size();
    benchmark::DoNotOptimize(rules);
  }
  state.counters["rules_written"] = static_cast<double>(rules);
}
BENCHMARK(BM_SetServPfRules)->Unit(benchmark::kMillisecond);

void BM_GetServPfStatusAll(benchmark::State &state) {
  const Json::Value all(Json::arrayValue);
  Json::ArrayIndex services = 0;
  for (auto _ : state) {
    RouterRuleServHandler handler;
    Json::Value out(Json::arrayValue);
    handler.GetServPfStatus(all, out);
    if (out.size() == 0) {
      state.SkipWithError("GetServPfStatus answered nothing");
      break;
    }
    services = out.size();
    benchmark::DoNotOptimize(out);
  }
  state.counters["services"] = services;
}
BENCHMARK(BM_GetServPfStatusAll)->Unit(benchmark::kMillisecond);

// The two fixed costs under both operations, for reading the figures above.
void BM_FirewallTable(benchmark::State &state) {
  for (auto _ : state) {
    ZARK_FW_SERVICE_TABLE *table = nullptr;
    int sections = ZARKFwServiceEnum(&table);
    benchmark::DoNotOptimize(sections);
    ZARKFwServiceFree(table);
  }
}
BENCHMARK(BM_FirewallTable)->Unit(benchmark::kMillisecond);

void BM_ReadSavedRules(benchmark::State &state) {
  for (auto _ : state) {
    RouterRuleConfReader reader(false);
    benchmark::DoNotOptimize(reader.Rules().size());
  }
}
BENCHMARK(BM_ReadSavedRules)->Unit(benchmark::kMillisecond);

} // namespace

int main(int argc, char **argv) {
  benchmark::Initialize(&argc, argv);
  std::string error;
  if (!zark::test::EnterPrivateMountNamespace(&error)) {
    fprintf(stderr,
            "cannot enter a private mount namespace (%s); run as root\n",
            error.c_str());
    return 1;
  }
  std::mt19937 rng(20240611);
  WriteServices(rng);
  if (!WriteSavedRules(rng)) {
    fprintf(stderr, "cannot write the saved rules\n");
    return 1;
  }
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
