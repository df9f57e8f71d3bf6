// Choosing the router protocol of the stored configuration (ChooseRouter):
// the "yes" flags first; for a configuration without them (what the module
// stores for a router detection found by UPnP before it runs
// zarkportforward), the router database entry of its router, then the kept
// detection record when it names the same router; otherwise the refusal of
// routers driven through their pages. HERMETIC: real files under
// /etc/portforward and /etc.defaults in a private mount namespace.
#include "catalog/detect_result_store.h"
#include "catalog/router_conf_store.h"
#include "drivers/driver_choice.h"
#include "hermetic.h"
#include "libzarkportmap.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <syslog.h>

#include <cstring>
#include <string>

namespace zark::portmap {
namespace {

const std::string kGateway = "192.168.1.1";
const std::string kDbDir = ZARK_PORTMAP_ROUTERDB_DIR;
constexpr char kPagesRefusal[] =
    "is driven through its web pages (\"http\"); drivers for router pages do "
    "not exist yet";
constexpr char kFromDb[] = "as its router database entry says";
constexpr char kFromDetection[] = "as the kept detection record says";

template <std::size_t N> void Copy(char (&field)[N], const std::string &text) {
  std::strncpy(field, text.c_str(), N - 1);
}

void StoreConf(const std::string &brand, const std::string &model,
               const std::string &version, const std::string &upnp = "no",
               const std::string &natpmp = "no") {
  ZARK_ROUTER_CONF conf{};
  Copy(conf.brand, brand);
  Copy(conf.model, model);
  Copy(conf.version, version);
  Copy(conf.support_upnp, upnp);
  Copy(conf.support_natpmp, natpmp);
  Copy(conf.conn_type, "http");
  Copy(conf.conn_port, "80");
  Copy(conf.max_rule, "32");
  int err = 0;
  ASSERT_TRUE(StoreRouterConfForGateway(kGateway, conf, err)) << err;
}

void StoreDetection(const std::string &pfpath, int upnp, int natpmp) {
  ZARK_ROUTER_DETECT_RESULT record{};
  record.enProgress = 100;
  record.hops = 1;
  Copy(record.gateway_ip, kGateway);
  Copy(record.network_interface, "eth0");
  record.support_upnp = upnp;
  record.support_natpmp = natpmp;
  Copy(record.upnp_pfpath, pfpath);
  ASSERT_TRUE(StoreDetectResult(kDetectResultPath, record));
}

// One description of the installed router database.
void AddDbEntry(const std::string &brand, const std::string &model,
                const std::string &file, const std::string &version,
                const std::string &protocol) {
  test::WriteFile(kDbDir + "/routerdb.conf", "syntax_version=1\nversion=1\n");
  test::WriteFile(kDbDir + "/" + brand + "/" + model + "/" + file,
                  "version=" + version + "\nprotocol=" + protocol +
                      "\nsupport_change_port=yes\nmax_rules=16\n");
}

int CountLogsContaining(const std::string &text) {
  int count = 0;
  for (const std::string &message : test::CapturedMessages()) {
    count += message.find(text) != std::string::npos ? 1 : 0;
  }
  return count;
}

class PortMapRouterChoice : public ::testing::Test {
protected:
  void SetUp() override {
    test::ResetFixedPaths();
    test::ClearLogs();
  }

  // ChooseRouter's answer: the protocol, or "" with mErr set.
  std::string Choose() {
    RouterChoice choice;
    mErr = -1;
    if (!ChooseRouter(kGateway, choice, mErr)) {
      return "";
    }
    EXPECT_EQ(ZARK_PORTMAP_ERR_NONE, mErr);
    EXPECT_EQ(32, choice.maxRouterEntries);
    return std::string(RouterProtocolName(choice.protocol));
  }

  std::string Logs() const {
    return ::testing::PrintToString(test::CapturedMessages());
  }

