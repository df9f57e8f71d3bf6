// The UPnP compatibility test against the fake router of
// tests/portmap/support (a UPnP IGD on 127.0.0.1) and the probe service in
// this process. On loopback nothing forwards anything, so the probe
// service's checks go through RouterPath, which plays the router's data
// path: a port is open from outside exactly when the fake's table maps it,
// and then the check really connects to the mapped local port, where the
// test's temporary listener answers with its token.
//
// Every case ends with the fake's table as it was before the test: the
// test removes every mapping it made, whatever happened.
// HERMETIC: /etc/portforward, /tmp.
#include "compat/compatibility_test.h"

#include "base/library_config.h"
#include "base/portmap_lock.h"
#include "base/running_task.h"
#include "catalog/router_conf_store.h"
#include "compat/compatibility_report.h"
#include "drivers/driver_choice.h"
#include "fake_igd.h"
#include "hermetic.h"
#include "porttest_support.h"
#include "syslog_capture.h"

#include "klibc.h"

#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <map>
#include <regex>
#include <thread>

namespace zark::portmap {
namespace {

using porttest::FreePort;
using porttest::LoopbackProbe;
using porttest::SetLibraryConfig;
using test::FakeIgd;
using test::HttpReply;
using test::SoapFault;
using test::SoapRequest;
namespace key = upnp_test_key;

const std::vector<Ipv4Network> kLoopback = {{0x7f000000u, 0xff000000u}};
const std::string kProbeKey(config_key::kProbeServiceAddress);

class RouterPath final : public probe::ConnectBack {
public:
  enum class Mode { kFollowTable, kAlwaysOpen, kAlwaysClosed };
  explicit RouterPath(FakeIgd &igd)
      : mIgd(igd), mReal(porttest::ShortTimeouts()) {}

  void SetMode(Mode mode) { mMode = mode; }

  probe::Verdict Check(const sockaddr_storage &requester, socklen_t length,
                       const probe::Request &request) override {
    const Mode mode = mMode.load();
    if (mode == Mode::kAlwaysClosed) {
      return {probe::Result::kUnreachable, probe::reason::kRefused};
    }
    probe::Request forwarded = request;
    if (mode == Mode::kFollowTable) {
      const std::string protocol =
          request.transport == probe::Transport::kTcp ? "TCP" : "UDP";
      bool mapped = false;
      for (const FakeIgd::Entry &entry : mIgd.Table()) {
        if (entry.protocol == protocol && entry.externalPort == request.port) {
          forwarded.port = entry.internalPort;
          mapped = true;
        }
      }
      if (!mapped) {
        return {probe::Result::kUnreachable, probe::reason::kRefused};
      }
    }
    return mReal.Check(requester, length, forwarded);
  }

private:
  FakeIgd &mIgd;
  probe::SocketConnectBack mReal;
  std::atomic<Mode> mMode{Mode::kFollowTable};
};

// What each progress callback saw.
struct Seen {
  std::vector<int> progress;
  std::vector<int> running;
  std::function<void(int progress)> hook;
};

void Record(const ZARK_ROUTER_TEST_COMPATIBILITY_RESULT *result, void *arg) {
  auto *seen = static_cast<Seen *>(arg);
  seen->progress.push_back(result->progress);
  ZARK_LIBZARKPORTMAP_TASK task{-1};
  seen->running.push_back(
      KLibGetLibZarkPortMapRunningTask(&task) == 0 ? task.task : -1);
  if (seen->hook) {
    seen->hook(result->progress);
  }
}

std::map<std::string, std::string> ProgressFile() {
  std::map<std::string, std::string> values;
  for (const char *name :
       {key::kInit, key::kAdd, key::kMax, key::kDelete, key::kConnectionFailed,
        key::kReadd1, key::kReadd2, key::kConnectionSuccess, key::kTerminal}) {
    char buffer[4096] = {};
    if (KLIBCFileGetKeyValue(ZARK_PORTMAP_UPNP_TEST_PROGRESS, name, buffer,
                             sizeof(buffer), 0) > 0) {
      values[name] = buffer;
    }
  }
  return values;
}

std::map<std::string, std::string> Passed(const std::string &max) {
  return {{key::kInit, "success"},
          {key::kAdd, "finished"},
          {key::kMax, max},
          {key::kDelete, "finished"},
          {key::kConnectionFailed, "success"},
          {key::kReadd1, "success"},
          {key::kReadd2, "finished"},
          {key::kConnectionSuccess, "success"},
          {key::kTerminal, "finished"}};
}

class PortTestCompat : public testing::Test {
protected:
  void SetUp() override {
    test::ResetFixedPaths();
    test::ClearLogs();
    RouterOverrides overrides;
    overrides.upnpRootDescUrls = {mIgd.RootDescUrl()};
    overrides.localNetworks = kLoopback;
    SetRouterOverridesForTesting(overrides);
    StoreConf("yes", "no");
    ASSERT_TRUE(mProbe.Running());
    SetLibraryConfig(kProbeKey, mProbe.Address());
    mEnv = DefaultUpnpTestEnvironment();
    mEnv.gateway = [] { return std::optional<std::string>("127.0.0.1"); };
    mFirst = FreePort();
    ASSERT_NE(0, mFirst);
    mEnv.firstPort = mFirst;
  }
  void TearDown() override { SetRouterOverridesForTesting(std::nullopt); }

