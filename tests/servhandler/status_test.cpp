// Forwarding status of services: which services the saved rules already
// forward. Real rule store, core library and firewall platform over files
// written in the private namespace.
#include "RouterRuleServHandler.h"
#include "hermetic.h"
#include "libzarkportmap.h"
#include "serv_test_env.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <stdexcept>

namespace {

using namespace zark::test;

Json::Value Ids(std::initializer_list<const char *> ids) {
  Json::Value array(Json::arrayValue);
  for (const char *id : ids) {
    array.append(id);
  }
  return array;
}

Json::Value Parse(const std::string &text) {
  Json::Value value;
  Json::Reader reader;
  EXPECT_TRUE(reader.parse(text, value)) << text;
  return value;
}

class ServHandlerStatus : public ::testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    ClearLogs();
    WriteFile(ZARK_FW_SERVICE_MAPPING_TABLE, "# no entries\n");
  }

  Json::Value Status(const Json::Value &ids) {
    RouterRuleServHandler handler;
    Json::Value out(Json::arrayValue);
    EXPECT_EQ(handler.GetServPfStatus(ids, out), 0);
    return out;
  }
};

TEST_F(ServHandlerStatus, EmptyListReportsEveryServiceOfTheDevice) {
  WriteSystemService("web", Section("web", "tcp", "80"));
  WriteSystemService("dns", Section("dns", "udp", "53"));
  SaveRules({Rule("0", true, "53", "53", "udp")});
  EXPECT_EQ(Status(Json::Value(Json::arrayValue)),
            Parse(R"([{"service_id": "dns", "status": "allow",
                       "port_info": {"dns": "allow"}},
                      {"service_id": "web", "status": "deny",
                       "port_info": {"web": "deny"}}])"));
}

TEST_F(ServHandlerStatus, NonArrayIdentifiersAreRefusedAndOutStaysUntouched) {
  WriteSystemService("web", Section("web", "tcp", "80"));
  for (const Json::Value &ids :
       {Json::Value("web"), Json::Value(), Json::Value(7)}) {
    ClearLogs();
    RouterRuleServHandler handler;
    Json::Value out = Parse(R"(["before"])");
    EXPECT_EQ(handler.GetServPfStatus(ids, out), 0);
    EXPECT_EQ(out, Parse(R"(["before"])"));
    EXPECT_TRUE(HasServLog("Required parameter error!"));
  }
}

TEST_F(ServHandlerStatus, ServiceWithoutSectionsIsUnknownWithoutPortInfo) {
  WriteSystemService("web", Section("web", "tcp", "80"));
  WriteSystemService("empty", "# nothing here\n");
  EXPECT_EQ(Status(Ids({"empty", "nosuch"})),
            Parse(R"([{"service_id": "empty", "status": "unknown"},
                      {"service_id": "nosuch", "status": "unknown"}])"));
}

TEST_F(ServHandlerStatus, ServiceWithOnlyUnusableSectionsIsUnknown) {
  WriteSystemService("smb", Section("smb", "tcp", "445", false));
  SaveRules({Rule("0", true, "445", "445", "tcp")});
  EXPECT_EQ(Status(Ids({"smb"})),
            Parse(R"([{"service_id": "smb", "status": "unknown"}])"));
}

TEST_F(ServHandlerStatus, SectionWithAnEmptyPortListIsAllow) {
  WriteSystemService("quiet", Section("quiet", "tcp", ""));
  EXPECT_EQ(Status(Ids({"quiet"})),
            Parse(R"([{"service_id": "quiet", "status": "allow",
                       "port_info": {"quiet": "allow"}}])"));
}

TEST_F(ServHandlerStatus, SectionWithoutPortListIsDeny) {
  WriteSystemService("odd", "[odd]\nprotocol=tcp\n");
  EXPECT_EQ(Status(Ids({"odd"})),
            Parse(R"([{"service_id": "odd", "status": "deny",
                       "port_info": {"odd": "deny"}}])"));
}

