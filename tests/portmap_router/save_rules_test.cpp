// Applying rules (KLibSaveRules, ApplyRules) to the fake routers: the
// difference against what the library remembers, progress, the saved rule
// configuration, failures that leave a truthful state for the next save.
// HERMETIC: real files under /etc/portforward and /tmp in a private mount
// namespace.
#include "apply/save_rules.h"

#include "RouterRuleConf.h"
#include "catalog/mapping_state.h"
#include "catalog/router_conf_store.h"
#include "drivers/driver_choice.h"
#include "fake_igd.h"
#include "fake_natpmp.h"
#include "hermetic.h"
#include "libzarkportmap.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstring>
#include <string>
#include <vector>

namespace zark::portmap {
namespace {

using test::FakeIgd;
using test::FakeNatPmp;
using test::HttpReply;
using test::SoapRequest;

const char *const kGateway = "127.0.0.1";
const std::vector<Ipv4Network> kLoopback = {{0x7f000000u, 0xff000000u}};

ZARK_ROUTER_RULE Rule(const std::string &id, const std::string &protocol,
                      const std::string &routerPort, const std::string &dsPort,
                      bool enable = true) {
  ZARK_ROUTER_RULE rule{};
  std::strncpy(rule.rule_id, id.c_str(), sizeof(rule.rule_id) - 1);
  rule.enable = enable ? 1 : 0;
  std::strncpy(rule.router_protocol, protocol.c_str(),
               sizeof(rule.router_protocol) - 1);
  std::strncpy(rule.router_port, routerPort.c_str(),
               sizeof(rule.router_port) - 1);
  std::strncpy(rule.ds_port, dsPort.c_str(), sizeof(rule.ds_port) - 1);
  std::strncpy(rule.serviceid, "svc", sizeof(rule.serviceid) - 1);
  return rule;
}

void StoreConf(const std::string &upnp, const std::string &natpmp,
               const std::string &connType = "", const std::string &max = "") {
  ZARK_ROUTER_CONF conf{};
  std::strcpy(conf.brand, "Generic");
  std::strcpy(conf.model, "Test");
  std::strcpy(conf.version, "generic");
  std::strncpy(conf.support_upnp, upnp.c_str(), sizeof(conf.support_upnp) - 1);
  std::strncpy(conf.support_natpmp, natpmp.c_str(),
               sizeof(conf.support_natpmp) - 1);
  std::strncpy(conf.conn_type, connType.c_str(), sizeof(conf.conn_type) - 1);
  std::strncpy(conf.max_rule, max.c_str(), sizeof(conf.max_rule) - 1);
  int err = 0;
  ASSERT_TRUE(StoreRouterConfForGateway(kGateway, conf, err)) << err;
}

// Every callback: the percentage and the progress file's line at that
// moment.
struct Progress {
  std::vector<int> percentages;
  std::vector<std::string> lines;
  std::vector<int> runningTasks;
};

void RecordProgress(ZARK_ROUTER_SAVE_RULE_RESULT *result, void *arg) {
  auto *progress = static_cast<Progress *>(arg);
  progress->percentages.push_back(result->percentage);
  std::string line = test::ReadFile(ZARK_PORTMAP_APPLY_PROGRESS);
  if (!line.empty() && line.back() == '\n') {
    line.pop_back();
  }
  progress->lines.push_back(line);
  ZARK_LIBZARKPORTMAP_TASK task{};
  progress->runningTasks.push_back(
      KLibGetLibZarkPortMapRunningTask(&task) == 0 ? task.task : -1);
}

class PortMapRouterSave : public testing::Test {
protected:
  void SetUp() override {
    test::ResetFixedPaths();
    test::ClearLogs();
    RouterOverrides overrides;
    overrides.upnpRootDescUrls = {mIgd.RootDescUrl()};
    overrides.localNetworks = kLoopback;
    overrides.natpmpPort = mNatPmp.Port();
    overrides.natpmpFirstWait = std::chrono::milliseconds(20);
    SetRouterOverridesForTesting(overrides);
    StoreConf("yes", "no");
  }
  void TearDown() override { SetRouterOverridesForTesting(std::nullopt); }

