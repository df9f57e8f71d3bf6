// What a device on the LAN answers cannot make the port-map library send a
// request off the local network. In the test network, the "elsewhere" is
// the outside host 1.2.3.2 (beyond the router, reachable from the server),
// where a listener counts every connection; a scripted UPnP device on the
// server's own LAN address points there in every way it can, and a save
// (KLibSaveRules) or a detection runs through the library.
//
// Already covered elsewhere, on loopback with a chosen local network, and
// not repeated here: an absolute control URL off the network
// (PortMapRouterUpnp.ControlUrlOffTheLocalNetworkIsRefusedUnused), an SSDP
// LOCATION off the network
// (DetectProbeRouter.ADeviceOffTheLocalNetworkIsRefused), a description on the
// server itself (PortMapRouterUpnp.
// ControlUrlOnTheServerItselfIsRefusedOutsideTests), and how a URL's host
// is cut (PortMapRouterLocalNetwork.*). Added here, with the machine's real
// interfaces and a real listener beyond the router: URLBase, URLBase with
// a user-info part, redirects of the description and of SOAP requests,
// the location remembered from an earlier job, the NAT-PMP path, and
// detection's SSDP answers.
#include "apply/save_rules.h"
#include "catalog/mapping_state.h"
#include "db_test_support.h"
#include "detect/router_probe.h"
#include "drivers/driver_choice.h"
#include "fake_igd.h"
#include "hermetic.h"
#include "libzarkportmap.h"
#include "security_support.h"
#include "syslog_capture.h"
#include "test_network.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cstring>
#include <filesystem>
#include <thread>

namespace zark::security {
namespace {

using namespace std::chrono_literals;
using zark::test::HasLogContaining;

class SecurityRouterReplies : public testing::Test {
protected:
  void SetUp() override {
    std::optional<zark::testnet::TestNetwork> network =
        zark::testnet::CurrentNetwork();
    ASSERT_TRUE(network.has_value())
        << "run through testnet/run-in-testnet.sh (as CTest does)";
    mNet = *network;
    zark::test::ResetFixedPaths();
    zark::test::InstallShippedRouterDb();
    zark::test::ClearLogs();
    mOutside = std::make_unique<CountingListener>(BoundSocketInNamespace(
        mNet.outsideNs, SOCK_STREAM, mNet.wanOutside, 0));
    ASSERT_TRUE(mOutside->Ok());
    mIgd = std::make_unique<zark::test::FakeIgd>(zark::test::IgdVariant::kIpV1,
                                                 mNet.lanServer);
    ASSERT_TRUE(mIgd->Ok());
  }

  void TearDown() override {
    zark::portmap::SetRouterOverridesForTesting(std::nullopt);
  }

  // "http://1.2.3.2:<listener port>" + path.
  std::string Elsewhere(const std::string &path) const {
    return "http://" + mNet.wanOutside + ":" +
           std::to_string(mOutside->Port()) + path;
  }

  void Configure(const char *supportUpnp, const char *supportNatpmp) {
    ZARK_ROUTER_CONF conf{};
    std::strcpy(conf.brand, "Generic");
    std::strcpy(conf.model,
                std::strcmp(supportUpnp, "yes") == 0 ? "UPnP IGD" : "NAT-PMP");
    std::strcpy(conf.version, "generic");
    std::strcpy(conf.support_upnp, supportUpnp);
    std::strcpy(conf.support_natpmp, supportNatpmp);
    ZARK_LIBZARKPORTMAP_ERR err{0};
    ASSERT_EQ(0, KLibSetRouterConf(mNet.lanRouter.c_str(), &conf, &err, true))
        << err.err;
  }

  // The library drives the scripted device only: its description is the
  // one known URL, no discovery; the local networks are the machine's own.
  void UseScriptedDevice() {
    zark::portmap::RouterOverrides overrides;
    overrides.upnpRootDescUrls = {mIgd->Url("/rootDesc.xml")};
    overrides.upnpDiscover = false;
    zark::portmap::SetRouterOverridesForTesting(overrides);
  }

  // One rule, TCP 18080 -> 8080, through the library's save.
  int Save(ZARK_ROUTER_SAVE_RULE_RESULT &result) {
    ZARK_ROUTER_RULE rule{};
    std::strcpy(rule.rule_id, "1");
    rule.enable = 1;
    std::strcpy(rule.router_protocol, "tcp");
    std::strcpy(rule.router_port, "18080");
    std::strcpy(rule.ds_port, "8080");
    std::strcpy(rule.service_name, "web");
    result = ZARK_ROUTER_SAVE_RULE_RESULT{};
    return KLibSaveRules(mNet.lanRouter.c_str(), 1, &rule, false, &result,
                         nullptr, nullptr);
  }

