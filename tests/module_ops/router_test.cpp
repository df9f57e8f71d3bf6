// Router database, router list, router description, and the stored router
// configuration (get, set, and the configuration of a detected UPnP router).
#include "ops_test_support.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cstring>

namespace zark::ops {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;
using zark::fake::Fake;
using zark::fake::MakeRouterDBNode;

void SetText(char *field, const std::string &text) {
  std::snprintf(field, ZARK_PORTMAP_TEXT_SIZE, "%s", text.c_str());
}

// --- RouterList update -----------------------------------------------------

class ModuleOpsRouterList : public OpsTest {};

TEST_F(ModuleOpsRouterList, UpdateAnswersVersionAsInteger) {
  Fake().KLibUpdateRouterDBList = [](int *version) {
    EXPECT_EQ(0, *version);
    *version = 42;
    return 0;
  };
  Json::Value result(Json::objectValue);
  ASSERT_TRUE(pf->UpdateRouterList(result));
  ASSERT_TRUE(result["router_version"].isInt());
  EXPECT_EQ(ParseJson(R"({"router_version": 42})"), result);
}

TEST_F(ModuleOpsRouterList, UpdateFailureAnswers1510AfterBothLines) {
  Fake().KLibUpdateRouterDBList = [](int *) { return -1; };
  Json::Value result(Json::objectValue);
  EXPECT_FALSE(pf->UpdateRouterList(result));
  EXPECT_EQ(1510, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("KLibUpdateRouterDBList() failed",
                                    "update routerdb failed"));
  EXPECT_FALSE(result.isMember("router_version"));
}

TEST_F(ModuleOpsRouterList, UpdateWithoutReporterLogsAndSkipsTheCode) {
  PortForwarding bare(nullptr);
  Json::Value result(Json::objectValue);
  EXPECT_FALSE(bare.UpdateRouterList(result));
  EXPECT_THAT(PfLogs(),
              ElementsAre("mStatusReportor is NULL", "update routerdb failed"));
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibUpdateRouterDBList"));
}

// --- RouterList list -------------------------------------------------------

TEST_F(ModuleOpsRouterList, ListAnswersNodesInListOrder) {
  Fake().routerDB = {MakeRouterDBNode("Acme", "R1", "1.0", false),
                     MakeRouterDBNode("Acme", "generic", "2.1", true),
                     MakeRouterDBNode("Zed", "Z9", "", false)};
  Json::Value result(Json::objectValue);
  ASSERT_TRUE(pf->ListRouterList(result));
  EXPECT_EQ(ParseJson(R"({"routers": [
      {"router_brand": "Acme", "router_model": "R1", "router_version": "1.0",
       "generic": false},
      {"router_brand": "Acme", "router_model": "generic",
       "router_version": "2.1", "generic": true},
      {"router_brand": "Zed", "router_model": "Z9", "router_version": "",
       "generic": false}]})"),
            result);
  EXPECT_TRUE(result["routers"][1]["generic"].isBool());
  EXPECT_THAT(zark::fake::CallNames(),
              ElementsAre("KLibGetRouterDBList", "KLibFreeRouterDBList"));
}

TEST_F(ModuleOpsRouterList, EmptyDatabaseIsAnErrorWith1500NotAnEmptyList) {
  Json::Value result(Json::objectValue);
  EXPECT_FALSE(pf->ListRouterList(result));
  EXPECT_EQ(1500, pf->GetErrorCode());
  EXPECT_FALSE(result.isMember("routers"));
  EXPECT_THAT(PfLogs(), ElementsAre("plRouterDBList is NULL"));
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibFreeRouterDBList"));
}

TEST_F(ModuleOpsRouterList, ListFailureAnswers1500AndFreesWhatCameBack) {
  Fake().KLibGetRouterDBList = [](ZARK_ROUTERDB_LIST **list) {
    *list = static_cast<ZARK_ROUTERDB_LIST *>(
        calloc(1, sizeof(ZARK_ROUTERDB_LIST)));
    return -1;
  };
  Json::Value result(Json::objectValue);
  EXPECT_FALSE(pf->ListRouterList(result));
  EXPECT_EQ(1500, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("KLibGetRouterDBList() failed"));
  EXPECT_EQ(1u, zark::fake::CountCalls("KLibFreeRouterDBList"));
}