TEST_F(ServHandlerStatus, BothProtocolsAllowOnlyWhenBothMapsAreCovered) {
  WriteSystemService("dns", Section("dns", "both", "53"));
  SaveRules({Rule("0", true, "53", "53", "tcp")});
  EXPECT_EQ(Status(Ids({"dns"}))[0]["status"], "deny");
  SaveRules({Rule("0", true, "53", "53", "udp")});
  EXPECT_EQ(Status(Ids({"dns"}))[0]["status"], "deny");
  SaveRules(
      {Rule("0", true, "53", "53", "tcp"), Rule("1", true, "53", "53", "udp")});
  EXPECT_EQ(Status(Ids({"dns"}))[0]["status"], "allow");
}

TEST_F(ServHandlerStatus, DisabledRulesCoverNothing) {
  WriteSystemService("web", Section("web", "tcp", "80"));
  SaveRules({Rule("0", false, "80", "80", "tcp")});
  EXPECT_EQ(Status(Ids({"web"}))[0]["status"], "deny");
}

TEST_F(ServHandlerStatus, RuleProtocolOtherThanTcpCoversUdpOnly) {
  WriteSystemService("tcpsvc", Section("tcpsvc", "tcp", "80"));
  WriteSystemService("udpsvc", Section("udpsvc", "udp", "80"));
  for (const char *protocol : {"both", "TCP", "udp", ""}) {
    SaveRules({Rule("0", true, "80", "80", protocol)});
    Json::Value status = Status(Ids({"tcpsvc", "udpsvc"}));
    EXPECT_EQ(status[0]["status"], "deny") << protocol;
    EXPECT_EQ(status[1]["status"], "allow") << protocol;
  }
}

TEST_F(ServHandlerStatus, OnlyLocalPortsOfRulesCount) {
  WriteSystemService("web", Section("web", "tcp", "5000"));
  SaveRules({Rule("0", true, "5000", "80", "tcp")});
  EXPECT_EQ(Status(Ids({"web"}))[0]["status"], "deny");
  SaveRules({Rule("0", true, "80", "5000", "tcp")});
  EXPECT_EQ(Status(Ids({"web"}))[0]["status"], "allow");
}

TEST_F(ServHandlerStatus, RangesAreCoveredByRulesTogether) {
  WriteSystemService("ftp", Section("ftp", "tcp", "21") +
                                Section("ftp_passive", "tcp", "55536-55899"));
  SaveRules({Rule("0", true, "21", "21", "tcp"),
             Rule("1", true, "55536-55700", "55536-55700", "tcp"),
             Rule("2", true, "55701-55899,1", "55701-55899,1", "tcp")});
  EXPECT_EQ(Status(Ids({"ftp"})),
            Parse(R"([{"service_id": "ftp", "status": "allow",
                       "port_info": {"ftp": "allow", "ftp_passive": "allow"}}])"));
  SaveRules({Rule("0", true, "21", "21", "tcp"),
             Rule("1", true, "55536-55898", "55536-55898", "tcp")});
  EXPECT_EQ(Status(Ids({"ftp"})),
            Parse(R"([{"service_id": "ftp", "status": "deny",
                       "port_info": {"ftp": "allow", "ftp_passive": "deny"}}])"));
}

TEST_F(ServHandlerStatus, ExplicitIdentifiersAreAnsweredSortedWithDuplicates) {
  WriteSystemService("b", Section("b", "tcp", "2"));
  WriteSystemService("a", Section("a", "tcp", "1"));
  Json::Value status = Status(Ids({"b", "zz", "a", "b"}));
  ASSERT_EQ(status.size(), 4u);
  EXPECT_EQ(status[0]["service_id"], "a");
  EXPECT_EQ(status[1]["service_id"], "b");
  EXPECT_EQ(status[2]["service_id"], "b");
  EXPECT_EQ(status[3]["service_id"], "zz");
  EXPECT_EQ(status[1], status[2]);
}

