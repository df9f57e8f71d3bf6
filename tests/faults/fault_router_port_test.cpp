// The router's daemon killed, or the router's LAN link cut, while the
// reachability test of rules (the module's Rules test, on the real library)
// asks the probe service on the outside host about each rule. Three rules
// are forwarded. The first two end at temporary listeners of the test,
// which answer within milliseconds; the local port of the third, UDP, is
// held by a service that never replies, which keeps the test going for the
// probe service's 2 s of waiting for a reply ("unknown"), and the fault
// comes while that rule is being tested.
//
// The test must end by itself within its bounds (the probe client waits at
// most 10 s for an answer) with a verdict or a reason for every rule and
// no rule left "testing"; a verdict it could not get is not made up. The
// port-map lock is freed, the temporary listeners are closed, and once the
// router is back the same test gives every verdict again.
#include "fault_support.h"

#include "RouterRuleConf.h"
#include "base/library_config.h"
#include "db_test_support.h"
#include "libzarkportmap.h"
#include "webapi.h"

#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <memory>

namespace zark::faults {
namespace {

using zark::integration::Answer;
using zark::integration::Invoke;
using zark::integration::kApiRules;
using zark::testnet::OutsideProcess;

constexpr uint16_t kProbePort = 7777;
constexpr const char *kSelection = "/tmp/selection.conf";
constexpr std::chrono::seconds kTestEndsWithin{40};

// True when nothing listens on port (TCP or UDP) in this namespace.
bool Free(int type, uint16_t port) {
  int fd = ::socket(AF_INET, type | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  bool ok = fd >= 0 && ::bind(fd, reinterpret_cast<sockaddr *>(&address),
                              sizeof(address)) == 0;
  if (fd >= 0) {
    ::close(fd);
  }
  return ok;
}

constexpr char kSilentVerdict[] =
    "unknown: a service listens on udp port 5002 and does not answer the "
    "probe";

class FaultRouterPortTest : public FaultTest {
protected:
  void SetUp() override {
    FaultTest::SetUp();
    if (HasFatalFailure()) {
      return;
    }
    // The service of the third rule: bound, never answering.
    mSilent = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(5002);
    ASSERT_TRUE(mSilent >= 0 &&
                ::bind(mSilent, reinterpret_cast<sockaddr *>(&address),
                       sizeof(address)) == 0)
        << std::strerror(errno);
    mProbe = std::make_unique<OutsideProcess>(
        mNet, std::vector<std::string>{ZARK_PROBED_PATH, "--listen",
                                       mNet.wanOutside + ":" +
                                           std::to_string(kProbePort)});
    ASSERT_TRUE(mProbe->WaitForTcp(mNet.wanOutside, kProbePort))
        << "zark-probed does not listen on the outside host";
    zark::test::SetLibraryConfig(
        std::string(zark::portmap::config_key::kProbeServiceAddress),
        mNet.wanOutside + ":" + std::to_string(kProbePort));
    ConfigureUpnpRouter();
    ASSERT_FALSE(HasFatalFailure());

    Json::Value rules(Json::arrayValue);
    rules.append(Rule("0", "tcp", "18080", "8080"));
    rules.append(Rule("1", "udp", "15000", "5000"));
    rules.append(Rule("2", "udp", "15002", "5002"));
    Json::Value history(Json::arrayValue);
    ASSERT_TRUE(Save(rules, history)) << history.toStyledString();

    // The test's selection: the saved rules.
    RouterRuleConfWriter writer;
    ASSERT_TRUE(writer.AddRule("0", true, "18080", "8080", "tcp", "", ""));
    ASSERT_TRUE(writer.AddRule("1", true, "15000", "5000", "udp", "", ""));
    ASSERT_TRUE(writer.AddRule("2", true, "15002", "5002", "udp", "", ""));
    ASSERT_TRUE(writer.Sync(kSelection));
  }

  void TearDown() override {
    FaultTest::TearDown();
    if (mSilent >= 0) {
      ::close(mSilent);
    }
  }

  // Runs the Rules test of the selection and follows test_status to its
  // end (at most kTestEndsWithin); with fault, fault is applied once both
  // forwarded rules have their verdict and the third is being tested.
  Answer RunTest(const std::function<void()> &fault, Json::Value &history) {
    Json::Value params(Json::objectValue);
    params["selection"] = kSelection;
    Answer started = Invoke(kApiRules, "test", params);
    EXPECT_TRUE(started.success) << started.errorCode;
    const std::string taskId = started.data["task_id"].asString();
    EXPECT_FALSE(taskId.empty());
    Json::Value status(Json::objectValue);
    status["task_id"] = taskId;
    if (fault) {
      bool testing = WaitUntil(
          [&] {
            Answer seen = Invoke(kApiRules, "test_status", status);
            Note(history, seen.data);
            const Json::Value &rules = seen.data["rules"];
            return seen.success && seen.data["status"] == "update" &&
                   rules["0"] == "reachable" && rules["1"] == "reachable" &&
                   rules["2"] == "testing";
          },
          std::chrono::seconds(20), std::chrono::milliseconds(2));
      EXPECT_TRUE(testing) << "the third rule was never seen under test\n"
                           << history.toStyledString();
      if (!testing) {
        return Answer{};
      }
      fault();
    }
    bool ended = false;
    Answer last = PollStatus(
        kApiRules, "test_status", taskId,
        [](const Answer &answer) {
          return !answer.success ||
                 answer.data["status"].asString() == "success";
        },
        kTestEndsWithin, history, ended);
    EXPECT_TRUE(ended) << "the test did not end within "
                       << kTestEndsWithin.count() << " s\n"
                       << history.toStyledString();
    ZARK::APIPolling::JoinAll();
    return last;
  }

  // What the test leaves behind, fault or not.
  void ExpectNothingHeld() {
    std::string why;
    EXPECT_TRUE(LockFree(ZARK_PORTMAP_LOCK_FILE, why)) << why;
    EXPECT_TRUE(Free(SOCK_STREAM, 8080));
    EXPECT_TRUE(Free(SOCK_DGRAM, 5000));
  }

  // The same test with the router back gives every verdict.
  void ExpectEveryVerdict() {
    Json::Value history(Json::arrayValue);
    Answer last = RunTest(nullptr, history);
    ASSERT_TRUE(last.success) << history.toStyledString();
    EXPECT_EQ("success", last.data["status"].asString());
    EXPECT_EQ(Verdicts(kSilentVerdict), last.data["rules"])
        << history.toStyledString();
    ExpectNothingHeld();
  }

  static Json::Value Verdicts(const char *third) {
    Json::Value verdicts(Json::objectValue);
    verdicts["0"] = "reachable";
    verdicts["1"] = "reachable";
    verdicts["2"] = third;
    return verdicts;
  }

  std::unique_ptr<OutsideProcess> mProbe;
  int mSilent = -1;
};

TEST_F(FaultRouterPortTest, DaemonKilledTheTestEndsWithEveryVerdict) {
  Json::Value history(Json::arrayValue);
  Answer last = RunTest([this] { KillRouter(); }, history);
  ASSERT_FALSE(HasFatalFailure());
  // The probes pass through the router's kernel, which keeps forwarding
  // what the killed daemon mapped: the verdicts are those of a live one.
  ASSERT_TRUE(last.success) << history.toStyledString();
  EXPECT_EQ("success", last.data["status"].asString());
  EXPECT_EQ(Verdicts(kSilentVerdict), last.data["rules"])
      << history.toStyledString();
  ExpectNothingHeld();
  RestartRouter(true);
  ASSERT_FALSE(HasFatalFailure());
  ExpectEveryVerdict();
}

TEST_F(FaultRouterPortTest, LanCutTheTestEndsAndSaysTheRuleWasNotTested) {
  Json::Value history(Json::arrayValue);
  Answer last = RunTest([this] { CutLan(); }, history);
  ASSERT_FALSE(HasFatalFailure());
  // The verdicts given before the cut stay; the rule under test when the
  // probe service's answer was cut off is reported as such, not guessed.
  ASSERT_TRUE(last.success) << history.toStyledString();
  EXPECT_EQ("success", last.data["status"].asString());
  EXPECT_EQ(Verdicts("probe service not reachable"), last.data["rules"])
      << history.toStyledString();
  ExpectNothingHeld();
  RestoreLan();
  ASSERT_FALSE(HasFatalFailure());
  ExpectEveryVerdict();
}

} // namespace
} // namespace zark::faults