// --- RouterList get --------------------------------------------------------

TEST_F(ModuleOpsRouterList, DescAnswersSupportChangePortAsBoolean) {
  Fake().KLibGetRouterDesc = [](const char *gateway, ZARK_ROUTER_DESC *desc,
                                ZARK_LIBZARKPORTMAP_ERR *err, bool flag) {
    EXPECT_STREQ("192.168.1.1", gateway);
    EXPECT_FALSE(desc->support_change_port);
    EXPECT_EQ(0, err->err);
    EXPECT_TRUE(flag);
    desc->support_change_port = false;
    return 0;
  };
  Json::Value result(Json::objectValue);
  ASSERT_TRUE(pf->GetRouterDesc(result));
  ASSERT_TRUE(result["support_change_port"].isBool());
  EXPECT_EQ(ParseJson(R"({"support_change_port": false})"), result);

  Fake().KLibGetRouterDesc = [](const char *, ZARK_ROUTER_DESC *desc,
                                ZARK_LIBZARKPORTMAP_ERR *, bool) {
    desc->support_change_port = true;
    return 0;
  };
  ASSERT_TRUE(pf->GetRouterDesc(result));
  EXPECT_EQ(ParseJson(R"({"support_change_port": true})"), result);
}

TEST_F(ModuleOpsRouterList, DescSyntaxErrorAnswers1530WithBothLines) {
  Fake().KLibGetRouterDesc = [](const char *, ZARK_ROUTER_DESC *,
                                ZARK_LIBZARKPORTMAP_ERR *err, bool) {
    err->err = ZARK_PORTMAP_ERR_DB_SYNTAX;
    return -1;
  };
  Json::Value result(Json::objectValue);
  EXPECT_FALSE(pf->GetRouterDesc(result));
  EXPECT_EQ(1530, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("routerdb syntax version error",
                                    "get router desc failed err=6"));
}

TEST_F(ModuleOpsRouterList, DescOtherErrorAnswers1500WithOneLine) {
  Fake().KLibGetRouterDesc = [](const char *, ZARK_ROUTER_DESC *,
                                ZARK_LIBZARKPORTMAP_ERR *err, bool) {
    err->err = ZARK_PORTMAP_ERR_NOT_CONFIGURED;
    return -1;
  };
  Json::Value result(Json::objectValue);
  EXPECT_FALSE(pf->GetRouterDesc(result));
  EXPECT_EQ(1500, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("get router desc failed err=2"));
}

TEST_F(ModuleOpsRouterList, DescWithoutGatewayAnswers1503BeforeTheDatabase) {
  Fake().KLibGetGatewayIP = [](char *, int) { return -1; };
  Json::Value result(Json::objectValue);
  EXPECT_FALSE(pf->GetRouterDesc(result));
  EXPECT_EQ(1503, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("unable to get gateway ip"));
  EXPECT_THAT(zark::fake::CallNames(), ElementsAre("KLibGetGatewayIP"));
  EXPECT_EQ("1024", zark::fake::Calls()[0].args[0]);
}

TEST_F(ModuleOpsRouterList, DescWithoutReporterLogs) {
  PortForwarding bare(nullptr);
  Json::Value result(Json::objectValue);
  EXPECT_FALSE(bare.GetRouterDesc(result));
  EXPECT_THAT(PfLogs(), ElementsAre("mStatusReportor is NULL"));
  EXPECT_THAT(zark::fake::CallNames(), IsEmpty());
}

// --- RouterConf get --------------------------------------------------------

class ModuleOpsRouterConf : public OpsTest {
protected:
  // Calls SetRouterConf with the user's values.
  bool Set(const std::string &connType, const std::string &connPort,
           bool hasAccount, const std::string &account,
           const std::string &password, const std::string &upnp,
           const std::string &natpmp) {
    Json::Value result(Json::objectValue);
    bool ok = pf->SetRouterConf(result, "Acme", "R1", "1.0", connType, connPort,
                                hasAccount, account, password, upnp, natpmp);
    EXPECT_EQ(Json::Value(Json::objectValue), result);
    return ok;
  }