TEST_F(ServHandlerStatus, PackageServicesAreCheckedThroughTheirFiles) {
  WriteSystemService("web", Section("web", "tcp", "80"));
  WritePackageFile("media.sc", Section("media", "tcp", "8200"));
  WriteFile(ZARK_FW_SERVICE_MAPPING_TABLE, "media=web\n");
  SaveRules({Rule("0", true, "8200", "8200", "tcp")});
  EXPECT_EQ(Status(Ids({"media"})),
            Parse(R"([{"service_id": "media", "status": "deny",
                       "port_info": {"media": "allow", "web": "deny"}}])"));
}

TEST_F(ServHandlerStatus, SecondSectionUnknownKeepsTheFirstVerdict) {
  WriteSystemService("web", Section("web", "tcp", "80"));
  SaveRules({Rule("0", true, "80", "80", "tcp")});
  RouterRuleServHandler handler;
  ASSERT_EQ(handler.FwSectionEnum(), 0);
  ASSERT_EQ(handler.FillPortMapByPfRules(), 0);
  SzList sections = NewList({"web", "vanished", "web"});
  Json::Value result(Json::objectValue);
  handler.CheckPfRulesByFwSection(sections.get(), result);
  EXPECT_EQ(result, Parse(R"({"status": "unknown",
                              "port_info": {"web": "allow"}})"));
}

TEST_F(ServHandlerStatus, CheckOfNoSectionsIsUnknown) {
  RouterRuleServHandler handler;
  Json::Value result(Json::objectValue);
  handler.CheckPfRulesByFwSection(nullptr, result);
  EXPECT_EQ(result, Parse(R"({"status": "unknown"})"));
  SzList empty = NewList();
  Json::Value other(Json::objectValue);
  handler.CheckPfRulesByFwSection(empty.get(), other);
  EXPECT_EQ(other, Parse(R"({"status": "unknown"})"));
}

TEST_F(ServHandlerStatus, CheckByPortsOfNullAndEmptyLists) {
  RouterRuleServHandler handler;
  EXPECT_EQ(handler.CheckPfRulesByPorts(3, nullptr), 0);
  SzList empty = NewList();
  EXPECT_EQ(handler.CheckPfRulesByPorts(3, empty.get()), 1);
  SzList ports = NewList({"10", "20-22"});
  EXPECT_EQ(handler.CheckPfRulesByPorts(1, ports.get()), 0);
  handler.FillTCPBitSet(10, 10);
  handler.FillTCPBitSet(20, 22);
  EXPECT_EQ(handler.CheckPfRulesByPorts(1, ports.get()), 1);
  EXPECT_EQ(handler.CheckPfRulesByPorts(3, ports.get()), 0);
  EXPECT_EQ(handler.CheckPfRulesByPorts(0, ports.get()), 1);
}

TEST_F(ServHandlerStatus, NoSavedRulesMeansNothingIsCovered) {
  RouterRuleServHandler handler;
  EXPECT_EQ(handler.FillPortMapByPfRules(), 0);
  EXPECT_EQ(handler.CheckPort("tcp", 80), 0);
  EXPECT_TRUE(CapturedLogs().empty());
}

TEST_F(ServHandlerStatus, MalformedRuleFileCoversNothing) {
  WriteSystemService("web", Section("web", "tcp", "80"));
  WriteFile(ZARK_PORTMAP_RULE_CONF, "this is not a rule file");
  EXPECT_EQ(Status(Ids({"web"}))[0]["status"], "deny");
}

TEST_F(ServHandlerStatus, NoFirewallSectionsLeavesOutEmpty) {
  std::filesystem::create_directories(ZARK_FW_SYSTEM_SERVICE_DIR);
  Json::Value out = Status(Json::Value(Json::arrayValue));
  EXPECT_EQ(out, Json::Value(Json::arrayValue));
  EXPECT_TRUE(HasServLog("Failed to enum firewall section, " + kErrState));
}