  void StoreConf(const std::string &upnp, const std::string &natpmp) {
    ZARK_ROUTER_CONF conf{};
    std::strcpy(conf.brand, "ZarkTest");
    std::strcpy(conf.model, "TestIGD");
    std::strcpy(conf.version, "1");
    std::strncpy(conf.support_upnp, upnp.c_str(),
                 sizeof(conf.support_upnp) - 1);
    std::strncpy(conf.support_natpmp, natpmp.c_str(),
                 sizeof(conf.support_natpmp) - 1);
    std::strcpy(conf.password, "s3cret-pw");
    int err = 0;
    ASSERT_TRUE(StoreRouterConfForGateway("127.0.0.1", conf, err)) << err;
  }

  int Run(int max = 60) {
    mResult = ZARK_ROUTER_TEST_COMPATIBILITY_RESULT{};
    return RunUpnpCompatibilityTest(max, mEnv, mResult, Record, &mSeen);
  }

  // The test left nothing of its own on the router.
  void ExpectNothingLeft() {
    for (const FakeIgd::Entry &entry : mIgd.Table()) {
      EXPECT_NE(kUpnpTestDescription, entry.description)
          << entry.protocol << " " << entry.externalPort;
    }
    EXPECT_NE(0, ::access(kUpnpTestRunPath, F_OK)) << "run file left";
    EXPECT_NE(0, ::access(kUpnpTestStopPath, F_OK)) << "stop file left";
    ZARK_LIBZARKPORTMAP_TASK task{-1};
    ASSERT_EQ(0, KLibGetLibZarkPortMapRunningTask(&task));
    EXPECT_EQ(ZARK_PORTMAP_TASK_NONE, task.task);
  }

  UpnpTestReport Report() {
    UpnpTestReport report;
    std::string why;
    EXPECT_TRUE(
        ParseUpnpTestReport(test::ReadFile(kUpnpTestReportPath), report, why))
        << why;
    return report;
  }