  void DetectedName(const std::string &pfpath) {
    SetText(Fake().detectResult.upnp_pfpath, pfpath);
  }

  // The tool that "set" runs after storing a detected router's
  // configuration; it leaves a mark so a test sees that and when it ran.
  void InstallTool(const std::string &body) {
    zark::test::WriteFile("/usr/zark/bin/zarkportforward", "#!/bin/sh\n" + body,
                          0755);
  }
};

TEST_F(ModuleOpsRouterConf, GetAnswersEightStringKeys) {
  ZARK_ROUTER_CONF &conf = Fake().routerConf;
  SetText(conf.brand, "Acme");
  SetText(conf.model, "R1");
  SetText(conf.version, "1.0");
  SetText(conf.support_upnp, "no");
  SetText(conf.support_natpmp, "yes");
  SetText(conf.account, "admin");
  SetText(conf.password, "secret");
  SetText(conf.conn_type, "https");
  SetText(conf.conn_port, "8443");
  SetText(conf.max_rule, "32");
  Json::Value result(Json::objectValue);
  ASSERT_TRUE(pf->GetRouterConf(result));
  EXPECT_EQ(ParseJson(R"({"router_brand": "Acme", "router_model": "R1",
      "router_version": "1.0", "support_upnp": "no", "support_natpmp": "yes",
      "router_port": "8443", "router_protocol": "https",
      "router_max_rule": "32"})"),
            result);
  EXPECT_TRUE(result["router_port"].isString());
  EXPECT_TRUE(result["router_max_rule"].isString());
  auto calls = zark::fake::Calls();
  ASSERT_EQ(2u, calls.size());
  EXPECT_THAT(calls[1].args, ElementsAre("192.168.1.1", "false"));
}

TEST_F(ModuleOpsRouterConf, GetNotConfiguredAnswers1501WithoutLogLine) {
  Fake().KLibGetRouterConf = [](const char *, ZARK_ROUTER_CONF *,
                                ZARK_LIBZARKPORTMAP_ERR *err, bool) {
    err->err = ZARK_PORTMAP_ERR_NOT_CONFIGURED;
    return -1;
  };
  Json::Value result(Json::objectValue);
  EXPECT_FALSE(pf->GetRouterConf(result));
  EXPECT_EQ(1501, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), IsEmpty());
}

TEST_F(ModuleOpsRouterConf, GetSyntaxErrorAnswers1530) {
  Fake().KLibGetRouterConf = [](const char *, ZARK_ROUTER_CONF *,
                                ZARK_LIBZARKPORTMAP_ERR *err, bool) {
    err->err = ZARK_PORTMAP_ERR_DB_SYNTAX;
    return -1;
  };
  Json::Value result(Json::objectValue);
  EXPECT_FALSE(pf->GetRouterConf(result));
  EXPECT_EQ(1530, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("routerdb syntax version error"));
}

TEST_F(ModuleOpsRouterConf, GetOtherErrorAnswers1500) {
  Fake().KLibGetRouterConf = [](const char *, ZARK_ROUTER_CONF *,
                                ZARK_LIBZARKPORTMAP_ERR *err, bool) {
    err->err = ZARK_PORTMAP_ERR_IO;
    return -1;
  };
  Json::Value result(Json::objectValue);
  EXPECT_FALSE(pf->GetRouterConf(result));
  EXPECT_EQ(1500, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("KLibGetRouterConf() failed"));
}

TEST_F(ModuleOpsRouterConf, GetWithoutGatewayAnswers1503) {
  Fake().KLibGetGatewayIP = [](char *, int) { return -1; };
  Json::Value result(Json::objectValue);
  EXPECT_FALSE(pf->GetRouterConf(result));
  EXPECT_EQ(1503, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("unable to get gateway ip"));
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibGetRouterConf"));
}

