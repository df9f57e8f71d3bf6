// The router configuration store and KLibGetRouterConf / KLibSetRouterConf,
// against real files under /etc/portforward (private mount namespace).
#include "libzarkportmap.h"

#include "catalog/router_conf_store.h"
#include "db_test_support.h"
#include "hermetic.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <sys/stat.h>

#include <cstring>
#include <filesystem>
#include <string>

namespace {

using namespace zark::portmap;
using zark::test::CapturedMessages;
using zark::test::ClearLogs;
using zark::test::DescriptionSpec;
using zark::test::HasLogContaining;
using zark::test::InstallShippedRouterDb;
using zark::test::kDbRoot;
using zark::test::ReadFile;
using zark::test::ResetFixedPaths;
using zark::test::WriteFile;
using zark::test::WriteRouterDb;

constexpr const char *kGateway = "192.168.1.1";
constexpr const char *kPassword = "s3cret-pa55word";

void Set(char (&field)[ZARK_PORTMAP_TEXT_SIZE], const std::string &text) {
  std::memset(field, 0, sizeof(field));
  std::memcpy(field, text.data(), std::min(text.size(), sizeof(field) - 1));
}

ZARK_ROUTER_CONF WebConf() {
  ZARK_ROUTER_CONF conf{};
  Set(conf.brand, "Acme");
  Set(conf.model, "R1");
  Set(conf.version, "1.0");
  Set(conf.support_upnp, "no");
  Set(conf.support_natpmp, "no");
  Set(conf.account, "admin");
  Set(conf.password, kPassword);
  Set(conf.conn_type, "http");
  Set(conf.conn_port, "80");
  return conf;
}

ZARK_ROUTER_CONF UpnpConf() {
  ZARK_ROUTER_CONF conf{};
  Set(conf.brand, "Generic");
  Set(conf.model, "UPnP IGD");
  Set(conf.version, "generic");
  Set(conf.support_upnp, "yes");
  Set(conf.support_natpmp, "no");
  return conf;
}

void ExpectSameConf(const ZARK_ROUTER_CONF &a, const ZARK_ROUTER_CONF &b) {
  EXPECT_STREQ(a.brand, b.brand);
  EXPECT_STREQ(a.model, b.model);
  EXPECT_STREQ(a.version, b.version);
  EXPECT_STREQ(a.support_upnp, b.support_upnp);
  EXPECT_STREQ(a.support_natpmp, b.support_natpmp);
  EXPECT_STREQ(a.account, b.account);
  EXPECT_STREQ(a.password, b.password);
  EXPECT_STREQ(a.conn_type, b.conn_type);
  EXPECT_STREQ(a.conn_port, b.conn_port);
  EXPECT_STREQ(a.max_rule, b.max_rule);
}

class PortMapDBConfStore : public testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    ClearLogs();
  }
};

TEST_F(PortMapDBConfStore, CanonicalGatewayAddresses) {
  EXPECT_EQ("192.168.1.1", CanonicalGatewayAddress("192.168.1.1").value());
  EXPECT_EQ("10.0.0.254", CanonicalGatewayAddress("10.0.0.254").value());
  for (const char *bad :
       {"", "192.168.1", "192.168.001.001", " 192.168.1.1", "192.168.1.1 ",
        "192.168.1.256", "::1", "router.local", "../../etc/passwd",
        "1.2.3.4/24", "0x7f.0.0.1", "192.168.1.1\n"}) {
    EXPECT_FALSE(CanonicalGatewayAddress(bad).has_value()) << bad;
  }
  EXPECT_EQ("/etc/portforward/routers/10.0.0.1.conf",
            RouterConfPath("10.0.0.1"));
}

