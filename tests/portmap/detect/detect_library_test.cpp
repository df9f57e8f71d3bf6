// The C interface of detection on fakes, in the private mount namespace:
// KLibDetectRouter announces stage 10 first, keeps its result on disk for
// KLibGetRouterDetectResult, refuses a second run at once; and
// ZARKIGetExternalIP asks the configured router, then a probe, then the
// probe service.
#include "catalog/detect_result_store.h"
#include "detect_fakes.h"
#include "drivers/natpmp.h"
#include "drivers/upnp.h"
#include "fake_igd.h"
#include "fake_natpmp.h"
#include "hermetic.h"
#include "libzarkportmap.h"
#include "reach/external_address.h"
#include "syslog_capture.h"
#include "zarknet.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstring>

namespace zark::test {
namespace {

using namespace zark::portmap;

struct Seen {
  std::vector<int32_t> stages;
};

void Record(ZARK_ROUTER_DETECT_RESULT *result, void *arg) {
  static_cast<Seen *>(arg)->stages.push_back(result->enProgress);
}

class DetectLibrary : public testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    ClearLogs();
    SetDetectEnvironmentFactoryForTesting([this] {
      DetectEnvironment environment = MakeFakeEnvironment(mScene);
      if (mAdjust) {
        mAdjust(mScene);
      }
      return environment;
    });
  }
  void TearDown() override { SetDetectEnvironmentFactoryForTesting(nullptr); }

  Scene mScene;
  std::function<void(Scene &)> mAdjust;
};

TEST_F(DetectLibrary, DetectAnnouncesStartThenEveryStageAndKeepsTheResult) {
  ZARK_ROUTER_DETECT_RESULT result;
  std::memset(&result, 0x5A, sizeof(result));
  Seen seen;
  ASSERT_EQ(0, KLibDetectRouter(&result, Record, &seen, true));
  EXPECT_EQ((std::vector<int32_t>{10, 20, 30, 40, 70, 50, 80, 100}),
            seen.stages);
  EXPECT_EQ(100, result.enProgress);
  EXPECT_STREQ("Acme: R1(2.0)", result.upnp_pfpath);

  ZARK_ROUTER_DETECT_RESULT stored;
  std::memset(&stored, 0x33, sizeof(stored));
  ASSERT_EQ(0, KLibGetRouterDetectResult(&stored));
  EXPECT_EQ(0, std::memcmp(&result, &stored, sizeof(result)));
}

TEST_F(DetectLibrary, AStoppedRunIsKeptToo) {
  mAdjust = [](Scene &scene) { scene.connector->answering.clear(); };
  ZARK_ROUTER_DETECT_RESULT result{};
  EXPECT_EQ(-1, KLibDetectRouter(&result, nullptr, nullptr, true));
  EXPECT_EQ(40, result.enProgress);
  ZARK_ROUTER_DETECT_RESULT stored{};
  ASSERT_EQ(0, KLibGetRouterDetectResult(&stored));
  EXPECT_EQ(40, stored.enProgress);
  EXPECT_STREQ("192.168.1.1", stored.gateway_ip);
}

TEST_F(DetectLibrary, FlagFalseKeepsNothing) {
  ZARK_ROUTER_DETECT_RESULT result{};
  ASSERT_EQ(0, KLibDetectRouter(&result, nullptr, nullptr, false));
  ClearLogs();
  ZARK_ROUTER_DETECT_RESULT stored{};
  stored.enProgress = 42;
  std::strcpy(stored.upnp_pfpath, "left over");
  EXPECT_EQ(0, KLibGetRouterDetectResult(&stored));
  EXPECT_EQ(0, stored.enProgress);
  EXPECT_STREQ("", stored.upnp_pfpath);
  EXPECT_TRUE(HasLogContaining("KLibGetRouterDetectResult: no router "
                               "detection has been run yet, answering an "
                               "empty result"));
}

TEST_F(DetectLibrary, ANewRunReplacesTheKeptResult) {
  ZARK_ROUTER_DETECT_RESULT result{};
  ASSERT_EQ(0, KLibDetectRouter(&result, nullptr, nullptr, true));
  mAdjust = [](Scene &scene) { scene.dns->names.clear(); };
  EXPECT_EQ(-1, KLibDetectRouter(&result, nullptr, nullptr, true));
  ZARK_ROUTER_DETECT_RESULT stored{};
  ASSERT_EQ(0, KLibGetRouterDetectResult(&stored));
  EXPECT_EQ(50, stored.enProgress);
  EXPECT_STREQ("", stored.upnp_pfpath);
}