TEST_F(ModuleOpsRouterConf, GetWithoutReporterLogs) {
  PortForwarding bare(nullptr);
  Json::Value result(Json::objectValue);
  EXPECT_FALSE(bare.GetRouterConf(result));
  EXPECT_THAT(PfLogs(), ElementsAre("mStatusReportor is NULL"));
}

// --- RouterConf set --------------------------------------------------------

TEST_F(ModuleOpsRouterConf, UpnpRouterStoredWithoutConnectionOrLogin) {
  ASSERT_TRUE(Set("", "80", true, "admin", "secret", "yes", "no"));
  ASSERT_EQ(1u, Fake().storedConfs.size());
  const ZARK_ROUTER_CONF &conf = Fake().storedConfs[0];
  EXPECT_STREQ("Acme", conf.brand);
  EXPECT_STREQ("R1", conf.model);
  EXPECT_STREQ("1.0", conf.version);
  EXPECT_STREQ("yes", conf.support_upnp);
  EXPECT_STREQ("no", conf.support_natpmp);
  EXPECT_STREQ("", conf.conn_type);
  EXPECT_STREQ("", conf.conn_port);
  EXPECT_STREQ("", conf.account);
  EXPECT_STREQ("", conf.password);
  EXPECT_STREQ("", conf.max_rule);
  auto calls = zark::fake::Calls();
  EXPECT_THAT(zark::fake::CallNames(),
              ElementsAre("KLibGetGatewayIP", "KLibGetRouterDetectResult",
                          "KLibSetRouterConf"));
  EXPECT_THAT(calls[2].args, ElementsAre("192.168.1.1", "true"));
  EXPECT_THAT(PfLogs(), IsEmpty());
}

TEST_F(ModuleOpsRouterConf, NatpmpRouterStoredWithoutConnection) {
  ASSERT_TRUE(Set("", "", false, "", "", "no", "yes"));
  ASSERT_EQ(1u, Fake().storedConfs.size());
  EXPECT_STREQ("yes", Fake().storedConfs[0].support_natpmp);
  EXPECT_STREQ("", Fake().storedConfs[0].conn_type);
}

TEST_F(ModuleOpsRouterConf, PageDrivenRouterWithoutConnTypeFails) {
  EXPECT_FALSE(Set("", "80", false, "", "", "no", "no"));
  EXPECT_EQ(1500, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("conntype shall not be empty",
                                    "set router conf failed"));
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibSetRouterConf"));
}

TEST_F(ModuleOpsRouterConf, PageDrivenRouterWithoutConnPortFails) {
  EXPECT_FALSE(Set("http", "", false, "", "", "no", "no"));
  EXPECT_EQ(1500, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("connport shall not be empty",
                                    "set router conf failed"));
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibSetRouterConf"));
}

TEST_F(ModuleOpsRouterConf, PageDrivenRouterStoresConnectionAndLogin) {
  ASSERT_TRUE(Set("http", "80", true, "admin", "secret", "no", "no"));
  ASSERT_EQ(1u, Fake().storedConfs.size());
  const ZARK_ROUTER_CONF &conf = Fake().storedConfs[0];
  EXPECT_STREQ("http", conf.conn_type);
  EXPECT_STREQ("80", conf.conn_port);
  EXPECT_STREQ("admin", conf.account);
  EXPECT_STREQ("secret", conf.password);
  EXPECT_STREQ("no", conf.support_upnp);
  EXPECT_STREQ("no", conf.support_natpmp);
}

TEST_F(ModuleOpsRouterConf, EmptyAccountDropsThePassword) {
  ASSERT_TRUE(Set("http", "80", true, "", "secret", "no", "no"));
  EXPECT_STREQ("", Fake().storedConfs[0].account);
  EXPECT_STREQ("", Fake().storedConfs[0].password);
}

TEST_F(ModuleOpsRouterConf, NoAccountLeavesLoginEmpty) {
  ASSERT_TRUE(Set("http", "80", false, "admin", "secret", "no", "no"));
  EXPECT_STREQ("", Fake().storedConfs[0].account);
  EXPECT_STREQ("", Fake().storedConfs[0].password);
}