  FakeIgd mIgd;
  RouterPath mPath{mIgd};
  LoopbackProbe mProbe{&mPath};
  UpnpTestEnvironment mEnv;
  uint16_t mFirst = 0;
  ZARK_ROUTER_TEST_COMPATIBILITY_RESULT mResult{};
  Seen mSeen;
};

TEST_F(PortTestCompat, ARouterThatTakesEverythingPasses) {
  ASSERT_EQ(0, Run(60)) << mResult.error;
  EXPECT_EQ(0, mResult.error);
  EXPECT_EQ(100, mResult.progress);
  EXPECT_EQ(Passed("60"), ProgressFile());

  EXPECT_STREQ("ZarkTest", mResult.record.brand);
  EXPECT_STREQ("TestIGD", mResult.record.model);
  EXPECT_STREQ("1", mResult.record.version);
  EXPECT_EQ(60, mResult.record.max_mappings);
  EXPECT_TRUE(std::regex_match(
      mResult.record.date, std::regex(R"(\d{4}-\d\d-\d\dT\d\d:\d\d:\d\dZ)")))
      << mResult.record.date;

  // 60 added and confirmed, each read back once more, all deleted and
  // confirmed gone; the connection port added twice more and deleted.
  EXPECT_EQ(62, mIgd.Count("AddPortMapping"));
  EXPECT_EQ(61, mIgd.Count("DeletePortMapping"));
  EXPECT_EQ(62 + 60 + 60, mIgd.Count("GetSpecificPortMappingEntry"));
  EXPECT_EQ(1, mIgd.Count("GetGenericPortMappingEntry"));
  // Closed after the delete, open after the re-add.
  EXPECT_EQ(2, mProbe.Counters().checks);
  EXPECT_TRUE(mIgd.Table().empty());

  // Progress: from 0 to 100, never back; the test marked running at each
  // step.
  ASSERT_FALSE(mSeen.progress.empty());
  EXPECT_EQ(0, mSeen.progress.front());
  EXPECT_EQ(100, mSeen.progress.back());
  EXPECT_TRUE(std::is_sorted(mSeen.progress.begin(), mSeen.progress.end()));
  for (int expected : {10, 20, 50, 60, 70, 80, 90}) {
    EXPECT_NE(mSeen.progress.end(),
              std::find(mSeen.progress.begin(), mSeen.progress.end(), expected))
        << expected;
  }
  EXPECT_EQ(std::vector<int>(mSeen.running.size(), ZARK_PORTMAP_TASK_UPNP_TEST),
            mSeen.running);
  ExpectNothingLeft();

  UpnpTestReport report = Report();
  EXPECT_FALSE(report.failed);
  EXPECT_EQ(60, report.mappingsReached);
  EXPECT_EQ(mIgd.RootDescUrl(), report.location);
  EXPECT_EQ(std::string::npos,
            test::ReadFile(kUpnpTestReportPath).find("s3cret-pw"));
}

TEST_F(PortTestCompat, ATableThatFillsAt8WithAnError) {
  mIgd.OnAction("AddPortMapping",
                [&](const SoapRequest &request) -> std::optional<HttpReply> {
                  std::vector<FakeIgd::Entry> table = mIgd.Table();
                  const std::string port = request.Arg("NewExternalPort");
                  bool present = std::any_of(
                      table.begin(), table.end(), [&](const auto &entry) {
                        return std::to_string(entry.externalPort) == port;
                      });
                  if (table.size() >= 8 && !present) {
                    return SoapFault(728, "NoPortMapsAvailable");
                  }
                  return std::nullopt;
                });
  ASSERT_EQ(0, Run(60)) << mResult.error;
  EXPECT_EQ(8, mResult.record.max_mappings);
  EXPECT_EQ(Passed("8"), ProgressFile());
  EXPECT_EQ(8 + 1 + 2, mIgd.Count("AddPortMapping"));
  EXPECT_TRUE(mIgd.Table().empty());
  EXPECT_TRUE(test::HasLogContaining("took 8 mapping(s)"));
  ExpectNothingLeft();
}

TEST_F(PortTestCompat, ATableThatFillsAt8Silently) {
  mIgd.SetTableCapacity(8);
  ASSERT_EQ(0, Run(60)) << mResult.error;
  EXPECT_EQ(8, mResult.record.max_mappings);
  EXPECT_EQ(Passed("8"), ProgressFile());
  EXPECT_TRUE(mIgd.Table().empty());
  ExpectNothingLeft();
}

TEST_F(PortTestCompat, FewerAskedFewerMade) {
  ASSERT_EQ(0, Run(5)) << mResult.error;
  EXPECT_EQ(5, mResult.record.max_mappings);
  EXPECT_EQ(5 + 2, mIgd.Count("AddPortMapping"));
  ExpectNothingLeft();
}

// A router that answers 718 for every new port once its table is full
// (as some do instead of 728).
TEST_F(PortTestCompat, ConflictsInARowEndTheFilling) {
  mIgd.OnAction(
      "AddPortMapping", [&](const SoapRequest &) -> std::optional<HttpReply> {
        if (mIgd.Table().size() >= 5 && mIgd.Count("DeletePortMapping") == 0) {
          return SoapFault(718, "ConflictInMappingEntry");
        }
        return std::nullopt;
      });
  ASSERT_EQ(0, Run(60)) << mResult.error;
  EXPECT_EQ(5, mResult.record.max_mappings);
  EXPECT_EQ(5 + mEnv.conflictsInARow + 2, mIgd.Count("AddPortMapping"));
  ExpectNothingLeft();
}

// Ports the router already maps for someone else, and ports of the user's
// own rules, are never touched.
TEST_F(PortTestCompat, PortsInUseAreLeftAlone) {
  const FakeIgd::Entry other{"TCP",       static_cast<uint16_t>(mFirst + 3),
                             "127.0.0.9", 80,
                             0,           "someone else"};
  mIgd.PutEntry(other);
  MappingState state;
  RouterRecord &record = state.FindOrAdd("127.0.0.1", RouterProtocol::kUpnp);
  RecordedMapping rule;
  rule.protocol = IpProtocol::kTcp;
  rule.externalPort = static_cast<uint16_t>(mFirst + 5);
  rule.internalPort = 8080;
  rule.internalClient = "127.0.0.1";
  rule.held = true;
  rule.ruleId = "web";
  record.Put(rule);
  ASSERT_TRUE(SaveMappingState(kMappingStatePath, state));
  FakeIgd::Entry userEntry{"TCP", rule.externalPort,    "127.0.0.1", 8080,
                           0,     "zarkportforward web"};
  mIgd.PutEntry(userEntry);

  ASSERT_EQ(0, Run(10)) << mResult.error;
  EXPECT_EQ(10, mResult.record.max_mappings);
  for (const SoapRequest &request : mIgd.SoapRequests()) {
    if (request.action == "AddPortMapping" ||
        request.action == "DeletePortMapping") {
      EXPECT_NE(std::to_string(mFirst + 3), request.Arg("NewExternalPort"));
      EXPECT_NE(std::to_string(mFirst + 5), request.Arg("NewExternalPort"));
    }
  }
  EXPECT_EQ((std::vector<FakeIgd::Entry>{other, userEntry}), mIgd.Table());
  ExpectNothingLeft();
}

// A router that keeps only its last 8 mappings while confirming each one
// as it is added: the user's rules would vanish from it.
TEST_F(PortTestCompat, ARouterThatDropsMappingsSilentlyFails) {
  mIgd.OnAction("AddPortMapping",
                [&](const SoapRequest &) -> std::optional<HttpReply> {
                  std::vector<FakeIgd::Entry> table = mIgd.Table();
                  if (table.size() >= 8) {
                    mIgd.ClearTable();
                    for (std::size_t i = 1; i < table.size(); ++i) {
                      mIgd.PutEntry(table[i]);
                    }
                  }
                  return std::nullopt;
                });
  EXPECT_EQ(-1, Run(20));
  EXPECT_EQ(ZARK_UPNP_TEST_ERR_FILL, mResult.error);
  std::map<std::string, std::string> progress = ProgressFile();
  EXPECT_EQ("finished", progress[key::kAdd]);
  EXPECT_EQ("-1", progress[key::kMax]);
  EXPECT_EQ("finished", progress[key::kTerminal]);
  EXPECT_EQ(0u, progress.count(key::kDelete));
  EXPECT_TRUE(test::HasLogContaining("dropped 12 of the 20 mappings"));
  EXPECT_TRUE(mIgd.Table().empty());
  EXPECT_EQ(0, mProbe.Counters().checks);
  ExpectNothingLeft();
  UpnpTestReport report = Report();
  EXPECT_TRUE(report.failed);
  EXPECT_EQ(ZARK_UPNP_TEST_ERR_FILL, report.error);
}

TEST_F(PortTestCompat, ARouterThatStopsAnsweringWhileFillingFails) {
  mIgd.OnAction("AddPortMapping",
                [&](const SoapRequest &) -> std::optional<HttpReply> {
                  if (mIgd.Count("AddPortMapping") > 10) {
                    HttpReply gone;
                    gone.close = true;
                    return gone;
                  }
                  return std::nullopt;
                });
  EXPECT_EQ(-1, Run(60));
  EXPECT_EQ(ZARK_UPNP_TEST_ERR_FILL, mResult.error);
  EXPECT_EQ("-1", ProgressFile()[key::kMax]);
  EXPECT_TRUE(mIgd.Table().empty());
  ExpectNothingLeft();
}

TEST_F(PortTestCompat, ARouterWithoutUpnpIsNotTested) {
  StoreConf("no", "yes");
  EXPECT_EQ(-1, Run());
  EXPECT_EQ(ZARK_PORTMAP_ERR_NOT_CONFIGURED, mResult.error);
  std::map<std::string, std::string> progress = ProgressFile();
  EXPECT_EQ("failed", progress[key::kInit]);
  EXPECT_EQ("failed", progress[key::kAdd]);
  EXPECT_EQ("finished", progress[key::kTerminal]);
  EXPECT_EQ(0, mIgd.TotalRequests());
  EXPECT_TRUE(test::HasLogContaining("is driven by natpmp, not UPnP"));
  ExpectNothingLeft();
}

TEST_F(PortTestCompat, NoRouterConfigured) {
  test::ResetFixedPaths();
  SetLibraryConfig(kProbeKey, mProbe.Address());
  EXPECT_EQ(-1, Run());
  EXPECT_EQ(ZARK_PORTMAP_ERR_NOT_CONFIGURED, mResult.error);
  EXPECT_EQ(0, mIgd.TotalRequests());
}

TEST_F(PortTestCompat, NoProbeServiceNoTest) {
  SetLibraryConfig(kProbeKey, "");
  EXPECT_EQ(-1, Run());
  EXPECT_EQ(ZARK_UPNP_TEST_ERR_INIT, mResult.error);
  EXPECT_EQ("failed", ProgressFile()[key::kInit]);
  EXPECT_EQ(0, mIgd.TotalRequests());
  EXPECT_EQ("no probe service configured", Report().reason);
}

TEST_F(PortTestCompat, NoUpnpServiceAnswers) {
  RouterOverrides overrides;
  overrides.upnpRootDescUrls = {
      "http://127.0.0.1:" + std::to_string(FreePort()) + "/rootDesc.xml"};
  overrides.localNetworks = kLoopback;
  SetRouterOverridesForTesting(overrides);
  EXPECT_EQ(-1, Run());
  EXPECT_EQ(ZARK_UPNP_TEST_ERR_INIT, mResult.error);
  EXPECT_EQ("failed", ProgressFile()[key::kInit]);
  ExpectNothingLeft();
}

TEST_F(PortTestCompat, ADeletedMappingThatStillAnswersFails) {
  mPath.SetMode(RouterPath::Mode::kAlwaysOpen);
  EXPECT_EQ(-1, Run(10));
  EXPECT_EQ(ZARK_UPNP_TEST_ERR_STILL_OPEN, mResult.error);
  std::map<std::string, std::string> progress = ProgressFile();
  EXPECT_EQ("finished", progress[key::kDelete]);
  EXPECT_EQ("failed", progress[key::kConnectionFailed]);
  EXPECT_EQ(0u, progress.count(key::kReadd1));
  EXPECT_TRUE(mIgd.Table().empty());
  ExpectNothingLeft();
}

TEST_F(PortTestCompat, AReaddedMappingThatDoesNotAnswerFails) {
  mPath.SetMode(RouterPath::Mode::kAlwaysClosed);
  EXPECT_EQ(-1, Run(10));
  EXPECT_EQ(ZARK_UPNP_TEST_ERR_NOT_OPEN, mResult.error);
  std::map<std::string, std::string> progress = ProgressFile();
  EXPECT_EQ("success", progress[key::kConnectionFailed]);
  EXPECT_EQ("finished", progress[key::kReadd2]);
  EXPECT_EQ("failed", progress[key::kConnectionSuccess]);
  EXPECT_EQ("finished", progress[key::kTerminal]);
  // The re-added mapping is gone too.
  EXPECT_TRUE(mIgd.Table().empty());
  EXPECT_EQ(10 + 2, mIgd.Count("AddPortMapping"));
  EXPECT_EQ(10 + 1, mIgd.Count("DeletePortMapping"));
  ExpectNothingLeft();
}

// A router that refuses to add a mapping over one it already holds: the
// way a renewal reaches it.
TEST_F(PortTestCompat, ARouterThatRefusesARenewalFails) {
  mIgd.OnAction("AddPortMapping",
                [&](const SoapRequest &request) -> std::optional<HttpReply> {
                  for (const FakeIgd::Entry &entry : mIgd.Table()) {
                    if (std::to_string(entry.externalPort) ==
                        request.Arg("NewExternalPort")) {
                      return SoapFault(718, "ConflictInMappingEntry");
                    }
                  }
                  return std::nullopt;
                });
  EXPECT_EQ(-1, Run(10));
  EXPECT_EQ(ZARK_UPNP_TEST_ERR_READD, mResult.error);
  std::map<std::string, std::string> progress = ProgressFile();
  EXPECT_EQ("success", progress[key::kReadd1]);
  EXPECT_EQ("failed", progress[key::kReadd2]);
  EXPECT_TRUE(mIgd.Table().empty());
  ExpectNothingLeft();
}

// Stopped while filling the table, from another thread of this process:
// the filling ends, every mapping goes, and the stop returns once the test
// has ended.
TEST_F(PortTestCompat, AStopInTheMiddle) {
  std::thread stopper;
  std::atomic<int> stopped{1};
  mSeen.hook = [&](int progress) {
    if (progress >= 30 && !stopper.joinable()) {
      stopper = std::thread([&] { stopped = StopUpnpCompatibilityTest(mEnv); });
      // Bounded wait until the request is there, so that the next look
      // sees it.
      for (int i = 0; i < 1000 && ::access(kUpnpTestStopPath, F_OK) != 0; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
      }
    }
  };
  EXPECT_EQ(-1, Run(60));
  ASSERT_TRUE(stopper.joinable());
  stopper.join();
  EXPECT_EQ(0, stopped.load());
  EXPECT_EQ(ZARK_UPNP_TEST_ERR_STOPPED, mResult.error);
  EXPECT_EQ("-1", ProgressFile()[key::kMax]);
  EXPECT_EQ("finished", ProgressFile()[key::kTerminal]);
  EXPECT_LT(mIgd.Count("AddPortMapping"), 60);
  EXPECT_TRUE(mIgd.Table().empty());
  EXPECT_TRUE(test::HasLogContaining("stopped on request"));
  ExpectNothingLeft();
}

// The same from another process, through the C call.
TEST_F(PortTestCompat, AStopFromAnotherProcess) {
  pid_t child = -1;
  mSeen.hook = [&](int progress) {
    if (progress >= 30 && child < 0) {
      child = ::fork();
      if (child == 0) {
        // A process of its own, not a copy of the test's: none of the
        // test's descriptors (its running mark among them) is shared.
        ::close_range(3, ~0u, 0);
        ::_exit(KLibStopTestUpnpCompatibility() == 0 ? 0 : 1);
      }
      for (int i = 0; i < 1000 && ::access(kUpnpTestStopPath, F_OK) != 0; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
      }
    }
  };
  EXPECT_EQ(-1, Run(60));
  ASSERT_GT(child, 0);
  int status = -1;
  // Bounded: the child's own wait is bounded too.
  for (int i = 0; i < 3000; ++i) {
    if (::waitpid(child, &status, WNOHANG) == child) {
      break;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
  EXPECT_EQ(ZARK_UPNP_TEST_ERR_STOPPED, mResult.error);
  EXPECT_TRUE(mIgd.Table().empty());
  ExpectNothingLeft();
}

// A test whose process was killed left mappings: a stop (or the next test)
// removes those that are ours, and marks the test ended.
TEST_F(PortTestCompat, LeftoversOfAKilledTestAreRemoved) {
  const uint16_t a = mFirst;
  const uint16_t b = static_cast<uint16_t>(mFirst + 1);
  const uint16_t c = static_cast<uint16_t>(mFirst + 2);
  mIgd.PutEntry({"TCP", a, "127.0.0.1", a, 0, kUpnpTestDescription});
  mIgd.PutEntry({"TCP", b, "127.0.0.1", b, 0, kUpnpTestDescription});
  // Since taken by someone else: stays.
  const FakeIgd::Entry other{"TCP", c, "127.0.0.7", 22, 0, "ssh"};
  mIgd.PutEntry(other);
  UpnpTestRun run;
  run.runId = "dead";
  run.pid = 1;
  run.gateway = "127.0.0.1";
  run.location = mIgd.RootDescUrl();
  run.client = "127.0.0.1";
  run.ports = {a, b, c, static_cast<uint16_t>(mFirst + 3)};
  test::WriteFile(kUpnpTestRunPath, SerializeUpnpTestRun(run));
  test::WriteFile(ZARK_PORTMAP_UPNP_TEST_PROGRESS,
                  "upnp_init=success\nupnp_add=finished\nupnp_max=2\n");

  ASSERT_EQ(0, KLibStopTestUpnpCompatibility());
  EXPECT_EQ((std::vector<FakeIgd::Entry>{other}), mIgd.Table());
  EXPECT_NE(0, ::access(kUpnpTestRunPath, F_OK));
  std::map<std::string, std::string> progress = ProgressFile();
  EXPECT_EQ("-1", progress[key::kMax]);
  EXPECT_EQ("finished", progress[key::kTerminal]);
}

TEST_F(PortTestCompat, LeftoversAreRemovedBeforeTheNextTest) {
  const uint16_t old = static_cast<uint16_t>(mFirst + 200);
  mIgd.PutEntry({"TCP", old, "127.0.0.1", old, 0, kUpnpTestDescription});
  UpnpTestRun run;
  run.runId = "dead";
  run.gateway = "127.0.0.1";
  run.location = mIgd.RootDescUrl();
  run.client = "127.0.0.1";
  run.ports = {old};
  test::WriteFile(kUpnpTestRunPath, SerializeUpnpTestRun(run));
  ASSERT_EQ(0, Run(3)) << mResult.error;
  EXPECT_TRUE(mIgd.Table().empty());
  ExpectNothingLeft();
}

TEST_F(PortTestCompat, StopWithNothingRunningAndNothingLeft) {
  EXPECT_EQ(0, KLibStopTestUpnpCompatibility());
  EXPECT_EQ(0, mIgd.TotalRequests());
}

TEST_F(PortTestCompat, OneTestAtATime) {
  test::WriteFile(ZARK_PORTMAP_UPNP_TEST_PROGRESS, "upnp_init=processing\n");
  RunningTaskMark other(ZARK_PORTMAP_TASK_UPNP_TEST);
  ASSERT_TRUE(other.Held());
  EXPECT_EQ(-1, Run());
  EXPECT_EQ(ZARK_PORTMAP_ERR_GENERIC, mResult.error);
  // The running test's progress is not touched.
  EXPECT_EQ("upnp_init=processing\n",
            test::ReadFile(ZARK_PORTMAP_UPNP_TEST_PROGRESS));
  EXPECT_EQ(0, mIgd.TotalRequests());
}

// While the test runs, a rule save cannot take the port-map lock; while a
// save holds it, no test starts.
TEST_F(PortTestCompat, TheTestAndRuleSavesExcludeEachOther) {
  ZarkPortMapSetLockTimeoutForTesting(std::chrono::milliseconds(50));
  int duringTest = 1;
  mSeen.hook = [&](int progress) {
    if (progress == 20) {
      std::thread save([&] {
        duringTest = KLibZarkPortMapLock();
        if (duringTest == 0) {
          (void)KLibZarkPortMapUnLock();
        }
      });
      save.join();
    }
  };
  ASSERT_EQ(0, Run(3)) << mResult.error;
  EXPECT_EQ(-1, duringTest);

  std::atomic<bool> held{false};
  std::atomic<bool> release{false};
  std::thread save([&] {
    ASSERT_EQ(0, KLibZarkPortMapLock());
    held = true;
    for (int i = 0; i < 1000 && !release; ++i) {
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    (void)KLibZarkPortMapUnLock();
  });
  for (int i = 0; i < 1000 && !held; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  mSeen.hook = nullptr;
  mIgd.ResetCounts();
  EXPECT_EQ(-1, Run(3));
  EXPECT_EQ(ZARK_PORTMAP_ERR_GENERIC, mResult.error);
  EXPECT_EQ(0, mIgd.TotalRequests());
  release = true;
  save.join();
  ZarkPortMapSetLockTimeoutForTesting(std::chrono::seconds(30));
}

TEST_F(PortTestCompat, BadArguments) {
  EXPECT_EQ(-1, Run(0));
  EXPECT_EQ(ZARK_PORTMAP_ERR_BAD_PARAMETER, mResult.error);
  EXPECT_EQ(-1, Run(kMaxUpnpTestMappings + 1));
  EXPECT_EQ(ZARK_PORTMAP_ERR_BAD_PARAMETER, mResult.error);
  EXPECT_EQ(-1, KLibTestUpnpCompatibility(60, nullptr, nullptr, nullptr, true));
  EXPECT_EQ(0, mIgd.TotalRequests());
}

TEST_F(PortTestCompat, WithoutTheProgressFile) {
  mEnv.writeProgress = false;
  ASSERT_EQ(0, Run(3)) << mResult.error;
  EXPECT_NE(0, ::access(ZARK_PORTMAP_UPNP_TEST_PROGRESS, F_OK));
  EXPECT_EQ(100, mSeen.progress.back());
}

} // namespace
} // namespace zark::portmap
