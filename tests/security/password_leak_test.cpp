// The router's login password stays in the router configuration store.
// It is stored through the real host, then every method of the module runs
// (reading the configuration back, loading and saving rules, detection,
// the reachability tests, the compatibility test, storing the detected
// router, which runs the zarkportforward tool with the password in the
// store), and the password must appear in no answer, no syslog line of the
// host or of the programs it ran, and no file of the run other than the
// store itself.
//
// RouterConf get answers the brand, model, version, protocols, port and
// rule limit; it returns neither the account nor the password, so its
// answer is held to the same rule as every other.
#include "base/library_config.h"
#include "db_test_support.h"
#include "detect_support.h"
#include "hermetic.h"
#include "outside_services.h"
#include "security_support.h"
#include "test_network.h"

#include <sys/wait.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <random>

namespace zark::security {
namespace {

using namespace std::chrono_literals;

constexpr uint16_t kProbePort = 7777;
constexpr char kApi[] = "ZARK.Core.PortForwarding";
constexpr char kApiRouterConf[] = "ZARK.Core.PortForwarding.RouterConf";
constexpr char kApiRouterList[] = "ZARK.Core.PortForwarding.RouterList";
constexpr char kApiRules[] = "ZARK.Core.PortForwarding.Rules";
constexpr char kApiRulesServ[] = "ZARK.Core.PortForwarding.Rules.Serv";
constexpr char kApiCompatibility[] = "ZARK.Core.PortForwarding.Compatibility";

// A password no code or data of the project could hold by chance.
std::string DistinctivePassword() {
  std::random_device random;
  static const char kHex[] = "0123456789abcdef";
  std::string password = "RtPw-";
  for (int i = 0; i < 24; ++i) {
    password += kHex[random() % 16];
  }
  return password;
}

class SecurityPassword : public testing::Test {
protected:
  void SetUp() override {
    std::optional<zark::testnet::TestNetwork> network =
        zark::testnet::CurrentNetwork();
    ASSERT_TRUE(network.has_value())
        << "run through testnet/run-in-testnet.sh (as CTest does)";
    mNet = *network;
    zark::test::ResetFixedPaths();
    zark::test::InstallShippedRouterDb();
    std::string why;
    ASSERT_TRUE(zark::integration::ConfigureDetection(mNet, why)) << why;
    ASSERT_TRUE(zark::integration::InstallPortForwardTool(
        kPortForwardToolBuilt, false, mNet.lanRouter, why))
        << why;
    mOutside = std::make_unique<zark::integration::OutsideServices>(
        mNet, zark::integration::kDetectProbeName, mNet.wanOutside,
        zark::integration::kWanProbePort);
    ASSERT_TRUE(mOutside->Running()) << mOutside->Why();
    mProbe = std::make_unique<zark::testnet::OutsideProcess>(
        mNet, std::vector<std::string>{kProbed, "--listen",
                                       mNet.wanOutside + ":" +
                                           std::to_string(kProbePort)});
    ASSERT_TRUE(mProbe->WaitForTcp(mNet.wanOutside, kProbePort));
    zark::test::SetLibraryConfig(
        std::string(zark::portmap::config_key::kProbeServiceAddress),
        mNet.wanOutside + ":" + std::to_string(kProbePort));
    mHost = std::make_unique<HostProcess>();
  }

  // Calls api/method as the administrator and keeps the answer.
  HostAnswer Call(const std::string &api, const std::string &method,
                  const std::string &params = "") {
    HostAnswer answer =
        mHost->Call(*mAdmin, RowFields({api, 1, method}) + params);
    mBodies.push_back(api + " " + method + ": " + answer.body);
    return answer;
  }

  // Starts a background method and follows it to its end.
  void RunTask(const std::string &api, const std::string &method,
               const std::string &statusMethod,
               const std::string &params = "") {
    HostAnswer started = Call(api, method, params);
    ASSERT_TRUE(started.Success())
        << api << " " << method << ": " << started.body;
    HostAnswer last =
        WaitForTask(*mHost, *mAdmin, api, statusMethod, started, 90s);
    mBodies.push_back(api + " " + statusMethod + ": " + last.body);
  }

  std::string RouterConfParams(const std::string &supportUpnp) const {
    return "&router_brand=Generic&router_model=" + FormEncode("UPnP IGD") +
           "&router_version=generic&router_protocol=http&router_port=8080"
           "&router_account=rtadmin&router_pass=" +
           mPassword + "&support_upnp=" + supportUpnp + "&support_natpmp=no";
  }