TEST_F(ModuleOpsRouterConf, OtherSupportWordsCountAsNo) {
  EXPECT_FALSE(Set("", "80", false, "", "", "YES", "unknown"));
  EXPECT_THAT(PfLogs(), ElementsAre("conntype shall not be empty",
                                    "set router conf failed"));
}

TEST_F(ModuleOpsRouterConf, ValuesAreCutTo1023Characters) {
  Json::Value result(Json::objectValue);
  std::string longText(1500, 'm');
  ASSERT_TRUE(pf->SetRouterConf(result, longText, longText, longText, longText,
                                longText, true, longText, longText, "no",
                                "no"));
  const ZARK_ROUTER_CONF &conf = Fake().storedConfs.at(0);
  EXPECT_EQ(longText.substr(0, 1023), std::string(conf.brand));
  EXPECT_EQ(longText.substr(0, 1023), std::string(conf.conn_port));
  EXPECT_EQ(longText.substr(0, 1023), std::string(conf.password));
}

TEST_F(ModuleOpsRouterConf, SyntaxErrorOnStoreAnswers1530) {
  Fake().KLibSetRouterConf = [](const char *, const ZARK_ROUTER_CONF *,
                                ZARK_LIBZARKPORTMAP_ERR *err, bool) {
    err->err = ZARK_PORTMAP_ERR_DB_SYNTAX;
    return -1;
  };
  EXPECT_FALSE(Set("http", "80", true, "admin", "s3cr3t-pass", "no", "no"));
  EXPECT_EQ(1530, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("routerdb syntax version error",
                                    "get router conf failed err=6",
                                    "set router conf failed"));
  EXPECT_THAT(AllLogText(), Not(HasSubstr("s3cr3t-pass")));
}

TEST_F(ModuleOpsRouterConf, OtherErrorOnStoreAnswers1500) {
  Fake().KLibSetRouterConf = [](const char *, const ZARK_ROUTER_CONF *,
                                ZARK_LIBZARKPORTMAP_ERR *err, bool) {
    err->err = ZARK_PORTMAP_ERR_ROUTER;
    return -1;
  };
  EXPECT_FALSE(Set("http", "80", false, "", "", "no", "no"));
  EXPECT_EQ(1500, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("get router conf failed err=5",
                                    "set router conf failed"));
}

TEST_F(ModuleOpsRouterConf, SetWithoutGatewayAnswers1503) {
  Fake().KLibGetGatewayIP = [](char *, int) { return -1; };
  EXPECT_FALSE(Set("http", "80", false, "", "", "no", "no"));
  EXPECT_EQ(1503, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("unable to get gateway ip"));
  EXPECT_THAT(zark::fake::CallNames(), ElementsAre("KLibGetGatewayIP"));
}

TEST_F(ModuleOpsRouterConf, SetWithoutDetectionResultAnswers1500) {
  Fake().KLibGetRouterDetectResult = [](ZARK_ROUTER_DETECT_RESULT *) {
    return -1;
  };
  EXPECT_FALSE(Set("http", "80", false, "", "", "no", "no"));
  EXPECT_EQ(1500, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("KLibGetRouterDetectResult failed"));
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibSetRouterConf"));
}

TEST_F(ModuleOpsRouterConf, SetWithoutReporterLogs) {
  PortForwarding bare(nullptr);
  Json::Value result(Json::objectValue);
  EXPECT_FALSE(bare.SetRouterConf(result, "a", "b", "c", "http", "80", false,
                                  "", "", "no", "no"));
  EXPECT_THAT(PfLogs(), ElementsAre("status reportor shall not be NULL"));
  EXPECT_THAT(zark::fake::CallNames(), IsEmpty());
}

// --- RouterConf set: the detected UPnP router ------------------------------

