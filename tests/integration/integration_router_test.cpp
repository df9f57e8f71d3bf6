// RouterList (list, update, get) and RouterConf (get, set) through the
// module's entry functions, on the real platform library, in the server
// namespace of a test network whose default gateway is the test router.
#include "detect_support.h"
#include "integration_fixture.h"

#include "base/library_config.h"
#include "catalog/router_conf_store.h"

#include <sys/stat.h>

#include <filesystem>

namespace zark::integration {
namespace {

namespace fs = std::filesystem;
using zark::test::CapturedMessages;
using zark::test::DescribeTree;
using zark::test::HasLogContaining;
using zark::test::kDbRoot;
using zark::test::PackRouterDb;
using zark::test::SetLibraryConfig;
using zark::test::WriteFile;
using zark::test::WriteRouterDb;

const std::string kSourceKey(zark::portmap::config_key::kRouterDbUpdateSource);
constexpr const char *kPassword = "pa55-w0rd-zark";

// RouterConf set reads the last detection's result first: a real
// detection of the test router runs before each set (detect_support.h).
void DetectTheTestRouter(const zark::testnet::TestNetwork &network) {
  ZARK_ROUTER_DETECT_RESULT result{};
  std::string why;
  ASSERT_EQ(0, zark::integration::DetectInTestNetwork(network, result, why))
      << why;
  ASSERT_STREQ("ZarkTest: TestIGD(1)", result.upnp_pfpath);
  zark::test::ClearLogs();
}

void MakeArchive(int syntax, int version, const std::string &archive) {
  std::error_code ec;
  fs::remove_all("/tmp/dbwork", ec);
  WriteRouterDb(
      "/tmp/dbwork/routerdb", syntax, version,
      {{"Generic", "UPnP IGD", "generic", "generic", "upnp", "yes", "128"},
       {"Acme", "R1", "2.0", "2.0", "web", "no", "16"}});
  PackRouterDb("/tmp/dbwork", archive);
}

class IntegrationRouterList : public IntegrationTest {};

TEST_F(IntegrationRouterList, ListAnswersEveryRouterOfTheDatabase) {
  Answer answer = Invoke(kApiRouterList, "list");
  ASSERT_TRUE(answer.success) << answer.errorCode;
  EXPECT_EQ(ParseJson(R"({"routers": [
      {"router_brand": "Generic", "router_model": "NAT-PMP",
       "router_version": "generic", "generic": true},
      {"router_brand": "Generic", "router_model": "UPnP IGD",
       "router_version": "generic", "generic": true}]})"),
            answer.data);
}

TEST_F(IntegrationRouterList, UpdateFromALocalArchiveInstallsTheNewDatabase) {
  MakeArchive(1, 2, "/tmp/routerdb.tgz");
  SetLibraryConfig(kSourceKey, "/tmp/routerdb.tgz");
  Answer answer = Invoke(kApiRouterList, "update");
  ASSERT_TRUE(answer.success) << answer.errorCode;
  EXPECT_EQ(ParseJson(R"({"router_version": 2})"), answer.data);
  ASSERT_TRUE(answer.data["router_version"].isInt());

  answer = Invoke(kApiRouterList, "list");
  ASSERT_TRUE(answer.success);
  EXPECT_EQ(ParseJson(R"({"routers": [
      {"router_brand": "Acme", "router_model": "R1",
       "router_version": "2.0", "generic": false},
      {"router_brand": "Generic", "router_model": "UPnP IGD",
       "router_version": "generic", "generic": true}]})"),
            answer.data);
}

TEST_F(IntegrationRouterList, UpdateOfAnotherSyntaxFailsAndKeepsTheDatabase) {
  const std::string before = DescribeTree(kDbRoot);
  MakeArchive(2, 9, "/tmp/routerdb.tgz");
  SetLibraryConfig(kSourceKey, "/tmp/routerdb.tgz");
  Answer answer = Invoke(kApiRouterList, "update");
  EXPECT_FALSE(answer.success);
  // The module answers every failed update with 1510; the library's log
  // says why.
  EXPECT_EQ(1510, answer.errorCode);
  EXPECT_TRUE(HasLogContaining("has syntax version 2; this library reads "
                               "syntax version 1"));
  EXPECT_EQ(before, DescribeTree(kDbRoot));
  EXPECT_TRUE(Invoke(kApiRouterList, "list").success);
}

TEST_F(IntegrationRouterList, UpdateWithoutSourceAnswers1510) {
  Answer answer = Invoke(kApiRouterList, "update");
  EXPECT_FALSE(answer.success);
  EXPECT_EQ(1510, answer.errorCode);
}

TEST_F(IntegrationRouterList, GetAnswersForTheRouterAtTheGateway) {
  ConfigureRouter("UPnP IGD", "yes", "no");
  Answer answer = Invoke(kApiRouterList, "get");
  ASSERT_TRUE(answer.success) << answer.errorCode;
  EXPECT_EQ(ParseJson(R"({"support_change_port": true})"), answer.data);
}

TEST_F(IntegrationRouterList, GetWithoutConfigurationFails) {
  Answer answer = Invoke(kApiRouterList, "get");
  EXPECT_FALSE(answer.success);
  EXPECT_EQ(1500, answer.errorCode);
  EXPECT_TRUE(HasLogContaining("get router desc failed err=2"));
}

