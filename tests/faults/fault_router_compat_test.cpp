// The router's daemon killed, or the router's LAN link cut, while the UPnP
// compatibility test (the module's Compatibility test, on the real
// library) fills the router's table: the module asks for 60 mappings,
// which the test network's miniupnpd all takes, one request after the
// other, and the fault comes after a few.
//
// The test must end by itself within its bounds (each router request: 3 s
// to connect, 5 s of silence; the cleanup stops at the first request left
// unanswered) as "failed", free the port-map lock and the running-job mark;
// once the router is back, the next test removes what the broken one left
// on the router, passes with the router's 60, and leaves nothing behind.
#include "fault_support.h"

#include "base/library_config.h"
#include "db_test_support.h"
#include "libzarkportmap.h"
#include "webapi.h"

#include <cstdlib>
#include <memory>

namespace zark::faults {
namespace {

using zark::integration::Answer;
using zark::integration::Invoke;
using zark::testnet::OutsideProcess;

constexpr uint16_t kProbePort = 7777;
constexpr std::chrono::seconds kTestEndsWithin{60};

class FaultRouterCompat : public FaultTest {
protected:
  void SetUp() override {
    FaultTest::SetUp();
    if (HasFatalFailure()) {
      return;
    }
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
  }

  // Runs the compatibility test and polls test_status until it says
  // "success" or "failed" (at most kTestEndsWithin); with fault, fault is
  // applied once the table holds a few of the test's mappings and is still
  // filling.
  Answer RunTest(const std::function<void()> &fault, Json::Value &history) {
    Answer started = Invoke(kApiCompatibility, "test");
    EXPECT_TRUE(started.success) << started.errorCode;
    Json::Value params(Json::objectValue);
    params["task_id"] = started.data["task_id"];
    if (fault) {
      bool filling = WaitUntil(
          [&] {
            Answer seen = Invoke(kApiCompatibility, "test_status", params);
            Note(history, seen.data);
            const Json::Value &items = seen.data["test"];
            if (!seen.success || seen.data["status"] != "processing" ||
                items.size() < 2 || items[1]["test_item"] != "max") {
              return false;
            }
            // "max" counts the mappings held while the table fills.
            const long held =
                std::strtol(items[1]["status"].asCString(), nullptr, 10);
            return held >= 3 && held <= 40;
          },
          std::chrono::seconds(30), std::chrono::milliseconds(2));
      EXPECT_TRUE(filling) << "the test was never seen filling the table\n"
                           << history.toStyledString();
      if (!filling) {
        return Answer{};
      }
      fault();
    }
    bool ended = false;
    Answer last = PollStatus(
        kApiCompatibility, "test_status", params["task_id"].asString(),
        [](const Answer &answer) {
          const std::string status = answer.data.get("status", "").asString();
          return !answer.success || status == "success" || status == "failed";
        },
        kTestEndsWithin, history, ended);
    EXPECT_TRUE(ended) << "the compatibility test did not end within "
                       << kTestEndsWithin.count() << " s\n"
                       << history.toStyledString();
    ZARK::APIPolling::JoinAll();
    return last;
  }

  void ExpectNothingHeld() {
    std::string why;
    EXPECT_TRUE(LockFree(ZARK_PORTMAP_LOCK_FILE, why)) << why;
    ZARK_LIBZARKPORTMAP_TASK task{-1};
    EXPECT_EQ(0, KLibGetLibZarkPortMapRunningTask(&task));
    EXPECT_EQ(ZARK_PORTMAP_TASK_NONE, task.task);
  }

  void ExpectFailed(const Answer &last, const Json::Value &history) {
    ASSERT_TRUE(last.success) << history.toStyledString();
    EXPECT_EQ("failed", last.data["status"].asString())
        << history.toStyledString();
    EXPECT_EQ(-1, last.data["percentage"].asInt());
    EXPECT_EQ(zark::integration::ParseJson(R"([
        {"test_item": "add", "status": "failed"}])"),
              last.data["test"]);
    ExpectNothingHeld();
  }

  // With the router back, a new test passes and cleans up after both.
  void ExpectNextTestPasses() {
    Json::Value history(Json::arrayValue);
    Answer last = RunTest(nullptr, history);
    ASSERT_TRUE(last.success) << history.toStyledString();
    EXPECT_EQ("success", last.data["status"].asString())
        << history.toStyledString();
    EXPECT_EQ(zark::integration::ParseJson(R"([
        {"test_item": "add", "status": "success"},
        {"test_item": "max", "status": "60"},
        {"test_item": "del", "status": "success"},
        {"test_item": "readd", "status": "success"},
        {"test_item": "con_s", "status": "success"}])"),
              last.data["test"]);
    EXPECT_TRUE(RouterMappings().empty());
    ExpectNothingHeld();
  }

  std::unique_ptr<OutsideProcess> mProbe;
};

TEST_F(FaultRouterCompat, DaemonKilledFailsTheTestAndTheNextOnePasses) {
  Json::Value history(Json::arrayValue);
  Answer last = RunTest([this] { KillRouter(); }, history);
  ASSERT_FALSE(HasFatalFailure());
  ExpectFailed(last, history);
  RestartRouter(true);
  ASSERT_FALSE(HasFatalFailure());
  ExpectNextTestPasses();
}

TEST_F(FaultRouterCompat, LanCutFailsTheTestAndTheNextOnePasses) {
  Json::Value history(Json::arrayValue);
  Answer last = RunTest([this] { CutLan(); }, history);
  ASSERT_FALSE(HasFatalFailure());
  ExpectFailed(last, history);
  RestoreLan();
  ASSERT_FALSE(HasFatalFailure());
  ExpectNextTestPasses();
}

} // namespace
} // namespace zark::faults