TEST_F(ModuleOpsRouterConf, DetectedRouterStoredFirstThenToolThenUsers) {
  DetectedName("Netco: NX-300(2.0.1)");
  InstallTool("echo noise; echo ran >> /tmp/tool.ran\nexit 3\n");
  std::vector<bool> toolHadRun;
  Fake().KLibSetRouterConf = [&toolHadRun](const char *,
                                           const ZARK_ROUTER_CONF *conf,
                                           ZARK_LIBZARKPORTMAP_ERR *, bool) {
    toolHadRun.push_back(access("/tmp/tool.ran", F_OK) == 0);
    Fake().storedConfs.push_back(*conf);
    return 0;
  };
  // Its own non-zero exit status does not fail the set.
  ASSERT_TRUE(Set("http", "8080", true, "admin", "pw", "yes", "no"));
  ASSERT_EQ(2u, Fake().storedConfs.size());
  EXPECT_THAT(toolHadRun, ElementsAre(false, true));
  EXPECT_EQ("ran\n", zark::test::ReadFile("/tmp/tool.ran"));

  const ZARK_ROUTER_CONF &detected = Fake().storedConfs[0];
  EXPECT_STREQ("Netco", detected.brand);
  EXPECT_STREQ("NX-300", detected.model);
  EXPECT_STREQ("2.0.1", detected.version);
  EXPECT_STREQ("no", detected.support_upnp);
  EXPECT_STREQ("no", detected.support_natpmp);
  EXPECT_STREQ("http", detected.conn_type);
  EXPECT_STREQ("8080", detected.conn_port);
  EXPECT_STREQ("admin", detected.account);
  EXPECT_STREQ("pw", detected.password);

  const ZARK_ROUTER_CONF &users = Fake().storedConfs[1];
  EXPECT_STREQ("Acme", users.brand);
  EXPECT_STREQ("yes", users.support_upnp);
  EXPECT_STREQ("", users.conn_type);
  EXPECT_THAT(PfLogs(), IsEmpty());
}

TEST_F(ModuleOpsRouterConf, OnlyTheLastClosingParenthesisIsCut) {
  DetectedName("Netco: NX(v1)beta)");
  ASSERT_TRUE(Set("http", "80", false, "", "", "yes", "no"));
  ASSERT_EQ(2u, Fake().storedConfs.size());
  EXPECT_STREQ("NX", Fake().storedConfs[0].model);
  EXPECT_STREQ("v1)beta", Fake().storedConfs[0].version);
}

TEST_F(ModuleOpsRouterConf, VersionWithoutClosingParenthesisIsKept) {
  DetectedName("Netco: NX(3.1");
  ASSERT_TRUE(Set("http", "80", false, "", "", "yes", "no"));
  EXPECT_STREQ("3.1", Fake().storedConfs.at(0).version);
}

TEST_F(ModuleOpsRouterConf, NameWithoutColonBlankFailsTheSplit) {
  DetectedName("Netco NX-300");
  EXPECT_FALSE(Set("http", "80", false, "", "", "yes", "no"));
  EXPECT_EQ(1500, pf->GetErrorCode());
  EXPECT_THAT(PfLogs(),
              ElementsAre("incorrect information", "split router name failed"));
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibSetRouterConf"));
}

TEST_F(ModuleOpsRouterConf, NameWithoutVersionReadsTheGenericDescription) {
  DetectedName("Netco: NX-300");
  zark::test::WriteFile(
      "/etc.defaults/portforward/routerdb/Netco/NX-300/generic",
      "[router]\nname=NX\nversion=4.2.0\n");
  ASSERT_TRUE(Set("http", "80", false, "", "", "yes", "no"));
  ASSERT_EQ(2u, Fake().storedConfs.size());
  EXPECT_STREQ("Netco", Fake().storedConfs[0].brand);
  EXPECT_STREQ("NX-300", Fake().storedConfs[0].model);
  EXPECT_STREQ("4.2.0", Fake().storedConfs[0].version);
}

TEST_F(ModuleOpsRouterConf, MissingGenericDescriptionFailsTheSet) {
  DetectedName("Netco: NX-300");
  EXPECT_FALSE(Set("http", "80", false, "", "", "yes", "no"));
  EXPECT_THAT(PfLogs(),
              ElementsAre("incorrect information", "split router name failed"));
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibSetRouterConf"));
}