  // Nothing reached the outside listener, which did listen all along: a
  // connection of the test itself is counted.
  void ExpectNothingWentElsewhere() {
    EXPECT_EQ(0, mOutside->Seen()) << "the library connected to 1.2.3.2";
    int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(mOutside->Port());
    ::inet_pton(AF_INET, mNet.wanOutside.c_str(), &address.sin_addr);
    ASSERT_EQ(0, ::connect(fd, reinterpret_cast<sockaddr *>(&address),
                           sizeof(address)));
    ::close(fd);
    for (int i = 0; i < 500 && mOutside->Seen() == 0; ++i) {
      std::this_thread::sleep_for(10ms);
    }
    EXPECT_EQ(1, mOutside->Seen()) << "the outside listener did not listen";
  }

  zark::testnet::TestNetwork mNet;
  std::unique_ptr<CountingListener> mOutside;
  std::unique_ptr<zark::test::FakeIgd> mIgd;
};

TEST_F(SecurityRouterReplies, UrlBaseOffTheNetworkIsRefusedBeforeAnyRequest) {
  Configure("yes", "no");
  mIgd->SetUrlBase(Elsewhere("/"));
  UseScriptedDevice();

  ZARK_ROUTER_SAVE_RULE_RESULT result;
  EXPECT_EQ(-1, Save(result));
  EXPECT_EQ(zark::portmap::kSaveErrRouter, result.errType);
  EXPECT_NE(nullptr,
            std::strstr(result.detail.text, "is not on the local network"))
      << result.detail.text;
  EXPECT_TRUE(HasLogContaining(
      "refusing control URL " + Elsewhere("/ctl/IPConn") +
      " of the UPnP device at " + mIgd->Url("/rootDesc.xml") + ": host " +
      mNet.wanOutside + " is not on the local network"));
  EXPECT_EQ(std::vector<std::string>{"GET /rootDesc.xml"},
            mIgd->RequestLines());
  // The router failed, not the rules: they are kept for the next try.
  EXPECT_TRUE(std::filesystem::exists(ZARK_PORTMAP_RULE_CONF));
  ExpectNothingWentElsewhere();
}

// "http://<lan>:<port>@1.2.3.2:<port>/": the host part is cut at the first
// ":" by the check and by miniupnpc alike, so the requests go where the
// check looked (the scripted device), never to 1.2.3.2.
TEST_F(SecurityRouterReplies, UrlBaseWithUserInfoGoesWhereTheCheckLooked) {
  Configure("yes", "no");
  const std::string urlBase =
      "http://" + mNet.lanServer + ":" + std::to_string(mIgd->Port()) + "@" +
      mNet.wanOutside + ":" + std::to_string(mOutside->Port()) + "/";
  mIgd->SetUrlBase(urlBase);
  UseScriptedDevice();

  ZARK_ROUTER_SAVE_RULE_RESULT result;
  EXPECT_EQ(0, Save(result)) << result.errType << " " << result.detail.text;
  const std::vector<std::string> requests = mIgd->RequestLines();
  EXPECT_NE(requests.end(),
            std::find(requests.begin(), requests.end(), "SOAP AddPortMapping"));
  ExpectNothingWentElsewhere();
}

TEST_F(SecurityRouterReplies, RedirectOfTheDescriptionIsNotFollowed) {
  Configure("yes", "no");
  const std::string target = Elsewhere("/rootDesc.xml");
  mIgd->OnGet([target](const std::string &) {
    return zark::test::HttpReply{302, "", target};
  });
  UseScriptedDevice();

  ZARK_ROUTER_SAVE_RULE_RESULT result;
  EXPECT_EQ(-1, Save(result));
  // miniupnpc reads the redirect as no description at all.
  EXPECT_EQ(zark::portmap::kSaveErrRouter, result.errType);
  EXPECT_NE(
      nullptr,
      std::strstr(
          result.detail.text,
          ("no UPnP description at " + mIgd->Url("/rootDesc.xml")).c_str()))
      << result.detail.text;
  for (const std::string &request : mIgd->RequestLines()) {
    EXPECT_EQ("GET /rootDesc.xml", request);
  }
  // The router failed, not the rules: they are kept for the next try.
  EXPECT_TRUE(std::filesystem::exists(ZARK_PORTMAP_RULE_CONF));
  ExpectNothingWentElsewhere();
}

TEST_F(SecurityRouterReplies, RedirectOfASoapRequestIsNotFollowed) {
  Configure("yes", "no");
  const std::string target = Elsewhere("/ctl/IPConn");
  mIgd->OnAnyAction([target](const zark::test::SoapRequest &) {
    return zark::test::HttpReply{307, "", target};
  });
  UseScriptedDevice();

  ZARK_ROUTER_SAVE_RULE_RESULT result;
  EXPECT_EQ(-1, Save(result));
  // The redirect is no reply: the add fails and is reported.
  EXPECT_EQ(zark::portmap::kSaveErrRouter, result.errType);
  EXPECT_NE(nullptr,
            std::strstr(result.detail.text, "UPNP_AddPortMapping TCP 18080->"))
      << result.detail.text;
  const std::vector<std::string> requests = mIgd->RequestLines();
  EXPECT_NE(requests.end(),
            std::find(requests.begin(), requests.end(), "SOAP AddPortMapping"));
  // The router failed, not the rules: they are kept for the next try.
  EXPECT_TRUE(std::filesystem::exists(ZARK_PORTMAP_RULE_CONF));
  ExpectNothingWentElsewhere();
}

// No test seam: where the last job found the router (the mapping state)
// is tried first, and is checked like any other reply.
TEST_F(SecurityRouterReplies, RememberedLocationOffTheNetworkIsRefused) {
  Configure("yes", "no");
  zark::portmap::MappingState state;
  zark::portmap::RouterRecord &record =
      state.FindOrAdd(mNet.lanRouter, zark::portmap::RouterProtocol::kUpnp);
  record.location = Elsewhere("/rootDesc.xml");
  ASSERT_TRUE(
      zark::portmap::SaveMappingState(zark::portmap::kMappingStatePath, state));

  ZARK_ROUTER_SAVE_RULE_RESULT result;
  // Discovery then finds the real router at the gateway.
  EXPECT_EQ(0, Save(result)) << result.errType << " " << result.detail.text;
  EXPECT_TRUE(HasLogContaining(
      "refusing the UPnP device at " + Elsewhere("/rootDesc.xml") + ": host " +
      mNet.wanOutside + " is not on the local network"));
  zark::portmap::MappingState after;
  ASSERT_TRUE(
      zark::portmap::LoadMappingState(zark::portmap::kMappingStatePath, after));
  zark::portmap::RouterRecord *used =
      after.Find(mNet.lanRouter, zark::portmap::RouterProtocol::kUpnp);
  ASSERT_NE(nullptr, used);
  EXPECT_EQ(mNet.rootDesc, used->location);
  ExpectNothingWentElsewhere();
}

// NAT-PMP talks to the gateway only, whatever the mapping state remembers:
// the NAT-PMP record's location and the UPnP record (of a router that was
// switched from UPnP, whose mappings are removed first) both name 1.2.3.2.
TEST_F(SecurityRouterReplies, NatPmpSaveTalksToTheGatewayOnly) {
  Configure("no", "yes");
  CountingListener outsideNatPmp(BoundSocketInNamespace(
      mNet.outsideNs, SOCK_DGRAM, mNet.wanOutside, 5351));
  ASSERT_TRUE(outsideNatPmp.Ok());
  zark::portmap::MappingState state;
  zark::portmap::RouterRecord &upnp =
      state.FindOrAdd(mNet.lanRouter, zark::portmap::RouterProtocol::kUpnp);
  upnp.location = Elsewhere("/rootDesc.xml");
  zark::portmap::RecordedMapping old;
  old.protocol = zark::portmap::IpProtocol::kTcp;
  old.externalPort = 18081;
  old.internalPort = 8081;
  old.internalClient = mNet.lanServer;
  old.held = true;
  old.ruleId = "9";
  upnp.Put(old);
  zark::portmap::RouterRecord &natpmp =
      state.FindOrAdd(mNet.lanRouter, zark::portmap::RouterProtocol::kNatPmp);
  natpmp.location = mNet.wanOutside;
  ASSERT_TRUE(
      zark::portmap::SaveMappingState(zark::portmap::kMappingStatePath, state));

  ZARK_ROUTER_SAVE_RULE_RESULT result;
  const int rc = Save(result);
  // The old UPnP mapping is removed through the router that discovery
  // finds at the gateway; the remembered location is refused on the way.
  EXPECT_TRUE(HasLogContaining("refusing the UPnP device at " +
                               Elsewhere("/rootDesc.xml")));
  EXPECT_EQ(0, rc) << result.errType << " " << result.detail.text;
  EXPECT_TRUE(HasLogContaining("applying rules to the natpmp router at " +
                               mNet.lanRouter));
  EXPECT_EQ(0, outsideNatPmp.Seen()) << "NAT-PMP request sent to 1.2.3.2";
  ExpectNothingWentElsewhere();
}

// An SSDP device on the LAN that answers detection's search (sent to the
// gateway and to the multicast group, which this responder joined on the
// server's LAN interface) with the locations the test gives.
class SsdpResponder {
public:
  SsdpResponder(const std::string &lanAddress,
                std::vector<std::string> locations)
      : mLocations(std::move(locations)) {
    int fd = BoundSocket(SOCK_DGRAM, "0.0.0.0", 0);
    ip_mreq group{};
    ::inet_pton(AF_INET, "239.255.255.250", &group.imr_multiaddr);
    ::inet_pton(AF_INET, lanAddress.c_str(), &group.imr_interface);
    if (fd < 0 ||
        ::setsockopt(fd, IPPROTO_IP, IP_ADD_MEMBERSHIP, &group,
                     sizeof(group)) != 0 ||
        ::pipe2(mWake, O_CLOEXEC) != 0) {
      if (fd >= 0) {
        ::close(fd);
      }
      return;
    }
    mFd = fd;
    mPort = BoundPort(fd);
    mThread = std::thread([this] { Serve(); });
  }
  ~SsdpResponder() {
    if (mThread.joinable()) {
      (void)!::write(mWake[1], "x", 1);
      mThread.join();
    }
    for (int fd : {mFd, mWake[0], mWake[1]}) {
      if (fd >= 0) {
        ::close(fd);
      }
    }
  }
  SsdpResponder(const SsdpResponder &) = delete;
  SsdpResponder &operator=(const SsdpResponder &) = delete;

