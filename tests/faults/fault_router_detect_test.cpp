// The router's daemon killed, or the router's LAN link cut, while a router
// detection (the module's detect, on the real library) asks the router
// about UPnP and NAT-PMP. The outside host serves the name and the WAN
// listener the earlier steps need (outside_services.h).
//
// The daemon is frozen (SIGSTOP) before the detection starts: the steps
// before the router's do not need it (the kernel routes), and the router
// step then waits on it, so that the fault surely comes while that step is
// under way. The detection must end by itself within its bounds (300 ms
// of SSDP search, 875 ms of NAT-PMP tries, 1 s for the description) with
// the router step "failed", release its lock, and succeed once the router
// is back.
#include "detect/detect_router.h"
#include "detect_support.h"
#include "fault_support.h"
#include "outside_services.h"

#include "libzarkportmap.h"
#include "syslog_capture.h"
#include "webapi.h"

#include <memory>
#include <vector>

namespace zark::faults {
namespace {

using zark::integration::Answer;
using zark::integration::Invoke;

constexpr std::chrono::seconds kDetectionEndsWithin{30};

const std::vector<std::string> kSteps = {
    "check_interface_enable_step", "check_gateway_setting_step",
    "check_connect_wan_step",      "check_hops_lan2wan_step",
    "check_dns_setting_step",      "detect_router_step"};

class FaultRouterDetect : public FaultTest {
protected:
  void SetUp() override {
    FaultTest::SetUp();
    if (HasFatalFailure()) {
      return;
    }
    std::string why;
    ASSERT_TRUE(zark::integration::ConfigureDetection(mNet, why)) << why;
    mOutside = std::make_unique<zark::integration::OutsideServices>(
        mNet, zark::integration::kDetectProbeName, mNet.wanOutside,
        zark::integration::kWanProbePort);
    ASSERT_TRUE(mOutside->Running()) << mOutside->Why();
  }

  // Starts a detection and follows detect_status to its end (at most
  // kDetectionEndsWithin); with fault, the router's daemon is frozen first
  // and fault is applied once the router step has begun.
  Answer Detect(const std::function<void()> &fault, Json::Value &history) {
    if (fault) {
      FreezeRouter();
      if (HasFatalFailure()) {
        return Answer{};
      }
    }
    Answer started = Invoke(kApiPortForwarding, "detect");
    EXPECT_TRUE(started.success) << started.errorCode;
    const std::string taskId = started.data["task_id"].asString();
    EXPECT_FALSE(taskId.empty());
    Json::Value params(Json::objectValue);
    params["task_id"] = taskId;
    if (fault) {
      bool atRouter = WaitUntil(
          [&] {
            Answer status = Invoke(kApiPortForwarding, "detect_status", params);
            Note(history, status.data);
            return status.success && status.data["status"] == "processing" &&
                   status.data["percentage"] == ZARK_DETECT_STAGE_ROUTER;
          },
          std::chrono::seconds(20), std::chrono::milliseconds(1));
      EXPECT_TRUE(atRouter) << "the detection never reported its router step\n"
                            << history.toStyledString();
      if (!atRouter) {
        return Answer{};
      }
      fault();
    }
    bool ended = false;
    Answer last = PollStatus(
        kApiPortForwarding, "detect_status", taskId,
        [](const Answer &answer) {
          return !answer.success ||
                 answer.data["status"].asString() == "success";
        },
        kDetectionEndsWithin, history, ended);
    EXPECT_TRUE(ended) << "the detection did not end within "
                       << kDetectionEndsWithin.count() << " s\n"
                       << history.toStyledString();
    ZARK::APIPolling::JoinAll();
    return last;
  }

  // The detection met the fault in its router step and said so.
  void ExpectStoppedAtTheRouterStep(const Answer &answer,
                                    const Json::Value &history) {
    ASSERT_TRUE(answer.success) << history.toStyledString();
    const Json::Value &data = answer.data;
    EXPECT_EQ("success", data["status"].asString());
    EXPECT_EQ(100, data["percentage"].asInt());
    for (std::size_t i = 0; i + 1 < kSteps.size(); ++i) {
      EXPECT_EQ("success", data["progress"][kSteps[i]]["status"].asString())
          << kSteps[i] << "\n"
          << data.toStyledString();
    }
    EXPECT_EQ("failed",
              data["progress"]["detect_router_step"]["status"].asString())
        << data.toStyledString();
    EXPECT_FALSE(data.isMember("router_brand")) << data.toStyledString();
    EXPECT_TRUE(zark::test::HasLogContaining(
        "detection stopped at the router check (stage 80)"))
        << ::testing::PrintToString(zark::test::CapturedMessages());
    ZARK_ROUTER_DETECT_RESULT kept{};
    ASSERT_EQ(0, KLibGetRouterDetectResult(&kept));
    EXPECT_EQ(ZARK_DETECT_STAGE_ROUTER, kept.enProgress);
    // No lock of the detection or of the port map is left held.
    std::string why;
    EXPECT_TRUE(LockFree(zark::portmap::kDetectLockPath, why)) << why;
    EXPECT_TRUE(LockFree(ZARK_PORTMAP_LOCK_FILE, why)) << why;
  }

  // A detection with the router back finds it.
  void ExpectDetectionSucceeds() {
    Json::Value history(Json::arrayValue);
    Answer answer = Detect(nullptr, history);
    ASSERT_TRUE(answer.success) << history.toStyledString();
    const Json::Value &data = answer.data;
    EXPECT_EQ("success", data["status"].asString());
    for (const std::string &step : kSteps) {
      const std::string status = data["progress"][step]["status"].asString();
      if (step == "check_hops_lan2wan_step") {
        // The router's kernel limits the ICMP answers the hop count relies
        // on to about one a second; right after the first run it may stay
        // silent, which the step reports as a warning.
        EXPECT_TRUE(status == "success" || status == "warning")
            << data.toStyledString();
        continue;
      }
      EXPECT_EQ("success", status) << step << "\n" << data.toStyledString();
    }
    EXPECT_EQ("ZarkTest: TestIGD(1)", data["upnp_pfpath"].asString());
    EXPECT_EQ("yes", data["support_upnp"].asString());
    EXPECT_EQ("yes", data["support_natpmp"].asString());
  }

  std::unique_ptr<zark::integration::OutsideServices> mOutside;
};

TEST_F(FaultRouterDetect, DaemonKilledFailsTheRouterStepAndTheNextRunFindsIt) {
  Json::Value history(Json::arrayValue);
  Answer answer = Detect([this] { KillRouter(); }, history);
  ASSERT_FALSE(HasFatalFailure());
  ExpectStoppedAtTheRouterStep(answer, history);
  RestartRouter(true);
  ASSERT_FALSE(HasFatalFailure());
  ExpectDetectionSucceeds();
}

TEST_F(FaultRouterDetect, LanCutFailsTheRouterStepAndTheNextRunFindsIt) {
  Json::Value history(Json::arrayValue);
  Answer answer = Detect(
      [this] {
        // The daemon answers again, but nothing reaches this server.
        CutLan();
        ThawRouter();
      },
      history);
  ASSERT_FALSE(HasFatalFailure());
  ExpectStoppedAtTheRouterStep(answer, history);
  RestoreLan();
  ASSERT_FALSE(HasFatalFailure());
  ExpectDetectionSucceeds();
}

} // namespace
} // namespace zark::faults