TEST_F(PortMapDBConfStore, StoresAndLoadsEveryField) {
  ZARK_ROUTER_CONF conf = WebConf();
  Set(conf.max_rule, "32");
  int err = -1;
  ASSERT_TRUE(StoreRouterConfForGateway(kGateway, conf, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_NONE, err);
  ZARK_ROUTER_CONF loaded{};
  err = -1;
  ASSERT_TRUE(LoadRouterConfForGateway(kGateway, loaded, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_NONE, err);
  ExpectSameConf(conf, loaded);
}

TEST_F(PortMapDBConfStore, KeepsAnyBytesAndFullLengthFields) {
  ZARK_ROUTER_CONF conf{};
  std::string longText(1023, 'x');
  longText[0] = '"';
  longText[1] = '\\';
  Set(conf.brand, longText);
  Set(conf.password, "\xff\xfe\x01 \"quoted\" \n\t");
  Set(conf.model, "Modèl ünïcode");
  int err = 0;
  ASSERT_TRUE(StoreRouterConfForGateway(kGateway, conf, err));
  ZARK_ROUTER_CONF loaded{};
  ASSERT_TRUE(LoadRouterConfForGateway(kGateway, loaded, err));
  ExpectSameConf(conf, loaded);
  EXPECT_EQ(1023u, std::strlen(loaded.brand));
}

TEST_F(PortMapDBConfStore, FileIsPrivateAndOnePerGateway) {
  int err = 0;
  ASSERT_TRUE(StoreRouterConfForGateway(kGateway, WebConf(), err));
  ASSERT_TRUE(StoreRouterConfForGateway("10.0.0.1", UpnpConf(), err));
  struct stat info {};
  ASSERT_EQ(0, ::stat(RouterConfPath(kGateway).c_str(), &info));
  EXPECT_EQ(0600u, info.st_mode & 07777);
  ASSERT_EQ(0, ::stat(kRouterConfDir, &info));
  EXPECT_EQ(0700u, info.st_mode & 07777);
  ZARK_ROUTER_CONF a{};
  ZARK_ROUTER_CONF b{};
  ASSERT_TRUE(LoadRouterConfForGateway(kGateway, a, err));
  ASSERT_TRUE(LoadRouterConfForGateway("10.0.0.1", b, err));
  EXPECT_STREQ("Acme", a.brand);
  EXPECT_STREQ("Generic", b.brand);
  // Replacing leaves no temporary file behind.
  ASSERT_TRUE(StoreRouterConfForGateway(kGateway, UpnpConf(), err));
  std::size_t files = 0;
  for (const auto &item : std::filesystem::directory_iterator(kRouterConfDir)) {
    (void)item;
    ++files;
  }
  EXPECT_EQ(2u, files);
}

TEST_F(PortMapDBConfStore, MissingConfigurationIsNotConfigured) {
  ZARK_ROUTER_CONF conf{};
  int err = 0;
  EXPECT_FALSE(LoadRouterConfForGateway(kGateway, conf, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_NOT_CONFIGURED, err);
  EXPECT_TRUE(CapturedMessages().empty());
}

TEST_F(PortMapDBConfStore, BadGatewayIsRefused) {
  ZARK_ROUTER_CONF conf = WebConf();
  int err = 0;
  EXPECT_FALSE(StoreRouterConfForGateway("../x", conf, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_BAD_PARAMETER, err);
  EXPECT_FALSE(LoadRouterConfForGateway("../x", conf, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_BAD_PARAMETER, err);
  EXPECT_FALSE(std::filesystem::exists(kRouterConfDir));
}

TEST_F(PortMapDBConfStore, UnterminatedFieldIsRefused) {
  ZARK_ROUTER_CONF conf = WebConf();
  std::memset(conf.conn_type, 'a', sizeof(conf.conn_type));
  int err = 0;
  EXPECT_FALSE(StoreRouterConfForGateway(kGateway, conf, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_BAD_PARAMETER, err);
  EXPECT_TRUE(HasLogContaining("\"conn_type\" is not NUL-terminated"));
}

TEST_F(PortMapDBConfStore, MalformedFilesAreRefusedAndLogged) {
  const std::string path = RouterConfPath(kGateway);
  for (const char *text :
       {"", "{", "[]", "{\"format\":2,\"router\":{}}",
        "{\"format\":1,\"router\":{\"brand\":\"a\"}}",
        "{\"format\":1,\"router\":{\"brand\":1,\"model\":\"\",\"version\":\"\","
        "\"support_upnp\":\"\",\"support_natpmp\":\"\",\"account\":\"\","
        "\"password\":\"\",\"conn_type\":\"\",\"conn_port\":\"\","
        "\"max_rule\":\"\"}}",
        "{\"format\":1,\"router\":{\"brand\":\"a\\u0000b\",\"model\":\"\","
        "\"version\":\"\",\"support_upnp\":\"\",\"support_natpmp\":\"\","
        "\"account\":\"\",\"password\":\"\",\"conn_type\":\"\","
        "\"conn_port\":\"\",\"max_rule\":\"\"}}"}) {
    WriteFile(path, text, 0600);
    ClearLogs();
    ZARK_ROUTER_CONF conf{};
    int err = 0;
    EXPECT_FALSE(LoadRouterConfForGateway(kGateway, conf, err)) << text;
    EXPECT_EQ(ZARK_PORTMAP_ERR_IO, err) << text;
    EXPECT_TRUE(HasLogContaining("is not a router configuration")) << text;
  }
}

TEST_F(PortMapDBConfStore, SerializedTextReadsBack) {
  ZARK_ROUTER_CONF conf = WebConf();
  std::string text = SerializeRouterConf(kGateway, conf);
  EXPECT_NE(std::string::npos, text.find("\"format\" : 1"));
  EXPECT_NE(std::string::npos, text.find("\"gateway\" : \"192.168.1.1\""));
  ZARK_ROUTER_CONF parsed{};
  std::string why;
  ASSERT_TRUE(ParseRouterConf(text, parsed, why)) << why;
  ExpectSameConf(conf, parsed);
}

// --- The C interface --------------------------------------------------------

class PortMapDBConfApi : public PortMapDBConfStore {
protected:
  void SetUp() override {
    PortMapDBConfStore::SetUp();
    InstallShippedRouterDb();
  }
};

TEST_F(PortMapDBConfApi, GetWithoutConfigurationAnswersError2) {
  ZARK_ROUTER_CONF conf{};
  ZARK_LIBZARKPORTMAP_ERR err{0};
  EXPECT_EQ(-1, KLibGetRouterConf(kGateway, &conf, &err, false));
  EXPECT_EQ(ZARK_PORTMAP_ERR_NOT_CONFIGURED, err.err);
  EXPECT_EQ(-1, KLibGetRouterConf(kGateway, &conf, nullptr, false));
}

TEST_F(PortMapDBConfApi, SetThenGetHidesCredentialsUnlessAsked) {
  ZARK_ROUTER_CONF conf = WebConf();
  ZARK_LIBZARKPORTMAP_ERR err{-1};
  ASSERT_EQ(0, KLibSetRouterConf(kGateway, &conf, &err, true));
  EXPECT_EQ(ZARK_PORTMAP_ERR_NONE, err.err);

  ZARK_ROUTER_CONF got{};
  ASSERT_EQ(0, KLibGetRouterConf(kGateway, &got, &err, false));
  EXPECT_STREQ("Acme", got.brand);
  EXPECT_STREQ("http", got.conn_type);
  EXPECT_STREQ("80", got.conn_port);
  EXPECT_STREQ("", got.account);
  EXPECT_STREQ("", got.password);

  ASSERT_EQ(0, KLibGetRouterConf(kGateway, &got, &err, true));
  EXPECT_STREQ("admin", got.account);
  EXPECT_STREQ(kPassword, got.password);
  // The password reaches no log line, whatever happened above.
  for (const std::string &line : CapturedMessages()) {
    EXPECT_EQ(std::string::npos, line.find(kPassword)) << line;
  }
}

TEST_F(PortMapDBConfApi, MaxRuleComesFromTheDatabase) {
  ZARK_ROUTER_CONF conf = UpnpConf();
  ZARK_LIBZARKPORTMAP_ERR err{0};
  ASSERT_EQ(0, KLibSetRouterConf(kGateway, &conf, &err, true));
  ZARK_ROUTER_CONF stored{};
  int code = 0;
  ASSERT_TRUE(LoadRouterConfForGateway(kGateway, stored, code));
  EXPECT_STREQ("128", stored.max_rule);

  // A later database with another limit reaches the stored configuration.
  WriteRouterDb(
      kDbRoot, 1, 2,
      {{"Generic", "UPnP IGD", "generic", "generic", "upnp", "yes", "40"}});
  ZARK_ROUTER_CONF got{};
  ASSERT_EQ(0, KLibGetRouterConf(kGateway, &got, &err, false));
  EXPECT_STREQ("40", got.max_rule);
}

TEST_F(PortMapDBConfApi, RouterMissingFromTheDatabaseKeepsItsOwnLimit) {
  ZARK_ROUTER_CONF conf = WebConf();
  Set(conf.max_rule, "7");
  ZARK_LIBZARKPORTMAP_ERR err{0};
  ASSERT_EQ(0, KLibSetRouterConf(kGateway, &conf, &err, true));
  ZARK_ROUTER_CONF got{};
  ASSERT_EQ(0, KLibGetRouterConf(kGateway, &got, &err, false));
  EXPECT_STREQ("7", got.max_rule);
}

TEST_F(PortMapDBConfApi, DatabaseOfAnotherSyntaxAnswersError6) {
  ZARK_ROUTER_CONF conf = UpnpConf();
  ZARK_LIBZARKPORTMAP_ERR err{0};
  ASSERT_EQ(0, KLibSetRouterConf(kGateway, &conf, &err, true));
  WriteFile(kDbRoot + "/routerdb.conf", "syntax_version=2\nversion=9\n");
  ClearLogs();
  ZARK_ROUTER_CONF got{};
  EXPECT_EQ(-1, KLibGetRouterConf(kGateway, &got, &err, false));
  EXPECT_EQ(ZARK_PORTMAP_ERR_DB_SYNTAX, err.err);
  EXPECT_TRUE(HasLogContaining("has syntax version 2; this library reads "
                               "syntax version 1"));
  err.err = 0;
  EXPECT_EQ(-1, KLibSetRouterConf(kGateway, &conf, &err, true));
  EXPECT_EQ(ZARK_PORTMAP_ERR_DB_SYNTAX, err.err);
  // Without the database check the record is stored as it is.
  EXPECT_EQ(0, KLibSetRouterConf(kGateway, &conf, &err, false));
}

TEST_F(PortMapDBConfApi, NullArgumentsAreRefused) {
  ZARK_ROUTER_CONF conf{};
  ZARK_LIBZARKPORTMAP_ERR err{0};
  EXPECT_EQ(-1, KLibGetRouterConf(nullptr, &conf, &err, false));
  EXPECT_EQ(ZARK_PORTMAP_ERR_BAD_PARAMETER, err.err);
  EXPECT_EQ(-1, KLibSetRouterConf(kGateway, nullptr, &err, true));
  EXPECT_EQ(ZARK_PORTMAP_ERR_BAD_PARAMETER, err.err);
}

} // namespace