  [[nodiscard]] bool Ok() const { return mFd >= 0; }
  [[nodiscard]] uint16_t Port() const { return mPort; }
  [[nodiscard]] int Searches() const { return mSearches.load(); }

private:
  void Serve() {
    for (;;) {
      pollfd watched[2] = {{mFd, POLLIN, 0}, {mWake[0], POLLIN, 0}};
      if (::poll(watched, 2, -1) < 0 && errno != EINTR) {
        return;
      }
      if (watched[1].revents != 0) {
        return;
      }
      char buffer[2048];
      sockaddr_storage from{};
      socklen_t length = sizeof(from);
      ssize_t n = ::recvfrom(mFd, buffer, sizeof(buffer), MSG_DONTWAIT,
                             reinterpret_cast<sockaddr *>(&from), &length);
      if (n <= 0 || std::string(buffer, n).rfind("M-SEARCH", 0) != 0) {
        continue;
      }
      ++mSearches;
      for (const std::string &location : mLocations) {
        const std::string reply =
            "HTTP/1.1 200 OK\r\nCACHE-CONTROL: max-age=120\r\n"
            "ST: urn:schemas-upnp-org:device:InternetGatewayDevice:1\r\n"
            "USN: uuid:5c0d7a11::urn:schemas-upnp-org:device:"
            "InternetGatewayDevice:1\r\nSERVER: Scripted/1 UPnP/1.1\r\n"
            "LOCATION: " +
            location + "\r\n\r\n";
        (void)!::sendto(mFd, reply.data(), reply.size(), 0,
                        reinterpret_cast<sockaddr *>(&from), length);
      }
    }
  }