TEST_F(DetectLibrary, ASecondDetectionCannotStartWhileOneRuns) {
  // Another detection (here: this test) holds the lock.
  (void)::mkdir(ZARK_PORTMAP_CONF_DIR, 0755);
  int fd = ::open(kDetectLockPath, O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  ASSERT_GE(fd, 0);
  ASSERT_EQ(0, ::flock(fd, LOCK_EX | LOCK_NB));
  ZARK_ROUTER_DETECT_RESULT result{};
  Seen seen;
  EXPECT_EQ(-1, KLibDetectRouter(&result, Record, &seen, true));
  EXPECT_EQ(10, result.enProgress);
  EXPECT_EQ(std::vector<int32_t>{10}, seen.stages);
  EXPECT_TRUE(HasLogContaining("another router detection is running"));
  EXPECT_TRUE(HasLogContaining("KLibDetectRouter: detection could not start"));
  ZARK_ROUTER_DETECT_RESULT stored{};
  EXPECT_EQ(0, KLibGetRouterDetectResult(&stored));
  EXPECT_EQ(0, stored.enProgress); // nothing kept: the empty result
  ::close(fd);

  // Released: the next run starts.
  seen = {};
  EXPECT_EQ(0, KLibDetectRouter(&result, Record, &seen, true));
  EXPECT_EQ(8u, seen.stages.size());
}

TEST_F(DetectLibrary, NullArgumentsFail) {
  EXPECT_EQ(-1, KLibDetectRouter(nullptr, nullptr, nullptr, true));
  EXPECT_TRUE(HasLogContaining("KLibDetectRouter: result must not be NULL"));
  EXPECT_EQ(-1, KLibGetRouterDetectResult(nullptr));
  EXPECT_TRUE(
      HasLogContaining("KLibGetRouterDetectResult: result must not be NULL"));
}

TEST_F(DetectLibrary, ABrokenKeptResultIsRefused) {
  WriteFile(kDetectResultPath, "{\"format\": 1, \"en_progress\": \"100\"}\n");
  ZARK_ROUTER_DETECT_RESULT stored{};
  EXPECT_EQ(-1, KLibGetRouterDetectResult(&stored));
  EXPECT_TRUE(HasLogContaining("the detection result "
                               "/etc/portforward/detect_result.json is not "
                               "understood: \"en_progress\" missing or not a "
                               "32-bit integer"));
}

TEST_F(DetectLibrary, TheKeptResultIsReadableByAnyone) {
  ZARK_ROUTER_DETECT_RESULT result{};
  ASSERT_EQ(0, KLibDetectRouter(&result, nullptr, nullptr, true));
  struct stat info {};
  ASSERT_EQ(0, ::stat(kDetectResultPath, &info));
  EXPECT_EQ(0644u, info.st_mode & 07777);
}

// --- ZARKIGetExternalIP ------------------------------------------------------

ZARK_ROUTER_CONF Conf(const char *upnp, const char *natpmp) {
  ZARK_ROUTER_CONF conf{};
  std::strcpy(conf.brand, "Generic");
  std::strcpy(conf.support_upnp, upnp);
  std::strcpy(conf.support_natpmp, natpmp);
  return conf;
}

class DetectExternalAddress : public testing::Test {
protected:
  void SetUp() override { ClearLogs(); }
  void TearDown() override {
    SetExternalAddressEnvironmentFactoryForTesting(nullptr);
  }

  // An environment whose gateway is loopback, where the fake routers are.
  ExternalAddressEnvironment Environment() {
    ExternalAddressEnvironment environment;
    environment.gateway = [this]() -> std::optional<std::string> {
      return mGateway;
    };
    environment.storedConf =
        [this](const std::string &gateway) -> std::optional<ZARK_ROUTER_CONF> {
      mConfAsked.push_back(gateway);
      return mConf;
    };
    environment.makeRouter =
        [this](RouterProtocol protocol,
               const std::string &gateway) -> std::unique_ptr<RouterDriver> {
      mMade.emplace_back(RouterProtocolName(protocol));
      if (protocol == RouterProtocol::kUpnp) {
        UpnpOptions options;
        options.gateway = gateway;
        options.knownRootDescUrls = {mIgd.RootDescUrl()};
        options.discover = false;
        options.localNetworks =
            std::vector<Ipv4Network>{{Ip("127.0.0.0"), Ip("255.0.0.0")}};
        return std::make_unique<UpnpRouter>(options);
      }
      NatPmpOptions options;
      options.gateway = gateway;
      options.port = mNatPmp.Port();
      options.firstWait = std::chrono::milliseconds(50);
      options.tries = 2;
      return std::make_unique<NatPmpRouter>(options);
    };
    auto probes = std::make_unique<FakeRouterProbes>();
    probes->upnp = mUpnp;
    probes->natpmp = mNatPmpFinding;
    mProbes = probes.get();
    environment.probes = std::move(probes);
    environment.config = [this](std::string_view key, std::string_view) {
      return key == "probe_service_address" ? mProbeService : std::string();
    };
    environment.probeService =
        [this](const std::string &service) -> std::optional<uint32_t> {
      mServiceAsked.push_back(service);
      return mServiceAnswer;
    };
    return environment;
  }

  // The environment stays until the next call, for its fakes' records.
  std::optional<uint32_t> Find() {
    mEnvironment = Environment();
    return FindExternalAddress(mEnvironment);
  }

  FakeIgd mIgd;
  FakeNatPmp mNatPmp;
  UpnpFinding mUpnp;
  NatPmpFinding mNatPmpFinding;
  FakeRouterProbes *mProbes = nullptr;
  ExternalAddressEnvironment mEnvironment;
  std::optional<std::string> mGateway = std::string("127.0.0.1");
  std::optional<ZARK_ROUTER_CONF> mConf;
  std::string mProbeService;
  std::optional<uint32_t> mServiceAnswer;
  std::vector<std::string> mConfAsked;
  std::vector<std::string> mMade;
  std::vector<std::string> mServiceAsked;
};

TEST_F(DetectExternalAddress, AConfiguredUpnpRouterTellsIt) {
  mConf = Conf("yes", "no");
  EXPECT_EQ(Ip("198.51.100.7"), Find());
  EXPECT_EQ(std::vector<std::string>{"127.0.0.1"}, mConfAsked);
  EXPECT_EQ(std::vector<std::string>{"upnp"}, mMade);
  EXPECT_EQ(1, mIgd.Count("GetExternalIPAddress"));
  EXPECT_TRUE(mProbes->upnpAsked.empty());
  EXPECT_EQ(0, mNatPmp.Requests());
}

TEST_F(DetectExternalAddress, AConfiguredNatPmpRouterTellsIt) {
  mConf = Conf("no", "yes");
  EXPECT_EQ(Ip("198.51.100.7"), Find());
  EXPECT_EQ(std::vector<std::string>{"natpmp"}, mMade);
  ASSERT_EQ(1, mNatPmp.Requests());
  EXPECT_EQ(0, mNatPmp.ReceivedRequests()[0].opcode);
  EXPECT_EQ(0, mIgd.TotalRequests());
}

TEST_F(DetectExternalAddress, WithoutConfigurationTheRouterIsProbed) {
  mUpnp.support = ProtocolSupport::kYes;
  mUpnp.externalAddress = "203.0.113.9";
  EXPECT_EQ(Ip("203.0.113.9"), Find());
  EXPECT_TRUE(mMade.empty());
  EXPECT_EQ(std::vector<std::string>{"127.0.0.1"}, mProbes->upnpAsked);
}

TEST_F(DetectExternalAddress, ARouterDrivenByItsPagesIsProbedToo) {
  mConf = Conf("no", "no");
  mNatPmpFinding.support = ProtocolSupport::kYes;
  mNatPmpFinding.publicAddress = "203.0.113.10";
  EXPECT_EQ(Ip("203.0.113.10"), Find());
  EXPECT_TRUE(mMade.empty());
}

TEST_F(DetectExternalAddress,
       AConfiguredRouterThatDoesNotAnswerFallsBackOnTheProbe) {
  mConf = Conf("yes", "no");
  mIgd.OnAction("GetExternalIPAddress", [](const SoapRequest &) {
    return std::optional<HttpReply>(SoapFault(501, "ActionFailed"));
  });
  mNatPmpFinding.support = ProtocolSupport::kYes;
  mNatPmpFinding.publicAddress = "203.0.113.11";
  EXPECT_EQ(Ip("203.0.113.11"), Find());
  EXPECT_TRUE(HasLogContaining("external address: the configured router "
                               "(upnp at 127.0.0.1) did not tell"));
}

TEST_F(DetectExternalAddress, APrivateRouterAddressAsksTheProbeService) {
  mUpnp.externalAddress = "10.1.2.3";
  mProbeService = "probe.example:7777";
  mServiceAnswer = Ip("203.0.113.50");
  EXPECT_EQ(Ip("203.0.113.50"), Find());
  EXPECT_EQ(std::vector<std::string>{"probe.example:7777"}, mServiceAsked);
  EXPECT_TRUE(HasLogContaining("external address: the router (UPnP) reports "
                               "10.1.2.3, a private address: the router is "
                               "behind another NAT"));
}

TEST_F(DetectExternalAddress, UnknownWithoutRouterAnswerOrProbeService) {
  EXPECT_EQ(std::nullopt, Find());
  EXPECT_TRUE(mServiceAsked.empty());
  EXPECT_TRUE(HasLogContaining("external address: unknown (the router does "
                               "not tell and no probe service is "
                               "configured)"));
}

TEST_F(DetectExternalAddress, NoGatewayStillAsksTheProbeService) {
  mGateway.reset();
  mProbeService = "probe.example:7777";
  mServiceAnswer = std::nullopt;
  EXPECT_EQ(std::nullopt, Find());
  EXPECT_EQ(std::vector<std::string>{"probe.example:7777"}, mServiceAsked);
  EXPECT_TRUE(mProbes->upnpAsked.empty());
  EXPECT_TRUE(HasLogContaining("external address: no default gateway"));
}

TEST_F(DetectExternalAddress, TheCInterfaceAnswersInNetworkByteOrder) {
  mConf = Conf("yes", "no");
  SetExternalAddressEnvironmentFactoryForTesting(
      [this] { return Environment(); });
  EXPECT_EQ(htonl(Ip("198.51.100.7")), ZARKIGetExternalIP());

  mConf.reset();
  EXPECT_EQ(0u, ZARKIGetExternalIP());
}

} // namespace
} // namespace zark::test