  int mErr = -1;
};

TEST_F(PortMapRouterChoice, SplitsTheDetectedNameAsTheModuleDoes) {
  std::optional<DetectedRouterName> name =
      SplitDetectedRouterName("ZarkTest: TestIGD(1)");
  ASSERT_TRUE(name);
  EXPECT_EQ("ZarkTest", name->brand);
  EXPECT_EQ("TestIGD", name->model);
  EXPECT_EQ(std::optional<std::string>("1"), name->version);

  // Only the last ")" goes; a model with blanks keeps them.
  name = SplitDetectedRouterName("Acme Inc: Box 2(v1 (beta))");
  ASSERT_TRUE(name);
  EXPECT_EQ("Acme Inc", name->brand);
  EXPECT_EQ("Box 2", name->model);
  EXPECT_EQ(std::optional<std::string>("v1 (beta)"), name->version);

  name = SplitDetectedRouterName("Acme: Box");
  ASSERT_TRUE(name);
  EXPECT_EQ("Box", name->model);
  EXPECT_FALSE(name->version);

  EXPECT_FALSE(SplitDetectedRouterName("Acme Box(1)"));
  EXPECT_FALSE(SplitDetectedRouterName(""));
}

TEST_F(PortMapRouterChoice, YesFlagsStillWin) {
  // Both other sources would say NAT-PMP.
  AddDbEntry("Acme", "R1", "generic", "generic", "natpmp");
  StoreDetection("Acme: R1(generic)", 0, 1);

  StoreConf("Acme", "R1", "generic", "yes", "no");
  EXPECT_EQ("upnp", Choose()) << Logs();

  StoreConf("Acme", "R1", "generic", "no", "yes");
  EXPECT_EQ("natpmp", Choose()) << Logs();
  StoreConf("Acme", "R1", "generic", "yes", "yes");
  EXPECT_EQ("upnp", Choose()) << Logs();

  EXPECT_EQ(0, CountLogsContaining(kFromDb)) << Logs();
  EXPECT_EQ(0, CountLogsContaining(kFromDetection)) << Logs();
}

TEST_F(PortMapRouterChoice, RouterDbEntryDecides) {
  AddDbEntry("Acme", "R1", "generic", "generic", "natpmp");
  AddDbEntry("Acme", "R1", "v2", "2.0", "upnp");
  // The detection record names the same router and says otherwise: the
  // database comes first.
  StoreDetection("Acme: R1(2.0)", 0, 1);
  StoreConf("Acme", "R1", "2.0");

  EXPECT_EQ("upnp", Choose()) << Logs();
  EXPECT_EQ(1, CountLogsContaining(kFromDb)) << Logs();
  EXPECT_TRUE(test::HasLogContaining(
      "the router configured for gateway 192.168.1.1 (Acme R1 2.0) has no "
      "protocol flag set; driving it by UPnP, as its router database entry "
      "says"))
      << Logs();
  EXPECT_EQ(0, CountLogsContaining(kFromDetection)) << Logs();
}

TEST_F(PortMapRouterChoice, ModelsGenericDbEntryDecidesForAnUnlistedVersion) {
  AddDbEntry("Acme", "R1", "generic", "generic", "natpmp");
  AddDbEntry("Acme", "R1", "v2", "2.0", "upnp");
  StoreConf("Acme", "R1", "3.1");

  EXPECT_EQ("natpmp", Choose()) << Logs();
  EXPECT_TRUE(test::HasLogContaining("driving it by NAT-PMP, as its router "
                                     "database entry says"))
      << Logs();
}

TEST_F(PortMapRouterChoice, DetectionRecordDecides) {
  // The database knows other routers only.
  AddDbEntry("Generic", "UPnP IGD", "generic", "generic", "upnp");
  StoreDetection("ZarkTest: TestIGD(1)", 1, 1);
  StoreConf("ZarkTest", "TestIGD", "1");

  EXPECT_EQ("upnp", Choose()) << Logs();
  EXPECT_EQ(1, CountLogsContaining(kFromDetection)) << Logs();
  EXPECT_TRUE(test::HasLogContaining(
      "the router configured for gateway 192.168.1.1 (ZarkTest TestIGD 1) has "
      "no protocol flag set; driving it by UPnP, as the kept detection record "
      "says"))
      << Logs();
  EXPECT_FALSE(test::HasLogContaining(kPagesRefusal)) << Logs();
}

TEST_F(PortMapRouterChoice, DetectionRecordWithNatPmpOnlyGivesNatPmp) {
  StoreDetection("ZarkTest: TestIGD(1)", 0, 1);
  StoreConf("ZarkTest", "TestIGD", "1");

  EXPECT_EQ("natpmp", Choose()) << Logs();
  EXPECT_EQ(1, CountLogsContaining("driving it by NAT-PMP, as the kept "
                                   "detection record says"))
      << Logs();
}

TEST_F(PortMapRouterChoice, DbEntryOfRouterPagesLeavesItToTheDetectionRecord) {
  AddDbEntry("ZarkTest", "TestIGD", "generic", "generic", "web");
  StoreDetection("ZarkTest: TestIGD", 1, 0);
  // A name without version matches any version of that brand and model.
  StoreConf("ZarkTest", "TestIGD", "generic");

  EXPECT_EQ("upnp", Choose()) << Logs();
  EXPECT_EQ(1, CountLogsContaining(kFromDetection)) << Logs();
}

TEST_F(PortMapRouterChoice, AnotherRoutersDetectionRecordDoesNot) {
  StoreConf("ZarkTest", "TestIGD", "1");

  for (const char *other :
       {"Other: TestIGD(1)", "ZarkTest: OtherIGD(1)", "ZarkTest: TestIGD(2)",
        "ZarkTest TestIGD(1)", ""}) {
    SCOPED_TRACE(other);
    test::ClearLogs();
    StoreDetection(other, 1, 1);
    EXPECT_EQ("", Choose()) << Logs();
    EXPECT_EQ(ZARK_PORTMAP_ERR_NOT_CONFIGURED, mErr);
    EXPECT_EQ(1, CountLogsContaining(kPagesRefusal)) << Logs();
    EXPECT_EQ(0, CountLogsContaining(kFromDetection)) << Logs();
  }
}

TEST_F(PortMapRouterChoice, DetectionRecordWithoutUpnpOrNatPmpDoesNot) {
  StoreDetection("ZarkTest: TestIGD(1)", 0, 0);
  StoreConf("ZarkTest", "TestIGD", "1");

  EXPECT_EQ("", Choose()) << Logs();
  EXPECT_EQ(ZARK_PORTMAP_ERR_NOT_CONFIGURED, mErr);
  EXPECT_TRUE(test::HasLogContaining(kPagesRefusal)) << Logs();
}

TEST_F(PortMapRouterChoice, NothingMatchesIsError2WithTheRouterPagesLine) {
  AddDbEntry("Acme", "R1", "generic", "generic", "web");
  StoreConf("Acme", "R1", "generic");

  EXPECT_EQ("", Choose()) << Logs();
  EXPECT_EQ(2, mErr);
  EXPECT_EQ(ZARK_PORTMAP_ERR_NOT_CONFIGURED, mErr);
  bool found = false;
  for (const test::LogLine &line : test::CapturedLogs()) {
    if (line.message.find(kPagesRefusal) != std::string::npos) {
      found = true;
      EXPECT_EQ(LOG_ERR, line.priority);
      EXPECT_NE(std::string::npos,
                line.message.find("the router configured for gateway "
                                  "192.168.1.1 (Acme R1) is driven through"))
          << line.message;
    }
  }
  EXPECT_TRUE(found) << Logs();
  EXPECT_EQ(0, CountLogsContaining(kFromDb)) << Logs();
}

TEST_F(PortMapRouterChoice, NoDatabaseAndNoDetectionRecordIsError2) {
  StoreConf("Acme", "R1", "generic");

  EXPECT_EQ("", Choose()) << Logs();
  EXPECT_EQ(ZARK_PORTMAP_ERR_NOT_CONFIGURED, mErr);
  EXPECT_EQ(1, CountLogsContaining(kPagesRefusal)) << Logs();
}

} // namespace
} // namespace zark::portmap