  std::vector<std::string> mLocations;
  int mFd = -1;
  uint16_t mPort = 0;
  int mWake[2] = {-1, -1};
  std::atomic<int> mSearches{0};
  std::thread mThread;
};

TEST_F(SecurityRouterReplies, DetectionRefusesSsdpAnswersPointingElsewhere) {
  mIgd->SetUrlBase(Elsewhere("/"));
  SsdpResponder device(
      mNet.lanServer, {Elsewhere("/rootDesc.xml"), mIgd->Url("/rootDesc.xml")});
  ASSERT_TRUE(device.Ok());
  zark::portmap::RouterProbeOptions options;
  options.ssdpPort = device.Port();
  options.ssdpWait = 1000ms;
  std::unique_ptr<zark::portmap::RouterProbes> probes =
      zark::portmap::MakeRouterProbes(options);

  zark::portmap::RouterFindings findings =
      zark::portmap::ProbeRouter(*probes, mNet.lanRouter);

  EXPECT_GE(device.Searches(), 1) << "the search did not reach the device";
  EXPECT_NE(zark::portmap::ProtocolSupport::kYes, findings.upnp.support)
      << findings.upnp.why;
  EXPECT_TRUE(HasLogContaining("refusing the UPnP device at " +
                               Elsewhere("/rootDesc.xml")));
  EXPECT_TRUE(
      HasLogContaining("refusing control URL " + Elsewhere("/ctl/IPConn")));
  EXPECT_EQ(std::vector<std::string>{"GET /rootDesc.xml"},
            mIgd->RequestLines());
  // The real router still answers NAT-PMP: the probe ran against it.
  EXPECT_EQ(zark::portmap::ProtocolSupport::kYes, findings.natpmp.support)
      << findings.natpmp.why;
  ExpectNothingWentElsewhere();
}

} // namespace
} // namespace zark::security