TEST_F(ModuleOpsRouterConf, GenericDescriptionWithoutVersionFailsTheSet) {
  DetectedName("Netco: NX-300");
  zark::test::WriteFile(
      "/etc.defaults/portforward/routerdb/Netco/NX-300/generic",
      "name=NX\nversion=\n");
  EXPECT_FALSE(Set("http", "80", false, "", "", "yes", "no"));
  EXPECT_THAT(PfLogs(),
              ElementsAre("incorrect information", "split router name failed"));
}

TEST_F(ModuleOpsRouterConf, DetectedRouterNeedsAConnectionType) {
  DetectedName("Netco: NX(1)");
  EXPECT_FALSE(Set("", "80", false, "", "", "yes", "no"));
  EXPECT_THAT(PfLogs(), ElementsAre("conntype shall not be empty",
                                    "set pfpath router conf failed"));
  EXPECT_EQ(0u, zark::fake::CountCalls("KLibSetRouterConf"));
}

TEST_F(ModuleOpsRouterConf, DetectedNameIgnoredUnlessUpnpIsYes) {
  DetectedName("Netco: NX(1)");
  ASSERT_TRUE(Set("http", "80", false, "", "", "no", "yes"));
  ASSERT_EQ(1u, Fake().storedConfs.size());
  EXPECT_STREQ("Acme", Fake().storedConfs[0].brand);
}

TEST_F(ModuleOpsRouterConf, MissingToolStillCountsAsRun) {
  DetectedName("Netco: NX(1)");
  // No tool installed: the shell answers 127, which is an exit status.
  ASSERT_TRUE(Set("http", "80", false, "", "", "yes", "no"));
  EXPECT_EQ(2u, Fake().storedConfs.size());
}

TEST_F(ModuleOpsRouterConf, ToolThatCannotRunFailsAfterTheDetectedConf) {
  DetectedName("Netco: NX(1)");
  // Kills the shell that runs it, so the run itself fails; only a parent
  // that really is that shell is killed.
  InstallTool("p=$PPID\n"
              "[ \"$(cat /proc/$p/comm)\" = sh ] && kill -KILL $p\n"
              "sleep 1\n");
  EXPECT_FALSE(Set("http", "80", false, "", "", "yes", "no"));
  EXPECT_THAT(PfLogs(), ElementsAre("execute zarkportforward failed"));
  // The detected router's configuration stays; nothing is rolled back.
  ASSERT_EQ(1u, Fake().storedConfs.size());
  EXPECT_STREQ("Netco", Fake().storedConfs[0].brand);
}

TEST_F(ModuleOpsRouterConf, UsersConfRefusedAfterDetectedConfKeepsTheFirst) {
  DetectedName("Netco: NX(1)");
  int calls = 0;
  Fake().KLibSetRouterConf = [&calls](const char *,
                                      const ZARK_ROUTER_CONF *conf,
                                      ZARK_LIBZARKPORTMAP_ERR *err, bool) {
    if (++calls == 2) {
      err->err = ZARK_PORTMAP_ERR_IO;
      return -1;
    }
    Fake().storedConfs.push_back(*conf);
    return 0;
  };
  EXPECT_FALSE(Set("http", "80", false, "", "", "yes", "no"));
  EXPECT_THAT(PfLogs(), ElementsAre("get router conf failed err=4",
                                    "set router conf failed"));
  ASSERT_EQ(1u, Fake().storedConfs.size());
  EXPECT_STREQ("Netco", Fake().storedConfs[0].brand);
}

TEST_F(ModuleOpsRouterConf, PasswordIsNeverLogged) {
  DetectedName("Netco NX");
  EXPECT_FALSE(Set("http", "80", true, "admin", "pa55-word", "yes", "no"));
  Fake().KLibSetRouterConf = [](const char *, const ZARK_ROUTER_CONF *,
                                ZARK_LIBZARKPORTMAP_ERR *err, bool) {
    err->err = ZARK_PORTMAP_ERR_GENERIC;
    return -1;
  };
  DetectedName("");
  EXPECT_FALSE(Set("http", "80", true, "admin", "pa55-word", "no", "no"));
  EXPECT_FALSE(PfLogs().empty());
  EXPECT_THAT(AllLogText(), Not(HasSubstr("pa55-word")));
}

} // namespace
} // namespace zark::ops