TEST_F(IntegrationRouterList, InstalledDatabaseOfAnotherSyntaxAnswers1530) {
  ConfigureRouter("UPnP IGD", "yes", "no");
  WriteFile(kDbRoot + "/routerdb.conf", "syntax_version=2\nversion=3\n");
  Answer answer = Invoke(kApiRouterList, "get");
  EXPECT_FALSE(answer.success);
  EXPECT_EQ(1530, answer.errorCode);
  EXPECT_TRUE(HasLogContaining("routerdb syntax version error"));
  EXPECT_TRUE(HasLogContaining("get router desc failed err=6"));

  answer = Invoke(kApiRouterConf, "get");
  EXPECT_FALSE(answer.success);
  EXPECT_EQ(1530, answer.errorCode);
}

class IntegrationRouterConf : public IntegrationTest {};

TEST_F(IntegrationRouterConf, GetAnswersTheStoredConfiguration) {
  ZARK_ROUTER_CONF conf{};
  std::strcpy(conf.brand, "Acme");
  std::strcpy(conf.model, "R1");
  std::strcpy(conf.version, "2.0");
  std::strcpy(conf.support_upnp, "no");
  std::strcpy(conf.support_natpmp, "no");
  std::strcpy(conf.account, "admin");
  std::strcpy(conf.password, kPassword);
  std::strcpy(conf.conn_type, "https");
  std::strcpy(conf.conn_port, "8443");
  std::strcpy(conf.max_rule, "12");
  ZARK_LIBZARKPORTMAP_ERR err{0};
  ASSERT_EQ(0, KLibSetRouterConf(mNet.lanRouter.c_str(), &conf, &err, true));

  Answer answer = Invoke(kApiRouterConf, "get");
  ASSERT_TRUE(answer.success) << answer.errorCode;
  EXPECT_EQ(ParseJson(R"({"router_brand": "Acme", "router_model": "R1",
      "router_version": "2.0", "support_upnp": "no", "support_natpmp": "no",
      "router_port": "8443", "router_protocol": "https",
      "router_max_rule": "12"})"),
            answer.data);
}

TEST_F(IntegrationRouterConf, GetTakesTheRuleLimitFromTheDatabase) {
  ConfigureRouter("NAT-PMP", "no", "yes");
  Answer answer = Invoke(kApiRouterConf, "get");
  ASSERT_TRUE(answer.success) << answer.errorCode;
  EXPECT_EQ("128", answer.data["router_max_rule"].asString());
  EXPECT_EQ("yes", answer.data["support_natpmp"].asString());
}

TEST_F(IntegrationRouterConf, GetWithoutConfigurationAnswers1501) {
  Answer answer = Invoke(kApiRouterConf, "get");
  EXPECT_FALSE(answer.success);
  EXPECT_EQ(1501, answer.errorCode);
}

TEST_F(IntegrationRouterConf, SetStoresAUpnpRouterForTheGateway) {
  ASSERT_NO_FATAL_FAILURE(DetectTheTestRouter(mNet));
  // The detected UPnP router's own configuration is stored first and the
  // tool runs with it; that configuration needs a connection type.
  std::string why;
  ASSERT_TRUE(zark::integration::InstallPortForwardTool(
      ZARK_PORTFORWARD_TOOL_PATH, false, mNet.lanRouter, why))
      << why;
  Answer answer =
      Invoke(kApiRouterConf, "set", ParseJson(R"({"router_brand": "Generic",
                           "router_model": "UPnP IGD",
                           "router_version": "generic",
                           "router_protocol": "http",
                           "support_upnp": "yes", "support_natpmp": "no"})"));
  ASSERT_TRUE(answer.success) << answer.errorCode;
  answer = Invoke(kApiRouterConf, "get");
  ASSERT_TRUE(answer.success);
  EXPECT_EQ("UPnP IGD", answer.data["router_model"].asString());
  EXPECT_EQ("yes", answer.data["support_upnp"].asString());
  EXPECT_EQ("128", answer.data["router_max_rule"].asString());
  answer = Invoke(kApiRouterList, "get");
  ASSERT_TRUE(answer.success);
  EXPECT_TRUE(answer.data["support_change_port"].asBool());
}

TEST_F(IntegrationRouterConf, SetKeepsTheRouterPasswordPrivate) {
  ASSERT_NO_FATAL_FAILURE(DetectTheTestRouter(mNet));
  Json::Value params = ParseJson(R"({"router_brand": "Acme",
      "router_model": "R1", "router_version": "2.0", "support_upnp": "no",
      "support_natpmp": "no", "router_protocol": "http", "router_port": 8080,
      "router_account": "admin"})");
  params["router_pass"] = kPassword;
  Answer answer = Invoke(kApiRouterConf, "set", params);
  ASSERT_TRUE(answer.success) << answer.errorCode;

  const std::string path = zark::portmap::RouterConfPath(mNet.lanRouter);
  struct stat info {};
  ASSERT_EQ(0, ::stat(path.c_str(), &info));
  EXPECT_EQ(0600u, info.st_mode & 07777);
  answer = Invoke(kApiRouterConf, "get");
  ASSERT_TRUE(answer.success);
  EXPECT_EQ("8080", answer.data["router_port"].asString());
  EXPECT_EQ(std::string::npos, answer.data.toStyledString().find(kPassword));
  for (const std::string &line : CapturedMessages()) {
    EXPECT_EQ(std::string::npos, line.find(kPassword)) << line;
  }
  // The library itself still has it, for the router's pages.
  ZARK_ROUTER_CONF stored{};
  ASSERT_EQ(0,
            KLibGetRouterConf(mNet.lanRouter.c_str(), &stored, nullptr, true));
  EXPECT_STREQ(kPassword, stored.password);
}

} // namespace
} // namespace zark::integration