  int Save(std::vector<ZARK_ROUTER_RULE> rules, bool flag = false,
           Progress *progress = nullptr) {
    mResult = ZARK_ROUTER_SAVE_RULE_RESULT{};
    return KLibSaveRules(kGateway, static_cast<int>(rules.size()),
                         rules.empty() ? nullptr : rules.data(), flag, &mResult,
                         progress ? RecordProgress : nullptr, progress);
  }

  MappingState State() {
    MappingState state;
    EXPECT_TRUE(LoadMappingState(kMappingStatePath, state));
    return state;
  }

  std::vector<RouterRule> SavedRules() {
    RouterRuleConfReader reader(false);
    EXPECT_TRUE(reader.IsValid());
    return reader.Rules();
  }

  FakeIgd mIgd;
  FakeNatPmp mNatPmp;
  ZARK_ROUTER_SAVE_RULE_RESULT mResult{};
};

std::vector<ZARK_ROUTER_RULE> ThreeRules() {
  return {Rule("web", "tcp", "8080", "80"),
          Rule("games", "tcp", "9000-9002", "9000-9002"),
          Rule("dns", "udp", "5353", "53")};
}

TEST_F(PortMapRouterSave, AppliesThreeRulesOneOfThemARange) {
  Progress progress;

  ASSERT_EQ(0, Save(ThreeRules(), false, &progress)) << mResult.detail.text;

  EXPECT_EQ((std::vector<FakeIgd::Entry>{
                {"TCP", 8080, "127.0.0.1", 80, 0, "zarkportforward web"},
                {"TCP", 9000, "127.0.0.1", 9000, 0, "zarkportforward games"},
                {"TCP", 9001, "127.0.0.1", 9001, 0, "zarkportforward games"},
                {"TCP", 9002, "127.0.0.1", 9002, 0, "zarkportforward games"},
                {"UDP", 5353, "127.0.0.1", 53, 0, "zarkportforward dns"}}),
            mIgd.Table());
  EXPECT_EQ((std::map<std::string, int>{{"GET", 1},
                                        {"AddPortMapping", 5},
                                        {"GetSpecificPortMappingEntry", 5}}),
            mIgd.Counts());
  EXPECT_EQ((std::vector<int>{50, 50, 60, 70, 80, 90, 100, 100}),
            progress.percentages);
  EXPECT_EQ(
      (std::vector<std::string>{"del=0/0", "add=0/5", "add=1/5", "add=2/5",
                                "add=3/5", "add=4/5", "add=5/5", "add=5/5"}),
      progress.lines);
  EXPECT_EQ(std::vector<int>(8, ZARK_PORTMAP_TASK_APPLY_RULES),
            progress.runningTasks);
  EXPECT_EQ(100, mResult.percentage);
  EXPECT_EQ(0u, mResult.errType);
  // Finished: no progress file, no running job.
  EXPECT_NE(0, ::access(ZARK_PORTMAP_APPLY_PROGRESS, F_OK));
  ZARK_LIBZARKPORTMAP_TASK task{-1};
  ASSERT_EQ(0, KLibGetLibZarkPortMapRunningTask(&task));
  EXPECT_EQ(ZARK_PORTMAP_TASK_NONE, task.task);

  std::vector<RouterRule> saved = SavedRules();
  ASSERT_EQ(3u, saved.size());
  EXPECT_EQ("games", saved[1].ruleId);
  EXPECT_EQ("9000-9002", saved[1].routerPort);
  EXPECT_EQ("svc", saved[1].serviceId);

  MappingState state = State();
  RouterRecord *record = state.Find(kGateway, RouterProtocol::kUpnp);
  ASSERT_NE(nullptr, record);
  EXPECT_EQ(mIgd.RootDescUrl(), record->location);
  EXPECT_EQ(5u, record->mappings.size());
  for (const RecordedMapping &mapping : record->mappings) {
    EXPECT_TRUE(mapping.held);
  }
  struct stat info {};
  ASSERT_EQ(0, ::stat(kMappingStatePath, &info));
  EXPECT_EQ(0600u, info.st_mode & 0777);
}

TEST_F(PortMapRouterSave, UnchangedSetIsVerifiedOnTheRouter) {
  ASSERT_EQ(0, Save(ThreeRules()));
  mIgd.ResetCounts();

  ASSERT_EQ(0, Save(ThreeRules()));

  // IGD:1 cannot list by port range: one lookup per mapping.
  EXPECT_EQ((std::map<std::string, int>{{"GetSpecificPortMappingEntry", 5}}),
            mIgd.Counts());
  EXPECT_EQ(5u, mIgd.Table().size());
}

TEST_F(PortMapRouterSave, TenChangesOfAHundredCostRequestsForTheChangesOnly) {
  std::vector<ZARK_ROUTER_RULE> rules;
  for (int i = 0; i < 100; ++i) {
    std::string port = std::to_string(10000 + i);
    rules.push_back(Rule(std::to_string(i), "tcp", port, port));
  }
  ASSERT_EQ(0, Save(rules)) << mResult.detail.text;
  EXPECT_EQ(201, mIgd.TotalRequests());
  mIgd.ResetCounts();
  for (int i = 0; i < 10; ++i) {
    std::string local = std::to_string(20000 + i);
    std::strcpy(rules[i * 10].ds_port, local.c_str());
  }

  ASSERT_EQ(0, Save(rules)) << mResult.detail.text;

  // The 90 unchanged ones are looked up too.
  EXPECT_EQ((std::map<std::string, int>{{"DeletePortMapping", 10},
                                        {"AddPortMapping", 10},
                                        {"GetSpecificPortMappingEntry", 100}}),
            mIgd.Counts());
  EXPECT_EQ(1, mIgd.MaxOpenConnections());
  EXPECT_EQ(100u, mIgd.Table().size());
}

TEST_F(PortMapRouterSave, EmptySetRemovesOurMappingsOnly) {
  mIgd.PutEntry({"TCP", 7000, "127.0.0.9", 7000, 0, "someone else"});
  ASSERT_EQ(0, Save({Rule("a", "tcp", "8080", "80"),
                     Rule("b", "tcp", "8081", "81")}));
  Progress progress;

  ASSERT_EQ(0, Save({}, false, &progress));

  EXPECT_EQ((std::vector<FakeIgd::Entry>{
                {"TCP", 7000, "127.0.0.9", 7000, 0, "someone else"}}),
            mIgd.Table());
  EXPECT_EQ((std::vector<int>{0, 25, 50, 100, 100}), progress.percentages);
  EXPECT_EQ((std::vector<std::string>{"del=0/2", "del=1/2", "del=2/2",
                                      "add=0/0", "add=0/0"}),
            progress.lines);
  EXPECT_TRUE(SavedRules().empty());
}

TEST_F(PortMapRouterSave, RefusalsCarryTheirLimitOrTextAndTouchNothing) {
  ASSERT_EQ(0, Save({Rule("old", "tcp", "8080", "80")}));
  mIgd.ResetCounts();
  struct Case {
    ZARK_ROUTER_RULE rule;
    uint32_t type;
    int32_t maxPort;
    int32_t maxRange;
    const char *text;
  };
  const Case cases[] = {
      {Rule("1", "tcp", "70000", "80"), 10, 65535, 0, nullptr},
      {Rule("1", "tcp", "1-101", ""), 12, 65535, 100, nullptr},
      {Rule("1", "tcp", "1-60,100-160", ""), 11, 100, 0, nullptr},
      {Rule("1", "tcp", "80a", "80"), 8, 0, 0, "80a"},
      {Rule("1", "icmp", "80", "80"), 9, 0, 0, "icmp"},
  };
  for (const Case &c : cases) {
    EXPECT_EQ(-1, Save({c.rule}));
    EXPECT_EQ(c.type, mResult.errType);
    if (c.text != nullptr) {
      EXPECT_STREQ(c.text, mResult.detail.text);
    } else {
      EXPECT_EQ(c.maxPort, mResult.detail.limit.maxPort);
      EXPECT_EQ(c.maxRange, mResult.detail.limit.maxRange);
    }
  }
  EXPECT_EQ(0, mIgd.TotalRequests());
  ASSERT_EQ(1u, SavedRules().size());
  EXPECT_EQ("old", SavedRules()[0].ruleId);
  EXPECT_NE(0, ::access(ZARK_PORTMAP_APPLY_PROGRESS, F_OK));
}

TEST_F(PortMapRouterSave, MoreEntriesThanTheConfiguredRouterTakesIsType7) {
  StoreConf("yes", "no", "", "4");

  EXPECT_EQ(-1, Save({Rule("1", "both", "1000-1002", "")}));

  EXPECT_EQ(7u, mResult.errType);
  EXPECT_EQ(4, mResult.detail.limit.maxPort);
  EXPECT_EQ(0, mIgd.TotalRequests());
}

TEST_F(PortMapRouterSave, NoConfigurationIsType2) {
  test::ResetFixedPaths();
  test::ClearLogs();

  EXPECT_EQ(-1, Save({Rule("1", "tcp", "80", "80")}));

  EXPECT_EQ(static_cast<uint32_t>(ZARK_SAVE_ERR_NOT_CONFIGURED),
            mResult.errType);
  EXPECT_TRUE(
      test::HasLogContaining("no router is configured for gateway 127.0.0.1"));
  EXPECT_EQ(0, mIgd.TotalRequests());
}

TEST_F(PortMapRouterSave, RouterPagesConfigurationIsType2AndSaysWhy) {
  StoreConf("no", "no", "http");

  EXPECT_EQ(-1, Save({Rule("1", "tcp", "80", "80")}));

  EXPECT_EQ(static_cast<uint32_t>(ZARK_SAVE_ERR_NOT_CONFIGURED),
            mResult.errType);
  EXPECT_TRUE(test::HasLogContaining(
      "is driven through its web pages (\"http\"); drivers for router pages "
      "do not exist yet"));
}

TEST_F(PortMapRouterSave, BadArgumentsAreType3) {
  ZARK_ROUTER_SAVE_RULE_RESULT result{};
  EXPECT_EQ(
      -1, KLibSaveRules(nullptr, 0, nullptr, false, &result, nullptr, nullptr));
  EXPECT_EQ(3u, result.errType);
  EXPECT_EQ(-1, KLibSaveRules(kGateway, 2, nullptr, false, &result, nullptr,
                              nullptr));
  EXPECT_EQ(3u, result.errType);
  EXPECT_EQ(-1, KLibSaveRules("gateway", 0, nullptr, false, &result, nullptr,
                              nullptr));
  EXPECT_EQ(3u, result.errType);
  EXPECT_EQ(
      -1, KLibSaveRules(nullptr, 0, nullptr, false, nullptr, nullptr, nullptr));
}

TEST_F(PortMapRouterSave, ConflictIsReportedForItsRuleAndTheRestApplied) {
  ASSERT_EQ(0, Save({Rule("old", "tcp", "7000", "7000")}));
  mIgd.PutEntry({"TCP", 8080, "127.0.0.9", 80, 0, "someone else"});

  EXPECT_EQ(-1, Save({Rule("web", "tcp", "8080", "80"),
                      Rule("ssh", "tcp", "2222", "22")}));

  EXPECT_EQ(5u, mResult.errType);
  EXPECT_NE(nullptr, std::strstr(mResult.detail.text,
                                 "rule \"web\", router port tcp 8080 is "
                                 "taken on the router"));
  EXPECT_NE(nullptr, std::strstr(mResult.detail.text, "(718)"));
  // Never moved to another port; the other rule is on the router.
  for (const SoapRequest &request : mIgd.SoapRequests()) {
    if (request.action == "AddPortMapping" &&
        request.Arg("NewInternalPort") == "80") {
      EXPECT_EQ("8080", request.Arg("NewExternalPort"));
    }
  }
  std::vector<FakeIgd::Entry> table = mIgd.Table();
  EXPECT_EQ(2u, table.size());
  EXPECT_EQ("127.0.0.9", table[0].client);
  EXPECT_EQ(2222, table[1].externalPort);
  // The rules are kept; the state says what the router has and why the
  // other mapping is not ours.
  EXPECT_NE(nullptr, std::strstr(mResult.detail.text,
                                 "conflict with another mapping: "));
  EXPECT_NE(nullptr, std::strstr(mResult.detail.text,
                                 "by 127.0.0.9:80 (\"someone else\")"));
  ASSERT_EQ(2u, SavedRules().size());
  EXPECT_EQ("web", SavedRules()[0].ruleId);
  MappingState state = State();
  RouterRecord *record = state.Find(kGateway, RouterProtocol::kUpnp);
  ASSERT_NE(nullptr, record);
  ASSERT_EQ(2u, record->mappings.size());
  const RecordedMapping *web = record->Find(IpProtocol::kTcp, 8080);
  ASSERT_NE(nullptr, web);
  EXPECT_FALSE(web->held);
  EXPECT_EQ(MappingApply::kRefused, web->apply);
  EXPECT_EQ(ZARK_FAILURE_CONFLICT, web->failure);
  EXPECT_NE(std::string::npos, web->reason.find("someone else"));
  const RecordedMapping *ssh = record->Find(IpProtocol::kTcp, 2222);
  ASSERT_NE(nullptr, ssh);
  EXPECT_TRUE(ssh->held);
  EXPECT_EQ(MappingApply::kOnRouter, ssh->apply);
  ASSERT_TRUE(record->lastJob.has_value());
  EXPECT_FALSE(record->lastJob->ok);
  EXPECT_EQ(ZARK_FAILURE_CONFLICT, record->lastJob->failure);

  // The rule no longer wanted: the foreign mapping is left alone.
  mIgd.ResetCounts();
  ASSERT_EQ(0, Save({Rule("ssh", "tcp", "2222", "22")})) << mResult.detail.text;
  EXPECT_EQ(0, mIgd.Count("DeletePortMapping"));
  EXPECT_EQ("someone else", mIgd.Table()[0].description);
}

TEST_F(PortMapRouterSave, RouterThatClosesMidSaveEndsItAndTheNextSaveRepairs) {
  std::atomic<int> adds{0};
  mIgd.OnAction("AddPortMapping",
                [&adds](const SoapRequest &) -> std::optional<HttpReply> {
                  if (++adds > 2) {
                    HttpReply gone;
                    gone.close = true;
                    return gone;
                  }
                  return std::nullopt;
                });
  std::vector<ZARK_ROUTER_RULE> rules = {
      Rule("a", "tcp", "8001", "8001"), Rule("b", "tcp", "8002", "8002"),
      Rule("c", "tcp", "8003", "8003"), Rule("d", "tcp", "8004", "8004")};

  EXPECT_EQ(-1, Save(rules));

  EXPECT_EQ(5u, mResult.errType);
  EXPECT_NE(nullptr, std::strstr(mResult.detail.text, "router port tcp 8003"));
  EXPECT_NE(nullptr,
            std::strstr(mResult.detail.text, "no reply from the router"));
  EXPECT_EQ(3, mIgd.Count("AddPortMapping")); // stopped at the first silence
  EXPECT_EQ(4u, SavedRules().size());         // the rules are kept
  MappingState state = State();
  RouterRecord *record = state.Find(kGateway, RouterProtocol::kUpnp);
  ASSERT_NE(nullptr, record);
  ASSERT_EQ(4u, record->mappings.size());
  EXPECT_TRUE(record->mappings[0].held);
  EXPECT_TRUE(record->mappings[1].held);
  EXPECT_FALSE(record->mappings[2].held); // may or may not be there
  EXPECT_EQ(8003, record->mappings[2].externalPort);
  EXPECT_EQ(MappingApply::kPending, record->mappings[2].apply);
  EXPECT_FALSE(record->mappings[3].held); // never asked
  EXPECT_EQ(MappingApply::kPending, record->mappings[3].apply);
  EXPECT_EQ(ZARK_FAILURE_ROUTER_NOT_ANSWERING, record->mappings[3].failure);
  EXPECT_NE(std::string::npos,
            record->mappings[3].reason.find("did not answer within 8 s"));

  // The router answers again: the next save does exactly the rest.
  mIgd.OnAction("AddPortMapping",
                [](const SoapRequest &) { return std::optional<HttpReply>(); });
  mIgd.ResetCounts();
  ASSERT_EQ(0, Save(rules)) << mResult.detail.text;
  // Two lookups of the held ones, two adds and their confirmations.
  EXPECT_EQ((std::map<std::string, int>{{"AddPortMapping", 2},
                                        {"GetSpecificPortMappingEntry", 4}}),
            mIgd.Counts());
  EXPECT_EQ(4u, mIgd.Table().size());
  EXPECT_EQ(4u, SavedRules().size());
}

TEST_F(PortMapRouterSave, RouterThatHangsMidSaveEndsItWithinItsDeadline) {
  std::atomic<int> adds{0};
  mIgd.OnAction("AddPortMapping",
                [&adds](const SoapRequest &) -> std::optional<HttpReply> {
                  if (++adds == 2) {
                    HttpReply silent;
                    silent.hang = true;
                    return silent;
                  }
                  return std::nullopt;
                });
  std::vector<ZARK_ROUTER_RULE> rules = {Rule("a", "tcp", "8001", "8001"),
                                         Rule("b", "tcp", "8002", "8002"),
                                         Rule("c", "tcp", "8003", "8003")};

  EXPECT_EQ(-1, Save(rules));

  EXPECT_EQ(5u, mResult.errType);
  EXPECT_NE(nullptr, std::strstr(mResult.detail.text, "router port tcp 8002"));
  EXPECT_EQ(2, mIgd.Count("AddPortMapping"));

  mIgd.ResetCounts();
  ASSERT_EQ(0, Save(rules)) << mResult.detail.text;
  EXPECT_EQ(2, mIgd.Count("AddPortMapping"));
  EXPECT_EQ(3u, mIgd.Table().size());
}

TEST_F(PortMapRouterSave, FullTableStopsTheAddStage) {
  mIgd.SetTableCapacity(2);

  EXPECT_EQ(-1, Save({Rule("a", "tcp", "8001-8004", "8001-8004")}));

  EXPECT_EQ(5u, mResult.errType);
  EXPECT_NE(nullptr, std::strstr(mResult.detail.text, "table full"));
  EXPECT_EQ(3, mIgd.Count("AddPortMapping"));
  MappingState state = State();
  const RouterRecord *record = state.Find(kGateway, RouterProtocol::kUpnp);
  ASSERT_NE(nullptr, record);
  ASSERT_EQ(4u, record->mappings.size());
  EXPECT_EQ(2, std::count_if(record->mappings.begin(), record->mappings.end(),
                             [](const RecordedMapping &mapping) {
                               return mapping.held;
                             }));
  EXPECT_EQ(MappingApply::kRefused, record->mappings[2].apply);
  EXPECT_EQ(ZARK_FAILURE_TABLE_FULL, record->mappings[2].failure);
  EXPECT_EQ(MappingApply::kPending, record->mappings[3].apply);
}

TEST_F(PortMapRouterSave, AddThatCannotBeReadBackStaysUncertain) {
  mIgd.OnAction("GetSpecificPortMappingEntry", [](const SoapRequest &) {
    return std::optional<HttpReply>(
        test::SoapFault(606, "Action not authorized"));
  });
  std::vector<ZARK_ROUTER_RULE> rules = {Rule("a", "tcp", "8001", "8001"),
                                         Rule("b", "tcp", "8002", "8002")};

  EXPECT_EQ(-1, Save(rules));

  EXPECT_EQ(5u, mResult.errType);
  // Both were tried: a reply that cannot be read back stops nothing.
  EXPECT_EQ(2, mIgd.Count("AddPortMapping"));
  MappingState state = State();
  RouterRecord *record = state.Find(kGateway, RouterProtocol::kUpnp);
  ASSERT_NE(nullptr, record);
  ASSERT_EQ(2u, record->mappings.size());
  EXPECT_FALSE(record->mappings[0].held);
  EXPECT_FALSE(record->mappings[1].held);

  mIgd.OnAction("GetSpecificPortMappingEntry",
                [](const SoapRequest &) { return std::optional<HttpReply>(); });
  mIgd.ResetCounts();
  ASSERT_EQ(0, Save(rules)) << mResult.detail.text;
  EXPECT_EQ(2, mIgd.Count("AddPortMapping"));
  EXPECT_EQ(2u, mIgd.Table().size());
}

TEST_F(PortMapRouterSave, TheJobStopsWhenItsTimeIsUp) {
  ApplyEnvironment environment = DefaultApplyEnvironment();
  environment.deadline = std::chrono::seconds(0);
  std::vector<ZARK_ROUTER_RULE> rules = {Rule("a", "tcp", "8001", "8001")};
  ZARK_ROUTER_SAVE_RULE_RESULT result{};

  EXPECT_EQ(-1, ApplyRules(kGateway, rules, ApplyOptions{}, environment, result,
                           nullptr, nullptr));

  EXPECT_EQ(5u, result.errType);
  EXPECT_NE(nullptr, std::strstr(result.detail.text, "ran out of time"));
  EXPECT_EQ(0, mIgd.Count("AddPortMapping"));
  // The wanted mapping is recorded as not applied yet.
  MappingState state = State();
  const RouterRecord *record = state.Find(kGateway, RouterProtocol::kUpnp);
  ASSERT_NE(nullptr, record);
  ASSERT_EQ(1u, record->mappings.size());
  EXPECT_FALSE(record->mappings[0].held);
  EXPECT_EQ(MappingApply::kPending, record->mappings[0].apply);
}

TEST_F(PortMapRouterSave, VerifyFlagReaddsWhatTheRouterLost) {
  ASSERT_EQ(0, Save(ThreeRules()));
  mIgd.ClearTable(); // the router rebooted
  mIgd.ResetCounts();

  ASSERT_EQ(0, Save(ThreeRules(), /*flag=*/true)) << mResult.detail.text;

  // One lookup each (714), then add and confirm.
  EXPECT_EQ((std::map<std::string, int>{{"AddPortMapping", 5},
                                        {"GetSpecificPortMappingEntry", 10}}),
            mIgd.Counts());
  EXPECT_EQ(5u, mIgd.Table().size());

  mIgd.ResetCounts();
  ASSERT_EQ(0, Save(ThreeRules(), /*flag=*/true));
  EXPECT_EQ((std::map<std::string, int>{{"GetSpecificPortMappingEntry", 5}}),
            mIgd.Counts());
}

TEST_F(PortMapRouterSave, FiniteLeasesAreRefreshedWhenTheyRunLow) {
  mIgd.OnAction("AddPortMapping",
                [](const SoapRequest &request) -> std::optional<HttpReply> {
                  if (request.Arg("NewLeaseDuration") == "0") {
                    return test::SoapFault(725, "OnlyPermanentLeasesSupported");
                  }
                  return std::nullopt;
                });
  int64_t now = 1700000000;
  ApplyEnvironment environment = DefaultApplyEnvironment();
  environment.now = [&now] { return now; };
  std::vector<ZARK_ROUTER_RULE> rules = {Rule("a", "tcp", "8001", "8001")};
  ZARK_ROUTER_SAVE_RULE_RESULT result{};
  ASSERT_EQ(0, ApplyRules(kGateway, rules, ApplyOptions{}, environment, result,
                          nullptr, nullptr));
  MappingState state = State();
  ASSERT_EQ(now + 3600,
            state.Find(kGateway, RouterProtocol::kUpnp)->mappings[0].expires);
  EXPECT_TRUE(state.Find(kGateway, RouterProtocol::kUpnp)->finiteLeases);
  ApplyOptions renew;
  renew.refreshLeases = true;
  renew.writeRuleConf = false;
  mIgd.ResetCounts();

  // Plenty of lease left: nothing to do.
  now += 600;
  ASSERT_EQ(0, ApplyRules(kGateway, rules, renew, environment, result, nullptr,
                          nullptr));
  EXPECT_EQ(0, mIgd.TotalRequests());

  // Less than renewAhead left: added again, straight with a finite lease.
  now += 1200;
  ASSERT_EQ(0, ApplyRules(kGateway, rules, renew, environment, result, nullptr,
                          nullptr));
  EXPECT_EQ((std::map<std::string, int>{{"AddPortMapping", 1},
                                        {"GetSpecificPortMappingEntry", 1}}),
            mIgd.Counts());
  EXPECT_EQ(now + 3600,
            State().Find(kGateway, RouterProtocol::kUpnp)->mappings[0].expires);
}

TEST_F(PortMapRouterSave, NatPmpRouterEndToEnd) {
  StoreConf("no", "yes");
  int64_t now = 1700000000;
  ApplyEnvironment environment = DefaultApplyEnvironment();
  environment.now = [&now] { return now; };
  std::vector<ZARK_ROUTER_RULE> rules = {Rule("web", "tcp", "8080", "80"),
                                         Rule("dns", "udp", "5353", "53")};
  ZARK_ROUTER_SAVE_RULE_RESULT result{};

  ASSERT_EQ(0, ApplyRules(kGateway, rules, ApplyOptions{}, environment, result,
                          nullptr, nullptr))
      << result.detail.text;

  EXPECT_EQ((std::vector<FakeNatPmp::Mapping>{{2, 80, 8080, 7200},
                                              {1, 53, 5353, 7200}}),
            mNatPmp.Table());
  MappingState state = State();
  RouterRecord *record = state.Find(kGateway, RouterProtocol::kNatPmp);
  ASSERT_NE(nullptr, record);
  EXPECT_TRUE(record->finiteLeases);
  ASSERT_EQ(2u, record->mappings.size());
  EXPECT_EQ(now + 7200, record->mappings[0].expires);
  EXPECT_EQ(0, mIgd.TotalRequests());

  // Unchanged: nothing sent. Checked: NAT-PMP cannot be asked, so each is
  // mapped again.
  ASSERT_EQ(0, ApplyRules(kGateway, rules, ApplyOptions{}, environment, result,
                          nullptr, nullptr));
  EXPECT_EQ(2, mNatPmp.Requests());
  ApplyOptions check;
  check.verifyUnchanged = true;
  ASSERT_EQ(0, ApplyRules(kGateway, rules, check, environment, result, nullptr,
                          nullptr));
  EXPECT_EQ(4, mNatPmp.Requests());

  // Removing a rule unmaps it.
  ASSERT_EQ(0, ApplyRules(kGateway, std::span(rules).first(1), ApplyOptions{},
                          environment, result, nullptr, nullptr));
  EXPECT_EQ((std::vector<FakeNatPmp::Mapping>{{2, 80, 8080, 7200}}),
            mNatPmp.Table());
}

TEST_F(PortMapRouterSave,
       NatPmpPortTakenIsAConflictAndTheOtherPortIsGivenBack) {
  StoreConf("no", "yes");
  mNatPmp.TakePublicPort(2, 8080);

  EXPECT_EQ(-1, Save({Rule("web", "tcp", "8080", "80")}));

  EXPECT_EQ(5u, mResult.errType);
  EXPECT_NE(nullptr, std::strstr(mResult.detail.text, "router port tcp 8080"));
  EXPECT_TRUE(mNatPmp.Table().empty());
  // The add, giving the other port back, and the outside address (to tell
  // a double NAT).
  EXPECT_EQ(3, mNatPmp.Requests());
}

TEST_F(PortMapRouterSave, SwitchingProtocolsDeletesThroughTheOldOne) {
  ASSERT_EQ(0, Save(ThreeRules()));
  StoreConf("no", "yes");
  mIgd.ResetCounts();

  ASSERT_EQ(0, Save(ThreeRules())) << mResult.detail.text;

  EXPECT_TRUE(mIgd.Table().empty());
  EXPECT_EQ(5, mIgd.Count("DeletePortMapping"));
  EXPECT_EQ(5u, mNatPmp.Table().size());
  MappingState state = State();
  EXPECT_TRUE(state.Find(kGateway, RouterProtocol::kUpnp) == nullptr ||
              state.Find(kGateway, RouterProtocol::kUpnp)->mappings.empty());
  EXPECT_EQ(5u, state.Find(kGateway, RouterProtocol::kNatPmp)->mappings.size());
}

TEST_F(PortMapRouterSave, ChangedLocalPortIsDeletedThenAdded) {
  ASSERT_EQ(0, Save({Rule("web", "tcp", "8080", "80")}));
  mIgd.ResetCounts();

  ASSERT_EQ(0, Save({Rule("web", "tcp", "8080", "81")}));

  std::vector<std::string> actions;
  for (const SoapRequest &request : mIgd.SoapRequests()) {
    actions.push_back(request.action);
  }
  EXPECT_EQ((std::vector<std::string>{"DeletePortMapping", "AddPortMapping",
                                      "GetSpecificPortMappingEntry"}),
            actions);
  EXPECT_EQ(81, mIgd.Table().at(0).internalPort);
}

TEST_F(PortMapRouterSave, CorruptStateIsLoggedAndRebuilt) {
  test::WriteFile(kMappingStatePath, "{ not json", 0600);

  ASSERT_EQ(0, Save({Rule("web", "tcp", "8080", "80")}));

  EXPECT_TRUE(test::HasLogContaining("the mappings made before are unknown"));
  EXPECT_EQ(1u, State().Find(kGateway, RouterProtocol::kUpnp)->mappings.size());
}

} // namespace
} // namespace zark::portmap
