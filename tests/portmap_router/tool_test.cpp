// The zarkportforward tool run in-process against the fake routers:
// applying the saved rules, renewing, listing, and its exit codes.
// HERMETIC (/etc/portforward, /tmp).
#include "zarkportforward_tool.h"

#include "RouterRuleConf.h"
#include "base/portmap_lock.h"
#include "catalog/router_conf_store.h"
#include "drivers/driver_choice.h"
#include "fake_igd.h"
#include "fake_natpmp.h"
#include "hermetic.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <atomic>
#include <condition_variable>
#include <cstring>
#include <mutex>
#include <sstream>
#include <thread>

namespace zark::portmap {
namespace {

using test::FakeIgd;
using test::FakeNatPmp;
using test::HttpReply;
using test::SoapRequest;

const std::vector<Ipv4Network> kLoopback = {{0x7f000000u, 0xff000000u}};

void StoreConf(const std::string &upnp, const std::string &natpmp) {
  ZARK_ROUTER_CONF conf{};
  std::strcpy(conf.brand, "Generic");
  std::strncpy(conf.support_upnp, upnp.c_str(), sizeof(conf.support_upnp) - 1);
  std::strncpy(conf.support_natpmp, natpmp.c_str(),
               sizeof(conf.support_natpmp) - 1);
  int err = 0;
  ASSERT_TRUE(StoreRouterConfForGateway("127.0.0.1", conf, err)) << err;
}

class PortMapRouterTool : public testing::Test {
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
    mEnv = DefaultToolEnvironment();
    mEnv.gateway = [] { return std::optional<std::string>("127.0.0.1"); };
    RouterRuleConfWriter writer;
    ASSERT_TRUE(writer.AddRule("web", true, "8080", "80", "tcp", "", ""));
    ASSERT_TRUE(writer.AddRule("dns", true, "5353", "53", "udp", "", ""));
    ASSERT_TRUE(writer.AddRule("off", false, "9999", "9999", "tcp", "", ""));
    ASSERT_TRUE(writer.Sync(ZARK_PORTMAP_RULE_CONF));
  }
  void TearDown() override { SetRouterOverridesForTesting(std::nullopt); }

  int Run(std::vector<std::string> args) {
    mOut.str("");
    mErr.str("");
    return RunZarkPortForward(args, mOut, mErr, mEnv);
  }

