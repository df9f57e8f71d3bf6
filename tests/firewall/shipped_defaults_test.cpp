// The system service definitions and the mapping table that ship with the
// system parse cleanly and say what they are meant to say.
#include "firewall_test_files.h"
#include "hermetic.h"
#include "service_dir.h"
#include "service_file.h"
#include "syslog_capture.h"
#include "zarkfw.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <map>

namespace {

using namespace zark::test;
using Names = std::vector<std::string>;

class FirewallShippedDefaults : public ::testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    ClearLogs();
    InstallShippedDefinitions();
  }
};

TEST_F(FirewallShippedDefaults, EveryFileParsesWithoutAProblem) {
  namespace fs = std::filesystem;
  int files = 0;
  for (const auto &entry : fs::directory_iterator(
           std::string(ZARK_FIREWALL_DATA_DIR) + "/services.d")) {
    auto parsed = zark::fw::ParseServiceFile(ReadFile(entry.path().string()));
    EXPECT_TRUE(parsed.problems.empty())
        << entry.path() << ": " << ::testing::PrintToString(parsed.problems);
    EXPECT_EQ(parsed.sections.size(), parsed.sectionNames.size())
        << entry.path();
    EXPECT_FALSE(parsed.sections.empty()) << entry.path();
    for (const auto &section : parsed.sections) {
      EXPECT_FALSE(section.title.empty()) << section.name;
      EXPECT_TRUE(section.ports.has_value()) << section.name;
    }
    ++files;
  }
  EXPECT_EQ(files, 7);
}

TEST_F(FirewallShippedDefaults, TableHoldsTheExpectedSections) {
  struct Expected {
    int protoMask;
    Names ports;
    int usable;
  };
  const std::map<std::string, Expected> expected = {
      {"webadmin_http", {ZARK_FW_PROTO_TCP, {"5000"}, 1}},
      {"webadmin_https", {ZARK_FW_PROTO_TCP, {"5001"}, 1}},
      {"ssh", {ZARK_FW_PROTO_TCP, {"22"}, 1}},
      {"ftp", {ZARK_FW_PROTO_TCP, {"21"}, 1}},
      {"ftp_passive", {ZARK_FW_PROTO_TCP, {"55536-55899"}, 1}},
      {"webdav_http", {ZARK_FW_PROTO_TCP, {"5005"}, 1}},
      {"webdav_https", {ZARK_FW_PROTO_TCP, {"5006"}, 1}},
      {"rsync", {ZARK_FW_PROTO_TCP, {"873"}, 1}},
      {"openvpn", {ZARK_FW_PROTO_UDP, {"1194"}, 1}},
      {"smb", {ZARK_FW_PROTO_TCP, {"445", "139"}, 0}},
      {"smb_netbios", {ZARK_FW_PROTO_UDP, {"137-138"}, 0}},
  };
  ZARK_FW_SERVICE_TABLE *table = nullptr;
  EXPECT_EQ(ZARKFwServiceEnum(&table), static_cast<int>(expected.size()));
  for (const auto &[name, want] : expected) {
    const ZARK_FW_SERVICE *section = ZARKFWServiceFind(table, name.c_str());
    ASSERT_NE(section, nullptr) << name;
    EXPECT_EQ(section->protoMask, want.protoMask) << name;
    EXPECT_EQ(Items(section->pslPorts), want.ports) << name;
    EXPECT_EQ(section->blUsable, want.usable) << name;
  }
  ZARKFwServiceFree(table);
  EXPECT_TRUE(CapturedLogs().empty())
      << ::testing::PrintToString(CapturedMessages());
}

TEST_F(FirewallShippedDefaults, SystemServicesNameTheirSections) {
  SzList services = NewList();
  KLIBSZLIST *raw = services.release();
  ASSERT_EQ(KLIBServiceEnum(&raw), 0);
  services.reset(raw);
  EXPECT_EQ(Items(services.get()), (Names{"ftp", "openvpn", "rsync", "smb",
                                          "ssh", "webadmin", "webdav"}));
  const std::map<std::string, Names> sections = {
      {"ftp", {"ftp", "ftp_passive"}},
      {"openvpn", {"openvpn"}},
      {"rsync", {"rsync"}},
      {"smb", {"smb", "smb_netbios"}},
      {"ssh", {"ssh"}},
      {"webadmin", {"webadmin_http", "webadmin_https"}},
      {"webdav", {"webdav_http", "webdav_https"}},
  };
  for (const auto &[id, want] : sections) {
    SzList list = NewList();
    KLIBSZLIST *listRaw = list.release();
    EXPECT_EQ(KLIBServicecfgInfoGet(id.c_str(), 64, &listRaw), 0) << id;
    list.reset(listRaw);
    EXPECT_EQ(Items(list.get()), want) << id;
  }
}

TEST_F(FirewallShippedDefaults, MappingTableExistsAndHoldsNoKey) {
  ASSERT_EQ(KLIBCFileExist(ZARK_FW_SERVICE_MAPPING_TABLE), 1);
  SzList sections = NewList();
  KLIBSZLIST *raw = sections.release();
  // Every line is a comment: no section, and its example key is not read.
  EXPECT_EQ(KLIBCFileEnumSection(ZARK_FW_SERVICE_MAPPING_TABLE, &raw), 0);
  sections.reset(raw);
  char value[1024] = "untouched";
  EXPECT_EQ(KLIBCFileGetKeyValue(ZARK_FW_SERVICE_MAPPING_TABLE, "mediaserver",
                                 value, sizeof(value), 0),
            0);
}

} // namespace