TEST_F(ServHandlerStatus, ServicesThatCannotBeListedLeaveOutEmpty) {
  WritePackageFile("pkg.sc", Section("pkg", "tcp", "80"));
  Json::Value out = Status(Ids({"pkg"}));
  EXPECT_EQ(out, Json::Value(Json::arrayValue));
  EXPECT_TRUE(HasServLog("Failed to enum service, " + kErrState));
}

TEST_F(ServHandlerStatus, RulePortsPastThePortSpaceThrowOutOfTheCheck) {
  WriteSystemService("web", Section("web", "tcp", "80"));
  SaveRules({Rule("0", true, "65530-65540", "65530-65540", "tcp")});
  RouterRuleServHandler handler;
  Json::Value out(Json::arrayValue);
  EXPECT_THROW(handler.GetServPfStatus(Ids({"web"}), out), std::out_of_range);
  EXPECT_EQ(out, Json::Value(Json::arrayValue));
}

// Over the definitions that ship with the system: with no rule every
// forwardable service is denied, the local-only one is unknown; rules for
// every port of the forwardable sections make them all allowed.
TEST_F(ServHandlerStatus, ShippedServicesDenyWithoutRulesAndAllowWithThem) {
  InstallShippedDefinitions();
  const std::vector<std::string> forwardable = {"ftp", "openvpn",  "rsync",
                                                "ssh", "webadmin", "webdav"};

  Json::Value before = Status(Json::Value(Json::arrayValue));
  ASSERT_EQ(before.size(), 7u);
  for (const Json::Value &service : before) {
    std::string id = service["service_id"].asString();
    if (id == "smb") {
      EXPECT_EQ(service,
                Parse(R"({"service_id": "smb", "status": "unknown"})"));
      continue;
    }
    EXPECT_NE(std::find(forwardable.begin(), forwardable.end(), id),
              forwardable.end())
        << id;
    EXPECT_EQ(service["status"], "deny") << id;
    for (const std::string &section : service["port_info"].getMemberNames()) {
      EXPECT_EQ(service["port_info"][section], "deny") << id << "/" << section;
    }
  }

  // One rule per protocol and section, straight from the shipped table.
  std::vector<RouterRule> rules;
  ZARK_FW_SERVICE_TABLE *table = nullptr;
  ASSERT_GT(ZARKFwServiceEnum(&table), 0);
  for (const std::string &id : forwardable) {
    SzList sections = NewList();
    KLIBSZLIST *raw = sections.release();
    ASSERT_EQ(KLIBServicecfgInfoGet(id.c_str(), 64, &raw), 0);
    sections.reset(raw);
    for (const std::string &name : Items(sections.get())) {
      const ZARK_FW_SERVICE *section = ZARKFWServiceFind(table, name.c_str());
      ASSERT_NE(section, nullptr) << name;
      std::string ports;
      for (const std::string &item : Items(section->pslPorts)) {
        ports += (ports.empty() ? "" : ",") + item;
      }
      for (const char *protocol : {"tcp", "udp"}) {
        int bit = std::string(protocol) == "tcp" ? 1 : 2;
        if (section->protoMask & bit) {
          rules.push_back(Rule(std::to_string(rules.size()), true, ports, ports,
                               protocol, name));
        }
      }
    }
  }
  ZARKFwServiceFree(table);
  SaveRules(rules);

  Json::Value after = Status(Json::Value(Json::arrayValue));
  ASSERT_EQ(after.size(), 7u);
  for (const Json::Value &service : after) {
    std::string id = service["service_id"].asString();
    EXPECT_EQ(service["status"], id == "smb" ? "unknown" : "allow") << id;
  }
  Json::Value ftp = Status(Ids({"ftp"}));
  EXPECT_EQ(ftp, Parse(R"([{"service_id": "ftp", "status": "allow",
                            "port_info": {"ftp": "allow",
                                          "ftp_passive": "allow"}}])"));
  EXPECT_EQ(
      Status(Ids({"unknown_service"})),
      Parse(R"([{"service_id": "unknown_service", "status": "unknown"}])"));
}

} // namespace