  FakeIgd mIgd;
  FakeNatPmp mNatPmp;
  ToolEnvironment mEnv;
  std::ostringstream mOut;
  std::ostringstream mErr;
};

TEST_F(PortMapRouterTool, HelpListsTheExitCodes) {
  EXPECT_EQ(kToolOk, Run({"--help"}));
  EXPECT_NE(std::string::npos, mOut.str().find("usage: zarkportforward"));
  EXPECT_NE(std::string::npos, mOut.str().find("6  the saved rules are "));
  EXPECT_EQ(0, mIgd.TotalRequests());
}

TEST_F(PortMapRouterTool, UnknownArgumentIsAUsageError) {
  EXPECT_EQ(kToolUsage, Run({"refresh"}));
  EXPECT_NE(std::string::npos, mErr.str().find("unknown argument \"refresh\""));
  EXPECT_EQ(kToolUsage, Run({"renew", "list"}));
}

TEST_F(PortMapRouterTool, UnknownGatewayIsExit3) {
  mEnv.gateway = [] { return std::optional<std::string>(); };
  EXPECT_EQ(kToolNoGateway, Run({}));
}

TEST_F(PortMapRouterTool, AppliesTheSavedRules) {
  EXPECT_EQ(kToolOk, Run({})) << mErr.str();

  EXPECT_EQ("apply: 0 deleted, 2 added, 0 checked, 0 unchanged, 0 failed, "
            "0 repaired\n",
            mOut.str());
  EXPECT_EQ((std::vector<FakeIgd::Entry>{
                {"TCP", 8080, "127.0.0.1", 80, 0, "zarkportforward web"},
                {"UDP", 5353, "127.0.0.1", 53, 0, "zarkportforward dns"}}),
            mIgd.Table());

  // Again: each is asked about once and left alone.
  mIgd.ResetCounts();
  EXPECT_EQ(kToolOk, Run({}));
  EXPECT_EQ("apply: 0 deleted, 0 added, 2 checked, 0 unchanged, 0 failed, "
            "0 repaired\n",
            mOut.str());
  EXPECT_EQ((std::map<std::string, int>{{"GetSpecificPortMappingEntry", 2}}),
            mIgd.Counts());
}

TEST_F(PortMapRouterTool, RenewAddsAgainWhatTheRouterLost) {
  ASSERT_EQ(kToolOk, Run({}));
  mIgd.ClearTable();

  EXPECT_EQ(kToolOk, Run({"renew"})) << mErr.str();

  EXPECT_EQ("renew: 0 deleted, 2 added, 0 checked, 0 unchanged, 0 failed, "
            "2 repaired\n",
            mOut.str());
  EXPECT_EQ(2u, mIgd.Table().size());
}

TEST_F(PortMapRouterTool, NoConfiguredRouterIsExit2) {
  test::ResetFixedPaths();
  EXPECT_EQ(kToolNotConfigured, Run({}));
  EXPECT_EQ(kToolNotConfigured, Run({"list"}));
}

TEST_F(PortMapRouterTool, RouterThatDoesNotAnswerIsExit4) {
  mIgd.OnAction("AddPortMapping", [](const SoapRequest &) {
    HttpReply gone;
    gone.close = true;
    return std::optional<HttpReply>(gone);
  });

  EXPECT_EQ(kToolRouterFailed, Run({}));
  EXPECT_NE(std::string::npos, mErr.str().find("no reply from the router"));
}

TEST_F(PortMapRouterTool, ListsTheRoutersTableAndMarksOurs) {
  mIgd.PutEntry({"TCP", 7000, "127.0.0.9", 7000, 0, "someone else"});
  ASSERT_EQ(kToolOk, Run({}));

  EXPECT_EQ(kToolOk, Run({"list"})) << mErr.str();

  EXPECT_EQ("router: upnp at " + mIgd.RootDescUrl() +
                "\n"
                "  TCP 7000 -> 127.0.0.9:7000 lease 0 \"someone else\"\n"
                "* TCP 8080 -> 127.0.0.1:80 lease 0 \"zarkportforward web\"\n"
                "* UDP 5353 -> 127.0.0.1:53 lease 0 \"zarkportforward dns\"\n"
                "3 mapping(s); * made by this server\n",
            mOut.str());
}

TEST_F(PortMapRouterTool, ListsOurOwnRecordForNatPmp) {
  StoreConf("no", "yes");
  ASSERT_EQ(kToolOk, Run({})) << mErr.str();
  const int requests = mNatPmp.Requests();

  EXPECT_EQ(kToolOk, Run({"list"}));

  EXPECT_EQ("router: natpmp at 127.0.0.1 (it cannot list its table; these "
            "are the mappings this server made)\n"
            "* TCP 8080 -> 127.0.0.1:80 lease 7200 rule \"web\"\n"
            "* UDP 5353 -> 127.0.0.1:53 lease 7200 rule \"dns\"\n",
            mOut.str());
  EXPECT_EQ(requests, mNatPmp.Requests());
}

TEST_F(PortMapRouterTool, LockHeldElsewhereIsExit3) {
  ZarkPortMapSetLockTimeoutForTesting(std::chrono::milliseconds(50));
  std::mutex mutex;
  std::condition_variable changed;
  bool locked = false;
  bool release = false;
  std::thread holder([&] {
    KLibZarkPortMapLock();
    {
      std::lock_guard<std::mutex> guard(mutex);
      locked = true;
    }
    changed.notify_all();
    std::unique_lock<std::mutex> guard(mutex);
    changed.wait(guard, [&] { return release; });
    KLibZarkPortMapUnLock();
  });
  {
    std::unique_lock<std::mutex> guard(mutex);
    changed.wait(guard, [&] { return locked; });
  }

  EXPECT_EQ(kToolNoGateway, Run({}));
  EXPECT_NE(std::string::npos, mErr.str().find("holds the lock"));
  EXPECT_EQ(0, mIgd.TotalRequests());

  {
    std::lock_guard<std::mutex> guard(mutex);
    release = true;
  }
  changed.notify_all();
  holder.join();
  ZarkPortMapSetLockTimeoutForTesting(std::chrono::milliseconds(30000));
}

} // namespace
} // namespace zark::portmap