  zark::testnet::TestNetwork mNet;
  std::unique_ptr<zark::integration::OutsideServices> mOutside;
  std::unique_ptr<zark::testnet::OutsideProcess> mProbe;
  // Made after the fixed folders are emptied: its syslog socket lives in
  // /tmp.
  std::unique_ptr<HostProcess> mHost;
  std::optional<HostSession> mAdmin;
  const std::string mPassword = DistinctivePassword();
  std::vector<std::string> mBodies;
};

TEST_F(SecurityPassword, AppearsNowhereButInTheRouterConfigurationStore) {
  std::string why;
  ASSERT_TRUE(mHost->Start(why)) << why;
  mAdmin = mHost->Login(kAdminAccount);
  ASSERT_TRUE(mAdmin);
  const std::string store =
      "/etc/portforward/routers/" + mNet.lanRouter + ".conf";
  const std::string rules =
      FormEncode(R"([{"enable":true,"rule_id":"1","router_protocol":"tcp",)"
                 R"("router_port":"18080","ds_port":"8080","serviceid":"",)"
                 R"("service_name":"web"}])");

  // A router driven through its pages, with a login.
  ASSERT_TRUE(Call(kApiRouterConf, "set", RouterConfParams("no")).Success())
      << mBodies.back();
  ASSERT_NE(std::string::npos, zark::test::ReadFile(store).find(mPassword))
      << "the store holds the password";
  HostAnswer conf = Call(kApiRouterConf, "get");
  EXPECT_TRUE(conf.Success()) << conf.body;
  EXPECT_EQ("http", conf.json["data"]["router_protocol"].asString());

  for (const auto &[api, method] :
       std::vector<std::pair<std::string, std::string>>{
           {kApiRouterList, "list"},
           {kApiRouterList, "get"},
           {kApiRouterList, "update"},
           {kApiRules, "load"},
           {kApi, "get_current_process"},
           {kApiRulesServ, "check"}}) {
    (void)Call(api, method);
  }
  RunTask(kApiRules, "save", "save_status", "&rules=" + rules);
  RunTask(kApiRules, "test", "test_status", "&selection=%22%22");
  RunTask(kApiRulesServ, "test", "test_status",
          "&service_id=" + FormEncode(R"(["web"])"));
  RunTask(kApi, "detect", "detect_status", "&auto_save=false");

  // The router that detection found, stored by UPnP: the module first
  // stores it under its detected name with the login, and runs the tool,
  // which reads that configuration.
  EXPECT_TRUE(Call(kApiRouterConf, "set", RouterConfParams("yes")).Success())
      << mBodies.back();
  (void)Call(kApiRouterConf, "get");
  RunTask(kApiRules, "save", "save_status", "&rules=" + rules);
  (void)Call(kApiRules, "load");
  // With a rule on the router: the reachability tests through the probe
  // service on the outside host.
  RunTask(kApiRules, "test", "test_status", "&selection=%22%22");
  RunTask(kApiRulesServ, "test", "test_status",
          "&service_id=" + FormEncode(R"(["web"])"));
  (void)Call(kApiRulesServ, "check");
  RunTask(kApiCompatibility, "test", "test_status");
  (void)Call(kApiCompatibility, "stop");
  (void)Call(kApiCompatibility, "upload");
  (void)Call(kApi, "get_current_process");

  // The login again, so that the store holds it at the end as well.
  EXPECT_TRUE(Call(kApiRouterConf, "set", RouterConfParams("no")).Success())
      << mBodies.back();
  (void)Call(kApiRouterConf, "get");
  const int status = mHost->Stop();
  EXPECT_TRUE(status != -1 && WIFEXITED(status) && WEXITSTATUS(status) == 0)
      << "the host did not stop cleanly: " << status;

  for (const std::string &body : mBodies) {
    EXPECT_EQ(std::string::npos, body.find(mPassword)) << body;
  }
  const std::vector<std::string> lines = mHost->LogLines();
  // The run did log, the tool too (it read the stored login): the check
  // below looked at something.
  EXPECT_GT(lines.size(), 10u);
  EXPECT_TRUE(std::any_of(lines.begin(), lines.end(),
                          [](const std::string &line) {
                            return line.find(" zarkportforward: ") !=
                                   std::string::npos;
                          }))
      << "the tool did not run";
  for (const std::string &line : lines) {
    EXPECT_EQ(std::string::npos, line.find(mPassword)) << line;
  }
  const std::vector<std::string> roots = ModuleWrittenRoots();
  std::vector<std::string> holding;
  for (const auto &[path, content] :
       ReadAllFiles(roots, {kWorkDir + "/modules"})) {
    if (content.find(mPassword) != std::string::npos) {
      holding.push_back(path);
    }
  }
  EXPECT_EQ(std::vector<std::string>{store}, holding);
}

} // namespace
} // namespace zark::security
